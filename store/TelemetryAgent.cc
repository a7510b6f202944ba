#include "store/TelemetryAgent.h"

#include <fmt/format.h>

#include <cmath>
#include <optional>
#include <string_view>
#include <utility>

#include "platform/WorkQueue.h"

namespace quarvel {

namespace {

std::int64_t IntegerIn(const Dictionary& dictionary, const char* key, std::int64_t otherwise) {
  const Value* value = dictionary.find(key);
  return value != nullptr && value->integer() != nullptr ? *value->integer() : otherwise;
}

double RealIn(const Dictionary& dictionary, const char* key) {
  const Value* value = dictionary.find(key);
  const double* real = value != nullptr ? value->real() : nullptr;
  return real != nullptr && std::isfinite(*real) ? *real : 0;
}

bool BooleanIn(const Dictionary& dictionary, const char* key) {
  const Value* value = dictionary.find(key);
  return value != nullptr && value->boolean() != nullptr && *value->boolean();
}

std::string_view TextIn(const Dictionary& dictionary, const char* key) {
  const Value* value = dictionary.find(key);
  return value != nullptr && value->string() != nullptr ? std::string_view(*value->string())
                                                        : std::string_view();
}

Outcome HandOver(TelemetryStore& store, const TelemetryStore::Message& message) {
  Outcome taken = store.addMessage(message);
  store.countQueued();
  return taken;
}

}  // namespace

class TelemetryAgent::Session final : public RelmReportingSession {
 public:
  Session(std::shared_ptr<const Core> core, const Dictionary& sessionInfo,
          const Dictionary& userInfo)
      : core_(std::move(core)),
        sessionID_(IntegerIn(sessionInfo, kRelmReportingSessionInfoSessionID, -1)),
        clientName_(TextIn(userInfo, kRelmReportingUserInfoClientName)),
        serviceName_(TextIn(userInfo, kRelmReportingUserInfoServiceName)),
        id_(core_->store->addAgentSession(
            {sessionID_, IntegerIn(sessionInfo, kRelmReportingSessionInfoClientType, 0),
             RealIn(sessionInfo, kRelmReportingSessionInfoClientVersion),
             BooleanIn(sessionInfo, kRelmReportingSessionInfoBatchEvent),
             TextIn(sessionInfo, kRelmReportingSessionInfoHierarchyToken), clientName_,
             serviceName_, Payload(userInfo)})) {}

  void startConfiguration(ConfigurationCompletion completion) override {
    core_->completions->async([core = core_, completion = std::move(completion)] {
      // The store is the queue of every backend: a remote engine that is down has a backlog.
      const bool found = core->store->isOpen() && !core->backends.empty();
      completion(found ? std::optional(core->backends) : std::nullopt);
    });
  }

  Outcome agentSendMessage(std::uint16_t category, std::uint16_t type,
                           const Payload& payload) override {
    // After refusing the session the store is closed, and counts this message as refused too.
    return HandOver(*core_->store, {id_ ? std::optional(id_.value()) : std::nullopt, sessionID_,
                                    clientName_, serviceName_, category, type, payload});
  }

  void flushMessages(FlushCompletion completion) override {
    const Outcome begun = id_ ? core_->store->flush(id_.value(), completion) : id_.error();
    if (begun) return;
    core_->completions->async(
        [error = begun.error(), completion = std::move(completion)] { completion(error); });
  }

  [[nodiscard]] std::string description() const override {
    return fmt::format("<RelmReportingSession {} of {}>",
                       id_ ? fmt::to_string(id_.value()) : "refused", sessionID_);
  }

 private:
  const std::shared_ptr<const Core> core_;
  const std::int64_t sessionID_;
  const std::string clientName_;
  const std::string serviceName_;
  const Result<std::int64_t> id_;  // in the store
};

TelemetryAgent::TelemetryAgent(std::shared_ptr<TelemetryStore> store,
                               std::vector<std::string> backends)
    // A queue of its own: on the sessions' queues completions would wait behind the sessions that
    // wait for them.
    : core_(std::make_shared<const Core>(
          Core{std::move(store), std::move(backends),
               CreateSerialQueue("tarnwick.quarvel.agent", QualityOfService::userInteractive)})) {}

std::shared_ptr<RelmReportingSession> TelemetryAgent::createAgentSession(
    const Dictionary& sessionInfo, const Dictionary& userInfo) {
  return std::make_shared<Session>(core_, sessionInfo, userInfo);
}

Outcome TelemetryAgent::sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                                       std::uint16_t category, std::uint16_t type,
                                       const Payload& payload) {
  return HandOver(*core_->store,
                  {std::nullopt, IntegerIn(sessionInfo, kRelmReportingSessionInfoSessionID, -1),
                   TextIn(userInfo, kRelmReportingUserInfoClientName),
                   TextIn(userInfo, kRelmReportingUserInfoServiceName), category, type, payload});
}

}  // namespace quarvel
