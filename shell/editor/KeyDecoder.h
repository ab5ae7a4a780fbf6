// SPDX-License-Identifier: MIT
// Turns the bytes a terminal sends into the line editor's keys.
//
// Control sequences are read by ECMA-48's grammar (ESC "[", parameter bytes 0x30-0x3F,
// intermediate bytes 0x20-0x2F, a final byte 0x40-0x7E; and ESC "O" with one final byte), so a
// sequence the editor does not know is swallowed whole and never reaches the line. The encodings
// of xterm, the Linux console, rxvt and tmux are all recognised for the arrows, Home, End and
// Delete. Text between the bracketed-paste markers ESC "[200~" and ESC "[201~" is taken literally,
// control bytes included; only its line ends (CR, LF or CR LF) end a line, as typed ones would.
//
// Bytes arrive with feed() in whatever pieces reads return; next() hands out whole keys. A piece
// may end inside a sequence or inside a multi-byte character: next() then waits for more, and if
// none comes in time the editor calls expire(), which drops an unfinished control sequence (a
// lone ESC is a key of its own, bound to nothing) and lets an unfinished character through as
// the bytes it has. The work is linear in the bytes fed, whatever they are.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

namespace halvex::editor {

enum class Key : unsigned char {
  kText,  // insert KeyEvent::text at the cursor
  kEnter,
  kTab,
  kBackspace,
  kDelete,
  kLeft,
  kRight,
  kWordLeft,
  kWordRight,
  kHome,
  kEnd,
  kHistoryPrevious,
  kHistoryNext,
  kKillToEnd,
  kKillToStart,
  kKillWordBack,
  kYank,
  kClearScreen,
  kInterrupt,   // Ctrl-C
  kEndOfInput,  // Ctrl-D
  kSuspend,     // Ctrl-Z
  kSearch,      // Ctrl-R
  kCancel,      // Ctrl-G
};

struct KeyEvent {
  Key key;
  std::string text;  // only for Key::kText

  bool operator==(const KeyEvent&) const = default;
};

class KeyDecoder {
 public:
  void feed(std::string_view bytes);

  // The next whole key, or nothing when the bytes fed so far are used up or end inside a sequence.
  std::optional<KeyEvent> next();

  // The bytes fed so far end inside a control sequence or a character that more bytes may finish.
  bool waitingForMore() const;

  // No more bytes came in time: see the opening comment.
  void expire();

  // Inside a bracketed paste whose end marker has not been taken yet.
  bool inPaste() const { return state_ == State::kPaste; }

  // The end marker of the open paste is among the bytes fed but not yet taken.
  bool pasteEndFed();

 private:
  enum class State : unsigned char { kGround, kEscape, kControl, kShift3, kPaste };

  std::optional<KeyEvent> dispatchControl(unsigned char final);
  std::optional<KeyEvent> takeText(bool pasted);
  void compact();

  std::string buffer_;
  std::size_t pos_ = 0;
  State state_ = State::kGround;
  std::string parameters_;            // of the control sequence being read, bounded
  bool afterCarriageReturn_ = false;  // an LF right after a CR belongs to the same line end
  bool releasePartial_ = false;       // expire() let an unfinished character through
  bool partialHeld_ = false;          // next() is holding back an unfinished character
  std::size_t markerSearched_ = 0;    // where pasteEndFed() may resume its search
};

}  // namespace halvex::editor
