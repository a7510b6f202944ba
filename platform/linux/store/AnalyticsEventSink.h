#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "base/Payload.h"
#include "platform/linux/store/TelemetryStore.h"

namespace quarvel {

/// The analytics event sink: keeps in the store the events that somebody wants. Any thread.
class AnalyticsEventSink {
 public:
  /// `wanted`: shell patterns ("*", "?", "[...]") of event names; an event that matches none is not
  /// wanted.
  AnalyticsEventSink(std::shared_ptr<TelemetryStore> store, std::vector<std::string> wanted);

  /// As `VistrelSendEventLazy`.
  void sendEventLazy(std::string_view name, const std::function<Payload()>& payload);

 private:
  [[nodiscard]] bool wants(std::string_view name) const;

  const std::shared_ptr<TelemetryStore> store_;
  const std::vector<std::string> wanted_;
  const bool wantsAll_;
};

}  // namespace quarvel
