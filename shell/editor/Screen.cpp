// SPDX-License-Identifier: MIT
#include "shell/editor/Screen.h"

#include <algorithm>

#include "shell/editor/Utf8.h"

namespace halvex::editor {

namespace {

constexpr std::string_view kPlaceholder = "\x1b[7m?\x1b[27m";

// How far drawing walks looks for visible characters: zero-width ones cost no column, so they
// are bounded by count instead.
std::size_t walkLimit(int columns) {
  return 4 * static_cast<std::size_t>(columns) + 16;
}

void appendShown(std::string& out, std::string_view text, std::size_t pos, const utf8::Char& c) {
  if (utf8::isPrintable(c)) {
    out.append(text.substr(pos, c.size));
  } else {
    out.append(kPlaceholder);
  }
}

// Where the characters that fit in `columns` columns before `end` begin, and their width.
struct Span {
  std::size_t start;
  int width;
};
Span fitBefore(std::string_view text, std::size_t end, int columns, std::size_t limit) {
  Span span{end, 0};
  for (std::size_t steps = 0; span.start > 0 && steps < limit; ++steps) {
    const std::size_t previous = utf8::previous(text, span.start);
    const int width = utf8::width(utf8::decode(text, previous));
    if (span.width + width > columns) {
      break;
    }
    span.width += width;
    span.start = previous;
  }
  return span;
}

// Appends the characters of text from start on while they fit in `columns` columns.
int appendFitting(std::string& out, std::string_view text, std::size_t start, int columns,
                  std::size_t limit) {
  int used = 0;
  for (std::size_t pos = start, steps = 0; pos < text.size() && steps < limit; ++steps) {
    const utf8::Char c = utf8::decode(text, pos);
    const int width = utf8::width(c);
    if (used + width > columns) {
      break;
    }
    appendShown(out, text, pos, c);
    used += width;
    pos += c.size;
  }
  return used;
}

}  // namespace

std::string drawLine(std::string_view prompt, std::string_view text, std::size_t cursor,
                     int columns) {
  columns = std::max(columns, 2);
  const std::size_t limit = walkLimit(columns);
  // A prompt that would leave little room for the line shows only its end.
  const int promptRoom = columns - 1 - std::min(columns / 2, 16);
  const Span promptSpan = fitBefore(prompt, prompt.size(), promptRoom, limit);

  std::string out = "\r";
  appendFitting(out, prompt, promptSpan.start, promptSpan.width, limit);
  const int room = std::max(columns - 1 - promptSpan.width, 1);
  // One column to spare shows the character under the cursor when the cursor is at the right edge.
  const Span before = fitBefore(text, cursor, std::max(room - 1, 0), limit);
  appendFitting(out, text, before.start, room, limit);
  out += "\x1b[K\r";
  const int cursorColumn = promptSpan.width + before.width;
  if (cursorColumn > 0) {
    out += "\x1b[" + std::to_string(cursorColumn) + "C";
  }
  return out;
}

std::string drawCandidates(const std::vector<std::string>& candidates, int columns) {
  const std::size_t limit = walkLimit(columns);
  std::vector<int> widths;
  int widest = 0;
  for (const std::string& candidate : candidates) {
    std::string ignored;
    widths.push_back(appendFitting(ignored, candidate, 0, columns, limit));
    widest = std::max(widest, widths.back());
  }
  const int cell = widest + 2;
  const auto perRow = static_cast<std::size_t>(std::max(1, std::max(columns, 2) / cell));
  std::string out;
  for (std::size_t i = 0; i < candidates.size(); ++i) {
    const bool rowEnd = (i + 1) % perRow == 0 || i + 1 == candidates.size();
    appendFitting(out, candidates[i], 0, columns, limit);
    if (rowEnd) {
      out += "\r\n";
    } else {
      out.append(static_cast<std::size_t>(cell - widths[i]), ' ');
    }
  }
  return out;
}

}  // namespace halvex::editor
