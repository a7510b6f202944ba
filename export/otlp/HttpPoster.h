#pragma once

#include <chrono>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/Mutex.h"
#include "export/ExportSettings.h"

namespace quarvel {

/// Posts bodies to one address, on one connection that is kept until `disconnect`. Follows no
/// redirect and asks no proxy, so that rows reach the configured address or none. Owned by its
/// engine and used on the exporter's thread, but for `stop` and `resume`.
class HttpPoster {
 public:
  /// A response with a longer body is not read to its end and counts as none.
  static constexpr std::size_t kMaximumBody = 64 * 1024;

  struct Options {
    std::string url;                             // complete, with its path
    std::map<std::string, std::string> headers;  // sent with each request; may hold secrets
    TlsSettings tls;
    std::chrono::seconds connect{5};   // of one connection attempt
    std::chrono::seconds timeout{10};  // of a whole request
  };
  /// Opens no connection before the first `post`.
  explicit HttpPoster(Options options);
  ~HttpPoster();
  HttpPoster(const HttpPoster&) = delete;
  HttpPoster& operator=(const HttpPoster&) = delete;

  struct Response {
    long status = 0;                                   // 0: there was no response
    std::string failure{};                             // the reason why there was none
    bool stopped = false;                              // by `stop`
    std::string body{};                                // complete, kMaximumBody at most
    std::optional<std::chrono::seconds> retryAfter{};  // the header, as a time from now
  };
  /// Blocks until the response is complete, `timeout` is over or `stop` is called.
  [[nodiscard]] Response post(std::string_view body) QUARVEL_EXCLUDES(mutex_);
  /// Closes the connection; the next `post` opens another one.
  void disconnect() QUARVEL_EXCLUDES(mutex_);

  // Any thread. Between `stop` and `resume` a request ends at once, also one in flight.
  void stop() QUARVEL_EXCLUDES(mutex_);
  void resume() QUARVEL_EXCLUDES(mutex_);

 private:
  struct Connection;  // of the library

  /// The open connection, or a new one.
  Connection& connection() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] bool isStopped() const QUARVEL_EXCLUDES(mutex_);

  const Options options_;
  mutable Mutex mutex_;
  bool stopped_ QUARVEL_GUARDED_BY(mutex_) = false;
  std::unique_ptr<Connection> connection_;  // replaced under the lock, used by the one thread
};

}  // namespace quarvel
