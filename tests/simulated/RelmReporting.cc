#include "platform/RelmReporting.h"

#include <fmt/format.h>

#include "tests/simulated/Simulation.h"

namespace quarvel {
namespace {

SimulatedAgent& Agent() {
  return Simulation::current().agent;
}

void AwaitRoom() {
  while (Agent().full) TheScheduler().sleep(100ms);
}

class SimulatedAgentSession final : public RelmReportingSession {
 public:
  SimulatedAgentSession(SimulatedAgent::Session& record, std::size_t number)
      : record_(record), number_(number) {}
  ~SimulatedAgentSession() override {
    record_.released = true;
    Simulation::current().note(fmt::format("agent {} released", number_));
  }
  void startConfiguration(ConfigurationCompletion completion) override {
    if (!Agent().answers) return;
    if (Agent().backends) record_.foundAfter = Agent().answersAfter;
    TheScheduler().after(Agent().answersAfter, [found = Agent().backends, completion] {
      TheScheduler().spawn("agent", [found, completion] { completion(found); });
    });
  }
  Outcome agentSendMessage(std::uint16_t category, std::uint16_t type,
                           const Payload& payload) override {
    AwaitRoom();
    Simulation::current().note(
        fmt::format("agent {} message {:#x} {:#x}", number_, category, type));
    record_.offered.push_back({category, type, payload, Simulation::current().elapsed()});
    if (Agent().sendError) return *Agent().sendError;
    record_.messages.push_back(record_.offered.back());
    return Success();
  }
  void flushMessages(FlushCompletion completion) override {
    Simulation::current().note(fmt::format("agent {} flush", number_));
    ++record_.flushes;
    TheScheduler().spawn("agent", [completion, error = Agent().flushError] { completion(error); });
  }
  [[nodiscard]] std::string description() const override {
    return fmt::format("<RelmReportingSession {}>", number_);
  }

 private:
  SimulatedAgent::Session& record_;
  const std::size_t number_;
};

}  // namespace

RelmReportingToken RelmReporting::newSecureHierarchyToken(
    const std::optional<RelmReportingToken>&) {
  return Agent().tokens.emplace_back(fmt::format("token {}", Agent().tokens.size() + 1));
}

std::shared_ptr<RelmReportingSession> RelmReporting::createAgentSession(
    const Dictionary& sessionInfo, const Dictionary& userInfo, const std::vector<std::string>&) {
  SimulatedAgent::Session& record = Agent().sessions.emplace_back();
  record.info = sessionInfo;
  record.userInfo = userInfo;
  record.queue = TheScheduler().currentQueue();
  Simulation::current().note(fmt::format("agent {} created", Agent().sessions.size()));
  return std::make_shared<SimulatedAgentSession>(record, Agent().sessions.size());
}

Outcome RelmReporting::sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                                      std::uint16_t category, std::uint16_t type,
                                      const Payload& payload) {
  AwaitRoom();
  Simulation::current().note(fmt::format("agent single {:#x} {:#x}", category, type));
  const auto& error = Agent().singleMessageError;
  const SimulatedAgent::Message message{category, type, payload, Simulation::current().elapsed()};
  Agent().singleMessages.push_back({sessionInfo, userInfo, message, error.has_value()});
  return error ? Outcome(*error) : Success();
}

}  // namespace quarvel
