#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "store/database/Tables.h"

namespace quarvel {

/// What a backend has been given of one table: where its cursor stands now, and lines for the
/// ledger.
struct ExportRecord {
  struct Line {
    std::int64_t firstID = 0;
    std::int64_t lastID = 0;
    std::int64_t rows = 0;
    std::int64_t bytes = 0;
    std::string outcome;
  };

  std::string backend;
  std::string storeID;  // of the store that the rows were read from
  StoreTable table{};
  std::int64_t lastID = 0;
  std::vector<Line> lines;
};

}  // namespace quarvel
