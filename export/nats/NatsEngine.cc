#include "export/nats/NatsEngine.h"

#include <fmt/format.h>
#include <nats/nats.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <deque>
#include <utility>
#include <vector>

#include "base/Mutex.h"

namespace quarvel {

namespace {

constexpr std::int64_t kConnectMilliseconds = 3000;  // to one server
constexpr std::int64_t kPingMilliseconds = 2000;
constexpr const char* kSubjects = "quarvel.>";

template <class T, void (*destroy)(T*)>
struct Destroy {
  void operator()(T* destroyed) const { destroy(destroyed); }
};
template <class T, void (*destroy)(T*)>
using Owned = std::unique_ptr<T, Destroy<T, destroy>>;

std::string TextOf(natsStatus status) {
  const char* const detail = nats_GetLastError(nullptr);
  const std::string text = natsStatus_GetText(status);
  return detail == nullptr || *detail == '\0' || text == detail
             ? text
             : fmt::format("{}: {}", text, detail);
}

}  // namespace

/// The stream's acknowledgements of the rows of one batch. Lives as long as the process, because
/// the library may call it after the connection is closed. Any thread.
class NatsEngine::Acknowledgements {
 public:
  struct Result {
    std::size_t taken = 0;  // rows, counted from the first
    bool all = false;
    bool refused = false;  // the row after them
    bool stopped = false;
    std::string reason;
  };

  void expect(const ExportBatch& batch) {
    const MutexLock lock(mutex_);
    prefix_ = batch.nameOf(ExportRow{});
    prefix_.pop_back();  // the id
    ids_.clear();
    for (const ExportRow& row : batch.rows) ids_.push_back(row.id);
    states_.assign(ids_.size(), State::waiting);
    waiting_ = ids_.size();
    closed_ = false;
    reason_.clear();
  }
  /// Marks a row, by its index in the batch, as one that cannot be published.
  void refuse(std::size_t index, std::string reason) {
    const MutexLock lock(mutex_);
    setState(index, State::refused, std::move(reason));
  }
  void acknowledge(const char* name, const jsPubAckErr* error) {
    const MutexLock lock(mutex_);
    if (!std::string_view(name).starts_with(prefix_)) return;
    const std::int64_t id = std::strtoll(name + prefix_.size(), nullptr, 10);
    const auto found = std::ranges::lower_bound(ids_, id);
    if (found == ids_.end() || *found != id) return;
    const auto index = static_cast<std::size_t>(found - ids_.begin());
    if (error == nullptr) {
      setState(index, State::taken, {});
      return;
    }
    const bool never = error->ErrCode == JSStreamMessageExceedsMaximumErr;
    setState(index, never ? State::refused : State::failed,
             error->ErrText != nullptr ? error->ErrText : natsStatus_GetText(error->Err));
  }
  void connectionClosed() {
    const MutexLock lock(mutex_);
    closed_ = true;
    changed_.notifyAll();
  }
  void setStopped(bool stopped) {
    const MutexLock lock(mutex_);
    stopped_ = stopped;
    changed_.notifyAll();
  }

  /// Waits until every row has its acknowledgement, or no more can come.
  Result await(std::chrono::seconds limit) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    const MutexLock lock(mutex_);
    bool inTime = true;
    while (inTime && waiting_ > 0 && !closed_ && !stopped_) {
      inTime = changed_.waitUntil(mutex_, deadline);
    }
    Result result;
    while (result.taken < states_.size() && states_[result.taken] == State::taken) ++result.taken;
    result.all = result.taken == states_.size();
    if (result.all) return result;
    result.stopped = stopped_;
    result.refused = states_[result.taken] == State::refused;
    if (!reason_.empty()) {
      result.reason = reason_;
    } else if (closed_) {
      result.reason = "the connection was lost";
    } else {
      result.reason =
          fmt::format("{} rows were not acknowledged within {} s", waiting_, limit.count());
    }
    return result;
  }

 private:
  enum class State : std::uint8_t { waiting, taken, refused, failed };

  void setState(std::size_t index, State state, std::string reason) QUARVEL_REQUIRES(mutex_) {
    if (states_[index] == State::waiting) --waiting_;
    states_[index] = state;
    if (reason_.empty()) reason_ = std::move(reason);
    if (waiting_ == 0) changed_.notifyAll();
  }

