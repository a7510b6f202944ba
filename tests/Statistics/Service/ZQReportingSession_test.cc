#include "Statistics/Service/ZQReportingSession.h"

#include <gmock/gmock.h>

#include "tests/Statistics/Service/SessionOwner.h"

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

SEEDED_TEST(Session, StartSetsUpAnAgentSessionWithWhatIsConfiguredByThen, SessionOwner) {
  setServiceType(kServiceTypeTelephony);
  session->setConfiguration(Dictionary{{"app", "Phone"}, {"version", 1}});
  session->setConfiguration(Dictionary{{"version", 2}});
  session->updateDefaults(std::nullopt);
  start();
  // The user information is shared with the set-up, which has not begun; the service name is not.
  session->updateDefaults(Dictionary{{"ClientName", "renamed"}});
  holdServerQueue();
  session->setServiceType(kServiceTypeAlarms);
  run();

  ASSERT_EQ(agent.sessions.size(), 1U);
  EXPECT_THAT(agent.tokenParents, ElementsAre(std::nullopt));
  EXPECT_EQ(agent.sessions[0].info, (Dictionary{{"ClientType", 19},
                                                {"ClientVersion", 2.0},
                                                {"SessionID", 7},
                                                {"BatchEvent", true},
                                                {"HierarchyToken", agent.tokens.at(0)}}));
  EXPECT_EQ(agent.sessions[0].userInfo, (Dictionary{{"ClientName", "renamed"},
                                                    {"ServiceName", "telephony_session"},
                                                    {"app", "Phone"},
                                                    {"version", 2}}));
  EXPECT_THAT(agent.sessions[0].frameworksToCheck, IsEmpty());
  EXPECT_EQ(agent.sessions[0].configurations, 1U);
  EXPECT_EQ(session->serviceName(), "alarms");
  EXPECT_FALSE(session->relmReportingSessionStarted());
}

TEST(Session, MessagesWaitForTheBackendsUpToNineSeconds) {
  struct Case {
    const char* name;
    std::optional<Scheduler::Duration> answersAfter;
    bool found;
    std::optional<Scheduler::Duration> deliveredAt;
    std::vector<std::string> errors;
  };
  const std::string none =
      Line("error", kStart, "No backends found, this session won't get sent to the server");
  const std::string timeOut = Line("error", kWait, "failed to find backend");
  const std::string dropped = Line("error", kSend, "No valid RelmReportingSession");
  const Case kCases[] = {
      {"at once", 0s, true, 0s, {}},
      {"just in time", 9s - 1us, true, 9s - 1us, {}},
      {"just too late", 9s + 1us, true, std::nullopt, {timeOut, dropped}},
      {"never", std::nullopt, true, std::nullopt, {timeOut, dropped}},
      {"none found", 1s, false, std::nullopt, {none, timeOut, dropped}},
  };
  for (const Case& each : kCases) {
    for (const auto seed : Seeds()) {
      SCOPED_TRACE(each.name);
      SessionOwner owner(seed);
      SimulatedAgent& agent = owner.agent;
      agent.answers = each.answersAfter.has_value();
      agent.answersAfter = each.answersAfter.value_or(0s);
      if (!each.found) agent.backends.reset();
      owner.start();
      owner.send();
      EXPECT_THAT(owner.sent, ElementsAre(std::nullopt));  // whatever becomes of it
      owner.run();

      EXPECT_THAT(owner.errors(), ElementsAreArray(each.errors));
      EXPECT_EQ(agent.sessions.at(0).released, !each.deliveredAt);
      ASSERT_EQ(owner.delivered().size(), each.deliveredAt ? 1U : 0U);
      if (each.deliveredAt) {
        EXPECT_EQ(owner.delivered()[0].at, *each.deliveredAt);
      }
      EXPECT_EQ(owner.counters.of(MessageDrop::noAgentSession), each.deliveredAt ? 0U : 1U);
      EXPECT_FALSE(owner.session->relmReportingSessionStarted());
      EXPECT_THAT(owner.history(), ElementsAre("Playback_Start_1"));
    }
  }
}

