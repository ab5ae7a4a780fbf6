// SPDX-License-Identifier: MIT
#include "shell/editor/LineEditor.h"

#include <algorithm>
#include <chrono>
#include <utility>

#include "shell/editor/Screen.h"
#include "shell/editor/Utf8.h"

namespace halvex::editor {

namespace {

// How long the rest of an escape sequence or a character may take to arrive: a terminal sends
// one key's bytes together, so a longer pause means a lone ESC.
constexpr std::chrono::milliseconds kSequenceWait{50};
// How long a paste may pause before its end marker counts as lost.
constexpr std::chrono::milliseconds kPasteWait{1000};
constexpr std::size_t kReadSize = std::size_t{64} * 1024;
constexpr std::string_view kBell = "\x07";

// The longest start all candidates share, cut back to whole characters.
std::string commonStart(const std::vector<std::string>& candidates) {
  const std::string& first = candidates.front();
  std::size_t length = first.size();
  for (const std::string& candidate : candidates) {
    length = static_cast<std::size_t>(
        std::mismatch(first.begin(), first.begin() + static_cast<std::ptrdiff_t>(length),
                      candidate.begin(), candidate.end())
            .first -
        first.begin());
  }
  std::size_t whole = 0;
  while (whole < length && whole + utf8::decode(first, whole).size <= length) {
    whole += utf8::decode(first, whole).size;
  }
  return first.substr(0, whole);
}

}  // namespace

LineEditor::LineEditor(Terminal& terminal, Completer completer)
    : terminal_(terminal), completer_(std::move(completer)), chunk_(kReadSize, '\0') {}

std::optional<std::string> LineEditor::readLine(std::string_view prompt) {
  prompt_ = prompt;
  line_ = LineBuffer();
  browsing_ = history_.size();
  edits_.clear();
  if (!terminal_.enterRaw()) {
    return readPlain();
  }
  redraw();
  for (;;) {
    const std::optional<KeyEvent> event = decoder_.next();
    if (!event) {
      if (dirty_) {
        redraw();
      }
      if (!readMore()) {
        terminal_.write("\r\n");
        terminal_.leaveRaw();
        return std::nullopt;
      }
      continue;
    }
    const Step step = handle(*event);
    lastKey_ = event->key;
    if (step == Step::kAccept) {
      return accept();
    }
    if (step == Step::kEnd) {
      terminal_.write("\r\n");
      terminal_.leaveRaw();
      return std::nullopt;
    }
  }
}

bool LineEditor::readMore() {
  if (decoder_.waitingForMore() && !terminal_.waitForInput(kSequenceWait)) {
    decoder_.expire();
    return true;
  }
  const long n = terminal_.read(chunk_.data(), chunk_.size());
  if (n <= 0) {
    return false;
  }
  decoder_.feed(std::string_view(chunk_).substr(0, static_cast<std::size_t>(n)));
  return true;
}

std::string LineEditor::accept() {
  // The rest of a paste would reach the terminal in its normal mode while the line runs, where
  // the kernel echoes it and acts on its control bytes: take all of it first.
  while (decoder_.inPaste() && !decoder_.pasteEndFed() && terminal_.waitForInput(kPasteWait) &&
         readMore()) {
  }
  line_.end();
  redraw();
  terminal_.write("\r\n");
  terminal_.leaveRaw();
  std::string line = line_.text();
  history_.add(line);
  return line;
}

LineEditor::Step LineEditor::handle(const KeyEvent& event) {
  // Set before the key acts: some keys draw on their own and may leave a fresh line to draw.
  dirty_ = true;
  if (search_ && handleSearch(event)) {
    return Step::kGoOn;
  }
  switch (event.key) {
    case Key::kText: line_.insert(event.text); break;
    case Key::kEnter: return Step::kAccept;
    case Key::kTab: complete(lastKey_ == Key::kTab); break;
    case Key::kBackspace: line_.backspace(); break;
    case Key::kDelete: line_.deleteForward(); break;
    case Key::kLeft: line_.left(); break;
    case Key::kRight: line_.right(); break;
    case Key::kWordLeft: line_.wordLeft(); break;
    case Key::kWordRight: line_.wordRight(); break;
    case Key::kHome: line_.home(); break;
    case Key::kEnd: line_.end(); break;
    case Key::kHistoryPrevious: browse(true); break;
    case Key::kHistoryNext: browse(false); break;
    case Key::kKillToEnd: killed_ = line_.killToEnd(); break;
    case Key::kKillToStart: killed_ = line_.killToStart(); break;
    case Key::kKillWordBack: killed_ = line_.killWordBack(); break;
    case Key::kYank: line_.insert(killed_); break;
    case Key::kClearScreen: terminal_.write("\x1b[H\x1b[2J"); break;
    case Key::kInterrupt:
      line_.end();
      redraw();
      terminal_.write("^C\r\n");
      line_ = LineBuffer();
      browsing_ = history_.size();
      edits_.clear();
      dirty_ = true;
      break;
    case Key::kEndOfInput:
      if (line_.text().empty()) {
        return Step::kEnd;
      }
      line_.deleteForward();
      break;
    case Key::kSuspend:
      terminal_.write("\r\n");
      terminal_.suspend();
      break;
    case Key::kSearch: search_.emplace(); break;
    case Key::kCancel: terminal_.write(kBell); break;
  }
  return Step::kGoOn;
}

bool LineEditor::handleSearch(const KeyEvent& event) {
  Search& search = *search_;
  switch (event.key) {
    case Key::kText:
      search.query += event.text;
      searchFrom(search.match ? search.match->index : history_.size());
      return true;
    case Key::kBackspace:
      if (!search.query.empty()) {
        search.query.erase(utf8::previous(search.query, search.query.size()));
      }
      searchFrom(history_.size());
      return true;
    case Key::kSearch:
      if (!search.match || search.match->index == 0) {
        terminal_.write(kBell);
        return true;
      }
      searchFrom(search.match->index - 1);
      return true;
    case Key::kCancel: search_.reset(); return true;
    case Key::kInterrupt: search_.reset(); return false;
    default:
      // Any other key takes the match into the line and then does what it does there.
      if (search.match) {
        browsing_ = search.match->index;
        line_.assign(history_.at(search.match->index), search.match->offset);
      }
      search_.reset();
      return false;
  }
}

void LineEditor::searchFrom(std::size_t index) {
  Search& search = *search_;
  if (search.query.empty()) {
    search.match.reset();
    search.failed = false;
    return;
  }
  if (std::optional<History::Match> match = history_.searchBackward(search.query, index)) {
    search.match = match;
    search.failed = false;
  } else {
    search.failed = true;
    terminal_.write(kBell);
  }
}

void LineEditor::browse(bool older) {
  if (older ? browsing_ == 0 : browsing_ >= history_.size()) {
    return;
  }
  edits_[browsing_] = line_.text();
  browsing_ = older ? browsing_ - 1 : browsing_ + 1;
  const auto edited = edits_.find(browsing_);
  if (edited != edits_.end()) {
    line_.assign(edited->second);
  } else {
    line_.assign(browsing_ < history_.size() ? history_.at(browsing_) : std::string());
  }
}

void LineEditor::complete(bool list) {
  const std::string_view before = std::string_view(line_.text()).substr(0, line_.cursor());
  const Completion completion = completer_(before);
  if (completion.candidates.empty()) {
    terminal_.write(kBell);
    return;
  }
  const std::size_t typed = before.size() - completion.start;
  const std::string common = commonStart(completion.candidates);
  if (completion.candidates.size() == 1) {
    line_.insert(std::string_view(common).substr(typed));
    if (!common.ends_with('/')) {
      line_.insert(" ");
    }
  } else if (common.size() > typed) {
    line_.insert(std::string_view(common).substr(typed));
  } else if (list) {
    terminal_.write("\r\n" + drawCandidates(completion.candidates, terminal_.columns()));
  }
}

void LineEditor::redraw() {
  const int columns = terminal_.columns();
  if (search_) {
    const std::string prompt =
        (search_->failed ? "(failed reverse-i-search)`" : "(reverse-i-search)`") + search_->query +
        "': ";
    if (search_->match) {
      terminal_.write(
          drawLine(prompt, history_.at(search_->match->index), search_->match->offset, columns));
    } else {
      terminal_.write(drawLine(prompt, line_.text(), line_.cursor(), columns));
    }
  } else {
    terminal_.write(drawLine(prompt_, line_.text(), line_.cursor(), columns));
  }
  dirty_ = false;
}

std::optional<std::string> LineEditor::readPlain() {
  terminal_.write(prompt_);
  for (std::size_t searched = 0;;) {
    const std::size_t end = plain_.find('\n', searched);
    searched = plain_.size();
    if (end != std::string::npos) {
      std::string line = plain_.substr(0, end);
      plain_.erase(0, end + 1);
      return line;
    }
    const long n = terminal_.read(chunk_.data(), chunk_.size());
    if (n <= 0) {
      if (plain_.empty()) {
        return std::nullopt;
      }
      return std::exchange(plain_, {});
    }
    plain_.append(chunk_, 0, static_cast<std::size_t>(n));
  }
}

}  // namespace halvex::editor
