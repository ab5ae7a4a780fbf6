// SPDX-License-Identifier: MIT
// The words that follow a log-dump option, and the text of trace property values.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace halvex {

// The reason a collection carries when the user gives none; a reason word the user gives is
// sent as kReasonPrefix followed by that word, so the server can tell our dumps apart.
inline constexpr const char* kReasonPrefix = "[halvextool] ";
inline constexpr const char* kDefaultReason = "[halvextool] User triggered";

// Consumes words from the front: "nocompress" clears compress, "nonui" sets nonui, and the first
// other word becomes the reason and ends parsing, leaving the words after it in place. The caller
// initialises compress and nonui; reason is always set. Matching is exact and case-sensitive.
void parseDumpOptions(std::vector<std::string>& words, bool& compress, std::string& reason,
                      bool& nonui);

// Reads a trace property value: the words false/off/no (0), true/on/yes/full (1) and lite (2) in
// any case, or a whole C integer literal (decimal, 0x hex, 0 octal; leading blanks and a sign
// allowed) within the signed 32-bit range. Returns false, leaving value untouched, otherwise.
bool parseTraceValue(const std::string& text, std::int32_t& value);

}  // namespace halvex
