#include "store/AnalyticsEventSink.h"

#include <fnmatch.h>

#include <algorithm>
#include <utility>

namespace quarvel {

AnalyticsEventSink::AnalyticsEventSink(EventQueue& path, std::vector<std::string> wanted)
    : path_(path),
      wanted_(std::move(wanted)),
      wantsAll_(std::ranges::find(wanted_, "*") != wanted_.end()) {}

void AnalyticsEventSink::sendEventLazy(std::string_view name,
                                       const std::function<Payload()>& payload) {
  if (wants(name)) path_.addAnalyticsEvent(name, payload());
}

bool AnalyticsEventSink::wants(std::string_view name) const {
  if (wantsAll_ || wanted_.empty()) return wantsAll_;
  const std::string terminated(name);
  return std::ranges::any_of(wanted_, [&terminated](const std::string& pattern) {
    return ::fnmatch(pattern.c_str(), terminated.c_str(), 0) == 0;
  });
}

}  // namespace quarvel
