#include "Statistics/Service/ZQReportingSession.h"

#include <fmt/format.h>
#include <gmock/gmock.h>

#include "base/Mutex.h"
#include "platform/Condition.h"
#include "tests/Statistics/Service/CoreFixtures.h"

namespace quarvel {
namespace {

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;

std::string Line(const char* level, const char* function, const char* message) {
  return std::string(level) + " zqrr " + function + ": " + message;
}
const char* const kStart = "-[ZQReportingSession start]";
const char* const kStop = "-[ZQReportingSession stop]";
const char* const kSend = "-[ZQReportingSession sendMessage:category:type:sync:reply:]";
const char* const kSendSingle =
    "+[ZQReportingSession sendSingleMessage:category:type:serviceType:userInfo:reply:]";
const char* const kWait = "ZQReportingUtilityWait";

TEST(Wait, EndsWhenTheFlagIsSetOrAPeriodAfterTheLastWakeUp) {
  struct Case {
    std::vector<std::pair<Scheduler::Duration, bool>> signals;  // true: sets the flag
    Scheduler::Duration endedAt;
    bool result;
    const char* lines;
  };
  const Case kCases[] = {
      {{}, 0s, true, ""},  // set before the wait
      {{{5s, false}}, 14s, false, "waiting, continuing, waiting, too late"},
      {{{8s, false}, {16s, false}, {24s, true}},
       24s,
       true,
       "waiting, continuing, waiting, continuing, waiting, continuing"},
  };
  for (const Case& each : kCases) {
    for (const auto seed : Seeds()) {
      const auto condition = CreateCondition();
      bool done = each.signals.empty();
      bool result = !each.result;
      Scheduler::Duration endedAt{-1};
      Simulation simulation(seed);
      simulation.spawn("waiter", [&] {
        result = ZQReportingUtilityWait(*condition, &done, "waiting", "too late", nullptr, 9.0);
        endedAt = simulation.elapsed();
      });
      for (const auto& signal : each.signals) {
        simulation.spawn("setter", [&] {
          simulation.scheduler.sleep(signal.first);
          const BasicMutexLock<Condition> lock(*condition);
          done = done || signal.second;
          condition->signal();
        });
      }
      simulation.run();
      EXPECT_EQ(result, each.result) << each.lines;
      EXPECT_EQ(endedAt, each.endedAt) << each.lines;
      EXPECT_EQ(fmt::format("{}", fmt::join(simulation.log.messages(), ", ")), each.lines);
    }
  }
}

SEEDED_TEST(Session, TheAgentSessionHasTheUserInformationAtItsSetUp, SessionOwner) {
  setServiceType(kServiceTypeTelephony);
  session->setConfiguration(Dictionary{{"app", "Phone"}, {"version", 1}});
  session->setConfiguration(Dictionary{{"version", 2}});
  session->updateDefaults(std::nullopt);
  start();
  // The set-up, which has not begun, shares the user information but not the service name.
  session->updateDefaults(Dictionary{{"ClientName", "renamed"}});
  holdServerQueue();
  session->setServiceType(kServiceTypeAlarms);
  run();
  ASSERT_EQ(agent.sessions.size(), 1U);
  EXPECT_EQ(*agent.sessions[0].info.find("HierarchyToken"), Value(agent.tokens.at(0)));
  EXPECT_EQ(agent.sessions[0].userInfo, (Dictionary{{"ClientName", "renamed"},
                                                    {"ServiceName", "telephony_session"},
                                                    {"app", "Phone"},
                                                    {"version", 2}}));
}

TEST(Session, MessagesWaitForTheBackendsUpToNineSeconds) {
  struct Case {
    const char* name;
    Scheduler::Duration answersAfter;
    bool found;
    std::vector<std::string> errors;
  };
  const std::string none =
      Line("error", kStart, "No backends found, this session won't get sent to the server");
  const std::string timeOut = Line("error", kWait, "failed to find backend");
  const std::string dropped = Line("error", kSend, "No valid RelmReportingSession");
  const Case kCases[] = {
      {"just in time", 9s - 1us, true, {}},
      {"just too late", 9s + 1us, true, {timeOut, dropped}},
      {"none found", 1s, false, {none, timeOut, dropped}},
  };
  for (const Case& each : kCases) {
    for (const auto seed : Seeds()) {
      SCOPED_TRACE(each.name);
      SessionOwner owner(seed);
      owner.agent.answersAfter = each.answersAfter;
      if (!each.found) owner.agent.backends.reset();
      owner.start();
      owner.send();
      owner.run();
      EXPECT_THAT(owner.errors(), ElementsAreArray(each.errors));
      EXPECT_EQ(owner.delivered().size(), each.errors.empty() ? 1U : 0U);
    }
  }
}

TEST(Session, StartsAndStopsRepeat) {
  // The steps: "+" starts, "." stops, "m" sends a message.
  const auto logged = [](auto... line) { return "log " + Line(line...); };
  using Lines = std::vector<std::string>;
  const Lines starting = {logged("debug", kStart, "starting session owned by 7")};
  const Lines started = {"trace 0x2104282c"};
  const Lines already = {logged("info", kStart, "7 is already started")};
  const Lines message = {logged("debug", kSend, "sending message for session owned by 7"),
                         "trace 0x21042838"};
  const Lines ending = {logged("debug", kStop, "ending session 7")};
  const Lines stopping = {"trace 0x21042830",
                          logged("default", kStop, "sending summary event for reporter 7")};
  for (const auto seed : Seeds()) {
    SessionOwner owner(seed);
    owner.log.verbose = {"zqrr"};
    for (const char step : std::string_view(".++mm..+m.")) {
      step == '+' ? owner.start() : step == '.' ? owner.stop() : owner.send();
    }
    owner.holdServerQueue();
    EXPECT_EQ(owner.session->messageIdForCategory(kCategorySummary, kTypeSummary),
              "Undefined_Unknown_3")
        << "each summary counts as a message";
    Lines expected;
    for (const Lines& lines :
         {ending, starting, started, starting, already, message, message, ending, ending, stopping,
          message, ending, starting, started, message, ending, ending, stopping, message}) {
      expected.insert(expected.end(), lines.begin(), lines.end());
    }
    EXPECT_EQ(owner.journal.lines({"log", "trace"}), expected);
  }
}

SEEDED_TEST(Session, AFailedFlushIsLoggedAndAFailedSendIsNot, SessionOwner) {
  agent.sendError = Error::because("agent", 3, "full");
  agent.flushError = Error::because("agent", 4, "gone");
  log.verbose = {"zqrr"};
  start();
  send();
  run();
  EXPECT_EQ(journal.lines({"agent 1 message"}).size(), 1U);
  EXPECT_THAT(log.texts("debug"),
              ElementsAre(Line("debug", kStart, "starting session owned by 7"),
                          Line("debug", kSend, "sending message for session owned by 7")));
  EXPECT_THAT(errors(), IsEmpty());
  stop();
  run();
  EXPECT_THAT(errors(), ElementsAre(Line("error", kStop, "flush error agent 4: gone")));
}

SEEDED_TEST(Delivery, VerboseLinesFollowAMessage, SessionOwner) {
  log.verbose = {"zqrr"};
  start();
  run();
  log.lines.clear();
  send({{"a key", 1}}, 0x10000003);
  run();
  const std::string sending = Line("debug", kSend, "sending message for session owned by 7");
  EXPECT_THAT(log.texts(),
              ElementsAre(sending, Line("debug", kSend,
                                        "RelmReportingAgent <RelmReportingSession 1> : message "
                                        "{\"a key\":1} : category 268435459 : type 1")));
  stop();
  run();
  log.lines.clear();
  send({{"a key", 1}}, 0x10000003);
  run();
  EXPECT_THAT(
      log.texts(),
      ElementsAre(
          sending, Line("debug", kSend, "session not started, will send as a single message"),
          Line("debug", kSendSingle, "sending single message after delta 0 for service 0"),
          Line("debug", kSendSingle, "sending single message"),
          Line("debug", kSendSingle, "message {\"a_key\":1} : category 268435459 : type 1")));
}

SEEDED_TEST(SingleMessage, OnlyAlarmsAreDelayedUpTo59Seconds, Simulation) {
  random.largest = true;
  for (const std::uint16_t type : {kServiceTypeStandalone, kServiceTypeAlarms}) {
    ZQReportingSession::sendSingleMessage(Payload(), 1, 1, type, std::nullopt, nullptr);
  }
  run();
  ASSERT_EQ(agent.singleMessages.size(), 2U);
  EXPECT_EQ(agent.singleMessages[0].message.at, 0s);
  EXPECT_EQ(agent.singleMessages[1].message.at, 59s);
}

SEEDED_TEST(SingleMessage, TheReplyHasTheAgentsError, Simulation) {
  agent.singleMessageError = Error::because("agent", 3, "full");
  std::optional<Error> replied;
  ZQReportingSession::sendSingleMessage(
      std::nullopt, 1, 0, 0, std::nullopt,
      [&](const std::optional<Error>& reply) { replied = reply; });
  run();
  EXPECT_EQ(replied, agent.singleMessageError);
  EXPECT_THAT(log.texts(), ElementsAre(Line("error", kSendSingle,
                                            "sendOneMessageWithSessionInfo agent 3: full")));
}

TEST(Summary, JoinsTheTextsOfEachKeyAndInsertsTheUserInformation) {
  SessionOwner owner(1, kServiceTypeLongFormAudio);
  owner.session->setConfiguration(Dictionary{{"app", "Music"}, {"n", 1.5}});
  owner.holdServerQueue();
  EXPECT_EQ(owner.session->createSummaryEventForSession(), std::nullopt);
  owner.send({{"a b", List{1, "x"}}});
  owner.send({{"a", true}});
  const auto with = [](const Dictionary& userInfo) {
    Dictionary summary = {{"ZQ_Session_Summary_Event", "7"}};
    summary.merge(userInfo);
    summary.merge(
        {{"Playback_Start_1", "{\"a_b\":[1,\"x\"]}"}, {"Playback_Start_2", "{\"a\":true}"}});
    return Payload(summary);
  };
  EXPECT_EQ(owner.session->createSummaryEventForSession(), with({}));
  EXPECT_EQ(owner.session->createSummaryEventForSession(), with({{"app", "Music"}, {"n", "1.5"}}));
  EXPECT_EQ(owner.session->createSummaryEventForSession(),
            with({{"app", "Music,Music"}, {"n", "1.5,1.5"}}));
}

}  // namespace
}  // namespace quarvel
