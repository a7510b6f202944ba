#include "platform/Vistrel.h"

#include "linux/Service.h"

namespace quarvel {

void VistrelSendEventLazy(std::string_view name, const std::function<Payload()>& payload) {
  Service::current().analytics().sendEventLazy(name, payload);
}

}  // namespace quarvel
