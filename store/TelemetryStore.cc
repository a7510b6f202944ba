#include "store/TelemetryStore.h"

#include <pthread.h>

#include <utility>

#include "store/StoreDatabase.h"
#include "store/StoreWriter.h"
#include "store/database/StoreFile.h"

namespace quarvel {

namespace {

Date SystemDate() {
  return std::chrono::floor<std::chrono::microseconds>(std::chrono::system_clock::now());
}

/// Whether the reason for which the file cannot be opened may go away by itself.
bool MayPass(const Error& error) {
  return error.code == static_cast<std::int64_t>(StoreErrorCode::diskFull) ||
         error.code == static_cast<std::int64_t>(StoreErrorCode::failed);
}

}  // namespace

Result<std::unique_ptr<TelemetryStore>> TelemetryStore::open(Options options) {
  if (!options.clock) options.clock = SystemDate;
  const StoreWriter::Options writerOptions{
      {options.path, {options.maximumBytes, options.remoteBackends}, options.logPages},
      options.sync,
      {options.firstBackOff, options.longestBackOff},
      options.maximumAge,
      options.ageing,
      options.clock};
  auto database = StoreDatabase::open(writerOptions.database, options.clock(), false);
  if (!database && !MayPass(database.error())) return database.error();
  std::unique_ptr<TelemetryStore> store(
      new TelemetryStore(options, database ? database.value()->lastIDs()[StoreTable::agentSession]
                                           : kProvisionalSessions));
  store->writer_ = std::make_unique<StoreWriter>(
      writerOptions, database ? std::move(database.value()) : nullptr,
      database ? std::nullopt : std::optional(database.error()), store->queue_);
  MutexLock lock(store->closing_);
  store->thread_ = std::thread([writer = store->writer_.get()] {
    pthread_setname_np(pthread_self(), "quarvel.store");
    writer->run();
  });
  return store;
}

TelemetryStore::TelemetryStore(const Options& options, std::int64_t lastAgentSession)
    : path_(options.path),
      clock_(options.clock),
      queue_(options.queueRows, options.queueBytes),
      lastAgentSession_(lastAgentSession) {}

TelemetryStore::~TelemetryStore() {
  close();
}

Result<std::int64_t> TelemetryStore::addAgentSession(const AgentSession& session) {
  const std::int64_t id = ++lastAgentSession_;
  Outcome added = queue_.pushAtOnce(
      AgentSessionRow{id, session.sessionID, session.clientType, session.clientVersion,
                      session.batchEvent, session.userInfo, clock_()},
      {session.hierarchyToken, session.clientName, session.serviceName});
  if (!added) return added.error();
  return id;
}

Outcome TelemetryStore::addMessage(const Message& message) {
  return queue_.push(MessageRow{message.agentSession, message.sessionID, message.category,
                                message.type, message.payload, clock_()},
                     {message.clientName, message.serviceName});
}

Outcome TelemetryStore::addAnalyticsEvent(std::string_view name, const Payload& payload) {
  return queue_.push(AnalyticsEventRow{payload, clock_()}, {name});
}

Outcome TelemetryStore::addPowerEvent(std::int32_t domain, std::string_view name,
                                      const Payload& payload) {
  return queue_.push(PowerEventRow{domain, payload, clock_()}, {name});
}

bool TelemetryStore::addAnalyticsEventIfRoom(std::string_view name, const Payload& payload) {
  return queue_.pushIfRoom(AnalyticsEventRow{payload, clock_()}, {name});
}

bool TelemetryStore::addPowerEventIfRoom(std::int32_t domain, std::string_view name,
                                         const Payload& payload) {
  return queue_.pushIfRoom(PowerEventRow{domain, payload, clock_()}, {name});
}

Outcome TelemetryStore::flush(std::int64_t agentSession, FlushCompletion completion) {
  return queue_.pushAtOnce(FlushRow{agentSession, std::move(completion)}, {});
}

TelemetryStore::State TelemetryStore::state() const {
  const StoreQueue::Tally outstanding = queue_.outstanding();
  return {outstanding.rows, outstanding.bytes, writer_->problem()};
}

Outcome TelemetryStore::addExport(ExportRecord record, FlushCompletion completion) {
  return queue_.pushAtOnce(ExportedRow{std::move(record), std::move(completion)}, {});
}

Outcome TelemetryStore::erase(ErasureSelection selection,
                              std::function<void(const Result<std::int64_t>&)> completion) {
  return queue_.pushAtOnce(ErasureRow{selection, std::move(completion)}, {});
}

void TelemetryStore::followDurableExtent(std::function<void(const DurableExtent&)> follower) {
  writer_->followDurableExtent(std::move(follower));
}

void TelemetryStore::close() {
  queue_.close();
  MutexLock lock(closing_);
  if (thread_.joinable()) thread_.join();
}

}  // namespace quarvel
