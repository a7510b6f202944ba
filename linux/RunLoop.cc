#include "platform/RunLoop.h"

#include <fmt/format.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <thread>
#include <utility>

#include "queues/BlockingScope.h"
#include "queues/Thread.h"
#include "queues/ThreadRunLoop.h"

namespace quarvel {

namespace {

class LinuxWorkerThread final : public WorkerThread {
 public:
  LinuxWorkerThread(std::string_view label, Block body) : label_(label), body_(std::move(body)) {}

  void start() override {
    constexpr int kStartersNice = 0;
    const int failure = StartThread(label_, kStartersNice, std::move(body_));
    if (failure == 0) return;
    fmt::print(stderr, "quarvel: no thread for {}: {}\n", label_, std::strerror(failure));
    std::abort();
  }

 private:
  const std::string_view label_;
  Block body_;  // until `start`
};

}  // namespace

RunLoop& RunLoop::current() {
  static thread_local ThreadRunLoop loop;
  return loop;
}

std::shared_ptr<RunLoopTimer> CreateRunLoopTimer(std::chrono::microseconds interval, Block block) {
  return ThreadRunLoop::createTimer(interval, std::move(block));
}

std::unique_ptr<WorkerThread> CreateWorkerThread(std::string_view label, Block body) {
  return std::make_unique<LinuxWorkerThread>(label, std::move(body));
}

void SleepThread(std::chrono::microseconds duration) {
  const BlockingScope blocking;
  std::this_thread::sleep_for(duration);
}

}  // namespace quarvel
