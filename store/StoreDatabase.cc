#include "store/StoreDatabase.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>
#include <variant>

#include "base/Json.h"
#include "platform/Log.h"
#include "store/database/Salvage.h"
#include "store/database/StoreFile.h"

namespace quarvel {

namespace {

constexpr std::size_t kKeptJson = 1 << 20;
constexpr int kIDParameter = 1;  // of `InsertSql`
// A log this many times as long as `logPages` is restarted while new readers wait.
constexpr int kLogsBeforeRestart = 4;
constexpr int kFewPages = 16;  // a rest of at most `logPages` / 16, 64 pages by default, is short
constexpr std::uint64_t kLogPageBytes = 4096;

/// The bound of the file, and at least 16 times `logPages`, for slow readers.
int LongestLogPages(const StoreDatabase::Options& options) {
  const std::uint64_t pages = options.bounds.maximumBytes / kLogPageBytes;
  const auto least = static_cast<std::uint64_t>(options.logPages) * 16;
  return static_cast<int>(std::clamp<std::uint64_t>(pages, least, 1 << 30));
}

constexpr const char* kMoveCursor =
    "INSERT INTO backend_cursor SELECT ?1, ?2, ?3"
    " WHERE (SELECT value FROM meta WHERE key = 'store_id') = ?4"
    " ON CONFLICT DO UPDATE SET exported_through = excluded.exported_through";
// About eight megabytes of lines: years of a busy device.
constexpr const char* kTrimLedger =
    "DELETE FROM export_log WHERE id <= (SELECT max(id) FROM export_log) - 100000";

std::int64_t Microseconds(Date date) {
  return date.time_since_epoch().count();
}

void Write(const StoreNotices& notices) {
  for (const StoreNotice& notice : notices) {
    if (!ZQLogEnabled(LogLevel::error, nullptr)) continue;
    ZQLogWrite(nullptr, LogLevel::error, __FILE_NAME__, __LINE__, notice.function, notice.text);
  }
}

}  // namespace

Result<std::unique_ptr<StoreDatabase>> StoreDatabase::open(const Options& options, Date now,
                                                           bool isSuspect) {
  StoreNotices notices;
  Result<SqliteConnection> connection = OpenStore(options.path, now, isSuspect, notices);
  Write(notices);
  if (!connection) return connection.error();
  std::unique_ptr<StoreDatabase> database(
      new StoreDatabase(std::move(connection.value()), options));
  if (database->prepare(options, now)) return database;
  if (database->isCorrupt() && !isSuspect) {
    database.reset();
    return open(options, now, true);
  }
  return StoreError(StoreErrorCode::failed,
                    fmt::format("The telemetry store {} cannot be read: {}.", options.path.string(),
                                database->message()));
}

StoreDatabase::StoreDatabase(SqliteConnection connection, const Options& options)
    : connection_(std::move(connection)),
      logPages_(options.logPages),
      longestLogPages_(LongestLogPages(options)),
      retention_(options.bounds, connection_, committedIDs_),
      path_(options.path) {}

StoreDatabase::~StoreDatabase() {
  waitForSync();
  syncer_.reset();
  // Another store's log may have the name of the log of a file that is gone.
  if (!isCorrupt() && !fileIsGone()) connection_.checkpointAtClose();
}

bool StoreDatabase::prepare(const Options& options, Date now) {
  for (const StoreTable table : kAllStoreTables) {
    if (!connection_.prepare(inserts_[table], InsertSql(Describe(table)))) return false;
  }
  return connection_.prepare(begin_, "BEGIN IMMEDIATE") && connection_.prepare(commit_, "COMMIT") &&
         connection_.prepare(markFlushed_,
                             "UPDATE agent_session SET flushed_at = ?2 WHERE id = ?1") &&
         connection_.prepare(keepDrops_, "INSERT OR REPLACE INTO meta VALUES(?1, ?2)") &&
         connection_.prepare(moveCursor_, kMoveCursor) &&
         connection_.prepare(writeLedger_, InsertSql(kExportLogTable)) &&
         connection_.prepare(trimLedger_, kTrimLedger) && readLastIDs() && addKnown(options) &&
         retention_.prepare(now);
}

bool StoreDatabase::addKnown(const Options& options) {
  const bool knowsAll = std::ranges::all_of(kAllStoreTables, [&](StoreTable table) {
    return committedIDs_[table] >= options.knownIDs[table];
  });
  if (knowsAll) return true;
  StoreDrops drops;
  for (const StoreDrop reason : {StoreDrop::retention, StoreDrop::erased}) {
    drops[reason] = std::max(dropsAtOpening_[reason], options.knownDrops[reason]);
  }
  return SettleAccounts(connection_, options.knownIDs, drops) && readLastIDs();
}

bool StoreDatabase::readLastIDs() {
  storeID_ = connection_.text("SELECT value FROM meta WHERE key = 'store_id'").value_or("");
  for (const StoreTable table : kAllStoreTables) {
    const auto lastID = connection_.integer(LastIDSql(table));
    if (!lastID) return false;
    committedIDs_[table] = *lastID;
  }
  lastIDs_ = committedIDs_;
  std::int64_t stored = 0;
  for (const StoreTable table : kCountedStoreTables) stored += committedIDs_[table];
  for (std::size_t i = 0; i < kStoreDrops; ++i) {
    const auto reason = static_cast<StoreDrop>(i);
    const auto dropped = connection_.integer(
        fmt::format("SELECT max(ifnull((SELECT CAST(value AS INTEGER) FROM meta WHERE key = '{}'),"
                    " 0), 0)",
                    StoreDropKey(reason)));
    if (!dropped) return false;
    dropsAtOpening_[reason] = static_cast<std::uint64_t>(*dropped);
    if (std::ranges::find(kDropsFromStore, reason) != kDropsFromStore.end()) stored -= *dropped;
  }
  storedAtOpening_ = static_cast<std::uint64_t>(std::max(stored, std::int64_t{0}));
  keptDrops_ = dropsAtOpening_;
  return true;
}

bool StoreDatabase::write(const StoreBatch& batch, std::size_t first, std::size_t last,
                          Synchronous synchronous, Date now, const StoreDrops& drops) {
  now_ = Microseconds(now);
  bool changesFile = false;
  const bool isAtItsLongest = connection_.logPages() >= longestLogPages_;
  if (synchronous == Synchronous::full || isAtItsLongest) waitForSync();
  if (connection_.logSyncFailed() && !sync()) return false;
  logIsTooLong_ = isAtItsLongest && !connection_.restartLog();
  if (logIsTooLong_) return false;
  bool written = begin(synchronous);
  for (std::size_t i = first; written && i < last; ++i) {
    written =
        std::visit([this, &batch](const auto& row) { return insert(batch, row); }, batch.rows()[i]);
    changesFile = changesFile || connection_.changes() > 0;
  }
  if (written && keepDrops(drops) && commit_.run()) {
    committedIDs_ = lastIDs_;
    keptDrops_ = drops;
    // A commit without changes, as of a flush whose session is gone, syncs nothing.
    return changesFile || synchronous == Synchronous::normal || sync();
  }
  connection_.rollBack();
  lastIDs_ = committedIDs_;
  return false;
}

bool StoreDatabase::begin(Synchronous synchronous) {
  if (synchronous != synchronous_) {
    if (!connection_.execute(synchronous == Synchronous::full ? "PRAGMA synchronous = FULL"
                                                              : "PRAGMA synchronous = NORMAL")) {
      return false;
    }
    synchronous_ = synchronous;
  }
  return begin_.run();
}

bool StoreDatabase::insert(const StoreBatch& batch, const AgentSessionRow& row) {
  constexpr const TableDescription& kTable = kAgentSessionTable;
  const std::int64_t id = storedID(row.id);
  std::int64_t& lastID = lastIDs_[StoreTable::agentSession];
  lastID = std::max(lastID, id);
  return inserts_[StoreTable::agentSession]
      .bind(kIDParameter, id)
      .bind(ParameterOf(kTable, "session_id"), row.sessionID)
      .bind(ParameterOf(kTable, "client_type"), row.clientType)
      .bind(ParameterOf(kTable, "client_version"), row.clientVersion)
      .bind(ParameterOf(kTable, "batch_event"), std::int64_t{row.batchEvent})
      .bind(ParameterOf(kTable, "hierarchy_token"),
            batch.text(row.texts[AgentSessionRow::hierarchyToken]))
      .bind(ParameterOf(kTable, "client_name"), batch.text(row.texts[AgentSessionRow::clientName]))
      .bind(ParameterOf(kTable, "service_name"),
            batch.text(row.texts[AgentSessionRow::serviceName]))
      .bind(ParameterOf(kTable, "user_info"), json(row.userInfo))
      .bind(ParameterOf(kTable, "opened_at"), Microseconds(row.openedAt))
      .run();
}

bool StoreDatabase::insert(const StoreBatch& batch, const MessageRow& row) {
  constexpr const TableDescription& kTable = kMessageTable;
  SqliteStatement& insert = inserts_[StoreTable::message];
  if (row.agentSession) {
    insert.bind(ParameterOf(kTable, "agent_session"), storedID(*row.agentSession));
  } else {
    insert.bind(ParameterOf(kTable, "agent_session"), nullptr);
  }
  return insert.bind(kIDParameter, ++lastIDs_[StoreTable::message])
      .bindSteady(ParameterOf(kTable, "session_id"), row.sessionID)
      .bindSteady(ParameterOf(kTable, "client_name"), batch.text(row.texts[MessageRow::clientName]))
      .bindSteady(ParameterOf(kTable, "service_name"),
                  batch.text(row.texts[MessageRow::serviceName]))
      .bindSteady(ParameterOf(kTable, "category"), std::int64_t{row.category})
      .bindSteady(ParameterOf(kTable, "type"), std::int64_t{row.type})
      .bind(ParameterOf(kTable, "payload"), json(row.payload))
      .bind(ParameterOf(kTable, "sent_at"), Microseconds(row.sentAt))
      .run();
}

bool StoreDatabase::insert(const StoreBatch& batch, const AnalyticsEventRow& row) {
  constexpr const TableDescription& kTable = kAnalyticsEventTable;
  return inserts_[StoreTable::analyticsEvent]
      .bind(kIDParameter, ++lastIDs_[StoreTable::analyticsEvent])
      .bindSteady(ParameterOf(kTable, "name"), batch.text(row.texts[AnalyticsEventRow::name]))
      .bind(ParameterOf(kTable, "payload"), json(row.payload))
      .bind(ParameterOf(kTable, "recorded_at"), Microseconds(row.recordedAt))
      .run();
}

bool StoreDatabase::insert(const StoreBatch& batch, const PowerEventRow& row) {
  constexpr const TableDescription& kTable = kPowerEventTable;
  return inserts_[StoreTable::powerEvent]
      .bind(kIDParameter, ++lastIDs_[StoreTable::powerEvent])
      .bind(ParameterOf(kTable, "domain"), std::int64_t{row.domain})
      .bind(ParameterOf(kTable, "name"), batch.text(row.texts[PowerEventRow::name]))
      .bind(ParameterOf(kTable, "payload"), json(row.payload))
      .bind(ParameterOf(kTable, "recorded_at"), Microseconds(row.recordedAt))
      .run();
}

bool StoreDatabase::insert(const StoreBatch&, const FlushRow& row) {
  return markFlushed_.bind(1, storedID(row.agentSession)).bind(2, now_).run();
}

bool StoreDatabase::keepDrops(const StoreDrops& drops) {
  return std::ranges::all_of(kDropsBeforeStore, [&](StoreDrop reason) {
    if (drops[reason] == keptDrops_[reason]) return true;
    const std::string key = StoreDropKey(reason);
    return keepDrops_.bind(1, key).bind(2, static_cast<std::int64_t>(drops[reason])).run();
  });
}

bool StoreDatabase::insert(const StoreBatch&, const ExportedRow& row) {
  constexpr const TableDescription& kLedger = kExportLogTable;
  const ExportRecord& record = row.record;
  const char* const table = StoreTableName(record.table);
  // A record about a store that was set aside meanwhile changes nothing: its ids meant other rows.
  const bool moved = moveCursor_.bind(1, record.backend)
                         .bind(2, table)
                         .bind(3, record.lastID)
                         .bind(4, record.storeID)
                         .run();
  if (!moved || connection_.changes() == 0) return moved;
  for (const ExportRecord::Line& line : record.lines) {
    if (!writeLedger_.bind(kIDParameter, nullptr)
             .bind(ParameterOf(kLedger, "backend"), record.backend)
             .bind(ParameterOf(kLedger, "table_name"), table)
             .bind(ParameterOf(kLedger, "first_id"), line.firstID)
             .bind(ParameterOf(kLedger, "last_id"), line.lastID)
             .bind(ParameterOf(kLedger, "rows"), line.rows)
             .bind(ParameterOf(kLedger, "bytes"), line.bytes)
             .bind(ParameterOf(kLedger, "outcome"), line.outcome)
             .bind(ParameterOf(kLedger, "at"), now_)
             .run()) {
      return false;
    }
  }
  return trimLedger_.run();
}

Outcome StoreDatabase::restoreFile(const std::filesystem::path& path, Date now) {
  const Result<std::filesystem::path> place = MakePlaceFor(path, now);
  if (!place) return place.error();
  if (connection_.copyTo(place.value())) return SyncStoreFile(place.value());
  return StoreError(StoreErrorCode::failed, connection_.message());
}

std::int64_t StoreDatabase::storedID(std::int64_t session) const {
  if (session < kProvisionalSessions) return session;
  return session - kProvisionalSessions + provisionalSessionsAfter_;
}

Error StoreDatabase::error() const {
  const bool full = connection_.fault() == SqliteFault::diskFull;
  return StoreError(full ? StoreErrorCode::diskFull : StoreErrorCode::failed, message());
}

std::string StoreDatabase::message() const {
  if (connection_.logSyncFailed()) return "the write-ahead log cannot be synced";
  if (logIsTooLong_) {
    return "a program reads the store in one transaction for so long that its log has grown as "
           "large as the store may be; end it";
  }
  return connection_.message();
}

std::string_view StoreDatabase::json(const Payload& payload) {
  json_.clear();
  if (json_.capacity() > kKeptJson) json_.shrink_to_fit();
  AppendJson(json_, payload.root());
  return json_;
}

bool StoreDatabase::sync() {
  waitForSync();
  return connection_.syncLog();
}

void StoreDatabase::checkpoint() {
  waitForSync();
  connection_.checkpoint();
}

bool StoreDatabase::beginCheckpointIfDue() {
  const int logPages = connection_.logPages();
  if (logPages < checkpointedPages_) {
    // The log has begun again.
    checkpointedPages_ = movedPages_ = 0;
    isCatchingUp_ = false;
  }
  const int left = logPages - movedPages_;
  if (left <= 0) isCatchingUp_ = false;
  if (!isCatchingUp_ && logPages - checkpointedPages_ < logPages_) return false;
  checkpointedPages_ = logPages;
  // The writer moves a short rest itself: no row is added meanwhile, so the log can begin again. It
  // also restarts a log that readers have kept from that until it is several times as long: new
  // readers wait for it.
  const bool isLittle = isCatchingUp_ && left <= std::max(logPages_ / kFewPages, 1);
  if (isLittle || logIsLong()) {
    inFlight_ = {committedIDs_, std::nullopt, StoreSyncer::Task::checkpoint};
    runTaskHere();
  } else {
    beginTask(StoreSyncer::Task::checkpoint);
  }
  return true;
}

bool StoreDatabase::logIsLong() const {
  return connection_.logPages() >= logPages_ * kLogsBeforeRestart;
}

void StoreDatabase::beginTask(StoreSyncer::Task task) {
  inFlight_ = {committedIDs_, std::nullopt, task};
  // After a failed sync only the writer's connection can rewrite the log.
  const bool here = connection_.logSyncFailed();
  if (!here && !syncer_) syncer_ = StoreSyncer::open(path_, connection_, onSyncDone_);
  if (!here && syncer_) {
    syncer_->begin(task);
  } else {
    runTaskHere();
  }
}

void StoreDatabase::runTaskHere() {
  const StoreSyncer::Task task = inFlight_->task;
  StoreSyncer::TaskResult result{task, false, false, connection_.logPages()};
  if (task == StoreSyncer::Task::sync) {
    result.durable = connection_.syncLog();
  } else if (logIsLong()) {
    result.durable = connection_.restartLog();
  } else {
    const SqliteConnection::Checkpoint checkpoint = connection_.checkpoint();
    result.durable = checkpoint.complete;
    result.movedPages = checkpoint.pages;
  }
  result.logSyncFailed = connection_.logSyncFailed();
  taskEnded(result);
}

void StoreDatabase::taskEnded(const StoreSyncer::TaskResult& result) {
  inFlight_->result = result;
  if (result.task == StoreSyncer::Task::checkpoint) {
    movedPages_ = std::max(result.movedPages, 0);
    isCatchingUp_ = result.durable;
  }
  if (!result.logSyncFailed) return;
  connection_.noteLogSyncFailure();
  // Its connection would not learn that the log has been rewritten.
  syncer_.reset();
}

void StoreDatabase::waitForSync() {
  if (!inFlight_ || inFlight_->result) return;
  syncer_->wait();
  if (const auto result = syncer_->takeResult()) taskEnded(*result);
}

std::optional<StoreDatabase::SyncResult> StoreDatabase::takeSyncResult() {
  if (!inFlight_) return std::nullopt;
  if (!inFlight_->result) {
    const auto result = syncer_->takeResult();
    if (!result) return std::nullopt;
    taskEnded(*result);
  }
  const StoreSyncer::TaskResult& result = *inFlight_->result;
  const SyncResult taken{result.durable, inFlight_->ids,
                         result.task == StoreSyncer::Task::sync && !result.durable};
  inFlight_.reset();
  return taken;
}

}  // namespace quarvel
