// SPDX-License-Identifier: MIT
// What the line editor writes to draw its line: plain ECMA-48, whatever the terminal.
//
// The prompt and the line share one row of the screen. A line too long for it scrolls
// sideways so that the cursor stays in view, and the last column stays empty so that the terminal
// never wraps. Drawing looks only at the characters that can be seen around the cursor, so it
// costs a screen width however long the line is. Bytes that are not printable UTF-8 (controls,
// ill-formed bytes) show as a "?" in reverse video; the line keeps them as they are.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace halvex::editor {

// Redraws the current row: carriage return, the prompt, the visible part of text, erase to the
// end of the row, and the cursor put back at cursor (a byte offset into text).
std::string drawLine(std::string_view prompt, std::string_view text, std::size_t cursor,
                     int columns);

// Candidates laid out in columns across the screen, each row ending in CR LF.
std::string drawCandidates(const std::vector<std::string>& candidates, int columns);

}  // namespace halvex::editor
