#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

#include "base/Payload.h"

namespace quarvel {

/// Writes one record to the power log. `options` is always absent. From any thread; may hold its
/// caller back while there is no room; never fails towards the caller.
void OhmrikLogRegisteredEvent(std::int32_t domain, std::string_view name, const Payload& record,
                              std::nullptr_t options);

}  // namespace quarvel
