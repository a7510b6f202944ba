#include "platform/Vistrel.h"

#include "linux/ProcessStore.h"
#include "store/EventSinks.h"
#include "system/Configuration.h"

namespace quarvel {

void VistrelSendEventLazy(std::string_view name, const std::function<Payload()>& payload) {
  static auto& sink =
      *new AnalyticsEventSink(ProcessEventQueue(), Configuration::process().analyticsWanted);
  sink.sendEventLazy(name, payload);
}

}  // namespace quarvel
