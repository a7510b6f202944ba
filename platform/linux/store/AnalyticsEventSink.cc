#include "platform/linux/store/AnalyticsEventSink.h"

#include <fnmatch.h>

#include <algorithm>
#include <utility>

namespace quarvel {

AnalyticsEventSink::AnalyticsEventSink(std::shared_ptr<TelemetryStore> store,
                                       std::vector<std::string> wanted)
    : store_(std::move(store)),
      wanted_(std::move(wanted)),
      wantsAll_(std::ranges::find(wanted_, "*") != wanted_.end()) {}

void AnalyticsEventSink::sendEventLazy(std::string_view name,
                                       const std::function<Payload()>& payload) {
  if (!wants(name)) return;
  // A refusal is counted by the store, and there is nobody else to tell.
  (void)store_->addAnalyticsEvent(name, payload());
}

bool AnalyticsEventSink::wants(std::string_view name) const {
  if (wantsAll_ || wanted_.empty()) return wantsAll_;
  const std::string terminated(name);
  return std::ranges::any_of(wanted_, [&terminated](const std::string& pattern) {
    return ::fnmatch(pattern.c_str(), terminated.c_str(), 0) == 0;
  });
}

}  // namespace quarvel
