// SPDX-License-Identifier: MIT
#include "shell/editor/Utf8.h"

#include <algorithm>
#include <array>
#include <iterator>

namespace halvex::editor::utf8 {

namespace {

struct Range {
  char32_t first, last;
};

// Combining marks and format characters that take no column of their own.
constexpr std::array kZeroWidth{
    Range{0x0300, 0x036F}, Range{0x0483, 0x0489}, Range{0x0591, 0x05BD},  Range{0x05BF, 0x05BF},
    Range{0x05C1, 0x05C2}, Range{0x05C4, 0x05C5}, Range{0x05C7, 0x05C7},  Range{0x0610, 0x061A},
    Range{0x064B, 0x065F}, Range{0x0670, 0x0670}, Range{0x06D6, 0x06DC},  Range{0x06DF, 0x06E4},
    Range{0x06E7, 0x06E8}, Range{0x06EA, 0x06ED}, Range{0x0900, 0x0902},  Range{0x093A, 0x093A},
    Range{0x093C, 0x093C}, Range{0x0941, 0x0948}, Range{0x094D, 0x094D},  Range{0x0951, 0x0957},
    Range{0x0E31, 0x0E31}, Range{0x0E34, 0x0E3A}, Range{0x0E47, 0x0E4E},  Range{0x1AB0, 0x1AFF},
    Range{0x1DC0, 0x1DFF}, Range{0x200B, 0x200F}, Range{0x202A, 0x202E},  Range{0x2060, 0x2064},
    Range{0x20D0, 0x20FF}, Range{0x302A, 0x302D}, Range{0x3099, 0x309A},  Range{0xFE00, 0xFE0F},
    Range{0xFE20, 0xFE2F}, Range{0xFEFF, 0xFEFF}, Range{0xE0100, 0xE01EF}};

// East Asian Wide and Fullwidth, and the emoji blocks that terminals draw two columns wide.
constexpr std::array kWide{
    Range{0x1100, 0x115F},   Range{0x231A, 0x231B},   Range{0x2329, 0x232A},
    Range{0x23E9, 0x23EC},   Range{0x23F0, 0x23F0},   Range{0x23F3, 0x23F3},
    Range{0x25FD, 0x25FE},   Range{0x2614, 0x2615},   Range{0x2648, 0x2653},
    Range{0x267F, 0x267F},   Range{0x2693, 0x2693},   Range{0x26A1, 0x26A1},
    Range{0x26AA, 0x26AB},   Range{0x26BD, 0x26BE},   Range{0x26C4, 0x26C5},
    Range{0x26CE, 0x26CE},   Range{0x26D4, 0x26D4},   Range{0x26EA, 0x26EA},
    Range{0x26F2, 0x26F5},   Range{0x26FA, 0x26FD},   Range{0x2705, 0x2705},
    Range{0x270A, 0x270B},   Range{0x2728, 0x2728},   Range{0x274C, 0x274C},
    Range{0x2753, 0x2755},   Range{0x2757, 0x2757},   Range{0x2795, 0x2797},
    Range{0x27B0, 0x27B0},   Range{0x27BF, 0x27BF},   Range{0x2B1B, 0x2B1C},
    Range{0x2B50, 0x2B50},   Range{0x2B55, 0x2B55},   Range{0x2E80, 0x303E},
    Range{0x3041, 0x33FF},   Range{0x3400, 0x4DBF},   Range{0x4E00, 0x9FFF},
    Range{0xA000, 0xA4CF},   Range{0xA960, 0xA97F},   Range{0xAC00, 0xD7A3},
    Range{0xF900, 0xFAFF},   Range{0xFE10, 0xFE19},   Range{0xFE30, 0xFE6F},
    Range{0xFF00, 0xFF60},   Range{0xFFE0, 0xFFE6},   Range{0x16FE0, 0x16FE4},
    Range{0x17000, 0x18CFF}, Range{0x1B000, 0x1B2FF}, Range{0x1F004, 0x1F004},
    Range{0x1F0CF, 0x1F0CF}, Range{0x1F18E, 0x1F18E}, Range{0x1F191, 0x1F19A},
    Range{0x1F200, 0x1F2FF}, Range{0x1F300, 0x1F64F}, Range{0x1F680, 0x1F6FF},
    Range{0x1F7E0, 0x1F7EB}, Range{0x1F90C, 0x1F9FF}, Range{0x1FA70, 0x1FAFF},
    Range{0x20000, 0x2FFFD}, Range{0x30000, 0x3FFFD}};

template <std::size_t N>
bool contains(const std::array<Range, N>& table, char32_t code) {
  const auto it = std::upper_bound(table.begin(), table.end(), code,
                                   [](char32_t c, const Range& r) { return c < r.first; });
  return it != table.begin() && code <= std::prev(it)->last;
}

unsigned char byteAt(std::string_view text, std::size_t pos) {
  return static_cast<unsigned char>(text[pos]);
}

}  // namespace

Char decode(std::string_view text, std::size_t pos) {
  const unsigned char lead = byteAt(text, pos);
  Char ill{1, lead, false};
  if (lead < 0x80) {
    return {1, lead, true};
  }
  std::size_t size = 0;
  char32_t code = 0;
  char32_t min = 0;
  if (lead >= 0xC2 && lead <= 0xDF) {
    size = 2, code = lead & 0x1Fu, min = 0x80;
  } else if (lead >= 0xE0 && lead <= 0xEF) {
    size = 3, code = lead & 0x0Fu, min = 0x800;
  } else if (lead >= 0xF0 && lead <= 0xF4) {
    size = 4, code = lead & 0x07u, min = 0x10000;
  } else {
    return ill;
  }
  if (text.size() - pos < size) {
    return ill;
  }
  for (std::size_t i = 1; i < size; ++i) {
    const unsigned char next = byteAt(text, pos + i);
    if ((next & 0xC0u) != 0x80u) {
      return ill;
    }
    code = (code << 6) | (next & 0x3Fu);
  }
  if (code < min || code > 0x10FFFF || (code >= 0xD800 && code <= 0xDFFF)) {
    return ill;
  }
  return {size, code, true};
}

std::size_t previous(std::string_view text, std::size_t pos) {
  if ((byteAt(text, pos - 1) & 0xC0u) != 0x80u) {
    return pos - 1;
  }
  // A well-formed sequence that ends exactly at pos wins; decoding from the start would have
  // found it too, as nothing before its lead byte can reach past it.
  for (std::size_t back = 2; back <= 4 && back <= pos; ++back) {
    const std::size_t start = pos - back;
    if ((byteAt(text, start) & 0xC0u) != 0x80u) {
      const Char c = decode(text, start);
      return c.wellFormed && start + c.size == pos ? start : pos - 1;
    }
  }
  return pos - 1;
}

bool isPrintable(const Char& c) {
  return c.wellFormed && c.code >= 0x20 && !(c.code >= 0x7F && c.code < 0xA0);
}

int width(const Char& c) {
  if (!isPrintable(c) || c.code < 0x300) {
    return 1;
  }
  if (contains(kZeroWidth, c.code)) {
    return 0;
  }
  return contains(kWide, c.code) ? 2 : 1;
}

}  // namespace halvex::editor::utf8
