#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <vector>

#include "base/Json.h"
#include "tests/client/ClientTesting.h"

namespace quarvel {
namespace {

using test::Expected;
using test::FakeService;
using test::IsCode;
using vocabulary::Kind;
using namespace std::chrono_literals;
using Change = Client::ConnectionChange;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

const auto kGeneric = Client::MessageType::generic;

class ReconnectTest : public test::DrivenClient {
 protected:
  ReconnectTest() {
    options_.reconnect = Client::Reconnect{1ms, 4ms};
    options_.connectionChanged = [this](const Change& change) { changes_.push_back(change); };
    connect();
  }

  void receive(int calls) {
    for (int i = 0; i < calls; ++i) ASSERT_TRUE(service_.receive());
  }
  void loseConnection() {
    service_.hangUp();
    driveUntil([&] { return !client_->connected(); });
  }
  void restoreConnection() {
    driveUntil([&] { return client_->connected(); });
    service_.accept();
  }
  /// The calls that the service has received next, without their numbers.
  std::vector<std::string> calls(int count) {
    std::vector<std::string> calls;
    for (int i = 0; i < count; ++i) {
      const List call = *service_.receive()->list();
      calls.push_back(*call[call.size() - 2].string() + JsonText(call.back()));
    }
    return calls;
  }

