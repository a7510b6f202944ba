#include "Statistics/Service/ZQReportingServiceDelegate.h"

#include <gmock/gmock.h>

#include <algorithm>

#include "tests/Statistics/Service/RunningService.h"

namespace quarvel {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using testing::StartsWith;
using Lines = std::vector<std::string>;

const Value kYes(true);
const std::string kDelegate = "-[ZQReportingServiceDelegate ";
const std::string kInstance = "-[ZQReportingServerInstance ";

TEST(ServiceDelegate, IsSetUpInOrder) {
  RunningService service(1);
  const auto& queues = service.queues;
  ASSERT_EQ(queues.size(), 1U);
  EXPECT_EQ(queues[0].label, "tarnwick.quarvel.reporting.server");
  EXPECT_EQ(queues[0].qualityOfService, QualityOfService::userInteractive);
  const auto lines = service.log.texts();
  ASSERT_GE(lines.size(), 2U);
  EXPECT_EQ(lines[0],
            "default zqrs " + kDelegate + "listenForDefaultsNotification]: notify setup result 0");
  EXPECT_EQ(lines[1],
            "info zqrd -[ZQReportingDriverUtility init]: creating tallixing driver utility");
  EXPECT_EQ(service.log.lines[0].file, "ZQReportingServiceDelegate.cc");
}

TEST(ServiceDelegate, RegistersItsLogScopes) {
  RunningService service(1);
  service.connect(42).create(7);
  service.run();
  std::map<std::string, std::pair<std::uint32_t, std::string>> scopes;
  for (const LogScope* scope : RegisteredLogScopes()) {
    if (scope->subsystem != "tarnwick.quarvel") continue;
    scopes[scope->name] = {scope->code, scope->verboseKey};
    EXPECT_EQ(scope->options, 1);
    EXPECT_EQ(scope->levelMask, 31);
  }
  EXPECT_THAT(scopes,
              ElementsAre(std::pair("zqrd", std::pair(0x7a717264U, "reporting_driver_verbose")),
                          std::pair("zqrr", std::pair(0x7a717272U, "reporting_session_verbose")),
                          std::pair("zqrs", std::pair(0x7a717273U, "reporting_server_verbose"))));
}

SEEDED_TEST(ServiceDelegate, AcceptsWhoeverComes, RunningService) {
  log.lines.clear();
  Client client = connect(-1);
  const auto created = client.create(7);
  run();
  EXPECT_THAT(created->results, ElementsAre(kYes));
  const auto lines = log.texts("default");
  EXPECT_EQ(lines[0],
            "default zqrs " + kDelegate +
                "listener:shouldAcceptNewConnection:]: newConnection: " + client.description());
  EXPECT_EQ(lines[1], "default zqrs " + kInstance +
                          "initWithPID:delegate:]: new client with pid 18446744073709551615");
}

TEST(ServiceDelegate, NamesAProcessByItsIdentifier) {
  Simulation simulation(1);
  simulation.process.ownIdentifier = 100;
  simulation.process.ownName = "quarveld";
  simulation.process.table = {{1, "init"}, {100, "not asked"}, {42, "player"}};
  const std::pair<std::int32_t, std::optional<std::string>> kNames[] = {
      {100, "quarveld"}, {42, "player"},    {1, "init"},
      {43, {}},          {0, std::nullopt}, {-1, std::nullopt}};
  for (const auto& [pid, name] : kNames) EXPECT_EQ(ProcessNameForPID(pid), name) << pid;
}

SEEDED_TEST(ServiceDelegate, SearchesClientsInTheOrderOfAcceptance, RunningService) {
  Client first = connect(41);
  Client second = connect(42);
  Client asking = connect(43);
  second.create(7);
  run();
  first.create(7);
  run();
  log.lines.clear();
  asking.serviceType(7);
  second.serviceType(7);
  run();
  EXPECT_THAT(log.texts("info"), ElementsAre("info zqrs " + kDelegate +
                                             "findReportingSessionForID:]: "
                                             "found reporting session 7 for client 41"));
}

TEST(ServiceDelegate, EndsAClientOnceAndLetsItGo) {
  for (const auto seed : Seeds()) {
    for (const bool interrupted : {true, false}) {
      RunningService service(seed);
      Client client = service.connect(42);
      client.create(6);
      client.createStarted(7);
      service.run();
      service.journal.clear();
      interrupted ? client.interrupt() : client.disconnect();
      service.run();
      EXPECT_EQ(service.journal.lines({"trace 0x21042830"}).size(), 1U);
      const auto ofClient = [&](const std::string& line) {
        return std::ranges::count(service.journal.lines(), "log default zqrs " + line);
      };
      EXPECT_EQ(ofClient(kDelegate + "listener:shouldAcceptNewConnection:]: InterruptionHandler: "
                                     "connection exited"),
                interrupted ? 1 : 0);
      EXPECT_EQ(
          ofClient(kInstance + "handleConnectionError]: removing 42 from the server client list"),
          1);
      EXPECT_EQ(ofClient(kInstance + "dealloc]: dealloc 42 from the server client list"), 1);
    }
  }
}

// The user information that a new session of `client` hands to the agent.
Dictionary UserInfoAtStart(RunningService& service, Client& client, ReporterID id) {
  client.start(id);
  service.run();
  return service.agent.sessions.back().userInfo;
}

TEST(Preferences, AreReadWhenTheyAreSaidToHaveChanged) {
  const std::string function = " zqrs " + kDelegate + "listenForDefaultsNotification]: ";
  const std::pair<Dictionary, const char*> kCases[] = {
      {{}, "{\"disable_reporting\":0}"},
      {{{"other", 1}, {"device_name", "Kitchen"}},
       "{\"device_name\":\"Kitchen\",\"disable_reporting\":0}"},
      {{{"disable_reporting", true}, {"device_name", 7}},
       "{\"device_name\":\"7\",\"disable_reporting\":true}"},
      {{{"disable_reporting", 1}, {"device_name", true}}, "{\"disable_reporting\":true}"},
      {{{"disable_reporting", false}}, "{\"disable_reporting\":false}"},
  };
  for (const auto& [entries, defaults] : kCases) {
    RunningService service(1);
    service.log.lines.clear();
    service.changePreferences(entries);
    EXPECT_THAT(service.log.texts(),
                ElementsAre("default" + function + "re-reading quarvel defaults",
                            "info" + function + "defaults " + defaults));
  }
}

TEST(Preferences, ChangeNothingBeforeThatOrByAForeignNotification) {
  for (const auto seed : Seeds()) {
    RunningService service(seed, [](Simulation& simulation) {
      simulation.preferences["tarnwick.quarvel"] = {{"disable_reporting", true}};
    });
    Client client = service.connect(42);
    service.log.lines.clear();
    service.notifications.deliverForeign("tarnwick.quarvel.reporting");
    service.run();
    EXPECT_THAT(service.log.texts(), IsEmpty());
    const auto sent = client.send({});
    service.run();
    EXPECT_THAT(sent->results, ElementsAre(Value()));
  }
}

SEEDED_TEST(Preferences, ReachEverySessionThereIsAndStayInIt, RunningService) {
  Client client = connect(42);
  client.create(7);
  run();
  changePreferences({{"device_name", "Kitchen"}});
  client.create(8);
  run();
  changePreferences({});
  client.create(9);
  EXPECT_EQ(*UserInfoAtStart(*this, client, 7).find("device_name"), Value("Kitchen"));
  EXPECT_EQ(UserInfoAtStart(*this, client, 8).find("device_name"), nullptr);
  EXPECT_EQ(UserInfoAtStart(*this, client, 9).size(), 2U);
}

TEST(Preferences, TheServiceRunsOnWithoutNotifications) {
  RunningService service(
      1, [](Simulation& simulation) { simulation.notifications.registrationStatus = 5; });
  EXPECT_EQ(service.log.texts("default").at(0),
            "default zqrs " + kDelegate + "listenForDefaultsNotification]: notify setup result 5");
  const auto created = service.connect(42).create(7);
  service.run();
  EXPECT_THAT(created->results, ElementsAre(kYes));
}

TEST(ClientUptime, IsReportedWhenTheConnectionEnds) {
  struct Case {
    const char* name;
    const char* process;  // none: unknown to the kernel
    std::chrono::seconds clockStep;
    std::optional<double> seconds;
    Lines lines;
  };
  const Case kCases[] = {
      {"a fraction is cut in the line only",
       "player",
       0s,
       12.75,
       {"InvalidationHandler: connection exited process=player uptime_sec=12"}},
      {"the clock went back",
       "player",
       -60s,
       47.25,
       {"clientStartDate is in the past. clientpid=42 clientprocessname=player",
        "InvalidationHandler: connection exited process=player uptime_sec=47"}},
      {"a process without a name",
       nullptr,
       0s,
       std::nullopt,
       {"InvalidationHandler: connection exited process=(null) uptime_sec=12",
        "clientProcessName is nil. clientpid=42"}},
  };
  const std::string function =
      "default zqrs " + kDelegate + "listener:shouldAcceptNewConnection:]: ";
  for (const Case& each : kCases) {
    for (const auto seed : Seeds()) {
      SCOPED_TRACE(each.name);
      RunningService service(seed);
      if (each.process != nullptr) service.process.table[42] = each.process;
      Client client = service.connect(42);
      service.runFor(12750ms);
      service.scheduler.setWallClock(service.scheduler.wallClock() + each.clockStep);
      service.log.lines.clear();
      client.disconnect();
      service.run();
      Lines lines = service.log.texts(function);
      for (std::string& line : lines) line.erase(0, function.size());
      EXPECT_EQ(lines, each.lines);
      const auto& events = service.vistrel.events;
      ASSERT_EQ(events.size(), each.seconds ? 1U : 0U);
      if (each.seconds) {
        EXPECT_EQ(events[0].name, "tarnwick.quarvel.zqreportingclientuptime");
        EXPECT_EQ(events[0].payload.root().toDictionary(),
                  (Dictionary{{"processName", each.process}, {"seconds", *each.seconds}}));
      }
    }
  }
}

SEEDED_TEST(ClientUptime, OfAClientThatLeftBeforeItWasRegistered, RunningService) {
  process.table[42] = "player";
  ServerQueue().async([&] { scheduler.sleep(1s); });
  Client client(listener.connect(42));
  client.disconnect();
  run();
  const std::string function =
      "default zqrs " + kDelegate + "listener:shouldAcceptNewConnection:]: ";
  const auto lines = log.texts(function);
  EXPECT_THAT(lines, ElementsAre(StartsWith(function + "newConnection: "),
                                 function + "clientStartDate is nil. clientpid=42 "
                                            "clientprocessname=unknown",
                                 function + "InvalidationHandler: connection exited process=(null) "
                                            "uptime_sec=-1",
                                 function + "clientProcessName is nil. clientpid=42"));
  EXPECT_THAT(vistrel.events, IsEmpty());
}

}  // namespace
}  // namespace quarvel
