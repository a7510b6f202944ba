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
/// own struct from this, and the rest of the service uses no other part of it. Constant once read;
/// shared by the configuration and the engine.
struct BackendSettings {
  virtual ~BackendSettings() = default;

  std::chrono::seconds gather{0};  // how long rows are collected before a batch is sent
};

/// A remote backend that [agent] may name, and the reader of its section [agent.<name>].
struct BackendKind {
  std::string_view name;
  /// Reads and checks the section, which may be absent. Never null.
  std::shared_ptr<const BackendSettings> (*readSettings)(ConfigurationSection& section);
};

/// The platform configuration, quarvel.toml, with a default for every key. A value type. The
/// process's own (`process`) is read once and constant, so that any thread may use it.
struct Configuration {
  /// [device]: the device properties.
  std::map<std::string, ConfigurationSection::Scalar, std::less<>> device;

  /// [log]: the least urgent level that is written.
  LogLevel logLevel = LogLevel::standard;

  /// [store]
  struct Store {
    std::filesystem::path path;  // empty: telemetry.db in the state directory
    std::chrono::milliseconds sync{
        1000};  // a row is on the medium at most this long after queueing
    std::uint64_t maximumBytes = 268'435'456;  // the oldest rows are removed above it
    std::chrono::days maximumAge{14};          // likewise
  } store;

  /// [agent]
  struct Agent {
    std::vector<std::string> backends{"store"};  // in order, each once; may be empty
    bool exports = true;                         // consent to rows leaving the device
    std::uint32_t drainRowsPerSecond = 2000;     // rate limit of draining a backlog
    std::string device;                          // empty: the host's name
    /// By the name of each remote backend that the service knows, also of the ones not in
    /// `backends`.
    std::map<std::string, std::shared_ptr<const BackendSettings>, std::less<>> settings;

    /// The names in `backends` that are fed from the store.
    [[nodiscard]] std::vector<std::string> remoteBackends() const;
  } agent;

  /// [analytics]: glob patterns of the event names that are recorded.
  std::vector<std::string> analyticsWanted{"*"};

  /// [[tallix.channel]]: one driver counter in a file of its own or in a report.
  struct TallixChannel {
    std::string group, subgroup, name;  // no subgroup: empty
    std::filesystem::path file;         // read when samples are taken, not here
    std::string pattern;                // empty: the file holds the integer alone
  };
  /// [tallix]
  struct Tallix {
    std::filesystem::path root;           // empty: no tree
    std::vector<TallixChannel> channels;  // in the file's order
  } tallix;

  /// [orientation]
  enum class OrientationSource {
    none,   // no orientation is ever reported
    files,  // two files in the runtime directory
    iio,    // the sensor proxy on the system bus
  };
  OrientationSource orientation = OrientationSource::none;

  /// [limits]
  struct Limits {
    std::size_t messageBytes = 1'048'576;     // of one message
    std::size_t replyBytes = 1'048'576;       // held for a client that does not read
    std::chrono::milliseconds frame{10'000};  // to complete a frame that was begun
    std::chrono::milliseconds stall{30'000};  // without progress of a client's reading
    unsigned depth = 32;                      // of nested lists and dictionaries
    std::size_t queuedCalls = 256;            // of one client
    std::size_t queuedBytes = 4'194'304;      // likewise
    std::size_t connections = 4096;           // of all clients
  } limits;

  /// The file's name in the configuration directory.
  static constexpr const char* kFileName = "quarvel.toml";

  /// Reads one file; a missing file yields the defaults. `backends` are the remote backends that
  /// [agent] may name. `warnings` receives a sentence for each unknown key. Errors: domain
  /// "quarvel.configuration".
  [[nodiscard]] static Result<Configuration> read(const std::filesystem::path& file,
                                                  std::span<const BackendKind> backends,
                                                  std::vector<std::string>& warnings);
};

}  // namespace quarvel
