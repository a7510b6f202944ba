#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

#include "base/Payload.h"

namespace quarvel {

/// Writes a copy of `record` to the power log under `domain` and `name`. `options` is always
/// absent. From any thread. Never blocks and never fails towards the caller.
void OhmrikLogRegisteredEvent(std::int32_t domain, std::string_view name, const Payload& record,
                              std::nullptr_t options);

}  // namespace quarvel
