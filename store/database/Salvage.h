#pragma once

#include <filesystem>

#include "base/StoreCounters.h"
#include "store/database/Sqlite.h"
#include "store/database/StoreFile.h"
#include "store/database/Tables.h"

namespace quarvel {

// Saves rows from damaged stores. Called by the thread that opens the store, before any other use
// of `into`.

/// Copies every readable row of the stores that were set aside beside `path` into the store that
/// `into` has open, once for each of them: rows with their ids, the store's id, cursors and
/// counters. Rows between two readable parts of a file are lost, and counted. The damaged files
/// stay as they are. Adds its results to `notices`. When it has to stop, for lack of room for
/// example, the next opening goes on and copies no row twice.
void SalvageStoresSetAside(const std::filesystem::path& path, SqliteConnection& into,
                           StoreNotices& notices);

/// Counts every row and writes to `meta`: ids up to `lastIDs` have been given, rows were removed as
/// in `drops`, and all other missing rows are damaged. False when it failed.
[[nodiscard]] bool SettleAccounts(SqliteConnection& store, const StoreIDs& lastIDs,
                                  const StoreDrops& drops);

}  // namespace quarvel
