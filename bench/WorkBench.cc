#include <benchmark/benchmark.h>

#include <atomic>
#include <chrono>
#include <cstdint>

#include "queues/CallTracker.h"
#include "queues/WorkQueues.h"

namespace quarvel {
namespace {

class Counted final : public CallTracker {
 public:
  [[nodiscard]] std::size_t bytes() const override { return 280; }
  void ran(std::chrono::nanoseconds /*time*/) override {}
  void carriedOut() override {}
  void completed() override {}
};

// One producer to one serial queue, as connections feed the server's queue; timed until the last
// block has run. First argument: whether each block is queued under a tracker of its own. Second:
// work of the producer's own between two blocks; slow producers find the queue at rest again.
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

// There and back between two queues: what a wake-up costs when there is nothing to batch.
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
