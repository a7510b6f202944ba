#pragma once

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Statistics/Service/ZQReportingSession.h"
#include "tests/simulated/Simulation.h"

namespace quarvel {

/// A session that the test owns. The test runs only while the simulation does not, in place of the
/// `ServerQueue`.
struct SessionOwner : Simulation {
  explicit SessionOwner(std::uint64_t seed, std::uint16_t serviceType = 0) : Simulation(seed) {
    setServiceType(serviceType);
  }
  static void holdServerQueue() QUARVEL_ASSERT_CAPABILITY(serverQueueRole) {}

  void setServiceType(std::uint16_t serviceType) {
    holdServerQueue();
    session->setServiceType(serviceType);
    log.lines.clear();
    journal.clear();
  }
  void start() {
    holdServerQueue();
    session->start();
  }
  void stop() {
    holdServerQueue();
    session->stop();
  }
  void send(const Dictionary& payload = {{"a", 1}}, std::uint32_t category = 3) {
    holdServerQueue();
    session->sendMessage(Payload(payload), category, 1, nullptr);
  }
  [[nodiscard]] std::vector<std::string> errors() const { return log.texts("error"); }
  /// Messages that reached the agent inside its one session.
  [[nodiscard]] const std::vector<SimulatedAgent::Message>& delivered() const {
    return agent.sessions.at(0).messages;
  }

  std::shared_ptr<ZQReportingSession> session = ZQReportingSession::initWithID(7, {42});
};

}  // namespace quarvel
