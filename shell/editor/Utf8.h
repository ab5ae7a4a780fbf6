// SPDX-License-Identifier: MIT
// UTF-8 as the line editor sees it, without the C library's locale: where characters begin and
// end, and how many terminal columns each one takes.
//
// Any bytes at all have one segmentation: a well-formed sequence (RFC 3629: no overlong forms, no
// surrogates, nothing above U+10FFFF) is one character; every other byte is a character of its
// own, which the editor shows as a placeholder but keeps in the line as it was typed.
#pragma once

#include <cstddef>
#include <string_view>

namespace halvex::editor::utf8 {

struct Char {
  std::size_t size = 1;  // bytes, 1 to 4
  char32_t code = 0;     // the code point; for an ill-formed byte, the byte itself
  bool wellFormed = false;
};

// The character that starts at pos (pos < text.size()).
Char decode(std::string_view text, std::size_t pos);

// Where the character that ends at pos begins (0 < pos <= text.size(), pos a character boundary).
// Agrees with decoding from the start of text: it looks at no more than the last four bytes.
std::size_t previous(std::string_view text, std::size_t pos);

// Whether the character can be written to a terminal as it is: not ill-formed and not a C0 or C1
// control or DEL.
bool isPrintable(const Char& c);

// Terminal columns: 0 for combining marks and other zero-width characters, 2 for East Asian wide
// and fullwidth characters and emoji, 1 for the rest (a placeholder takes 1 too).
int width(const Char& c);

}  // namespace halvex::editor::utf8
