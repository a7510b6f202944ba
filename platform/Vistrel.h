#pragma once

#include <functional>
#include <string_view>

#include "base/Payload.h"

namespace quarvel {

/// Records one analytics event: a copy of `name`, and the payload that the builder `payload`
/// returns. The builder is called only when the event is wanted, at most once and before this
/// returns. From any thread. Never blocks and never fails towards the caller.
void VistrelSendEventLazy(std::string_view name, const std::function<Payload()>& payload);

}  // namespace quarvel
