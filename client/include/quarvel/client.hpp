#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <initializer_list>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include <quarvel/vocabulary.hpp>

#include "base/Error.h"
#include "base/Payload.h"
#include "base/Value.h"

namespace quarvel {

/// A reporting session's number. Its client chooses it; all clients share one space of numbers. 0
/// names no session.
using ReporterID = std::int64_t;

// NOLINTBEGIN(google-explicit-constructor): arguments are converted to both views.

/// An argument that is a dictionary, in either of its forms, or absent. A view for
/// the length of one call; it owns nothing.
class PayloadArgument {
 public:
  PayloadArgument(const Payload& payload) : payload_(&payload) {}
  PayloadArgument(const Dictionary& dictionary) : dictionary_(&dictionary) {}
  PayloadArgument(std::nullopt_t) {}

  /// At most one of the two is not null.
  [[nodiscard]] const Payload* payload() const { return payload_; }
  [[nodiscard]] const Dictionary* dictionary() const { return dictionary_; }

 private:
  const Payload* payload_ = nullptr;
  const Dictionary* dictionary_ = nullptr;
};

/// The recipients of a message: the sessions named, or every started session of every client. A
/// view for the length of one call; it owns nothing.
class Recipients {
 public:
  Recipients(const ReporterID& session) : sessions_({&session, 1}) {}
  Recipients(std::initializer_list<ReporterID> sessions)
      : sessions_(std::span(sessions.begin(), sessions.size())) {}
  Recipients(const std::vector<ReporterID>& sessions) : sessions_(sessions) {}
  Recipients(std::span<const ReporterID> sessions) : sessions_(sessions) {}
  /// When no session is started anywhere, the service sends the message on its own.
  [[nodiscard]] static Recipients everyStartedSession() { return {}; }

  /// None: every started session.
  [[nodiscard]] const std::optional<std::span<const ReporterID>>& sessions() const {
    return sessions_;
  }

 private:
  Recipients() = default;
  std::optional<std::span<const ReporterID>> sessions_;
};

// NOLINTEND(google-explicit-constructor)

/// A connection to the reporting service.
///
/// Threads: every function but the destructor and the moves may be called from every thread. Calls
/// reach the service in their order. Replies are called one at a time, in the order in which they
/// arrive, on the thread that drives the connection: the connection's own, or the caller of
/// `dispatch` (see `Driver`). Calls made from a reply never wait: they are sent together after all
/// replies that have arrived.
///
/// Back-pressure: while the service does not read this client's socket, a call waits, where the
/// connection has its own thread. Calls that may not wait (from a reply, or with a connection that
/// the caller drives) gather, and are refused with `Code::heldBack` beyond
/// `Options::gatheredBytes`.
///
/// Delivery: a call is written to one connection, once. When that breaks before the reply arrives,
/// the call may or may not have been carried out; it is never repeated.
///
/// Errors: a reply is called exactly once, with an error where there is no result. A refusal by the
/// service is an error of the service's domains: "tarnwick.audio.reporting" while reporting is
/// switched off, "quarvel.connection" for an unknown call. A failure on this side is of domain
/// `kErrorDomain`. A call without a reply is sent as a notification, which the service never
/// answers. The asynchronous operations return `Code::none`, or the reason for which the call was
/// not accepted; for a call without a reply that is the only error ever reported.
///
/// Lifetime: the destructor sends the gathered calls, for at most five seconds, closes the
/// connection, which stops its sessions, and answers every pending call with
/// `Code::connectionLost`. No reply is called after that. A reply may destroy its client; the other
/// replies then follow its return.
///
/// Fork: the connection stays the parent's. The child may destroy its copy, which only closes the
/// child's descriptors, and must call nothing else. `exec` closes the descriptors.
class Client {
  class Channel;

 public:
  using ServiceType = vocabulary::ServiceType;
  using Category = vocabulary::Category;
  using MessageType = vocabulary::MessageType;

  static constexpr std::string_view kErrorDomain = "quarvel.client";
  enum class Code : std::int64_t {
    none = 0,
    unreachable = 1,  // `connect`: the reason names the obstacle and the remedy
    connectionLost = 2,
    timedOut = 3,         // a synchronous form waited for its whole time-out
    wouldDeadlock = 4,    // a synchronous form, or `dispatch`, was called from a reply
    unexpectedReply = 5,  // the service's reply is of another kind than the operation's
    heldBack = 6,         // too much has gathered; try again later
    deferred = 7          // see `Options::reconnect`
  };

  /// The service's answer about a reporter ID.
  struct Validity {
    ReporterID reporterID = 0;  // 0: there is no such session
    ServiceType serviceType = ServiceType::unknown;
    [[nodiscard]] bool valid() const { return reporterID != 0; }
  };

  /// The callback of a call. A call without one is sent as a notification, which the service does
  /// not answer.
  template <class T>
  using Reply = std::function<void(Result<T>)>;

