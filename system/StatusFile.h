#pragma once

#include <filesystem>

namespace quarvel {

class Status;

/// The notification that asks for the status.
inline constexpr const char* kStatusNotification = "tarnwick.quarvel.status";

/// Writes `status` to the file `path` in one step. Errors are logged: who asked finds no new file.
void WriteStatusFile(const Status& status, const std::filesystem::path& path);

/// Has the process's status written to `status.json` in the runtime directory whenever the
/// notification is posted, and at no other time. Called once in a process, at its start.
void AnswerStatusRequests();

}  // namespace quarvel
