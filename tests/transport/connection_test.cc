// Traffic on the wire: calls, replies, unknown calls, bytes that are no calls, and both ends;
// limits of clients; the listening socket.

#include <gmock/gmock.h>
#include <sys/stat.h>
#include <unistd.h>

#include <latch>
#include <numeric>
#include <string>
#include <thread>

#include "tests/transport/ConnectionFixture.h"

namespace quarvel {
namespace {

using ::testing::AllOf;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::StartsWith;
using namespace std::chrono_literals;
using namespace std::string_literals;

/// Encoded, as in the bytes of a call.
const std::string echo =
    "\xab"
    "echo:reply:"s;

/// From 0 up, below `count`.
std::vector<std::int64_t> Numbers(std::size_t count) {
  std::vector<std::int64_t> numbers(count);
  std::iota(numbers.begin(), numbers.end(), 0);
  return numbers;
}

TEST(Connection, AnswersCallsInEveryFormThatFits) {
  const struct {
    const char* name;
    std::string bytes;
    const char* response;
  } cases[] = {
      {"shortest forms", "\x94\x00\x07"s + echo + "\x91\x2a", "[1,7,null,42]"},
      {"unsigned where signed would do",
       "\x94\xcc\x00\xcd\x00\x07"s + echo + "\x91\xcf\0\0\0\0\0\0\0\x2a"s, "[1,7,null,42]"},
      {"signed forms of the id", "\x94\x00\xd3\0\0\0\0\xff\xff\xff\xff"s + echo + "\x91\xd0\xd6",
       "[1,4294967295,null,-42]"},
      {"long heads for lists and strings",
       "\xdd\0\0\0\x04\x00\x07\xdb\0\0\0\x0b"s + "echo:reply:" + "\xdc\0\x01\x2a"s,
       "[1,7,null,42]"},
      {"absent arguments", CallBytes(8, "describe:code:list:reply:", {nullptr, 65535, nullptr}),
       R"([1,8,null,"none 65535 none"])"},
      {"every argument",
       CallBytes(9, "describe:code:list:reply:",
                 {Dictionary{{"a", 1}, {2, List{"b", true}}}, 0, List{1, -2, 3}}),
       R"([1,9,null,"{\"a\":1,\"2\":[\"b\",true]} 0 3"])"},
      {"an error reply", CallBytes(10, "refuse:", {}),
       R"([1,10,{"domain":"test","code":9,"userInfo":{"why":"because"}},null])"},
  };
  Service service;
  Client client = service.connect();
  for (const auto& row : cases) {
    ASSERT_TRUE(client.send(row.bytes));
    EXPECT_EQ(client.response(), row.response) << row.name;
  }
}

TEST(Connection, AnswersWrongCallsWithAReasonAndGoesOn) {
  const std::string describe = "describe:code:list:reply:";
  const struct {
    const char* name;
    std::string bytes;
    int code;
    const char* reason;
  } cases[] = {
      {"unknown method", CallBytes(5, "ecco:", {}), 1,
       "no operation \\\"ecco:\\\"; there are: echo:reply:,"},
      {"method that is no text", CallBytes(5, "\xff\n", {}), 1, "no operation \\\"??\\\""},
      {"too few arguments", CallBytes(5, describe, {}), 2, "takes 3 arguments, but 0 came"},
      {"too many arguments", CallBytes(5, "echo:reply:", {1, 2}), 2,
       "takes 1 argument, but 2 came"},
      {"another kind", CallBytes(5, "echo:reply:", {"1"}), 2,
       "(echo) of echo:reply: must be a signed 64-bit integer"},
      {"number out of range", CallBytes(5, describe, {nullptr, 65536, nullptr}), 2, "(code) of"},
      {"negative number", CallBytes(5, describe, {nullptr, -1, nullptr}), 2,
       "unsigned 16-bit integer"},
      {"list with another kind", CallBytes(5, describe, {nullptr, 1, List{1, "2"}}), 2, "item 2"},
      {"dictionary with a real as key",
       "\x94\x00\x05\xb9"s + describe + "\x93\x81\xcb\0\0\0\0\0\0\0\0\x01\x01\xc0"s, 2,
       "(describe) of"},
      {"text that is not UTF-8",
       "\x94\x00\x05\xb9"s + describe + "\x93\x81\xa1\x61\xa1\xff\x01\xc0", 2, "(describe) of"},
  };
  Service service;
  Client client = service.connect();
  for (const auto& row : cases) {
    ASSERT_TRUE(client.send(row.bytes));
    EXPECT_THAT(client.response(),
                AllOf(StartsWith(R"([1,5,{"domain":"quarvel.connection","code":)" +
                                 std::to_string(row.code)),
                      HasSubstr(row.reason)))
        << row.name;
  }
  EXPECT_TRUE(client.isServed());
  EXPECT_THAT(service.journal.record().calls, ElementsAre(Client::kServedNumber))
      << "a wrong call reached the object";
}

TEST(Connection, EndsAClientThatBreaksTheProtocolAndNoOther) {
  Configuration::Limits limits;
  limits.messageBytes = 4096;
  limits.depth = 8;
  const std::pair<const char*, std::string> cases[] = {
      {"text", "GET / HTTP/1.1\r\n\r\n"},
      {"a byte that MessagePack never uses", "\xc1"},
      {"a list of nothing", "\x90"},
      {"a dictionary", "\x84\x00\x01\x02\x03\x04\x05\x06\x07"s},
      {"a response", "\x94\x01\x07\xc0\xc0"},
      {"an unknown type", "\x94\x03\x07"s + echo + "\x91\x2a"},
      {"a request without id", "\x93\x00"s + echo + "\x91\x2a"},
      {"a notification with id", "\x94\x02\x07"s + echo + "\x91\x2a"},
      {"five items", "\x95\x00\x07"s + echo + "\x91\x2a\xc0"},
      {"a negative id", "\x94\x00\xff"s + echo + "\x91\x2a"},
      {"an id above 32 bits", "\x94\x00\xcf\0\0\0\1\0\0\0\0"s + echo + "\x91\x2a"},
      {"an id that is text", "\x94\x00\xa1\x37"s + echo + "\x91\x2a"},
      {"a method that is bytes", "\x94\x00\x07\xc4\x01\x61\x91\x2a"s},
      {"params that are no list", "\x94\x00\x07"s + echo + "\x2a"},
      {"a message too large", CallBytes(7, "echo:reply:", {std::string(4096, 'x')})},
      {"nested too deeply", "\x94\x00\x07"s + echo + std::string(8, '\x91') + "\x00"s},
  };
  Service service(limits);
  Client bystander = service.connect();
  std::vector<std::string> handlers;
  for (const auto& [name, bytes] : cases) {
    SCOPED_TRACE(name);
    Client client = service.connect();
    // The call before it, in the same write, is still executed and answered.
    ASSERT_TRUE(client.send(CallBytes(1, "echo:reply:", {1}) + bytes));
    EXPECT_EQ(client.response(), "[1,1,null,1]");
    EXPECT_EQ(client.response(), "end");
    handlers.insert(handlers.end(), {"interrupted", "invalidated"});
    ASSERT_TRUE(service.journal.waitForHandlers(handlers.size()));
    EXPECT_EQ(service.journal.record().handlers, handlers);
    EXPECT_THAT(
        LogRecorder::takeErrors(),
        ElementsAre(StartsWith("client " + std::to_string(::getpid()) + " broke the protocol: ")));
    EXPECT_TRUE(bystander.isServed());
  }
}

TEST(Connection, TakesAMegabyteInSixtyThousandPieces) {
  Service service;
  Client client = service.connect();
  // A scan from the start at each piece would take minutes.
  Dictionary large{{"text", std::string(1'000'000, 't')}};
  for (int i = 0; i < 1000; ++i) large.set(i, i);
  const std::string bytes = CallBytes(2, "describe:code:list:reply:", {large, 1, nullptr});
  for (std::size_t at = 0; at < bytes.size(); at += 16) {
    ASSERT_TRUE(client.send(std::string_view(bytes).substr(at, 16)));
  }
  EXPECT_THAT(client.response(), AllOf(StartsWith("[1,2,null,"), HasSubstr("\\\"999\\\":999")));
  EXPECT_TRUE(client.isServed());
}

TEST(Connection, DeliversTheFirstReplyAndNoOther) {
  Service service;
  Client client = service.connect();
  ASSERT_TRUE(client.call(1, "twice:reply:", {10}));
  ASSERT_TRUE(client.call(2, "never:", {}));
  ASSERT_TRUE(client.send(CallBytes(std::nullopt, "nobody:", {}) +
                          CallBytes(std::nullopt, "echo:reply:", {"x"})));
  ASSERT_TRUE(client.call(3, "keep:reply:", {30}));
  ASSERT_TRUE(client.call(4, "echo:reply:", {40}));
  EXPECT_EQ(client.response(), "[1,1,null,10]");
  EXPECT_EQ(client.response(), "[1,4,null,40]")
      << "replies come in the order in which they are given";
  auto kept = service.journal.takeKeptCall();
  kept->reply(31);  // from this thread
  kept->reply(32);
  EXPECT_EQ(client.response(), "[1,3,null,31]");
  EXPECT_TRUE(client.isServed());
}

TEST(Connection, ReleasesItsObjectWhenItsClientHasGone) {
  Service service;
  Client client = service.connect();
  Client other = service.connect();
  ASSERT_TRUE(client.call(1, "keep:reply:", {1}));
  ASSERT_TRUE(service.journal.waitForCalls(1));
  ASSERT_TRUE(other.isServed());
  auto stillKnown = service.connections.front().lock();
  EXPECT_EQ(stillKnown->processIdentifier(), ::getpid());
  client.hangUp();
  ASSERT_TRUE(service.journal.waitForHandlers(1));
  ASSERT_TRUE(other.isServed());  // by the same thread, so the end of the first is complete
  EXPECT_TRUE(service.objects.front().expired());
  stillKnown.reset();
  EXPECT_TRUE(service.connections.front().expired()) << "though its call is in flight";
  EXPECT_THAT(service.journal.record().handlers, ElementsAre("invalidated"));
  EXPECT_THAT(LogRecorder::takeErrors(), IsEmpty()) << "closing is no protocol error";
  service.journal.takeKeptCall()->reply(1);  // discarded
}

TEST(Connection, ExecutesCallsOfAClientThatDoesNotWaitForReplies) {
  constexpr std::size_t kCalls = 2000;
  Service service;
  {
    Client client = service.connect();
    for (std::uint32_t i = 0; i < kCalls; ++i) client.call(i, "make:size:reply:", {1, 500});
  }
  EXPECT_TRUE(service.journal.waitForCalls(kCalls));
  EXPECT_TRUE(service.journal.waitForHandlers(1));
  Client halfOpen = service.connect();
  ASSERT_TRUE(halfOpen.call(1, "echo:reply:", {1}));
  halfOpen.stopSending();
  EXPECT_EQ(halfOpen.response(), "[1,1,null,1]");
  EXPECT_EQ(halfOpen.response(), "end");
}

TEST(Connection, DrainsCallsAtTheEndOfTheService) {
  Configuration::Limits limits;
  limits.queuedCalls = 4;
  Service service(limits);
  Client client = service.connect();
  for (int i = 0; i < 100; ++i) client.send(CallBytes(std::nullopt, "keep:reply:", {i}));
  Client other = service.connect();
  ASSERT_TRUE(other.isServed());
  service.end();
  std::vector<std::int64_t> arrived = service.journal.record().calls;
  std::erase(arrived, Client::kServedNumber);
  EXPECT_EQ(arrived, Numbers(100)) << "a call that had been sent was not executed";
  EXPECT_THAT(service.journal.record().handlers,
              ElementsAre("invalidated", "invalidated", "ended"));
  EXPECT_THAT(LogRecorder::takeErrors(), IsEmpty());
  EXPECT_EQ(client.response(), "end");
  EXPECT_FALSE(std::filesystem::exists(service.socketPath()));
  while (auto kept = service.journal.takeKeptCall()) kept->reply(0);  // too late, and harmless
}

TEST(Connection, ServesClientsThatConnectedBeforeTheEnd) {
  Service service({}, false);
  Client client = service.connect();
  ASSERT_TRUE(client.call(1, "echo:reply:", {1}));
  service.requestEnd();
  service.begin();
  service.end();
  EXPECT_EQ(client.response(), "[1,1,null,1]");
  EXPECT_EQ(client.response(), "end");
}

// Clients that are too fast, too slow or too many: bounded, without cost to other clients.

TEST(ConnectionLimits, AClientThatIsTooFastWaitsAndLosesNothing) {
  Configuration::Limits byCalls;
  byCalls.queuedCalls = 8;
  Configuration::Limits byBytes;
  byBytes.queuedBytes = 8 * CallBytes(100, "keep:reply:", {100}).size();
  for (const Configuration::Limits& limits : {byCalls, byBytes}) {
    constexpr std::size_t kCalls = 100;
    Service service(limits);
    Client client = service.connect();
    for (std::uint32_t i = 0; i < kCalls; ++i) client.call(100 + i, "keep:reply:", {i});
    ASSERT_TRUE(service.journal.waitForCalls(8));
    EXPECT_TRUE(service.connect().isServed()) << "only the fast client waits";
    // Each reply is given before the call completes.
    std::thread worker([&] {
      for (std::size_t done = 0; done < kCalls;) {
        if (auto kept = service.journal.takeKeptCall()) {
          kept->reply(kept->number);
          ++done;
        } else if (!service.journal.waitForCalls(done + 2)) {  // the other client's call counts too
          break;
        }
      }
    });
    for (std::size_t i = 0; i < kCalls; ++i) {
      ASSERT_THAT(client.response(), HasSubstr(",null," + std::to_string(i) + "]"));
    }
    worker.join();
    std::vector<std::int64_t> arrived = service.journal.record().calls;
    EXPECT_EQ(arrived.at(8), Client::kServedNumber)
        << "more than eight calls were taken in before one completed";
    arrived.erase(arrived.begin() + 8);
    EXPECT_EQ(arrived, Numbers(kCalls));
    EXPECT_LE(service.journal.record().mostKept, 9U);
  }
}

TEST(ConnectionLimits, UnstoredCallsHoldBackLaterOnesUntilTheyAreStoredOrSlow) {
  Service service;
  const auto callTwoHundredTimes = [](Client& client) {
    for (int i = 0; i < 200; ++i) ASSERT_TRUE(client.call(1, "answerUnstored:reply:", {i}));
  };
  Client slow = service.connect();
  const auto began = std::chrono::steady_clock::now();
  callTwoHundredTimes(slow);
  EXPECT_TRUE(service.journal.waitForCalls(200)) << "none of them completes";
  EXPECT_GE(std::chrono::steady_clock::now() - began, 50ms) << "more than 128 were unstored";
  Client other = service.connect();
  callTwoHundredTimes(other);
  ASSERT_TRUE(service.journal.waitForCalls(200 + 128));
  while (service.journal.takeKeptCall()) continue;
  EXPECT_TRUE(service.journal.waitForCalls(400)) << "completed calls make room";
}

TEST(ConnectionLimits, ClientsThatReconnectWithoutPauseAreRateLimited) {
  Service service({}, false);
  for (int i = 0; i < 1512; ++i) service.connect().hangUp();
  Client last = service.connect();
  const auto began = std::chrono::steady_clock::now();
  service.begin();
  EXPECT_TRUE(last.isServed());
  // 1000 more than the burst, at 4,000 a second.
  EXPECT_GE(std::chrono::steady_clock::now() - began, 249ms);
}

TEST(ConnectionLimits, AClientThatReadsLateIsHeldBackAndGetsEveryReplyInOrder) {
  constexpr std::size_t kCalls = 300;
  Configuration::Limits limits;
  limits.replyBytes = 64 * 1024;
  Service service(limits);
  Client client = service.connect();
  std::string bytes;
  for (std::uint32_t i = 0; i < kCalls; ++i) {
    bytes += CallBytes(i, "make:size:reply:", {i, 16 * 1024});
    bytes += CallBytes(std::nullopt, "make:size:reply:", {i, 1});  // answered with nothing
  }
  ASSERT_TRUE(client.send(bytes));
  Client bystander = service.connect();
  ASSERT_TRUE(bystander.isServed());
  // The kernel's buffer and `replyBytes` hold far fewer replies.
  ASSERT_TRUE(bystander.isServed());
  EXPECT_LT(service.journal.record().calls.size(), kCalls);
  for (std::size_t i = 0; i < kCalls; ++i) {
    ASSERT_EQ(client.response().substr(0, 12 + std::to_string(i).size()),
              "[1," + std::to_string(i) + ",null,\"xx");
  }
  EXPECT_TRUE(service.journal.waitForCalls(2 * kCalls + 2));
  EXPECT_THAT(LogRecorder::takeErrors(), IsEmpty());
}

TEST(ConnectionLimits, RepliesThatComeLaterCountToo) {
  Configuration::Limits limits;
  limits.replyBytes = 1024;
  limits.stall = 1ms;
  Service service(limits);
  Client bystander = service.connect();
  Client client = service.connect();
  constexpr std::size_t kCalls = 2000;  // their replies are more than a socket takes unread
  for (std::size_t i = 0; i < kCalls; ++i) ASSERT_TRUE(client.call(1, "later:reply:", {1 << 30}));
  ASSERT_TRUE(service.journal.waitForCalls(kCalls));
  // One by one, so that the socket is full well before `replyBytes` are held.
  while (auto kept = service.journal.takeKeptCall()) {
    kept->reply(kept->number);
    ASSERT_TRUE(bystander.isServed());
  }
  EXPECT_THAT(LogRecorder::nextError(), HasSubstr("does not read its replies"));
}

TEST(ConnectionLimits, AMessageThatTheServiceHoldsBackHasNoDeadline) {
  Configuration::Limits limits;
  limits.frame = 1ms;
  limits.queuedCalls = 1;
  Service service(limits);
  Client client = service.connect();
  Client other = service.connect();
  const std::string keep = CallBytes(1, "keep:reply:", {1});
  ASSERT_TRUE(client.send(keep + keep + CallBytes(2, "echo:reply:", {2}).substr(0, 5)));
  ASSERT_TRUE(service.journal.waitForCalls(1));
  // Meanwhile the other client's message times out.
  ASSERT_TRUE(other.send(keep.substr(0, 5)));
  EXPECT_EQ(other.response(), "end");
  EXPECT_THAT(LogRecorder::nextError(), HasSubstr("is disconnected: a message was begun"));
  service.journal.takeKeptCall()->reply(1);
  EXPECT_EQ(client.response(), "[1,1,null,1]");
}

// The socket file that clients connect to, and a socket that was passed in.

class ListeningSocketTest : public ::testing::Test {
 protected:
  const TemporaryDirectory directory_;
  const std::filesystem::path path_ = directory_.path() / "socket";
};

TEST_F(ListeningSocketTest, MakesItsDirectoryAndRemovesItsOwnFile) {
  const auto path = directory_.path() / "run" / "quarvel" / "reporting.sock";
  const auto modeOf = [](const std::filesystem::path& file) {
    return static_cast<mode_t>(std::filesystem::status(file).permissions());
  };
  const mode_t umaskBefore = ::umask(0027);
  {
    auto socket = ListeningSocket::listeningAt(path);
    ::umask(umaskBefore);
    ASSERT_TRUE(socket) << socket.error().description();
    EXPECT_EQ(modeOf(path), 0660U);
    EXPECT_EQ(modeOf(path.parent_path()), 0750U);
  }
  EXPECT_FALSE(std::filesystem::exists(path));
  auto socket = ListeningSocket::listeningAt(path);
  ASSERT_TRUE(socket);
  std::filesystem::remove(path);
  const auto successor = ListeningSocket::listeningAt(path);
  ASSERT_TRUE(successor);
  socket.value().removeFile();
  EXPECT_TRUE(std::filesystem::exists(path)) << "the file of a successor";
}

TEST_F(ListeningSocketTest, ReplacesOnlyAStaleFile) {
  const struct {
    const char* name;
    int type;
    int backlog;  // -1: does not listen
    bool stale;   // closed before, so replaced
  } cases[] = {
      {"dead", SOCK_STREAM, 5, true},
      {"dead before it listened", SOCK_STREAM, -1, true},
      {"dead, of another type", SOCK_DGRAM, -1, true},
      {"live", SOCK_STREAM, 5, false},
      {"live, with its queue full", SOCK_STREAM, 0, false},
      {"about to listen", SOCK_STREAM, -1, false},
      {"live, of another type", SOCK_DGRAM, -1, false},
  };
  for (const auto& row : cases) {
    SCOPED_TRACE(row.name);
    std::filesystem::remove(path_);
    UniqueDescriptor there(BoundSocket(path_, row.type));
    if (row.backlog >= 0) {
      ASSERT_EQ(::listen(there.get(), row.backlog), 0);
    }
    if (row.stale) there = UniqueDescriptor();
    const auto socket = ListeningSocket::listeningAt(path_);
    EXPECT_EQ(socket.ok(), row.stale);
    if (!socket) {
      EXPECT_THAT(socket.error().description(), HasSubstr("another service is listening there"));
    }
    EXPECT_TRUE(std::filesystem::exists(path_));
  }
}

TEST_F(ListeningSocketTest, RefusesAPathThatIsNoSocketOrTooLongAndASocketThatDoesNotListen) {
  directory_.write("socket", "precious");
  const auto socket = ListeningSocket::listeningAt(path_);
  ASSERT_FALSE(socket);
  EXPECT_THAT(socket.error().description(), HasSubstr("no socket"));
  EXPECT_EQ(std::filesystem::file_size(path_), 8U);
  const auto tooLong = ListeningSocket::listeningAt(directory_.path() / std::string(108, 'l'));
  ASSERT_FALSE(tooLong);
  EXPECT_THAT(tooLong.error().description(), HasSubstr("1 to 107 bytes"));
  EXPECT_FALSE(ListeningSocket::inherited(
      UniqueDescriptor(BoundSocket(directory_.path() / "quiet", SOCK_STREAM))));
}

TEST_F(ListeningSocketTest, OfServicesThatStartAtOnceExactlyOneSucceeds) {
  for (int round = 0; round < 50; ++round) {
    ::close(BoundSocket(path_, SOCK_STREAM));  // stale
    std::latch go(4);
    std::vector<std::optional<ListeningSocket>> sockets(4);
    std::vector<std::thread> services;
    for (auto& mine : sockets) {
      services.emplace_back([&] {
        go.arrive_and_wait();
        if (auto socket = ListeningSocket::listeningAt(path_))
          mine.emplace(std::move(socket.value()));
      });
    }
    for (std::thread& service : services) service.join();
    ASSERT_EQ(std::ranges::count_if(sockets, [](const auto& each) { return each.has_value(); }), 1);
  }
}

}  // namespace
}  // namespace quarvel