  /// The thread that reads the socket, calls the replies and runs the timers.
  enum class Driver : std::uint8_t {
    ownThread,  // the connection's own thread, which takes no signals
    caller      // the thread in `dispatch`; the library makes none
  };

  /// The back-off between attempts: `firstDelay`, doubled after each failed attempt up to
  /// `longestDelay`, with a jitter of a quarter. Starts anew after a connection has lasted for ten
  /// seconds.
  struct Reconnect {
    std::chrono::milliseconds firstDelay{100};
    std::chrono::milliseconds longestDelay{30'000};
  };

  /// A loss of the connection, or its return. Not reported when the client itself ends it.
  struct ConnectionChange {
    enum class Kind : std::uint8_t { lost, restored };
    Kind kind = Kind::lost;
    /// `lost`: the reason, of `Code::connectionLost`.
    Error why;
    /// `lost`: pending calls, which are answered with an error next.
    std::size_t unanswered = 0;
    /// Calls without a reply that certainly did not reach the service. `lost`: calls that had not
    /// left this process; `restored`: calls made in between. Calls that had left the process unread
    /// cannot be counted: pass a reply to learn of each.
    std::size_t unsent = 0;
    /// `lost`: sessions that will be restored; `restored`: sessions that have been.
    std::size_t sessions = 0;
  };

  struct Options {
    /// Empty: `defaultSocketPath()`.
    std::string socketPath;
    Driver driver = Driver::ownThread;

    /// When set, a lost connection is made again. The sessions that this client made by the typed
    /// operations are then restored: created with their service type and configuration, and started
    /// if they were. The start's reply then reports the end of the new start. Until the return
    /// - calls about these sessions, also those pending at the loss, are answered with
    ///   `Code::deferred`: they take effect when the session is restored;
    /// - all other calls are answered with `Code::connectionLost`; messages among them are lost.
    /// To the service this is a new client; other clients and their sessions are not affected.
    std::optional<Reconnect> reconnect;

    /// Called like a reply, before the replies that the change causes.
    std::function<void(const ConnectionChange&)> connectionChanged;

    /// Bytes that may gather where a call may not wait.
    std::size_t gatheredBytes = 4'194'304;
  };

  /// Connects to the service's socket. Waits only while the service's queue of new connections is
  /// full. The service must be running, also with `Options::reconnect`. Errors:
  /// `Code::unreachable`.
  [[nodiscard]] static Result<Client> connect(const Options& options);
  /// The same with default options.
  [[nodiscard]] static Result<Client> connect(std::string_view socketPath = {});

  /// `$QUARVEL_SOCKET`; else reporting.sock in the first directory that has one of
  /// `$RUNTIME_DIRECTORY`, `$XDG_RUNTIME_DIR/quarvel` (not for root; /run/user/UID/quarvel when it
  /// is not set) and /run/quarvel. When none has: in /run/quarvel if this user may not look there,
  /// else in the first.
  [[nodiscard]] static std::string defaultSocketPath();

  Client(Client&& other) noexcept;
  Client& operator=(Client&& other) noexcept;
  ~Client();

  /// False while the connection is lost.
  [[nodiscard]] bool connected() const;

  /// For `Driver::caller`: a descriptor that is readable while an event is due: input, room for
  /// output or a timer. Watch it for readability, level- or edge-triggered, and call `dispatch`
  /// each time. It stays the same when the connection is made again. The client owns it: stop
  /// watching it before the client is destroyed. -1 for `Driver::ownThread`.
  [[nodiscard]] int descriptor() const;

  /// Handles the events that are due: calls replies, writes gathered calls, reconnects, drains
  /// real-time reporters. Waits for an event for at most `wait`; none: without limit. For one
  /// thread at a time, the one that uses the synchronous forms. Returns `Code::none`;
  /// `Code::connectionLost` when the connection is lost for good and watching the descriptor may
  /// end; `Code::wouldDeadlock`, without any effect, from a reply, beside another thread's
  /// `dispatch`, and where the connection has its own thread.
  Code dispatch(std::optional<std::chrono::milliseconds> wait = std::chrono::milliseconds(0));

  // The service's operations, by the first keyword of their names.

  /// Makes a session under `reporterID`; one that this client already has there is replaced without
  /// being stopped. The reply is true.
  Code createReportingSession(ReporterID reporterID, Reply<bool> reply = {});

  /// Sets the purpose of the session's audio. Only for this client's own session; the reply is true
  /// whether or not there is one.
  Code setServiceType(ServiceType serviceType, ReporterID reportingSession, Reply<bool> reply = {});

  /// Fetches, despite its name, the service type's code; unknown when there is no such session.
  Code getServiceNameForReporterID(ReporterID reporterID, Reply<ServiceType> reply);

  /// Merges `configuration` into the session's user information; a new value replaces an old one.
  /// Nothing changes when it is absent. Only this client's own session; the reply is true whether
  /// or not there is one.
  Code setConfiguration(PayloadArgument configuration, ReporterID reporterID,
                        Reply<bool> reply = {});

