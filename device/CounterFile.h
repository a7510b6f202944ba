#pragma once

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Tallix.h"

namespace quarvel {

/// A POSIX extended regular expression whose first group finds an integer in a text. "^" and "$"
/// match at every line, "." matches no line end. Immutable; any thread. Copies share the compiled
/// expression.
class CounterPattern {
 public:
  /// Returns none, with the reason in `fault`, when `text` is no such expression.
  [[nodiscard]] static std::optional<CounterPattern> compile(const std::string& text,
                                                             std::string& fault);

  /// The text that the group matched, or an empty one. Points into `content`.
  [[nodiscard]] std::string_view find(std::string_view content) const;

 private:
  struct Compiled;  // the C library's form; freed with the last copy
  explicit CounterPattern(std::shared_ptr<const Compiled> compiled);

  std::shared_ptr<const Compiled> compiled_;
};

/// `text` without the blanks and line ends around it.
[[nodiscard]] std::string_view TrimBlanks(std::string_view text);

/// Reads decimal text, blanks around it allowed, as a signed 64-bit integer. Returns noInteger or
/// integerOutOfRange when that is not possible.
[[nodiscard]] std::optional<TallixErrorCode> CounterFromText(std::string_view text,
                                                             std::int64_t& value);

/// An open file with counters. Follows its path: it is opened again when another file took its
/// place, or when its device went and came back. Owned by a `TallixSubscription`, which lets one
/// thread in at a time.
class CounterFile {
 public:
  enum class Extent {
    oneInteger,  // up to kIntegerBytes, by one read
    lines,       // a report of many lines, up to kReportBytes
  };
  /// A 64-bit integer has 20 characters; the rest is room for blanks around it.
  static constexpr std::size_t kIntegerBytes = 64;
  static constexpr std::size_t kReportBytes = 65536;

  /// Opens nothing.
  CounterFile(std::filesystem::path path, Extent extent);
  /// `other` no longer owns the descriptor.
  CounterFile(CounterFile&& other) noexcept;
  CounterFile& operator=(CounterFile&&) = delete;
  /// Closes the file.
  ~CounterFile();

  /// The path given at construction, for messages.
  [[nodiscard]] const std::filesystem::path& path() const { return path_; }
  /// Opens the file; never waits, not even for a named pipe. Returns 0 or the system's error
  /// number.
  [[nodiscard]] int open();
  /// Reads the present content into `buffer`; `content` points into it. A report that is longer
  /// than the limit is cut off. Returns 0 or the system's error number.
  [[nodiscard]] int read(std::string& buffer, std::string_view& content);

 private:
  /// Closes the descriptor if there is one.
  void close();
  /// Whether the open file has no name any more.
  [[nodiscard]] bool wasReplaced() const;
  /// One read of the open file, from its beginning. Returns 0 or the system's error number.
  [[nodiscard]] int readOnce(std::string& buffer, std::string_view& content) const;

  std::filesystem::path path_;  // constant after construction
  Extent extent_;               // constant after construction
  int descriptor_ = -1;         // -1: not open
};

}  // namespace quarvel
