#include "base/Json.h"

#include <fmt/format.h>
#include <rapidjson/error/en.h>
#include <rapidjson/prettywriter.h>
#include <rapidjson/reader.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstring>
#include <utility>
#include <variant>

#include "base/Base64.h"
#include "base/MessagePack.h"
#include "base/Utf8.h"

namespace quarvel {

namespace {

/// RapidJSON's output stream onto a string.
class StringStream {
 public:
  using Ch = char;
  explicit StringStream(std::string& out) : out_(out) {}
  void Put(char character) { out_.push_back(character); }
  void Flush() {}

 private:
  std::string& out_;
};

using PrettyWriter = rapidjson::PrettyWriter<StringStream>;

/// RFC 8259, section 7: the characters that a string holds only escaped.
constexpr bool MustBeEscaped(char character) {
  return static_cast<unsigned char>(character) < 0x20 || character == '"' || character == '\\';
}

/// The same for any of eight characters.
constexpr bool MustAnyBeEscaped(std::uint64_t eight) {
  constexpr std::uint64_t kOnes = 0x0101010101010101U;
  constexpr std::uint64_t kHighBits = 0x8080808080808080U;
  const auto anyBelow = [](std::uint64_t bytes, std::uint64_t bound) {
    return (bytes - kOnes * bound) & ~bytes & kHighBits;
  };
  return (anyBelow(eight, 0x20) | anyBelow(eight ^ kOnes * '"', 1) |
          anyBelow(eight ^ kOnes * '\\', 1)) != 0;
}

/// Copies a text that needs no escape. False when it needs one; then the copy is undefined.
bool CopyPlain(std::string_view text, char* to) {
  const std::size_t size = text.size();
  if (size < sizeof(std::uint32_t)) {
    for (std::size_t at = 0; at < size; ++at) {
      if (MustBeEscaped(text[at])) return false;
      to[at] = text[at];
    }
    return true;
  }
  // The last step overlaps the one before, so that no rest is left.
  if (size < sizeof(std::uint64_t)) {
    std::uint32_t first = 0;
    std::uint32_t last = 0;
    std::memcpy(&first, text.data(), sizeof first);
    std::memcpy(&last, text.data() + size - sizeof last, sizeof last);
    std::memcpy(to, &first, sizeof first);
    std::memcpy(to + size - sizeof last, &last, sizeof last);
    return !MustAnyBeEscaped(std::uint64_t{last} << 32 | first);
  }
  const auto step = [&](std::size_t at) {
    std::uint64_t eight = 0;
    std::memcpy(&eight, text.data() + at, sizeof eight);
    std::memcpy(to + at, &eight, sizeof eight);
    return !MustAnyBeEscaped(eight);
  };
  for (std::size_t at = 0; at + sizeof(std::uint64_t) < size; at += sizeof(std::uint64_t)) {
    if (!step(at)) return false;
  }
  return step(size - sizeof(std::uint64_t));
}

/// Appends compact JSON to a string, with the interface of RapidJSON's writers. Those take a text
/// character by character, at several times the cost, and every row of the store is written here.
/// The string's bytes behind the JSON are undefined until the writer is destroyed.
class CompactWriter {
 public:
  explicit CompactWriter(std::string& out) : out_(out), length_(out.size()) {}
  ~CompactWriter() { out_.resize(length_); }
  CompactWriter(const CompactWriter&) = delete;
  CompactWriter& operator=(const CompactWriter&) = delete;

  void Null() { plain("null"); }
  void Bool(bool boolean) { plain(boolean ? "true" : "false"); }
  void Int64(std::int64_t number) { integer(fmt::format_int(number)); }
  void Uint64(std::uint64_t number) { integer(fmt::format_int(number)); }
  void Double(double number) {
    if (shortDecimal(number)) return;
    std::array<char, 32> digits;
    const auto* end = std::to_chars(digits.data(), digits.data() + digits.size(), number).ptr;
    const std::string_view text(digits.data(), static_cast<std::size_t>(end - digits.data()));
    plain(text);
    // A reader must see a double, not an integer.
    if (text.find_first_of(".e") == std::string_view::npos) written(copy(".0", room(2)));
  }
  void String(const char* text, rapidjson::SizeType length) { quote({text, length}, false); }
  void Key(const char* text, rapidjson::SizeType length) { quote({text, length}, true); }
  void StartObject() { open('{'); }
  void EndObject() { close('}'); }
  void StartArray() { open('['); }
  void EndArray() { close(']'); }

