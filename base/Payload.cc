#include "base/Payload.h"

#include <fmt/format.h>

#include <algorithm>
#include <bit>
#include <limits>
#include <unordered_set>
#include <vector>

#include "base/MessagePack.h"
#include "base/MessagePackForm.h"
#include "base/Utf8.h"

namespace quarvel {

namespace {

using Form = MessagePackForm;

const Form& FormAt(const char* value) {
  return Form::of(static_cast<unsigned char>(*value));
}

/// What follows the head: the octets of a string, the first item of a list.
const char* BodyOf(const char* value) {
  return value + FormAt(value).headBytes();
}

/// The byte after the value.
const char* AfterValue(const char* value) {
  // Values still to be skipped; containers add theirs, so no recursion is needed.
  for (std::uint64_t left = 1; left > 0; --left) {
    const Form& form = FormAt(value);
    const std::uint64_t length = form.length(value);
    value += form.headBytes();
    if (form.kind == Form::Kind::list) {
      left += length;
    } else if (form.kind == Form::Kind::dictionary) {
      left += 2 * length;
    } else {
      value += length;
    }
  }
  return value;
}

std::string_view Octets(const char* value) {
  return {BodyOf(value), static_cast<std::size_t>(FormAt(value).length(value))};
}

constexpr signed char kTimestampType = -1;

bool IsTimestamp(const char* value) {
  return FormAt(value).kind == Form::Kind::extension &&
         static_cast<signed char>(*(BodyOf(value) - 1)) == kTimestampType;
}

}  // namespace

PayloadValue::Kind PayloadValue::kind() const {
  switch (FormAt(at_).kind) {
    case Form::Kind::boolean:
      return Kind::boolean;
    case Form::Kind::integer:
      return Kind::integer;
    case Form::Kind::unsignedInteger:
      return integer() ? Kind::integer : Kind::unsignedInteger;
    case Form::Kind::real:
      return Kind::real;
    case Form::Kind::string:
      return Kind::string;
    case Form::Kind::bytes:
      return Kind::bytes;
    case Form::Kind::extension:
      return Kind::date;
    case Form::Kind::list:
      return Kind::list;
    case Form::Kind::dictionary:
      return Kind::dictionary;
    case Form::Kind::nil:
    case Form::Kind::unused:
      break;
  }
  return Kind::nil;
}

std::optional<bool> PayloadValue::boolean() const {
  if (FormAt(at_).kind != Form::Kind::boolean) return std::nullopt;
  return *at_ == '\xc3';
}

std::optional<std::int64_t> PayloadValue::integer() const {
  const Form& form = FormAt(at_);
  if (form.kind == Form::Kind::unsignedInteger) {
    const std::uint64_t number = *unsignedInteger();
    if (number > std::numeric_limits<std::int64_t>::max()) return std::nullopt;
    return static_cast<std::int64_t>(number);
  }
  if (form.kind != Form::Kind::integer) return std::nullopt;
  if (form.fixed == 0) return static_cast<signed char>(*at_);
  // Shifted up and back down, the sign bit spreads.
  const int unusedBits = 64 - 8 * form.fixed;
  return static_cast<std::int64_t>(Form::bigEndian(at_ + 1, form.fixed) << unusedBits) >>
         unusedBits;
}

std::optional<std::uint64_t> PayloadValue::unsignedInteger() const {
  const Form& form = FormAt(at_);
  if (form.kind == Form::Kind::unsignedInteger) {
    return form.fixed == 0 ? static_cast<unsigned char>(*at_)
                           : Form::bigEndian(at_ + 1, form.fixed);
  }
  const auto number = integer();
  if (!number || *number < 0) return std::nullopt;
  return static_cast<std::uint64_t>(*number);
}

std::optional<double> PayloadValue::real() const {
  const Form& form = FormAt(at_);
  if (form.kind != Form::Kind::real) return std::nullopt;
  const std::uint64_t bits = Form::bigEndian(at_ + 1, form.fixed);
  if (form.fixed == 4) return std::bit_cast<float>(static_cast<std::uint32_t>(bits));
  return std::bit_cast<double>(bits);
}

std::optional<std::string_view> PayloadValue::string() const {
  if (FormAt(at_).kind != Form::Kind::string) return std::nullopt;
  return Octets(at_);
}

std::optional<std::string_view> PayloadValue::bytes() const {
  if (FormAt(at_).kind != Form::Kind::bytes) return std::nullopt;
  return Octets(at_);
}

std::optional<Date> PayloadValue::date() const {
  using namespace std::chrono;
  if (!IsTimestamp(at_)) return std::nullopt;
  const std::string_view octets = Octets(at_);
  std::int64_t count = 0;
  std::uint64_t subsecond = 0;
  if (octets.size() == 4) {
    count = static_cast<std::int64_t>(Form::bigEndian(octets.data(), 4));
  } else if (octets.size() == 8) {
    const std::uint64_t both = Form::bigEndian(octets.data(), 8);
    subsecond = both >> 34;
    count = static_cast<std::int64_t>(both & 0x3'ffff'ffffU);
  } else if (octets.size() == 12) {
    subsecond = Form::bigEndian(octets.data(), 4);
    count = static_cast<std::int64_t>(Form::bigEndian(octets.data() + 4, 8));
  } else {
    return std::nullopt;
  }
  if (subsecond > 999'999'999 || count < kEarliestDate.time_since_epoch() / seconds(1) ||
      count > kLatestDate.time_since_epoch() / seconds(1)) {
    return std::nullopt;
  }
  return Date(seconds(count) + floor<microseconds>(nanoseconds(subsecond)));
}

std::size_t PayloadValue::count() const {
  const Form& form = FormAt(at_);
  return form.isContainer() ? static_cast<std::size_t>(form.length(at_)) : 0;
}

PayloadValue::Items PayloadValue::items() const {
  return {BodyOf(at_), FormAt(at_).kind == Form::Kind::list ? count() : 0};
}

PayloadValue::Entries PayloadValue::entries() const {
  return {BodyOf(at_), FormAt(at_).kind == Form::Kind::dictionary ? count() : 0};
}

std::optional<PayloadValue> PayloadValue::find(std::string_view key) const {
  for (const PayloadEntry& entry : entries()) {
    if (entry.key.string() == key) return entry.value;
  }
  return std::nullopt;
}

std::string_view PayloadValue::encoded() const {
  return {at_, static_cast<std::size_t>(AfterValue(at_) - at_)};
}

PayloadValue::Items::Iterator& PayloadValue::Items::Iterator::operator++() {
  if (--left_ > 0) at_ = AfterValue(at_);
  return *this;
}

PayloadValue::Entries::Iterator::Iterator(const char* at, std::size_t left) : at_(at), left_(left) {
  if (left_ > 0) value_ = AfterValue(at_);
}

PayloadValue::Entries::Iterator& PayloadValue::Entries::Iterator::operator++() {
  if (--left_ > 0) {
    at_ = AfterValue(value_);
    value_ = AfterValue(at_);
  }
  return *this;
}

namespace {

Key KeyOf(PayloadValue key) {
  if (const auto text = key.string()) return *text;
  if (const auto number = key.integer()) return *number;
  return key.unsignedInteger().value_or(0);
}

}  // namespace

Value PayloadValue::toValue() const {
  switch (kind()) {
    case Kind::nil:
      return nullptr;
    case Kind::boolean:
      return *boolean();
    case Kind::integer:
      return *integer();
    case Kind::unsignedInteger:
      return *unsignedInteger();
    case Kind::real:
      return *real();
    case Kind::string:
      return *string();
    case Kind::bytes:
      return Bytes{std::string(*bytes())};
    case Kind::date:
      return date().value_or(Date{});
    case Kind::list: {
      List list;
      list.reserve(count());
      for (const PayloadValue item : items()) list.push_back(item.toValue());
      return list;
    }
    case Kind::dictionary:
      return toDictionary();
  }
  return nullptr;
}

Dictionary PayloadValue::toDictionary() const {
  Dictionary dictionary;
  for (const PayloadEntry& entry : entries())
    dictionary.set(KeyOf(entry.key), entry.value.toValue());
  return dictionary;
}

// The block is its bytes with a count in front: one allocation a payload.
struct Payload::Block {
  std::atomic<std::uint32_t> references{1};
  std::uint32_t size = 0;

