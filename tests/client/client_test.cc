#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <atomic>
#include <fstream>
#include <future>
#include <thread>
#include <vector>

#include <quarvel/client.hpp>

#include "base/Json.h"
#include "tests/client/ClientTesting.h"

namespace quarvel {
namespace {

using test::Expected;
using test::FakeService;
using test::IsCode;
using test::Text;
using vocabulary::Component;
using vocabulary::Kind;
using namespace std::chrono_literals;
using ::testing::AllOf;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

const Dictionary kPayload{{"SampleRate", 48000}, {"Route", "Speaker"}};

class ClientTest : public ::testing::Test {
 protected:
  ClientTest() : client_(Client::connect(service_.path())) {
    EXPECT_TRUE(client_.ok()) << Text(client_);
    service_.accept();
  }
  Client& client() { return client_.value(); }

  /// Runs one synchronous call beside the test, which plays the service meanwhile.
  template <class Call>
  auto beside(Call call) {
    return std::async(std::launch::async, [this, call] { return call(client()); });
  }

  FakeService service_;
  Result<Client> client_;
};

// The forms that the C functions, which call these, have no use for.
TEST_F(ClientTest, CallsHaveTheirFrames) {
  const auto dropped = [](const auto&) {};
  client().setConfiguration(std::nullopt, 7, dropped);
  client().sendMessage(Payload(kPayload), {Component::toolbox, Kind::error},
                       Client::MessageType::unknown, {7, 8}, dropped);
  client().sendMessage(kPayload, Kind::volume, Client::MessageType::generic,
                       Recipients::everyStartedSession());
  client().sendMessage(std::nullopt, Kind::volume, Client::MessageType::generic,
                       std::vector<ReporterID>());
  client().call("futureOperation:reply:", std::vector<Value>{Value("x")}, dropped);
  const std::string send = R"("sendMessage:withCategory:andType:forReportingIDs:reply:",)";
  const std::string payload = R"({"SampleRate":48000,"Route":"Speaker"})";
  for (const std::string& frame :
       {std::string(R"([0,0,"setConfiguration:forReporterID:reply:",[null,7]])"),
        "[0,1," + send + "[" + payload + ",2147483656,65535,[7,8]]]",
        "[2," + send + "[" + payload + ",11,0,null]]", "[2," + send + "[null,11,0,[]]]",
        std::string(R"([0,2,"futureOperation:reply:",["x"]])")}) {
    EXPECT_EQ(JsonText(*service_.receive()), frame);
  }
}

TEST_F(ClientTest, APositiveIDIsWrittenAsAnUnsignedInteger) {
  client().createReportingSession(0x1'0000'0000);
  EXPECT_THAT(*service_.receiveBytes(), HasSubstr(std::string("\xcf\0\0\0\1\0\0\0\0", 9)));
}

TEST_F(ClientTest, RepliesFindTheirCallsInWhateverOrderAndPiecesTheyArrive) {
  Expected<bool> stopped;
  Expected<Client::ServiceType> serviceType;
  Expected<Client::Validity> validity;
  Expected<std::vector<ReporterID>> reporters;
  client().startReportingSessionForID(7, stopped.reply());
  client().getServiceNameForReporterID(7, serviceType.reply());
  client().reporterID(7, validity.reply());
  client().getAllReporters(reporters.reply());
  const Value start = *service_.receive();
  const Value name = *service_.receive();
  const Value valid = *service_.receive();
  const Value all = *service_.receive();

  const std::string bytes =
      FakeService::response(all, nullptr, List{7, -8}) +
      FakeService::response(valid, nullptr, Dictionary{{"reporterID", 7}, {"serviceType", 3}}) +
      FakeService::response(name, nullptr, 65535) + FakeService::response(name, nullptr, 3);
  for (const char byte : bytes) service_.send({&byte, 1});
  EXPECT_THAT(reporters.get().value(), ElementsAre(7, -8));
  EXPECT_TRUE(validity.get().value().valid());
  EXPECT_EQ(serviceType.get().value(), Client::ServiceType::unknown);
  EXPECT_FALSE(stopped.given());
  service_.reply(start, true);
  EXPECT_TRUE(stopped.get().value());
}

TEST_F(ClientTest, AReplyOfAnotherKindIsAnError) {
  Expected<bool> unexpected;
  client().stopReportingSessionForID(7, unexpected.reply());
  service_.reply(*service_.receive(), "yes");
  EXPECT_TRUE(IsCode(unexpected.get().error(), Client::Code::unexpectedReply));
}

TEST_F(ClientTest, ASynchronousStartReturnsWhenItIsCarriedOutAndNotAtTheSessionsEnd) {
  for (const ReporterID known : {ReporterID{7}, ReporterID{0}}) {
    Expected<bool> stopped;
    auto started =
        beside([&](Client& c) { return c.sync().startReportingSessionForID(7, stopped.reply()); });
    const Value start = *service_.receive();
    service_.reply(*service_.receive(), Dictionary{{"reporterID", known}, {"serviceType", 0}});
    EXPECT_EQ(started.get().value(), known != 0);
    EXPECT_FALSE(stopped.given());
    service_.reply(start, true);
    EXPECT_TRUE(stopped.get().value());
  }
}

TEST_F(ClientTest, ALostConnectionAnswersWhatWaitsAndWhatStillComes) {
  std::vector<int> order;
  for (const int call : {0, 1, 2}) {
    client().startReportingSessionForID(call, [&order, call](const Result<bool>& result) {
      EXPECT_TRUE(IsCode(result.error(), Client::Code::connectionLost));
      order.push_back(call);
    });
    ASSERT_TRUE(service_.receive());
  }
  service_.hangUp();
  const auto late = client().sync().getAllReporters();
  EXPECT_TRUE(IsCode(late.error(), Client::Code::connectionLost)) << Text(late);
  EXPECT_THAT(order, ElementsAre(0, 1, 2));
  EXPECT_FALSE(client().connected());
}

TEST_F(ClientTest, BytesThatAreNoReplyLoseTheConnection) {
  for (const char* bytes : {"\xc1", "\x2a", "\x94\x01\xc0\xc0\xc0"}) {
    FakeService service;
    auto lied = Client::connect(service.path());
    service.accept();
    service.send(bytes);
    EXPECT_THAT(Text(lied.value().sync().getAllReporters()), HasSubstr("is no reply"));
  }
}

TEST_F(ClientTest, AReplyAfterTheTimeOutIsDiscarded) {
  EXPECT_TRUE(IsCode(client().sync(1ms).createReportingSession(7).error(), Client::Code::timedOut));
  const Value late = *service_.receive();
  auto stop = beside([](Client& c) { return c.sync().stopReportingSessionForID(7); });
  const Value call = *service_.receive();
  service_.reply(late, false);
  service_.reply(call, true);
  EXPECT_TRUE(stop.get().value());
}

TEST_F(ClientTest, AReplyMayCallButNotWait) {
  Expected<bool> second;
  std::optional<Error> refused;
  client().createReportingSession(7, [&](const Result<bool>&) {
    refused = client().sync().createReportingSession(8).error();
    client().createReportingSession(9, second.reply());
  });
  service_.reply(*service_.receive(), true);
  service_.reply(*service_.receive(), true);
  EXPECT_TRUE(second.get().value());
  ASSERT_TRUE(refused);
  EXPECT_TRUE(IsCode(*refused, Client::Code::wouldDeadlock));
}

TEST_F(ClientTest, ABatchGoesOutWhenItEndsOrWhenSomebodyWaits) {
  {
    Client::Batch batch(client());
    client().createReportingSession(1);
    client().createReportingSession(2);
    EXPECT_FALSE(service_.somethingWaits());
    auto reporters = beside([](Client& c) { return c.sync().getAllReporters(); });
    ASSERT_TRUE(service_.receive());
    ASSERT_TRUE(service_.receive());
    service_.reply(*service_.receive(), List{});
    EXPECT_TRUE(reporters.get().ok());
    client().createReportingSession(3);
    EXPECT_FALSE(service_.somethingWaits());
  }
  EXPECT_TRUE(service_.somethingWaits());
}

TEST_F(ClientTest, AClientThatIsHeldBackWaitsAndLosesNothing) {
  constexpr int kMessages = 4'000;
  constexpr int kInBuffers = 400;  // what the socket and both of the client's buffers hold at most
  const Payload payload(Dictionary{{"Samples", std::string(4'096, 'x')}});
  std::atomic<int> sent = 0;
  std::thread sender([&] {
    for (int i = 0; i < kMessages; ++i) {
      client().sendMessage(payload, Kind::performance, Client::MessageType::generic, i);
      ++sent;
      sent.notify_one();
    }
  });
  sent.wait(0);
  int ahead = 0;
  for (int i = 0; i < kMessages; ++i) {
    const Value call = *service_.receive();
    ahead = std::max(ahead, sent - i);
    const List& arguments = *(*call.list())[2].list();
    ASSERT_EQ(arguments[3], Value(List{i}));
  }
  sender.join();
  EXPECT_LE(ahead, kInBuffers);
}

TEST_F(ClientTest, CallsOfSeveralThreadsStayWholeAndInTheirOrder) {
  constexpr int kThreads = 4;
  constexpr int kCalls = 5'000;
  std::vector<std::thread> threads;
  for (int thread = 0; thread < kThreads; ++thread) {
    threads.emplace_back([&, thread] {
      for (int i = 0; i < kCalls; ++i) {
        client().setServiceType(static_cast<Client::ServiceType>(thread), i,
                                [](const Result<bool>& reply) { EXPECT_TRUE(reply.ok()); });
      }
    });
  }
  std::vector<std::int64_t> next(kThreads);
  for (int i = 0; i < kThreads * kCalls; ++i) {
    const Value call = *service_.receive();
    const List& arguments = *(*call.list())[3].list();
    const auto thread = static_cast<std::size_t>(*arguments[0].integer());
    ASSERT_EQ(*arguments[1].integer(), next[thread]++);
    service_.reply(call, true);
  }
  for (std::thread& thread : threads) thread.join();
}

TEST(ClientLifetimeTest, EndingAClientSendsWhatGatheredAndAnswersItsCallsBeforeItIsGone) {
  FakeService service;
  int lost = 0;
  {
    auto client = Client::connect(service.path());
    service.accept();
    const Client::Batch batch(client.value());
    for (int i = 0; i < 3; ++i) {
      client.value().createReportingSession(i, [&lost](const auto& reply) { lost += !reply.ok(); });
    }
    Client moved = std::move(client.value());
    EXPECT_EQ(lost, 0);
  }
  EXPECT_EQ(lost, 3);
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(service.receive());
}

TEST(ClientLifetimeTest, AReplyMayEndItsClient) {
  FakeService service;
  Expected<bool> ended;
  auto client = std::make_unique<Client>(std::move(Client::connect(service.path()).value()));
  service.accept();
  client->createReportingSession(7, [&client, reply = ended.reply()](const Result<bool>& result) {
    client.reset();
    reply(result);
  });
  service.reply(*service.receive(), true);
  EXPECT_TRUE(ended.get().value());
  EXPECT_FALSE(service.receive());
}

std::string WhyNot(const std::string& path) {
  const auto client = Client::connect(path);
  if (client) return "connected";
  EXPECT_TRUE(IsCode(client.error(), Client::Code::unreachable));
  return client.error().description();
}

TEST(ClientConnectTest, SaysWhyTheServiceIsNotThere) {
  FakeService service;
  EXPECT_THAT(WhyNot(service.directory() / "none.sock"),
              AllOf(HasSubstr("no socket " + service.directory().string()), HasSubstr("quarveld")));
  EXPECT_THAT(WhyNot("/" + std::string(200, 'x')), HasSubstr("107 bytes"));
  service.stopListening();
  EXPECT_THAT(WhyNot(service.path()), AllOf(HasSubstr("left behind"), HasSubstr("quarveld")));
}

TEST(ClientConnectTest, NamesTheGroupThatWouldBeLetIn) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can become a user who is not let in";
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
  ::unsetenv("XDG_RUNTIME_DIR");
  ::setenv("RUNTIME_DIRECTORY", (here + ":/elsewhere").c_str(), 1);
  EXPECT_EQ(Client::defaultSocketPath(), service.path());
  ::setenv("QUARVEL_SOCKET", "/somewhere/else.sock", 1);
  EXPECT_EQ(Client::defaultSocketPath(), "/somewhere/else.sock");
  ::unsetenv("QUARVEL_SOCKET");
  ::unsetenv("RUNTIME_DIRECTORY");
  EXPECT_EQ(Client::defaultSocketPath(), "/run/quarvel/reporting.sock");
}

}  // namespace
}  // namespace quarvel
