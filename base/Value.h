#pragma once

#include <concepts>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <variant>
#include <vector>

#include "base/Date.h"

namespace quarvel {

/// The integer types that are numbers.
template <class T>
concept IntegerNumber = std::integral<T> && !std::same_as<T, bool>;

class Value;
class Dictionary;
/// Values in order. A list may hold values of different kinds.
using List = std::vector<Value>;

/// Octets that are not text. A type of its own, since a string is UTF-8.
struct Bytes {
  std::string octets;
  bool operator==(const Bytes&) const = default;
};

/// A dictionary's key: a string or an integer. Only a number above the signed range is held
/// unsigned, so that equal numbers are equal keys.
class Key {
 public:
  // Strings and integers convert to a key. A string is copied or moved in, and must be UTF-8.
  Key(std::string text) : key_(std::move(text)) {}         // NOLINT(google-explicit-constructor)
  Key(std::string_view text) : key_(std::string(text)) {}  // NOLINT(google-explicit-constructor)
  Key(const char* text) : key_(std::string(text)) {}       // NOLINT(google-explicit-constructor)
  /// Equal numbers of different types are equal keys.
  template <IntegerNumber Integer>
  Key(Integer integer) {  // NOLINT(google-explicit-constructor)
    if (std::in_range<std::int64_t>(integer)) {
      key_ = static_cast<std::int64_t>(integer);
    } else {
      key_ = static_cast<std::uint64_t>(integer);
    }
  }

  // Each is null when the key is of another kind, and valid as long as the key is.
  [[nodiscard]] const std::string* string() const { return std::get_if<std::string>(&key_); }
  /// The number, when it fits 64 bits with a sign.
  [[nodiscard]] const std::int64_t* integer() const { return std::get_if<std::int64_t>(&key_); }
  /// The number, when it is 2^63 or more.
  [[nodiscard]] const std::uint64_t* unsignedInteger() const {
    return std::get_if<std::uint64_t>(&key_);
  }
  /// Keyed with a secret of the process, so that clients cannot write keys that collide. Differs in
  /// the next process: never stored or sent.
  [[nodiscard]] std::size_t hash() const;
  /// A string never equals a number: "5" and 5 are two keys.
  bool operator==(const Key&) const = default;

 private:
  std::variant<std::string, std::int64_t, std::uint64_t> key_;
};

/// A tree of property-list values that the service itself builds and changes: user information,
/// defaults, session info, summaries. Numbers keep their kind: signed 64-bit, unsigned 64-bit (only
/// above the signed range), double and boolean are different. Strings are UTF-8. A value; copying
/// copies the tree. Not synchronised: one thread at a time, or a lock around it.
class Value {
 public:
  /// The order is that of MessagePack's forms in `MessagePackForm`.
  enum class Kind : std::uint8_t {
    nil,      // present, without a value; JSON's null
    boolean,  // never equal to a number
    integer,
    unsignedInteger,  // 2^63 and more: smaller numbers are `integer`
    real,             // a double, also when it has no fraction
    string,           // UTF-8
    bytes,            // octets without a meaning here
    date,             // microseconds in UTC
    list,
    dictionary
  };

  // Every property-list type converts to a value. An integer is held signed when it fits, else
  // unsigned; no argument and `nullptr` are nil.
  Value() = default;
  Value(std::nullptr_t) {}                // NOLINT(google-explicit-constructor)
  Value(std::same_as<bool> auto boolean)  // NOLINT(google-explicit-constructor)
      : value_(boolean) {}
  template <IntegerNumber Integer>
  Value(Integer integer) {  // NOLINT(google-explicit-constructor)
    if (std::in_range<std::int64_t>(integer)) {
      value_ = static_cast<std::int64_t>(integer);
    } else {
      value_ = static_cast<std::uint64_t>(integer);
    }
  }
  Value(double real) : value_(real) {}                  // NOLINT(google-explicit-constructor)
  Value(std::string text) : value_(std::move(text)) {}  // NOLINT(google-explicit-constructor)
  Value(std::string_view text)                          // NOLINT(google-explicit-constructor)
      : value_(std::string(text)) {}
  Value(const char* text) : value_(std::string(text)) {}  // NOLINT(google-explicit-constructor)
  Value(Bytes bytes) : value_(std::move(bytes)) {}        // NOLINT(google-explicit-constructor)
  Value(Date date) : value_(date) {}                      // NOLINT(google-explicit-constructor)
  Value(List list);                                       // NOLINT(google-explicit-constructor)
  Value(Dictionary dictionary);                           // NOLINT(google-explicit-constructor)