SEEDED_TEST(Session, StopFlushesBehindWhatWasSentAndAnswersTheStartAtOnce, SessionOwner) {
  agent.answersAfter = 5s;
  start();
  awaitEnd();
  send({{"sent", "while started"}});
  stop();
  EXPECT_THAT(ended, ElementsAre(Value(true)));
  EXPECT_EQ(session->aggregatedPayloadData(), nullptr);
  send({{"sent", "after the stop"}});
  run();

  EXPECT_THAT(journal.lines({"agent 1"}),
              ElementsAre("agent 1 created", "agent 1 message 0x3 0x1",
                          "agent 1 message 0xffff 0xffff", "agent 1 flush", "agent 1 released"));
  EXPECT_THAT(agent.sessions[0].flushes, ElementsAre(5s));
  ASSERT_EQ(agent.singleMessages.size(), 1U);
  EXPECT_EQ(agent.singleMessages[0].message.payload,
            Payload(Dictionary{{"sent", "after the stop"}}));
  EXPECT_THAT(errors(), IsEmpty());
}

TEST(Session, StartsAndStopsRepeat) {
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
    owner.awaitEnd();
    owner.stop();
    EXPECT_THAT(owner.ended, IsEmpty()) << "stopped before it was started";
    owner.start();
    owner.start();
    owner.send();
    owner.send();
    EXPECT_THAT(owner.history(), ElementsAre("Playback_Start_1", "Playback_Start_2"));
    owner.stop();
    owner.stop();
    EXPECT_THAT(owner.ended, ElementsAre(Value(true)));
    owner.start();
    owner.send();
    EXPECT_THAT(owner.history(), ElementsAre("Playback_Start_3")) << "counts run on";
    owner.stop();
    EXPECT_THAT(owner.ended, ElementsAre(Value(true), Value(true)));
    owner.holdServerQueue();
    EXPECT_EQ(owner.session->messageIdForCategory(kCategorySummary, kTypeSummary),
              "Undefined_Unknown_3")
        << "the summaries have counted";

    Lines expected;
    for (const Lines& lines :
         {ending, starting, started, starting, already, message, message, ending, ending, stopping,
          message, ending, starting, started, message, ending, ending, stopping, message}) {
      expected.insert(expected.end(), lines.begin(), lines.end());
    }
    EXPECT_EQ(owner.journal.lines({"log", "trace"}), expected);
    owner.run();
    EXPECT_EQ(owner.agent.tokens.size(), 2U);
    ASSERT_EQ(owner.agent.sessions.size(), 2U);
    EXPECT_EQ(owner.agent.sessions[0].messages.size(), 3U);
    EXPECT_EQ(owner.agent.sessions[1].messages.size(), 2U);
  }
}

SEEDED_TEST(Session, OfTypeTestNeverTouchesTheAgent, SessionOwner) {
  setServiceType(kServiceTypeTest);
  start();
  awaitEnd();
  send();
  stop();
  run();
  EXPECT_THAT(ended, ElementsAre(Value(true)));
  EXPECT_THAT(agent.tokens, IsEmpty());
  EXPECT_THAT(journal.lines({"agent"}), IsEmpty());
  EXPECT_EQ(counters.of(MessageDrop::testServiceType), 2U);
  EXPECT_THAT(log.texts(),
              ElementsAre(Line("default", kStop, "sending summary event for reporter 7"),
                          Line("info", kSend, "transactions aren't allowed on this platform"),
                          Line("info", kSend, "transactions aren't allowed on this platform")));
}

SEEDED_TEST(Session, AnnouncesItsLifeAndKeepsItsQueuedWorkWhenItIsDropped, SessionOwner) {
  start();
  send();
  session.reset();
  run();
  EXPECT_EQ(delivered().size(), 1U);
  EXPECT_THAT(agent.sessions[0].flushes, IsEmpty());
  EXPECT_TRUE(agent.sessions[0].released);
  EXPECT_EQ(log.texts().back(),
            Line("info", "-[ZQReportingSession dealloc]", "deallocing this session 7"));
  ASSERT_FALSE(trace.empty());
  EXPECT_EQ(trace.front().code, 0x21042828U);
  EXPECT_EQ(trace.back().code, 0x21042834U);
  for (const TraceEvent& event : trace) {
    EXPECT_THAT(event.arguments, ElementsAre(0, 0, 0, 0));
  }
}

