#include <quarvel/client.hpp>

#include <utility>

#include "client/Channel.h"
#include "client/Operations.h"

namespace quarvel {
namespace {

/// A reply for which a thread waits. Shared by the waiting call and its callback.
template <class T>
class Awaited {
 public:
  void set(Result<T> result) QUARVEL_EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    result_ = std::move(result);
    given_.notifyAll();
  }

  [[nodiscard]] bool given() const QUARVEL_EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    return result_.has_value();
  }

  /// None when the deadline has passed; without one it waits without limit.
  std::optional<Result<T>> wait(std::optional<Poller::Time> deadline) QUARVEL_EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    while (!result_) {
      if (!deadline) {
        given_.wait(mutex_);
      } else if (!given_.waitUntil(mutex_, *deadline)) {
        break;
      }
    }
    return std::move(result_);
  }

 private:
  mutable Mutex mutex_;
  ConditionVariable given_;
  std::optional<Result<T>> result_ QUARVEL_GUARDED_BY(mutex_);
};

}  // namespace

Client::Client(std::shared_ptr<Channel> channel) : channel_(std::move(channel)) {}
Client::Client(Client&& other) noexcept = default;
Client& Client::operator=(Client&& other) noexcept {
  if (this != &other) {
    if (channel_) channel_->close();
    channel_ = std::move(other.channel_);
  }
  return *this;
}
Client::~Client() {
  if (channel_) channel_->close();
}

bool Client::connected() const {
  return channel_->connected();
}

int Client::descriptor() const {
  return channel_->descriptor();
}

Client::Code Client::dispatch(std::optional<std::chrono::milliseconds> wait) {
  const std::shared_ptr<Channel> channel = channel_;  // a reply may destroy the client
  return channel->dispatch(Channel::DeadlineAfter(wait));
}

Client::Code Client::createReportingSession(ReporterID reporterID, Reply<bool> reply) {
  return channel_->send(operations::Create(reporterID), std::move(reply)).code;
}

Client::Code Client::setServiceType(ServiceType serviceType, ReporterID reportingSession,
                                    Reply<bool> reply) {
  return channel_->send(operations::SetServiceType(serviceType, reportingSession), std::move(reply))
      .code;
}

Client::Code Client::getServiceNameForReporterID(ReporterID reporterID, Reply<ServiceType> reply) {
  return channel_->send(operations::GetServiceName(reporterID), std::move(reply)).code;
}

Client::Code Client::setConfiguration(PayloadArgument configuration, ReporterID reporterID,
                                      Reply<bool> reply) {
  return channel_->send(operations::SetConfiguration(configuration, reporterID), std::move(reply))
      .code;
}

Client::Code Client::startReportingSessionForID(ReporterID reporterID, Reply<bool> stopped) {
  return channel_->send(operations::Start(reporterID), std::move(stopped)).code;
}

Client::Code Client::sendMessage(PayloadArgument payload, Category category, MessageType type,
                                 Recipients reportingIDs, Reply<std::monostate> reply) {
  return channel_
      ->send(operations::SendMessage(payload, category, type, reportingIDs), std::move(reply))
      .code;
}

Client::Code Client::stopReportingSessionForID(ReporterID reporterID, Reply<bool> reply) {
  return channel_->send(operations::Stop(reporterID), std::move(reply)).code;
}

Client::Code Client::destroyReportingSession(ReporterID reporterID, Reply<bool> reply) {
  return channel_->send(operations::Destroy(reporterID), std::move(reply)).code;
}

Client::Code Client::reporterID(ReporterID reporterID, Reply<Validity> valid) {
  return channel_->send(operations::Valid(reporterID), std::move(valid)).code;
}

Client::Code Client::getAllReporters(Reply<std::vector<ReporterID>> reply) {
  return channel_->send(operations::GetAllReporters(), std::move(reply)).code;
}

Client::Code Client::killService(Reply<bool> reply) {
  return channel_->send(operations::KillService(), std::move(reply)).code;
}

Client::Code Client::call(std::string_view operation, std::span<const Value> arguments,
                          Reply<Value> reply) {
  return channel_->send(operations::AnyRequest{operation, arguments, {}}, std::move(reply)).code;
}

