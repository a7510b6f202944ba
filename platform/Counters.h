#pragma once

#include <cstdint>

#include "base/StoreCounters.h"

namespace quarvel {

// Counters of the service, for its status alone. From any thread; never block.

/// Counts a message that was taken from a client, or made by the service itself. The message is in
/// flight until the telemetry agent gets it (`agentSendMessage`, `sendOneMessage`), which counts
/// taken and refused messages, or until it is counted as dropped. Every message is accounted for:
/// accepted = stored + waiting + dropped.
void CountAcceptedMessage();

/// Counts an accepted message that never reaches the agent.
void CountDroppedMessage(StoreDrop reason);

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
