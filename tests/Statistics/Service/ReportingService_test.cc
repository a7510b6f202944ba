#include <fmt/format.h>
#include <gmock/gmock.h>

#include "tests/Statistics/Service/CoreFixtures.h"

// Log lines and their order, and cases that need a special set-up. The simulation checks the fate
// of messages.

namespace quarvel {
namespace {

using testing::Contains;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::StartsWith;
using testing::UnorderedElementsAre;

const Value kYes(true);
const std::string kDelegate = "-[ZQReportingServiceDelegate ";
const std::string kInstance = "-[ZQReportingServerInstance ";
const char* const kListener = "listener:shouldAcceptNewConnection:]: ";

TEST(ServerInstance, OperationsLogTraceAndReplyInOrder) {
  // Each call, then its journal. "+" stands for the operation's own log lines.
  const std::vector<std::pair<std::string, List>> kCalls = {
      {"createReportingSession:reply:", {8}},
      {"setServiceType:reportingSession:reply:", {2, 7}},
      {"getServiceNameForReporterID:reply:", {7}},
      {"getServiceNameForReporterID:reply:", {0}},
      {"setConfiguration:forReporterID:reply:", {Value(), 7}},
      {"startReportingSessionForID:reply:", {99}},
      {"stopReportingSessionForID:reply:", {7}},
      {"reporterID:valid:", {7}},
      {"destroyReportingSession:reply:", {8}},
      {"killService:", {}}};
  const std::string kJournal = R"(
+debug: creating session for reporter 8
trace 0x21042814
log info zqrr -[ZQReportingSession initWithID:processIdentifiers:]: created reporting session for ID: 8
trace 0x21042828
+default: session created for reporter 8
reply true
+debug: setting service type 2 for reporter 7
log info zqrr -[ZQReportingSession setServiceType:]: setting service type telephony
+default: service type 2 set for reporter  7
reply true
+debug: fetching seviceType
reply 2
+default: returnning service type 2 for reporter  7
+debug: fetching seviceType
reply 65535
reply 65535
+default: returnning service type 65535 for reporter  0
+debug: setting configuration
reply true
+debug: starting session for reporter 99
trace 0x21042818
log error zqrs -[ZQReportingServiceDelegate findReportingSessionForID:]: failed to find reporting session 99
+debug: stopping session for reporter 7
trace 0x2104281c
+default: nothing interesting to fetch from the drivers
+default: stopping 7
reply true
+debug: validating reporter 7
+default: validating reporter 7
reply {"reporterID":7,"serviceType":2}
+debug: destroying session for reporter 8
trace 0x21042820
trace 0x21042834
log info zqrr -[ZQReportingSession dealloc]: deallocing this session 8
+default: destroying 8
reply true
+default: DESTROYING SERVICE
exit 2)";
  for (const auto seed : Seeds()) {
    RunningService service(seed);
    Client client = service.connect(42);
    client.create(7);
    service.run();
    service.log.verbose = {"zqrs"};
    std::string journal;
    for (const auto& [method, arguments] : kCalls) {
      service.journal.clear();
      client.call(method, arguments);
      service.run();
      for (std::string line : service.journal.lines({"log", "trace", "reply", "exit"})) {
        const std::string own = " zqrs " + kInstance + method + "]";
        if (const auto at = line.find(own); at != std::string::npos) {
          line.erase(at, own.size()).replace(0, 4, "+");
        } else if (line.starts_with("reply " + method)) {
          line.erase(5, method.size() + 1);
        }
        journal += '\n' + line;
      }
    }
    EXPECT_EQ(journal, kJournal);
  }
}

SEEDED_TEST(ServerInstance, EntryLinesDoNotWaitForTheServerQueue, RunningService) {
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

TEST(Drivers, AStopReportsTheRiseOfTheCountersSinceTheStart) {
  const std::optional<std::string> none;
  for (const auto seed : Seeds()) {
    RunningService service(seed, [&](Simulation& simulation) {
      simulation.tallix.channels = {{"VorrenMXDrv", none, "a", 10},
                                    {"Speaker", "any", "b", 10},
                                    {"other", "MCA", "c", 10},
                                    {"Haptics", "Stats", none, 10},
                                    {"Haptics", "Other", "d", 10}};
    });
    Client client = service.connect(42);
    client.createStarted(7);
    service.run();
    for (std::size_t i = 0; i < 5; ++i) {
      service.tallix.channels[i].value = std::array{11, 9, 17, 13, 99}[i];
    }
    client.stop(7);
    service.run();
    const auto& messages = service.agent.sessions.at(0).messages;
    ASSERT_EQ(messages.size(), 2U);  // and the summary
    EXPECT_EQ(messages[0].category, 9);
    EXPECT_EQ(messages[0].type, 0);
    const std::string rise = R"({"VorrenMXDrv_a":1,"MCA_c":7,"Haptics_Stats_":3})";
    EXPECT_EQ(JsonText(messages[0].payload), rise);
    EXPECT_THAT(service.log.messages(), Contains("fetching driver logs " + rise));
    // The first stop dropped the snapshot; without one the counters themselves are reported.
    client.stop(7);
    service.run();
    ASSERT_EQ(service.agent.singleMessages.size(), 1U);
    EXPECT_EQ(JsonText(service.agent.singleMessages[0].message.payload),
              R"({"VorrenMXDrv_a":11,"Speaker_b":9,"MCA_c":17,"Haptics_Stats_":13})");
  }
}

TEST(Drivers, FailuresAreLoggedAndLeaveCountersOut) {
  const std::optional<std::string> none;
  Simulation simulation(1);
  simulation.tallix.channels = {{"Speaker", none, "b", 10}, {"Haptics", "Stats", "d", 0, false}};
  simulation.tallix.channelsError = Error{"tallix", 5, {}};
  const ZQReportingDriverUtility drivers;
  simulation.tallix.samplesError = Error{"tallix", 3, {}};
  const DriverSnapShot snapShot = drivers.getSnapShot();
  EXPECT_THAT(snapShot, IsEmpty());
  EXPECT_EQ(drivers.getDriverStatisticsRelativeToSnapShot(snapShot), std::nullopt);
  simulation.tallix.samplesError.reset();
  EXPECT_EQ(drivers.getDriverStatisticsRelativeToSnapShot(snapShot),
            (Dictionary{{"Speaker_b", 10}}));
  EXPECT_THAT(simulation.log.messages(),
              ElementsAre("creating tallixing driver utility",
                          "error 5 getting channels for driver VorrenMXDrv-(null)",
                          "error 5 getting channels for driver Speaker-(null)",
                          "subscribed to group group Speaker-(null)",
                          "error 5 getting channels for driver (null)-MCA",
                          "error 5 getting channels for driver Haptics-Stats",
                          "couldn't find any channels for driver group Haptics-Stats",
                          "subscribed to group group Haptics-Stats",
                          "sampling driver Speaker-(null)", "TallixCreateSamples error 3",
                          "getting latest samples", "done getting latest samples",
                          "TallixCreateSamples error 3", "getting latest samples",
                          "done getting latest samples", "TallixCreateSamplesDelta error 6"));
}

// Only the `ServerQueue` writes these journal lines while the sessions are started.
SEEDED_TEST(Routing, SinksPrecedeANamedSessionAndFollowABroadcastOne, RunningService) {
  const auto routed = [this] { return journal.lines({"vistrel", "ohmrik", "trace"}); };
  const std::string routing = "trace 0x21042824";
  const std::string event = "vistrel tarnwick.quarvel.Playback.Start";
  const std::string power = "ohmrik 28 Fennor_Haptics";
  const std::string sent = "trace 0x21042838";
  const Dictionary payload = {{"EngineOnTime", 3}, {"zqreporting_timestamp", 9.5}};
  Client first = connect(41);
  Client second = connect(42);
  second.createStarted(6);
  first.create(8);
  first.createStarted(7);
  run();
  journal.clear();
  first.send(payload, 3, 1, List{6, 6});
  run();
  EXPECT_THAT(routed(), ElementsAre(routing, event, power, sent, event, power, sent));
  journal.clear();
  log.lines.clear();
  second.send(payload);
  run();
  EXPECT_THAT(routed(), ElementsAre(routing, sent, event, power, sent, event, power));
  const std::string line =
      "default zqrs " + kInstance + "sendMessage:withCategory:andType:forReportingIDs:reply:]: ";
  EXPECT_THAT(log.texts(),
              ElementsAre(line + "sessions for client 41 : [\"<ZQReportingSession 7>\","
                                 "\"<ZQReportingSession 8>\"]",
                          line + "sessions for client 42 : [\"<ZQReportingSession 6>\"]",
                          line + "active reporting sessions 2 : [\"<ZQReportingSession 7>\","
                                 "\"<ZQReportingSession 6>\"]"));
}

TEST(Routing, OnlyAMessageToAtMostEightSessionsIsABriefBlock) {
  RunningService service(1);
  Client client = service.connect(41);
  const std::pair<std::optional<List>, std::size_t> kCases[] = {
      {List(8, Value(1)), 1}, {List(9, Value(1)), 0}, {std::nullopt, 0}};
  for (const auto& [reporterIDs, briefBlocks] : kCases) {
    service.briefBlocks = 0;
    client.send({}, 3, 1, reporterIDs);
    service.run();
    EXPECT_EQ(service.briefBlocks, briefBlocks);
  }
}

SEEDED_TEST(Routing, AFullAgentDelaysNoReply, RunningService) {
  Client client = connect(41);
  client.createStarted(7);
  run();
  agent.full = true;
  client.send({{"n", 1}}, 3, 1, List{7});
  client.send({{"n", 2}});
  const auto stop = client.stop(7);
  runFor(1s);
  EXPECT_THAT(stop->results, ElementsAre(kYes));
  EXPECT_THAT(agent.sessions.at(0).messages, IsEmpty());
  agent.full = false;
  run();
}

TEST(Preferences, AForeignNotificationAndAFailedRegistrationChangeNothing) {
  {
    RunningService service(
        1, [](Simulation& simulation) { simulation.notifications.registrationStatus = 5; });
    EXPECT_EQ(
        service.log.texts("default").at(0),
        "default zqrs " + kDelegate + "listenForDefaultsNotification]: notify setup result 5");
    const auto created = service.connect(42).create(7);
    service.run();
    EXPECT_THAT(created->results, ElementsAre(kYes));
  }
  RunningService listening(1);
  listening.log.lines.clear();
  listening.notifications.post("tarnwick.quarvel.reporting", 1);
  listening.run();
  EXPECT_THAT(listening.log.texts(), IsEmpty());
}

TEST(ClientUptime, IsReportedOnceWhenAClientEnds) {
  struct Case {
    std::int32_t pid;
    bool interrupted;
    std::chrono::seconds clockStep;
    double seconds;  // 0: no event, since the process has no name
    std::string line;
    std::string nextLine;
  };
  const std::string invalidated = "InvalidationHandler: connection exited process=";
  // Only the line truncates the fraction of the seconds.
  const Case kCases[] = {
      {42, true, 0s, 12.75, invalidated + "player uptime_sec=12",
       "InterruptionHandler: connection exited"},
      {42, false, -60s, 47.25, invalidated + "player uptime_sec=47",
       "clientStartDate is in the past. clientpid=42 clientprocessname=player"},
      {-1, false, 0s, 0, invalidated + "(null) uptime_sec=12",
       "clientProcessName is nil. clientpid=-1"},
  };
  for (const Case& each : kCases) {
    for (const auto seed : Seeds()) {
      SCOPED_TRACE(each.nextLine);
      RunningService service(seed);
      service.processes[42] = "player";
      Client client = service.connect(each.pid);
      EXPECT_EQ(service.log.texts().back(),
                fmt::format("default zqrs {}initWithPID:delegate:]: new client with pid {}",
                            kInstance, static_cast<std::uint64_t>(each.pid)));
      service.runFor(12750ms);
      service.scheduler.setWallClock(service.scheduler.wallClock() + each.clockStep);
      service.log.lines.clear();
      client.end(each.interrupted);
      service.run();
      const std::string pid = fmt::format("{} from the server client list", each.pid);
      const std::string instance = "default zqrs " + kInstance;
      const std::string delegate = "default zqrs " + kDelegate + kListener;
      EXPECT_THAT(service.log.texts(),
                  UnorderedElementsAre(delegate + each.line, delegate + each.nextLine,
                                       instance + "handleConnectionError]: removing " + pid,
                                       instance + "dealloc]: dealloc " + pid));
      ASSERT_EQ(service.analyticsEvents.size(), each.seconds > 0 ? 1U : 0U);
      if (each.seconds == 0) continue;
      const auto& [name, payload] = service.analyticsEvents[0];
      EXPECT_EQ(name, "tarnwick.quarvel.zqreportingclientuptime");
      EXPECT_EQ(payload.root().toDictionary(),
                (Dictionary{{"processName", "player"}, {"seconds", each.seconds}}));
    }
  }
}

SEEDED_TEST(ClientUptime, IsUnknownForAClientThatEndsBeforeItsRegistration, RunningService) {
  processes[42] = "player";
  ServerQueue().async([&] { scheduler.sleep(1s); });
  Client client(listener.connect(42));
  client.end();
  run();
  const std::string function = "default zqrs " + kDelegate + kListener;
  EXPECT_THAT(
      log.texts(function),
      ElementsAre(StartsWith(function + "newConnection: "),
                  function + "clientStartDate is nil. clientpid=42 clientprocessname=unknown",
                  function + "InvalidationHandler: connection exited process=(null) uptime_sec=-1",
                  function + "clientProcessName is nil. clientpid=42"));
  EXPECT_THAT(analyticsEvents, IsEmpty());
}

}  // namespace
}  // namespace quarvel
