#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <variant>
#include <vector>

#include "store/database/Tables.h"

namespace quarvel {

/// A column of a table, exported under its name in the store.
using ExportColumn = StoreColumn;

/// A value of a row: nothing, or by the column's kind an integer (also a boolean's, and a time's in
/// microseconds since the epoch), a real, or a text (also JSON).
using ExportValue = std::variant<std::monostate, std::int64_t, double, std::string>;

/// One row, its values in the order of `ExportColumns`.
struct ExportRow {
  std::int64_t id = 0;
  std::size_t bytes = 0;  // of its texts
  std::vector<ExportValue> values;
};

/// Rows of one table, in the order of their ids.
struct ExportBatch {
  StoreTable table{};
  std::string storeID;
  std::vector<ExportRow> rows;

  /// What a row is called everywhere and for ever: "<store_id>-<table>-<id>".
  [[nodiscard]] std::string nameOf(const ExportRow& row) const;
};

/// The exported columns of a table, without its id.
[[nodiscard]] constexpr std::span<const ExportColumn> ExportColumns(StoreTable table) {
  return InsertedColumns(Describe(table));
}

/// Appends a row as one JSON object: its id and its columns under their names.
void AppendRowJson(std::string& out, StoreTable table, const ExportRow& row);

}  // namespace quarvel
