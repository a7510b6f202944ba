#pragma once

#include <cstdint>

#include "base/StoreCounters.h"

namespace quarvel {

// What the service counts for its status (and for nothing else). From any thread; never waits.

/// A message has been taken from a client, or made by the service itself. From then on it is on its
/// way, until it has been handed to the telemetry agent (`agentSendMessage`, `sendOneMessage`),
/// which counts what it takes and what it refuses, or is counted as dropped. So nothing disappears
/// unnoticed: accepted = stored + waiting + dropped.
void CountAcceptedMessage();

/// The message never reaches the agent.
void CountDroppedMessage(StoreDrop reason);

/// What there is now.
enum class Gauge : std::uint8_t { clients, sessions, startedSessions };
void AddToGauge(Gauge gauge, int difference);

/// Counts as one of a kind for as long as it lives.
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
