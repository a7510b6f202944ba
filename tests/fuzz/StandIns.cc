// Fakes of the platform's outer ends for connection_fuzz.cc: an agent and sinks that accept and check
// every payload, a device without properties, preferences or drivers, and a process that must not end.

#include <rapidjson/reader.h>
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

void Check(const Payload& payload) {
  const std::string json = JsonText(payload);
  rapidjson::StringStream stream(json.c_str());
  rapidjson::BaseReaderHandler<> handler;
  Require(
      !rapidjson::Reader().Parse<rapidjson::kParseValidateEncodingFlag>(stream, handler).IsError(),
      "every payload is JSON");
}

class Session final : public RelmReportingSession {
 public:
  ~Session() override { Require(flushes_ <= 1, "a session is flushed once"); }
  void startConfiguration(ConfigurationCompletion completion) override {
    BackgroundQueue().async([completion = std::move(completion)] { completion({{"memory"}}); });
  }
  Outcome agentSendMessage(std::uint16_t, std::uint16_t, const Payload& payload) override {
    Require(flushes_ == 0, "nothing comes after the flush");
    Check(payload);
    return Success();
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

RelmReportingToken RelmReporting::newSecureHierarchyToken(
    const std::optional<RelmReportingToken>&) {
  return "token";
}

std::shared_ptr<RelmReportingSession> RelmReporting::createAgentSession(
    const Dictionary& sessionInfo, const Dictionary& userInfo, const std::vector<std::string>&) {
  Check(Payload(sessionInfo));
  Check(Payload(userInfo));
  return std::make_shared<Session>();
}

Outcome RelmReporting::sendOneMessage(const Dictionary&, const Dictionary&, std::uint16_t,
                                      std::uint16_t, const Payload& payload) {
  Check(payload);
  return Success();
}

void CountAcceptedMessage() {}
void CountDroppedMessage(MessageDrop) {}
void AddToGauge(Gauge gauge, int difference) {
  static std::array<std::atomic<int>, 3> gauges{};
  const int now = gauges[static_cast<std::size_t>(gauge)] += difference;
  Require(now >= 0, "no gauge falls below zero");
}

void VistrelSendEventLazy(std::string_view, const std::function<Payload()>& payload) {
  Check(payload());
}

void OhmrikLogRegisteredEvent(std::int32_t, std::string_view, const Payload& record,
                              std::nullptr_t) {
  Check(record);
}

std::optional<bool> DevicePropertyBoolean(std::string_view) {
  return std::nullopt;
}
std::optional<std::int64_t> DevicePropertyInteger(std::string_view) {
  return std::nullopt;
}
PreferencesDomain OpenPreferencesDomain(std::string_view) {
  return {};
}
std::int32_t RegisterForNotification(std::string_view, NotificationToken& token, WorkQueue&,
                                     NotificationHandler) {
  token = 1;
  return 0;
}
void RegisterDeviceOrientationHandler(std::string_view, OrientationHandler) {}
void UnregisterDeviceOrientationHandler(std::string_view) {}
void RegisterUIOrientationHandler(std::string_view, OrientationHandler) {}
void UnregisterUIOrientationHandler(std::string_view) {}
TallixChannels TallixCopyChannelsInGroup(std::optional<std::string_view>,
                                         std::optional<std::string_view>, std::optional<Error>&) {
  return nullptr;
}
std::string DiagnosticsPath(std::string_view path) {
  return std::string(path);
}
Outcome CreateDirectory(std::string_view, std::uint32_t) {
  return Success();
}
Outcome WriteFileAtomically(std::string_view, std::string_view) {
  return Success();
}

std::int32_t OwnProcessIdentifier() {
  return getpid();
}
std::string OwnProcessName() {
  return "fuzzed";
}
std::optional<std::string> ProcessCommandName(std::int32_t) {
  return "client";
}
void ExitProcess(int) {
  Require(false, "nothing ends the process");
  std::abort();
}

}  // namespace quarvel
