#include "store/StoreHealth.h"

#include "platform/Log.h"

namespace quarvel {

void StoreHealth::failed(Error error) {
  ZQ_FUNCTION("StoreWriter::failed");
  failure_ = std::move(error);
  failing_ = hasNewFailure_ = true;
  setProblem(failure_.description());
  if (!line_.isDue()) return;
  ZQ_LOG(nullptr, error, "The telemetry store {} fails: {}. Trying again; {} rows wait.",
         path_.string(), failure_.description(), queue_.counters().waiting);
}

void StoreHealth::succeeded() {
  ZQ_FUNCTION("StoreWriter::succeeded");
  if (!std::exchange(failing_, false)) return;
  setProblem(std::nullopt);
  ZQ_LOG(nullptr, standard, "The telemetry store {} takes rows again.", path_.string());
}

void StoreHealth::setProblem(std::optional<std::string> problem) {
  MutexLock lock(mutex_);
  problem_ = std::move(problem);
}

std::optional<std::string> StoreHealth::problem() const {
  MutexLock lock(mutex_);
  return problem_;
}

}  // namespace quarvel
