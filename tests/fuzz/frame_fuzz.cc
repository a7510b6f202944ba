// The frame decoder, as a connection uses it: a stream decodes to the same calls in one piece and
// in many, and the scanner agrees with an independent reader of the format.
//
// An input is the stream; its own bytes select where the stream is split.

#include <algorithm>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/MessagePack.h"
#include "tests/fuzz/Require.h"
#include "transport/ReadBuffer.h"
#include "transport/Request.h"

namespace {

using quarvel::MessagePackScanner;
using quarvel::PayloadValue;
using quarvel::ReadBuffer;
using quarvel::Request;
using Progress = MessagePackScanner::Progress;

constexpr std::size_t kLargest = 4096;
constexpr unsigned kDeepest = 32;

/// Reads one MessagePack value, written from the format's description.
class Reader {
 public:
  explicit Reader(std::string_view bytes) : bytes_(bytes) {}

  Progress skip(unsigned depth = 0) {
    const auto first = take(1);
    if (!first) return Progress::incomplete;
    const unsigned code = static_cast<unsigned char>(first->front());
    if (code <= 0x7f || code >= 0xe0) return Progress::complete;
    if (code <= 0x8f) return items(2 * (code & 0x0f), depth);
    if (code <= 0x9f) return items(code & 0x0f, depth);
    if (code <= 0xbf) return rest(code & 0x1f);
    if (code == 0xc1) return Progress::fault;
    // For each code from 0xc0: the octets of the length, the octets that follow besides, and the
    // items for each unit of length, or 0 if the length counts octets.
    constexpr struct {
      std::uint8_t octets, more, items;
    } kForms[] = {{0, 0, 0}, {0, 0, 0}, {0, 0, 0}, {0, 0, 0},  {1, 0, 0}, {2, 0, 0}, {4, 0, 0},
                  {1, 1, 0}, {2, 1, 0}, {4, 1, 0}, {0, 4, 0},  {0, 8, 0}, {0, 1, 0}, {0, 2, 0},
                  {0, 4, 0}, {0, 8, 0}, {0, 1, 0}, {0, 2, 0},  {0, 4, 0}, {0, 8, 0}, {0, 2, 0},
                  {0, 3, 0}, {0, 5, 0}, {0, 9, 0}, {0, 17, 0}, {1, 0, 0}, {2, 0, 0}, {4, 0, 0},
                  {2, 0, 1}, {4, 0, 1}, {2, 0, 2}, {4, 0, 2}};
    const auto& [octets, more, times] = kForms[code - 0xc0];
    const auto length = number(octets);
    if (!length) return Progress::incomplete;
    return times > 0 ? items(*length * times, depth) : rest(*length + more);
  }
  [[nodiscard]] std::size_t position() const { return position_; }

 private:
  std::optional<std::string_view> take(std::size_t count) {
    if (bytes_.size() - position_ < count) return std::nullopt;
    position_ += count;
    return bytes_.substr(position_ - count, count);
  }
  std::optional<std::size_t> number(std::size_t octets) {
    const auto taken = take(octets);
    if (!taken) return std::nullopt;
    std::size_t result = 0;
    for (const char octet : *taken) result = result * 256 + static_cast<unsigned char>(octet);
    return result;
  }
  Progress rest(std::size_t count) {
    return take(count) ? Progress::complete : Progress::incomplete;
  }
  Progress items(std::size_t count, unsigned depth) {
    if (depth + 1 > kDeepest) return Progress::fault;
    for (; count > 0; --count) {
      if (const Progress item = skip(depth + 1); item != Progress::complete) return item;
    }
    return Progress::complete;
  }

  std::string_view bytes_;
  std::size_t position_ = 0;
};

struct Decoded {
  std::vector<std::string> calls;
  bool faulty = false;
  bool operator==(const Decoded&) const = default;
};

void Decode(ReadBuffer& buffer, MessagePackScanner& scanner, Decoded& decoded) {
  while (!decoded.faulty && !buffer.empty()) {
    const std::string_view bytes = buffer.bytes();
    const Progress progress = scanner.scan(bytes);
    if (progress == Progress::incomplete) return;
    std::string_view fault = scanner.fault();
    std::optional<Request> request;
    if (progress == Progress::complete) request = Request::from(PayloadValue(bytes.data()), fault);
    if (!request) {
      Require(!fault.empty(), "a fault has a reason");
      decoded.faulty = true;
      return;
    }
    Require(request->params.encoded().end() <= bytes.begin() + scanner.length(),
            "the params lie in the frame");
    decoded.calls.emplace_back(bytes.substr(0, scanner.length()));
    buffer.consume(scanner.length());
    scanner.reset();
  }
}

/// `torn`: in pieces of a few bytes, else in pieces as large as the buffer's room.
Decoded DecodeStream(std::string_view stream, bool torn) {
  ReadBuffer buffer;
  MessagePackScanner scanner(kLargest, kDeepest);
  Decoded decoded;
  while (!stream.empty() && !decoded.faulty) {
    const std::span<char> room = buffer.room();
    const std::size_t wanted =
        torn ? 1 + static_cast<unsigned char>(stream.front()) % 7 : stream.size();
    const std::size_t count = std::min({wanted, room.size(), stream.size()});
    std::memcpy(room.data(), stream.data(), count);
    buffer.arrived(count);
    stream.remove_prefix(count);
    Decode(buffer, scanner, decoded);
    if (buffer.empty()) buffer.release();
  }
  return decoded;
}

void CompareWithReader(std::string_view stream) {
  MessagePackScanner scanner(kLargest, kDeepest);
  Reader reader(stream);
  const Progress progress = scanner.scan(stream);
  const Progress expected = reader.skip();
  if (progress == Progress::fault) {
    Require(expected != Progress::complete || reader.position() > kLargest,
            "a complete value of an allowed size is no fault");
    return;
  }
  Require(progress == expected, "both see a complete value, or both an incomplete one");
  if (progress == Progress::incomplete) return;
  Require(scanner.length() == reader.position(), "both see the same end");
  Require(scanner.length() <= kLargest, "no value is larger than allowed");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view stream(reinterpret_cast<const char*>(data), size);
  if (size > 0) CompareWithReader(stream);
  Require(DecodeStream(stream, true) == DecodeStream(stream, false), "pieces make no difference");
  return 0;
}
