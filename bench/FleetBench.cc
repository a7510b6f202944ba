// Measures the export of a fleet: the exporters of many devices in one process, each with its own
// store, against a running NATS cluster. Each store holds its rows before its exporter starts; the
// measured time ends with the acknowledgement of the last row. Prints one JSON line.
//
// Usage: fleet-bench DIRECTORY DEVICES ROWS URL...

#include <fmt/format.h>
#include <sys/resource.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iterator>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "base/Value.h"
#include "export/Exporters.h"
#include "export/nats/NatsEngine.h"

namespace quarvel {
namespace {

using std::chrono::steady_clock;

/// One device of the fleet: a store and its NATS exporter. Used by the main thread.
class Device {
 public:
  Device(const std::filesystem::path& directory, int number)
      : name_(fmt::format("device-{}", number)) {
    TelemetryStore::Options options;
    options.path = directory / (name_ + ".db");
    options.sync = {};
    options.remoteBackends = {"nats"};
    auto store = TelemetryStore::open(std::move(options));
    if (!store) {
      fmt::print(stderr, "{}\n", store.error().description());
      std::exit(1);
    }
    store_ = std::move(store.value());
  }

  void fill(int rows) {
    for (int i = 0; i < rows; ++i) {
      const Payload payload(Dictionary{{"Route", "Speaker"},
                                       {"SampleRate", 48'000},
                                       {"IOBufferFrames", 480},
                                       {"GlitchCount", i},
                                       {"HALLatency", 0.0112},
                                       {"HostApplicationDisplayID", "org.example.player"},
                                       {"Device", "builtin-speaker-0"},
                                       {"Active", true}});
      static_cast<void>(store_->addMessage(
          {std::nullopt, 4102, "tarnwick.quarvel", "nonlongformaudio_session", 3, 1, payload}));
    }
  }

  void start(const NatsSettings& nats) {
    std::vector<Exporters::Backend> backends;
    backends.push_back(
        {{"nats", 1'000'000}, std::make_unique<NatsEngine>(nats, ExportDevice{name_, "bench"})});
    exporters_ = std::make_unique<Exporters>(*store_, std::move(backends), true);
  }
  [[nodiscard]] std::uint64_t exported() const {
    return exporters_->threads().front()->status().exportedRows;
  }
  [[nodiscard]] std::uint64_t waiting() const { return store_->counters().waiting; }

 private:
  const std::string name_;
  std::unique_ptr<TelemetryStore> store_;
  std::unique_ptr<Exporters> exporters_;  // declared after the store that it uses
};

double CpuSeconds() {
  rusage used{};
  getrusage(RUSAGE_SELF, &used);
  const auto seconds = [](const timeval& time) {
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_usec) / 1e6;
  };
  return seconds(used.ru_utime) + seconds(used.ru_stime);
}

long ResidentKibibytes() {
  std::ifstream file("/proc/self/statm");
  long pages = 0;
  file >> pages >> pages;
  return pages * sysconf(_SC_PAGESIZE) / 1024;
}

std::ptrdiff_t Threads() {
  return std::distance(std::filesystem::directory_iterator("/proc/self/task"), {});
}

void AwaitAll(const std::vector<std::unique_ptr<Device>>& devices,
              const std::function<bool(const Device&)>& condition) {
  for (const auto& device : devices) {
    while (!condition(*device)) std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
}

int Run(int argumentCount, char** arguments) {
  if (argumentCount < 5) {
    fmt::print(stderr, "usage: fleet-bench DIRECTORY DEVICES ROWS URL...\n");
    return 2;
  }
  const int count = std::atoi(arguments[2]);
  const int rows = std::atoi(arguments[3]);
  NatsSettings nats;
  nats.urls.assign(arguments + 4, arguments + argumentCount);
  nats.acknowledge = std::chrono::seconds(60);
  const long residentBefore = ResidentKibibytes();
  // Never destroyed, so that the measured time does not include closing hundreds of stores.
  auto& devices = *new std::vector<std::unique_ptr<Device>>;
  for (int i = 0; i < count; ++i) {
    devices.push_back(std::make_unique<Device>(arguments[1], i));
    devices.back()->fill(rows);
  }
  AwaitAll(devices, [](const Device& device) { return device.waiting() == 0; });

  const double cpuBefore = CpuSeconds();
  const auto begun = steady_clock::now();
  for (const auto& device : devices) device->start(nats);
  const auto wanted = static_cast<std::uint64_t>(rows);
  AwaitAll(devices, [wanted](const Device& device) { return device.exported() == wanted; });
  const std::chrono::duration<double> taken = steady_clock::now() - begun;
  const double cpu = CpuSeconds() - cpuBefore;
  const double all = static_cast<double>(count) * rows;
  fmt::print(R"({{"devices":{},"rows":{},"seconds":{:.3f},"rows_per_second":{:.0f},)"
             R"("cpu_us_per_row":{:.1f},"kib_per_device":{},"threads_per_device":{:.1f}}})"
             "\n",
             count, rows, taken.count(), all / taken.count(), cpu * 1e6 / all,
             (ResidentKibibytes() - residentBefore) / count,
             static_cast<double>(Threads()) / count);
  return 0;
}

}  // namespace
}  // namespace quarvel

int main(int argumentCount, char** arguments) {
  const int status = quarvel::Run(argumentCount, arguments);
  std::fflush(stdout);
  _exit(status);
}
