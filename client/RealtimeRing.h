#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>
#include <vector>

namespace quarvel {

/// Records in slots of a fixed size, from one producer to one consumer at a time. The producer's
/// functions allocate nothing, lock nothing, call nothing of the system and never wait.
// NOLINTNEXTLINE(clang-analyzer-optin.performance.Padding): each side has cache lines of its own
class __attribute__((visibility("hidden"))) RealtimeRing {
 public:
  /// `records` becomes a power of two.
  RealtimeRing(std::size_t records, std::size_t recordBytes);
  RealtimeRing(const RealtimeRing&) = delete;
  RealtimeRing& operator=(const RealtimeRing&) = delete;

  // The producer's.

  /// Opens a record in the next free slot; false when there is none.
  bool begin(std::uint32_t category, std::uint16_t type) noexcept;
  void boolean(std::string_view name, bool value) noexcept;
  void integer(std::string_view name, std::int64_t value) noexcept;
  void unsignedInteger(std::string_view name, std::uint64_t value) noexcept;
  void real(std::string_view name, double value) noexcept;
  void string(std::string_view name, std::string_view value) noexcept;
  void date(std::string_view name, std::int64_t microseconds) noexcept;
  /// Hands the open record over. False, and the loss is counted, when there is none or it was too
  /// large.
  bool commit() noexcept;
  void abandon() noexcept { slot_ = nullptr; }

  // The consumer's.

  struct Record {
    std::uint32_t category;
    std::uint16_t type;
    std::string_view payload;  // valid until it is popped
  };
  [[nodiscard]] std::optional<Record> front() const noexcept;
  void pop() noexcept;

  // For every thread.

  [[nodiscard]] bool empty() const noexcept;
  [[nodiscard]] std::uint64_t full() const noexcept { return full_.load(kRelaxed); }
  [[nodiscard]] std::uint64_t tooLarge() const noexcept { return tooLarge_.load(kRelaxed); }

 private:
  static constexpr auto kRelaxed = std::memory_order_relaxed;
  static constexpr std::size_t kCacheLine = 64;

  struct Head {
    std::uint32_t category;
    std::uint32_t length;
    std::uint16_t type;
  };

  [[nodiscard]] char* slot(std::uint64_t index) noexcept;
  bool key(std::string_view key, std::size_t valueBytes) noexcept;
  void head(unsigned char code) noexcept { *at_++ = static_cast<char>(code); }
  template <class Unsigned>
  void bigEndian(Unsigned number) noexcept;
  void text(std::string_view text) noexcept;

  // Constant after construction.
  const std::size_t recordBytes_;
  const std::size_t stride_;
  const std::uint64_t mask_;
  std::vector<char> memory_;

  // The producer's own; the counts are read by others. Since nobody else adds, no addition needs to
  // be atomic.
  alignas(kCacheLine) std::atomic<std::uint64_t> written_{0};
  std::atomic<std::uint64_t> full_{0};
  std::atomic<std::uint64_t> tooLarge_{0};
  std::uint64_t knownTaken_ = 0;
  char* slot_ = nullptr;  // of the open record
  char* at_ = nullptr;
  char* end_ = nullptr;
  std::uint16_t entries_ = 0;
  bool overflow_ = false;

  // The consumer's own.
  alignas(kCacheLine) std::atomic<std::uint64_t> taken_{0};
};

}  // namespace quarvel
