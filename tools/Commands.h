#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "base/Error.h"

// What quarvelctl does. Each prints to standard output and returns why it could not.

namespace quarvel::commands {

struct Options {
  bool json = false;   // JSON Lines for programs instead of tables for people
  std::string socket;  // empty: where the service listens by default
  std::string store;   // empty: where the service keeps it by default
};

struct MessageOptions {
  std::optional<std::int64_t> session;
  std::optional<std::int64_t> last;
  bool follow = false;
};

/// Plays a script; "-" is standard input, each line of which is played as it comes. A file is read
/// whole first, so that nothing is played of one that has a fault.
[[nodiscard]] Outcome Run(const Options& options, const std::string& file);

[[nodiscard]] Outcome Reporters(const Options& options);
/// Fails when no client has such a session.
[[nodiscard]] Outcome Valid(const Options& options, std::int64_t reporterID);
[[nodiscard]] Outcome Kill(const Options& options);

[[nodiscard]] Outcome Sessions(const Options& options);
[[nodiscard]] Outcome Messages(const Options& options, const MessageOptions& which);

}  // namespace quarvel::commands
