#include "export/ExportBatch.h"

#include <fmt/format.h>

#include <iterator>

#include "base/Json.h"

namespace quarvel {

namespace {

using Kind = ExportColumn::Kind;

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
