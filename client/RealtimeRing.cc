#include "client/RealtimeRing.h"

#include <algorithm>
#include <bit>
#include <cstring>
#include <limits>

// MessagePack is written by hand here, since the writer that everything else uses fills a string.
// https://msgpack.org

namespace quarvel {
namespace {

constexpr std::size_t kLargest = 65'536;
/// A dictionary whose length takes two bytes, so that it can be set when it is known.
constexpr unsigned char kDictionary16 = 0xde;
constexpr std::size_t kDictionaryHead = 3;

constexpr std::size_t RoundedUp(std::size_t size, std::size_t to) {
  return (size + to - 1) / to * to;
}

constexpr std::size_t StringHead(std::size_t length) {
  if (length < 32) return 1;
  return length <= std::numeric_limits<std::uint8_t>::max() ? 2 : 3;
}

}  // namespace

RealtimeRing::RealtimeRing(std::size_t records, std::size_t recordBytes)
    : recordBytes_(std::clamp<std::size_t>(recordBytes, 16, kLargest)),
      stride_(RoundedUp(sizeof(Head) + recordBytes_, kCacheLine)),
      mask_(std::bit_ceil(std::clamp<std::size_t>(records, 2, kLargest)) - 1),
      memory_(stride_ * (mask_ + 1)) {}

char* RealtimeRing::slot(std::uint64_t index) noexcept {
  return memory_.data() + static_cast<std::size_t>(index & mask_) * stride_;
}

bool RealtimeRing::begin(std::uint32_t category, std::uint16_t type) noexcept {
  slot_ = nullptr;
  const std::uint64_t index = written_.load(kRelaxed);
  if (index - knownTaken_ > mask_) knownTaken_ = taken_.load(std::memory_order_acquire);
  if (index - knownTaken_ > mask_) return false;
  slot_ = slot(index);
  const Head opened{category, 0, type};
  std::memcpy(slot_, &opened, sizeof opened);
  at_ = slot_ + sizeof(Head) + kDictionaryHead;
  end_ = slot_ + sizeof(Head) + recordBytes_;
  entries_ = 0;
  overflow_ = false;
  return true;
}

// Writes a key when it and its value fit.
bool RealtimeRing::key(std::string_view key, std::size_t valueBytes) noexcept {
  if (slot_ == nullptr || overflow_) return false;
  const auto room = static_cast<std::size_t>(end_ - at_);
  // A length is looked at by itself first, so that no sum can go round.
  if (key.size() > room || valueBytes > room ||
      StringHead(key.size()) + key.size() + valueBytes > room) {
    overflow_ = true;
    return false;
  }
  text(key);
  ++entries_;
  return true;
}

template <class Unsigned>
void RealtimeRing::bigEndian(Unsigned number) noexcept {
  for (int shift = 8 * (static_cast<int>(sizeof number) - 1); shift >= 0; shift -= 8) {
    *at_++ = static_cast<char>(number >> shift);
  }
}

void RealtimeRing::text(std::string_view text) noexcept {
  switch (StringHead(text.size())) {
    case 1:
      head(static_cast<unsigned char>(0xa0 | text.size()));
      break;
    case 2:
      head(0xd9);
      bigEndian(static_cast<std::uint8_t>(text.size()));
      break;
    default:
      head(0xda);
      bigEndian(static_cast<std::uint16_t>(text.size()));
  }
  if (!text.empty()) std::memcpy(at_, text.data(), text.size());
  at_ += text.size();
}

void RealtimeRing::boolean(std::string_view name, bool value) noexcept {
  if (key(name, 1)) head(value ? 0xc3 : 0xc2);
}

void RealtimeRing::integer(std::string_view name, std::int64_t value) noexcept {
  if (value >= 0) return unsignedInteger(name, static_cast<std::uint64_t>(value));
  if (!key(name, 9)) return;
  head(0xd3);
  bigEndian(static_cast<std::uint64_t>(value));
}

void RealtimeRing::unsignedInteger(std::string_view name, std::uint64_t value) noexcept {
  constexpr std::uint64_t kFixed = 127;
  if (!key(name, value <= kFixed ? 1 : 9)) return;
  if (value <= kFixed) return head(static_cast<unsigned char>(value));
  head(0xcf);
  bigEndian(value);
}

void RealtimeRing::real(std::string_view name, double value) noexcept {
  if (!key(name, 9)) return;
  head(0xcb);
  bigEndian(std::bit_cast<std::uint64_t>(value));
}

void RealtimeRing::string(std::string_view name, std::string_view value) noexcept {
  if (key(name,
          value.size() <= recordBytes_ ? StringHead(value.size()) + value.size() : kLargest)) {
    text(value);
  }
}

// The timestamp extension of 96 bits.
void RealtimeRing::date(std::string_view name, std::int64_t microseconds) noexcept {
  constexpr std::int64_t kSecond = 1'000'000;
  if (!key(name, 15)) return;
  std::int64_t seconds = microseconds / kSecond;
  std::int64_t rest = microseconds % kSecond;
  if (rest < 0) {
    rest += kSecond;
    --seconds;
  }
  head(0xc7);
  head(12);
  head(0xff);
  bigEndian(static_cast<std::uint32_t>(rest * 1'000));
  bigEndian(static_cast<std::uint64_t>(seconds));
}

bool RealtimeRing::commit() noexcept {
  const auto count = [](std::atomic<std::uint64_t>& lost) {
    lost.store(lost.load(kRelaxed) + 1, kRelaxed);
    return false;
  };
  if (slot_ == nullptr) return count(full_);
  char* const begun = slot_;
  slot_ = nullptr;
  if (overflow_) return count(tooLarge_);
  const auto length = static_cast<std::uint32_t>(at_ - (begun + sizeof(Head)));
  std::memcpy(begun + offsetof(Head, length), &length, sizeof length);
  at_ = begun + sizeof(Head);
  head(kDictionary16);
  bigEndian(entries_);
  written_.store(written_.load(kRelaxed) + 1, std::memory_order_release);
  return true;
}

bool RealtimeRing::empty() const noexcept {
  return taken_.load(std::memory_order_acquire) == written_.load(std::memory_order_acquire);
}

std::optional<RealtimeRing::Record> RealtimeRing::front() const noexcept {
  if (empty()) return std::nullopt;
  const char* first =
      memory_.data() + static_cast<std::size_t>(taken_.load(kRelaxed) & mask_) * stride_;
  Head head{};
  std::memcpy(&head, first, sizeof head);
  return Record{head.category, head.type, {first + sizeof head, head.length}};
}

void RealtimeRing::pop() noexcept {
  taken_.store(taken_.load(kRelaxed) + 1, std::memory_order_release);
}

}  // namespace quarvel
