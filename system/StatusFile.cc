#include "system/StatusFile.h"

#include <chrono>
#include <memory>
#include <system_error>

#include "base/Files.h"
#include "base/Json.h"
#include "base/StandardPaths.h"
#include "platform/Clock.h"
#include "platform/Log.h"
#include "platform/Notifications.h"
#include "platform/Process.h"
#include "system/Status.h"

namespace quarvel {

namespace {

Status::Describe DescribeProcess() {
  using std::chrono::steady_clock;
  return [startedAt = CurrentDate(), started = steady_clock::now()] {
    const std::chrono::duration<double> uptime = steady_clock::now() - started;
    return Dictionary{{"at", CurrentDate()},
                      {"version", QUARVEL_VERSION},
                      {"pid", OwnProcessIdentifier()},
                      {"started_at", startedAt},
                      {"uptime_seconds", uptime.count()}};
  };
}

}  // namespace

void WriteStatusFile(const Status& status, const std::filesystem::path& path) {
  ZQ_FUNCTION("WriteStatusFile");
  const Outcome written =
      ReplaceFile(path.native(), JsonText(status.describe()) + "\n", kPrivateFile);
  if (!written) {
    ZQ_LOG(nullptr, error, "the status cannot be written: {}", written.error().description());
  }
}

void AnswerStatusRequests() {
  ZQ_FUNCTION("AnswerStatusRequests");
  static WorkQueue& queue =
      *CreateSerialQueue("tarnwick.quarvel.status", QualityOfService::utility).release();
  Status::process().add(DescribeProcess());
  NotificationToken token = 0;
  const std::int32_t status =
      RegisterForNotification(kStatusNotification, token, queue, [](NotificationToken) {
        WriteStatusFile(Status::process(), StandardPaths::process().runtime / "status.json");
      });
  if (status != 0) {
    ZQ_LOG(nullptr, error, "nobody can ask for the status: {}",
           std::generic_category().message(status));
  }
}

}  // namespace quarvel
