#pragma once

#include <filesystem>

#include "store/database/Sqlite.h"
#include "store/database/StoreCounters.h"
#include "store/database/Tables.h"

namespace quarvel {

/// Copies into the store `path`, open as `into`, what can be read of the damaged stores that were
/// set aside beside it and have not been looked at yet: rows with their ids, the store's own id,
/// cursors and counters. What lies between two readable parts of a file is lost, and counted. The
/// damaged files stay as they are. Says in the log what it did. Where it cannot go on, for lack of
/// room say, it will at the next opening; what is there then is not copied twice.
void SalvageStoresSetAside(const std::filesystem::path& path, SqliteConnection& into);

/// Has the store's `meta` say that ids up to `lastIDs` have been given, and of what was in the
/// store: that rows were removed as in `drops`, and that all others which are not there are
/// damaged. Counts every row. False when it failed.
[[nodiscard]] bool SettleAccounts(SqliteConnection& store, const StoreIDs& lastIDs,
                                  const StoreDrops& drops);

}  // namespace quarvel
