#pragma once

#include <cstdint>
#include <functional>
#include <string_view>

#include "platform/WorkQueue.h"

namespace quarvel {

/// Names one registration. Never 0, so that 0 can stand for none.
using NotificationToken = std::int32_t;

/// Is given the token of the registration it was made for.
using NotificationHandler = std::function<void(NotificationToken)>;

/// Registers for a named system notification. From then on each posting runs `handler` on `queue`,
/// a serial queue. A name may be registered for any number of times. Postings that come before the
/// handler has begun are one call, so a burst costs one; none is lost, and one that comes while the
/// handler runs is another call. What was posted before the registration is not reported.
/// `token` is set before the handler can be called.
/// Returns 0, or the system's error number when the facility cannot be set up; `token` is then 0
/// and the handler is never called. From any thread; does not block. Registration and `queue`,
/// which is not owned, are for the life of the process.
[[nodiscard]] std::int32_t RegisterForNotification(std::string_view name, NotificationToken& token,
                                                   WorkQueue& queue, NotificationHandler handler);

}  // namespace quarvel
