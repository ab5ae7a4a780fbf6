// SPDX-License-Identifier: MIT
// parseTraceValue over any text, checked against the C library: a named word in any case, or
// text that strtoll reads whole, base 0, within the signed 32-bit range. Anything else is refused
// and leaves the value alone.
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <optional>
#include <string>
#include <string_view>

#include "Tools/HalvexTool/DumpOptions.h"
#include "fuzz/FuzzSupport.h"

namespace {

std::string lowered(std::string text) {
  for (char& c : text) {
    if (c >= 'A' && c <= 'Z') {
      c = static_cast<char>(c - 'A' + 'a');
    }
  }
  return text;
}

std::optional<std::int32_t> expected(const std::string& text) {
  const std::string word = lowered(text);
  if (word == "false" || word == "off" || word == "no") {
    return 0;
  }
  if (word == "true" || word == "on" || word == "yes" || word == "full") {
    return 1;
  }
  if (word == "lite") {
    return 2;
  }
  // c_str() ends at the first NUL, so text holding one is never read whole.
  char* end = nullptr;
  errno = 0;
  const long long number = std::strtoll(text.c_str(), &end, 0);
  if (text.empty() || errno != 0 || end != text.c_str() + text.size() || number < INT32_MIN ||
      number > INT32_MAX) {
    return std::nullopt;
  }
  return static_cast<std::int32_t>(number);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using halvex::fuzz::check;
  const std::string text(reinterpret_cast<const char*>(data), size);
  constexpr std::int32_t kUntouched = 0x5A5A5A5A;
  std::int32_t value = kUntouched;
  const bool parsed = halvex::parseTraceValue(text, value);
  const std::optional<std::int32_t> want = expected(text);
  check(parsed == want.has_value(), "accepted exactly the named words and whole integers", text);
  check(value == want.value_or(kUntouched), "the value read, or the value left alone",
        [&] { return std::to_string(value); });
  return 0;
}
