// SPDX-License-Identifier: MIT
// Inter-process message dictionaries: the values that requests, replies and event payloads are
// made of. Portable code: standard library only.
//
// A MessageValue is exactly one of null, string, signed 64-bit integer, boolean or dictionary. A
// MessageDict maps string keys to values and keeps its keys in insertion order, because requests
// are built key by key and the receiving side sees them in that order. Both are plain values:
// copies are deep and independent, and neither type is safe for concurrent mutation.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace halvex {

class MessageValue;

class MessageDict {
 public:
  using Entry = std::pair<std::string, MessageValue>;

  MessageDict() = default;

  // Stores value under key. A key already present keeps its position; a new key goes last.
  void set(std::string_view key, MessageValue value);

  // The value under key, or nullptr when the key is absent. The pointer is valid until the next
  // change of this dictionary.
  const MessageValue* get(std::string_view key) const;

  // The string under key; fallback when the key is absent or its value is not a string.
  std::string getString(std::string_view key, std::string_view fallback = {}) const;

  bool contains(std::string_view key) const { return get(key) != nullptr; }
  std::size_t size() const;
  bool empty() const;
  const std::vector<Entry>& entries() const { return entries_; }

  friend bool operator==(const MessageDict& a, const MessageDict& b);

 private:
  std::vector<Entry> entries_;
};

class MessageValue {
 public:
  enum class Kind { kNull, kString, kInt64, kBool, kDict };

  // The default value is null.
  MessageValue() = default;

  static MessageValue null() { return MessageValue(); }
  static MessageValue string(std::string text);
  static MessageValue int64(std::int64_t number);
  static MessageValue boolean(bool flag);
  static MessageValue dict(MessageDict dict);

  Kind kind() const { return static_cast<Kind>(storage_.index()); }
  bool isNull() const { return kind() == Kind::kNull; }
  bool isString() const { return kind() == Kind::kString; }
  bool isInt64() const { return kind() == Kind::kInt64; }
  bool isBool() const { return kind() == Kind::kBool; }
  bool isDict() const { return kind() == Kind::kDict; }

  // Typed views: nullptr when the value holds another kind.
  const std::string* asString() const { return std::get_if<std::string>(&storage_); }
  const std::int64_t* asInt64() const { return std::get_if<std::int64_t>(&storage_); }
  const bool* asBool() const { return std::get_if<bool>(&storage_); }
  const MessageDict* asDict() const { return std::get_if<MessageDict>(&storage_); }

  // The string held, or fallback for any other kind.
  std::string stringOr(std::string_view fallback) const;

  friend bool operator==(const MessageValue& a, const MessageValue& b) {
    return a.storage_ == b.storage_;
  }

 private:
  // The alternatives' order matches Kind.
  std::variant<std::monostate, std::string, std::int64_t, bool, MessageDict> storage_;
};

// Defined here rather than in the class: sizing the vector needs Entry, and with it MessageValue,
// to be complete.
inline std::size_t MessageDict::size() const {
  return entries_.size();
}
inline bool MessageDict::empty() const {
  return entries_.empty();
}

// A readable one-line rendering, for logs and test failure messages.
std::string describe(const MessageValue& value);

}  // namespace halvex