 private:
  /// Memory for `count` characters; `written` takes the end of those used.
  char* room(std::size_t count) {
    if (out_.size() - length_ < count) {
      out_.resize(std::max(out_.capacity(), 2 * (length_ + count)));
    }
    return out_.data() + length_;
  }
  void written(const char* end) { length_ = static_cast<std::size_t>(end - out_.data()); }
  static char* copy(std::string_view text, char* at) {
    for (const char character : text) *at++ = character;
    return at;
  }
  /// Memory for a value of `count` characters, behind its comma.
  char* roomForValue(std::size_t count) {
    char* const at = room(count + 1);
    *at = ',';
    return at + (std::exchange(separated_, false) ? 0 : 1);
  }
  void plain(std::string_view text) { written(copy(text, roomForValue(text.size()))); }
  void integer(const fmt::format_int& digits) { plain({digits.data(), digits.size()}); }
  void open(char bracket) {
    plain({&bracket, 1});
    separated_ = true;
  }
  void close(char bracket) {
    written(copy({&bracket, 1}, room(1)));
    separated_ = false;
  }

  /// Most measures have few decimals: a number that a short decimal stands for exactly needs no
  /// search for its shortest text.
  bool shortDecimal(double number) {
    constexpr double kLargest = 1e9;
    constexpr std::size_t kDecimals = 4;
    if (!(std::abs(number) < kLargest) || (number == 0 && std::signbit(number))) return false;
    double scale = 1;
    for (std::size_t decimals = 0; decimals <= kDecimals; ++decimals, scale *= 10) {
      const auto scaled = static_cast<std::int64_t>(number * scale + std::copysign(0.5, number));
      // Both are exact, so this is the double nearest to the decimal.
      if (static_cast<double>(scaled) / scale != number) continue;
      const fmt::format_int whole(std::abs(scaled));
      const std::string_view digits(whole.data(), whole.size());
      const std::size_t before = digits.size() - std::min(digits.size(), decimals);
      char* at = roomForValue(32);
      if (scaled < 0) *at++ = '-';
      at = before > 0 ? copy(digits.substr(0, before), at) : copy("0", at);
      *at++ = '.';
      for (std::size_t zeros = digits.size() - before; zeros < std::max<std::size_t>(decimals, 1);
           ++zeros) {
        *at++ = '0';
      }
      written(copy(digits.substr(before), at));
      return true;
    }
    return false;
  }

  void quote(std::string_view text, bool isKey) {
    char* at = roomForValue(text.size() + 3);
    *at++ = '"';
    if (CopyPlain(text, at)) {
      at += text.size();
    } else {
      written(at);
      // In pieces: escapes can make a text six times as long, which a long text need not reserve.
      constexpr std::size_t kPiece = 4096;
      for (; text.size() > kPiece; text.remove_prefix(kPiece)) escaped(text.substr(0, kPiece));
      escaped(text);
      at = room(2);
    }
    *at++ = '"';
    if (isKey) *at++ = ':';
    separated_ = isKey;
    written(at);
  }
  void escaped(std::string_view text) {
    char* at = room(6 * text.size());
    for (const char character : text) {
      if (MustBeEscaped(character)) {
        at = escape(character, at);
      } else {
        *at++ = character;
      }
    }
    written(at);
  }
  static char* escape(char character, char* at) {
    constexpr std::string_view kNamed = "\"\\\b\f\n\r\t";
    constexpr std::string_view kNames = "\"\\bfnrt";
    constexpr std::string_view kHexadecimal = "0123456789ABCDEF";
    *at++ = '\\';
    if (const std::size_t named = kNamed.find(character); named != std::string_view::npos) {
      *at++ = kNames[named];
    } else {
      at = std::ranges::copy(std::string_view("u00"), at).out;
      *at++ = kHexadecimal[static_cast<unsigned char>(character) >> 4];
      *at++ = kHexadecimal[static_cast<unsigned char>(character) & 0xf];
    }
    return at;
  }

