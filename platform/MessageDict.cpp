// SPDX-License-Identifier: MIT
// Portable: standard library only.
#include "platform/MessageDict.h"

#include <algorithm>

namespace halvex {

void MessageDict::set(std::string_view key, MessageValue value) {
  auto it = std::find_if(entries_.begin(), entries_.end(),
                         [&](const Entry& entry) { return entry.first == key; });
  if (it != entries_.end()) {
    it->second = std::move(value);
  } else {
    entries_.emplace_back(std::string(key), std::move(value));
  }
}

const MessageValue* MessageDict::get(std::string_view key) const {
  auto it = std::find_if(entries_.begin(), entries_.end(),
                         [&](const Entry& entry) { return entry.first == key; });
  return it == entries_.end() ? nullptr : &it->second;
}

std::string MessageDict::getString(std::string_view key, std::string_view fallback) const {
  const MessageValue* value = get(key);
  return value ? value->stringOr(fallback) : std::string(fallback);
}

bool operator==(const MessageDict& a, const MessageDict& b) {
  return a.entries_ == b.entries_;
}

MessageValue MessageValue::string(std::string text) {
  MessageValue value;
  value.storage_ = std::move(text);
  return value;
}

MessageValue MessageValue::int64(std::int64_t number) {
  MessageValue value;
  value.storage_ = number;
  return value;
}

MessageValue MessageValue::boolean(bool flag) {
  MessageValue value;
  value.storage_ = flag;
  return value;
}

MessageValue MessageValue::dict(MessageDict dict) {
  MessageValue value;
  value.storage_ = std::move(dict);
  return value;
}

std::string MessageValue::stringOr(std::string_view fallback) const {
  const std::string* text = asString();
  return text ? *text : std::string(fallback);
}

namespace {

void appendQuoted(std::string& out, const std::string& text) {
  out += '"';
  for (char c : text) {
    if (c == '"' || c == '\\') {
      out += '\\';
    }
    out += c;
  }
  out += '"';
}

void appendValue(std::string& out, const MessageValue& value) {
  switch (value.kind()) {
    case MessageValue::Kind::kNull: out += "null"; break;
    case MessageValue::Kind::kString: appendQuoted(out, *value.asString()); break;
    case MessageValue::Kind::kInt64: out += std::to_string(*value.asInt64()); break;
    case MessageValue::Kind::kBool: out += *value.asBool() ? "true" : "false"; break;
    case MessageValue::Kind::kDict: {
      out += '{';
      bool first = true;
      for (const auto& [key, item] : value.asDict()->entries()) {
        if (!first) {
          out += ", ";
        }
        first = false;
        appendQuoted(out, key);
        out += ": ";
        appendValue(out, item);
      }
      out += '}';
      break;
    }
  }
}

}  // namespace

std::string describe(const MessageValue& value) {
  std::string out;
  appendValue(out, value);
  return out;
}

}  // namespace halvex
