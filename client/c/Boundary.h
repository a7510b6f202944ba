#pragma once

#include <algorithm>
#include <utility>

#include <quarvel/quarvel.h>
#include <quarvel/client.hpp>

// Where C++ ends: what is shared by the functions that C calls.

namespace quarvel::c {

/// Fills `out` unless it is null. Returns its status.
quarvel_status Fill(quarvel_error* out, const Error& error);
/// The same for an error that has nothing to say but its status.
quarvel_status Fill(quarvel_error* out, quarvel_status status);

/// Runs what may throw. Returns what it returns, or the status of what it threw.
template <class Body>
quarvel_status Guard(Body&& body) noexcept {
  try {
    return std::forward<Body>(body)();
  } catch (...) {
    // The library throws nothing of its own: what comes is memory or another resource at its end.
    return QUARVEL_NO_MEMORY;
  }
}

/// Options as their user knows them: a user older than the library has fewer, and gets zeros for
/// the rest; a newer one has more, which are not known here. False when there is no valid size.
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

/// What C calls a payload, once it is whole.
[[nodiscard]] quarvel_status quarvel_payload_read(const quarvel_payload* payload,
                                                  const quarvel::Payload*& read);

/// A client, as C has it.
struct quarvel_client {
  quarvel::Client client;
};
