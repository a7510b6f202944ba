#pragma once

#include <asio/io_context.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/steady_timer.hpp>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/MessagePack.h"
#include "platform/ClientConnection.h"
#include "queues/CallTracker.h"
#include "quotas/FlowControl.h"
#include "system/Configuration.h"
#include "transport/Call.h"
#include "transport/ListeningSocket.h"
#include "transport/ReadBuffer.h"

namespace quarvel {

class SocketConnection;
struct Request;

/// The event loop, limits and counts that the connections of one listener share.
/// Owner: the listener, its connections and their calls; lives as long as the last of them.
struct ConnectionContext : std::enable_shared_from_this<ConnectionContext> {
  explicit ConnectionContext(const Configuration::Limits& connectionLimits)
      : limits(connectionLimits) {}

  /// I/O thread. Counts the begin or the end of a connection until all blocks that are queued under
  /// the returned reference have run.
  [[nodiscard]] CallRef trackConnectionChange();

  asio::io_context io{1};  // run by the I/O thread alone
  const Configuration::Limits limits;
  ChurnLimit churn;

  // Constant once the listener serves.

  /// Any thread: `churn` allows clients to be accepted again.
  std::function<void()> acceptAgain;
  /// I/O thread: a connection has ended.
  std::function<void(const std::shared_ptr<SocketConnection>&)> connectionEnded;
};

/// One client on a stream socket, speaking MessagePack-RPC: decodes its calls, makes them on the
/// exported object, writes their replies, and ends a client that breaks a limit.
///
/// Owner: the listener until the connection has ended, the delegate if it keeps a reference, and
/// the pending waits. At most one wait is pending for reading, for writing and for each timer.
/// Thread: the I/O thread, except where another is named; calls report through `CallChannel`.
class SocketConnection final : public ClientConnection,
                               public std::enable_shared_from_this<SocketConnection> {
 public:
  /// `number` tells connections of one process apart in log lines. Null when the kernel has no room
  /// to watch a further socket.
  [[nodiscard]] static std::shared_ptr<SocketConnection> create(
      std::shared_ptr<ConnectionContext> context, UniqueDescriptor socket, std::uint64_t number);

  /// Of the process that connected, as the kernel tells at accept. Any thread.
  [[nodiscard]] std::int32_t processIdentifier() const override { return processIdentifier_; }
  // Set by the delegate while it accepts the connection, before `resume`.

  /// `exportedInterface` is constant and outlives the connection.
  void setExportedInterface(const ExportedInterface& exportedInterface) override;
  /// Holds the object until the connection has ended.
  void setExportedObject(std::shared_ptr<ExportedObject> object) override;
  /// Null before it is set and after the end.
  [[nodiscard]] std::shared_ptr<ExportedObject> exportedObject() const override;
  /// Called once, before the invalidation handler, when the client broke the protocol.
  void setInterruptionHandler(std::function<void()> handler) override;
  /// Called once, when the connection ends, however it ends.
  void setInvalidationHandler(std::function<void()> handler) override;
  /// Any thread.
  void resume() override;
  [[nodiscard]] std::string description() const override;

  /// Closes a connection that the delegate did not accept. Calls no handler.
  void refuse();
  /// Ends the connection as if its client had gone now: executes every call that has arrived,
  /// beyond any limit, then calls the invalidation handler.
  void drainAndEnd();

 private:
  SocketConnection(std::shared_ptr<ConnectionContext> context, std::uint64_t number);

  // Reading.

  /// Makes the calls that have been read, as far as the limits allow, then waits for more bytes. A
  /// limit that stopped it calls it again when there is room.
  void proceed();
  /// Makes calls until the limits, the turn or an incomplete call stop it. Whether bytes are left
  /// that may be a complete call.
  [[nodiscard]] bool decode();
  /// The socket is readable.
  void receive();
  /// Reads once. The number of bytes read; none when the client has gone.
  [[nodiscard]] std::optional<std::size_t> readAvailable();
  /// Whether the client waits until calls complete or until it reads its replies. A wake through
  /// the channel, the socket or a timer then calls `proceed`.
  [[nodiscard]] bool mustWait();
  /// One complete MessagePack value: a call, or a protocol error.
  void execute(std::string_view frame);
  /// Makes a call on the exported object, or answers with the reason why it cannot be made.
  void dispatch(const Request& request, std::size_t frameBytes);

  // Writing.

  /// Woken through the channel: replies are queued, or the limits allow calls again.
  void onRepliesOrRoom();
  /// Writes all queued replies, with one write where the socket takes them.
  void flush();
  /// Has `flush` called when the socket takes bytes again. At most one such wait is pending.
  void waitUntilWritable();

  // Time-outs: `limits.frame` for a partial message while the client could send the rest,
  // `limits.stall` while it reads no reply and the most replies are held.

  /// Sets the deadline of a message that has begun, unless one is set.
  void watchFrame();
  /// Waits for `frameDeadline_`, then ends the client or, if the deadline moved, waits on.
  void awaitFrameDeadline();
  /// The message is complete, or the service itself holds the client back.
  void unwatchFrame();
  /// Begins the stall time-out if the socket takes no bytes and the most replies are held.
  void watchStall();
  /// The client has read replies.
  void unwatchStall();
  /// Exempts calls that wait for a slow backend from the limit on unstored calls, after a time.
  void watchSlowCalls();

  // Ends.

  /// Bytes that are no call: logs `fault`, calls both handlers.
  void endForProtocolError(std::string_view fault);
  /// Logs `reason`, calls the invalidation handler alone.
  void endForTimeout(std::string_view reason);
  /// Closes the socket, calls the handlers and releases the exported object. Once.
  void end(bool interrupted);

  // Constant after construction.
  const std::shared_ptr<ConnectionContext> context_;
  const std::uint64_t number_;
  std::int32_t processIdentifier_ = 0;
  std::shared_ptr<CallChannel> channel_;

  // Constant from `resume` to the end.
  const ExportedInterface* interface_ = nullptr;
  std::shared_ptr<ExportedObject> object_;
  std::function<void()> interruptionHandler_;
  std::function<void()> invalidationHandler_;

  // The I/O thread's.
  asio::posix::stream_descriptor socket_;
  bool open_ = true;  // until `end`
  bool resumed_ = false;
  bool draining_ = false;  // the service ends: no limit applies to calls that have arrived

  bool reading_ = false;  // waits until the socket is readable
  ReadBuffer buffer_;
  MessagePackScanner scanner_;           // of the first frame in `buffer_`
  std::vector<PayloadValue> arguments_;  // of the current call; a member to reuse its memory

  bool writing_ = false;  // waits until the socket is writable
  std::string sending_;   // replies that were taken from the queue
  std::size_t sent_ = 0;  // bytes of `sending_`

  asio::steady_timer frameTimer_;
  bool frameTimerRuns_ = false;
  bool frameIsPartial_ = false;
  std::chrono::steady_clock::time_point frameDeadline_;  // of the partial frame
  asio::steady_timer stallTimer_;
  bool stallTimerRuns_ = false;
  asio::steady_timer slowCallsTimer_;
  bool slowCallsTimerRuns_ = false;
};

}  // namespace quarvel