  std::vector<Change> changes_;
};

TEST_F(ReconnectTest, SessionsAreMadeAnewAsTheyWereAndMessagesAreNotRepeated) {
  Expected<bool> created;
  Expected<bool> firstStart;
  Expected<bool> secondStart;
  Expected<std::monostate> message;
  client_->createReportingSession(7, created.reply());
  client_->setServiceType(Client::ServiceType::telephony, 7);
  client_->setConfiguration(Dictionary{{"Route", "Speaker"}, {"Rate", 1}}, 7);
  client_->setConfiguration(Payload(Dictionary{{"Rate", 2}}), 7);
  client_->startReportingSessionForID(7, firstStart.reply());
  client_->startReportingSessionForID(7, secondStart.reply());  // which the service never answers
  client_->createReportingSession(8);
  client_->destroyReportingSession(8);
  client_->createReportingSession(9);
  client_->startReportingSessionForID(9);
  client_->stopReportingSessionForID(9);
  client_->setServiceType(Client::ServiceType::test, 10);  // no session of this client
  client_->sendMessage(std::nullopt, Kind::volume, kGeneric, 7, message.reply());
  receive(13);
  loseConnection();
  restoreConnection();

  EXPECT_THAT(
      calls(4),
      ElementsAre(R"(createReportingSession:reply:[7])",
                  R"(setServiceType:reportingSession:reply:[2,7])",
                  R"(setConfiguration:forReporterID:reply:[{"Route":"Speaker","Rate":2},7])",
                  R"(startReportingSessionForID:reply:[7])"));
  EXPECT_THAT(calls(1), ElementsAre("createReportingSession:reply:[9]"));
  EXPECT_FALSE(service_.somethingWaits());
  EXPECT_FALSE(firstStart.given());
  EXPECT_TRUE(IsCode(created.get().error(), Client::Code::deferred));
  EXPECT_TRUE(IsCode(secondStart.get().error(), Client::Code::connectionLost));
  EXPECT_TRUE(IsCode(message.get().error(), Client::Code::connectionLost));
  ASSERT_EQ(changes_.size(), 2U);
  EXPECT_EQ(changes_[0].kind, Change::Kind::lost);
  EXPECT_THAT(changes_[0].why.description(), HasSubstr("closed the connection"));
  EXPECT_EQ(changes_[0].unanswered, 3U);
  EXPECT_EQ(changes_[0].sessions, 2U);
  EXPECT_EQ(changes_[1].kind, Change::Kind::restored);
  EXPECT_EQ(changes_[1].sessions, 2U);
}

TEST_F(ReconnectTest, TheStartsReplyTellsOfTheEndOfTheNewStart) {
  for (const bool again : {false, true}) {
    Expected<bool> stopped;
    client_->createReportingSession(7);
    client_->startReportingSessionForID(7, stopped.reply());
    receive(2);
    loseConnection();
    restoreConnection();
    if (again) {
      receive(2);
      loseConnection();
      restoreConnection();
    }
    receive(1);
    service_.reply(*service_.receive(), true);
    driveUntil([&] { return stopped.given(); });
    EXPECT_TRUE(stopped.get().value());
    client_->destroyReportingSession(7);
    receive(1);
  }
}

TEST_F(ReconnectTest, CallsInBetweenAreRememberedOrRefusedButNeverKeptSilently) {
  using Code = Client::Code;
  client_->createReportingSession(7);
  client_->createReportingSession(8);
  receive(2);
  loseConnection();
  Expected<bool> created;
  Expected<bool> orphaned;
  Expected<bool> stopped;
  Expected<std::vector<ReporterID>> reporters;
  EXPECT_EQ(client_->createReportingSession(9, created.reply()), Code::deferred);
  EXPECT_EQ(client_->startReportingSessionForID(9, stopped.reply()), Code::deferred);
  EXPECT_EQ(client_->startReportingSessionForID(8, orphaned.reply()), Code::deferred);
  EXPECT_EQ(client_->destroyReportingSession(8), Code::deferred);
  EXPECT_EQ(client_->stopReportingSessionForID(5), Code::connectionLost);
  EXPECT_EQ(client_->sendMessage(std::nullopt, Kind::volume, kGeneric, 9), Code::connectionLost);
  EXPECT_EQ(client_->getAllReporters(reporters.reply()), Code::connectionLost);
  restoreConnection();
  EXPECT_TRUE(IsCode(created.get().error(), Code::deferred));
  EXPECT_TRUE(IsCode(orphaned.get().error(), Code::connectionLost));
  EXPECT_TRUE(IsCode(reporters.get().error(), Code::connectionLost));
  EXPECT_EQ(changes_.back().unsent, 2U);
  EXPECT_THAT(calls(3),
              ElementsAre("createReportingSession:reply:[7]", "createReportingSession:reply:[9]",
                          "startReportingSessionForID:reply:[9]"));
  EXPECT_FALSE(service_.somethingWaits());
  EXPECT_FALSE(stopped.given());
}

TEST_F(ReconnectTest, WhatHadNotLeftIsCountedAndTheRestIsTriedUntilTheServiceIsBack) {
  {
    const Client::Batch batch(*client_);
    for (int i = 0; i < 3; ++i) client_->sendMessage(std::nullopt, Kind::volume, kGeneric, 7);
    client_->createReportingSession(7, [](const Result<bool>&) {});
    loseConnection();
  }
  EXPECT_EQ(changes_.back().unsent, 3U) << "the call with a reply has been answered";
  EXPECT_EQ(changes_.back().unanswered, 1U);
  const std::string path = service_.path();
  service_.stopListening();
  std::filesystem::remove(path);
  const auto later = std::chrono::steady_clock::now() + 50ms;
  driveUntil([&] { return std::chrono::steady_clock::now() > later; });
  EXPECT_FALSE(client_->connected());
  EXPECT_EQ(changes_.size(), 1U) << "attempts that fail are no changes";
  service_.listen();
  restoreConnection();
  EXPECT_THAT(calls(1), ElementsAre("createReportingSession:reply:[7]"));
}

TEST_F(ReconnectTest, AClientThatEndsWhileItReconnectsAnswersWhatItKept) {
  Expected<bool> stopped;
  client_->createReportingSession(7);
  client_->startReportingSessionForID(7, stopped.reply());
  receive(2);
  loseConnection();
  client_.reset();
  EXPECT_TRUE(IsCode(stopped.get().error(), Client::Code::connectionLost));
}

TEST(ReconnectingThread, ConnectsAgainAndWithoutTheOptionDoesNot) {
  for (const bool wanted : {true, false}) {
    FakeService service;
    std::promise<Change> changed;
    Client::Options options;
    options.socketPath = service.path();
    if (wanted) options.reconnect = Client::Reconnect{1ms, 4ms};
    options.connectionChanged = [&, kind = wanted ? Change::Kind::restored
                                                  : Change::Kind::lost](const Change& change) {
      if (change.kind == kind) changed.set_value(change);
    };
    auto client = Client::connect(options);
    service.accept();
    client.value().createReportingSession(7);
    ASSERT_TRUE(service.receive());
    service.hangUp();
    EXPECT_EQ(changed.get_future().get().sessions, wanted ? 1U : 0U);
    EXPECT_EQ(client.value().connected(), wanted);
    if (!wanted) continue;
    service.accept();
    EXPECT_TRUE(service.receive());
  }
}

}  // namespace
}  // namespace quarvel
