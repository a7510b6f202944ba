#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <variant>

#include "base/Value.h"

namespace quarvel {

/// The reason of a failure. `userInfo` may hold "reason": a sentence with the fault and the allowed
/// values. A value; copy it freely.
struct Error {
  std::string domain;  // the part that failed, such as "quarvel.client"; gives `code` its meaning
  std::int64_t code = 0;  // a number of the domain, or the system's error number
  Dictionary userInfo;    // further data, which goes to clients with the error

  /// An error whose `userInfo` holds the reason alone.
  [[nodiscard]] static Error because(std::string domain, std::int64_t code, std::string reason);
  /// "domain code: reason", or "domain code" when there is no reason.
  [[nodiscard]] std::string description() const;
  bool operator==(const Error&) const = default;
};

/// A value, or the error that prevented it. A caller must look at it before it takes either. A
/// value of its own; not synchronised.
template <class T>
class [[nodiscard]] Result {
 public:
  // A value and an error both convert, so that a function returns either as it is.
  Result(T value)  // NOLINT(google-explicit-constructor)
      : result_(std::in_place_index<0>, std::move(value)) {}
  Result(Error error)  // NOLINT(google-explicit-constructor)
      : result_(std::in_place_index<1>, std::move(error)) {}

  [[nodiscard]] bool ok() const { return result_.index() == 0; }
  explicit operator bool() const { return ok(); }
  // Precondition of the next two: ok(). Valid as long as the result; may be moved from.
  [[nodiscard]] T& value() { return *std::get_if<0>(&result_); }
  [[nodiscard]] const T& value() const { return *std::get_if<0>(&result_); }
  // Precondition: !ok().
  [[nodiscard]] Error& error() { return *std::get_if<1>(&result_); }
  [[nodiscard]] const Error& error() const { return *std::get_if<1>(&result_); }

 private:
  std::variant<T, Error> result_;
};

/// The result of an operation without a value.
using Outcome = Result<std::monostate>;
/// The outcome of an operation that has not failed.
inline Outcome Success() {
  return std::monostate{};
}

}  // namespace quarvel
