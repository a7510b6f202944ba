#include <gmock/gmock.h>

#include "tests/Statistics/Service/RunningService.h"

namespace quarvel {
namespace {

using testing::Contains;
using testing::ElementsAre;
using testing::IsEmpty;
using Lines = std::vector<std::string>;

const std::string kDelegate = "-[ZQReportingServiceDelegate ";
const std::string kInstance = "-[ZQReportingServerInstance ";

// What one call leaves in the journal. The lines of the operation itself stand there without
// "log " and without its function's name.
Lines JournalOf(RunningService& service, Client& client, const std::string& method,
                const List& arguments) {
  service.journal.clear();
  client.call(method, arguments);
  service.run();
  Lines lines = service.journal.lines({"log", "trace", "reply", "exit"});
  const std::string own = " zqrs " + kInstance + method + "]: ";
  for (std::string& line : lines) {
    if (const auto at = line.find(own); at != std::string::npos) {
      line = line.substr(4, at - 4) + ": " + line.substr(at + own.size());
    } else if (line.starts_with("reply " + method)) {
      line = "reply" + line.substr(6 + method.size());
    }
  }
  return lines;
}

TEST(ServerInstance, EveryOperationInOrder) {
  struct Case {
    const char* method;
    List arguments;
    Lines journal;
  };
  const std::string notFound = "log error zqrs " + kDelegate +
                               "findReportingSessionForID:]: failed to find reporting session 99";
  const Case kCases[] = {
      {"createReportingSession:reply:",
       {8},
       {"debug: creating session for reporter 8", "trace 0x21042814",
        "log info zqrr -[ZQReportingSession initWithID:processIdentifiers:]: created reporting "
        "session for ID: 8",
        "trace 0x21042828", "default: session created for reporter 8", "reply true"}},
      {"setServiceType:reportingSession:reply:",
       {2, 7},
       {"debug: setting service type 2 for reporter 7",
        "log info zqrr -[ZQReportingSession setServiceType:]: setting service type telephony",
        "default: service type 2 set for reporter  7", "reply true"}},
      {"setServiceType:reportingSession:reply:",
       {2, 99},
       {"debug: setting service type 2 for reporter 99", "reply true"}},
      {"setServiceType:reportingSession:reply:",
       {2, 0},
       {"debug: setting service type 2 for reporter 0", "reply true"}},
      {"getServiceNameForReporterID:reply:",
       {7},
       {"debug: fetching seviceType", "reply 2",
        "default: returnning service type 2 for reporter  7"}},
      {"getServiceNameForReporterID:reply:",
       {99},
       {"debug: fetching seviceType", notFound, "reply 65535",
        "default: returnning service type 65535 for reporter  99"}},
      {"getServiceNameForReporterID:reply:",
       {0},
       {"debug: fetching seviceType", "reply 65535", "reply 65535",
        "default: returnning service type 65535 for reporter  0"}},
      {"setConfiguration:forReporterID:reply:",
       {Dictionary{{"a", 1}}, 7},
       {"debug: setting configuration", "reply true"}},
      {"setConfiguration:forReporterID:reply:",
       {Value(), 99},
       {"debug: setting configuration", "reply true"}},
      {"startReportingSessionForID:reply:",
       {99},
       {"debug: starting session for reporter 99", "trace 0x21042818", notFound}},
      {"startReportingSessionForID:reply:",
       {0},
       {"debug: starting session for reporter 0", "trace 0x21042818", "reply true"}},
      {"stopReportingSessionForID:reply:",
       {7},
       {"debug: stopping session for reporter 7", "trace 0x2104281c",
        "default: nothing interesting to fetch from the drivers", "default: stopping 7",
        "reply true"}},
      {"stopReportingSessionForID:reply:",
       {99},
       {"debug: stopping session for reporter 99", "trace 0x2104281c", "default: stopping 99",
        "reply true"}},
      {"stopReportingSessionForID:reply:",
       {0},
       {"debug: stopping session for reporter 0", "trace 0x2104281c", "reply true"}},
      {"reporterID:valid:",
       {7},
       {"debug: validating reporter 7", "default: validating reporter 7",
        "reply {\"reporterID\":7,\"serviceType\":2}"}},
      {"reporterID:valid:",
       {99},
       {"debug: validating reporter 99", notFound, "default: validating reporter 99",
        "reply {\"reporterID\":0,\"serviceType\":65535}"}},
      {"reporterID:valid:",
       {0},
       {"debug: validating reporter 0", "default: validating reporter 0",
        "reply {\"reporterID\":0,\"serviceType\":65535}"}},
      {"getAllReporters:", {}, {"reply [7,8]"}},
      {"destroyReportingSession:reply:",
       {99},
       {"debug: destroying session for reporter 99", "trace 0x21042820", "default: destroying 99",
        "reply true"}},
      {"destroyReportingSession:reply:",
       {0},
       {"debug: destroying session for reporter 0", "trace 0x21042820", "reply true"}},
      {"destroyReportingSession:reply:",
       {8},
       {"debug: destroying session for reporter 8", "trace 0x21042820", "trace 0x21042834",
        "log info zqrr -[ZQReportingSession dealloc]: deallocing this session 8",
        "default: destroying 8", "reply true"}},
      {"killService:", {}, {"default: DESTROYING SERVICE", "exit 2"}},
  };
  for (const auto seed : Seeds()) {
    RunningService service(seed);
    Client client = service.connect(42);
    client.create(7);
    service.run();
    service.log.verbose = {"zqrs"};
    for (const Case& each : kCases) {
      EXPECT_EQ(JournalOf(service, client, each.method, each.arguments), each.journal)
          << each.method << " " << JsonText(Value(each.arguments));
    }
  }
}

SEEDED_TEST(ServerInstance, EntryLinesAreWrittenBeforeTheServerQueueGetsToTheCall, RunningService) {
  Client client = connect(42);
  log.verbose = {"zqrs"};
  bool entered = false;
  ServerQueue().async([&] {
    scheduler.sleep(1s);
    entered = !log.texts("debug").empty();
  });
  client.create(7);
  run();
  EXPECT_TRUE(entered);
}

SEEDED_TEST(ServerInstance, AStartIsAnsweredWhenTheSessionStops, RunningService) {
  Client client = connect(41);
  client.create(7);
  const auto start = client.start(7);
  runFor(1h);
  EXPECT_THAT(start->results, IsEmpty());
  client.stop(7);
  run();
  EXPECT_THAT(start->answeredAt, ElementsAre(1h));
}

struct ServiceWithDrivers : RunningService {
  explicit ServiceWithDrivers(std::uint64_t seed)
      : RunningService(seed, [](Simulation& simulation) {
          simulation.tallix.channels = {{"Haptics", "Stats", "X", 5},
                                        {"Speaker", std::nullopt, "Y", 5}};
        }) {}
};

TEST(ServerInstance, AStopReportsWhatTheDriversCountedSinceTheStart) {
  for (const auto seed : Seeds()) {
    ServiceWithDrivers service(seed);
    Client client = service.connect(42);
    client.createStarted(7);
    service.run();
    service.tallix.channels[0].value = 8;
    client.stop(7);
    service.run();
    const auto& messages = service.agent.sessions.at(0).messages;
    ASSERT_EQ(messages.size(), 2U);  // and the summary
    EXPECT_EQ(messages[0].category, 9);
    EXPECT_EQ(messages[0].type, 0);
    EXPECT_EQ(messages[0].payload.root().toDictionary(), (Dictionary{{"Haptics_Stats_X", 3}}));
    EXPECT_THAT(service.log.texts("default zqrs"),
                Contains("default zqrs " + kInstance +
                         "stopReportingSessionForID:reply:]: fetching driver logs "
                         "{\"Haptics_Stats_X\":3}"));
    // The snapshot went with the first stop; without one the counters themselves are reported.
    client.stop(7);
    service.run();
    ASSERT_EQ(service.agent.singleMessages.size(), 1U);
    EXPECT_EQ(service.agent.singleMessages[0].message.payload.root().toDictionary(),
              (Dictionary{{"Haptics_Stats_X", 8}, {"Speaker_Y", 5}}));
  }
}

SEEDED_TEST(ServerInstance, DestroyStopsAStartedSessionFirst, RunningService) {
  Client client = connect(42);
  client.createStarted(7);
  client.destroy(7);
  const auto valid = client.valid(7);
  run();
  EXPECT_THAT(journal.lines({"reply start", "reply destroy"}),
              ElementsAre("reply startReportingSessionForID:reply: true",
                          "reply destroyReportingSession:reply: true"));
  EXPECT_EQ(valid->results.at(0).dictionary()->find("reporterID")->integer()[0], 0);
}

SEEDED_TEST(ServerInstance, KillEndsTheProcessWithoutStoppingOrAnsweringAnything, RunningService) {
  Client client = connect(42);
  client.create(7);
  const auto start = client.start(7);
  run();
  const auto kill = client.kill();
  run();
  EXPECT_EQ(process.exitStatus, 2);
  EXPECT_THAT(start->results, IsEmpty());
  EXPECT_THAT(kill->results, IsEmpty());
  EXPECT_THAT(agent.sessions.at(0).flushes, IsEmpty());
}

}  // namespace
}  // namespace quarvel
