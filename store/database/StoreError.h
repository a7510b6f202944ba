#pragma once

#include <cstdint>
#include <string>

#include "base/Error.h"

namespace quarvel {

inline constexpr const char* kStoreErrorDomain = "quarvel.store";

/// The codes of that domain.
enum class StoreErrorCode : std::int64_t {
  closed = 1,        // the store takes no more rows
  diskFull = 2,      // closed with rows that the disk had no room for
  failed = 3,        // the database answered with another error
  inaccessible = 4,  // the file or its directory cannot be used
  laterVersion = 5,  // a later version of the service wrote the store
  foreign = 6,       // the file is the database of another program
  corrupt = 7,       // its header contradicts what is in it
  tooLarge = 8,      // a row is longer than the store takes
};

[[nodiscard]] inline Error StoreError(StoreErrorCode code, std::string reason) {
  return Error::because(kStoreErrorDomain, static_cast<std::int64_t>(code), std::move(reason));
}

}  // namespace quarvel
