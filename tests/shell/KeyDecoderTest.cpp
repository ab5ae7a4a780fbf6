// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "shell/editor/KeyDecoder.h"

namespace halvex::editor {
namespace {

using namespace std::string_literals;

const char* name(Key key) {
  switch (key) {
    case Key::kText: return "text";
    case Key::kEnter: return "Enter";
    case Key::kTab: return "Tab";
    case Key::kBackspace: return "Bs";
    case Key::kDelete: return "Del";
    case Key::kLeft: return "Left";
    case Key::kRight: return "Right";
    case Key::kWordLeft: return "WordLeft";
    case Key::kWordRight: return "WordRight";
    case Key::kHome: return "Home";
    case Key::kEnd: return "End";
    case Key::kHistoryPrevious: return "Up";
    case Key::kHistoryNext: return "Down";
    case Key::kKillToEnd: return "KillEnd";
    case Key::kKillToStart: return "KillStart";
    case Key::kKillWordBack: return "KillWord";
    case Key::kYank: return "Yank";
    case Key::kClearScreen: return "Clear";
    case Key::kInterrupt: return "Int";
    case Key::kEndOfInput: return "Eof";
    case Key::kSuspend: return "Susp";
    case Key::kSearch: return "Search";
    case Key::kCancel: return "Cancel";
  }
  return "?";
}

std::vector<KeyEvent> drain(KeyDecoder& decoder) {
  std::vector<KeyEvent> events;
  while (std::optional<KeyEvent> event = decoder.next()) {
    events.push_back(std::move(*event));
  }
  return events;
}

// Feeds the pieces in turn (a "" is a pause: expire()) and names the keys: "Left [text] Enter",
// where texts that follow each other read as one.
std::string decode(const std::vector<std::string>& pieces) {
  KeyDecoder decoder;
  std::vector<KeyEvent> events;
  for (const std::string& piece : pieces) {
    if (piece.empty()) {
      decoder.expire();
    } else {
      decoder.feed(piece);
    }
    for (KeyEvent& event : drain(decoder)) {
      events.push_back(std::move(event));
    }
  }
  std::string keys;
  for (std::size_t i = 0; i < events.size(); ++i) {
    const bool text = events[i].key == Key::kText;
    const bool continued = text && i > 0 && events[i - 1].key == Key::kText;
    if (continued) {
      keys.insert(keys.size() - 1, events[i].text);
      continue;
    }
    keys += (keys.empty() ? "" : " ") + (text ? "[" + events[i].text + "]" : name(events[i].key));
  }
  return keys;
}

TEST(KeyDecoderTest, DecodesKeysAndSwallowsWhatItDoesNotKnow) {
  const struct {
    std::string bytes;
    std::string keys;
  } cases[] = {
      {"ab\x01\x02\x05\x06\x08\x7f\x09", "[ab] Home Left End Right Bs Bs Tab"},
      {"\x03\x04\x07\x0b\x0c\x0e\x10\x12\x15\x17\x19\x1a",
       "Int Eof Cancel KillEnd Clear Down Up "
       "Search KillStart KillWord Yank Susp"},
      // Unbound control bytes (Ctrl-S, Ctrl-Q, Ctrl-\, NUL) do nothing.
      {"a\x13\x11\x1c"s + '\0' + "b", "[ab]"},
      {"\x1b[A\x1b[B\x1b[C\x1b[D\x1bOA\x1bOB\x1bOC\x1bOD", "Up Down Right Left Up Down Right Left"},
      {"\x1b[H\x1b[F\x1bOH\x1bOF\x1b[1~\x1b[4~\x1b[7~\x1b[8~\x1b[3~",
       "Home End Home End Home End Home End Del"},
      {"\x1b[1;5D\x1b[1;3C\x1b[1;2D\x1b"
       "b\x1b"
       "F\x1b\x7f",
       "WordLeft WordRight Left WordLeft "
       "WordRight KillWord"},
      // Function keys, device reports, Alt with an unbound key, over-long parameters: nothing.
      {"\x1b[15~\x1bOP\x1b[?1;2c\x1b[1;5P\x1bx\x1b[" + std::string(5000, '1') + "A" + "z",
       "Up [z]"},
      // A byte that cannot be in a sequence ends it and counts on its own.
      {"\x1b[1\x01", "Home"},
      {"a\rb\r\nc\n\r\rd", "[a] Enter [b] Enter [c] Enter Enter Enter [d]"},
      {"\xc3\xa9\xff\xe6\x97\xa5", "[\xc3\xa9\xff\xe6\x97\xa5]"},
      // Pasted text is literal but for its line ends; the markers themselves vanish.
      {"x\x1b[200~a\tb\x03\x1b[Ac\r\nd\re\x1b[201~\x1b[D",
       "[xa\tb\x03\x1b[Ac] Enter [d] Enter "
       "[e] Left"},
      {"\x1b[201~\x1b[200~\x1b[200~\x1b[20x\x1b[201~", "[\x1b[200~\x1b[20x]"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.bytes);
    EXPECT_EQ(decode({c.bytes}), c.keys);
    // Split anywhere, the same keys come out.
    std::vector<std::string> bytes;
    for (const char byte : c.bytes) {
      bytes.emplace_back(1, byte);
    }
    EXPECT_EQ(decode(bytes), c.keys);
  }
}

TEST(KeyDecoderTest, PausesEndSequencesButNotPastes) {
  const struct {
    std::vector<std::string> pieces;
    std::string keys;
  } cases[] = {
      {{"\x1b", "", "[A"}, "[[A]"},
      {{"\x1b", "[A"}, "Up"},
      {{"\x1b[1;", "", "5D"}, "[5D]"},
      {{"\xc3", "\xa9"}, "[\xc3\xa9]"},
      {{"a\xe6\x97", "", "\xa5"}, "[a\xe6\x97\xa5]"},
      {{"\x1b[200~a\x1b[20", "", "1~b\x01"}, "[ab] Home"},
      {{"\x1b[200~a\xc3", "", "\xa9"}, "[a\xc3\xa9]"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.pieces.front());
    EXPECT_EQ(decode(c.pieces), c.keys);
  }
  KeyDecoder decoder;
  for (const char* unfinished : {"\x1b", "\xc3", "\xf0\x9f\x98"}) {
    decoder.feed(unfinished);
    EXPECT_TRUE(drain(decoder).empty());
    EXPECT_TRUE(decoder.waitingForMore()) << unfinished;
    decoder.expire();
    drain(decoder);
  }
  decoder.feed("\x1b[200~line\r");
  drain(decoder);
  EXPECT_TRUE(decoder.inPaste());
  EXPECT_FALSE(decoder.waitingForMore());
  EXPECT_FALSE(decoder.pasteEndFed());
  decoder.feed("more\x1b[2");
  EXPECT_FALSE(decoder.pasteEndFed());
  decoder.feed("01~");
  EXPECT_TRUE(decoder.pasteEndFed());
  const std::vector<KeyEvent> more = drain(decoder);
  EXPECT_EQ(more, (std::vector<KeyEvent>{{Key::kText, "more"}}));
  EXPECT_FALSE(decoder.inPaste());
}

}  // namespace
}  // namespace halvex::editor
