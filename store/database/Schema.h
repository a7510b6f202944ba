#pragma once

#include <cstdint>
#include <filesystem>
#include <string>

#include "base/Date.h"
#include "base/Error.h"
#include "store/database/Sqlite.h"

namespace quarvel {

/// Opens the store's file and brings it to this version of the schema: makes a new one when there
/// is none, sets a corrupt one aside, makes a new one then and copies into it what can be read of
/// the old one. Logs what it did. Errors: domain
/// "quarvel.store", each with a reason that says what to do; the file is left as it was.
/// `now` names what is set aside. `isSuspect`: the file has been found to be corrupt, which a close
/// look will find again.
[[nodiscard]] Result<SqliteConnection> OpenStore(const std::filesystem::path& path, Date now,
                                                 bool isSuspect);

}  // namespace quarvel
