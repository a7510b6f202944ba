#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "base/Error.h"
#include "platform/Log.h"
#include "system/ConfigurationSection.h"

namespace quarvel {

/// Settings of one remote backend, a backend that is fed from the store. Each engine derives its
/// own struct from this; the rest of the service sees nothing else of it.
struct BackendSettings {
  virtual ~BackendSettings() = default;

  std::chrono::seconds gather{0};  // how long rows are collected before a batch is sent
};

/// A remote backend that [agent] may name, and the reader of its section [agent.<name>].
struct RemoteBackend {
  std::string_view name;
  /// Reads and checks the section, which may be absent. Never null.
  std::shared_ptr<const BackendSettings> (*readSettings)(ConfigurationSection& section);
};

/// The platform configuration, quarvel.toml; every key is optional. A value type. The process's own
/// (`process`) is read once and constant, so that any thread may use it.
struct Configuration {
  /// [device]: the device properties.
  std::map<std::string, ConfigurationSection::Scalar, std::less<>> device;

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
    std::string device;  // empty: the host's name
    /// Of each remote backend that the service knows, whether or not `backends` names it.
    std::map<std::string, std::shared_ptr<const BackendSettings>, std::less<>> settings;

    /// The names in `backends` that are fed from the store.
    [[nodiscard]] std::vector<std::string> remoteBackends() const;
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
    /// Of the queued calls, how many a client has ahead of others to begin with. Not configured.
    std::size_t firstTurn = 16;
  } limits;

  /// Names the remote backends of this process's configuration, with `std::span` over constant
  /// data. Before the first `process`; without it "store" is the only backend.
  static void setRemoteBackends(std::span<const RemoteBackend> backends);

  /// The process's configuration, read on first use. An error in the file goes to the log (file,
  /// line, key and the allowed values) and ends the process with status 1. Unknown keys are
  /// warnings in the log.
  [[nodiscard]] static const Configuration& process();

  /// Reads the process's file again, for values that may change at run time; `process` stays as it
  /// was.
  [[nodiscard]] static Result<Configuration> readAgain();

  /// Reads one file; a missing file yields the defaults. `warnings` receives a sentence for each
  /// unknown key. Errors: domain "quarvel.configuration".
  [[nodiscard]] static Result<Configuration> read(const std::filesystem::path& file,
                                                  std::span<const RemoteBackend> backends,
                                                  std::vector<std::string>& warnings);
};

}  // namespace quarvel
