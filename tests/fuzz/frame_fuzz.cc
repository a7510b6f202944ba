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
  enum class Finding { whole, cut, wrong };
  explicit Reader(std::string_view bytes) : bytes_(bytes) {}

  Finding skip(unsigned depth = 0) {
    const auto first = take(1);
    if (!first) return Finding::cut;
    const unsigned code = static_cast<unsigned char>(first->front());
    if (code <= 0x7f || code >= 0xe0) return Finding::whole;
    if (code <= 0x8f) return items(2 * (code & 0x0f), depth);
    if (code <= 0x9f) return items(code & 0x0f, depth);
    if (code <= 0xbf) return rest(code & 0x1f);
    if (code == 0xc1) return Finding::wrong;
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
    if (!length) return Finding::cut;
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
  Finding rest(std::size_t count) { return take(count) ? Finding::whole : Finding::cut; }
  Finding items(std::size_t count, unsigned depth) {
    if (depth + 1 > kDeepest) return Finding::wrong;
    for (; count > 0; --count) {
      if (const Finding item = skip(depth + 1); item != Finding::whole) return item;
    }
    return Finding::whole;
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
    std::string_view fault;
    const auto request = progress == Progress::complete
                             ? Request::from(PayloadValue(bytes.data()), fault)
                             : std::nullopt;
    if (!request) {
      Require(progress == Progress::complete ? !fault.empty() : !scanner.fault().empty(),
              "a fault has a reason");
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
  const Reader::Finding finding = reader.skip();
  if (progress == Progress::complete) {
    Require(finding == Reader::Finding::whole, "a complete value is whole");
    Require(scanner.length() == reader.position(), "both see the same end");
    Require(scanner.length() <= kLargest, "no value is larger than allowed");
  } else if (progress == Progress::incomplete) {
    Require(finding == Reader::Finding::cut, "an incomplete value is cut");
  } else {
    Require(finding != Reader::Finding::whole || reader.position() > kLargest,
            "a whole value of an allowed size is no fault");
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view stream(reinterpret_cast<const char*>(data), size);
  if (size > 0) CompareWithReader(stream);
  Require(DecodeStream(stream, true) == DecodeStream(stream, false), "pieces make no difference");
  return 0;
}
