#include <benchmark/benchmark.h>

#include <atomic>
#include <chrono>
#include <cstdint>

#include "queues/CallTracker.h"
#include "queues/WorkQueues.h"

namespace quarvel {
namespace {

/// A tracker without effect, of a call of 280 bytes.
class Counted final : public CallTracker {
 public:
  [[nodiscard]] std::size_t bytes() const override { return 280; }
  void blockRan(std::chrono::nanoseconds /*time*/) override {}
  void callExecuted() override {}
  void callCompleted() override {}
};

// One producer feeds one serial queue, like connections the server queue; the time ends when the
// last block has run. First argument: whether each block is queued under its own tracker. Second:
// the producer's work between two blocks; a slow producer finds the queue idle each time.
void AsyncToSerialQueue(benchmark::State& state) {
  constexpr std::int64_t kBlocks = 1'000'000;
  WorkQueues queues;
  const auto queue =
      queues.createSerialQueue("tarnwick.quarvel.bench", QualityOfService::userInteractive);
  for (auto _ : state) {
    std::int64_t run = 0;
    std::atomic<bool> done{false};
    for (std::int64_t i = 0; i < kBlocks; ++i) {
      CallRef hold;
      if (state.range(0) != 0) hold = CallRef(std::make_shared<Counted>());
      const CallScope scope(CallScope::Of::call, hold);
      for (std::int64_t pause = 0; pause < state.range(1); ++pause) benchmark::DoNotOptimize(pause);
      queue->async([&run] { ++run; });
    }
    queue->async([&] {
      done = true;
      done.notify_one();
    });
    done.wait(false);
    if (run != kBlocks) state.SkipWithError("blocks were lost");
  }
  state.SetItemsProcessed(state.iterations() * kBlocks);
}
BENCHMARK(AsyncToSerialQueue)
    ->Args({0, 0})
    ->Args({1, 0})
    ->Args({0, 1000})
    ->UseRealTime()
    ->MeasureProcessCPUTime();

// From one queue to another and back: the cost of a wake-up without batching.
void PingPong(benchmark::State& state) {
  WorkQueues queues;
  const auto server =
      queues.createSerialQueue("tarnwick.quarvel.server", QualityOfService::userInteractive);
  const auto session =
      queues.createSerialQueue("tarnwick.quarvel.session", QualityOfService::utility);
  for (auto _ : state) {
    std::atomic<bool> done{false};
    server->async([&] {
      session->async([&] {
        done = true;
        done.notify_one();
      });
    });
    done.wait(false);
  }
}
BENCHMARK(PingPong)->UseRealTime()->MeasureProcessCPUTime();

}  // namespace
}  // namespace quarvel
