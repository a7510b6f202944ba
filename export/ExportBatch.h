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

/// A value of a row: absent, or by the column's kind an integer (a boolean is 0 or 1, a time is in
/// microseconds since the epoch), a real, or a text (also of a JSON column).
using ExportValue = std::variant<std::monostate, std::int64_t, double, std::string>;

/// One row, with its values in the order of `ExportColumns`.
struct ExportRow {
  std::int64_t id = 0;    // in the store; rises within a table and is given once
  std::size_t bytes = 0;  // of its values; a number counts 8
  std::vector<ExportValue> values;
};

/// Rows of one table in the order of their ids. Made by `ExportSource::read`, handed to the engine
/// on the same thread, and gone when the delivery has been recorded.
struct ExportBatch {
  StoreTable table{};   // of all its rows
  std::string storeID;  // of the store that the rows were read from
  std::vector<ExportRow> rows;

  /// The stable name of a row, by which engines drop repeats: "<store_id>-<table>-<id>".
  [[nodiscard]] std::string nameOf(const ExportRow& row) const;
};

/// The exported columns of a table, without its id.
[[nodiscard]] constexpr std::span<const ExportColumn> ExportColumns(StoreTable table) {
  return InsertedColumns(Describe(table));
}

/// Appends a row as one JSON object: its id, then its columns under their names, absent ones as
/// null, 64-bit integers as numbers, JSON columns unquoted. Pure; `row` must be of `table`.
void AppendRowJson(std::string& out, StoreTable table, const ExportRow& row);

}  // namespace quarvel
