#include "client/RealtimeRing.h"

#include <algorithm>
#include <bit>
#include <cstring>

namespace quarvel {
namespace {

constexpr std::size_t kLargest = 65'536;
/// The head of a dictionary with up to 65,535 entries; one with fewer than 16 takes a single byte.
constexpr std::size_t kDictionaryHead = 3;
constexpr std::size_t kShortDictionary = 16;

constexpr std::size_t RoundedUp(std::size_t size, std::size_t to) {
  return (size + to - 1) / to * to;
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
  const Head opened{category, 0, type, 0};
  std::memcpy(slot_, &opened, sizeof opened);
  // The dictionary's head is written last, when its count is known.
  char* const body = slot_ + sizeof(Head);
  sink_ = FixedSink(body + kDictionaryHead, body + recordBytes_);
  entries_ = 0;
  return true;
}

template <class Write>
void RealtimeRing::entry(std::string_view name, Write&& write) noexcept {
  if (slot_ == nullptr) return;
  Writer writer(sink_);
  writer.string(name);
  write(writer);
  ++entries_;
}

void RealtimeRing::boolean(std::string_view name, bool value) noexcept {
  entry(name, [=](Writer& writer) { writer.boolean(value); });
}

void RealtimeRing::integer(std::string_view name, std::int64_t value) noexcept {
  entry(name, [=](Writer& writer) { writer.integer(value); });
}

void RealtimeRing::unsignedInteger(std::string_view name, std::uint64_t value) noexcept {
  entry(name, [=](Writer& writer) { writer.unsignedInteger(value); });
}

void RealtimeRing::real(std::string_view name, double value) noexcept {
  entry(name, [=](Writer& writer) { writer.real(value); });
}

void RealtimeRing::string(std::string_view name, std::string_view value) noexcept {
  entry(name, [=](Writer& writer) { writer.string(value); });
}

void RealtimeRing::date(std::string_view name, Date value) noexcept {
  entry(name, [=](Writer& writer) { writer.date(value); });
}

bool RealtimeRing::commit() noexcept {
  const auto count = [](std::atomic<std::uint64_t>& lost) {
    lost.store(lost.load(kRelaxed) + 1, kRelaxed);
    return false;
  };
  if (slot_ == nullptr) return count(full_);
  char* const begun = slot_;
  slot_ = nullptr;
  if (sink_.overflowed()) return count(tooLarge_);
  char* const body = begun + sizeof(Head);
  Head head{};
  std::memcpy(&head, begun, sizeof head);
  head.skipped = entries_ < kShortDictionary ? kDictionaryHead - 1 : 0;
  head.length = static_cast<std::uint32_t>(sink_.end() - (body + head.skipped));
  std::memcpy(begun, &head, sizeof head);
  FixedSink front(body + head.skipped, body + kDictionaryHead);
  Writer(front).dictionary(entries_);
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
  return Record{head.category, head.type, {first + sizeof head + head.skipped, head.length}};
}

void RealtimeRing::pop() noexcept {
  taken_.store(taken_.load(kRelaxed) + 1, std::memory_order_release);
}

}  // namespace quarvel
