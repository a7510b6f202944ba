#include <quarvel/client.hpp>

#include <concepts>
#include <type_traits>
#include <utility>

#include "client/Channel.h"
#include "client/Failure.h"

namespace quarvel {
namespace {

constexpr std::string_view kCreate = "createReportingSession:reply:";
constexpr std::string_view kSetServiceType = "setServiceType:reportingSession:reply:";
constexpr std::string_view kGetServiceName = "getServiceNameForReporterID:reply:";
constexpr std::string_view kSetConfiguration = "setConfiguration:forReporterID:reply:";
constexpr std::string_view kStart = "startReportingSessionForID:reply:";
constexpr std::string_view kSendMessage = "sendMessage:withCategory:andType:forReportingIDs:reply:";
constexpr std::string_view kStop = "stopReportingSessionForID:reply:";
constexpr std::string_view kDestroy = "destroyReportingSession:reply:";
constexpr std::string_view kValid = "reporterID:valid:";
constexpr std::string_view kGetAll = "getAllReporters:";
constexpr std::string_view kKill = "killService:";

template <std::integral Integer>
void Write(MessagePackWriter& writer, Integer number) {
  writer.integer(number);
}
template <class Enumeration>
requires std::is_enum_v<Enumeration>
void Write(MessagePackWriter& writer, Enumeration code) {
  writer.integer(static_cast<std::underlying_type_t<Enumeration>>(code));
}
void Write(MessagePackWriter& writer, vocabulary::Category category) {
  writer.integer(category.code);
}
void Write(MessagePackWriter& writer, const PayloadArgument& argument) {
  if (argument.payload() != nullptr) {
    writer.encoded(argument.payload()->encoded());
  } else if (argument.dictionary() != nullptr) {
    writer.value(*argument.dictionary());
  } else {
    writer.nil();
  }
}
void Write(MessagePackWriter& writer, const Recipients& recipients) {
  if (!recipients.sessions()) return writer.nil();
  writer.list(recipients.sessions()->size());
  for (const ReporterID session : *recipients.sessions()) writer.integer(session);
}

// A reply that is an empty function is none: the call becomes a notification.
template <class T, class AnyReply>
AnyReply Wanted(Client::Reply<T> reply) {
  if (!reply) return {};
  return reply;
}

/// A reply that a thread waits for.
template <class T>
class Awaited {
 public:
  void set(Result<T> result) QUARVEL_EXCLUDES(mutex_) {
    MutexLock lock(mutex_);
    result_ = std::move(result);
    given_.notifyAll();
  }

