#include <algorithm>
#include <atomic>
#include <utility>

#include <quarvel/realtime.hpp>

#include "base/Mutex.h"
#include "client/Channel.h"
#include "client/Operations.h"
#include "client/RealtimeRing.h"

namespace quarvel {

/// The consumer's side: sends the ring's records, on the connection's driver or in `stop`. Owned by
/// the reporter; the driver holds it while it runs.
class __attribute__((visibility("hidden"))) RealtimeReporter::Drain final
    : public Client::Channel::Periodic,
      public std::enable_shared_from_this<Drain> {
 public:
  Drain(std::shared_ptr<Client::Channel> channel, ReporterID session, Options options)
      : channel_(std::move(channel)),
        session_(session),
        options_(std::move(options)),
        ring_(options_.records, options_.recordBytes) {}

  RealtimeRing& ring() { return ring_; }

  void start() QUARVEL_EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    started_ = true;
    schedule();
  }

  void stop() QUARVEL_EXCLUDES(mutex_) {
    {
      MutexLock lock(mutex_);
      started_ = false;
    }
    if (!beginDrain()) return;
    const bool all = sendAll();
    endDrain();
    MutexLock lock(mutex_);
    if (!all) schedule();
  }

  /// Stops for good, and counts the records that could not be sent as lost.
  void end() QUARVEL_EXCLUDES(mutex_) {
    stop();
    if (!beginDrain()) return;
    for (; ring_.front(); ring_.pop()) ++unsent_;
    endDrain();
  }

  std::optional<Client::Channel::Time> run() override QUARVEL_EXCLUDES(mutex_) {
    const bool emptying = beginDrain();
    const bool all = emptying && sendAll();
    if (emptying) endDrain();
    MutexLock lock(mutex_);
    scheduled_ = started_ || !all;
    return scheduled_ ? std::optional(nextTime()) : std::nullopt;
  }

  [[nodiscard]] Statistics statistics() const { return {sent_, loss()}; }

 private:
  [[nodiscard]] Client::Channel::Time nextTime() const {
    return std::chrono::steady_clock::now() +
           std::max(options_.interval, std::chrono::milliseconds(1));
  }

  void schedule() QUARVEL_REQUIRES(mutex_) {
    if (!std::exchange(scheduled_, true)) channel_->schedule(nextTime(), weak_from_this());
  }

