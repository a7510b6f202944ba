#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>

#include "base/MessagePack.h"
#include "base/Value.h"

namespace quarvel {

/// Ends the program with the failed operation `what` and errno.
[[noreturn]] void Fail(const std::string& what);

/// A message that audio clients send every few seconds: about 280 bytes on the wire.
[[nodiscard]] Dictionary TypicalPayload();
/// A payload of `keys` similar keys.
[[nodiscard]] Dictionary PayloadOfKeys(std::size_t keys);

/// A request with `count` arguments, written by `arguments`.
[[nodiscard]] std::string CallFrame(std::uint32_t messageID, std::string_view method,
                                    const std::function<void(MessagePackWriter&)>& arguments,
                                    std::size_t count);
/// A request that sends `payload` to one session, or to every started one (`reporterID` 0). All
/// frames of one payload with small IDs have the same length.
[[nodiscard]] std::string SendMessageFrame(std::uint32_t messageID, std::int64_t reporterID,
                                           const Dictionary& payload = TypicalPayload());

/// Removes the complete replies from the front of the received bytes and returns their number.
using CountReplies = std::size_t (*)(std::string& arrived);
[[nodiscard]] std::size_t CountMessagePackReplies(std::string& arrived);

/// A client with minimal cost of its own, so that measurements show the server. Calls block; every
/// failure ends the program. Used by one thread at a time.
class WireClient {
 public:
  /// Connects, retrying for ten seconds. `type`: SOCK_STREAM or SOCK_DGRAM.
  explicit WireClient(const std::string& path, CountReplies countReplies = CountMessagePackReplies,
                      int type = 1);
  ~WireClient();
  WireClient(const WireClient&) = delete;
  WireClient& operator=(const WireClient&) = delete;

  void write(std::string_view bytes) const;
  /// Waits for at least one reply; returns the number of replies.
  std::size_t readReplies();
  void call(std::string_view method, std::int64_t reporterID, bool answered = true);
  /// Creates and starts a session.
  void startSession(std::int64_t reporterID);
  /// Sends `frame` `count` times, with at most `window` requests in flight.
  void pipeline(std::string_view frame, std::size_t count, std::size_t window);

 private:
  int socket_;
  CountReplies countReplies_;
  std::string arrived_;
};

}  // namespace quarvel
