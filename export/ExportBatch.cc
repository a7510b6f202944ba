#include "export/ExportBatch.h"

#include <fmt/format.h>

#include <array>
#include <iterator>

#include "base/Json.h"

namespace quarvel {

namespace {

using Kind = ExportColumn::Kind;

constexpr std::array kSessionColumns{
    ExportColumn{"session_id", Kind::integer},   ExportColumn{"client_type", Kind::integer},
    ExportColumn{"client_version", Kind::real},  ExportColumn{"batch_event", Kind::boolean},
    ExportColumn{"hierarchy_token", Kind::text}, ExportColumn{"client_name", Kind::text},
    ExportColumn{"service_name", Kind::text},    ExportColumn{"user_info", Kind::json},
    ExportColumn{"opened_at", Kind::time}};
constexpr std::array kMessageColumns{
    ExportColumn{"agent_session", Kind::integer}, ExportColumn{"session_id", Kind::integer},
    ExportColumn{"client_name", Kind::text},      ExportColumn{"service_name", Kind::text},
    ExportColumn{"category", Kind::integer},      ExportColumn{"type", Kind::integer},
    ExportColumn{"payload", Kind::json},          ExportColumn{"sent_at", Kind::time}};
constexpr std::array kAnalyticsColumns{ExportColumn{"name", Kind::text},
                                       ExportColumn{"payload", Kind::json},
                                       ExportColumn{"recorded_at", Kind::time}};
constexpr std::array kPowerColumns{
    ExportColumn{"domain", Kind::integer}, ExportColumn{"name", Kind::text},
    ExportColumn{"payload", Kind::json}, ExportColumn{"recorded_at", Kind::time}};

void AppendValue(std::string& out, Kind kind, const ExportValue& value) {
  if (const auto* integer = std::get_if<std::int64_t>(&value)) {
    if (kind == Kind::boolean) {
      out += *integer != 0 ? "true" : "false";
    } else {
      fmt::format_to(std::back_inserter(out), "{}", *integer);
    }
  } else if (const auto* real = std::get_if<double>(&value)) {
    AppendJson(out, Value(*real));
  } else if (const auto* text = std::get_if<std::string>(&value)) {
    if (kind == Kind::json) {
      out += *text;
    } else {
      AppendJson(out, Value(*text));
    }
  } else {
    out += "null";
  }
}

}  // namespace

std::string ExportBatch::nameOf(const ExportRow& row) const {
  return fmt::format("{}-{}-{}", storeID, StoreTableName(table), row.id);
}

std::span<const ExportColumn> ExportColumns(StoreTable table) {
  switch (table) {
    case StoreTable::agentSession:
      return kSessionColumns;
    case StoreTable::message:
      return kMessageColumns;
    case StoreTable::analyticsEvent:
      return kAnalyticsColumns;
    case StoreTable::powerEvent:
      return kPowerColumns;
  }
  return {};
}

void AppendRowJson(std::string& out, StoreTable table, const ExportRow& row) {
  fmt::format_to(std::back_inserter(out), "{{\"id\":{}", row.id);
  const auto columns = ExportColumns(table);
  for (std::size_t i = 0; i < columns.size(); ++i) {
    fmt::format_to(std::back_inserter(out), ",\"{}\":", columns[i].name);
    AppendValue(out, columns[i].kind, row.values[i]);
  }
  out += '}';
}

}  // namespace quarvel