  [[nodiscard]] char* bytes() { return reinterpret_cast<char*>(this + 1); }

  static Block* copyOf(std::string_view encoded) {
    void* memory = ::operator new(sizeof(Block) + encoded.size());
    auto* block = ::new (memory) Block;
    block->size = static_cast<std::uint32_t>(encoded.size());
    std::ranges::copy(encoded, block->bytes());
    return block;
  }
};

namespace {

constexpr const char* kEmptyDictionary = "\x80";

/// Whether a dictionary, whose keys are strings or integers, may have equal keys; false is certain.
/// A client's dictionary is small, so comparing each with each is cheapest; a large one may be
/// meant to make that expensive.
bool MayHaveEqualKeys(PayloadValue dictionary) {
  constexpr std::size_t kSmall = 32;
  const std::size_t count = dictionary.count();
  if (count < 2) return false;
  if (count > kSmall) {
    std::unordered_set<std::string_view> texts;
    std::unordered_set<std::uint64_t> numbers;
    for (const PayloadEntry& entry : dictionary.entries()) {
      if (const auto text = entry.key.string()) {
        if (!texts.insert(*text).second) return true;
      } else {
        const auto number = entry.key.integer();
        const std::uint64_t bits =
            number ? static_cast<std::uint64_t>(*number) : *entry.key.unsignedInteger();
        // Signed and unsigned numbers of the same bits are different keys, but so rare a meeting
        // may as well take the slow path, which tells them apart.
        if (!numbers.insert(bits).second) return true;
      }
    }
    return false;
  }
  std::array<std::string_view, kSmall> keys;
  std::size_t seen = 0;
  for (const PayloadEntry& entry : dictionary.entries()) {
    // A string and an integer never have the same bytes; an integer's two forms are two byte
    // strings, so integers are compared in their shortest form.
    const auto text = entry.key.string();
    if (!text) return true;
    for (std::size_t i = 0; i < seen; ++i) {
      if (keys[i] == *text) return true;
    }
    keys[seen++] = *text;
  }
  return false;
}

/// What makes a well-formed value no payload, a sentence's end; and whether it needs rewriting.
struct Inspection {
  std::string fault;
  bool mayHaveEqualKeys = false;

