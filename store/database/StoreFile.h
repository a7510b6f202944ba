#pragma once

#include <cstdint>
#include <filesystem>
#include <string>
#include <string_view>
#include <vector>

#include "base/Date.h"
#include "base/Error.h"
#include "store/database/Sqlite.h"

namespace quarvel {

// The store's file, the files beside it, and the opening of the store.
//
// All functions may be called from any thread, by one thread at a time for one file, and wait for
// the medium. Errors have the domain "quarvel.store", a `StoreErrorCode` and a reason that tells
// the reader how to mend it.

inline constexpr const char* kStoreErrorDomain = "quarvel.store";

enum class StoreErrorCode : std::int64_t {
  closed = 1,        // the store takes no more rows
  diskFull = 2,      // closed with rows for which the disk had no room
  failed = 3,        // the database answered with another error
  inaccessible = 4,  // the file or its directory cannot be used
  laterVersion = 5,  // a later version of the service wrote the store
  foreign = 6,       // the file is the database of another program
  corrupt = 7,       // the header contradicts the content
  tooLarge = 8,      // a row is longer than the store takes
};

[[nodiscard]] inline Error StoreError(StoreErrorCode code, std::string reason) {
  return Error::because(kStoreErrorDomain, static_cast<std::int64_t>(code), std::move(reason));
}

/// The numbers in the header of the store's file.
inline constexpr std::int64_t kStoreApplicationID = 0x51525654;
inline constexpr std::int64_t kStoreVersion = 1;

/// A line for the log, which this folder does not know: the caller writes it at the level error,
/// also when the operation failed in the end.
struct StoreNotice {
  const char* function;  // a string literal, as `ZQ_FUNCTION`
  std::string text;
};
using StoreNotices = std::vector<StoreNotice>;

/// Opens the store's file and brings it to this version of the schema. Makes a new file when there
/// is none. Sets a corrupt file aside, makes a new one and copies every readable row into it. Adds
/// its results to `notices`. `now` names a file that is set aside. `isSuspect`: corruption was met
/// in this file, so all of it is checked. Errors: the file is left as it was.
[[nodiscard]] Result<SqliteConnection> OpenStore(const std::filesystem::path& path, Date now,
                                                 bool isSuspect, StoreNotices& notices);

/// Makes the file, empty, when there is none; otherwise checks that it can be used. Moves a log
/// that an interrupted `SetStoreAside` left behind; `now` names it.
[[nodiscard]] Outcome MakeStoreFile(const std::filesystem::path& path, Date now);

/// Where to write a store whose file was removed or renamed: makes `path`, empty, and its
/// directory. When another file stands there, the name of a store set aside.
[[nodiscard]] Result<std::filesystem::path> MakePlaceFor(const std::filesystem::path& path,
                                                         Date now);
/// Makes the content of a file and its name durable.
[[nodiscard]] Outcome SyncStoreFile(const std::filesystem::path& path);

/// The error for a file or directory that cannot be used, with a remedy for the reader.
[[nodiscard]] Error StoreUnusable(const std::filesystem::path& path, int errorNumber,
                                  std::string_view remedy);

/// Renames the store's file and its side files, so that a new store can be begun. No connection may
/// be open.
[[nodiscard]] Outcome SetStoreAside(const std::filesystem::path& path, Date now,
                                    const std::string& reason, StoreNotices& notices);

/// The stores that were set aside, the newest first.
[[nodiscard]] std::vector<std::filesystem::path> StoresSetAside(const std::filesystem::path& path);
/// Removes the stores that were set aside and their side files, for an erasure: single rows cannot
/// be removed from them. Returns the number of files removed.
std::size_t RemoveStoresSetAside(const std::filesystem::path& path);

}  // namespace quarvel
