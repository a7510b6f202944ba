#include "system/Status.h"

#include <fmt/format.h>

#include <chrono>
#include <system_error>
#include <utility>

#include "base/Files.h"
#include "base/Json.h"
#include "platform/Clock.h"
#include "platform/Log.h"
#include "platform/Notifications.h"
#include "platform/Process.h"

namespace quarvel {

namespace {

/// Adds a part's error, with the part's name in front.
void collectProblem(List& problems, const std::string& name, const Dictionary& part) {
  const Value* error = part.find("error");
  if (error == nullptr || error->string() == nullptr) return;
  problems.emplace_back(fmt::format("{}: {}", name, *error->string()));
}

std::string nameOf(const Dictionary& backend) {
  const Value* name = backend.find("name");
  return name != nullptr && name->string() != nullptr ? *name->string() : "backend";
}

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

void Status::add(Describe describe) {
  const MutexLock lock(mutex_);
  top_.push_back(std::move(describe));
}

void Status::addSection(std::string name, Describe describe) {
  const MutexLock lock(mutex_);
  sections_.emplace_back(std::move(name), std::move(describe));
}

void Status::addBackend(Describe describe) {
  const MutexLock lock(mutex_);
  backends_.push_back(std::move(describe));
}

Dictionary Status::describe() const {
  // Described without the lock: a description may take long, or add another.
  std::vector<Describe> top;
  Sections sections;
  std::vector<Describe> backends;
  {
    const MutexLock lock(mutex_);
    top = top_;
    sections = sections_;
    backends = backends_;
  }
  List problems;
  Dictionary parts;
  for (const Describe& describe : top) parts.merge(describe());
  for (const auto& [name, describe] : sections) {
    Dictionary part = describe();
    collectProblem(problems, name, part);
    parts.set(name, std::move(part));
  }
  List entries;
  for (const Describe& describe : backends) {
    Dictionary part = describe();
    collectProblem(problems, nameOf(part), part);
    entries.emplace_back(std::move(part));
  }
  parts.set("backends", std::move(entries));
  Dictionary status{{"healthy", problems.empty()}, {"problems", std::move(problems)}};
  status.merge(parts);
  return status;
}

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
