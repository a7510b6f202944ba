// Whatever bytes come: the scanner finds the same end in one piece and in pieces, and what it lets
// through can be walked, checked, rewritten and written as JSON, and comes back the same from a
// tree.

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "base/Json.h"
#include "base/MessagePack.h"
#include "base/Payload.h"

namespace {

using quarvel::MessagePackScanner;
using quarvel::Payload;
using quarvel::PayloadValue;

void Require(bool holds) {
  if (!holds) std::abort();
}

MessagePackScanner::Progress ScanInPieces(MessagePackScanner& scanner, std::string_view bytes) {
  auto progress = MessagePackScanner::Progress::incomplete;
  for (std::size_t arrived = 0;
       arrived < bytes.size() && progress == MessagePackScanner::Progress::incomplete;) {
    arrived = std::min(bytes.size(), arrived + 1 + static_cast<unsigned char>(bytes[arrived]) % 7);
    progress = scanner.scan(bytes.substr(0, arrived));
  }
  return progress;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view bytes(reinterpret_cast<const char*>(data), size);
  MessagePackScanner whole(1 << 16, 32);
  MessagePackScanner pieces(1 << 16, 32);
  const auto progress = whole.scan(bytes);
  if (size > 0) Require(ScanInPieces(pieces, bytes) == progress);
  if (progress != MessagePackScanner::Progress::complete) return 0;
  Require(pieces.length() == whole.length());

  const PayloadValue value(bytes.data());
  Require(value.encoded().size() == whole.length());
  const auto payload = Payload::from(value);
  if (!payload) return 0;
  static_cast<void>(payload.value().replacingInKeys(' ', '_').count());
  Require(quarvel::ValueFromJson(quarvel::JsonText(payload.value())).ok());
  const Payload again(payload.value().root().toDictionary());
  Require(quarvel::JsonText(again) == quarvel::JsonText(payload.value()));
  return 0;
}
