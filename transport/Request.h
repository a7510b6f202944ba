#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

#include "base/Error.h"
#include "base/Payload.h"
#include "platform/ExportedInterface.h"

namespace quarvel {

/// One MessagePack-RPC call as it stands in the read buffer, which must outlive it: a request
/// `[0, message id, method, params]` or a notification `[2, method, params]`.
struct Request {
  std::optional<std::uint32_t> messageID;  // none for a notification
  std::string_view method;                 // not checked: any octets
  PayloadValue params;                     // a list

  /// None when the value is neither; `fault` then says in a literal what is wrong.
  [[nodiscard]] static std::optional<Request> from(PayloadValue frame, std::string_view& fault);
};

// What a well-formed call is answered with when it cannot be made: domain "quarvel.connection".
[[nodiscard]] Error UnknownMethodError(const ExportedInterface* interface, std::string_view method);
[[nodiscard]] Error BadArgumentsError(std::string reason);

}  // namespace quarvel
