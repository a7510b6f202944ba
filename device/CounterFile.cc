#include "device/CounterFile.h"

#include <fcntl.h>
#include <regex.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <utility>

namespace quarvel {

// The C library's matcher: std::regex recurses once for each character and overflows the stack on a
// report of this size.
struct CounterPattern::Compiled {
  regex_t expression{};
  bool valid = false;

  Compiled() = default;
  Compiled(const Compiled&) = delete;
  Compiled& operator=(const Compiled&) = delete;
  ~Compiled() {
    if (valid) regfree(&expression);
  }
};

CounterPattern::CounterPattern(std::shared_ptr<const Compiled> compiled)
    : compiled_(std::move(compiled)) {}

std::optional<CounterPattern> CounterPattern::compile(const std::string& text, std::string& fault) {
  auto compiled = std::make_shared<Compiled>();
  const int status = regcomp(&compiled->expression, text.c_str(), REG_EXTENDED | REG_NEWLINE);
  if (status != 0) {
    std::array<char, 128> reason{};
    regerror(status, &compiled->expression, reason.data(), reason.size());
    fault = reason.data();
    return std::nullopt;
  }
  compiled->valid = true;
  if (compiled->expression.re_nsub == 0) {
    fault = "it has no group in parentheses";
    return std::nullopt;
  }
  return CounterPattern(std::move(compiled));
}

std::string_view CounterPattern::find(std::string_view content) const {
  std::array<regmatch_t, 2> matches{};
  matches[0].rm_eo = static_cast<regoff_t>(content.size());
  if (regexec(&compiled_->expression, content.data(), matches.size(), matches.data(),
              REG_STARTEND) != 0 ||
      matches[1].rm_so < 0) {
    return {};
  }
  return content.substr(static_cast<std::size_t>(matches[1].rm_so),
                        static_cast<std::size_t>(matches[1].rm_eo - matches[1].rm_so));
}

std::string_view TrimBlanks(std::string_view text) {
  static constexpr std::string_view kBlanks = " \t\r\n";
  text.remove_prefix(std::min(text.find_first_not_of(kBlanks), text.size()));
  return text.substr(0, text.find_last_not_of(kBlanks) + 1);
}

std::optional<TallixErrorCode> CounterFromText(std::string_view text, std::int64_t& value) {
  text = TrimBlanks(text);
  const auto [end, status] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (end == text.data() || end != text.data() + text.size()) return TallixErrorCode::noInteger;
  if (status == std::errc::result_out_of_range) return TallixErrorCode::integerOutOfRange;
  return std::nullopt;
}

CounterFile::CounterFile(std::filesystem::path path, Extent extent)
    : path_(std::move(path)), extent_(extent) {}

CounterFile::CounterFile(CounterFile&& other) noexcept
    : path_(std::move(other.path_)),
      extent_(other.extent_),
      descriptor_(std::exchange(other.descriptor_, -1)) {}

CounterFile::~CounterFile() {
  close();
}

void CounterFile::close() {
  if (descriptor_ >= 0) ::close(std::exchange(descriptor_, -1));
}

int CounterFile::open() {
  close();
  // Without O_NONBLOCK a named pipe in place of a counter would block the service.
  descriptor_ = ::open(path_.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
  return descriptor_ < 0 ? errno : 0;
}

bool CounterFile::wasReplaced() const {
  struct stat status {};
  return fstat(descriptor_, &status) == 0 && status.st_nlink == 0;
}

int CounterFile::read(std::string& buffer, std::string_view& content) {
  if (descriptor_ >= 0 && !wasReplaced() && readOnce(buffer, content) == 0) return 0;
  if (const int error = open(); error != 0) return error;
  return readOnce(buffer, content);
}

int CounterFile::readOnce(std::string& buffer, std::string_view& content) const {
  const std::size_t limit = extent_ == Extent::lines ? kReportBytes : kIntegerBytes;
  if (buffer.size() < limit) buffer.resize(limit);
  std::size_t length = 0;
  // The kernel returns its reports one page at a time, for a buffer of any size.
  while (length < limit) {
    const ssize_t count =
        pread(descriptor_, buffer.data() + length, limit - length, static_cast<off_t>(length));
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return errno;
    length += static_cast<std::size_t>(count);
    if (count == 0 || extent_ == Extent::oneInteger) break;
  }
  content = std::string_view(buffer).substr(0, length);
  return 0;
}

}  // namespace quarvel
