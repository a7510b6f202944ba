#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

#include "base/Error.h"
#include "base/Payload.h"
#include "platform/ExportedInterface.h"

namespace quarvel {

/// One MessagePack-RPC call: a request `[0, message id, method, params]` or a notification
/// `[2, method, params]`. Refers to the read buffer, which must outlive it.
struct Request {
  std::optional<std::uint32_t> messageID;  // none for a notification
  std::string_view method;                 // not checked: any octets
  PayloadValue params;                     // a list

  /// None when `frame` is neither: the connection is then ended. `fault` is a literal that names
  /// the error, for the log.
  [[nodiscard]] static std::optional<Request> from(PayloadValue frame, std::string_view& fault);
};

// Answers to a well-formed call that cannot be made: domain "quarvel.connection", with a reason
// that tells the allowed values.

/// Code 1: `interface` has no operation of this name. Null: the delegate has set none.
[[nodiscard]] Error UnknownMethodError(const ExportedInterface* interface, std::string_view method);
/// Code 2: arguments of the wrong number, kind or range, or too many targets.
[[nodiscard]] Error BadArgumentsError(std::string reason);

}  // namespace quarvel
