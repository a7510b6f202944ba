#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>

#include "base/MessagePack.h"
#include "base/Value.h"

namespace quarvel {

/// Ends the program: what failed, and errno.
[[noreturn]] void Fail(const std::string& what);

/// What an audio client reports every few seconds: some 280 bytes on the wire.
[[nodiscard]] Dictionary TypicalPayload();
/// A payload of `keys` keys, alike in kind.
[[nodiscard]] Dictionary PayloadOfKeys(std::size_t keys);

/// A request of `count` arguments, which `arguments` writes.
[[nodiscard]] std::string CallFrame(std::uint32_t messageID, std::string_view method,
                                    const std::function<void(MessagePackWriter&)>& arguments,
                                    std::size_t count);
/// Sends `payload` to one session, or to every started one (`reporterID` 0). Every such frame of
/// one payload and of small ids has the same length.
[[nodiscard]] std::string SendMessageFrame(std::uint32_t messageID, std::int64_t reporterID,
                                           const Dictionary& payload = TypicalPayload());

/// Takes the whole replies off the front of what has arrived and returns how many they were.
using CountReplies = std::size_t (*)(std::string& arrived);
[[nodiscard]] std::size_t CountMessagePackReplies(std::string& arrived);

/// A client that costs as little as one can, so that what is measured is the server. Blocks; every
/// failure ends the program.
class WireClient {
 public:
  /// Tries for ten seconds. `type`: SOCK_STREAM or SOCK_DGRAM.
  explicit WireClient(const std::string& path, CountReplies countReplies = CountMessagePackReplies,
                      int type = 1);
  ~WireClient();
  WireClient(const WireClient&) = delete;
  WireClient& operator=(const WireClient&) = delete;

  void write(std::string_view bytes) const;
  /// Waits for at least one reply; returns how many are there.
  std::size_t readReplies();
  void call(std::string_view method, std::int64_t reporterID, bool answered = true);
  /// Creates and starts a session.
  void startSession(std::int64_t reporterID);
  /// Sends `frame` so many times with at most `window` of them unanswered.
  void pipeline(std::string_view frame, std::size_t count, std::size_t window);

 private:
  int socket_;
  CountReplies countReplies_;
  std::string arrived_;
};

}  // namespace quarvel
