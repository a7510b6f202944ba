#pragma once

#include <algorithm>
#include <utility>

#include <quarvel/quarvel.h>
#include <quarvel/client.hpp>

// Shared by the functions that C calls: errors, exceptions and options at the language boundary.

namespace quarvel::c {

/// Fills `out` unless it is null. Returns the error's status.
quarvel_status Fill(quarvel_error* out, const Error& error);
/// The same for an error that has a status alone.
quarvel_status Fill(quarvel_error* out, quarvel_status status);

/// Runs a body that may throw. Returns the body's status, or the status of the exception.
template <class Body>
quarvel_status Guard(Body&& body) noexcept {
  try {
    return std::forward<Body>(body)();
  } catch (...) {
    // The library itself throws nothing: an exception means that memory or another resource is used
    // up.
    return QUARVEL_NO_MEMORY;
  }
}

/// Reads options of another version: a program older than the library has fewer, and gets zeros for
/// the rest; a newer one has more, which are ignored. False when the size is not valid.
template <class Options>
bool Read(const Options* options, Options& read) {
  read = Options{};
  if (options == nullptr) return true;
  if (options->size <= sizeof options->size) return false;
  std::copy_n(reinterpret_cast<const char*>(options), std::min(options->size, sizeof read),
              reinterpret_cast<char*>(&read));
  return true;
}

}  // namespace quarvel::c

/// Sets `read` to the finished payload; it lives as long as `payload`, until the next change. Fails
/// while the payload is not whole.
[[nodiscard]] quarvel_status quarvel_payload_read(const quarvel_payload* payload,
                                                  const quarvel::Payload*& read);

/// The client behind C's opaque pointer.
struct quarvel_client {
  quarvel::Client client;
};
