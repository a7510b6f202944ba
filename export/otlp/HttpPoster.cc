#include "export/otlp/HttpPoster.h"

#include <curl/curl.h>
#include <fmt/format.h>

#include <array>
#include <cstdlib>
#include <utility>

namespace quarvel {

namespace {

constexpr int kPollMilliseconds = 1000;  // a bound; the library wakes up for news by itself

// The library's handles are all pointers to void.
struct EasyCleanUp {
  void operator()(CURL* easy) const { curl_easy_cleanup(easy); }
};
struct MultiCleanUp {
  void operator()(CURLM* multi) const { curl_multi_cleanup(multi); }
};
struct ListCleanUp {
  void operator()(curl_slist* list) const { curl_slist_free_all(list); }
};

template <class T>
T* OrAbort(T* made) {
  if (made == nullptr) std::abort();  // out of memory
  return made;
}

std::size_t AppendBody(char* data, std::size_t, std::size_t length, void* body) {
  std::string& kept = *static_cast<std::string*>(body);
  if (kept.size() + length > HttpPoster::kMaximumBody) return 0;
  kept.append(data, length);
  return length;
}

}  // namespace

struct HttpPoster::Connection {
  explicit Connection(const Options& options)
      : multi(OrAbort(curl_multi_init())), easy(OrAbort(curl_easy_init())) {
    // No waiting for "100 Continue".
    headers.reset(OrAbort(curl_slist_append(nullptr, "Expect:")));
    for (const auto& [name, value] : options.headers) {
      // A header without a value is written with a semicolon.
      const std::string line = value.empty() ? name + ";" : fmt::format("{}: {}", name, value);
      OrAbort(curl_slist_append(headers.get(), line.c_str()));
    }
    set(CURLOPT_URL, options.url.c_str());
    set(CURLOPT_HTTPHEADER, headers.get());
    set(CURLOPT_PROTOCOLS_STR, "http,https");
    set(CURLOPT_PROXY, "");
    set(CURLOPT_FOLLOWLOCATION, 0L);
    set(CURLOPT_NOSIGNAL, 1L);
    set(CURLOPT_QUICK_EXIT, 1L);
    set(CURLOPT_CONNECTTIMEOUT, static_cast<long>(options.connect.count()));
    set(CURLOPT_TIMEOUT, static_cast<long>(options.timeout.count()));
    set(CURLOPT_WRITEFUNCTION, AppendBody);
    set(CURLOPT_ERRORBUFFER, reason.data());
    setPath(CURLOPT_CAINFO, options.tls.authority);
    setPath(CURLOPT_SSLCERT, options.tls.certificate);
    setPath(CURLOPT_SSLKEY, options.tls.key);
  }

  template <class Argument>
  void set(CURLoption option, Argument argument) {
    curl_easy_setopt(easy.get(), option, argument);
  }
  void setPath(CURLoption option, const std::filesystem::path& path) {
    if (!path.empty()) set(option, path.c_str());
  }

  std::unique_ptr<CURLM, MultiCleanUp> multi;
  std::unique_ptr<CURL, EasyCleanUp> easy;
  std::unique_ptr<curl_slist, ListCleanUp> headers;
  std::array<char, CURL_ERROR_SIZE> reason{};
};

HttpPoster::HttpPoster(Options options) : options_(std::move(options)) {
  // Once a process, and never undone.
  static const CURLcode initialized = curl_global_init(CURL_GLOBAL_DEFAULT);
  static_cast<void>(initialized);
}

HttpPoster::~HttpPoster() = default;

HttpPoster::Connection& HttpPoster::connection() {
  const MutexLock lock(mutex_);
  if (!connection_) connection_ = std::make_unique<Connection>(options_);
  return *connection_;
}

bool HttpPoster::isStopped() const {
  const MutexLock lock(mutex_);
  return stopped_;
}

HttpPoster::Response HttpPoster::post(std::string_view body) {
  Connection& used = connection();
  Response response;
  used.set(CURLOPT_WRITEDATA, &response.body);
  used.set(CURLOPT_POSTFIELDS, body.data());
  used.set(CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(body.size()));
  used.reason[0] = '\0';

  curl_multi_add_handle(used.multi.get(), used.easy.get());
  int running = 1;
  while (running > 0 && !response.stopped) {
    if (curl_multi_perform(used.multi.get(), &running) != CURLM_OK) break;
    if (running > 0) curl_multi_poll(used.multi.get(), nullptr, 0, kPollMilliseconds, nullptr);
    response.stopped = isStopped();
  }
  CURLcode result = CURLE_ABORTED_BY_CALLBACK;
  int waiting = 0;
  while (const CURLMsg* message = curl_multi_info_read(used.multi.get(), &waiting)) {
    if (message->msg == CURLMSG_DONE) result = message->data.result;
  }
  if (result == CURLE_OK) {
    curl_off_t seconds = 0;
    curl_easy_getinfo(used.easy.get(), CURLINFO_RESPONSE_CODE, &response.status);
    curl_easy_getinfo(used.easy.get(), CURLINFO_RETRY_AFTER, &seconds);
    if (seconds > 0) response.retryAfter = std::chrono::seconds(seconds);
    response.stopped = false;
  } else if (result == CURLE_WRITE_ERROR) {
    response.failure = "the answer is longer than allowed";
  } else {
    response.failure = used.reason[0] != '\0' ? used.reason.data() : curl_easy_strerror(result);
  }
  curl_multi_remove_handle(used.multi.get(), used.easy.get());
  return response;
}

void HttpPoster::disconnect() {
  const MutexLock lock(mutex_);
  connection_.reset();
}

void HttpPoster::stop() {
  const MutexLock lock(mutex_);
  stopped_ = true;
  if (connection_) curl_multi_wakeup(connection_->multi.get());
}

void HttpPoster::resume() {
  const MutexLock lock(mutex_);
  stopped_ = false;
}

}  // namespace quarvel