  /// Starts a session of any client. `stopped` is answered with true **when the session stops**,
  /// perhaps hours later. When there is no such session, or it is started already, `stopped` is not
  /// answered before the connection ends.
  Code startReportingSessionForID(ReporterID reporterID, Reply<bool> stopped = {});

  /// Sends a message to the sessions named by `reportingIDs`, started or not, or to every started
  /// one. The reply reports the routing, not the delivery.
  Code sendMessage(PayloadArgument payload, Category category, MessageType type,
                   Recipients reportingIDs, Reply<std::monostate> reply = {});

  /// Stops this client's own session; the reply is true whether or not there is one.
  Code stopReportingSessionForID(ReporterID reporterID, Reply<bool> reply = {});

  /// Stops this client's own session if need be and forgets it; the reply is true whether or not
  /// there is one.
  Code destroyReportingSession(ReporterID reporterID, Reply<bool> reply = {});

  /// Asks whether any client has a session of this ID.
  Code reporterID(ReporterID reporterID, Reply<Validity> valid);

  /// The IDs of every client's sessions.
  Code getAllReporters(Reply<std::vector<ReporterID>> reply);

  /// Ends the service at once. It never replies: `reply` receives `Code::connectionLost` when the
  /// service has gone, which here is success.
  Code killService(Reply<bool> reply = {});

  /// Any operation by its full keyword name with its arguments in order: for tools, and for
  /// operations newer than this library. A service without it answers with an error. Its effects on
  /// sessions are not restored by `Options::reconnect`.
  Code call(std::string_view operation, std::span<const Value> arguments, Reply<Value> reply = {});

  /// While one exists, calls gather and are sent together, at the latest at 64 KiB: one write to
  /// the socket instead of one for each call. For a thread that has several messages at hand. A
  /// synchronous form sends the gathered calls. Batches may nest.
  class [[nodiscard]] Batch {
   public:
    explicit Batch(Client& client);
    ~Batch();
    Batch(const Batch&) = delete;
    Batch& operator=(const Batch&) = delete;

   private:
    std::shared_ptr<Channel> channel_;
  };

  class Synchronous;

  /// The operations in their synchronous forms. Each waits for its reply until the connection is
  /// lost, and for at most `timeout`; then it fails with `Code::timedOut`, and a later reply is
  /// discarded.
  [[nodiscard]] Synchronous sync(std::optional<std::chrono::milliseconds> timeout = std::nullopt);

 private:
  explicit Client(std::shared_ptr<Channel> channel);

  friend class RealtimeReporter;

  std::shared_ptr<Channel> channel_;  // constant after construction; null when moved from
};

/// The synchronous forms: same operations, same arguments, and the reply as result. Use it at once
/// and do not keep it: it refers to its client. Not from a reply (`Code::wouldDeadlock`). With
/// `Driver::caller` they dispatch while they wait, so that other replies are called meanwhile, and
/// are for the thread that dispatches.
class Client::Synchronous {
 public:
  [[nodiscard]] Result<bool> createReportingSession(ReporterID reporterID);
  [[nodiscard]] Result<bool> setServiceType(ServiceType serviceType, ReporterID reportingSession);
  [[nodiscard]] Result<ServiceType> getServiceNameForReporterID(ReporterID reporterID);
  [[nodiscard]] Result<bool> setConfiguration(PayloadArgument configuration, ReporterID reporterID);

  /// Waits until the service has carried the start out, not until the session stops: it asks for
  /// the ID's validity right after the start. True: there is such a session, and it is started;
  /// `stopped` is answered as in the asynchronous form. False: there is no such session, and
  /// `stopped` will not be answered.
  [[nodiscard]] Result<bool> startReportingSessionForID(ReporterID reporterID,
                                                        Reply<bool> stopped = {});

  [[nodiscard]] Outcome sendMessage(PayloadArgument payload, Category category, MessageType type,
                                    Recipients reportingIDs);
  [[nodiscard]] Result<bool> stopReportingSessionForID(ReporterID reporterID);
  [[nodiscard]] Result<bool> destroyReportingSession(ReporterID reporterID);
  [[nodiscard]] Result<Validity> reporterID(ReporterID reporterID);
  [[nodiscard]] Result<std::vector<ReporterID>> getAllReporters();

  /// Waits until the service has ended, which is success.
  [[nodiscard]] Outcome killService();

  /// A call that the service never answers (a second start) waits for the time-out, or without
  /// limit.
  [[nodiscard]] Result<Value> call(std::string_view operation, std::span<const Value> arguments);

 private:
  friend class Client;
  Synchronous(Client& client, std::optional<std::chrono::milliseconds> timeout)
      : client_(client), timeout_(timeout) {}

  template <class T, class Request>
  Result<T> ask(const Request& request);

  Client& client_;
  std::optional<std::chrono::milliseconds> timeout_;
};

}  // namespace quarvel
