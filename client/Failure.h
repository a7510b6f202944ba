#pragma once

#include <string>
#include <utility>

#include <quarvel/client.hpp>

namespace quarvel {

/// An error of this side of the connection; `reason` is a sentence.
inline Error Failure(Client::Code code, std::string reason) {
  return Error::because(std::string(Client::kErrorDomain), static_cast<std::int64_t>(code),
                        std::move(reason));
}

}  // namespace quarvel
