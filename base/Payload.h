#pragma once

#include <atomic>
#include <bit>
#include <cstddef>
#include <cstdint>
#include <iterator>
#include <limits>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include "base/Error.h"
#include "base/MessagePackForm.h"
#include "base/Value.h"

namespace quarvel {

/// A view of one value inside MessagePack bytes, walked in place: no tree, no copy. Cheap to copy,
/// valid as long as the bytes are, safe to use from every thread. The bytes must be well-formed: a
/// `MessagePackScanner` has found the value's end. Only inside a `Payload` are strings known to be
/// UTF-8 and keys to be of an allowed kind.
class PayloadValue {
 public:
  using Kind = Value::Kind;
  class Items;    // the range over a list
  class Entries;  // the range over a dictionary

  /// The value whose first byte is at `wellFormed`.
  explicit PayloadValue(const char* wellFormed) : at_(wellFormed) {}

  /// An extension is a date: no other extension is allowed in a payload.
  [[nodiscard]] Kind kind() const {
    const MessagePackForm& form = MessagePackForm::at(at_);
    // In every form, a number in the signed range is a signed integer.
    if (form.kind == MessagePackForm::Kind::unsignedInteger) {
      return form.fixed == 8 && at_[1] < 0 ? Kind::unsignedInteger : Kind::integer;
    }
    return static_cast<Kind>(form.kind);
  }
  [[nodiscard]] bool isNil() const { return kind() == Kind::nil; }
  /// Whether the value is an integer of either kind.
  [[nodiscard]] bool isInteger() const {
    const MessagePackForm::Kind kind = MessagePackForm::at(at_).kind;
    return kind == MessagePackForm::Kind::integer || kind == MessagePackForm::Kind::unsignedInteger;
  }

  // Each is none when the value is of another kind. The two integers accept every integer form
  // whose number fits their type. Texts and bytes are views of the value's bytes, not copies.
  [[nodiscard]] inline std::optional<bool> boolean() const;
  [[nodiscard]] inline std::optional<std::int64_t> integer() const;
  [[nodiscard]] inline std::optional<std::uint64_t> unsignedInteger() const;
  /// Single precision is widened to a double; an integer is no real.
  [[nodiscard]] inline std::optional<double> real() const;
  [[nodiscard]] std::optional<std::string_view> string() const {
    return octets(MessagePackForm::Kind::string);
  }
  [[nodiscard]] std::optional<std::string_view> bytes() const {
    return octets(MessagePackForm::Kind::bytes);
  }
  /// None also for an extension that is no timestamp, and for a date without an RFC 3339 text.
  /// Finer parts than a microsecond are cut off.
  [[nodiscard]] std::optional<Date> date() const;

  /// The number of a list's items or a dictionary's entries; 0 for other kinds.
  [[nodiscard]] std::size_t count() const {
    const MessagePackForm& form = MessagePackForm::at(at_);
    return form.isContainer() ? static_cast<std::size_t>(form.length(at_)) : 0;
  }
  /// For range-for over a list's values; empty for other kinds.
  [[nodiscard]] inline Items items() const;
  /// For range-for over a dictionary's entries in the order received; empty for other kinds.
  [[nodiscard]] inline Entries entries() const;
  /// A dictionary's value under a string key; none for other kinds. Walks the entries in order and
  /// takes the first with this key.
  [[nodiscard]] std::optional<PayloadValue> find(std::string_view key) const;

  /// The value's first byte.
  [[nodiscard]] const char* data() const { return at_; }
  /// The value's own MessagePack bytes. Walks to the value's end.
  [[nodiscard]] std::string_view encoded() const {
    return {at_, static_cast<std::size_t>(AfterMessagePack(at_) - at_)};
  }
  /// The same value as a tree, which is a copy.
  [[nodiscard]] Value toValue() const;
  /// A dictionary as a tree; empty for other kinds.
  [[nodiscard]] Dictionary toDictionary() const;

 private:
  /// The bytes behind the head of a value of this kind; none for every other kind.
  [[nodiscard]] std::optional<std::string_view> octets(MessagePackForm::Kind kind) const {
    const MessagePackForm& form = MessagePackForm::at(at_);
    if (form.kind != kind) return std::nullopt;
    return std::string_view(at_ + form.headBytes, static_cast<std::size_t>(form.length(at_)));
  }

