#pragma once

#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Payload.h"
#include "store/EventSinks.h"

namespace quarvel {

/// The analytics event sink: sends on their way to the store the events that somebody wants. Any
/// thread.
class AnalyticsEventSink {
 public:
  /// `path` must outlive the sink. `wanted`: shell patterns ("*", "?", "[...]") of event names; an
  /// event that matches none is not wanted.
  AnalyticsEventSink(EventQueue& path, std::vector<std::string> wanted);

  /// As `VistrelSendEventLazy`.
  void sendEventLazy(std::string_view name, const std::function<Payload()>& payload);

 private:
  [[nodiscard]] bool wants(std::string_view name) const;

  EventQueue& path_;
  const std::vector<std::string> wanted_;
  const bool wantsAll_;
};

}  // namespace quarvel
