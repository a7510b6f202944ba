// Fakes of the platform's outer ends for connection_fuzz.cc: an agent and sinks that accept and
// check every payload, a device without properties, preferences or drivers, and a process that must
// not end.

#include <unistd.h>

#include <array>
#include <atomic>
#include <cstdlib>

#include "base/Json.h"
#include "platform/Counters.h"
#include "platform/DeviceProperties.h"
#include "platform/FileSystem.h"
#include "platform/Notifications.h"
#include "platform/Ohmrik.h"
#include "platform/Orientation.h"
#include "platform/Preferences.h"
#include "platform/Process.h"
#include "platform/RelmReporting.h"
#include "platform/Tallix.h"
#include "platform/Vistrel.h"
#include "platform/WorkQueue.h"
#include "tests/fuzz/Require.h"

namespace quarvel {
namespace {

Outcome Check(const Payload& payload) {
  Require(ValueFromJson(JsonText(payload)).ok(), "every payload is JSON");
  return Success();
}

class Session final : public RelmReportingSession {
 public:
  ~Session() override { Require(flushes_ <= 1, "a session is flushed once"); }
  void startConfiguration(ConfigurationCompletion completion) override {
    BackgroundQueue().async([completion = std::move(completion)] { completion({{"memory"}}); });
  }
  Outcome agentSendMessage(std::uint16_t, std::uint16_t, const Payload& payload) override {
    Require(flushes_ == 0, "nothing comes after the flush");
    return Check(payload);
  }
  void flushMessages(FlushCompletion completion) override {
    ++flushes_;
    BackgroundQueue().async([completion = std::move(completion)] { completion(std::nullopt); });
  }
  [[nodiscard]] std::string description() const override { return "<Session>"; }

 private:
  int flushes_ = 0;
};

}  // namespace

std::shared_ptr<RelmReportingSession> RelmReporting::createAgentSession(
    const Dictionary& sessionInfo, const Dictionary& userInfo, const std::vector<std::string>&) {
  Require(Check(Payload(sessionInfo)).ok() && Check(Payload(userInfo)).ok(), "both are payloads");
  return std::make_shared<Session>();
}

void AddToGauge(Gauge gauge, int difference) {
  static std::array<std::atomic<int>, 3> gauges{};
  const int now = gauges[static_cast<std::size_t>(gauge)] += difference;
  Require(now >= 0, "no gauge falls below zero");
}

void ExitProcess(int) {
  Require(false, "nothing ends the process");
  std::abort();
}

// One line each.
// clang-format off
using Text = std::string_view;
RelmReportingToken RelmReporting::newSecureHierarchyToken(const std::optional<RelmReportingToken>&) { return "token"; }
Outcome RelmReporting::sendOneMessage(const Dictionary&, const Dictionary&, std::uint16_t, std::uint16_t,
                                      const Payload& payload) { return Check(payload); }
void VistrelSendEventLazy(Text, const std::function<Payload()>& payload) { (void)Check(payload()); }
void OhmrikLogRegisteredEvent(std::int32_t, Text, const Payload& record, std::nullptr_t) { (void)Check(record); }
void CountAcceptedMessage() {}
void CountDroppedMessage(StoreDrop) {}
std::optional<bool> DevicePropertyBoolean(Text) { return std::nullopt; }
std::optional<std::int64_t> DevicePropertyInteger(Text) { return std::nullopt; }
PreferencesDomain OpenPreferencesDomain(Text) { return {}; }
std::int32_t RegisterForNotification(Text, NotificationToken& token, WorkQueue&, NotificationHandler) { return token = 1, 0; }
void RegisterDeviceOrientationHandler(Text, OrientationHandler) {}
void UnregisterDeviceOrientationHandler(Text) {}
void RegisterUIOrientationHandler(Text, OrientationHandler) {}
void UnregisterUIOrientationHandler(Text) {}
TallixChannels TallixCopyChannelsInGroup(std::optional<Text>, std::optional<Text>, std::optional<Error>&) { return nullptr; }
std::string DiagnosticsPath(Text path) { return std::string(path); }
Outcome CreateDirectory(Text, std::uint32_t) { return Success(); }
Outcome WriteFileAtomically(Text, Text) { return Success(); }
std::int32_t OwnProcessIdentifier() { return getpid(); }
std::string OwnProcessName() { return "fuzzed"; }
std::optional<std::string> ProcessCommandName(std::int32_t) { return "client"; }
// clang-format on

}  // namespace quarvel
