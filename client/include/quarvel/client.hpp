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

/// The number under which a client knows its reporting session. The client chooses it; it is looked
/// up across all clients. 0 names no session.
using ReporterID = std::int64_t;

// NOLINTBEGIN(google-explicit-constructor): both views are there to be converted to.

/// What a call carries besides numbers: a dictionary in either of its forms, or nothing. A view for
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

/// Whom a message is for: the sessions named, or every started session of every client. A view for
/// the length of one call; it owns nothing.
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
/// reach the service in the order in which they were made. Replies are given one at a time, in the
/// order in which they arrive, on the thread that drives the connection: one of its own, or
/// whichever calls `dispatch` (see `Driver`). Calls made from a reply never wait: they go out
/// together when the replies that had arrived have been given.
///
/// Back-pressure: while the service holds this client back, a call waits in there, where the
/// connection has its own thread. Calls that may not wait (from a reply, or with a connection that
/// the caller drives) gather, and are refused with `Code::heldBack` beyond
/// `Options::gatheredBytes`.
///
/// Delivery: a call is written to one connection, once. When that breaks before the reply has come,
/// it may or may not have been carried out, and it is never repeated.
///
/// Errors: a reply that is passed is given exactly once, with an error where there is no result.
/// What the service refuses is an error of its own ("tarnwick.audio.reporting" while reporting is
/// switched off, "quarvel.connection" for a call that it does not know). What happens on this side
/// is of domain `kErrorDomain`. A call without a reply is sent as a notification; what the service
/// makes of it nobody hears. The asynchronous operations return `Code::none`, or why the call could
/// not be taken, which for a call without a reply is all that is ever heard of it.
///
/// Lifetime: destroying the client sends what has gathered, for which it waits five seconds at
/// most, closes the connection, which stops its sessions, and answers every call that still waits
/// with `Code::connectionLost`; after that no reply is given. A reply may destroy its client; then
/// the rest is answered when it has returned.
///
/// Fork: the connection stays the parent's. The child may destroy its copy, which closes the
/// child's descriptors and does nothing else, and must call nothing else. Descriptors are closed by
/// `exec`.
class Client {
  class Channel;

 public:
  using ServiceType = vocabulary::ServiceType;
  using Category = vocabulary::Category;
  using MessageType = vocabulary::MessageType;

  static constexpr std::string_view kErrorDomain = "quarvel.client";
  enum class Code : std::int64_t {
    none = 0,
    unreachable = 1,  // `connect`: the reason says what is missing and what to do
    connectionLost = 2,
    timedOut = 3,         // a synchronous form waited as long as it was told to
    wouldDeadlock = 4,    // a synchronous form, or `dispatch`, was called from a reply
    unexpectedReply = 5,  // the service's reply is not of the kind that the operation has
    heldBack = 6,         // too much has gathered; try again when the service has taken some
    deferred = 7          // see `Options::reconnect`
  };

  /// What the service knows of a reporter ID.
  struct Validity {
    ReporterID reporterID = 0;  // 0: there is no such session
    ServiceType serviceType = ServiceType::unknown;
    [[nodiscard]] bool valid() const { return reporterID != 0; }
  };

  /// A call made without one is sent as a notification, which the service does not answer.
  template <class T>
  using Reply = std::function<void(Result<T>)>;

  /// Who reads the socket, gives the replies and keeps the times.
  enum class Driver : std::uint8_t {
    ownThread,  // a thread of the connection's own, which takes no signals
    caller      // `dispatch`; no thread is made
  };

  /// From `firstDelay` on, the wait doubles with each attempt that fails, up to `longestDelay`, and
  /// varies by a quarter. It begins anew when a connection has lasted for ten seconds.
  struct Reconnect {
    std::chrono::milliseconds firstDelay{100};
    std::chrono::milliseconds longestDelay{30'000};
  };

  /// The connection broke, or is there again. Not told of when the client itself ends it.
  struct ConnectionChange {
    enum class Kind : std::uint8_t { lost, restored };
    Kind kind = Kind::lost;
    /// `lost`: why, of `Code::connectionLost`.
    Error why;
    /// `lost`: calls that waited for their reply and are answered with an error next.
    std::size_t unanswered = 0;
    /// Calls without a reply that are known not to have reached the service: `lost`: they had not
    /// left this process; `restored`: they were made in between. What had left it and was not
    /// read, nobody can count: whoever needs to know passes a reply.
    std::size_t unsent = 0;
    /// `lost`: sessions that will be made anew; `restored`: that have been.
    std::size_t sessions = 0;
  };

  struct Options {
    /// Empty: `defaultSocketPath()`.
    std::string socketPath;
    Driver driver = Driver::ownThread;

    /// With it a lost connection is made again, and so are the sessions that this client has asked
    /// for by the typed operations: created, with the service type and the configuration that they
    /// had, started if they were. The start's reply then tells of the end of the new start. Until
    /// then
    /// - calls about these sessions are answered with `Code::deferred`: what they ask of the
    /// session
    ///   holds when it is made anew. So do those that wait at the loss;
    /// - all other calls are answered with `Code::connectionLost`. Messages among them are gone.
    /// The service sees another client: its ID space and other clients' sessions are what they are.
    std::optional<Reconnect> reconnect;

    /// Called like a reply, before those that the change answers.
    std::function<void(const ConnectionChange&)> connectionChanged;

    /// What may gather where a call may not wait.
    std::size_t gatheredBytes = 4'194'304;
  };

  /// Connects to the service's socket. Waits only while the service's queue of new connections is
  /// full. The service must be there, also with `Options::reconnect`. Errors: `Code::unreachable`.
  [[nodiscard]] static Result<Client> connect(const Options& options);
  /// With the other options as they are by default.
  [[nodiscard]] static Result<Client> connect(std::string_view socketPath = {});

