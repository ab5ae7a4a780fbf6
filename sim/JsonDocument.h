// SPDX-License-Identifier: MIT
// The scenario's JSON document: reading the text with every problem placed (a JSON pointer to the
// value, or a line and column in text that is not JSON), and typed reads of its values that
// refuse, with the value's place, anything but what they ask for. No rules of the scenario here.
#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <nlohmann/json.hpp>
#include <string>
#include <string_view>
#include <utility>

#include "sim/ScenarioError.h"

namespace halvex::sim::json {

// ordered_json keeps a payload's keys in the order written: they go on the bus in that order.
using Json = nlohmann::ordered_json;

// Deeper than any payload the bus takes (bus::kMaxDictDepth), shallow enough that nothing
// recursive downstream can run out of stack.
inline constexpr std::size_t kMaxDepth = 64;

// The document in text, nested at most kMaxDepth levels. Throws ScenarioError.
Json parse(std::string_view text);

// The pointer to member key of the object at pointer.
std::string child(const std::string& pointer, std::string_view key);

// "a string", "an object", ... for messages.
const char* typeName(const Json& value);

[[noreturn]] void fail(const std::string& pointer, const std::string& problem);
// Fails with "expected WHAT, got TYPE".
[[noreturn]] void expected(const std::string& pointer, const char* what, const Json& got);

// Checks that value is an object holding only the allowed keys.
void checkObject(const Json& value, const std::string& pointer,
                 std::initializer_list<std::string_view> allowed);

bool readBool(const Json& value, const std::string& pointer);
std::string readString(const Json& value, const std::string& pointer);

// An integer in [low, high]; JSON numbers with a fraction or exponent are refused.
template <typename Int>
Int readInteger(const Json& value, const std::string& pointer, std::int64_t low,
                std::uint64_t high) {
  if (value.is_number_unsigned()) {
    const auto number = value.get<std::uint64_t>();
    if (number <= high) {
      return static_cast<Int>(number);
    }
  } else if (value.is_number_integer()) {
    const auto number = value.get<std::int64_t>();
    if (number >= low && (number < 0 || static_cast<std::uint64_t>(number) <= high)) {
      return static_cast<Int>(number);
    }
  } else {
    expected(pointer, "an integer", value);
  }
  fail(pointer, "out of range (" + std::to_string(low) + " to " + std::to_string(high) + ")");
}

// One of the words in names, returned as the choice it names.
template <typename Enum, std::size_t N>
Enum readChoice(const Json& value, const std::string& pointer,
                const std::pair<std::string_view, Enum> (&names)[N]) {
  std::string list;
  for (const auto& [name, choice] : names) {
    list += (list.empty() ? "\"" : ", \"") + std::string(name) + "\"";
  }
  if (!value.is_string()) {
    expected(pointer, ("one of " + list).c_str(), value);
  }
  const auto& text = value.get_ref<const std::string&>();
  for (const auto& [name, choice] : names) {
    if (text == name) {
      return choice;
    }
  }
  fail(pointer, "\"" + text + "\" is not one of " + list);
}

}  // namespace halvex::sim::json