  Mutex mutex_;
  ConditionVariable changed_;
  std::string prefix_ QUARVEL_GUARDED_BY(mutex_);  // of the rows' names
  std::vector<std::int64_t> ids_ QUARVEL_GUARDED_BY(mutex_);
  std::vector<State> states_ QUARVEL_GUARDED_BY(mutex_);
  std::size_t waiting_ QUARVEL_GUARDED_BY(mutex_) = 0;
  bool closed_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool stopped_ QUARVEL_GUARDED_BY(mutex_) = false;
  std::string reason_ QUARVEL_GUARDED_BY(mutex_);  // the first one

 public:
  /// Never destroyed.
  static Acknowledgements& make() {
    static Mutex mutex;
    static auto& all = *new std::deque<Acknowledgements>;
    const MutexLock lock(mutex);
    return all.emplace_back();
  }
};

/// A connection and its JetStream context, for the exporter's thread. Replaced after the first
/// failure.
class NatsEngine::Connection {
 public:
  Connection(const NatsSettings& settings, Acknowledgements& acknowledgements)
      : settings_(settings), acknowledgements_(acknowledgements) {}
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;
  ~Connection() {
    if (published_) {  // before that the library has no list and does not check
      natsMsgList pending{};
      if (js_PublishAsyncGetPendingList(&pending, js_.get()) == NATS_OK) {
        natsMsgList_Destroy(&pending);
      }
    }
    js_.reset();
    if (connection_) natsConnection_Close(connection_.get());
  }

  /// Returns the reason when it fails.
  std::optional<std::string> open(const std::string& name) {
    natsOptions* made = nullptr;
    natsStatus status = natsOptions_Create(&made);
    const Owned<natsOptions, natsOptions_Destroy> options(made);
    if (status == NATS_OK) status = configure(made, name);
    if (status != NATS_OK) return TextOf(status);
    natsConnection* connected = nullptr;
    status = natsConnection_Connect(&connected, made);
    connection_.reset(connected);
    if (status != NATS_OK) {
      return fmt::format("{} cannot be reached: {}", fmt::join(settings_.urls, ", "),
                         TextOf(status));
    }
    jsOptions jetStream;
    jsOptions_Init(&jetStream);
    jetStream.Wait = milliseconds();
    jetStream.PublishAsync.AckHandler = [](jsCtx*, natsMsg* message, jsPubAck*, jsPubAckErr* error,
                                           void* acknowledgements) {
      const char* row = nullptr;
      if (natsMsgHeader_Get(message, "Nats-Msg-Id", &row) == NATS_OK) {
        static_cast<Acknowledgements*>(acknowledgements)->acknowledge(row, error);
      }
      natsMsg_Destroy(message);
    };
    jetStream.PublishAsync.AckHandlerClosure = &acknowledgements_;
    jsCtx* js = nullptr;
    status = natsConnection_JetStream(&js, connected, &jetStream);
    js_.reset(js);
    if (status != NATS_OK) return TextOf(status);
    return settings_.stream.empty() ? std::nullopt : prepareStream();
  }

  natsStatus publish(const std::string& subject, const std::string& name, const std::string& body) {
    natsMsg* message = nullptr;
    natsStatus status = natsMsg_Create(&message, subject.c_str(), nullptr, body.data(),
                                       static_cast<int>(body.size()));
    jsPubOptions options;
    jsPubOptions_Init(&options);
    options.MsgId = name.c_str();
    if (!settings_.stream.empty()) options.ExpectStream = settings_.stream.c_str();
    if (status == NATS_OK) status = js_PublishMsgAsync(js_.get(), &message, &options);
    published_ = published_ || status == NATS_OK;
    natsMsg_Destroy(message);
    return status;
  }

 private:
  [[nodiscard]] std::int64_t milliseconds() const { return settings_.acknowledge.count() * 1000; }

  natsStatus configure(natsOptions* options, const std::string& name) {
    std::vector<const char*> urls;
    for (const std::string& url : settings_.urls) urls.push_back(url.c_str());
    const auto& [authority, certificate, key] = settings_.tls;
    natsStatus status = NATS_OK;
    const auto also = [&status](natsStatus next) {
      if (status == NATS_OK) status = next;
    };
    also(natsOptions_SetServers(options, urls.data(), static_cast<int>(urls.size())));
    also(natsOptions_SetName(options, name.c_str()));
    also(natsOptions_SetTimeout(options, kConnectMilliseconds));
    // The exporter has its own back-off; reconnecting by the library would cost wake-ups.
    also(natsOptions_SetAllowReconnect(options, false));
    also(natsOptions_SetPingInterval(options, kPingMilliseconds));
    also(natsOptions_SetClosedCB(
        options,
        [](natsConnection*, void* acknowledgements) {
          static_cast<Acknowledgements*>(acknowledgements)->connectionClosed();
        },
        &acknowledgements_));
    if (!authority.empty()) {
      also(natsOptions_LoadCATrustedCertificates(options, authority.c_str()));
      also(natsOptions_SetSecure(options, true));
    }
    if (!certificate.empty()) {
      also(natsOptions_LoadCertificatesChain(options, certificate.c_str(), key.c_str()));
    }
    if (!settings_.credentials.empty()) {
      also(
          natsOptions_SetUserCredentialsFromFiles(options, settings_.credentials.c_str(), nullptr));
    }
    return status;
  }