  /// `$QUARVEL_SOCKET`; else reporting.sock in the first directory that has one of
  /// `$RUNTIME_DIRECTORY`, `$XDG_RUNTIME_DIR/quarvel` (not for root) and /run/quarvel; when none
  /// has, where this user's own service would put it.
  [[nodiscard]] static std::string defaultSocketPath();

  Client(Client&& other) noexcept;
  Client& operator=(Client&& other) noexcept;
  ~Client();

  /// False while the connection is lost.
  [[nodiscard]] bool connected() const;

  /// For `Driver::caller`: a descriptor that is readable while something is due, be it input, room
  /// for output or a time that has come. Watch it for readability, level- or edge-triggered, and
  /// call `dispatch` each time; it stays the same however often the connection is made anew. It is
  /// the client's: stop watching it before the client goes. -1 for `Driver::ownThread`.
  [[nodiscard]] int descriptor() const;

  /// Does what is due and returns: gives replies, writes what has gathered, reconnects, drains
  /// real-time reporters. Waits until something is due, for `wait` at most; none: as long as it
  /// takes. From one thread at a time, the one that uses the synchronous forms. Returns
  /// `Code::none`; `Code::connectionLost` when that is for good, so that watching the descriptor
  /// may end; `Code::wouldDeadlock` from a reply, beside another thread's `dispatch`, and where the
  /// connection has its own thread: then it has done nothing.
  Code dispatch(std::optional<std::chrono::milliseconds> wait = std::chrono::milliseconds(0));

  // The service's operations, by the first keyword of their names.

  /// Makes a session under `reporterID`; one that this client already has there is replaced without
  /// being stopped. The reply is true.
  Code createReportingSession(ReporterID reporterID, Reply<bool> reply = {});

  /// Says what the session's audio is for. Only this client's own session; the reply is true
  /// whether or not there is one.
  Code setServiceType(ServiceType serviceType, ReporterID reportingSession, Reply<bool> reply = {});

  /// Despite its name this fetches the service type's code; unknown when there is no such session.
  Code getServiceNameForReporterID(ReporterID reporterID, Reply<ServiceType> reply);

  /// Merges `configuration` into the session's user information; a new value replaces an old one.
  /// Nothing changes when it is absent. Only this client's own session; the reply is true whether
  /// or not there is one.
  Code setConfiguration(PayloadArgument configuration, ReporterID reporterID,
                        Reply<bool> reply = {});

  /// Starts the session, whichever client's it is. `stopped` is answered with true **when the
  /// session stops**, which may be hours later. It is never answered, before the connection ends,
  /// when there is no such session or it is started already.
  Code startReportingSessionForID(ReporterID reporterID, Reply<bool> stopped = {});

  /// Sends a message to the sessions named by `reportingIDs`, started or not, or to every started
  /// one. The reply tells of the routing, not of the delivery.
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
  /// operations that are newer than this library. A service without it answers with an error. What
  /// it does to sessions is not made anew by `Options::reconnect`.
  Code call(std::string_view operation, std::span<const Value> arguments, Reply<Value> reply = {});

  /// While one exists, calls gather and go out together, at the latest when there are 64 KiB of
  /// them: one write to the socket instead of one a call. For a thread that has several messages at
  /// hand. A synchronous form sends what has gathered.
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

  /// The operations in their synchronous forms, each of which waits for its reply: until the
  /// connection is lost, or for `timeout` at most, after which it fails with `Code::timedOut` and a
  /// reply that comes later is discarded.
  [[nodiscard]] Synchronous sync(std::optional<std::chrono::milliseconds> timeout = std::nullopt);

 private:
  explicit Client(std::shared_ptr<Channel> channel);

  friend class RealtimeReporter;

  std::shared_ptr<Channel> channel_;  // constant after construction; null when moved from
};

/// The synchronous forms: same operations, same arguments, and the reply as result. To be used at
/// once and not kept: it refers to its client. Not from a reply (`Code::wouldDeadlock`). With
/// `Driver::caller` they dispatch while they wait, so that other replies are given in there, and
/// belong to the thread that dispatches.
class Client::Synchronous {
 public:
  [[nodiscard]] Result<bool> createReportingSession(ReporterID reporterID);
  [[nodiscard]] Result<bool> setServiceType(ServiceType serviceType, ReporterID reportingSession);
  [[nodiscard]] Result<ServiceType> getServiceNameForReporterID(ReporterID reporterID);
  [[nodiscard]] Result<bool> setConfiguration(PayloadArgument configuration, ReporterID reporterID);

  /// Since a start is answered only when the session stops, this form waits until the service has
  /// carried the start out, which it learns by asking for the ID's validity right behind it. True:
  /// the session is there, so it is started now, or was so already; `stopped` is answered as in the
  /// asynchronous form. False: there is no such session, and `stopped` will not be answered.
  [[nodiscard]] Result<bool> startReportingSessionForID(ReporterID reporterID,
                                                        Reply<bool> stopped = {});

  [[nodiscard]] Outcome sendMessage(PayloadArgument payload, Category category, MessageType type,
                                    Recipients reportingIDs);
  [[nodiscard]] Result<bool> stopReportingSessionForID(ReporterID reporterID);
  [[nodiscard]] Result<bool> destroyReportingSession(ReporterID reporterID);
  [[nodiscard]] Result<Validity> reporterID(ReporterID reporterID);
  [[nodiscard]] Result<std::vector<ReporterID>> getAllReporters();

  /// Waits until the service has gone; success is that it has.
  [[nodiscard]] Outcome killService();

  /// A call that the service never answers (a second start) waits for the time-out, or for ever.
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
