#include "base/Payload.h"

#include <fmt/format.h>

#include <algorithm>
#include <bit>
#include <limits>
#include <vector>

#include "base/MessagePack.h"
#include "base/SecretHash.h"
#include "base/Utf8.h"

namespace quarvel {

namespace {

using Form = MessagePackForm;

/// The byte after the head: a string's first octet, a list's first item.
const char* BodyOf(const char* value) {
  return value + Form::at(value).headBytes;
}

std::string_view Octets(const char* value) {
  return {BodyOf(value), static_cast<std::size_t>(Form::at(value).length(value))};
}

constexpr signed char kTimestampType = -1;

bool IsTimestamp(const char* value) {
  return Form::at(value).kind == Form::Kind::extension &&
         static_cast<signed char>(*(BodyOf(value) - 1)) == kTimestampType;
}

}  // namespace

static_assert(static_cast<int>(Form::Kind::nil) == static_cast<int>(Value::Kind::nil) &&
              static_cast<int>(Form::Kind::bytes) == static_cast<int>(Value::Kind::bytes) &&
              static_cast<int>(Form::Kind::extension) == static_cast<int>(Value::Kind::date) &&
              static_cast<int>(Form::Kind::dictionary) ==
                  static_cast<int>(Value::Kind::dictionary));

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

std::optional<PayloadValue> PayloadValue::find(std::string_view key) const {
  for (const PayloadEntry& entry : entries()) {
    if (entry.key.string() == key) return entry.value;
  }
  return std::nullopt;
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
struct __attribute__((visibility("hidden"))) Payload::Block {
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

/// A hash table of one dictionary's keys; points into the dictionary's bytes.
class KeyTable {
 public:
  explicit KeyTable(PayloadValue dictionary)
      : bytes_(dictionary.data()),
        places_(std::bit_ceil(dictionary.count() + dictionary.count() / 2 + 1)) {}

  /// Puts the key that begins at `key`, a string or an integer, in the place of an equal one.
  /// Returns the replaced key; null when there is none.
  const char* put(const char* key) {
    const auto offset = static_cast<std::uint64_t>(key - bytes_);
    if (offset > std::numeric_limits<std::uint32_t>::max())
      return nullptr;  // too long for a payload
    std::uint32_t& place = placeOf(key);
    const char* const before = at(place);
    place = static_cast<std::uint32_t>(offset);
    return before;
  }
  [[nodiscard]] const char* find(const char* key) { return at(placeOf(key)); }

 private:
  static std::uint64_t hash(PayloadValue key) {
    if (const auto text = key.string()) return SecretHash::of(*text);
    const auto number = key.integer();
    return SecretHash::of(number ? static_cast<std::uint64_t>(*number) : *key.unsignedInteger());
  }
  static bool areEqual(PayloadValue one, PayloadValue other) {
    return one.string() == other.string() && one.integer() == other.integer() &&
           one.unsignedInteger() == other.unsignedInteger();
  }

  [[nodiscard]] const char* at(std::uint32_t place) const {
    return place == 0 ? nullptr : bytes_ + place;
  }
  std::uint32_t& placeOf(const char* key) {
    const std::size_t mask = places_.size() - 1;
    std::size_t i = hash(PayloadValue(key)) & mask;
    while (places_[i] != 0 && !areEqual(PayloadValue(at(places_[i])), PayloadValue(key))) {
      i = (i + 1) & mask;
    }
    return places_[i];
  }

  const char* const bytes_;
  // Offsets from the dictionary's first byte; 0: free, since no key begins there.
  std::vector<std::uint32_t> places_;
};

/// Finds equal keys of one dictionary. Most dictionaries are small, and comparing is cheapest
/// there; a large one goes to the hash table, since it may be built to make comparing expensive.
class SeenKeys {
 public:
  explicit SeenKeys(PayloadValue dictionary)
      : dictionary_(dictionary), isSmall_(dictionary.count() <= kSmall) {}

  /// Adds the key that begins at `key`; returns whether it is new. `text` is the key when that is a
  /// string.
  bool add(const char* key, const std::optional<std::string_view>& text) {
    if (isSmall_ && text) return addSmall(*text);
    if (!table_) table_.emplace(dictionary_);
    return table_->put(key) == nullptr;
  }

 private:
  static constexpr std::size_t kSmall = 32;

  struct Span {
    const char* text;
    std::size_t length;
  };

  bool addSmall(std::string_view text) {
    const auto at = [&text](std::size_t i) -> std::size_t {
      return static_cast<unsigned char>(text[i]);
    };
    const std::size_t mark =
        text.empty() ? 0 : text.size() + 7 * at(text.size() / 2) + 31 * at(text.size() - 1);
    if (isMarked(mark)) {
      for (std::size_t i = 0; i < added_; ++i) {
        if (std::string_view(small_[i].text, small_[i].length) == text) return false;
      }
    }
    small_[added_++] = {text.data(), text.size()};
    return true;
  }
  /// Sets the mark and returns whether it was set: keys with different marks are different.
  bool isMarked(std::size_t mark) {
    std::uint64_t& word = marks_[mark / 64 % marks_.size()];
    const std::uint64_t bit = std::uint64_t{1} << mark % 64;
    const bool was = (word & bit) != 0;
    word |= bit;
    return was;
  }

  const PayloadValue dictionary_;
  const bool isSmall_;
  std::array<std::uint64_t, 4> marks_{};
  std::array<Span, kSmall> small_;  // the first `added_`; the rest is not initialised
  std::size_t added_ = 0;
  std::optional<KeyTable> table_;
};

/// Walks a well-formed value once. Finds faults that keep it from being a payload, and equal keys,
/// which need rewriting.
class Inspection {
 public:
  /// The byte after the value; null at a fault.
  const char* inspect(const char* value) {
    const Form& form = Form::at(value);
    switch (form.kind) {
      case Form::Kind::string:
        if (!IsUtf8(Octets(value))) return refuse(kNotUtf8);
        break;
      case Form::Kind::extension:
        if (!PayloadValue(value).date()) {
          return refuse(
              "an extension in it is not a timestamp (type -1) between the years 1 and 9999, "
              "the only extension allowed");
        }
        break;
      case Form::Kind::list: {
        const char* at = BodyOf(value);
        for (std::uint64_t left = form.length(value); left > 0 && at != nullptr; --left) {
          const std::uint64_t passed = OneByteValues(at, left - 1);
          at += passed;
          left -= passed;
          at = inspect(at);
        }
        return at;
      }
      case Form::Kind::dictionary:
        return inspectEntries(value);
      default:
        break;
    }
    return value + form.headBytes + form.length(value);
  }

  [[nodiscard]] const std::string& fault() const { return fault_; }
  [[nodiscard]] bool hasEqualKeys() const { return hasEqualKeys_; }

 private:
  const char* inspectEntries(const char* dictionary) {
    const std::uint64_t count = Form::at(dictionary).length(dictionary);
    SeenKeys seen{PayloadValue(dictionary)};
    const char* at = BodyOf(dictionary);
    for (std::uint64_t left = count; left > 0; --left) {
      const PayloadValue key(at);
      const auto text = key.string();
      if (text ? !IsUtf8(*text) : !key.isInteger()) {
        return refuse(text ? kNotUtf8 : "a key in it is neither a string nor an integer");
      }
      hasEqualKeys_ |= !seen.add(at, text);
      at = text ? text->data() + text->size() : AfterMessagePack(at);
      at = inspect(at);
      if (at == nullptr) return nullptr;
    }
    return at;
  }
  const char* refuse(const char* fault) {
    fault_ = fault;
    return nullptr;
  }

  static constexpr const char* kNotUtf8 = "a string in it is not UTF-8";

  std::string fault_;
  bool hasEqualKeys_ = false;
};

bool HasEqualKeys(PayloadValue dictionary) {
  SeenKeys seen(dictionary);
  for (const PayloadEntry& entry : dictionary.entries()) {
    if (!seen.add(entry.key.data(), entry.key.string())) return true;
  }
  return false;
}

/// Copies a value, without the entries whose key comes again later in their dictionary.
void WriteWithLastKeys(MessagePackWriter& writer, PayloadValue value) {
  if (value.kind() == Value::Kind::list) {
    writer.list(value.count());
    for (const PayloadValue item : value.items()) WriteWithLastKeys(writer, item);
  } else if (value.kind() == Value::Kind::dictionary) {
    KeyTable last(value);
    std::size_t count = 0;
    for (const PayloadEntry& entry : value.entries()) {
      if (last.put(entry.key.data()) == nullptr) ++count;
    }
    writer.dictionary(count);
    for (const PayloadEntry& entry : value.entries()) {
      if (last.find(entry.key.data()) != entry.key.data()) continue;
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
  Inspection inspection;
  const char* const end = inspection.inspect(dictionary.data());
  if (end == nullptr) return refuse(inspection.fault());
  const std::string_view encoded(dictionary.data(),
                                 static_cast<std::size_t>(end - dictionary.data()));
  if (encoded.size() > std::numeric_limits<std::uint32_t>::max()) return refuse("it is over 4 GiB");
  if (!inspection.hasEqualKeys()) return Payload(encoded);
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
  // Most payloads have no such character anywhere, and one search shows that.
  if (encoded().find(from) != std::string_view::npos) {
    for (const PayloadEntry& entry : root().entries()) any = any || concerned(entry);
  }
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
  if (!HasEqualKeys(PayloadValue(rewritten.data()))) return Payload(rewritten);
  std::string unique;
  MessagePackWriter uniqueWriter(unique);
  WriteWithLastKeys(uniqueWriter, PayloadValue(rewritten.data()));
  return Payload(unique);
}

}  // namespace quarvel