  std::optional<std::string> prepareStream() {
    const char* const name = settings_.stream.c_str();
    jsStreamInfo* found = nullptr;
    jsErrCode code{};
    natsStatus status = js_GetStreamInfo(&found, js_.get(), name, nullptr, &code);
    Owned<jsStreamInfo, jsStreamInfo_Destroy> info(found);
    if (status == NATS_OK) return std::nullopt;
    if (status != NATS_NOT_FOUND) return fmt::format("its stream {}: {}", name, TextOf(status));
    if (!settings_.createStream) {
      return fmt::format("it has no stream {}: make it, or set create_stream in [agent.nats]",
                         name);
    }
    const char* subjects[] = {kSubjects};
    jsStreamConfig stream;
    jsStreamConfig_Init(&stream);
    stream.Name = name;
    stream.Subjects = subjects;
    stream.SubjectsLen = 1;
    stream.Replicas = settings_.replicas;
    stream.Duplicates = std::chrono::nanoseconds(settings_.duplicateWindow).count();
    status = js_AddStream(&found, js_.get(), &stream, nullptr, &code);
    info.reset(found);
    if (status == NATS_OK) return std::nullopt;
    return fmt::format("its stream {} cannot be made: {}", name, TextOf(status));
  }

  const NatsSettings& settings_;
  Acknowledgements& acknowledgements_;
  Owned<natsConnection, natsConnection_Destroy> connection_;
  Owned<jsCtx, jsCtx_Destroy> js_;
  bool published_ = false;
};

NatsEngine::NatsEngine(NatsSettings settings, const ExportDevice& device)
    : settings_(std::move(settings)),
      name_(fmt::format("quarveld {} {}", device.version, device.name)),
      subject_(fmt::format("quarvel.{}.", device.name)),
      acknowledgements_(Acknowledgements::make()) {}

NatsEngine::~NatsEngine() = default;

Delivery NatsEngine::deliver(const ExportBatch& batch) {
  acknowledgements_.expect(batch);
  if (!connection_) {
    connection_ = std::make_unique<Connection>(settings_, acknowledgements_);
    if (auto reason = connection_->open(name_)) {
      connection_.reset();
      return {.remainder = Delivery::Remainder::again, .reason = std::move(*reason)};
    }
  }
  const std::string subject = subject_ + StoreTableName(batch.table);
  std::string body;
  std::string failure;
  for (std::size_t i = 0; i < batch.rows.size() && failure.empty(); ++i) {
    body.clear();
    AppendRowJson(body, batch.table, batch.rows[i]);
    const natsStatus status = connection_->publish(subject, batch.nameOf(batch.rows[i]), body);
    if (status == NATS_MAX_PAYLOAD) {
      acknowledgements_.refuse(i, fmt::format("{} bytes are more than it allows", body.size()));
    } else if (status != NATS_OK) {
      failure = TextOf(status);
      acknowledgements_.connectionClosed();
    }
  }
  Acknowledgements::Result result = acknowledgements_.await(settings_.acknowledge);
  if (result.all) return {.taken = result.taken};
  if (result.stopped) return {.taken = result.taken, .remainder = Delivery::Remainder::stopped};
  if (result.refused) {
    return {.taken = result.taken,
            .remainder = Delivery::Remainder::refused,
            .refused = 1,
            .reason = std::move(result.reason)};
  }
  connection_.reset();
  return {.taken = result.taken,
          .remainder = Delivery::Remainder::again,
          .reason = failure.empty() ? std::move(result.reason) : std::move(failure)};
}

void NatsEngine::disconnect() {
  connection_.reset();
}

void NatsEngine::stop() {
  acknowledgements_.setStopped(true);
}

void NatsEngine::resume() {
  acknowledgements_.setStopped(false);
}

}  // namespace quarvel
