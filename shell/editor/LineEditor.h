// SPDX-License-Identifier: MIT
// The shell's line editor at a terminal: editing, history and completion, keyed as in readline's
// emacs mode.
//
//   Left, Right, Ctrl-B, Ctrl-F          a character back, forward
//   Alt-B, Alt-F, Ctrl/Alt-Left, -Right  a word back, forward
//   Home, End, Ctrl-A, Ctrl-E            start, end of the line
//   Backspace, Delete                    delete the character before, under the cursor
//   Ctrl-K, Ctrl-U, Ctrl-W, Ctrl-Y       delete to the end, to the start, the word before; put
//                                        back what was deleted last
//   Up, Down, Ctrl-P, Ctrl-N             walk the history (edits to a recalled line last until
//                                        the line is entered)
//   Ctrl-R                               search the history backwards as you type; Ctrl-R again
//                                        for an older match, Ctrl-G to give up, any other key
//                                        takes the match
//   TAB                                  complete the word at the cursor; a second TAB lists the
//                                        candidates when they have no longer common start
//   Ctrl-L                               clear the screen
//   Ctrl-C                               drop the line, fresh prompt
//   Ctrl-D                               end of input on an empty line, else delete under cursor
//   Ctrl-Z                               suspend; the line comes back on return
//   Enter                                evaluate the line
//
// A pasted text counts as the same bytes typed, except that its control bytes are taken
// literally; each of its line ends enters a line, in order.
//
// Threads: one thread, the shell's.
#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>

#include "shell/Completion.h"
#include "shell/editor/History.h"
#include "shell/editor/KeyDecoder.h"
#include "shell/editor/LineBuffer.h"
#include "shell/editor/Terminal.h"

namespace halvex::editor {

class LineEditor {
 public:
  // What TAB offers, given the line up to the cursor.
  using Completer = std::function<Completion(std::string_view beforeCursor)>;

  // terminal must outlive the editor.
  LineEditor(Terminal& terminal, Completer completer);

  // Shows prompt and edits one line until Enter; returns it without its line end, with the
  // terminal back in its normal mode. Nothing when input ends: Ctrl-D on an empty line, or the
  // terminal reports an end or an error; the editor is done then. Bytes that came after the line
  // are kept for the next.
  std::optional<std::string> readLine(std::string_view prompt);

 private:
  enum class Step : unsigned char { kGoOn, kAccept, kEnd };
  // Ctrl-R's state. No default member initialisers: clang needs them before LineEditor is
  // complete for std::optional<Search>; emplace() value-initialises instead.
  struct Search {
    std::string query;
    std::optional<History::Match> match;
    bool failed;
  };

  Step handle(const KeyEvent& event);
  bool handleSearch(const KeyEvent& event);
  void searchFrom(std::size_t index);
  void browse(bool older);
  void complete(bool list);
  void redraw();
  bool readMore();
  std::string accept();
  std::optional<std::string> readPlain();

  Terminal& terminal_;
  Completer completer_;
  KeyDecoder decoder_;
  History history_;
  std::string chunk_;

  // The line being edited and what it shows.
  std::string prompt_;
  LineBuffer line_;
  std::string killed_;
  std::size_t browsing_ = 0;                  // history index shown; size() is the new line
  std::map<std::size_t, std::string> edits_;  // lines changed while browsing, by index
  std::optional<Search> search_;
  bool dirty_ = false;
  std::optional<Key> lastKey_;
  std::string plain_;  // input read without raw mode, when the terminal refused it
};

}  // namespace halvex::editor
