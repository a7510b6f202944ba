#pragma once

#include <filesystem>
#include <string>

namespace quarvel {

/// The upper bound that the machine sets: a server that takes frames from a Unix socket in
/// `directory` and answers each, on one thread. With `rows` 1 it writes `json` as a row into the
/// service's message table, with `rows` 2 into its table of analytics events too, in one
/// transaction for all frames that have arrived; with `rows` 0 it only answers. Ends with the
/// process.
[[noreturn]] void RunFloor(const std::filesystem::path& directory, const std::string& json,
                           int rows);

}  // namespace quarvel
