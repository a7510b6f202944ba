#include "platform/Ohmrik.h"

#include "platform/linux/store/ProcessStore.h"

namespace quarvel {

void OhmrikLogRegisteredEvent(std::int32_t domain, std::string_view name, const Payload& record,
                              std::nullptr_t) {
  ProcessEventPath().addPowerEvent(domain, name, record);
}

}  // namespace quarvel
