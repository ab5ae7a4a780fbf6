// SPDX-License-Identifier: MIT
// The process's standard streams, reached through one place so that tests can swap them.
//
// Everything the tool prints or reads goes through consoleIn(), consoleOut() and consoleErr()
// rather than std::cin, std::cout and std::cerr directly. The functions may be called from any
// thread; the streams they return are the standard ones unless a ScopedConsoleForTesting is alive.
#pragma once

#include <iosfwd>
#include <string_view>

namespace halvex {

std::istream& consoleIn();
std::ostream& consoleOut();
std::ostream& consoleErr();

// Writes text, a newline, and flushes: every line the tool prints ends this way, so that a line
// is complete on the terminal (or in a pipe) before the next prompt or a later line from another
// thread.
void writeLine(std::ostream& out, std::string_view text);

// Test-only: redirects the console to the given streams for this object's lifetime, and restores
// what was there before on destruction (scopes may nest). The streams must outlive this object.
//
// Threads: construct it before any other thread may use the console and destroy it only after
// they have stopped using it; swapping streams under a thread that is writing is not supported.
// A stream itself is not synchronised, so two threads must not write to it at the same time
// (the shell guarantees that by waiting for each option's work before it prints again).
class ScopedConsoleForTesting {
 public:
  ScopedConsoleForTesting(std::istream& in, std::ostream& out, std::ostream& err);
  ~ScopedConsoleForTesting();

  ScopedConsoleForTesting(const ScopedConsoleForTesting&) = delete;
  ScopedConsoleForTesting& operator=(const ScopedConsoleForTesting&) = delete;

 private:
  std::istream* previousIn_;
  std::ostream* previousOut_;
  std::ostream* previousErr_;
};

}  // namespace halvex
