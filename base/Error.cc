#include "base/Error.h"

#include <fmt/format.h>

namespace quarvel {

Error Error::because(std::string domain, std::int64_t code, std::string reason) {
  return {std::move(domain), code, Dictionary{{"reason", std::move(reason)}}};
}

std::string Error::description() const {
  const Value* reason = userInfo.find("reason");
  if (reason == nullptr || reason->string() == nullptr) return fmt::format("{} {}", domain, code);
  return fmt::format("{} {}: {}", domain, code, *reason->string());
}

}  // namespace quarvel
