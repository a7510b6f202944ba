#include "store/database/Tables.h"

#include <fmt/format.h>

namespace quarvel {

namespace {

const char* SqlType(StoreColumn::Kind kind) {
  switch (kind) {
    case StoreColumn::Kind::real:
      return "REAL";
    case StoreColumn::Kind::text:
    case StoreColumn::Kind::json:
      return "TEXT";
    case StoreColumn::Kind::integer:
    case StoreColumn::Kind::boolean:
    case StoreColumn::Kind::time:
      break;
  }
  return "INTEGER";
}

/// "id, first, second".
std::string ColumnList(const TableDescription& table, std::span<const StoreColumn> columns) {
  std::string list = table.primaryKey.empty() ? "id" : "";
  for (const StoreColumn& column : columns) {
    if (!list.empty()) list += ", ";
    list += column.name;
  }
  return list;
}

}  // namespace

std::string CreateTableSql(const TableDescription& table) {
  std::string columns = table.primaryKey.empty() ? "id INTEGER PRIMARY KEY" : "";
  for (const StoreColumn& column : table.columns) {
    if (!columns.empty()) columns += ", ";
    columns += fmt::format("{} {}", column.name, SqlType(column.kind));
    if (!column.mayBeNull) columns += " NOT NULL";
    if (column.references != nullptr)
      columns += fmt::format(" REFERENCES {}(id)", column.references);
  }
  if (!table.primaryKey.empty()) columns += fmt::format(", PRIMARY KEY({})", table.primaryKey);
  return fmt::format("CREATE TABLE {}({});", table.name, columns);
}

std::string CreateTablesSql() {
  std::string statements;
  for (const TableDescription* table : kTables) statements += CreateTableSql(*table);
  return statements;
}

std::string InsertSql(const TableDescription& table) {
  const auto columns = InsertedColumns(table);
  std::string values = "?1";
  const std::size_t parameters = columns.size() + (table.primaryKey.empty() ? 1 : 0);
  for (std::size_t i = 2; i <= parameters; ++i) values += fmt::format(", ?{}", i);
  return fmt::format("INSERT INTO {}({}) VALUES({})", table.name, ColumnList(table, columns),
                     values);
}

std::string SelectSql(const TableDescription& table) {
  return fmt::format("SELECT {} FROM {}", ColumnList(table, table.columns), table.name);
}

std::string LastIDSql(StoreTable table) {
  return fmt::format(
      "SELECT max(ifnull((SELECT max(id) FROM {}), 0),"
      " ifnull((SELECT CAST(value AS INTEGER) FROM meta WHERE key = '{}'), 0))",
      StoreTableName(table), LastIDKey(table));
}

std::string LastIDKey(StoreTable table) {
  return std::string("last_id.") + StoreTableName(table);
}

}  // namespace quarvel
