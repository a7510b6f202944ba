#include "tools/Table.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdio>
#include <utility>

namespace quarvel {

Table::Table(std::vector<Column> columns, const Terminal& terminal)
    : columns_(std::move(columns)), terminal_(terminal) {
  for (const Column& column : columns_) widths_.push_back(ColumnsOf(column.heading));
}

void Table::add(std::vector<std::string> row) {
  for (std::size_t i = 0; i < row.size(); ++i) {
    row[i] = Printable(row[i]);
    widths_[i] = std::max(widths_[i], ColumnsOf(row[i]));
  }
  rows_.push_back(std::move(row));
}

void Table::print() {
  if (!std::exchange(begun_, true)) {
    std::vector<std::string> headings;
    for (const Column& column : columns_) headings.emplace_back(column.heading);
    printLine(headings, true);
  }
  for (const auto& row : rows_) printLine(row, false);
  rows_.clear();
  std::fflush(stdout);
}

void Table::printLine(const std::vector<std::string>& cells, bool heading) {
  constexpr std::size_t kGap = 2;
  constexpr std::size_t kLeastLast = 8;
  std::string line;
  std::size_t used = 0;
  for (std::size_t i = 0; i < cells.size(); ++i) {
    const bool last = i + 1 == cells.size();
    const std::size_t blanks = widths_[i] - ColumnsOf(cells[i]);
    if (columns_[i].toTheRight) line.append(blanks, ' ');
    if (last && terminal_.attached && !columns_[i].toTheRight) {
      line += Fitted(cells[i],
                     std::max(kLeastLast, terminal_.columns - std::min(used, terminal_.columns)));
    } else {
      line += cells[i];
    }
    if (last) break;
    if (!columns_[i].toTheRight) line.append(blanks, ' ');
    line.append(kGap, ' ');
    used += widths_[i] + kGap;
  }
  if (heading && terminal_.coloured) {
    fmt::print("\x1b[1m{}\x1b[0m\n", line);
  } else {
    fmt::print("{}\n", line);
  }
}

}  // namespace quarvel