  std::string& out_;
  std::size_t length_;     // of the part of `out_` that is written
  bool separated_ = true;  // the next value needs no comma in front
};

template <class Writer>
void WriteText(Writer& writer, std::string_view text) {
  writer.String(text.data(), static_cast<rapidjson::SizeType>(text.size()));
}

template <class Writer>
void WriteKey(Writer& writer, std::string_view text) {
  writer.Key(text.data(), static_cast<rapidjson::SizeType>(text.size()));
}

template <class Writer>
void WriteReal(Writer& writer, double number) {
  if (std::isnan(number)) {
    WriteText(writer, "NaN");
  } else if (std::isinf(number)) {
    WriteText(writer, number > 0 ? "Infinity" : "-Infinity");
  } else {
    writer.Double(number);
  }
}

// The accessors that differ between payloads and trees.
std::string_view OctetsOf(PayloadValue value) {
  return *value.bytes();
}
std::string_view OctetsOf(const Value& value) {
  return value.bytes()->octets;
}
auto ItemsOf(PayloadValue value) {
  return value.items();
}
const List& ItemsOf(const Value& value) {
  return *value.list();
}
auto EntriesOf(PayloadValue value) {
  return value.entries();
}
const Dictionary& EntriesOf(const Value& value) {
  return *value.dictionary();
}

template <class Writer, class AnyValue>
void Write(Writer& writer, const AnyValue& value);

template <class Writer, class Entries>
void WriteEntries(Writer& writer, const Entries& entries) {
  writer.StartObject();
  for (const auto& [key, value] : entries) {
    if (const auto text = key.string()) {
      WriteKey(writer, *text);
    } else if (const auto number = key.integer()) {
      WriteKey(writer, fmt::to_string(*number));
    } else {
      WriteKey(writer, fmt::to_string(*key.unsignedInteger()));
    }
    Write(writer, value);
  }
  writer.EndObject();
}

/// `value`: a `PayloadValue` or a `Value`.
template <class Writer, class AnyValue>
void Write(Writer& writer, const AnyValue& value) {
  switch (value.kind()) {
    case Value::Kind::nil:
      writer.Null();
      return;
    case Value::Kind::boolean:
      writer.Bool(*value.boolean());
      return;
    case Value::Kind::integer:
      writer.Int64(*value.integer());
      return;
    case Value::Kind::unsignedInteger:
      writer.Uint64(*value.unsignedInteger());
      return;
    case Value::Kind::real:
      return WriteReal(writer, *value.real());
    case Value::Kind::string:
      return WriteText(writer, *value.string());
    case Value::Kind::bytes:
      return WriteText(writer, ToBase64(OctetsOf(value)));
    case Value::Kind::date:
      return WriteText(writer, DateCharacters(*value.date()));
    case Value::Kind::list:
      writer.StartArray();
      for (const auto& item : ItemsOf(value)) Write(writer, item);
      writer.EndArray();
      return;
    case Value::Kind::dictionary:
      return WriteEntries(writer, EntriesOf(value));
  }
}

/// Builds a tree from RapidJSON's events. Held on a stack of its own, so that nesting costs no
/// recursion.
class TreeBuilder : public rapidjson::BaseReaderHandler<rapidjson::UTF8<>, TreeBuilder> {
 public:
  bool Null() { return add(nullptr); }
  bool Bool(bool boolean) { return add(boolean); }
  bool Int(int number) { return add(number); }
  bool Uint(unsigned number) { return add(number); }
  bool Int64(std::int64_t number) { return add(number); }
  bool Uint64(std::uint64_t number) { return add(number); }
  bool Double(double number) { return add(number); }
  bool String(const char* text, rapidjson::SizeType length, bool) {
    return add(std::string(text, length));
  }
  bool Key(const char* text, rapidjson::SizeType length, bool) {
    open_.back().key.assign(text, length);
    return true;
  }
  bool StartObject() { return start(Dictionary()); }
  bool StartArray() { return start(List()); }
  bool EndObject(rapidjson::SizeType) { return finish(); }
  bool EndArray(rapidjson::SizeType) { return finish(); }

