#include <poll.h>
#include <sys/stat.h>

#include <array>
#include <asio.hpp>
#include <atomic>

#include "tests/client/ClientTesting.h"

namespace quarvel {
namespace {

using ::testing::Field;
using Code = Client::Code;
using Change = Client::ConnectionChange;

const Dictionary kLarge{{"Samples", std::string(4'096, 'x')}};

class ClientTest : public DrivenClient {
 protected:
  ClientTest() {
    options_.driver = Client::Driver::ownThread;
    connect();
  }
  Client& client() { return *client_; }

  /// Runs one synchronous call beside the test, which plays the service meanwhile.
  template <class Call>
  auto beside(Call call) {
    return std::async(std::launch::async, [this, call] { return call(client()); });
  }
};

// The forms of arguments that the C functions, which call these, do not use.
TEST_F(ClientTest, CallsHaveTheirFrames) {
  client().sendMessage(Payload(), {Component::toolbox, Kind::error}, kGeneric, {7, 8});
  client().call("futureOperation:reply:", std::vector<Value>{Value("x")}, [](const auto&) {});
  client().createReportingSession(0x1'0000'0000);
  EXPECT_THAT(JsonText(service_.call()), HasSubstr(R"(reply:",[{},2147483656,0,[7,8]]])"));
  EXPECT_EQ(JsonText(service_.call()), R"([0,0,"futureOperation:reply:",["x"]])");
  // The wire has positive ids as unsigned integers.
  EXPECT_THAT(*service_.receiveBytes(), HasSubstr(std::string("\xcf\0\0\0\1\0\0\0\0", 9)));
}

TEST_F(ClientTest, RepliesFindTheirCallsInEveryOrderAndInPieces) {
  Expected<bool> stopped, ofAnotherKind;
  Expected<Client::ServiceType> serviceType;
  Expected<Client::Validity> validity;
  Expected<std::vector<ReporterID>> reporters;
  client().startReportingSessionForID(7, stopped.reply());
  client().stopReportingSessionForID(7, ofAnotherKind.reply());
  client().getServiceNameForReporterID(7, serviceType.reply());
  client().reporterID(7, validity.reply());
  client().getAllReporters(reporters.reply());
  std::array<Value, 5> calls;
  for (Value& call : calls) call = service_.call();
  const std::string bytes =
      FakeService::response(calls[4], nullptr, List{7, -8}) +
      FakeService::response(calls[3], nullptr, Dictionary{{"reporterID", 7}, {"serviceType", 3}}) +
      FakeService::response(calls[2], nullptr, 65535) +
      FakeService::response(calls[2], nullptr, 3) + FakeService::response(calls[1], nullptr, "yes");
  for (const char byte : bytes) service_.send({&byte, 1});
  EXPECT_THAT(reporters.get().value(), ElementsAre(7, -8));
  EXPECT_TRUE(validity.get().value().valid());
  EXPECT_EQ(serviceType.get().value(), Client::ServiceType::unknown);
  EXPECT_TRUE(IsCode(ofAnotherKind.get().error(), Code::unexpectedReply));
  EXPECT_FALSE(stopped.given());
  service_.reply(calls[0], true);
  EXPECT_TRUE(stopped.get().value());
}

TEST_F(ClientTest, ALostConnectionAnswersPendingAndLaterCalls) {
  std::vector<int> order;
  for (const int call : {0, 1, 2}) {
    client().startReportingSessionForID(call, [&order, call](const Result<bool>& result) {
      if (IsCode(result.error(), Code::connectionLost)) order.push_back(call);
    });
    ASSERT_TRUE(service_.receive());
  }
  service_.hangUp();
  const auto late = client().sync().getAllReporters();
  EXPECT_TRUE(IsCode(late.error(), Code::connectionLost)) << Text(late);
  EXPECT_THAT(order, ElementsAre(0, 1, 2));
  EXPECT_FALSE(client().connected());
}

TEST_F(ClientTest, BytesThatAreNoReplyLoseTheConnection) {
  for (const char* bytes : {"\xc1", "\x2a", "\x94\x01\xc0\xc0\xc0"}) {
    disconnect();
    connect();
    service_.send(bytes);
    EXPECT_THAT(Text(client().sync().getAllReporters()), HasSubstr("is no reply"));
  }
}

TEST_F(ClientTest, AReplyAfterTheTimeOutIsDiscarded) {
  EXPECT_TRUE(IsCode(client().sync(1ms).createReportingSession(7).error(), Code::timedOut));
  const Value late = service_.call();
  auto stop = beside([](Client& c) { return c.sync().stopReportingSessionForID(7); });
  const Value call = service_.call();
  service_.reply(late, false);
  service_.reply(call, true);
  EXPECT_TRUE(stop.get().value());
}

TEST_F(ClientTest, ABatchGoesOutWhenItEndsOrWhenACallWaits) {
  {
    Client::Batch batch(client());
    client().createReportingSession(1);
    client().createReportingSession(2);
    EXPECT_FALSE(service_.hasInput());
    auto reporters = beside([](Client& c) { return c.sync().getAllReporters(); });
    ASSERT_TRUE(service_.receive(2));
    service_.answer(List{});
    EXPECT_TRUE(reporters.get().ok());
    client().createReportingSession(3);
    EXPECT_FALSE(service_.hasInput());
  }
  EXPECT_TRUE(service_.hasInput());
}

TEST_F(ClientTest, AClientThatIsHeldBackWaitsAndLosesNothing) {
  constexpr int kMessages = 4'000;
  constexpr int kInBuffers = 400;  // the bound of the socket and of both of the client's buffers
  const Payload payload(kLarge);
  std::atomic<int> sent = 0;
  std::thread sender([&] {
    for (int i = 0; i < kMessages; ++i) {
      client().sendMessage(payload, Kind::performance, kGeneric, i);
      ++sent;
      sent.notify_one();
    }
  });
  sent.wait(0);
  int ahead = 0;
  for (int i = 0; i < kMessages; ++i) {
    const Value call = service_.call();
    ahead = std::max(ahead, sent - i);
    ASSERT_EQ((*(*call.list())[2].list())[3], Value(List{i}));
  }
  sender.join();
  EXPECT_LE(ahead, kInBuffers);
}

TEST_F(ClientTest, CallsOfSeveralThreadsStayWholeAndInTheirOrder) {
  constexpr int kThreads = 4;
  constexpr int kCalls = 5'000;
  const auto succeeded = [](const Result<bool>& reply) { EXPECT_TRUE(reply.ok()); };
  std::vector<std::jthread> threads;
  for (int thread = 0; thread < kThreads; ++thread) {
    threads.emplace_back([&, type = static_cast<Client::ServiceType>(thread)] {
      for (int i = 0; i < kCalls; ++i) client().setServiceType(type, i, succeeded);
    });
  }
  std::vector<std::int64_t> next(kThreads);
  for (int i = 0; i < kThreads * kCalls; ++i) {
    const Value call = service_.call();
    const List& arguments = *(*call.list())[3].list();
    const auto thread = static_cast<std::size_t>(*arguments[0].integer());
    ASSERT_EQ(*arguments[1].integer(), next[thread]++);
    service_.reply(call, true);
  }
}

TEST_F(ClientTest, EndingAClientSendsGatheredCallsAndAnswersThemFirst) {
  int lost = 0;
  {
    const Client::Batch batch(client());
    for (int i = 0; i < 3; ++i) {
      client().createReportingSession(i, [&lost](const auto& reply) { lost += !reply.ok(); });
    }
    Client moved = std::move(client());
    EXPECT_EQ(lost, 0);
  }
  EXPECT_EQ(lost, 3);
  EXPECT_TRUE(service_.receive(3));
}

std::string WhyNot(const std::string& path) {
  const auto client = Client::connect(path);
  EXPECT_TRUE(client || IsCode(client.error(), Code::unreachable));
  return Text(client);
}

TEST(ClientConnectTest, SaysWhyTheServiceCannotBeReached) {
  FakeService service;
  EXPECT_THAT(WhyNot(service.directory() / "none.sock"),
              AllOf(HasSubstr("no socket " + service.directory().string()), HasSubstr("quarveld")));
  EXPECT_THAT(WhyNot("/" + std::string(200, 'x')), HasSubstr("107 bytes"));
  service.stopListening();
  EXPECT_THAT(WhyNot(service.path()), AllOf(HasSubstr("left behind"), HasSubstr("quarveld")));
}

TEST(ClientConnectTest, NamesTheGroupThatMayConnect) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can become a user without the permission";
  FakeService service;
  constexpr gid_t kNamelessGroup = 54'321;
  ASSERT_EQ(::chown(service.path().c_str(), 0, kNamelessGroup), 0);
  ASSERT_EQ(::chmod(service.path().c_str(), 0660), 0);
  ASSERT_EQ(::chmod(service.directory().c_str(), 0755), 0);
  ASSERT_EQ(::seteuid(65'534), 0);
  const std::string forbidden = WhyNot(service.path());
  ASSERT_EQ(::seteuid(0), 0);
  EXPECT_THAT(forbidden, AllOf(HasSubstr("may not use"), HasSubstr("group 54321")));
}

TEST(ClientConnectTest, LooksWhereTheServiceListens) {
  FakeService service;
  const std::string here = service.directory().string();
  ::setenv("XDG_RUNTIME_DIR", "relative", 1);
  ::setenv("RUNTIME_DIRECTORY", (here + ":/elsewhere").c_str(), 1);
  EXPECT_EQ(Client::defaultSocketPath(), service.path());
  ::setenv("QUARVEL_SOCKET", "/somewhere/else.sock", 1);
  EXPECT_EQ(Client::defaultSocketPath(), "/somewhere/else.sock");
  ::unsetenv("QUARVEL_SOCKET");
  ::unsetenv("RUNTIME_DIRECTORY");
  const std::string user = "/run/user/" + std::to_string(::geteuid());
  EXPECT_EQ(Client::defaultSocketPath(),
            (::geteuid() == 0 ? "/run" : user) + "/quarvel/reporting.sock");
  ::unsetenv("XDG_RUNTIME_DIR");
}

// ---- A client without a thread: the program's own loop drives it.

bool IsDue(Client& client, std::chrono::milliseconds wait = 0ms) {
  pollfd due{client.descriptor(), POLLIN, 0};
  return ::poll(&due, 1, static_cast<int>(wait.count())) == 1;
}

void Poll(Client& client, const bool& done) {
  while (!done) {
    ASSERT_TRUE(IsDue(client, kTestTimeout));
    client.dispatch();
  }
}

void Asio(Client& client, const bool& done) {
  asio::io_context context;
  asio::posix::stream_descriptor due(context, client.descriptor());
  const std::function<void()> watch = [&] {
    due.async_wait(asio::posix::stream_descriptor::wait_read, [&](const asio::error_code&) {
      client.dispatch();
      if (!done) watch();
    });
  };
  watch();
  context.run_for(kTestTimeout);
  due.release();  // the descriptor is the client's
}

// The calls are more than the socket takes at once, so that the loop must write the rest.
TEST_F(DrivenClient, EveryLoopCarriesCallsOutAndGetsReplies) {
  constexpr int kCalls = 500;
  const auto threads = [] {
    return std::distance(std::filesystem::directory_iterator("/proc/self/task"), {});
  };
  for (const auto run : {Poll, Asio}) {
    Client& client = connect();
    const std::jthread service([this] {
      for (int i = 0; i < kCalls; ++i) service_.answer(true);
    });
    const auto before = threads();
    int replies = 0;
    bool done = false;
    const auto answered = [&](const Result<bool>& reply) {
      EXPECT_TRUE(reply.ok()) << Text(reply);
      done = ++replies == kCalls;
    };
    for (int i = 0; i < kCalls; ++i) {
      ASSERT_EQ(client.setConfiguration(kLarge, i, answered), Code::none);
    }
    EXPECT_EQ(threads(), before) << "the library made a thread";
    run(client, done);
    EXPECT_EQ(replies, kCalls);
    EXPECT_FALSE(IsDue(client));
    service_.hangUp();
    ASSERT_TRUE(IsDue(client, kTestTimeout));
    EXPECT_EQ(client.dispatch(), Code::connectionLost);
    EXPECT_FALSE(IsDue(client)) << "a lost connection is reported once";
    disconnect();
  }
}

TEST_F(DrivenClient, NeverWaitsAndRefusesTooManyCalls) {
  options_.gatheredBytes = 100'000;
  Client& client = connect();
  int taken = 0;
  while (client.sendMessage(kLarge, Kind::volume, kGeneric, 7) == Code::none) ++taken;
  Expected<bool> refused;
  EXPECT_EQ(client.stopReportingSessionForID(7, refused.reply()), Code::heldBack);
  EXPECT_FALSE(refused.given()) << "only the driver calls replies";
  client.dispatch();
  EXPECT_TRUE(IsCode(refused.get().error(), Code::heldBack));

  std::jthread service([&] {
    EXPECT_TRUE(service_.receive(taken));
    service_.answer(true);
  });
  Expected<bool> stopped;
  driveUntil([&] {
    stopped = {};
    return client.stopReportingSessionForID(7, stopped.reply()) == Code::none;
  });
  driveUntil([&] { return stopped.given(); });
  EXPECT_TRUE(stopped.get().value());
}

TEST_F(DrivenClient, AReplyMayCallAndEndItsClientButNotWait) {
  for (const auto driver : {Client::Driver::caller, Client::Driver::ownThread}) {
    options_.driver = driver;
    connect();
    Expected<bool> ended;
    client_->createReportingSession(7, [&, reply = ended.reply()](const Result<bool>& result) {
      EXPECT_EQ(client_->dispatch(), Code::wouldDeadlock);
      EXPECT_TRUE(IsCode(client_->sync().getAllReporters().error(), Code::wouldDeadlock));
      client_->createReportingSession(8);
      client_.reset();
      reply(result);
    });
    service_.answer(true);
    if (driver == Client::Driver::caller) driveUntil([&] { return ended.given(); });
    EXPECT_TRUE(ended.get().value());
    EXPECT_TRUE(service_.receive()) << "the gathered call";
    EXPECT_FALSE(service_.receive());
    service_.hangUp();
  }
}

TEST_F(DrivenClient, AForkedChildLeavesTheConnectionToItsParent) {
  for (const auto driver : {Client::Driver::caller, Client::Driver::ownThread}) {
    options_.driver = driver;
    Client& client = connect();
    Expected<bool> created;
    client.createReportingSession(7, created.reply());
    const auto child = [this] {
      client_.reset();
      ::_exit(0);
    };
    EXPECT_EXIT(child(), ::testing::ExitedWithCode(0), "");
    service_.answer(true);
    driveUntil([&] { return created.given(); });
    EXPECT_TRUE(created.get().value());
    client_.reset();
    EXPECT_FALSE(service_.receive());
    service_.hangUp();
  }
}

// ---- Reconnection

class ReconnectTest : public DrivenClient {
 protected:
  ReconnectTest() {
    options_.reconnect = Client::Reconnect{1ms, 4ms};
    options_.connectionChanged = [this](const Change& change) { changes_.push_back(change); };
    connect();
  }

  void restoreConnection() {
    driveUntil([&] { return client_->connected(); });
    service_.accept();
  }
  /// The next calls, without their numbers.
  std::vector<std::string> calls(int count) {
    std::vector<std::string> calls;
    while (count-- > 0) {
      const List frame = *service_.call().list();
      calls.push_back(*frame[frame.size() - 2].string() + JsonText(frame.back()));
    }
    return calls;
  }

  std::vector<Change> changes_;
};

TEST_F(ReconnectTest, SessionsAreRestoredAndMessagesAreNotRepeated) {
  Expected<bool> created, firstStart, secondStart;
  Expected<std::monostate> message;
  client_->createReportingSession(7, created.reply());
  client_->setServiceType(Client::ServiceType::telephony, 7);
  client_->setConfiguration(Dictionary{{"Route", "Speaker"}, {"Rate", 1}}, 7);
  client_->setConfiguration(Payload(Dictionary{{"Rate", 2}}), 7);
  client_->startReportingSessionForID(7, firstStart.reply());
  client_->startReportingSessionForID(7, secondStart.reply());  // which the service never answers
  client_->createReportingSession(8);
  client_->destroyReportingSession(8);
  client_->createReportingSession(9);
  client_->startReportingSessionForID(9);
  client_->stopReportingSessionForID(9);
  client_->setServiceType(Client::ServiceType::test, 10);  // another client's session
  client_->sendMessage(std::nullopt, Kind::volume, kGeneric, 7, message.reply());
  ASSERT_TRUE(service_.receive(13));
  loseConnection();
  restoreConnection();

  EXPECT_THAT(
      calls(5),
      ElementsAre(R"(createReportingSession:reply:[7])",
                  R"(setServiceType:reportingSession:reply:[2,7])",
                  R"(setConfiguration:forReporterID:reply:[{"Route":"Speaker","Rate":2},7])",
                  R"(startReportingSessionForID:reply:[7])", "createReportingSession:reply:[9]"));
  EXPECT_FALSE(service_.hasInput());
  EXPECT_FALSE(firstStart.given());
  EXPECT_TRUE(IsCode(created.get().error(), Code::deferred));
  EXPECT_TRUE(IsCode(secondStart.get().error(), Code::connectionLost));
  EXPECT_TRUE(IsCode(message.get().error(), Code::connectionLost));
  using C = Change;
  EXPECT_THAT(changes_,
              ElementsAre(AllOf(Field(&C::kind, C::Kind::lost), Field(&C::unanswered, 3U),
                                Field(&C::sessions, 2U)),
                          AllOf(Field(&C::kind, C::Kind::restored), Field(&C::sessions, 2U))));
  EXPECT_THAT(changes_[0].why.description(), HasSubstr("closed the connection"));
}

TEST_F(ReconnectTest, TheStartsReplyReportsTheEndOfTheNewStart) {
  for (const int losses : {1, 2}) {
    Expected<bool> stopped;
    client_->createReportingSession(7);
    client_->startReportingSessionForID(7, stopped.reply());
    for (int i = 0; i < losses; ++i) {
      ASSERT_TRUE(service_.receive(2));
      loseConnection();
      restoreConnection();
    }
    ASSERT_TRUE(service_.receive(1));
    service_.answer(true);
    driveUntil([&] { return stopped.given(); });
    EXPECT_TRUE(stopped.get().value());
    client_->destroyReportingSession(7);
    ASSERT_TRUE(service_.receive(1));
  }
}

TEST_F(ReconnectTest, CallsInBetweenAreDeferredOrRefused) {
  client_->createReportingSession(7);
  client_->createReportingSession(8);
  ASSERT_TRUE(service_.receive(2));
  loseConnection();
  Expected<bool> created, orphaned, stopped;
  Expected<std::vector<ReporterID>> reporters;
  EXPECT_EQ(client_->createReportingSession(9, created.reply()), Code::deferred);
  EXPECT_EQ(client_->startReportingSessionForID(9, stopped.reply()), Code::deferred);
  EXPECT_EQ(client_->startReportingSessionForID(8, orphaned.reply()), Code::deferred);
  EXPECT_EQ(client_->destroyReportingSession(8), Code::deferred);
  EXPECT_EQ(client_->stopReportingSessionForID(5), Code::connectionLost);
  EXPECT_EQ(client_->sendMessage(std::nullopt, Kind::volume, kGeneric, 9), Code::connectionLost);
  EXPECT_EQ(client_->getAllReporters(reporters.reply()), Code::connectionLost);
  restoreConnection();
  EXPECT_TRUE(IsCode(created.get().error(), Code::deferred));
  EXPECT_TRUE(IsCode(orphaned.get().error(), Code::connectionLost));
  EXPECT_TRUE(IsCode(reporters.get().error(), Code::connectionLost));
  EXPECT_EQ(changes_.back().unsent, 2U);
  EXPECT_THAT(calls(3),
              ElementsAre("createReportingSession:reply:[7]", "createReportingSession:reply:[9]",
                          "startReportingSessionForID:reply:[9]"));
  EXPECT_FALSE(service_.hasInput());
  EXPECT_FALSE(stopped.given());
}

TEST_F(ReconnectTest, UnsentCallsAreCountedAndAttemptsGoOnUntilTheServiceIsBack) {
  {
    const Client::Batch batch(*client_);
    for (int i = 0; i < 3; ++i) client_->sendMessage(std::nullopt, Kind::volume, kGeneric, 7);
    client_->createReportingSession(7, [](const Result<bool>&) {});
    loseConnection();
  }
  EXPECT_EQ(changes_.back().unsent, 3U) << "the call with a reply has been answered";
  EXPECT_EQ(changes_.back().unanswered, 1U);
  service_.stopListening();
  std::filesystem::remove(service_.path());
  const auto later = std::chrono::steady_clock::now() + 20ms;
  driveUntil([&] { return std::chrono::steady_clock::now() > later; });
  EXPECT_FALSE(client_->connected());
  EXPECT_EQ(changes_.size(), 1U) << "failed attempts are no changes";
  service_.listen();
  restoreConnection();
  EXPECT_THAT(calls(1), ElementsAre("createReportingSession:reply:[7]"));
}

TEST_F(ReconnectTest, AClientThatEndsWhileItReconnectsAnswersKeptReplies) {
  Expected<bool> stopped;
  client_->createReportingSession(7);
  client_->startReportingSessionForID(7, stopped.reply());
  ASSERT_TRUE(service_.receive(2));
  loseConnection();
  client_.reset();
  EXPECT_TRUE(IsCode(stopped.get().error(), Code::connectionLost));
}

TEST_F(DrivenClient, ItsOwnThreadReconnects) {
  options_.driver = Client::Driver::ownThread;
  options_.reconnect = Client::Reconnect{1ms, 4ms};
  std::promise<std::size_t> restored;
  options_.connectionChanged = [&](const Change& change) {
    if (change.kind == Change::Kind::restored) restored.set_value(change.sessions);
  };
  connect().createReportingSession(7);
  ASSERT_TRUE(service_.receive());
  service_.hangUp();
  auto sessions = restored.get_future();
  ASSERT_EQ(sessions.wait_for(kTestTimeout), std::future_status::ready);
  EXPECT_EQ(sessions.get(), 1U);
  service_.accept();
  EXPECT_TRUE(service_.receive());
}

}  // namespace
}  // namespace quarvel
