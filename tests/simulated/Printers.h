#pragma once

#include <ostream>

#include "base/Error.h"
#include "base/Json.h"

// How GoogleTest prints the project's values.

namespace quarvel {

inline void PrintTo(const Value& value, std::ostream* out) {
  *out << JsonText(value);
}
inline void PrintTo(const Dictionary& dictionary, std::ostream* out) {
  *out << JsonText(dictionary);
}
inline void PrintTo(const Payload& payload, std::ostream* out) {
  *out << JsonText(payload);
}
inline void PrintTo(const Error& error, std::ostream* out) {
  *out << error.description();
}

}  // namespace quarvel
