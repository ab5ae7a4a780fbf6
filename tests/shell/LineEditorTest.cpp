// SPDX-License-Identifier: MIT
// The line editor driven through an in-memory terminal: keys in, lines and screen bytes out.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "FakeTerminal.h"
#include "TestTree.h"
#include "shell/Completion.h"
#include "shell/editor/History.h"
#include "shell/editor/LineEditor.h"
#include "shell/editor/Screen.h"

namespace halvex::editor {
namespace {

using namespace std::string_literals;

const std::string kMark = "\x1b[7m?\x1b[27m";  // how an unprintable byte shows

struct Session {
  std::vector<std::string> lines;  // every line read until input ended
  std::string screen;
};

Session edit(const std::vector<std::string>& reads, int width = 80, bool refuseRaw = false,
             LineEditor::Completer completer = {}) {
  testing::FakeTerminal terminal(reads, width);
  terminal.refuseRaw = refuseRaw;
  const auto root = testing::makeToolTree();
  if (!completer) {
    completer = [&](std::string_view before) { return completeWord(root, before); };
  }
  LineEditor editor(terminal, completer);
  Session session;
  while (std::optional<std::string> line = editor.readLine("> ")) {
    EXPECT_FALSE(terminal.raw) << "raw mode outlives the line";
    session.lines.push_back(std::move(*line));
  }
  EXPECT_FALSE(terminal.raw);
  EXPECT_FALSE(terminal.drewOutsideRaw);
  session.screen = std::move(terminal.screen);
  return session;
}

TEST(LineEditorTest, KeysEditTheLine) {
  const struct {
    std::string keys;
    std::vector<std::string> lines;
    std::string shown = "";  // somewhere on the screen
  } cases[] = {
      {"ac\x1b[Db\r", {"abc"}},
      {"bc\x01"
       "a\x05"
       "d\r",
       {"abcd"}},
      {"abcd\x7f\x01\x1b[3~\r", {"bc"}},
      {"one two three\x17\x01\x19 \r", {"three one two "}},
      {"abcdef\x1b[D\x1b[D\x0b\x01\x19\r", {"efabcd"}},
      {"abc\x1b[Ddef\x15\r", {"c"}},
      {"one two\x1b"
       "b\x1b"
       "bX\x1b"
       "fY\r",
       {"XoneY two"}},
      {"a-b\x1b[1;5DX\r", {"a-Xb"}},
      {"ZZZ 9\x01\x1b"
       "fX\r",
       {"ZZZX 9"}},
      {"ab\x02\x02\x06X\x04\r", {"aX"}},
      // Characters, not bytes: multi-byte, wide, and a combining mark with its base.
      {"\xc3\xa9\xe6\x97\xa5\xe6\x9c\xac"
       "x\x1b[D\x1b[D\x7f\r",
       {"\xc3\xa9\xe6\x9c\xacx"}},
      {"xe\xcc\x81"
       "a\x1b[D\x1b[D\x7f\x1b[3~\r",
       {"a"}},
      // Bytes that are not UTF-8 stay as typed and show as placeholders.
      {"\xff\xfe"
       "ab\x1b[D\x7f\r",
       {"\xff\xfe"
        "b"},
       kMark + kMark + "b"},
      {"abc\x03"
       "def\r",
       {"def"},
       "^C\r\n\r> def"},
      {"x\rab\x01\x04\r\x04", {"x", "b"}},
      {"a\x0c\r", {"a"}, "\x1b[H\x1b[2J"},
      {"ab\x1a"
       "c\r",
       {"abc"},
       "\r\n<suspended>\r> ab"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.keys);
    const Session session = edit({c.keys});
    EXPECT_EQ(session.lines, c.lines);
    EXPECT_NE(session.screen.find(c.shown), std::string::npos) << session.screen;
  }
  // A lone ESC, then a pause: the ESC does nothing and what follows is typed text.
  EXPECT_EQ(edit({"\x1b", "", "[A\r"}).lines, std::vector<std::string>{"[A"});
  // Ctrl-C shows a fresh prompt at once, not only with the next key (Enter draws it again).
  const std::string fresh = "\r> \x1b[K\r\x1b[2C";
  EXPECT_NE(edit({"abc\x03", "\r"}).screen.find("^C\r\n" + fresh + fresh + "\r\n"),
            std::string::npos);
}

TEST(LineEditorTest, HistoryAndSearchRecallLines) {
  const struct {
    std::vector<std::string> reads;
    std::vector<std::string> lines;
    std::string shown = "";
  } cases[] = {
      {{"one\rtwo\r\x1b[A\x1b[A\r\x10\r"}, {"one", "two", "one", "one"}},
      {{"one\rnew\x1b[A\x1b[B!\r"}, {"one", "new!"}},
      {{"one\rtwo\r\x1b[AX\x1b[A\x1b[B\r\x1b[A\x1b[A\r"}, {"one", "two", "twoX", "two"}},
      {{"a\r\r \ra\r\x1b[A\x1b[A\r"}, {"a", "", " ", "a", "a"}},
      {{"abc\rabd\r\x12"
        "ab",
        "\x12\x05Z\r"},
       {"abc", "abd", "abcZ"},
       "(reverse-i-search)`ab': abd"},
      {{"one\rtwo\r\x12o", "a", "\x7f\x12\r"},
       {"one", "two", "one"},
       "(failed reverse-i-search)`oa': two"},
      {{"one\rX\x12on\x07\r"}, {"one", "X"}},
      {{"one\rX\x12on\x03\r"}, {"one", ""}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.reads.front());
    const Session session = edit(c.reads);
    EXPECT_EQ(session.lines, c.lines);
    EXPECT_NE(session.screen.find(c.shown), std::string::npos) << session.screen;
  }

  History history;
  for (const char* line : {"a", "a", " \t", "", "b"}) {
    history.add(line);
  }
  ASSERT_EQ(history.size(), 2u);
  EXPECT_EQ(history.at(0) + history.at(1), "ab");
  for (int i = 0; i <= 1000; ++i) {
    history.add(std::to_string(i));
  }
  EXPECT_EQ(history.size(), History::kMaxLines);
  EXPECT_EQ(history.at(0), "1");
  history.add(std::string(History::kMaxBytes + 1, 'x'));
  EXPECT_EQ(history.at(history.size() - 1), "1000");
  history.add(std::string(History::kMaxBytes / 2, 'y'));
  history.add(std::string(History::kMaxBytes / 2, 'z'));
  EXPECT_EQ(history.size(), 2u);
}

TEST(LineEditorTest, TabCompletesFromTheTree) {
  const struct {
    std::string keys;
    std::string line;
    std::string shown = "";
  } cases[] = {
      {"lo\tt\t\r", "logdump tel "},
      {"cd lo\t\r", "cd logdump "},
      {"logdump tel noc\t\r", "logdump tel nocompress "},
      {"logdump \t\t\r", "logdump ", "\r\nbb    cd    core  help  tel\r\n\r> logdump "},
      {"logdump tel no\t\t\r", "logdump tel no", "nocompress  nonui\r\n"},
      {"zz\t\r", "zz", "\x07"},
      // Completing in the middle of a line looks only at what is before the cursor.
      {"lo x\x1b[D\x1b[D\t\r", "logdump  x"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.keys);
    const Session session = edit({c.keys});
    EXPECT_EQ(session.lines, std::vector<std::string>{c.line});
    EXPECT_NE(session.screen.find(c.shown), std::string::npos) << session.screen;
  }
}

TEST(LineEditorTest, CompletesOnlyWholeCharacters) {
  // The candidates share the first byte of their first character, which is no start of its own.
  const auto completer = [](std::string_view) { return Completion{0, {"\xc3\xa9x", "\xc3\xa8y"}}; };
  EXPECT_EQ(edit({"\t\r"}, 80, false, completer).lines, std::vector<std::string>{""});
}

TEST(LineEditorTest, PastesEnterEachLineAndStayCheap) {
  EXPECT_EQ(edit({"x\x1b[200~one\r\ntwo\ta\x03\rthree\x1b[201~\r"}).lines,
            (std::vector<std::string>{"xone", "two\ta\x03", "three"}));
  // 10 MB pasted in the pieces a terminal would send: one line, and drawing it costs a screen
  // width per piece rather than the line's length.
  const std::string big(10 << 20, 'p');
  std::vector<std::string> reads{"\x1b[200~"};
  for (std::size_t at = 0; at < big.size(); at += 4096) {
    reads.push_back(big.substr(at, 4096));
  }
  reads.emplace_back("\x1b[201~\r");
  const Session session = edit(reads);
  ASSERT_EQ(session.lines.size(), 1u);
  EXPECT_TRUE(session.lines.front() == big);
  EXPECT_LT(session.screen.size(), reads.size() * 200);
}

TEST(LineEditorTest, ReadsPlainLinesWhenRawModeIsRefused) {
  const Session session = edit({"one\ntw", "o\nthree"}, 80, true);
  EXPECT_EQ(session.lines, (std::vector<std::string>{"one", "two", "three"}));
  EXPECT_EQ(session.screen, "> > > > ");
}

TEST(ScreenTest, DrawsTheVisiblePartAroundTheCursor) {
  const struct {
    std::string prompt, text;
    std::size_t cursor;
    int columns;
    std::string drawn;
  } cases[] = {
      {"> ", "abc", 3, 80, "\r> abc\x1b[K\r\x1b[5C"},
      {"", "", 0, 80, "\r\x1b[K\r"},
      {"", "x", 1, 80, "\rx\x1b[K\r\x1b[1C"},
      {"> ", "abcdefghij", 10, 8, "\r> ghij\x1b[K\r\x1b[6C"},
      {"> ", "abcdefghij", 0, 8, "\r> abcde\x1b[K\r\x1b[2C"},
      {"> ", "abcdefghij", 5, 8, "\r> bcdef\x1b[K\r\x1b[6C"},
      {"", "\xe6\x97\xa5\xe6\x9c\xac\xe8\xaa\x9e", 9, 6,
       "\r\xe6\x9c\xac\xe8\xaa\x9e\x1b[K\r\x1b[4C"},
      {"", "a\x01\xff", 3, 80, "\ra" + kMark + kMark + "\x1b[K\r\x1b[3C"},
      // The first surrogate, and the last character past Unicode's end: no characters.
      {"", "\xed\xa0\x80", 3, 80, "\r" + kMark + kMark + kMark + "\x1b[K\r\x1b[3C"},
      {"", "\xf4\x90\x80\x80", 4, 80, "\r" + kMark + kMark + kMark + kMark + "\x1b[K\r\x1b[4C"},
      // The first and the last character of a wide range.
      {"", "\xea\xb0\x80\xed\x9e\xa3x", 7, 80, "\r\xea\xb0\x80\xed\x9e\xa3x\x1b[K\r\x1b[5C"},
      {"", "\xef\xbc\xa1\xf0\x9f\x98\x80x", 8, 80,
       "\r\xef\xbc\xa1\xf0\x9f\x98\x80x\x1b[K\r\x1b[5C"},
      {"0123456789abcdef>> ", "x", 1, 20, "\rabcdef>> x\x1b[K\r\x1b[10C"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.text);
    EXPECT_EQ(drawLine(c.prompt, c.text, c.cursor, c.columns), c.drawn);
  }
  const std::string huge(10 << 20, 'x');
  EXPECT_LT(drawLine("> ", huge, huge.size() / 2, 80).size(), 100u);
  EXPECT_LT(drawLine("> ", std::string(1 << 20, '\x01') + huge, 1 << 20, 80).size(), 1000u);

  const std::vector<std::string> words{"bb", "cd", "core", "help", "tel"};
  EXPECT_EQ(drawCandidates(words, 80), "bb    cd    core  help  tel\r\n");
  EXPECT_EQ(drawCandidates(words, 12), "bb    cd\r\ncore  help\r\ntel\r\n");
}

}  // namespace
}  // namespace halvex::editor
