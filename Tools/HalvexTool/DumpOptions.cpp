// SPDX-License-Identifier: MIT
#include "Tools/HalvexTool/DumpOptions.h"

#include <array>
#include <cstddef>
#include <stdexcept>
#include <string_view>

namespace halvex {

namespace {

char lowerAscii(char c) {
  return (c >= 'A' && c <= 'Z') ? static_cast<char>(c - 'A' + 'a') : c;
}

bool equalsIgnoringCase(std::string_view text, std::string_view word) {
  if (text.size() != word.size()) {
    return false;
  }
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (lowerAscii(text[i]) != lowerAscii(word[i])) {
      return false;
    }
  }
  return true;
}

struct NamedValue {
  std::string_view word;
  std::int32_t value;
};

// Checked in this order; the first match wins.
constexpr std::array<NamedValue, 8> kNamedValues{{
    {"false", 0},
    {"off", 0},
    {"no", 0},
    {"true", 1},
    {"on", 1},
    {"yes", 1},
    {"full", 1},
    {"lite", 2},
}};

}  // namespace

void parseDumpOptions(std::vector<std::string>& words, bool& compress, std::string& reason,
                      bool& nonui) {
  reason = kDefaultReason;
  // The consumed words go in one erase at the end: erasing them one at a time would move every
  // later word once per word consumed.
  auto next = words.begin();
  while (next != words.end()) {
    const std::string& word = *next++;
    if (word == "nocompress") {
      compress = false;
    } else if (word == "nonui") {
      nonui = true;
    } else {
      reason = kReasonPrefix + word;
      break;
    }
  }
  words.erase(words.begin(), next);
}

bool parseTraceValue(const std::string& text, std::int32_t& value) {
  for (const NamedValue& named : kNamedValues) {
    if (equalsIgnoringCase(text, named.word)) {
      value = named.value;
      return true;
    }
  }
  // std::stoi rejects text without leading digits and numbers beyond int; on this platform int
  // is the 32-bit range the server's values live in.
  static_assert(sizeof(int) == sizeof(std::int32_t));
  std::size_t consumed = 0;
  int number = 0;
  try {
    number = std::stoi(text, &consumed, 0);
  } catch (const std::invalid_argument&) {
    return false;
  } catch (const std::out_of_range&) {
    return false;
  }
  if (consumed != text.size()) {
    return false;
  }
  value = number;
  return true;
}

}  // namespace halvex
