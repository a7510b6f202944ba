#include "base/Value.h"

#include <algorithm>

#include "base/SecretHash.h"

namespace quarvel {

std::size_t Key::hash() const {
  if (const auto* text = string()) return SecretHash::of(*text);
  const auto* number = integer();
  return SecretHash::of(number != nullptr ? static_cast<std::uint64_t>(*number)
                                          : *unsignedInteger());
}

Value::Value(List list) : value_(std::move(list)) {}
Value::Value(Dictionary dictionary) : value_(DictionaryBox(std::move(dictionary))) {}

const Dictionary* Value::dictionary() const {
  const auto* box = std::get_if<DictionaryBox>(&value_);
  return box == nullptr ? nullptr : &box->get();
}

bool Value::operator==(const Value& other) const {
  return value_ == other.value_;
}

Value::DictionaryBox::DictionaryBox(Dictionary dictionary)
    : dictionary_(new Dictionary(std::move(dictionary))) {}
Value::DictionaryBox::DictionaryBox(const DictionaryBox& other)
    : dictionary_(new Dictionary(*other.dictionary_)) {}
Value::DictionaryBox::DictionaryBox(DictionaryBox&& other) noexcept
    : dictionary_(std::exchange(other.dictionary_, nullptr)) {}
Value::DictionaryBox& Value::DictionaryBox::operator=(DictionaryBox other) noexcept {
  std::swap(dictionary_, other.dictionary_);
  return *this;
}
Value::DictionaryBox::~DictionaryBox() {
  delete dictionary_;
}

bool Value::DictionaryBox::operator==(const DictionaryBox& other) const {
  return *dictionary_ == *other.dictionary_;
}

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
  for (const Entry& entry : entries) set(entry.first, entry.second);
}

std::size_t Dictionary::indexOf(const Key& key) const {
  if (!index_.empty()) {
    const auto found = index_.find(key);
    return found == index_.end() ? entries_.size() : found->second;
  }
  const auto found = std::ranges::find(entries_, key, &Entry::first);
  return static_cast<std::size_t>(found - entries_.begin());
}

const Value* Dictionary::find(const Key& key) const {
  const std::size_t index = indexOf(key);
  return index == entries_.size() ? nullptr : &entries_[index].second;
}

void Dictionary::set(Key key, Value value) {
  const std::size_t index = indexOf(key);
  if (index < entries_.size()) {
    entries_[index].second = std::move(value);
    return;
  }
  if (!index_.empty()) index_.emplace(key, index);
  entries_.emplace_back(std::move(key), std::move(value));
  if (index_.empty() && entries_.size() >= kIndexedFrom) {
    for (std::size_t i = 0; i < entries_.size(); ++i) index_.emplace(entries_[i].first, i);
  }
}

void Dictionary::merge(const Dictionary& other) {
  for (const Entry& entry : other) set(entry.first, entry.second);
}

bool Dictionary::operator==(const Dictionary& other) const {
  return size() == other.size() && std::ranges::all_of(entries_, [&other](const Entry& entry) {
           const Value* value = other.find(entry.first);
           return value != nullptr && *value == entry.second;
         });
}

}  // namespace quarvel
