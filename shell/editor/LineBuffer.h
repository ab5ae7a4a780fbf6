// SPDX-License-Identifier: MIT
// The line being edited and the cursor in it, with the editing moves of readline's emacs mode.
//
// The text holds exactly the bytes typed, UTF-8 or not. The cursor moves by characters as
// utf8::decode() segments them, and a combining mark travels with the character before it, so
// the cursor never lands between the two. Words are as readline has them: Alt-B and Alt-F move
// over runs of letters and digits (every non-ASCII character counts as a letter), Ctrl-W deletes
// back to the previous whitespace. What Ctrl-K, Ctrl-U and Ctrl-W delete is returned, for Ctrl-Y.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace halvex::editor {

class LineBuffer {
 public:
  const std::string& text() const { return text_; }
  std::size_t cursor() const { return cursor_; }

  // Replaces the whole text and puts the cursor at its end (or at cursor, when given).
  void assign(std::string text);
  void assign(std::string text, std::size_t cursor);

  void insert(std::string_view bytes);
  void backspace();
  void deleteForward();

  void left();
  void right();
  void home() { cursor_ = 0; }
  void end() { cursor_ = text_.size(); }
  void wordLeft();
  void wordRight();

  std::string killToEnd();
  std::string killToStart();
  std::string killWordBack();

 private:
  std::size_t previousStop(std::size_t pos) const;
  std::size_t nextStop(std::size_t pos) const;
  std::string cut(std::size_t from, std::size_t to);

  std::string text_;
  std::size_t cursor_ = 0;
};

}  // namespace halvex::editor
