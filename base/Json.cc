#include "base/Json.h"

#include <fmt/format.h>
#include <rapidjson/error/en.h>
#include <rapidjson/prettywriter.h>
#include <rapidjson/reader.h>
#include <rapidjson/writer.h>

#include <cmath>
#include <variant>

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

using JsonWriter = rapidjson::Writer<StringStream>;
using PrettyWriter = rapidjson::PrettyWriter<StringStream>;

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

/// RFC 4648, section 4.
std::string Base64(std::string_view octets) {
  static constexpr std::string_view kAlphabet =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string text;
  text.reserve((octets.size() + 2) / 3 * 4);
  for (std::size_t i = 0; i < octets.size(); i += 3) {
    const std::size_t count = std::min<std::size_t>(3, octets.size() - i);
    std::uint32_t group = 0;
    for (std::size_t j = 0; j < 3; ++j) {
      group = group << 8 | (j < count ? static_cast<unsigned char>(octets[i + j]) : 0U);
    }
    for (std::size_t j = 0; j < 4; ++j) {
      text.push_back(j <= count ? kAlphabet[group >> (18 - 6 * j) & 0x3f] : '=');
    }
  }
  return text;
}

template <class Writer>
void Write(Writer& writer, PayloadValue value);
template <class Writer>
void Write(Writer& writer, const Dictionary& dictionary);

template <class Writer>
void WriteEntryKey(Writer& writer, PayloadValue key) {
  if (const auto text = key.string()) {
    WriteKey(writer, *text);
  } else if (const auto number = key.integer()) {
    WriteKey(writer, fmt::to_string(*number));
  } else {
    WriteKey(writer, fmt::to_string(key.unsignedInteger().value_or(0)));
  }
}

template <class Writer>
void WriteEntryKey(Writer& writer, const Key& key) {
  if (const auto* text = key.string()) {
    WriteKey(writer, *text);
  } else if (const auto* number = key.integer()) {
    WriteKey(writer, fmt::to_string(*number));
  } else {
    WriteKey(writer, fmt::to_string(*key.unsignedInteger()));
  }
}

template <class Writer>
void Write(Writer& writer, PayloadValue value) {
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
      return WriteText(writer, Base64(*value.bytes()));
    case Value::Kind::date:
      return WriteText(writer, DateText(value.date().value_or(Date{})));
    case Value::Kind::list:
      writer.StartArray();
      for (const PayloadValue item : value.items()) Write(writer, item);
      writer.EndArray();
      return;
    case Value::Kind::dictionary:
      writer.StartObject();
      for (const PayloadEntry& entry : value.entries()) {
        WriteEntryKey(writer, entry.key);
        Write(writer, entry.value);
      }
      writer.EndObject();
      return;
  }
}

template <class Writer>
void Write(Writer& writer, const Value& value) {
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
      return WriteText(writer, Base64(value.bytes()->octets));
    case Value::Kind::date:
      return WriteText(writer, DateText(*value.date()));
    case Value::Kind::list:
      writer.StartArray();
      for (const Value& item : *value.list()) Write(writer, item);
      writer.EndArray();
      return;
    case Value::Kind::dictionary:
      return Write(writer, *value.dictionary());
  }
}

template <class Writer>
void Write(Writer& writer, const Dictionary& dictionary) {
  writer.StartObject();
  for (const auto& [key, value] : dictionary) {
    WriteEntryKey(writer, key);
    Write(writer, value);
  }
  writer.EndObject();
}

template <class T>
void Append(std::string& out, const T& value) {
  StringStream stream(out);
  JsonWriter writer(stream);
  Write(writer, value);
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
  Append(out, value);
}
void AppendJson(std::string& out, const Value& value) {
  Append(out, value);
}
void AppendJson(std::string& out, const Dictionary& dictionary) {
  Append(out, dictionary);
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
  Write(implementation_->writer, dictionary);
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
