#include "platform/Vistrel.h"

#include "platform/linux/store/AnalyticsEventSink.h"
#include "platform/linux/store/ProcessStore.h"
#include "platform/linux/system/Configuration.h"

namespace quarvel {

void VistrelSendEventLazy(std::string_view name, const std::function<Payload()>& payload) {
  static auto& sink =
      *new AnalyticsEventSink(ProcessEventPath(), Configuration::process().analyticsWanted);
  sink.sendEventLazy(name, payload);
}

}  // namespace quarvel
