#include "store/StoreDatabase.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>
#include <variant>

#include "base/Json.h"
#include "store/database/Salvage.h"
#include "store/database/Schema.h"
#include "store/database/StoreError.h"
#include "store/database/StoreFile.h"

namespace quarvel {

namespace {

constexpr std::size_t kKeptJson = 1 << 20;
constexpr int kLogsBeforeRestart = 4;
constexpr int kFewPages = 16;  // the part of `logPages` that is one of them
constexpr std::uint64_t kLogPageBytes = 4096;

/// As much as the file itself, but enough for readers that take their time.
int LongestLogPages(const StoreDatabase::Options& options) {
  const std::uint64_t pages = options.bounds.maximumBytes / kLogPageBytes;
  const auto least = static_cast<std::uint64_t>(options.logPages) * 16;
  return static_cast<int>(std::clamp<std::uint64_t>(pages, least, 1 << 30));
}

constexpr const char* kMoveCursor =
    "INSERT INTO backend_cursor SELECT ?1, ?2, ?3"
    " WHERE (SELECT value FROM meta WHERE key = 'store_id') = ?4"
    " ON CONFLICT DO UPDATE SET exported_through = excluded.exported_through";
constexpr const char* kWriteLedger =
    "INSERT INTO export_log(backend, table_name, first_id, last_id, rows, bytes, outcome, at)"
    " VALUES(?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8)";
// Some eight megabytes of lines: a busy device's of years.
constexpr const char* kTrimLedger =
    "DELETE FROM export_log WHERE id <= (SELECT max(id) FROM export_log) - 100000";

std::int64_t Microseconds(Date date) {
  return date.time_since_epoch().count();
}

}  // namespace

Result<std::unique_ptr<StoreDatabase>> StoreDatabase::open(const Options& options, Date now,
                                                           bool isSuspect) {
  Result<SqliteConnection> connection = OpenStore(options.path, now, isSuspect);
  if (!connection) return connection.error();
  std::unique_ptr<StoreDatabase> database(
      new StoreDatabase(std::move(connection.value()), options));
  if (database->prepare(options, now)) return database;
  if (database->fault() == SqliteFault::corrupt && !isSuspect) {
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
  awaitMedium();
  syncer_.reset();
  // The log of a file that was taken away has a name that may be another's now.
  if (fault() != SqliteFault::corrupt && !wasTakenAway()) connection_.checkpointAtClose();
}

bool StoreDatabase::prepare(const Options& options, Date now) {
  return connection_.prepare(begin_, "BEGIN IMMEDIATE") && connection_.prepare(commit_, "COMMIT") &&
         connection_.prepare(
             insertAgentSession_,
             "INSERT INTO agent_session(id, session_id, client_type, client_version,"
             " batch_event, hierarchy_token, client_name, service_name, user_info,"
             " opened_at) VALUES(?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9, ?10)") &&
         connection_.prepare(insertMessage_,
                             "INSERT INTO message(id, agent_session, session_id, client_name,"
                             " service_name, category, type, payload, sent_at)"
                             " VALUES(?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9)") &&
         connection_.prepare(insertAnalyticsEvent_,
                             "INSERT INTO analytics_event(id, name, payload, recorded_at)"
                             " VALUES(?1, ?2, ?3, ?4)") &&
         connection_.prepare(insertPowerEvent_,
                             "INSERT INTO power_event(id, domain, name, payload, recorded_at)"
                             " VALUES(?1, ?2, ?3, ?4, ?5)") &&
         connection_.prepare(markFlushed_,
                             "UPDATE agent_session SET flushed_at = ?2 WHERE id = ?1") &&
         connection_.prepare(keepDrops_, "INSERT OR REPLACE INTO meta VALUES(?1, ?2)") &&
         connection_.prepare(moveCursor_, kMoveCursor) &&
         connection_.prepare(writeLedger_, kWriteLedger) &&
         connection_.prepare(trimLedger_, kTrimLedger) && readLastIDs() && learn(options) &&
         retention_.prepare(now);
}

bool StoreDatabase::learn(const Options& options) {
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
    const auto lastID = connection_.integer(
        fmt::format("SELECT max(ifnull((SELECT max(id) FROM {}), 0),"
                    " ifnull((SELECT CAST(value AS INTEGER) FROM meta WHERE key = '{}'), 0))",
                    StoreTableName(table), LastIDKey(table)));
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
                          Safety safety, Date now, const StoreDrops& drops) {
  now_ = Microseconds(now);
  bool changesFile = false;
  const bool isAtItsLongest = connection_.logPages() >= longestLogPages_;
  if (safety == Safety::full || isAtItsLongest) awaitMedium();
  if (connection_.logIsDoubtful() && !sync()) return false;
  logIsTooLong_ = isAtItsLongest && !connection_.restartLog();
  if (logIsTooLong_) return false;
  bool written = begin(safety);
  for (std::size_t i = first; written && i < last; ++i) {
    written =
        std::visit([this, &batch](const auto& row) { return insert(batch, row); }, batch.rows()[i]);
    changesFile = changesFile || connection_.changes() > 0;
  }
  if (written && keepDrops(drops) && commit_.run()) {
    committedIDs_ = lastIDs_;
    keptDrops_ = drops;
    // A commit of nothing, as of the flush of a session whose row is gone, syncs nothing either.
    return changesFile || safety == Safety::normal || sync();
  }
  connection_.rollBack();
  lastIDs_ = committedIDs_;
  return false;
}

bool StoreDatabase::begin(Safety safety) {
  if (safety != safety_) {
    if (!connection_.execute(safety == Safety::full ? "PRAGMA synchronous = FULL"
                                                    : "PRAGMA synchronous = NORMAL")) {
      return false;
    }
    safety_ = safety;
  }
  return begin_.run();
}

bool StoreDatabase::insert(const StoreBatch& batch, const AgentSessionRow& row) {
  const std::int64_t id = placed(row.id);
  std::int64_t& lastID = lastIDs_[StoreTable::agentSession];
  lastID = std::max(lastID, id);
  return insertAgentSession_.bind(1, id)
      .bind(2, row.sessionID)
      .bind(3, row.clientType)
      .bind(4, row.clientVersion)
      .bind(5, std::int64_t{row.batchEvent})
      .bind(6, batch.text(row.texts[AgentSessionRow::hierarchyToken]))
      .bind(7, batch.text(row.texts[AgentSessionRow::clientName]))
      .bind(8, batch.text(row.texts[AgentSessionRow::serviceName]))
      .bind(9, json(row.userInfo))
      .bind(10, Microseconds(row.openedAt))
      .run();
}

bool StoreDatabase::insert(const StoreBatch& batch, const MessageRow& row) {
  if (row.agentSession) {
    insertMessage_.bind(2, placed(*row.agentSession));
  } else {
    insertMessage_.bind(2, nullptr);
  }
  return insertMessage_.bind(1, ++lastIDs_[StoreTable::message])
      .bindSteady(3, row.sessionID)
      .bindSteady(4, batch.text(row.texts[MessageRow::clientName]))
      .bindSteady(5, batch.text(row.texts[MessageRow::serviceName]))
      .bindSteady(6, std::int64_t{row.category})
      .bindSteady(7, std::int64_t{row.type})
      .bind(8, json(row.payload))
      .bind(9, Microseconds(row.sentAt))
      .run();
}

bool StoreDatabase::insert(const StoreBatch& batch, const AnalyticsEventRow& row) {
  return insertAnalyticsEvent_.bind(1, ++lastIDs_[StoreTable::analyticsEvent])
      .bindSteady(2, batch.text(row.texts[AnalyticsEventRow::name]))
      .bind(3, json(row.payload))
      .bind(4, Microseconds(row.recordedAt))
      .run();
}

bool StoreDatabase::insert(const StoreBatch& batch, const PowerEventRow& row) {
  return insertPowerEvent_.bind(1, ++lastIDs_[StoreTable::powerEvent])
      .bind(2, std::int64_t{row.domain})
      .bind(3, batch.text(row.texts[PowerEventRow::name]))
      .bind(4, json(row.payload))
      .bind(5, Microseconds(row.recordedAt))
      .run();
}

bool StoreDatabase::insert(const StoreBatch&, const FlushRow& row) {
  return markFlushed_.bind(1, placed(row.agentSession)).bind(2, now_).run();
}

bool StoreDatabase::keepDrops(const StoreDrops& drops) {
  return std::ranges::all_of(kDropsBeforeStore, [&](StoreDrop reason) {
    if (drops[reason] == keptDrops_[reason]) return true;
    const std::string key = StoreDropKey(reason);
    return keepDrops_.bind(1, key).bind(2, static_cast<std::int64_t>(drops[reason])).run();
  });
}

bool StoreDatabase::insert(const StoreBatch&, const ExportedRow& row) {
  const ExportRecord& record = row.record;
  const char* const table = StoreTableName(record.table);
  // Of a store that was set aside meanwhile, in which the ids meant other rows.
  const bool moved = moveCursor_.bind(1, record.backend)
                         .bind(2, table)
                         .bind(3, record.lastID)
                         .bind(4, record.storeID)
                         .run();
  if (!moved || connection_.changes() == 0) return moved;
  for (const ExportRecord::Line& line : record.lines) {
    if (!writeLedger_.bind(1, record.backend)
             .bind(2, table)
             .bind(3, line.firstID)
             .bind(4, line.lastID)
             .bind(5, line.rows)
             .bind(6, line.bytes)
             .bind(7, line.outcome)
             .bind(8, now_)
             .run()) {
      return false;
    }
  }
  return trimLedger_.run();
}

Outcome StoreDatabase::putBack(const std::filesystem::path& path, Date now) {
  const Result<std::filesystem::path> place = MakePlaceFor(path, now);
  if (!place) return place.error();
  if (connection_.copyTo(place.value())) return SyncStoreFile(place.value());
  return StoreError(StoreErrorCode::failed, connection_.message());
}

std::int64_t StoreDatabase::placed(std::int64_t session) const {
  if (session < kProvisionalSessions) return session;
  return session - kProvisionalSessions + provisionalSessionsAfter_;
}

std::string StoreDatabase::message() const {
  if (connection_.logIsDoubtful()) return "the write-ahead log cannot be synced";
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
  awaitMedium();
  return connection_.syncLog();
}

void StoreDatabase::checkpoint() {
  awaitMedium();
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
  // What is left is so little that the writer does it itself: nothing is added meanwhile, and the
  // log can begin again. A log that has grown several times as long is kept from that by readers:
  // new ones wait for it.
  const bool isLittle = isCatchingUp_ && left <= std::max(logPages_ / kFewPages, 1);
  if (isLittle || logIsLong()) {
    underWay_ = {StoreSyncer::Task::checkpoint, committedIDs_, std::nullopt};
    carryOutHere();
  } else {
    beginTask(StoreSyncer::Task::checkpoint);
  }
  return true;
}

bool StoreDatabase::logIsLong() const {
  return connection_.logPages() >= logPages_ * kLogsBeforeRestart;
}

void StoreDatabase::beginTask(StoreSyncer::Task task) {
  underWay_ = {task, committedIDs_, std::nullopt};
  // What a failed sync has left is written again by nobody but who writes.
  if (!connection_.logIsDoubtful() && !syncer_) {
    syncer_ = StoreSyncer::open(path_, connection_, mediumAnswered_);
  }
  if (!connection_.logIsDoubtful() && syncer_) {
    syncer_->begin(task);
  } else {
    carryOutHere();
  }
}

void StoreDatabase::carryOutHere() {
  const StoreSyncer::Task task = underWay_->task;
  StoreSyncer::End end{task, false, false, connection_.logPages()};
  if (task == StoreSyncer::Task::sync) {
    end.isSafe = connection_.syncLog();
  } else if (logIsLong()) {
    end.isSafe = connection_.restartLog();
  } else {
    const SqliteConnection::Moved moved = connection_.checkpoint();
    end.isSafe = moved.all;
    end.movedPages = moved.pages;
  }
  end.logIsDoubtful = connection_.logIsDoubtful();
  taskEnded(end);
}

void StoreDatabase::taskEnded(const StoreSyncer::End& end) {
  underWay_->end = end;
  if (end.task == StoreSyncer::Task::checkpoint) {
    movedPages_ = std::max(end.movedPages, 0);
    isCatchingUp_ = end.isSafe;
  }
  if (!end.logIsDoubtful) return;
  connection_.doubtLog();
  // Its connection does not learn of it when the log has been written again.
  syncer_.reset();
}

void StoreDatabase::awaitMedium() {
  if (!underWay_ || underWay_->end) return;
  syncer_->await();
  if (const auto end = syncer_->takeEnd()) taskEnded(*end);
}

std::optional<StoreDatabase::Safe> StoreDatabase::takeSafe() {
  if (!underWay_) return std::nullopt;
  if (!underWay_->end) {
    const auto end = syncer_->takeEnd();
    if (!end) return std::nullopt;
    taskEnded(*end);
  }
  const StoreSyncer::End& end = *underWay_->end;
  const Safe safe{end.isSafe, underWay_->ids, end.task == StoreSyncer::Task::sync && !end.isSafe};
  underWay_.reset();
  return safe;
}

}  // namespace quarvel
