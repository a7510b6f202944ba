#include "platform/linux/store/StoreDatabase.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>
#include <variant>

#include "base/Json.h"
#include "platform/linux/store/StoreError.h"
#include "platform/linux/store/StoreSchema.h"

namespace quarvel {

namespace {

// In pages of 4 KiB. The larger the log, the fewer syncs and the more often a page is overwritten
// before it has to be moved; but what is moved at once holds up the rows behind it.
constexpr int kLogPagesWhenIdle = 1024;
constexpr int kLogPagesBetweenBatches = 4096;
constexpr std::size_t kKeptJson = 1 << 20;

std::int64_t Microseconds(Date date) {
  return date.time_since_epoch().count();
}

}  // namespace

Result<std::unique_ptr<StoreDatabase>> StoreDatabase::open(const Options& options, Date now) {
  Result<SqliteConnection> connection = OpenStore(options.path, options.vfs, now);
  if (!connection) return connection.error();
  std::unique_ptr<StoreDatabase> database(
      new StoreDatabase(std::move(connection.value()), options.bounds));
  if (!database->prepare(now)) {
    return StoreError(StoreErrorCode::failed,
                      fmt::format("The telemetry store {} cannot be read: {}.",
                                  options.path.string(), database->message()));
  }
  return database;
}

StoreDatabase::StoreDatabase(SqliteConnection connection, StoreRetention::Bounds bounds)
    : connection_(std::move(connection)),
      retention_(std::move(bounds), connection_, committedIDs_) {}

StoreDatabase::~StoreDatabase() {
  if (fault() != SqliteFault::corrupt) connection_.checkpointAtClose();
}

bool StoreDatabase::prepare(Date now) {
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
         readLastIDs() && retention_.prepare(lastAgentSession(), now);
}

bool StoreDatabase::readLastIDs() {
  for (const StoreTable table : kAllStoreTables) {
    const auto lastID = connection_.integer(
        fmt::format("SELECT max(ifnull((SELECT max(id) FROM {}), 0),"
                    " ifnull((SELECT CAST(value AS INTEGER) FROM meta WHERE key = '{}'), 0))",
                    StoreTableName(table), LastIDKey(table)));
    if (!lastID) return false;
    committedIDs_[table] = *lastID;
  }
  lastIDs_ = committedIDs_;
  const auto dropped = connection_.integer(
      fmt::format("SELECT ifnull((SELECT CAST(value AS INTEGER) FROM meta WHERE key = '{}'), 0)",
                  kDroppedByRetentionKey));
  if (!dropped) return false;
  std::int64_t everStored = 0;
  for (const StoreTable table : kCountedStoreTables) everStored += committedIDs_[table];
  droppedAtOpening_ = static_cast<std::uint64_t>(*dropped);
  storedAtOpening_ = static_cast<std::uint64_t>(std::max(everStored - *dropped, std::int64_t{0}));
  return true;
}

bool StoreDatabase::write(const StoreBatch& batch, std::size_t first, std::size_t last,
                          Safety safety, Date now) {
  now_ = Microseconds(now);
  bool changesFile = false;
  bool written = begin(safety);
  for (std::size_t i = first; written && i < last; ++i) {
    written =
        std::visit([this, &batch](const auto& row) { return insert(batch, row); }, batch.rows()[i]);
    changesFile = changesFile || connection_.changes() > 0;
  }
  if (written && commit_.run()) {
    committedIDs_ = lastIDs_;
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
  std::int64_t& lastID = lastIDs_[StoreTable::agentSession];
  lastID = std::max(lastID, row.id);
  return insertAgentSession_.bind(1, row.id)
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
    insertMessage_.bind(2, *row.agentSession);
  } else {
    insertMessage_.bind(2, nullptr);
  }
  return insertMessage_.bind(1, ++lastIDs_[StoreTable::message])
      .bind(3, row.sessionID)
      .bind(4, batch.text(row.texts[MessageRow::clientName]))
      .bind(5, batch.text(row.texts[MessageRow::serviceName]))
      .bind(6, std::int64_t{row.category})
      .bind(7, std::int64_t{row.type})
      .bind(8, json(row.payload))
      .bind(9, Microseconds(row.sentAt))
      .run();
}

bool StoreDatabase::insert(const StoreBatch& batch, const AnalyticsEventRow& row) {
  return insertAnalyticsEvent_.bind(1, ++lastIDs_[StoreTable::analyticsEvent])
      .bind(2, batch.text(row.texts[AnalyticsEventRow::name]))
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
  return markFlushed_.bind(1, row.agentSession).bind(2, now_).run();
}

std::string_view StoreDatabase::json(const Payload& payload) {
  json_.clear();
  if (json_.capacity() > kKeptJson) json_.shrink_to_fit();
  AppendJson(json_, payload.root());
  return json_;
}

bool StoreDatabase::checkpointIfDue(bool idle) {
  const int logPages = connection_.logPages();
  // The log began again, or a reader has kept it from doing so: then what was moved is still there.
  if (logPages < checkpointedPages_) checkpointedPages_ = 0;
  if (logPages - checkpointedPages_ < (idle ? kLogPagesWhenIdle : kLogPagesBetweenBatches)) {
    return false;
  }
  checkpointedPages_ = logPages;
  return connection_.checkpoint();
}

}  // namespace quarvel
