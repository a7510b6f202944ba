#include "platform/Ohmrik.h"

#include "linux/Service.h"

namespace quarvel {

void OhmrikLogRegisteredEvent(std::int32_t domain, std::string_view name, const Payload& record,
                              std::nullptr_t) {
  Service::current().events().addPowerEvent(domain, name, record);
}

}  // namespace quarvel
