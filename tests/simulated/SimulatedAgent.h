#pragma once

#include <cstdint>
#include <deque>
#include <optional>
#include <string>
#include <vector>

#include "platform/RelmReporting.h"
#include "tests/simulated/Scheduler.h"

namespace quarvel {

/// The telemetry agent: keeps what reaches it, fails as it is told. Its completions run on
/// simulated threads of their own.
struct SimulatedAgent {
  struct Message {
    std::uint16_t category;
    std::uint16_t type;
    Payload payload;
    Scheduler::Duration at;
  };
  struct Session {
    Dictionary info;
    Dictionary userInfo;
    std::vector<Message> messages;
    /// Also those that were refused.
    std::vector<Message> offered;
    /// When a configuration found backends, after how long.
    std::optional<Scheduler::Duration> foundAfter;
    /// The number of the queue on which the session was made.
    std::size_t queue = 0;
    std::vector<Scheduler::Duration> flushes;
    bool released = false;
  };
  struct SingleMessage {
    Dictionary info;
    Dictionary userInfo;
    Message message;
  };

  // Switches.

  /// What a session's configuration finds; none: no backends.
  std::optional<std::vector<std::string>> backends = std::vector<std::string>{"store"};
  /// How long a configuration takes.
  Scheduler::Duration answersAfter{0};
  /// Whether a configuration is answered at all.
  bool answers = true;
  std::optional<Error> sendError;
  std::optional<Error> flushError;
  std::optional<Error> singleMessageError;
  /// Whether there is no room: senders are held back until it is switched off (and time passes).
  bool full = false;

  std::vector<RelmReportingToken> tokens;
  std::deque<Session> sessions;  // references stay valid
  std::vector<SingleMessage> singleMessages;
  std::vector<SingleMessage> refusedSingleMessages;
};

}  // namespace quarvel