  /// None when the time is over.
  std::optional<Result<T>> wait(std::optional<std::chrono::milliseconds> timeout)
      QUARVEL_EXCLUDES(mutex_) {
    const auto deadline =
        timeout ? std::optional(std::chrono::steady_clock::now() + *timeout) : std::nullopt;
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
  Mutex mutex_;
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

template <class T, class... Arguments>
std::optional<std::uint32_t> Client::send(std::string_view operation, Reply<T> reply,
                                          const Arguments&... arguments) {
  return channel_->send(operation, Wanted<T, Channel::AnyReply>(std::move(reply)),
                        sizeof...(arguments),
                        [&](MessagePackWriter& writer) { (Write(writer, arguments), ...); });
}

void Client::createReportingSession(ReporterID reporterID, Reply<bool> reply) {
  send(kCreate, std::move(reply), reporterID);
}

void Client::setServiceType(ServiceType serviceType, ReporterID reportingSession,
                            Reply<bool> reply) {
  send(kSetServiceType, std::move(reply), serviceType, reportingSession);
}

void Client::getServiceNameForReporterID(ReporterID reporterID, Reply<ServiceType> reply) {
  send(kGetServiceName, std::move(reply), reporterID);
}

void Client::setConfiguration(PayloadArgument configuration, ReporterID reporterID,
                              Reply<bool> reply) {
  send(kSetConfiguration, std::move(reply), configuration, reporterID);
}

void Client::startReportingSessionForID(ReporterID reporterID, Reply<bool> stopped) {
  send(kStart, std::move(stopped), reporterID);
}

void Client::sendMessage(PayloadArgument payload, Category category, MessageType type,
                         Recipients reportingIDs, Reply<std::monostate> reply) {
  send(kSendMessage, std::move(reply), payload, category, type, reportingIDs);
}

void Client::stopReportingSessionForID(ReporterID reporterID, Reply<bool> reply) {
  send(kStop, std::move(reply), reporterID);
}

void Client::destroyReportingSession(ReporterID reporterID, Reply<bool> reply) {
  send(kDestroy, std::move(reply), reporterID);
}

void Client::reporterID(ReporterID reporterID, Reply<Validity> valid) {
  send(kValid, std::move(valid), reporterID);
}

void Client::getAllReporters(Reply<std::vector<ReporterID>> reply) {
  send(kGetAll, std::move(reply));
}

void Client::killService(Reply<bool> reply) {
  send(kKill, std::move(reply));
}

void Client::call(std::string_view operation, std::span<const Value> arguments,
                  Reply<Value> reply) {
  sendValues(operation, std::move(reply), arguments);
}

std::optional<std::uint32_t> Client::sendValues(std::string_view operation, Reply<Value> reply,
                                                std::span<const Value> arguments) {
  return channel_->send(operation, Wanted<Value, Channel::AnyReply>(std::move(reply)),
                        arguments.size(), [arguments](MessagePackWriter& writer) {
                          for (const Value& argument : arguments) writer.value(argument);
                        });
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

template <class T, class Send>
Result<T> Client::Synchronous::wait(Send&& send) {
  Channel& channel = *client_.channel_;
  if (channel.onReaderThread()) {
    return Failure(Code::wouldDeadlock,
                   "A reply cannot wait for another reply; use the asynchronous form there.");
  }
  const auto awaited = std::make_shared<Awaited<T>>();
  const auto call = send([awaited](Result<T> result) { awaited->set(std::move(result)); });
  channel.sendGathered();
  if (auto result = awaited->wait(timeout_)) return *std::move(result);
  channel.forget(*call);
  return Failure(Code::timedOut, "The service has not replied in time.");
}

template <class T, class... Arguments>
Result<T> Client::Synchronous::ask(std::string_view operation, const Arguments&... arguments) {
  return wait<T>(
      [&](Reply<T> reply) { return client_.send<T>(operation, std::move(reply), arguments...); });
}

Result<bool> Client::Synchronous::createReportingSession(ReporterID reporterID) {
  return ask<bool>(kCreate, reporterID);
}

Result<bool> Client::Synchronous::setServiceType(ServiceType serviceType,
                                                 ReporterID reportingSession) {
  return ask<bool>(kSetServiceType, serviceType, reportingSession);
}

Result<Client::ServiceType> Client::Synchronous::getServiceNameForReporterID(
    ReporterID reporterID) {
  return ask<ServiceType>(kGetServiceName, reporterID);
}

Result<bool> Client::Synchronous::setConfiguration(PayloadArgument configuration,
                                                   ReporterID reporterID) {
  return ask<bool>(kSetConfiguration, configuration, reporterID);
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
  return ask<std::monostate>(kSendMessage, payload, category, type, reportingIDs);
}

Result<bool> Client::Synchronous::stopReportingSessionForID(ReporterID reporterID) {
  return ask<bool>(kStop, reporterID);
}

Result<bool> Client::Synchronous::destroyReportingSession(ReporterID reporterID) {
  return ask<bool>(kDestroy, reporterID);
}

Result<Client::Validity> Client::Synchronous::reporterID(ReporterID reporterID) {
  return ask<Validity>(kValid, reporterID);
}

Result<std::vector<ReporterID>> Client::Synchronous::getAllReporters() {
  return ask<std::vector<ReporterID>>(kGetAll);
}

Outcome Client::Synchronous::killService() {
  auto killed = ask<bool>(kKill);
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
  return wait<Value>([&](Reply<Value> reply) {
    return client_.sendValues(operation, std::move(reply), arguments);
  });
}

}  // namespace quarvel