  const char* at_;  // the value's first byte; never null
};

/// One entry of a dictionary, as two views. `key` is a string or an integer inside a `Payload`.
struct PayloadEntry {
  PayloadValue key;
  PayloadValue value;
};

/// A list's values, for range-for. Valid as long as the bytes.
class PayloadValue::Items {
 public:
  /// Walks over each item once: `operator++` passes the whole item, however deep.
  class Iterator {
   public:
    Iterator(const char* at, std::size_t left) : at_(at), left_(left) {}
    PayloadValue operator*() const { return PayloadValue(at_); }
    Iterator& operator++() {
      if (--left_ > 0) at_ = AfterMessagePack(at_);
      return *this;
    }
    bool operator==(std::default_sentinel_t) const { return left_ == 0; }

   private:
    const char* at_;
    std::size_t left_;  // items from `at_` on
  };
  Items(const char* first, std::size_t count) : first_(first), count_(count) {}
  [[nodiscard]] Iterator begin() const { return {first_, count_}; }
  [[nodiscard]] std::default_sentinel_t end() const { return {}; }

 private:
  const char* first_;
  std::size_t count_;
};

/// A dictionary's entries, for range-for. Valid as long as the bytes.
class PayloadValue::Entries {
 public:
  /// Finds a value by walking over its key, so each key is walked over once.
  class Iterator {
   public:
    Iterator(const char* at, std::size_t left) : at_(at), left_(left) {
      if (left_ > 0) value_ = AfterMessagePack(at_);
    }
    PayloadEntry operator*() const { return {PayloadValue(at_), PayloadValue(value_)}; }
    Iterator& operator++() {
      if (--left_ > 0) {
        at_ = AfterMessagePack(value_);
        value_ = AfterMessagePack(at_);
      }
      return *this;
    }
    bool operator==(std::default_sentinel_t) const { return left_ == 0; }

   private:
    const char* at_;               // the key
    const char* value_ = nullptr;  // its value; null in an empty dictionary
    std::size_t left_;             // entries from `at_` on
  };
  Entries(const char* first, std::size_t count) : first_(first), count_(count) {}
  [[nodiscard]] Iterator begin() const { return {first_, count_}; }
  [[nodiscard]] std::default_sentinel_t end() const { return {}; }

 private:
  const char* first_;
  std::size_t count_;
};

std::optional<bool> PayloadValue::boolean() const {
  if (MessagePackForm::at(at_).kind != MessagePackForm::Kind::boolean) return std::nullopt;
  return *at_ == '\xc3';
}

std::optional<std::int64_t> PayloadValue::integer() const {
  const MessagePackForm& form = MessagePackForm::at(at_);
  if (form.kind == MessagePackForm::Kind::unsignedInteger) {
    const std::uint64_t number = *unsignedInteger();
    if (number > std::numeric_limits<std::int64_t>::max()) return std::nullopt;
    return static_cast<std::int64_t>(number);
  }
  if (form.kind != MessagePackForm::Kind::integer) return std::nullopt;
  if (form.fixed == 0) return static_cast<signed char>(*at_);
  // Shifted up and back down, the sign bit spreads.
  const int unusedBits = 64 - 8 * form.fixed;
  return static_cast<std::int64_t>(MessagePackForm::bigEndian(at_ + 1, form.fixed) << unusedBits) >>
         unusedBits;
}

std::optional<std::uint64_t> PayloadValue::unsignedInteger() const {
  const MessagePackForm& form = MessagePackForm::at(at_);
  if (form.kind == MessagePackForm::Kind::unsignedInteger) {
    return form.fixed == 0 ? static_cast<unsigned char>(*at_)
                           : MessagePackForm::bigEndian(at_ + 1, form.fixed);
  }
  const auto number = integer();
  if (!number || *number < 0) return std::nullopt;
  return static_cast<std::uint64_t>(*number);
}

std::optional<double> PayloadValue::real() const {
  const MessagePackForm& form = MessagePackForm::at(at_);
  if (form.kind != MessagePackForm::Kind::real) return std::nullopt;
  const std::uint64_t bits = MessagePackForm::bigEndian(at_ + 1, form.fixed);
  if (form.fixed == 4) return std::bit_cast<float>(static_cast<std::uint32_t>(bits));
  return std::bit_cast<double>(bits);
}

PayloadValue::Items PayloadValue::items() const {
  const MessagePackForm& form = MessagePackForm::at(at_);
  return {at_ + form.headBytes, form.kind == MessagePackForm::Kind::list ? count() : 0};
}

PayloadValue::Entries PayloadValue::entries() const {
  const MessagePackForm& form = MessagePackForm::at(at_);
  return {at_ + form.headBytes, form.kind == MessagePackForm::Kind::dictionary ? count() : 0};
}

/// A client's dictionary as one immutable, shared block of its own MessagePack bytes. Strings are
/// UTF-8, keys are strings or integers, dates have an RFC 3339 text, no key stands twice in one
/// dictionary. Copying shares the block, which lives as long as its last copy; every thread may
/// read it.
class Payload {
 public:
  /// The empty dictionary.
  Payload();
  /// Copies a well-formed value (nesting at most `MessagePackScanner::kDeepest`) and checks that it
  /// is a payload. Of equal keys the last one stays. Errors: domain "quarvel.payload", with a
  /// reason.
  [[nodiscard]] static Result<Payload> from(PayloadValue dictionary);
  /// Encodes a tree. Its strings must be UTF-8 and its dates have an RFC 3339 text, which is not
  /// checked: the service has built the tree.
  explicit Payload(const Dictionary& dictionary);
  /// The payload in the bytes that a `MessagePackWriter` wrote. Precondition, not checked: they are
  /// a dictionary that is a payload.
  [[nodiscard]] static Payload written(std::string_view encoded) { return Payload(encoded); }

