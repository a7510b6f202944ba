#pragma once

#include <cstdint>
#include <filesystem>
#include <string>

#include "base/Date.h"
#include "base/Error.h"
#include "platform/linux/store/Sqlite.h"

namespace quarvel {

/// Opens the store's file and brings it to this version of the schema: makes a new one when there
/// is none, sets a corrupt one aside and makes a new one then. Logs what it did. Errors: domain
/// "quarvel.store", each with a reason that says what to do; the file is left as it was.
/// `now` names what is set aside.
[[nodiscard]] Result<SqliteConnection> OpenStore(const std::filesystem::path& path,
                                                 const std::string& vfs, Date now);

/// Renames the database at `path` and its side files, so that nothing of it is lost but a new one
/// can be begun; says so in the log. No connection may be open.
[[nodiscard]] Outcome SetStoreAside(const std::filesystem::path& path, Date now,
                                    const std::string& reason);

}  // namespace quarvel
