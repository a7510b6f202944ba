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

  /// Files in PEM; empty: the system's authorities, and no certificate of one's own.
  struct Tls {
    std::filesystem::path authority, certificate, key;
  };
  /// The backend "nats".
  struct Nats {
    std::vector<std::string> urls{"nats://localhost:4222"};
    std::string stream = "QUARVEL";  // empty: whichever has the subject, and nobody checks
    bool createStream = false;       // with the next two
    int replicas = 3;
    std::chrono::seconds duplicateWindow{120};
    std::filesystem::path credentials;  // empty: none
    Tls tls;
    std::chrono::seconds acknowledge{10};  // how long acknowledgements may take
    std::chrono::seconds gather{0};        // how long rows are collected before they are sent
  };
  /// The backend "otlp".
  struct Otlp {
    std::string endpoint = "http://localhost:4318";
    std::map<std::string, std::string> headers;
    bool gzip = true;
    Tls tls;
    std::chrono::seconds connect{5};
    std::chrono::seconds timeout{10};  // of a whole request
    std::chrono::seconds gather{0};
  };
  struct Agent {
    std::vector<std::string> backends{"store"};
    bool exports = true;
    std::uint32_t drainRowsPerSecond = 2000;
    std::string device;  // empty: the host's name
    Nats nats;
    Otlp otlp;

    /// Those of `backends` that are fed from the store.
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
  } limits;

  /// The file's name in the configuration directory.
  static constexpr const char* kFileName = "quarvel.toml";

  /// Reads one file; a missing file yields the defaults. `warnings` receives a sentence for each
  /// unknown key. Errors: domain "quarvel.configuration".
  [[nodiscard]] static Result<Configuration> read(const std::filesystem::path& file,
                                                  std::vector<std::string>& warnings);
};

}  // namespace quarvel
