#include <quarvel/realtime.hpp>

#include <poll.h>

#include "tests/client/ClientTesting.h"

namespace quarvel {
namespace {

using Loss = RealtimeReporter::Loss;

const RealtimeReporter::Category kPlayback(Component::hal, Kind::playback);
const auto kSetup = RealtimeReporter::MessageType::setup;

class RealtimeReporterTest : public DrivenClient {
 protected:
  RealtimeReporterTest() {
    reporter_.interval = 1ms;
    reporter_.lost = [this](const Loss& loss) { losses_.push_back(loss); };
  }
  RealtimeReporter& report() {
    reporting_ = std::make_unique<RealtimeReporter>(connect(), 7, reporter_);
    return *reporting_;
  }
  bool record(int number) { return reporting_->record(kPlayback, kSetup).set("n", number).send(); }
  Value arguments() { return service_.call().list()->back(); }
  std::string message() { return JsonText(arguments()); }

  RealtimeReporter::Options reporter_;
  std::vector<Loss> losses_;
  std::unique_ptr<RealtimeReporter> reporting_;
};

TEST_F(RealtimeReporterTest, ARecordBecomesAMessageWithEveryKindOfValue) {
  reporter_.recordBytes = 1'024;
  for (const int entries : {0, 30}) {  // a dictionary's head of one byte, and of three
    RealtimeReporter& reporter = report();
    const std::string longText(300, 'y');
    Dictionary expected;
    {
      auto record = reporter.record(kPlayback, kSetup);
      const auto set = [&](const std::string& key, auto value) {
        record.set(key, value);
        expected.set(key, value);
      };
      for (const bool boolean : {true, false}) set(boolean ? "yes" : "no", boolean);
      for (const std::int64_t number : {127L, 128L, -1L, INT64_MIN}) {
        set(std::to_string(number), number);
      }
      set("most", UINT64_MAX);
      set("real", 0.25);
      set("", "");
      set(std::string(40, 'x'), std::string_view(longText));
      for (const int microseconds : {-1, 0, 1}) {
        set("date" + std::to_string(microseconds), Date{std::chrono::microseconds(microseconds)});
      }
      for (int i = 0; i < entries; ++i) set("entry " + std::to_string(i), i);
      EXPECT_TRUE(record.send());
    }
    reporter.stop();
    EXPECT_EQ(arguments(), Value(List{expected, 536870915, 3, List{7}}));
    reporting_.reset();
    disconnect();
  }
}

TEST_F(RealtimeReporterTest, LossesAreCountedAndReportedAndTheRestIsWhole) {
  reporter_.records = 3;  // four slots
  reporter_.recordBytes = 16;
  RealtimeReporter& reporter = report();
  EXPECT_FALSE(reporter.record(kPlayback, kSetup).set("twelve bytes", 128).send());
  EXPECT_FALSE(
      reporter.record(kPlayback, kSetup).set("k", std::string(70'000, 'x')).set("n", 1).send());
  EXPECT_TRUE(reporter.record(kPlayback, kSetup).set("k", "\xff").send());
  EXPECT_TRUE(reporter.record(kPlayback, kSetup).set("elevenbytes", 1).send()) << "16 bytes";
  static_cast<void>(reporter.record(kPlayback, kSetup).set("abandoned", 1));
  EXPECT_TRUE(record(1));
  EXPECT_TRUE(record(2));
  EXPECT_FALSE(record(3));
  {
    auto refused = reporter.record(kPlayback, kSetup);
    EXPECT_FALSE(refused);
    EXPECT_FALSE(refused.send());
    EXPECT_FALSE(refused.set("n", 5).send()) << "spent, and no loss of its own";
  }
  reporter.stop();
  EXPECT_THAT(losses_, ElementsAre(Loss{2, 2, 1, 0}));
  for (const std::string entry : {R"("elevenbytes":1)", R"("n":1)", R"("n":2)"}) {
    EXPECT_EQ(message(), "[{" + entry + "},536870915,3,[7]]");
  }
  EXPECT_EQ(message(), R"([{"RealtimeRecordsLost":5,"Full":2,"TooLarge":2,"Invalid":1},8,5,[7]])");
  EXPECT_TRUE(record(6)) << "there is room again";
  reporter.stop();
  EXPECT_EQ(message(), R"([{"n":6},536870915,3,[7]])");
  EXPECT_FALSE(service_.hasInput());
  EXPECT_EQ(reporter.statistics().sent, 4U);
}

TEST_F(RealtimeReporterTest, TheDriverEmptiesItWhileItIsStartedAndSleepsOtherwise) {
  RealtimeReporter& reporter = report();
  pollfd due{client_->descriptor(), POLLIN, 0};
  record(1);
  EXPECT_EQ(::poll(&due, 1, 20), 0) << "not started";
  reporter.start();
  reporter.start();
  driveUntil([&] { return reporter.statistics().sent == 1; });
  record(2);
  driveUntil([&] { return reporter.statistics().sent == 2; });
  reporter.stop();
  client_->dispatch(10ms);  // the last wake-up
  EXPECT_EQ(::poll(&due, 1, 20), 0) << "stopped";
  record(3);
  EXPECT_EQ(::poll(&due, 1, 20), 0);
  EXPECT_EQ(message(), R"([{"n":1},536870915,3,[7]])");
}

TEST_F(RealtimeReporterTest, RecordsWaitForTheConnectionThatIsMadeAgain) {
  options_.reconnect = Client::Reconnect{1ms, 4ms};
  RealtimeReporter& reporter = report();
  reporter.start();
  loseConnection();
  record(1);
  reporter.stop();
  EXPECT_EQ(reporter.statistics().sent, 0U);
  driveUntil([&] { return reporter.statistics().sent == 1; });
  service_.accept();
  EXPECT_EQ(message(), R"([{"n":1},536870915,3,[7]])");
}

TEST_F(RealtimeReporterTest, RecordsThatCannotBeSentAreLost) {
  RealtimeReporter& reporter = report();
  loseConnection();
  record(1);
  reporter.stop();
  EXPECT_EQ(reporter.statistics().lost, (Loss{0, 0, 0, 1}));
  record(2);
  client_.reset();
  reporting_.reset();
  EXPECT_THAT(losses_, ElementsAre(Loss{0, 0, 0, 1}, Loss{0, 0, 0, 1}));
}

TEST_F(RealtimeReporterTest, AServiceThatIsSlowCostsRecordsOnlyWhenTheRingIsFull) {
  options_.gatheredBytes = 1'000;
  reporter_.records = 4'096;
  RealtimeReporter& reporter = report();
  const std::string text(200, 'x');
  int taken = 0;
  while (reporter.record(kPlayback, kSetup).set("text", text).send()) {
    reporter.stop();
    ++taken;
  }
  std::jthread service([&] { service_.receive(taken); });
  driveUntil([&] { return std::cmp_equal(reporter.statistics().sent, taken); });
  EXPECT_EQ(reporter.statistics().lost, (Loss{1, 0, 0, 0}));
}

// The client's own thread empties the ring that another fills; both ends are compared.
TEST_F(RealtimeReporterTest, EveryRecordArrivesOnceAndInItsOrderOrIsCounted) {
  constexpr std::uint64_t kRecords = 50'000;
  options_.driver = Client::Driver::ownThread;
  reporter_.records = 512;
  reporter_.lossMessage.reset();
  RealtimeReporter& reporter = report();
  reporter.start();
  std::uint64_t refused = 0;
  std::jthread producer([&] {
    for (std::uint64_t i = 0; i < kRecords; ++i) {
      // Before the refusal: after it the ring may be empty, and nothing more would be sent.
      const std::uint64_t sent = reporter.statistics().sent;
      if (reporter.record(kPlayback, kSetup).set("n", i).set("half", i / 2).send()) continue;
      ++refused;
      while (reporter.statistics().sent == sent) std::this_thread::yield();
    }
    reporter.stop();
    client_->killService();  // the last call received
  });
  std::uint64_t received = 0;
  std::int64_t last = -1;
  for (;;) {
    const List call = *arguments().list();
    if (call.empty()) break;
    const std::int64_t number = *call[0].dictionary()->find("n")->integer();
    ASSERT_GT(number, last);
    ASSERT_EQ(*call[0].dictionary()->find("half")->integer(), number / 2);
    last = number;
    ++received;
  }
  producer.join();
  EXPECT_EQ(received + refused, kRecords);
  EXPECT_EQ(reporter.statistics().sent, received);
  EXPECT_EQ(reporter.statistics().lost, (Loss{refused, 0, 0, 0}));
}

}  // namespace
}  // namespace quarvel
