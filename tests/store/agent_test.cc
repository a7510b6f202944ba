#include "store/TelemetryAgent.h"

#include <gmock/gmock.h>

#include <future>
#include <limits>
#include <thread>

#include "store/EventSinks.h"
#include "store/database/StoreFile.h"
#include "tests/FolderPlatform.h"
#include "tests/Interposer.h"
#include "tests/store/StoreFixture.h"

namespace quarvel::testing {
namespace {

using ::testing::ElementsAre;
using ::testing::Optional;
using ::testing::StartsWith;

class AgentTest : public StoreFixture {
 protected:
  std::shared_ptr<TelemetryStore> store_ = open({.clock = [] { return Date{}; }});
  static std::optional<Error> flush(RelmReportingSession& session) {
    std::promise<std::optional<Error>> done;
    session.flushMessages([&done](const std::optional<Error>& error) { done.set_value(error); });
    return Get(done.get_future());
  }
};

// A row that the database refuses, for a NULL for example, would stop every row behind it.
TEST_F(AgentTest, MissingAndMisshapenInformationStillMakesARow) {
  TelemetryAgent agent(store_, {"store"});
  const Dictionary odd{
      {kRelmReportingSessionInfoClientType, "nineteen"},
      {kRelmReportingSessionInfoClientVersion, std::numeric_limits<double>::quiet_NaN()},
      {kRelmReportingSessionInfoBatchEvent, 1},
      {5, nullptr}};
  const auto first = agent.createAgentSession({}, {});
  const auto second = agent.createAgentSession(odd, {{kRelmReportingUserInfoClientName, 7}});
  ASSERT_TRUE(agent.sendOneMessage({}, {}, 0, 0, Payload()));
  EXPECT_EQ(flush(*second), std::nullopt);
  EXPECT_THAT(rows("SELECT * FROM agent_session"),
              ElementsAre("1|-1|0|0.0|0||||{}|0|-", R"(2|-1|0|0.0|0||||{"ClientName":7}|0|0)"));
  EXPECT_THAT(rows("SELECT session_id, client_name, payload FROM message"), ElementsAre("-1||{}"));
}

TEST_F(AgentTest, ConfigurationFindsTheBackendsThatCanTakeDataNow) {
  const auto asking = std::this_thread::get_id();
  const auto found = [&](std::vector<std::string> configured) {
    std::promise<std::optional<std::vector<std::string>>> answer;
    const auto session = TelemetryAgent(store_, std::move(configured)).createAgentSession({}, {});
    session->startConfiguration([&](const auto& backends) {
      EXPECT_NE(std::this_thread::get_id(), asking);
      answer.set_value(backends);
    });
    return Get(answer.get_future());
  };
  EXPECT_THAT(found({"store"}), Optional(ElementsAre("store")));
  EXPECT_THAT(found({"nats", "otlp"}), Optional(ElementsAre("nats", "otlp")))
      << "with or without a network";
  EXPECT_EQ(found({}), std::nullopt);
  store_->close();
  EXPECT_EQ(found({"store"}), std::nullopt);
  EXPECT_EQ(found({"nats", "otlp"}), std::nullopt);
}

TEST_F(AgentTest, AClosedStoreIsAnErrorForEveryOperation) {
  TelemetryAgent agent(store_, {"store"});
  const auto before = agent.createAgentSession({}, {});
  store_->close();
  const auto after = agent.createAgentSession({}, {});
  for (const auto& session : {before, after}) {
    const Outcome sent = session->agentSendMessage(1, 1, Payload());
    ASSERT_FALSE(sent);
    EXPECT_THAT(sent.error().description(), StartsWith("quarvel.store 1: "));
    EXPECT_EQ(flush(*session), sent.error());
  }
  EXPECT_FALSE(agent.sendOneMessage({}, {}, 1, 1, Payload()));
}

TEST_F(AgentTest, EventsWaitForRoomInOrderAndTheirSendersDoNot) {
  store_->close();
  Interposer& files = Interposer::watch(directory_);
  store_ = open({.queueRows = 2});
  EventQueue events(store_);
  files.hold();
  for (int i = 0; i < 20; ++i) {
    events.addAnalyticsEvent(std::to_string(i), Payload());
    events.addPowerEvent(28, std::to_string(i), Payload());
  }
  files.release();
  ASSERT_TRUE(FolderQueues().drain(std::chrono::steady_clock::now() + std::chrono::seconds(60)));
  store_->close();
  for (const std::string table : {"analytics_event", "power_event"}) {
    EXPECT_EQ(value("SELECT count(*), min(name = id - 1) FROM " + table), "20|1");
  }
}

}  // namespace
}  // namespace quarvel::testing
