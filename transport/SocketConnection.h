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
#include "system/Configuration.h"
#include "transport/ConnectionChurnLimit.h"
#include "transport/ReadBuffer.h"
#include "transport/ReplyQueue.h"
#include "transport/UniqueDescriptor.h"

namespace quarvel {

class SocketConnection;
struct Request;

/// What the connections of one listener share. Lives as long as any of them.
struct ConnectionContext {
  explicit ConnectionContext(const Configuration::Limits& connectionLimits)
      : limits(connectionLimits) {}

  asio::io_context io{1};  // run by the I/O thread alone
  const Configuration::Limits limits;
  ConnectionChurnLimit passages;
  /// Told, on the I/O thread, of each connection that has ended. Constant once the listener serves.
  std::function<void(const std::shared_ptr<SocketConnection>&)> connectionEnded;
};

/// One client on a stream socket, speaking MessagePack-RPC. All of it belongs to the I/O thread,
/// except where it says otherwise; calls and their replies meet it at the `ReplyQueue`.
///
/// Shared by its listener until it has ended, by whoever was handed it, and by the waits it has
/// begun. A wait for the socket or a timer is begun at most once at a time.
class SocketConnection final : public ClientConnection,
                               public std::enable_shared_from_this<SocketConnection> {
 public:
  /// Null when the kernel has no room for a further socket to be watched. `number` tells
  /// connections of one process apart in log lines.
  [[nodiscard]] static std::shared_ptr<SocketConnection> create(
      std::shared_ptr<ConnectionContext> context, UniqueDescriptor socket, std::uint64_t number);

  [[nodiscard]] std::int32_t processIdentifier() const override { return processIdentifier_; }
  void setExportedInterface(const ExportedInterface& exportedInterface) override;
  void setExportedObject(std::shared_ptr<ExportedObject> object) override;
  [[nodiscard]] std::shared_ptr<ExportedObject> exportedObject() const override;
  void setInterruptionHandler(std::function<void()> handler) override;
  void setInvalidationHandler(std::function<void()> handler) override;
  /// Any thread.
  void resume() override;
  [[nodiscard]] std::string description() const override;

  /// Closes a connection that nobody wants, without telling anybody but the client.
  void refuse();
  /// Ends the connection as if its client had gone this moment: what it has sent is still carried
  /// out, then the invalidation handler is called.
  void endInOrder();

 private:
  SocketConnection(std::shared_ptr<ConnectionContext> context, std::uint64_t number);

  // Reading.
  void proceed();
  bool decode();
  void receive();
  [[nodiscard]] std::optional<std::size_t> readAvailable();
  [[nodiscard]] bool mustWait();
  void carryOut(std::string_view frame);
  void dispatch(const Request& request, std::size_t frameBytes);

  // Writing.
  void attend();
  void flush();
  void waitUntilWritable();

  // Clocks.
  void watchFrame();
  void awaitFrameDeadline();
  void unwatchFrame();
  void watchStall();
  void unwatchStall();
  void watchThoseBehind();

  // Ends.
  void breach(std::string_view fault);
  void giveUp(std::string_view why);
  void end(bool interrupted);

  // Constant after construction.
  const std::shared_ptr<ConnectionContext> context_;
  const std::uint64_t number_;
  std::int32_t processIdentifier_ = 0;
  std::shared_ptr<ReplyQueue> desk_;

  // Constant from `resume` to the end.
  const ExportedInterface* interface_ = nullptr;
  std::shared_ptr<ExportedObject> object_;
  std::function<void()> interruptionHandler_;
  std::function<void()> invalidationHandler_;

  // The I/O thread's.
  asio::posix::stream_descriptor socket_;
  bool open_ = true;
  bool resumed_ = false;
  bool lastWords_ = false;  // the service ends: what has arrived is taken in, whatever the limits

  bool reading_ = false;  // waits until the socket is readable
  ReadBuffer buffer_;
  MessagePackScanner scanner_;
  std::vector<PayloadValue> arguments_;  // of the call being made; kept for its memory

  bool writing_ = false;  // waits until the socket is writable
  std::string sending_;
  std::size_t sent_ = 0;  // bytes of `sending_`

  asio::steady_timer frameTimer_;
  bool frameTimerRuns_ = false;
  bool frameIsPartial_ = false;
  std::chrono::steady_clock::time_point frameDeadline_;  // of the partial frame
  asio::steady_timer stallTimer_;
  bool stallTimerRuns_ = false;
  asio::steady_timer behindTimer_;
  bool behindTimerRuns_ = false;
};

}  // namespace quarvel