  // A copy shares the block and costs an atomic addition. A moved-from payload is the empty
  // dictionary.
  Payload(const Payload& other) noexcept;
  Payload(Payload&& other) noexcept : block_(std::exchange(other.block_, nullptr)) {}
  Payload& operator=(Payload other) noexcept {
    std::swap(block_, other.block_);
    return *this;
  }
  ~Payload();

  /// The payload's dictionary. Views of its bytes are valid as long as one copy of the payload
  /// lives.
  [[nodiscard]] PayloadValue root() const { return PayloadValue(bytes()); }
  /// The number of entries.
  [[nodiscard]] std::size_t count() const { return root().count(); }
  [[nodiscard]] bool empty() const { return count() == 0; }
  // For range-for over the entries in the order received.
  [[nodiscard]] auto begin() const;
  [[nodiscard]] auto end() const;
  /// The value under a string key; none when there is none.
  [[nodiscard]] std::optional<PayloadValue> find(std::string_view key) const {
    // Most lookups fail, and a search of the bytes shows that sooner than a look at each key.
    if (encoded().find(key) == std::string_view::npos) return std::nullopt;
    return root().find(key);
  }
  /// The payload's own MessagePack bytes.
  [[nodiscard]] std::string_view encoded() const;

  /// The payload with `from` replaced by `to` in its own string keys; nested dictionaries do not
  /// change. Of keys that become equal the last one stays. Shares the block when nothing
  /// changes.
  [[nodiscard]] Payload replacingInKeys(char from, char to) const;

  /// The payload with `value` under `key`: in place of an old value, else at the end. Copies the
  /// bytes; this payload does not change. `value` must be one that a payload may hold.
  [[nodiscard]] Payload setting(std::string_view key, const Value& value) const;

  /// Whether both are the same block, or hold the same bytes. The same entries in another order are
  /// other bytes.
  bool operator==(const Payload& other) const { return encoded() == other.encoded(); }
  /// Whether both are copies of one payload, or both made as the empty dictionary.
  [[nodiscard]] bool sharesBlockWith(const Payload& other) const { return block_ == other.block_; }

 private:
  /// The shared bytes with their reference count; null stands for the empty dictionary.
  struct Block;
  explicit Payload(std::string_view encoded);
  /// The first byte of the block, or of a constant empty dictionary.
  [[nodiscard]] const char* bytes() const;

  Block* block_;
};

inline auto Payload::begin() const {
  return root().entries().begin();
}
inline auto Payload::end() const {
  return std::default_sentinel;
}

}  // namespace quarvel
