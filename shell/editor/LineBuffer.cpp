// SPDX-License-Identifier: MIT
#include "shell/editor/LineBuffer.h"

#include <utility>

#include "shell/editor/Utf8.h"

namespace halvex::editor {

namespace {

bool isWordByte(char c) {
  const auto byte = static_cast<unsigned char>(c);
  return byte >= 0x80 || (byte >= '0' && byte <= '9') || (byte >= 'A' && byte <= 'Z') ||
         (byte >= 'a' && byte <= 'z');
}

bool isBlank(char c) {
  return c == ' ' || c == '\t';
}

}  // namespace

void LineBuffer::assign(std::string text) {
  text_ = std::move(text);
  cursor_ = text_.size();
}

void LineBuffer::assign(std::string text, std::size_t cursor) {
  text_ = std::move(text);
  cursor_ = cursor < text_.size() ? cursor : text_.size();
}

void LineBuffer::insert(std::string_view bytes) {
  text_.insert(cursor_, bytes);
  cursor_ += bytes.size();
}

std::size_t LineBuffer::previousStop(std::size_t pos) const {
  while (pos > 0) {
    pos = utf8::previous(text_, pos);
    if (utf8::width(utf8::decode(text_, pos)) != 0) {
      break;
    }
  }
  return pos;
}

std::size_t LineBuffer::nextStop(std::size_t pos) const {
  if (pos < text_.size()) {
    pos += utf8::decode(text_, pos).size;
  }
  while (pos < text_.size()) {
    const utf8::Char c = utf8::decode(text_, pos);
    if (utf8::width(c) != 0) {
      break;
    }
    pos += c.size;
  }
  return pos;
}

void LineBuffer::backspace() {
  cut(previousStop(cursor_), cursor_);
}

void LineBuffer::deleteForward() {
  const std::size_t at = cursor_;
  cut(at, nextStop(at));
}

void LineBuffer::left() {
  cursor_ = previousStop(cursor_);
}

void LineBuffer::right() {
  cursor_ = nextStop(cursor_);
}

void LineBuffer::wordLeft() {
  while (cursor_ > 0 && !isWordByte(text_[cursor_ - 1])) {
    cursor_ = previousStop(cursor_);
  }
  while (cursor_ > 0 && isWordByte(text_[cursor_ - 1])) {
    cursor_ = previousStop(cursor_);
  }
}

void LineBuffer::wordRight() {
  while (cursor_ < text_.size() && !isWordByte(text_[cursor_])) {
    cursor_ = nextStop(cursor_);
  }
  while (cursor_ < text_.size() && isWordByte(text_[cursor_])) {
    cursor_ = nextStop(cursor_);
  }
}

std::string LineBuffer::killToEnd() {
  return cut(cursor_, text_.size());
}

std::string LineBuffer::killToStart() {
  return cut(0, cursor_);
}

std::string LineBuffer::killWordBack() {
  std::size_t from = cursor_;
  while (from > 0 && isBlank(text_[from - 1])) {
    --from;
  }
  while (from > 0 && !isBlank(text_[from - 1])) {
    from = previousStop(from);
  }
  return cut(from, cursor_);
}

std::string LineBuffer::cut(std::size_t from, std::size_t to) {
  std::string removed = text_.substr(from, to - from);
  text_.erase(from, to - from);
  cursor_ = from;
  return removed;
}

}  // namespace halvex::editor
