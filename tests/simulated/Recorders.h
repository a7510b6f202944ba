#pragma once

#include <array>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "platform/Counters.h"
#include "platform/Log.h"
#include "platform/Notifications.h"
#include "platform/Orientation.h"
#include "platform/RelmReporting.h"
#include "platform/ServiceListener.h"
#include "tests/simulated/Scheduler.h"

// Each recorder keeps the calls of one platform service and has a switch for each of its failures.
// The `Simulation` owns them all. Simulated threads use them while they hold the baton, the test
// between two runs.

namespace quarvel {

/// Telemetry agent. Its completions run on simulated threads of their own.
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
    std::vector<Message> offered;                   // refused messages too
    std::optional<Scheduler::Duration> foundAfter;  // set when a configuration finds backends
    std::size_t queue = 0;                          // number of the queue that made the session
    std::size_t flushes = 0;
    bool released = false;
  };
  struct SingleMessage {
    Dictionary info;
    Dictionary userInfo;
    Message message;
    bool refused;
  };
  // Switches.
  bool answers = true;                  // off: a configuration is never answered
  Scheduler::Duration answersAfter{0};  // duration of a configuration
  std::optional<std::vector<std::string>> backends = std::vector<std::string>{"store"};
  std::optional<Error> sendError;
  std::optional<Error> flushError;
  std::optional<Error> singleMessageError;
  bool full = false;  // on: senders are held back until it is off and 100 ms have passed
  // Records.
  std::vector<RelmReportingToken> tokens;
  std::deque<Session> sessions;  // references stay valid
  std::vector<SingleMessage> singleMessages;
};

/// A registered log scope. Lives, as its handle does, as long as the process.
class LogScope {
 public:
  std::string name;
};

struct LogLine {
  LogLevel level;
  std::string scope;  // "[default]" for the default log
  std::string function;
  std::string message;
  /// "default zqrs -[Class operation:]: message"; the journal has the same after "log ".
  [[nodiscard]] std::string text() const;
};

struct SimulatedLog {
  /// Switch: names of the scopes whose verbose lines are written.
  std::set<std::string, std::less<>> verbose;
  std::vector<LogLine> lines;
  /// The texts of the lines that begin with `prefix`.
  [[nodiscard]] std::vector<std::string> texts(std::string_view prefix = "") const;
  /// The messages alone, of all lines.
  [[nodiscard]] std::vector<std::string> messages() const;
};

/// Notification facility.
struct SimulatedNotifications {
  struct Registration {
    std::string name;
    NotificationToken token;
    WorkQueue* queue;
    NotificationHandler handler;
    bool pending = false;
  };
  /// Switch: the error number with which registrations fail.
  std::int32_t registrationStatus = 0;
  std::vector<std::shared_ptr<Registration>> registrations;

  /// Posts to every registration of that name. With an offset, handlers get a foreign token.
  void post(std::string_view name, NotificationToken tokenOffset = 0);
};

/// Service counters. Messages are conserved: once none is in flight, accepted = handed to the agent
/// (taken or refused) + dropped.
struct SimulatedCounters {
  std::uint64_t accepted = 0;
  std::array<std::uint64_t, 3> dropped{};
  std::array<std::int64_t, 3> gauges{};
  [[nodiscard]] std::uint64_t of(StoreDrop reason) const {
    return dropped[static_cast<std::size_t>(reason)];
  }
};

/// Source of `RandomBelow`, from the seed.
struct SimulatedRandom {
  std::mt19937 source;
  bool largest = false;  // switch: the largest number is drawn from now on
};

/// Orientation facility.
struct SimulatedOrientation {
  using Handlers = std::map<std::string, OrientationHandler, std::less<>>;
  Handlers device;
  Handlers ui;
  /// Calls `device` or `ui` on a simulated thread. Handlers must not wait there.
  static void turn(const Handlers& handlers, Orientation orientation);
};

/// File system.
struct SimulatedFiles {
  /// Path and content of every write in order, failed writes too.
  std::vector<std::pair<std::string, std::string>> writes;
  std::optional<Error> directoryError;  // switch, as the next
  std::optional<Error> writeError;
};

/// Driver statistics facility.
struct SimulatedTallix {
  using Name = std::optional<std::string>;
  struct Channel {
    Name group;
    Name subgroup;
    Name name;
    std::int64_t value = 0;
    bool published = true;  // else its group is known all the same
  };
  std::vector<Channel> channels;       // may change their values but not vanish
  std::optional<Error> channelsError;  // switch: the channels are returned all the same
  std::optional<Error> samplesError;   // switch
};

class SimulatedConnection;

/// One call of a client and every answer to it, later ones too.
struct RecordedCall {
  std::string method;
  List arguments;
  std::vector<Value> results;        // an error as its text
  std::optional<std::string> fault;  // the reason why it did not reach the exported object
};

/// An event that reached the service, recorded when its work is queued: the service executes
/// arrivals in this order.
struct Arrival {
  enum class Kind : std::uint8_t { connection, call, end, notification };
  Kind kind;
  std::size_t client = 0;  // in the order of connecting; unused for a notification
  std::shared_ptr<const RecordedCall> call;  // null unless it is a call
};

/// Client process: the far end of a connection. Its calls are made in order on the connection's own
/// simulated thread, once the connection serves. Copies are the same client; dropping one does not
/// disconnect.
class SimulatedClient {
 public:
  using Call = std::shared_ptr<const RecordedCall>;
  explicit SimulatedClient(const std::shared_ptr<SimulatedConnection>& connection);
  /// Sends `arguments`, as MessagePack, to the exported operation `method`.
  Call call(std::string method, const List& arguments);
  /// Breaks the protocol (interruption, then invalidation) or goes away (invalidation alone).
  void end(bool interrupted = false);
  [[nodiscard]] bool isReleased() const { return connection_.expired(); }

 private:
  std::weak_ptr<SimulatedConnection> connection_;
};

/// The process's listener, owned by the `Simulation`.
class SimulatedListener final : public ServiceListener {
 public:
  /// Connects a process. The delegate is asked on a platform thread, in the next run.
  SimulatedClient connect(std::int32_t processIdentifier);
  void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) override {
    delegate_ = std::move(delegate);
  }
  /// Returns at once, since the test has the main thread.
  void resume() override { resumed_ = true; }
  /// Releases an ended connection.
  void drop(const SimulatedConnection& connection);
  /// For the end of the simulation: releases everything.
  void release();

 private:
  std::shared_ptr<ServiceListenerDelegate> delegate_;
  std::vector<std::shared_ptr<SimulatedConnection>> connections_;
  std::size_t clients_ = 0;
  bool resumed_ = false;
};

}  // namespace quarvel
