// SPDX-License-Identifier: MIT
// A terminal in memory for the line editor: it hands out the reads it was given, in that order,
// and keeps what the editor draws. A "" among the reads is a pause longer than a key takes.
#pragma once

#include <algorithm>
#include <chrono>
#include <deque>
#include <string>
#include <string_view>
#include <vector>

#include "shell/editor/Terminal.h"

namespace halvex::testing {

class FakeTerminal : public editor::Terminal {
 public:
  FakeTerminal(const std::vector<std::string>& reads, int width)
      : reads_(reads.begin(), reads.end()), columns_(width) {}

  bool enterRaw() override {
    raw = !refuseRaw;
    return raw;
  }
  void leaveRaw() override { raw = false; }
  int columns() override { return columns_; }
  long read(char* buffer, std::size_t size) override {
    while (!reads_.empty() && reads_.front().empty()) {
      reads_.pop_front();
    }
    if (reads_.empty()) {
      return 0;
    }
    std::string& next = reads_.front();
    const std::size_t n = std::min(size, next.size());
    next.copy(buffer, n);
    next.erase(0, n);
    if (next.empty()) {
      reads_.pop_front();
    }
    return static_cast<long>(n);
  }
  bool waitForInput(std::chrono::milliseconds) override {
    if (!reads_.empty() && reads_.front().empty()) {
      reads_.pop_front();
      return false;
    }
    return !reads_.empty();
  }
  void write(std::string_view bytes) override {
    drewOutsideRaw = drewOutsideRaw || (!raw && !refuseRaw);
    screen.append(bytes);
  }
  void suspend() override { screen += "<suspended>"; }

  bool raw = false;
  bool refuseRaw = false;
  bool drewOutsideRaw = false;
  std::string screen;

 private:
  std::deque<std::string> reads_;
  int columns_;
};

}  // namespace halvex::testing
