// SPDX-License-Identifier: MIT
#include "shell/editor/KeyDecoder.h"

#include <algorithm>

namespace halvex::editor {

namespace {

constexpr unsigned char kEsc = 0x1B;
constexpr std::string_view kPasteEnd = "\x1b[201~";
// Long enough for any key's parameters; a longer run is read to its end but not kept.
constexpr std::size_t kMaxParameters = 16;

std::optional<Key> controlKey(unsigned char byte) {
  switch (byte) {
    case 0x01: return Key::kHome;
    case 0x02: return Key::kLeft;
    case 0x03: return Key::kInterrupt;
    case 0x04: return Key::kEndOfInput;
    case 0x05: return Key::kEnd;
    case 0x06: return Key::kRight;
    case 0x07: return Key::kCancel;
    case 0x08: return Key::kBackspace;
    case 0x09: return Key::kTab;
    case 0x0A: return Key::kEnter;
    case 0x0B: return Key::kKillToEnd;
    case 0x0C: return Key::kClearScreen;
    case 0x0D: return Key::kEnter;
    case 0x0E: return Key::kHistoryNext;
    case 0x10: return Key::kHistoryPrevious;
    case 0x12: return Key::kSearch;
    case 0x15: return Key::kKillToStart;
    case 0x17: return Key::kKillWordBack;
    case 0x19: return Key::kYank;
    case 0x1A: return Key::kSuspend;
    case 0x7F: return Key::kBackspace;
    default: return std::nullopt;
  }
}

// ESC followed by a key is how terminals send Alt with it.
std::optional<Key> altKey(unsigned char byte) {
  switch (byte) {
    case 'b':
    case 'B': return Key::kWordLeft;
    case 'f':
    case 'F': return Key::kWordRight;
    case 0x08:
    case 0x7F: return Key::kKillWordBack;
    default: return std::nullopt;
  }
}

// The final byte of CSI or SS3 for the cursor keys; a Ctrl or Alt modifier turns Left and Right
// into word moves.
std::optional<Key> cursorKey(unsigned char final, bool modified) {
  switch (final) {
    case 'A': return Key::kHistoryPrevious;
    case 'B': return Key::kHistoryNext;
    case 'C': return modified ? Key::kWordRight : Key::kRight;
    case 'D': return modified ? Key::kWordLeft : Key::kLeft;
    case 'H': return Key::kHome;
    case 'F': return Key::kEnd;
    default: return std::nullopt;
  }
}

bool isTextByte(unsigned char byte) {
  return byte >= 0x20 && byte != 0x7F;
}

bool isContinuation(unsigned char byte) {
  return (byte & 0xC0u) == 0x80u;
}

// How many bytes at the end of text are the start of a multi-byte character still missing its
// last bytes.
std::size_t unfinishedTail(std::string_view text) {
  for (std::size_t back = 1; back <= 3 && back <= text.size(); ++back) {
    const auto byte = static_cast<unsigned char>(text[text.size() - back]);
    if (isContinuation(byte)) {
      continue;
    }
    const std::size_t needed = byte >= 0xF0 && byte <= 0xF4   ? 4
                               : byte >= 0xE0 && byte <= 0xEF ? 3
                               : byte >= 0xC2 && byte <= 0xDF ? 2
                                                              : 0;
    return needed > back ? back : 0;
  }
  return 0;
}

}  // namespace

void KeyDecoder::feed(std::string_view bytes) {
  compact();
  buffer_.append(bytes);
  partialHeld_ = false;
}

bool KeyDecoder::waitingForMore() const {
  return state_ == State::kEscape || state_ == State::kControl || state_ == State::kShift3 ||
         partialHeld_;
}

void KeyDecoder::expire() {
  if (state_ != State::kPaste) {
    state_ = State::kGround;
  }
  releasePartial_ = partialHeld_;
  partialHeld_ = false;
}

bool KeyDecoder::pasteEndFed() {
  const std::size_t from = std::max(pos_, markerSearched_);
  if (buffer_.find(kPasteEnd, from) != std::string::npos) {
    return true;
  }
  markerSearched_ = buffer_.size() < kPasteEnd.size() ? 0 : buffer_.size() - kPasteEnd.size() + 1;
  return false;
}

void KeyDecoder::compact() {
  // Dropping taken bytes only once they outweigh the rest keeps the copying linear.
  if (pos_ == buffer_.size() || (pos_ > 4096 && pos_ > buffer_.size() / 2)) {
    buffer_.erase(0, pos_);
    markerSearched_ = markerSearched_ > pos_ ? markerSearched_ - pos_ : 0;
    pos_ = 0;
  }
}

std::optional<KeyEvent> KeyDecoder::takeText(bool pasted) {
  const std::size_t start = pos_;
  while (pos_ < buffer_.size()) {
    const auto byte = static_cast<unsigned char>(buffer_[pos_]);
    if (pasted ? (byte == kEsc || byte == '\r' || byte == '\n') : !isTextByte(byte)) {
      break;
    }
    ++pos_;
  }
  // A character split between two reads waits for its last bytes, unless expire() said none come.
  if (pos_ == buffer_.size() && !releasePartial_) {
    const std::size_t held = unfinishedTail(std::string_view(buffer_).substr(start));
    pos_ -= held;
    partialHeld_ = held > 0;
  }
  releasePartial_ = false;
  if (pos_ == start) {
    return std::nullopt;
  }
  return KeyEvent{Key::kText, buffer_.substr(start, pos_ - start)};
}

std::optional<KeyEvent> KeyDecoder::next() {
  while (pos_ < buffer_.size() && !partialHeld_) {
    const auto byte = static_cast<unsigned char>(buffer_[pos_]);
    switch (state_) {
      case State::kGround:
        if (isTextByte(byte)) {
          afterCarriageReturn_ = false;
          if (std::optional<KeyEvent> text = takeText(false)) {
            return text;
          }
          continue;
        }
        ++pos_;
        if (byte == kEsc) {
          state_ = State::kEscape;
          continue;
        }
        if (byte == '\n' && afterCarriageReturn_) {
          afterCarriageReturn_ = false;
          continue;
        }
        afterCarriageReturn_ = byte == '\r';
        if (std::optional<Key> key = controlKey(byte)) {
          return KeyEvent{*key, {}};
        }
        continue;
      case State::kEscape:
        ++pos_;
        afterCarriageReturn_ = false;
        if (byte == '[') {
          state_ = State::kControl;
          parameters_.clear();
          continue;
        }
        if (byte == 'O') {
          state_ = State::kShift3;
          continue;
        }
        if (byte == kEsc) {
          continue;
        }
        state_ = State::kGround;
        if (std::optional<Key> key = altKey(byte)) {
          return KeyEvent{*key, {}};
        }
        continue;
      case State::kControl:
        if (byte >= 0x20 && byte <= 0x3F) {
          if (byte >= 0x30 && parameters_.size() < kMaxParameters) {
            parameters_ += static_cast<char>(byte);
          }
          ++pos_;
          continue;
        }
        state_ = State::kGround;
        if (byte >= 0x40 && byte <= 0x7E) {
          ++pos_;
          if (std::optional<KeyEvent> key = dispatchControl(byte)) {
            return key;
          }
        }
        // Any other byte breaks the sequence off and counts on its own.
        continue;
      case State::kShift3:
        ++pos_;
        state_ = State::kGround;
        if (std::optional<Key> key = cursorKey(byte, false)) {
          return KeyEvent{*key, {}};
        }
        continue;
      case State::kPaste:
        if (byte == kEsc) {
          const std::string_view rest = std::string_view(buffer_).substr(pos_);
          if (rest.starts_with(kPasteEnd)) {
            pos_ += kPasteEnd.size();
            state_ = State::kGround;
            continue;
          }
          if (kPasteEnd.starts_with(rest)) {
            return std::nullopt;  // the marker may be on its way
          }
          ++pos_;
          return KeyEvent{Key::kText, "\x1b"};
        }
        if (byte == '\r' || byte == '\n') {
          ++pos_;
          const bool secondHalf = byte == '\n' && afterCarriageReturn_;
          afterCarriageReturn_ = byte == '\r';
          if (secondHalf) {
            continue;
          }
          return KeyEvent{Key::kEnter, {}};
        }
        afterCarriageReturn_ = false;
        if (std::optional<KeyEvent> text = takeText(true)) {
          return text;
        }
        continue;
    }
  }
  return std::nullopt;
}

std::optional<KeyEvent> KeyDecoder::dispatchControl(unsigned char final) {
  const std::string_view parameters = parameters_;
  const std::size_t separator = parameters.find(';');
  const std::string_view first = parameters.substr(0, separator);
  const std::string_view modifier =
      separator == std::string_view::npos ? std::string_view() : parameters.substr(separator + 1);
  if (final == '~') {
    if (first == "200") {
      state_ = State::kPaste;
      afterCarriageReturn_ = false;
      return std::nullopt;
    }
    if (first == "1" || first == "7") {
      return KeyEvent{Key::kHome, {}};
    }
    if (first == "4" || first == "8") {
      return KeyEvent{Key::kEnd, {}};
    }
    if (first == "3") {
      return KeyEvent{Key::kDelete, {}};
    }
    return std::nullopt;
  }
  // Shift (2) alone leaves a move as it is; Alt (3), Ctrl (5) and their combinations make it
  // move by words.
  const bool modified = !modifier.empty() && modifier != "1" && modifier != "2";
  if (std::optional<Key> key = cursorKey(final, modified)) {
    return KeyEvent{*key, {}};
  }
  return std::nullopt;
}

}  // namespace halvex::editor
