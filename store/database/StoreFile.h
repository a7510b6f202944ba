#pragma once

#include <filesystem>
#include <string>
#include <vector>

#include "base/Date.h"
#include "base/Error.h"

namespace quarvel {

// The store's file and what lies beside it. Errors: domain "quarvel.store", each with a reason that
// says what to do.

/// Makes the file, empty, when there is none; when there is one, looks whether it can be used.
/// What an attempt to set a store aside has left half done is finished first; `now` names it.
[[nodiscard]] Outcome MakeStoreFile(const std::filesystem::path& path, Date now);

/// Where the store goes whose file was taken away: makes `path`, empty, and its directory. When
/// something stands there already, the place is that of a store set aside.
[[nodiscard]] Result<std::filesystem::path> MakePlaceFor(const std::filesystem::path& path,
                                                         Date now);
/// Makes the content of a file and its name safe from a power cut.
[[nodiscard]] Outcome SyncStoreFile(const std::filesystem::path& path);

/// Why the file or its directory cannot be used, with what to do about it.
[[nodiscard]] Error StoreUnusable(const std::filesystem::path& path, int errorNumber,
                                  std::string_view remedy);

/// Renames the store's file and its side files, so that nothing of it is lost but a new one can be
/// begun; says so in the log. No connection may be open.
[[nodiscard]] Outcome SetStoreAside(const std::filesystem::path& path, Date now,
                                    const std::string& reason);

/// The stores that were set aside, the newest first.
[[nodiscard]] std::vector<std::filesystem::path> StoresSetAside(const std::filesystem::path& path);

}  // namespace quarvel
