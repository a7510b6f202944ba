#include "tools/Table.h"

#include <fmt/format.h>

#include <algorithm>
#include <cstdio>
#include <utility>

namespace quarvel {
namespace {

constexpr std::size_t kGap = 2;
constexpr std::size_t kLeastText = 8;

}  // namespace

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
  const std::vector<std::size_t> widths = fittedWidths();
  if (!std::exchange(begun_, true)) {
    std::vector<std::string> headings;
    for (const Column& column : columns_) headings.emplace_back(column.heading);
    printLine(headings, widths, true);
  }
  for (const auto& row : rows_) printLine(row, widths, false);
  rows_.clear();
  std::fflush(stdout);
}

std::vector<std::size_t> Table::fittedWidths() const {
  std::vector<std::size_t> widths = widths_;
  if (!terminal_.attached) return widths;
  // Finds the largest width to which texts must be cut so that a line fits; numbers are not cut.
  for (std::size_t most = terminal_.columns; most >= kLeastText; --most) {
    std::size_t line = kGap * (widths.size() - 1);
    for (std::size_t i = 0; i < widths.size(); ++i) {
      widths[i] = columns_[i].toTheRight ? widths_[i] : std::min(widths_[i], most);
      line += widths[i];
    }
    if (line <= terminal_.columns) {
      if (!columns_.back().toTheRight) widths.back() += terminal_.columns - line;
      break;
    }
  }
  return widths;
}

void Table::printLine(const std::vector<std::string>& cells, const std::vector<std::size_t>& widths,
                      bool heading) {
  std::string line;
  for (std::size_t i = 0; i < cells.size(); ++i) {
    const std::string cell = terminal_.attached ? Fitted(cells[i], widths[i]) : cells[i];
    const std::size_t blanks = widths[i] - std::min(widths[i], ColumnsOf(cell));
    if (columns_[i].toTheRight) line.append(blanks, ' ');
    line += cell;
    if (i + 1 == cells.size()) break;
    if (!columns_[i].toTheRight) line.append(blanks, ' ');
    line.append(kGap, ' ');
  }
  if (terminal_.attached) line = Fitted(line, terminal_.columns);
  if (heading && terminal_.coloured) {
    fmt::print("\x1b[1m{}\x1b[0m\n", line);
  } else {
    fmt::print("{}\n", line);
  }
}

}  // namespace quarvel
