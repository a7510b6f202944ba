#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <map>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "base/Error.h"
#include "platform/Log.h"

namespace quarvel {

/// The platform configuration, quarvel.toml. Every key is optional.
struct Configuration {
  /// [device]: the device properties.
  std::map<std::string, std::variant<bool, std::int64_t, std::string>, std::less<>> device;

  LogLevel logLevel = LogLevel::standard;

  struct Store {
    std::filesystem::path path;  // empty: telemetry.db in the state directory
    std::chrono::milliseconds sync{1000};
    std::uint64_t maximumBytes = 268'435'456;
    std::chrono::days maximumAge{14};
  } store;

  struct Agent {
    std::vector<std::string> backends{"store"};
    bool exports = true;
    std::uint32_t drainRowsPerSecond = 2000;
  } agent;

  std::vector<std::string> analyticsWanted{"*"};

  struct TallixChannel {
    std::string group, subgroup, name;
    std::filesystem::path file;
    std::string pattern;  // empty: the file holds the integer alone
  };
  struct Tallix {
    std::filesystem::path root;  // empty: no tree
    std::vector<TallixChannel> channels;
  } tallix;

  enum class OrientationSource { none, files, iio };
  OrientationSource orientation = OrientationSource::none;

  struct Limits {
    std::size_t messageBytes = 1'048'576;
    std::size_t replyBytes = 1'048'576;
    std::chrono::milliseconds frame{10'000};
    std::chrono::milliseconds stall{30'000};
    unsigned depth = 32;
    std::size_t queuedCalls = 256;
    std::size_t queuedBytes = 4'194'304;
    std::size_t connections = 4096;
  } limits;

  /// The process's configuration, read on first use. When the file has an error, says so on
  /// standard error (file, line, key, what is allowed) and ends the process with status 1. Unknown
  /// keys are warnings in the log.
  [[nodiscard]] static const Configuration& process();

  /// Reads one file; a missing file yields the defaults. `warnings` receives a sentence for each
  /// unknown key. Errors: domain "quarvel.configuration".
  [[nodiscard]] static Result<Configuration> read(const std::filesystem::path& file,
                                                  std::vector<std::string>& warnings);
};

}  // namespace quarvel
