#include "platform/WorkQueue.h"

#include "tests/simulated/Simulation.h"

namespace quarvel {
namespace {

class SimulatedWorkQueue final : public WorkQueue {
 public:
  explicit SimulatedWorkQueue(std::shared_ptr<Scheduler::Queue> queue) : queue_(std::move(queue)) {}
  [[nodiscard]] std::string_view label() const override { return queue_->name; }
  void async(Block block) override {
    TheScheduler().enqueue(queue_, std::move(block));
    TheScheduler().mayYield();
  }
  void asyncBrief(Block block) override {
    ++Simulation::current().briefBlocks;
    async(std::move(block));
  }
  void after(std::chrono::milliseconds delay, Block block) override {
    TheScheduler().after(delay, [queue = queue_, late = std::move(block)]() mutable {
      TheScheduler().enqueue(queue, std::move(late));
    });
  }
  [[nodiscard]] bool isCurrent() const override { return TheScheduler().isCurrent(*queue_); }

 private:
  const std::shared_ptr<Scheduler::Queue> queue_;
};

}  // namespace

std::unique_ptr<WorkQueue> CreateSerialQueue(std::string_view label, QualityOfService) {
  auto queue = TheScheduler().makeQueue(std::string(label), true);
  Simulation::current().queues.emplace_back(label, queue->number);
  return std::make_unique<SimulatedWorkQueue>(std::move(queue));
}
std::unique_ptr<WorkQueue>& ProcessServerQueue() {
  return Simulation::current().serverQueue;
}
WorkQueue& BackgroundQueue() {
  static SimulatedWorkQueue queue(std::make_shared<Scheduler::Queue>("background", false));
  return queue;
}

}  // namespace quarvel
