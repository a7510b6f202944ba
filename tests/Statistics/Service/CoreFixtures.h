#pragma once

#include <functional>

#include "Statistics/Service/ServiceMain.h"
#include "Statistics/Service/ZQReportingServiceDelegate.h"
#include "Statistics/Service/ZQReportingSession.h"
#include "tests/simulated/Simulation.h"

namespace quarvel {

/// A client of the service, with an operation of the protocol each.
class Client : public SimulatedClient {
 public:
  explicit Client(SimulatedClient client) : SimulatedClient(std::move(client)) {}
  Call create(ReporterID id) { return call("createReportingSession:reply:", {id}); }
  Call setServiceType(std::uint16_t type, ReporterID id) {
    return call("setServiceType:reportingSession:reply:", {type, id});
  }
  Call serviceType(ReporterID id) { return call("getServiceNameForReporterID:reply:", {id}); }
  Call configure(Dictionary configuration, ReporterID id) {
    return call("setConfiguration:forReporterID:reply:", {std::move(configuration), id});
  }
  Call start(ReporterID id) { return call("startReportingSessionForID:reply:", {id}); }
  /// To the sessions of `ids`, or a broadcast.
  Call send(Dictionary payload, std::uint32_t category = 3, std::uint16_t type = 1,
            std::optional<List> ids = std::nullopt) {
    return call("sendMessage:withCategory:andType:forReportingIDs:reply:",
                {std::move(payload), category, type, ids ? Value(*std::move(ids)) : Value()});
  }
  Call stop(ReporterID id) { return call("stopReportingSessionForID:reply:", {id}); }
  Call destroy(ReporterID id) { return call("destroyReportingSession:reply:", {id}); }
  Call valid(ReporterID id) { return call("reporterID:valid:", {id}); }
  Call reporters() { return call("getAllReporters:", {}); }
  void createStarted(ReporterID id) {
    create(id);
    start(id);
  }
};

/// The whole service on the simulated platform, as its process entry sets it up.
struct RunningService : Simulation {
  /// `prepare` arranges the platform before the service starts.
  explicit RunningService(
      std::uint64_t seed, const std::function<void(Simulation&)>& prepare = [](Simulation&) {})
      : Simulation(seed) {
    prepare(*this);
    EXPECT_EQ(ServiceMain(), 0);
  }
  /// Connects a client and runs until it is registered, so that clients are registered in this
  /// order.
  [[nodiscard]] Client connect(std::int32_t pid) {
    Client client(listener.connect(pid));
    run();
    return client;
  }
};

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
