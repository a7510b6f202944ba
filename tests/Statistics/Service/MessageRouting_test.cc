#include <gmock/gmock.h>

#include "tests/Statistics/Service/RunningService.h"

namespace quarvel {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using Lines = std::vector<std::string>;

const Value kYes(true);
const std::string kInstance = "-[ZQReportingServerInstance ";

// Messages and their ways. The journal of the `ServerQueue` alone, which no other queue's work
// interleaves with as long as the sessions are started.
Lines Routed(RunningService& service) {
  return service.simulation.journal.lines({"vistrel", "ohmrik", "trace"});
}
const std::string kRouting = "trace 0x21042824";
const std::string kEvent = "vistrel tarnwick.quarvel.Playback.Start";
const std::string kPower = "ohmrik Fennor_Haptics";
const std::string kSent = "trace 0x21042838";
const Dictionary kWithEngineTime = {{"EngineOnTime", 3}, {"zqreporting_timestamp", 9.5}};

std::vector<std::size_t> MessagesOfAgentSessions(const RunningService& service) {
  std::vector<std::size_t> counts;
  for (const auto& session : service.simulation.agent.sessions) {
    counts.push_back(session.messages.size());
  }
  return counts;
}

TEST(Routing, ByIdentifiersTheSinksComeFirstOnceAnOccurrence) {
  for (const auto seed : Seeds()) {
    RunningService service(seed);
    Client owner = service.connect(41);
    Client sender = service.connect(42);
    owner.createStarted(7);
    sender.create(0);  // may be made, but 0 names nobody
    service.run();
    service.simulation.journal.clear();
    const auto sent = sender.send(kWithEngineTime, 3, 1, List{0, 7, 99, 7});
    service.run();
    EXPECT_THAT(sent->results, ElementsAre(Value()));
    EXPECT_THAT(Routed(service),
                ElementsAre(kRouting, kEvent, kPower, kSent, kEvent, kPower, kSent));
    EXPECT_THAT(MessagesOfAgentSessions(service), ElementsAre(2));
    EXPECT_THAT(service.simulation.agent.singleMessages, IsEmpty());
  }
}

TEST(Routing, ByIdentifiersReachesASessionThatIsNotStarted) {
  for (const auto seed : Seeds()) {
    RunningService service(seed);
    Client client = service.connect(41);
    client.create(7);
    client.setServiceType(2, 7);
    client.send(kWithEngineTime, 3, 1, List{7, 0, 8});
    service.run();
    EXPECT_EQ(service.simulation.counters.accepted, 3U);
    EXPECT_EQ(service.simulation.counters.of(MessageDrop::noSuchSession), 2U);
    ASSERT_EQ(service.simulation.agent.singleMessages.size(), 1U);
    EXPECT_EQ(*service.simulation.agent.singleMessages[0].userInfo.find("ServiceName"),
              Value("telephony"));
    EXPECT_EQ(service.simulation.vistrel.events.size(), 1U);
    EXPECT_EQ(service.simulation.ohmrik.records.size(), 1U);
  }
}

TEST(Routing, TheOwnSessionGoesBeforeThatOfTheClientAcceptedFirst) {
  for (const auto seed : Seeds()) {
    RunningService service(seed);
    Client first = service.connect(41);
    Client second = service.connect(42);
    Client third = service.connect(43);
    first.createStarted(7);
    service.run();
    second.create(7);
    service.run();
    second.send({{"from", "second"}}, 3, 1, List{7});
    service.run();
    EXPECT_THAT(MessagesOfAgentSessions(service), ElementsAre(0));
    EXPECT_EQ(service.simulation.agent.singleMessages.size(), 1U);
    third.send({{"from", "third"}}, 3, 1, List{7});
    service.run();
    EXPECT_THAT(MessagesOfAgentSessions(service), ElementsAre(1));
    EXPECT_EQ(service.simulation.agent.singleMessages.size(), 1U);
  }
}

TEST(Routing, ABroadcastReachesEveryStartedSessionAndTheSinksAfterIt) {
  for (const auto seed : Seeds()) {
    RunningService service(seed);
    Client first = service.connect(41);
    Client second = service.connect(42);
    second.createStarted(6);
    service.run();
    first.createStarted(9);
    first.create(8);
    first.createStarted(7);
    service.run();
    service.simulation.journal.clear();
    service.simulation.log.lines.clear();
    const auto sent = second.send(kWithEngineTime);
    service.run();
    EXPECT_THAT(sent->results, ElementsAre(Value()));
    EXPECT_THAT(Routed(service), ElementsAre(kRouting, kSent, kEvent, kPower, kSent, kEvent, kPower,
                                             kSent, kEvent, kPower));
    EXPECT_THAT(MessagesOfAgentSessions(service), ElementsAre(1, 1, 1));
    const std::string line =
        "default zqrs " + kInstance + "sendMessage:withCategory:andType:forReportingIDs:reply:]: ";
    EXPECT_THAT(service.simulation.log.texts(),
                ElementsAre(line + "sessions for client 41 : [\"<ZQReportingSession 7>\","
                                   "\"<ZQReportingSession 8>\",\"<ZQReportingSession 9>\"]",
                            line + "sessions for client 42 : [\"<ZQReportingSession 6>\"]",
                            line + "active reporting sessions 3 : [\"<ZQReportingSession 7>\","
                                   "\"<ZQReportingSession 9>\",\"<ZQReportingSession 6>\"]"));
  }
}

TEST(Routing, ABroadcastThatNobodyTakesGoesOutAloneButAnEmptyListGoesNowhere) {
  for (const auto seed : Seeds()) {
    RunningService service(seed);
    Client client = service.connect(41);
    client.create(7);
    service.run();
    const auto nowhere = client.send(kWithEngineTime, 3, 1, List{});
    service.run();
    EXPECT_THAT(nowhere->results, ElementsAre(Value()));
    EXPECT_THAT(service.simulation.agent.singleMessages, IsEmpty());

    service.simulation.log.lines.clear();
    const auto alone = client.send({{"EngineOnTime", 3}, {"a key", 1}}, 0x10000003, 1);
    service.run();
    EXPECT_THAT(alone->results, ElementsAre(Value()));
    ASSERT_EQ(service.simulation.agent.singleMessages.size(), 1U);
    const auto& single = service.simulation.agent.singleMessages[0];
    EXPECT_EQ(*single.userInfo.find("ServiceName"), Value("standalone"));
    EXPECT_EQ(single.message.category, 3);
    EXPECT_EQ(single.message.payload.root().toDictionary(),
              (Dictionary{{"EngineOnTime", 3}, {"a_key", 1}}));
    EXPECT_THAT(service.simulation.vistrel.events, IsEmpty());
    EXPECT_THAT(service.simulation.ohmrik.records, IsEmpty());
    EXPECT_EQ(service.simulation.log.texts().back(),
              "default zqrs " + kInstance +
                  "sendMessage:withCategory:andType:forReportingIDs:reply:]: no active reporting "
                  "sessions found, sending as standalone");
  }
}

TEST(Routing, SwitchedOffRefusesEveryMessageAndHidesOtherClientsSessions) {
  for (const auto seed : Seeds()) {
    RunningService service(seed);
    Client owner = service.connect(41);
    Client other = service.connect(42);
    owner.createStarted(7);
    service.run();
    service.changePreferences({{"disable_reporting", true}});
    service.simulation.journal.clear();
    service.simulation.log.lines.clear();
    const auto named = owner.send(kWithEngineTime, 3, 1, List{7});
    const auto broadcast = other.send(kWithEngineTime);
    const auto hidden = other.serviceType(7);
    service.run();
    for (const auto& refused : {named, broadcast}) {
      EXPECT_THAT(refused->results, IsEmpty());
      EXPECT_THAT(refused->errors, ElementsAre(Error{"tarnwick.audio.reporting", 1, {}}));
    }
    EXPECT_THAT(hidden->results, ElementsAre(Value(65535)));
    EXPECT_THAT(service.simulation.log.texts("error"), IsEmpty());
    EXPECT_THAT(service.simulation.log.texts("info"), IsEmpty());
    EXPECT_THAT(Routed(service), ElementsAre(kRouting, kRouting));
    EXPECT_THAT(MessagesOfAgentSessions(service), ElementsAre(0));

    service.changePreferences({});
    const auto accepted = other.send(kWithEngineTime, 3, 1, List{7});
    service.run();
    EXPECT_THAT(accepted->results, ElementsAre(Value()));
    EXPECT_THAT(MessagesOfAgentSessions(service), ElementsAre(1)) << "it was never stopped";
  }
}

TEST(Routing, AnAgentWithoutRoomHoldsNobodyUpButTheDeliveries) {
  for (const auto seed : Seeds()) {
    RunningService service(seed);
    Client client = service.connect(41);
    client.createStarted(7);
    service.run();
    service.simulation.agent.full = true;
    const auto named = client.send({{"n", 1}}, 3, 1, List{7});
    const auto broadcast = client.send({{"n", 2}});
    const auto stop = client.stop(7);
    service.simulation.runFor(1s);
    EXPECT_THAT(named->results, ElementsAre(Value()));
    EXPECT_THAT(broadcast->results, ElementsAre(Value()));
    EXPECT_THAT(stop->results, ElementsAre(kYes));
    EXPECT_THAT(MessagesOfAgentSessions(service), ElementsAre(0));
    service.simulation.agent.full = false;
    service.run();
    EXPECT_THAT(MessagesOfAgentSessions(service), ElementsAre(3)) << "with the summary";
    EXPECT_THAT(service.simulation.agent.singleMessages, IsEmpty());
  }
}

// Clients that do as they like, a slow agent: whatever the interleaving, each message that was
// accepted arrives as often as there were targets, and each session's messages arrive in order.
TEST(Routing, LosesAndReordersNothingWhateverTheInterleaving) {
  constexpr int kMessages = 12;
  for (const auto seed : Seeds()) {
    RunningService service(seed);
    service.simulation.spuriousWakeUps = true;
    service.simulation.agent.answersAfter = 3s;
    std::vector<Client> clients = {service.connect(41), service.connect(42), service.connect(43)};
    std::vector<Client::Call> starts;
    for (std::size_t i = 0; i < clients.size(); ++i) {
      service.simulation.spawn("client", [&, i] {
        Client& client = clients[i];
        const auto own = static_cast<ReporterID>(i + 1);
        client.create(own);
        starts.push_back(client.start(own));
        for (int n = 0; n < kMessages; ++n) {
          client.send({{"client", own}, {"n", n}}, 3, 1, List{own});
          service.simulation.scheduler.sleep(
              std::chrono::milliseconds(service.simulation.scheduler.choose(500)));
        }
        if (i == 0) {
          client.disconnect();
        } else {
          client.stop(own);
        }
      });
    }
    service.run();
    const SimulatedCounters& counters = service.simulation.counters;
    EXPECT_EQ(counters.accepted, clients.size() * (kMessages + 1));
    EXPECT_EQ(counters.of(Gauge::clients), 2);
    EXPECT_EQ(counters.of(Gauge::sessions), 2);
    EXPECT_EQ(counters.of(Gauge::startedSessions), 0);
    for (const auto& start : starts) EXPECT_THAT(start->results, ElementsAre(kYes));
    ASSERT_EQ(service.simulation.agent.sessions.size(), clients.size());
    for (const auto& session : service.simulation.agent.sessions) {
      ASSERT_EQ(session.messages.size(), kMessages + 1U);  // and the summary
      for (int n = 0; n < kMessages; ++n) {
        const auto& payload = session.messages[static_cast<std::size_t>(n)].payload;
        EXPECT_EQ(payload.find("n")->integer(), n);
        EXPECT_EQ(payload.find("client")->integer(), *session.info.find("SessionID")->integer());
      }
      EXPECT_EQ(session.messages.back().category, 0xffff);
      EXPECT_EQ(session.flushes.size(), 1U);
    }
    EXPECT_THAT(service.simulation.agent.singleMessages, IsEmpty());
  }
}

}  // namespace
}  // namespace quarvel