  [[nodiscard]] Kind kind() const { return static_cast<Kind>(value_.index()); }
  [[nodiscard]] bool isNil() const { return kind() == Kind::nil; }

  // Each is null when the value is of another kind. There is no conversion between kinds: the
  // number 1 has no `real`. The pointers are valid until the value changes or ends.
  [[nodiscard]] const bool* boolean() const { return std::get_if<bool>(&value_); }
  [[nodiscard]] const std::int64_t* integer() const { return std::get_if<std::int64_t>(&value_); }
  [[nodiscard]] const std::uint64_t* unsignedInteger() const {
    return std::get_if<std::uint64_t>(&value_);
  }
  [[nodiscard]] const double* real() const { return std::get_if<double>(&value_); }
  [[nodiscard]] const std::string* string() const { return std::get_if<std::string>(&value_); }
  [[nodiscard]] const Bytes* bytes() const { return std::get_if<Bytes>(&value_); }
  [[nodiscard]] const Date* date() const { return std::get_if<Date>(&value_); }
  [[nodiscard]] const List* list() const { return std::get_if<List>(&value_); }
  [[nodiscard]] const Dictionary* dictionary() const;

  /// Values of different kinds are different, also when their numbers are equal. Compares whole
  /// trees; a real that is not a number equals nothing, itself included.
  bool operator==(const Value& other) const;

 private:
  // Holds a dictionary behind a pointer, since the class is not complete here.
  class DictionaryBox {
   public:
    explicit DictionaryBox(Dictionary dictionary);
    DictionaryBox(const DictionaryBox& other);
    DictionaryBox(DictionaryBox&& other) noexcept;
    DictionaryBox& operator=(DictionaryBox other) noexcept;
    ~DictionaryBox();
    [[nodiscard]] const Dictionary& get() const { return *dictionary_; }
    bool operator==(const DictionaryBox& other) const;

   private:
    Dictionary* dictionary_;
  };

  // In the order of `Kind`.
  std::variant<std::monostate, bool, std::int64_t, std::uint64_t, double, std::string, Bytes, Date,
               List, DictionaryBox>
      value_;
};

/// Keys to values, enumerated in the order in which the keys were first set. Two dictionaries are
/// equal when they hold equal entries, in any order. Not synchronised.
class Dictionary {
 public:
  /// A key and its value. The key of a stored entry never changes.
  using Entry = std::pair<Key, Value>;

  Dictionary() = default;
  /// The last of equal keys keeps its value.
  Dictionary(std::initializer_list<Entry> entries);

  /// Null when there is no such key. Valid until the dictionary changes.
  [[nodiscard]] const Value* find(const Key& key) const;
  /// Takes both over. A new value replaces an old one in its place; a new key comes last.
  void set(Key key, Value value);
  /// Sets every entry of `other`, in its order; nothing is removed. Values are copied, and nested
  /// dictionaries are replaced, not merged.
  void merge(const Dictionary& other);

  /// The number of entries; a nested dictionary is one.
  [[nodiscard]] std::size_t size() const { return entries_.size(); }
  [[nodiscard]] bool empty() const { return entries_.empty(); }
  /// For range-for over the entries, in their order. Valid until the dictionary changes.
  [[nodiscard]] auto begin() const { return entries_.begin(); }
  [[nodiscard]] auto end() const { return entries_.end(); }

  bool operator==(const Dictionary& other) const;

 private:
  struct KeyHash {
    std::size_t operator()(const Key& key) const { return key.hash(); }
  };
  /// From this size on an index is kept, so that a large hostile dictionary costs no quadratic
  /// time; below it a linear search is faster.
  static constexpr std::size_t kIndexedFrom = 16;

  /// The entry's place in `entries_`, or `entries_.size()` when there is no such key.
  [[nodiscard]] std::size_t indexOf(const Key& key) const;

  std::vector<Entry> entries_;  // in the order in which their keys were first set
  std::unordered_map<Key, std::size_t, KeyHash> index_;  // empty below `kIndexedFrom` entries
};

}  // namespace quarvel
