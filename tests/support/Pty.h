// SPDX-License-Identifier: MIT
// Pseudo-terminals for tests that play the terminal a program runs on.
#pragma once

#include <chrono>
#include <string>
#include <string_view>

namespace halvex::test {

// The test types into master and reads the screen from it; slave is the program's terminal.
// Both ends close with the object.
struct Pty {
  Pty(int columns);
  ~Pty();
  Pty(const Pty&) = delete;
  Pty& operator=(const Pty&) = delete;

  void type(std::string_view keys) const;
  // What the program wrote since the last call, up to and including the next `text`; when that
  // does not come within timeout, the test fails and all that came is returned.
  std::string readUntil(std::string_view text,
                        std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;

  int master = -1;
  int slave = -1;

 private:
  mutable std::string unread_;  // read past the last `text`
};

}  // namespace halvex::test
