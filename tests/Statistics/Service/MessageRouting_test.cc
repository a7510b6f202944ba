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
  return service.journal.lines({"vistrel", "ohmrik", "trace"});
}
const std::string kRouting = "trace 0x21042824";
const std::string kEvent = "vistrel tarnwick.quarvel.Playback.Start";
const std::string kPower = "ohmrik Fennor_Haptics";
const std::string kSent = "trace 0x21042838";
const Dictionary kWithEngineTime = {{"EngineOnTime", 3}, {"zqreporting_timestamp", 9.5}};

std::vector<std::size_t> MessagesOfAgentSessions(const RunningService& service) {
  std::vector<std::size_t> counts;
  for (const auto& session : service.agent.sessions) {
    counts.push_back(session.messages.size());
  }
  return counts;
}

SEEDED_TEST(Routing, ByIdentifiersTheSinksComeFirstOnceAnOccurrence, RunningService) {
  Client owner = connect(41);
  Client sender = connect(42);
  owner.createStarted(7);
  sender.create(0);  // may be made, but 0 names nobody
  run();
  journal.clear();
  const auto sent = sender.send(kWithEngineTime, 3, 1, List{0, 7, 99, 7});
  run();
  EXPECT_THAT(sent->results, ElementsAre(Value()));
  EXPECT_THAT(Routed(*this), ElementsAre(kRouting, kEvent, kPower, kSent, kEvent, kPower, kSent));
  EXPECT_THAT(MessagesOfAgentSessions(*this), ElementsAre(2));
  EXPECT_THAT(agent.singleMessages, IsEmpty());
}

SEEDED_TEST(Routing, ABroadcastReachesEveryStartedSessionAndTheSinksAfterIt, RunningService) {
  Client first = connect(41);
  Client second = connect(42);
  second.createStarted(6);
  run();
  first.createStarted(9);
  first.create(8);
  first.createStarted(7);
  run();
  journal.clear();
  log.lines.clear();
  const auto sent = second.send(kWithEngineTime);
  run();
  EXPECT_THAT(sent->results, ElementsAre(Value()));
  EXPECT_THAT(Routed(*this), ElementsAre(kRouting, kSent, kEvent, kPower, kSent, kEvent, kPower,
                                         kSent, kEvent, kPower));
  EXPECT_THAT(MessagesOfAgentSessions(*this), ElementsAre(1, 1, 1));
  const std::string line =
      "default zqrs " + kInstance + "sendMessage:withCategory:andType:forReportingIDs:reply:]: ";
  EXPECT_THAT(log.texts(),
              ElementsAre(line + "sessions for client 41 : [\"<ZQReportingSession 7>\","
                                 "\"<ZQReportingSession 8>\",\"<ZQReportingSession 9>\"]",
                          line + "sessions for client 42 : [\"<ZQReportingSession 6>\"]",
                          line + "active reporting sessions 3 : [\"<ZQReportingSession 7>\","
                                 "\"<ZQReportingSession 9>\",\"<ZQReportingSession 6>\"]"));
}

SEEDED_TEST(Routing, ABroadcastThatNobodyTakesGoesOutAloneButAnEmptyListGoesNowhere,
            RunningService) {
  Client client = connect(41);
  client.create(7);
  run();
  const auto nowhere = client.send(kWithEngineTime, 3, 1, List{});
  run();
  EXPECT_THAT(nowhere->results, ElementsAre(Value()));
  EXPECT_THAT(agent.singleMessages, IsEmpty());

  log.lines.clear();
  const auto alone = client.send({{"EngineOnTime", 3}, {"a key", 1}}, 0x10000003, 1);
  run();
  EXPECT_THAT(alone->results, ElementsAre(Value()));
  ASSERT_EQ(agent.singleMessages.size(), 1U);
  const auto& single = agent.singleMessages[0];
  EXPECT_EQ(*single.userInfo.find("ServiceName"), Value("standalone"));
  EXPECT_EQ(single.message.category, 3);
  EXPECT_EQ(single.message.payload.root().toDictionary(),
            (Dictionary{{"EngineOnTime", 3}, {"a_key", 1}}));
  EXPECT_THAT(vistrel.events, IsEmpty());
  EXPECT_THAT(ohmrik.records, IsEmpty());
  EXPECT_EQ(log.texts().back(),
            "default zqrs " + kInstance +
                "sendMessage:withCategory:andType:forReportingIDs:reply:]: no active reporting "
                "sessions found, sending as standalone");
}

SEEDED_TEST(Routing, SwitchedOffRefusesEveryMessageAndHidesOtherClientsSessions, RunningService) {
  Client owner = connect(41);
  Client other = connect(42);
  owner.createStarted(7);
  run();
  changePreferences({{"disable_reporting", true}});
  journal.clear();
  log.lines.clear();
  const auto named = owner.send(kWithEngineTime, 3, 1, List{7});
  const auto broadcast = other.send(kWithEngineTime);
  const auto hidden = other.serviceType(7);
  run();
  for (const auto& refused : {named, broadcast}) {
    EXPECT_THAT(refused->results, IsEmpty());
    EXPECT_THAT(refused->errors, ElementsAre(Error{"tarnwick.audio.reporting", 1, {}}));
  }
  EXPECT_THAT(hidden->results, ElementsAre(Value(65535)));
  EXPECT_THAT(log.texts("error"), IsEmpty());
  EXPECT_THAT(log.texts("info"), IsEmpty());
  EXPECT_THAT(Routed(*this), ElementsAre(kRouting, kRouting));
  EXPECT_THAT(MessagesOfAgentSessions(*this), ElementsAre(0));

  changePreferences({});
  const auto accepted = other.send(kWithEngineTime, 3, 1, List{7});
  run();
  EXPECT_THAT(accepted->results, ElementsAre(Value()));
  EXPECT_THAT(MessagesOfAgentSessions(*this), ElementsAre(1)) << "it was never stopped";
}

SEEDED_TEST(Routing, AnAgentWithoutRoomHoldsNobodyUpButTheDeliveries, RunningService) {
  Client client = connect(41);
  client.createStarted(7);
  run();
  agent.full = true;
  const auto named = client.send({{"n", 1}}, 3, 1, List{7});
  const auto broadcast = client.send({{"n", 2}});
  const auto stop = client.stop(7);
  runFor(1s);
  EXPECT_THAT(named->results, ElementsAre(Value()));
  EXPECT_THAT(broadcast->results, ElementsAre(Value()));
  EXPECT_THAT(stop->results, ElementsAre(kYes));
  EXPECT_THAT(MessagesOfAgentSessions(*this), ElementsAre(0));
  agent.full = false;
  run();
  EXPECT_THAT(MessagesOfAgentSessions(*this), ElementsAre(3)) << "with the summary";
  EXPECT_THAT(agent.singleMessages, IsEmpty());
}

}  // namespace
}  // namespace quarvel
