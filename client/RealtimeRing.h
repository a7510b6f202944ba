#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string_view>
#include <vector>

#include "base/MessagePackWriter.h"

namespace quarvel {

/// Fixed memory as the sink of a MessagePack writer. Bytes that do not fit are left out, and so is
/// everything after them. One thread at a time; real-time safe.
class FixedSink {
 public:
  /// Without memory: takes nothing.
  FixedSink() = default;
  /// Writes from `begin` on, at most up to `end`; the memory must outlive the sink.
  FixedSink(char* begin, char* end) : at_(begin), end_(end) {}

  void push_back(char byte) noexcept { append(&byte, 1); }
  void append(const char* bytes, std::size_t count) noexcept {
    overflowed_ = overflowed_ || count > static_cast<std::size_t>(end_ - at_);
    if (overflowed_ || count == 0) return;
    std::memcpy(at_, bytes, count);
    at_ += count;
  }

  /// Whether bytes were left out: the MessagePack is then not whole.
  [[nodiscard]] bool overflowed() const noexcept { return overflowed_; }
  /// The byte after the last one written.
  [[nodiscard]] const char* end() const noexcept { return at_; }

 private:
  char* at_ = nullptr;
  char* end_ = nullptr;
  bool overflowed_ = false;
};

/// Records in slots of a fixed size, from one producer thread to one consumer at a time. Owned by a
/// real-time reporter's drain. The producer's functions allocate nothing, lock nothing, make no
/// system call and never wait.
// NOLINTNEXTLINE(clang-analyzer-optin.performance.Padding): each side has cache lines of its own
class __attribute__((visibility("hidden"))) RealtimeRing {
 public:
  /// `records` is rounded up to a power of two. `recordBytes` bounds a record's MessagePack. All
  /// memory is allocated here, and touched, so that the producer meets no page fault.
  RealtimeRing(std::size_t records, std::size_t recordBytes);
  RealtimeRing(const RealtimeRing&) = delete;
  RealtimeRing& operator=(const RealtimeRing&) = delete;

  // For the producer.

  /// Opens a record in the next free slot; false when there is none.
  bool begin(std::uint32_t category, std::uint16_t type) noexcept;
  // Each adds an entry to the open record; without one they do nothing. `name` and texts must be
  // UTF-8, which is not checked here: the consumer drops a record that is not. They are copied.
  void boolean(std::string_view name, bool value) noexcept;
  void integer(std::string_view name, std::int64_t value) noexcept;
  void unsignedInteger(std::string_view name, std::uint64_t value) noexcept;
  void real(std::string_view name, double value) noexcept;
  void string(std::string_view name, std::string_view value) noexcept;
  void date(std::string_view name, Date value) noexcept;
  /// Hands the open record to the consumer. False, and the loss is counted, when no record is open
  /// or it was too large.
  bool commit() noexcept;
  /// Frees the open record's slot for the next `begin`; no loss is counted.
  void abandon() noexcept { slot_ = nullptr; }

  // For the consumer.

  /// A view of the oldest record.
  struct Record {
    std::uint32_t category;
    std::uint16_t type;
    std::string_view payload;  // valid until it is popped
  };
  /// The oldest record; none when the ring is empty.
  [[nodiscard]] std::optional<Record> front() const noexcept;
  /// Frees the oldest record's slot. Precondition: there is a record.
  void pop() noexcept;

  // For every thread.

  /// Whether no record waits; may have changed when it returns.
  [[nodiscard]] bool empty() const noexcept;
  /// Records lost for want of a free slot.
  [[nodiscard]] std::uint64_t full() const noexcept { return full_.load(kRelaxed); }
  /// Records lost because they were longer than a slot.
  [[nodiscard]] std::uint64_t tooLarge() const noexcept { return tooLarge_.load(kRelaxed); }

 private:
  static constexpr auto kRelaxed = std::memory_order_relaxed;
  static constexpr std::size_t kCacheLine = 64;

  using Writer = BasicMessagePackWriter<FixedSink>;

  /// In front of each slot's MessagePack.
  struct Head {
    std::uint32_t category;
    std::uint32_t length;  // of the MessagePack
    std::uint16_t type;
    std::uint16_t skipped;  // bytes between this and the MessagePack
  };

  /// The first byte of the slot of the record with this number, counted from the ring's start.
  [[nodiscard]] char* slot(std::uint64_t index) noexcept;
  /// Writes a name and, by `write`, its value; counts the entry.
  template <class Write>
  void entry(std::string_view name, Write&& write) noexcept;

  // Constant after construction.
  const std::size_t recordBytes_;
  const std::size_t stride_;  // bytes from slot to slot
  const std::uint64_t mask_;  // the number of slots, less 1
  std::vector<char> memory_;  // all slots

  // Written by the producer alone, so that adding needs no atomic addition; the counts are read by
  // every thread.
  alignas(kCacheLine) std::atomic<std::uint64_t> written_{0};  // records committed
  std::atomic<std::uint64_t> full_{0};
  std::atomic<std::uint64_t> tooLarge_{0};
  std::uint64_t knownTaken_ = 0;  // `taken_` when the producer last read it
  char* slot_ = nullptr;          // of the open record
  FixedSink sink_;                // behind the open record's head
  std::uint16_t entries_ = 0;     // of the open record

  // Written by the consumer alone.
  alignas(kCacheLine) std::atomic<std::uint64_t> taken_{0};  // records popped
};

}  // namespace quarvel
