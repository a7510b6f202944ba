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
/// match at every line, "." matches no line's end. Immutable; from any thread.
class CounterPattern {
 public:
  /// None, with a `fault` that says what is wrong, when `text` is no such expression.
  [[nodiscard]] static std::optional<CounterPattern> compile(const std::string& text,
                                                             std::string& fault);

  /// What the group matched; empty when nothing did. Points into `content`.
  [[nodiscard]] std::string_view find(std::string_view content) const;

 private:
  struct Compiled;
  explicit CounterPattern(std::shared_ptr<const Compiled> compiled);

  std::shared_ptr<const Compiled> compiled_;
};

/// Reads decimal text, blanks around it allowed, as a signed 64-bit integer. Returns noInteger or
/// integerOutOfRange when that is not possible.
[[nodiscard]] std::optional<TallixErrorCode> CounterFromText(std::string_view text,
                                                             std::int64_t& value);

/// A file that counters are read from, kept open. It follows its path: when another file took its
/// place, or its device went and came back, it is opened again. One thread at a time.
class CounterFile {
 public:
  enum class Extent {
    oneInteger,  // a few bytes, read at once
    lines,       // a report of many lines, up to kReportBytes
  };
  static constexpr std::size_t kIntegerBytes = 64;
  static constexpr std::size_t kReportBytes = 65536;

  CounterFile(std::filesystem::path path, Extent extent);
  CounterFile(CounterFile&& other) noexcept;
  CounterFile& operator=(CounterFile&&) = delete;
  ~CounterFile();

  [[nodiscard]] const std::filesystem::path& path() const { return path_; }
  /// Returns 0 or the system's error number.
  [[nodiscard]] int open();
  /// What the file holds now, placed in `buffer`; a report that is longer than the limit is cut
  /// off. Returns 0 or the system's error number.
  [[nodiscard]] int read(std::string& buffer, std::string_view& content);

 private:
  void close();
  [[nodiscard]] bool wasReplaced() const;
  [[nodiscard]] int readOnce(std::string& buffer, std::string_view& content) const;

  std::filesystem::path path_;  // constant after construction
  Extent extent_;               // constant after construction
  int descriptor_ = -1;
};

}  // namespace quarvel
