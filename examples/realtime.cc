// An audio callback reports messages: between two interrupts it allocates nothing, takes no lock
// and makes no system call. A thread that wakes up at the same rate stands for the audio device.
//
// Usage: realtime [SOCKET]    (else $QUARVEL_SOCKET, else where the service listens by default)

#include <quarvel/realtime.hpp>

#include <pthread.h>
#include <sched.h>

#include <chrono>
#include <cstdlib>
#include <iostream>
#include <random>
#include <thread>

using quarvel::Client;
using quarvel::RealtimeReporter;
using quarvel::ReporterID;
namespace vocabulary = quarvel::vocabulary;
using Clock = std::chrono::steady_clock;

namespace {

constexpr int kCallbacks = 200;
constexpr std::chrono::microseconds kPeriod(2'667);  // 128 frames at 48 kHz

/// Called in each period, on the device's thread.
void AudioCallback(RealtimeReporter& reporter, int number, double load) {
  reporter.record(vocabulary::Kind::performance, RealtimeReporter::MessageType::generic)
      .set("callback", number)
      .set("frames", 128)
      .set("load", load)
      .set("late", load > 1.0)
      .send();
}

void RunDevice(RealtimeReporter& reporter) {
  // A device's thread has real-time priority; without the permission this stays an ordinary thread.
  const sched_param priority{sched_get_priority_min(SCHED_FIFO)};
  pthread_setschedparam(pthread_self(), SCHED_FIFO, &priority);
  Clock::time_point next = Clock::now();
  double load = 0;
  for (int i = 0; i < kCallbacks; ++i) {
    std::this_thread::sleep_until(next += kPeriod);
    const auto begun = Clock::now();
    AudioCallback(reporter, i, load);
    load = std::chrono::duration<double>(Clock::now() - begun) / kPeriod;
  }
}

}  // namespace

int main(int argc, char** argv) {
  auto connected = Client::connect(argc > 1 ? argv[1] : "");
  if (!connected) {
    std::cerr << connected.error().description() << '\n';
    return EXIT_FAILURE;
  }
  Client& client = connected.value();
  std::random_device random;
  const ReporterID session = std::uniform_int_distribution<ReporterID>(1)(random);
  client.createReportingSession(session);
  client.setServiceType(Client::ServiceType::audioDeviceUsage, session);
  client.startReportingSessionForID(session);

  RealtimeReporter::Options options;
  options.interval = std::chrono::milliseconds(50);
  options.lost = [](const RealtimeReporter::Loss& loss) {
    std::cerr << loss.total() << " records are lost\n";
  };
  RealtimeReporter reporter(client, session, options);
  reporter.start();
  std::thread device(RunDevice, std::ref(reporter));
  device.join();
  reporter.stop();  // the last records go ahead of the session's end

  const auto stopped = client.sync().stopReportingSessionForID(session);
  if (!stopped) std::cerr << stopped.error().description() << '\n';
  std::cout << reporter.statistics().sent << " records sent\n";
  return stopped ? EXIT_SUCCESS : EXIT_FAILURE;
}
