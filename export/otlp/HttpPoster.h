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

/// Posts bodies to one address, on one connection that is kept until `rest`. Follows no redirect
/// and asks no proxy: what leaves the device goes where the configuration says, or nowhere. For one
/// thread, but for `stop` and `resume`.
class HttpPoster {
 public:
  /// An answer's body beyond this is not read, and the answer counts for none.
  static constexpr std::size_t kMaximumAnswer = 64 * 1024;

  struct Options {
    std::string url;
    std::map<std::string, std::string> headers;
    TlsSettings tls;
    std::chrono::seconds connect{5};
    std::chrono::seconds timeout{10};  // of a whole request
  };
  explicit HttpPoster(Options options);
  ~HttpPoster();
  HttpPoster(const HttpPoster&) = delete;
  HttpPoster& operator=(const HttpPoster&) = delete;

  struct Answer {
    long status = 0;      // 0: there was none
    std::string failure;  // why
    bool stopped = false;
    std::string body;
    std::optional<std::chrono::seconds> retryAfter;
  };
  [[nodiscard]] Answer post(std::string_view body) QUARVEL_EXCLUDES(mutex_);
  void rest() QUARVEL_EXCLUDES(mutex_);

  // Any thread. From now on until `resume` a request, also one under way, ends at once.
  void stop() QUARVEL_EXCLUDES(mutex_);
  void resume() QUARVEL_EXCLUDES(mutex_);

 private:
  struct Connection;

  Connection& connection() QUARVEL_EXCLUDES(mutex_);
  [[nodiscard]] bool isStopped() const QUARVEL_EXCLUDES(mutex_);

  const Options options_;
  mutable Mutex mutex_;
  bool stopped_ QUARVEL_GUARDED_BY(mutex_) = false;
  std::unique_ptr<Connection> connection_;  // replaced under the lock, used by the one thread
};

}  // namespace quarvel