  // Draining may wait for the service, so no lock is held meanwhile, and the driver does not wait
  // for another thread's drain.
  bool beginDrain() QUARVEL_EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    while (draining_) {
      if (channel_->onDriver()) return false;
      drained_.wait(mutex_);
    }
    return draining_ = true;
  }

  void endDrain() QUARVEL_EXCLUDES(mutex_) {
    const Loss now = loss();
    const Loss lost = Difference(now, std::exchange(reportedToCallback_, now));
    if (lost.total() > 0 && options_.lost) options_.lost(lost);
    MutexLock lock(mutex_);
    draining_ = false;
    drained_.notifyAll();
  }

  [[nodiscard]] Loss loss() const { return {ring_.full(), ring_.tooLarge(), invalid_, unsent_}; }

  [[nodiscard]] static Loss Difference(const Loss& one, const Loss& other) {
    return {one.full - other.full, one.tooLarge - other.tooLarge, one.invalid - other.invalid,
            one.unsent - other.unsent};
  }

  // Returns whether everything has been sent.
  bool sendAll() {
    while (const auto record = ring_.front()) {
      if (channel_->reconnecting()) return false;
      const auto payload = Payload::from(PayloadValue(record->payload.data()));
      if (!payload) {
        ++invalid_;
      } else {
        const Client::Code code =
            send(payload.value(), Category(record->category), MessageType{record->type});
        if (code == Client::Code::heldBack) return false;
        ++(code == Client::Code::none ? sent_ : unsent_);
      }
      ring_.pop();
    }
    return sendLossMessage();
  }

  bool sendLossMessage() {
    const Loss now = loss();
    Loss lost = Difference(now, reportedByMessage_);
    lost.unsent = 0;  // counted only after a loss for good, when no message can be sent
    if (!options_.lossMessage || lost.total() == 0) return true;
    if (channel_->reconnecting()) return false;
    Dictionary message{{"RealtimeRecordsLost", lost.total()}};
    if (lost.full > 0) message.set("Full", lost.full);
    if (lost.tooLarge > 0) message.set("TooLarge", lost.tooLarge);
    if (lost.invalid > 0) message.set("Invalid", lost.invalid);
    const LossMessage& as = *options_.lossMessage;
    if (send(message, as.category, as.type) == Client::Code::heldBack) return false;
    reportedByMessage_ = now;
    return true;
  }

  Client::Code send(PayloadArgument payload, Category category, MessageType type) {
    const Recipients recipients(session_);
    return channel_
        ->send(operations::SendMessage(payload, category, type, recipients),
               Client::Reply<std::monostate>())
        .code;
  }

  // Constant after construction.
  const std::shared_ptr<Client::Channel> channel_;
  const ReporterID session_;
  const Options options_;

  Mutex mutex_;  // taken before the connection's
  ConditionVariable drained_;
  bool started_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool scheduled_ QUARVEL_GUARDED_BY(mutex_) = false;
  bool draining_ QUARVEL_GUARDED_BY(mutex_) = false;

  // For the thread that has set `draining_`; the counts are read by every thread.
  RealtimeRing ring_;  // as its consumer
  std::atomic<std::uint64_t> sent_{0};
  std::atomic<std::uint64_t> invalid_{0};
  std::atomic<std::uint64_t> unsent_{0};
  Loss reportedByMessage_;   // in a loss message
  Loss reportedToCallback_;  // to the callback `lost`
};

RealtimeReporter::RealtimeReporter(Client& client, ReporterID reporterID, Options options)
    : drain_(std::make_shared<Drain>(client.channel_, reporterID, std::move(options))),
      ring_(&drain_->ring()) {}
RealtimeReporter::RealtimeReporter(Client& client, ReporterID reporterID)
    : RealtimeReporter(client, reporterID, Options()) {}
RealtimeReporter::~RealtimeReporter() {
  drain_->end();
}

void RealtimeReporter::start() {
  drain_->start();
}
void RealtimeReporter::stop() {
  drain_->stop();
}
RealtimeReporter::Statistics RealtimeReporter::statistics() const {
  return drain_->statistics();
}

RealtimeReporter::Record RealtimeReporter::record(Category category, MessageType type) noexcept {
  return Record(*ring_, category, type);
}

using Record = RealtimeReporter::Record;

Record::Record(RealtimeRing& ring, Category category, MessageType type) noexcept
    : ring_(&ring), fits_(ring.begin(category.code, static_cast<std::uint16_t>(type))) {}
Record::~Record() {
  if (ring_ != nullptr) ring_->abandon();
}

Record& Record::setBoolean(std::string_view key, bool value) noexcept {
  if (ring_ != nullptr) ring_->boolean(key, value);
  return *this;
}
Record& Record::setInteger(std::string_view key, std::int64_t value) noexcept {
  if (ring_ != nullptr) ring_->integer(key, value);
  return *this;
}
Record& Record::setUnsignedInteger(std::string_view key, std::uint64_t value) noexcept {
  if (ring_ != nullptr) ring_->unsignedInteger(key, value);
  return *this;
}
Record& Record::set(std::string_view key, double value) noexcept {
  if (ring_ != nullptr) ring_->real(key, value);
  return *this;
}
Record& Record::set(std::string_view key, std::string_view text) noexcept {
  if (ring_ != nullptr) ring_->string(key, text);
  return *this;
}
Record& Record::set(std::string_view key, Date date) noexcept {
  if (ring_ != nullptr) ring_->date(key, date);
  return *this;
}
bool Record::send() noexcept {
  return ring_ != nullptr && std::exchange(ring_, nullptr)->commit();
}

}  // namespace quarvel
