#pragma once

#include <string>

#include "base/Error.h"

namespace quarvel {

/// A socket that does not block, connected to the service's at `path`. Errors:
/// `Client::Code::unreachable`; also, unless `mayWait`, while the queue of new connections is full.
[[nodiscard]] Result<int> ConnectTo(const std::string& path, bool mayWait);

}  // namespace quarvel
