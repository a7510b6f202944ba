#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

#include "tools/Terminal.h"

namespace quarvel {

/// Rows under a heading, printed to standard output in portions. Columns are as wide as the widest
/// cell so far; on a terminal the widest texts are cut until the line fits. Owned by one command;
/// one thread.
class Table {
 public:
  struct Column {
    std::string_view heading;  // a constant
    bool toTheRight = false;   // numbers
  };

  /// Without a terminal nothing is cut.
  Table(std::vector<Column> columns, const Terminal& terminal);

  /// Takes one cell for each column.
  void add(std::vector<std::string> row);
  /// Prints the rows added since the last time, the heading before the first.
  void print();

 private:
  /// The columns' widths, cut so that a line fits the terminal.
  [[nodiscard]] std::vector<std::size_t> fittedWidths() const;
  void printLine(const std::vector<std::string>& cells, const std::vector<std::size_t>& widths,
                 bool heading);

  const std::vector<Column> columns_;
  const Terminal terminal_;
  std::vector<std::size_t> widths_;  // of the widest cells so far, in columns of a terminal
  std::vector<std::vector<std::string>> rows_;  // added and not printed yet
  bool begun_ = false;                          // the heading is printed
};

}  // namespace quarvel