  bool inspect(PayloadValue value) {
    switch (value.kind()) {
      case Value::Kind::string: {
        if (IsUtf8(*value.string())) return true;
        fault = "a string in it is not UTF-8";
        return false;
      }
      case Value::Kind::date: {
        if (value.date()) return true;
        fault =
            "an extension in it is not a timestamp (type -1) between the years 1 and 9999, "
            "the only extension allowed";
        return false;
      }
      case Value::Kind::list: {
        for (const PayloadValue item : value.items()) {
          if (!inspect(item)) return false;
        }
        return true;
      }
      case Value::Kind::dictionary: {
        for (const PayloadEntry& entry : value.entries()) {
          const Value::Kind keyKind = entry.key.kind();
          if (keyKind != Value::Kind::string && keyKind != Value::Kind::integer &&
              keyKind != Value::Kind::unsignedInteger) {
            fault = "a key in it is neither a string nor an integer";
            return false;
          }
          if (!inspect(entry.key) || !inspect(entry.value)) return false;
        }
        mayHaveEqualKeys = mayHaveEqualKeys || MayHaveEqualKeys(value);
        return true;
      }
      default:
        return true;
    }
  }
};

struct KeyHash {
  std::size_t operator()(const Key& key) const { return key.hash(); }
};

/// Writes a value again, each dictionary without the entries whose key comes again later.
void WriteWithLastKeys(MessagePackWriter& writer, PayloadValue value) {
  if (value.kind() == Value::Kind::list) {
    writer.list(value.count());
    for (const PayloadValue item : value.items()) WriteWithLastKeys(writer, item);
  } else if (value.kind() == Value::Kind::dictionary) {
    std::unordered_map<Key, std::size_t, KeyHash> last;
    std::size_t index = 0;
    for (const PayloadEntry& entry : value.entries()) last[KeyOf(entry.key)] = index++;
    writer.dictionary(last.size());
    index = 0;
    for (const PayloadEntry& entry : value.entries()) {
      if (last[KeyOf(entry.key)] != index++) continue;
      writer.encoded(entry.key.encoded());
      WriteWithLastKeys(writer, entry.value);
    }
  } else {
    writer.encoded(value.encoded());
  }
}

}  // namespace

Payload::Payload() : block_(nullptr) {}

Payload::Payload(std::string_view encoded) : block_(Block::copyOf(encoded)) {}

Payload::Payload(const Dictionary& dictionary) : block_(nullptr) {
  std::string encoded;
  MessagePackWriter(encoded).value(dictionary);
  block_ = Block::copyOf(encoded);
}

Payload::Payload(const Payload& other) noexcept : block_(other.block_) {
  if (block_ != nullptr) block_->references.fetch_add(1, std::memory_order_relaxed);
}

Payload::~Payload() {
  if (block_ != nullptr && block_->references.fetch_sub(1, std::memory_order_acq_rel) == 1) {
    std::destroy_at(block_);
    ::operator delete(block_);
  }
}

const char* Payload::bytes() const {
  return block_ == nullptr ? kEmptyDictionary : block_->bytes();
}

std::string_view Payload::encoded() const {
  return block_ == nullptr ? std::string_view(kEmptyDictionary)
                           : std::string_view(block_->bytes(), block_->size);
}

Result<Payload> Payload::from(PayloadValue dictionary) {
  const auto refuse = [](std::string reason) {
    return Error::because("quarvel.payload", 1, std::move(reason));
  };
  if (dictionary.kind() != Value::Kind::dictionary) return refuse("it is not a dictionary");
  const std::string_view encoded = dictionary.encoded();
  if (encoded.size() > std::numeric_limits<std::uint32_t>::max()) return refuse("it is over 4 GiB");
  Inspection inspection;
  if (!inspection.inspect(dictionary)) return refuse(std::move(inspection.fault));
  if (!inspection.mayHaveEqualKeys) return Payload(encoded);
  std::string rewritten;
  rewritten.reserve(encoded.size());
  MessagePackWriter writer(rewritten);
  WriteWithLastKeys(writer, dictionary);
  return Payload(rewritten);
}

Payload Payload::setting(std::string_view key, const Value& value) const {
  const bool replaces = find(key).has_value();
  std::string rewritten;
  rewritten.reserve(encoded().size() + key.size() + 64);
  MessagePackWriter writer(rewritten);
  writer.dictionary(count() + (replaces ? 0 : 1));
  for (const PayloadEntry& entry : root().entries()) {
    writer.encoded(entry.key.encoded());
    if (entry.key.string() == key) {
      writer.value(value);
    } else {
      writer.encoded(entry.value.encoded());
    }
  }
  if (!replaces) {
    writer.string(key);
    writer.value(value);
  }
  return Payload(rewritten);
}

Payload Payload::replacingInKeys(char from, char to) const {
  const auto concerned = [from](const PayloadEntry& entry) {
    const auto text = entry.key.string();
    return text && text->find(from) != std::string_view::npos;
  };
  bool any = false;
  for (const PayloadEntry& entry : root().entries()) any = any || concerned(entry);
  if (!any) return *this;

  std::string rewritten;
  rewritten.reserve(encoded().size());
  MessagePackWriter writer(rewritten);
  writer.dictionary(count());
  for (const PayloadEntry& entry : root().entries()) {
    if (concerned(entry)) {
      std::string text(*entry.key.string());
      std::ranges::replace(text, from, to);
      writer.string(text);
    } else {
      writer.encoded(entry.key.encoded());
    }
    writer.encoded(entry.value.encoded());
  }
  if (!MayHaveEqualKeys(PayloadValue(rewritten.data()))) return Payload(rewritten);
  std::string unique;
  MessagePackWriter uniqueWriter(unique);
  WriteWithLastKeys(uniqueWriter, PayloadValue(rewritten.data()));
  return Payload(unique);
}

}  // namespace quarvel
