#pragma once

#include <functional>
#include <string_view>

#include "base/Payload.h"

namespace quarvel {

/// Records one analytics event, a copy of `name` and of the payload that `payload` returns. The
/// builder is called only when the event is wanted, at most once and before this returns. From any
/// thread; neither holds its caller back nor fails towards it.
void VistrelSendEventLazy(std::string_view name, const std::function<Payload()>& payload);

}  // namespace quarvel
