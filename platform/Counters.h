#pragma once

#include <cstdint>

namespace quarvel {

// Counters of the service, for its status alone. From any thread; never block.

/// Counts a message that was taken from a client, or made by the service itself. The message is in
/// flight until the telemetry agent gets it (`agentSendMessage`, `sendOneMessage`), which counts
/// taken and refused messages, or until it is counted as dropped. Every message is accounted for:
/// accepted = stored + waiting + dropped.
void CountAcceptedMessage();

/// Why a message never reaches the agent.
enum class MessageDrop : std::uint8_t {
  noAgentSession,   // the session found no backend
  testServiceType,  // messages of the service type "test" are not sent
  noSuchSession,    // it was for a session that nobody has
};
/// Counts an accepted message that ends here.
void CountDroppedMessage(MessageDrop reason);

/// Objects that are counted while they exist.
enum class Gauge : std::uint8_t { clients, sessions, startedSessions };
void AddToGauge(Gauge gauge, int difference);

/// Adds 1 to a gauge for its own lifetime. A member of the counted object.
class CountedAs {
 public:
  explicit CountedAs(Gauge gauge) : gauge_(gauge) { AddToGauge(gauge_, 1); }
  ~CountedAs() { AddToGauge(gauge_, -1); }
  CountedAs(const CountedAs&) = delete;
  CountedAs& operator=(const CountedAs&) = delete;

 private:
  const Gauge gauge_;
};

}  // namespace quarvel
