#pragma once

#include <cstdint>
#include <functional>
#include <string_view>

#include "platform/WorkQueue.h"

namespace quarvel {

/// Identifies one registration. Never 0, which stands for none.
using NotificationToken = std::int32_t;

/// Called with the token of its own registration.
using NotificationHandler = std::function<void(NotificationToken)>;

/// Registers for a named system notification: each posting from now on runs `handler` on `queue`, a
/// serial queue. A name may have any number of registrations. Postings that arrive before the
/// handler has begun are coalesced into one call; one that arrives while it runs is another call.
/// Earlier postings are not reported.
///
/// `token` is set before the handler can be called. Returns 0, or the system's error number when
/// the facility cannot be set up; `token` is then 0 and the handler is never called. From any
/// thread; never blocks. The registration and `queue`, which it does not own, last as long as the
/// process.
[[nodiscard]] std::int32_t RegisterForNotification(std::string_view name, NotificationToken& token,
                                                   WorkQueue& queue, NotificationHandler handler);

}  // namespace quarvel
