#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

#include "base/Payload.h"

namespace quarvel {

/// Writes one record to the power log. `options` is always absent. From any thread; neither holds
/// its caller back nor fails towards it.
void OhmrikLogRegisteredEvent(std::int32_t domain, std::string_view name, const Payload& record,
                              std::nullptr_t options);

}  // namespace quarvel
