#include "system/StatusFile.h"

#include <chrono>
#include <system_error>
#include <utility>

#include "base/Files.h"
#include "base/Json.h"
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

StatusFile::StatusFile(Status& status, std::filesystem::path path)
    : status_(status),
      path_(std::move(path)),
      queue_(CreateSerialQueue("tarnwick.quarvel.status", QualityOfService::utility)) {
  ZQ_FUNCTION("AnswerStatusRequests");
  status.add(DescribeProcess());
  NotificationToken token = 0;
  const std::int32_t failure = RegisterForNotification(kStatusNotification, token, *queue_,
                                                       [this](NotificationToken) { write(); });
  if (failure != 0) {
    ZQ_LOG(nullptr, error, "nobody can ask for the status: {}",
           std::generic_category().message(failure));
  }
}

void StatusFile::write() const {
  ZQ_FUNCTION("WriteStatusFile");
  const Outcome written =
      ReplaceFile(path_.native(), JsonText(status_.describe()) + "\n", kPrivateFile);
  if (!written) {
    ZQ_LOG(nullptr, error, "the status cannot be written: {}", written.error().description());
  }
}

}  // namespace quarvel