Client::Batch::Batch(Client& client) : channel_(client.channel_) {
  channel_->beginBatch();
}
Client::Batch::~Batch() {
  channel_->endBatch();
}

Client::Synchronous Client::sync(std::optional<std::chrono::milliseconds> timeout) {
  return {*this, timeout};
}

template <class T, class Request>
Result<T> Client::Synchronous::ask(const Request& request) {
  const std::shared_ptr<Channel> channel = client_.channel_;  // see `dispatch`
  const auto deadline = Channel::DeadlineAfter(timeout_);
  if (channel->onDriver()) {
    return Failure(Code::wouldDeadlock,
                   "A reply cannot wait for another reply; use the asynchronous form there.");
  }
  const auto awaited = std::make_shared<Awaited<T>>();
  const Channel::Sent sent = channel->send(
      request, Reply<T>([awaited](Result<T> result) { awaited->set(std::move(result)); }));
  channel->flush();
  if (channel->descriptor() >= 0) {
    const bool driven = channel->driveUntil([&] { return awaited->given(); }, deadline);
    if (!driven && !awaited->given()) {
      if (sent.call) channel->forget(*sent.call);
      return Failure(Code::wouldDeadlock, "Another thread dispatches; use the asynchronous form.");
    }
  }
  if (auto result = awaited->wait(deadline)) return *std::move(result);
  if (sent.call) channel->forget(*sent.call);
  return Failure(Code::timedOut, "The service has not replied in time.");
}

Result<bool> Client::Synchronous::createReportingSession(ReporterID reporterID) {
  return ask<bool>(operations::Create(reporterID));
}

Result<bool> Client::Synchronous::setServiceType(ServiceType serviceType,
                                                 ReporterID reportingSession) {
  return ask<bool>(operations::SetServiceType(serviceType, reportingSession));
}

Result<Client::ServiceType> Client::Synchronous::getServiceNameForReporterID(
    ReporterID reporterID) {
  return ask<ServiceType>(operations::GetServiceName(reporterID));
}

Result<bool> Client::Synchronous::setConfiguration(PayloadArgument configuration,
                                                   ReporterID reporterID) {
  return ask<bool>(operations::SetConfiguration(configuration, reporterID));
}

Result<bool> Client::Synchronous::startReportingSessionForID(ReporterID reporterID,
                                                             Reply<bool> stopped) {
  client_.startReportingSessionForID(reporterID, std::move(stopped));
  auto validity = this->reporterID(reporterID);
  if (!validity) return std::move(validity.error());
  return validity.value().valid();
}

Outcome Client::Synchronous::sendMessage(PayloadArgument payload, Category category,
                                         MessageType type, Recipients reportingIDs) {
  return ask<std::monostate>(operations::SendMessage(payload, category, type, reportingIDs));
}

Result<bool> Client::Synchronous::stopReportingSessionForID(ReporterID reporterID) {
  return ask<bool>(operations::Stop(reporterID));
}

Result<bool> Client::Synchronous::destroyReportingSession(ReporterID reporterID) {
  return ask<bool>(operations::Destroy(reporterID));
}

Result<Client::Validity> Client::Synchronous::reporterID(ReporterID reporterID) {
  return ask<Validity>(operations::Valid(reporterID));
}

Result<std::vector<ReporterID>> Client::Synchronous::getAllReporters() {
  return ask<std::vector<ReporterID>>(operations::GetAllReporters());
}

Outcome Client::Synchronous::killService() {
  auto killed = ask<bool>(operations::KillService());
  if (killed) {
    return Failure(Code::unexpectedReply, "The service replied instead of ending.");
  }
  const Error& error = killed.error();
  const bool gone =
      error.domain == kErrorDomain && error.code == static_cast<std::int64_t>(Code::connectionLost);
  if (gone) return Success();
  return error;
}

Result<Value> Client::Synchronous::call(std::string_view operation,
                                        std::span<const Value> arguments) {
  return ask<Value>(operations::AnyRequest{operation, arguments, {}});
}

}  // namespace quarvel
