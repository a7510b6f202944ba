#pragma once

#include <filesystem>
#include <string>

namespace quarvel {

/// What the machine allows: a server that takes frames from a Unix socket in `directory`, answers
/// each and writes `json` as its row into the service's message table (and, with `rows` 2, into its
/// table of analytics events), all on one thread, one transaction for what has arrived. With `rows`
/// 0 it answers and does nothing else. Ends with the process.
[[noreturn]] void RunFloor(const std::filesystem::path& directory, const std::string& json,
                           int rows);

}  // namespace quarvel