SEEDED_TEST(Session, LogsAFailedFlushAndKeepsQuietAboutAFailedSend, SessionOwner) {
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
  EXPECT_TRUE(agent.sessions[0].released);
}

SEEDED_TEST(Delivery, VerboseLinesFollowAMessage, SessionOwner) {
  log.verbose = {"zqrr"};
  start();
  run();
  log.lines.clear();
  send({{"a key", 1}}, 0x10000003);
  run();
  EXPECT_THAT(log.texts(),
              ElementsAre(Line("debug", kSend, "sending message for session owned by 7"),
                          Line("debug", kSend,
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
          Line("debug", kSend, "sending message for session owned by 7"),
          Line("debug", kSend, "session not started, will send as a single message"),
          Line("debug", kSendSingle, "sending single message after delta 0 for service 0"),
          Line("debug", kSendSingle, "sending single message"),
          Line("debug", kSendSingle, "message {\"a_key\":1} : category 268435459 : type 1")));
}

SEEDED_TEST(SingleMessage, CarriesItsServiceTypeAndNothingOfTheUserInformation, SessionOwner) {
  setServiceType(kServiceTypeTelephony);
  session->setConfiguration(Dictionary{{"app", "Phone"}});
  send({{"a key", 1}}, 0x10000003);
  run();
  const auto& singles = agent.singleMessages;
  ASSERT_EQ(singles.size(), 1U);
  EXPECT_EQ(singles[0].info,
            (Dictionary{{"ClientType", 19}, {"ClientVersion", 2.0}, {"SessionID", -1}}));
  EXPECT_EQ(singles[0].userInfo,
            (Dictionary{{"ClientName", "tarnwick.quarvel"}, {"ServiceName", "telephony"}}));
  EXPECT_EQ(singles[0].message.category, 3);
  EXPECT_EQ(singles[0].message.payload.root().toDictionary(), (Dictionary{{"a_key", 1}}));
  EXPECT_THAT(journal.lines({"trace"}), ElementsAre("trace 0x21042838", "trace 0x21042838"));
  EXPECT_THAT(history(), ElementsAre("DSP_Playback_Start_1"));
}

TEST(SingleMessage, OnlyAlarmsAreSpreadOverAMinute) {
  for (const auto seed : Seeds()) {
    for (const std::uint32_t drawn : {0U, 59U}) {
      Simulation simulation(seed);
      simulation.random.always = drawn;
      const auto sendOne = [](std::uint16_t serviceType) {
        ZQReportingSession::sendSingleMessage(Payload(), 1, serviceType, serviceType, std::nullopt,
                                              nullptr);
      };
      sendOne(kServiceTypeAlarms);
      sendOne(kServiceTypeStandalone);
      simulation.run();
      EXPECT_THAT(simulation.random.bounds, ElementsAre(60));
      std::map<std::uint16_t, Scheduler::Duration> sentAt;
      for (const auto& single : simulation.agent.singleMessages) {
        sentAt[single.message.type] = single.message.at;
      }
      EXPECT_EQ(sentAt.at(kServiceTypeAlarms), std::chrono::seconds(drawn));
      EXPECT_EQ(sentAt.at(kServiceTypeStandalone), 0s);
    }
  }
}

TEST(SingleMessage, IsAnsweredWithTheAgentsError) {
  for (const auto seed : Seeds()) {
    for (const auto& error :
         {std::optional<Error>(), std::optional(Error::because("agent", 3, "full"))}) {
      Simulation simulation(seed);
      simulation.agent.singleMessageError = error;
      std::vector<std::optional<Error>> replies;
      ZQReportingSession::sendSingleMessage(
          std::nullopt, 1, 0, 0, Dictionary{{"ignored", true}},
          [&](const std::optional<Error>& reply) { replies.push_back(reply); });
      simulation.run();
      EXPECT_THAT(replies, ElementsAre(error));
      EXPECT_EQ(simulation.log.texts(),
                error ? std::vector{Line("error", kSendSingle,
                                         "sendOneMessageWithSessionInfo agent 3: full")}
                      : std::vector<std::string>());
    }
  }
}

TEST(Summary, JoinsEveryKeysTextsAndLeavesTheUserInformationInFront) {
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
  EXPECT_THAT(owner.files.files, IsEmpty());
}

}  // namespace
}  // namespace quarvel