  [[nodiscard]] Value& root() { return root_; }
  [[nodiscard]] bool tooDeep() const { return tooDeep_; }

 private:
  struct Container {
    std::variant<List, Dictionary> content;
    std::string key;
  };

  bool add(Value value) {
    if (open_.empty()) {
      root_ = std::move(value);
    } else if (auto* list = std::get_if<List>(&open_.back().content)) {
      list->push_back(std::move(value));
    } else {
      std::get<Dictionary>(open_.back().content).set(open_.back().key, std::move(value));
    }
    return true;
  }
  bool start(std::variant<List, Dictionary> content) {
    if (open_.size() == MessagePackScanner::kDeepest) {
      tooDeep_ = true;
      return false;
    }
    open_.push_back({std::move(content), {}});
    return true;
  }
  bool finish() {
    Container container = std::move(open_.back());
    open_.pop_back();
    return std::visit([this](auto& content) { return add(std::move(content)); }, container.content);
  }

  Value root_;
  std::vector<Container> open_;
  bool tooDeep_ = false;
};

}  // namespace

void AppendJson(std::string& out, PayloadValue value) {
  CompactWriter writer(out);
  Write(writer, value);
}
void AppendJson(std::string& out, const Value& value) {
  CompactWriter writer(out);
  Write(writer, value);
}
void AppendJson(std::string& out, const Dictionary& dictionary) {
  CompactWriter writer(out);
  WriteEntries(writer, dictionary);
}

std::string JsonText(const Payload& payload) {
  std::string text;
  AppendJson(text, payload.root());
  return text;
}

std::string JsonText(const Value& value) {
  std::string text;
  AppendJson(text, value);
  return text;
}

std::string JsonText(const Dictionary& dictionary) {
  std::string text;
  AppendJson(text, dictionary);
  return text;
}

struct PrettyJsonWriter::Implementation {
  std::string text;
  StringStream stream{text};
  PrettyWriter writer{stream};
};

PrettyJsonWriter::PrettyJsonWriter() : implementation_(std::make_unique<Implementation>()) {}
PrettyJsonWriter::~PrettyJsonWriter() = default;

void PrettyJsonWriter::beginList() {
  implementation_->writer.StartArray();
}
void PrettyJsonWriter::endList() {
  implementation_->writer.EndArray();
}
void PrettyJsonWriter::beginDictionary() {
  implementation_->writer.StartObject();
}
void PrettyJsonWriter::endDictionary() {
  implementation_->writer.EndObject();
}
void PrettyJsonWriter::key(std::string_view key) {
  WriteKey(implementation_->writer, key);
}
void PrettyJsonWriter::value(PayloadValue value) {
  Write(implementation_->writer, value);
}
void PrettyJsonWriter::value(const Dictionary& dictionary) {
  WriteEntries(implementation_->writer, dictionary);
}

Result<std::string> PrettyJsonWriter::finish() {
  if (!IsUtf8(implementation_->text)) {
    return Error::because("quarvel.json", 3, "A text in it is not UTF-8.");
  }
  return std::move(implementation_->text);
}

Result<Value> ValueFromJson(std::string_view text) {
  rapidjson::MemoryStream memory(text.data(), text.size());
  rapidjson::Reader reader;
  TreeBuilder builder;
  constexpr unsigned kFlags = rapidjson::kParseValidateEncodingFlag |
                              rapidjson::kParseFullPrecisionFlag | rapidjson::kParseIterativeFlag;
  const rapidjson::ParseResult parsed = reader.Parse<kFlags>(memory, builder);
  if (!parsed.IsError()) return std::move(builder.root());
  if (builder.tooDeep()) {
    return Error::because("quarvel.json", 2,
                          fmt::format("It is nested deeper than {}, at offset {}.",
                                      MessagePackScanner::kDeepest, parsed.Offset()));
  }
  return Error::because(
      "quarvel.json", 1,
      fmt::format("{} At offset {}.", rapidjson::GetParseError_En(parsed.Code()), parsed.Offset()));
}

}  // namespace quarvel
