// SPDX-License-Identifier: MIT
// The process's standard streams, reached through one place so that tests can swap them.
//
// Everything the tool prints or reads goes through consoleIn(), consoleOut() and consoleErr()
// rather than std::cin, std::cout and std::cerr directly. The functions may be called from any
// thread; the streams they return are the standard ones unless a ScopedConsoleForTesting is alive.
#pragma once

#include <iosfwd>
#include <optional>
#include <string>
#include <string_view>

namespace halvex {

namespace editor {
class Terminal;
}

std::istream& consoleIn();
std::ostream& consoleOut();
std::ostream& consoleErr();

// The terminal behind consoleIn() and consoleOut(), for the line editor: the process's own when
// its standard input and output are both terminals and no ScopedConsoleForTesting is alive, the
// one a ScopedConsoleForTesting names, or else null. Shell thread only.
editor::Terminal* consoleTerminal();

// Call first thing in main. A standard descriptor the process was started without is opened on
// /dev/null, so that no file or socket opened later takes its number and receives what is meant
// for the console; output that went to a closed standard output still counts as lost.
void reserveStandardDescriptors();

// Flushes consoleOut() and says why some of what was written to it was lost (a full device, a
// closed or broken output), or nothing when all of it arrived. Call it once output is over.
std::optional<std::string> consoleOutError();

// Writes text, a newline, and flushes: every line the tool prints ends this way, so that a line
// is complete on the terminal (or in a pipe) before the next prompt or a later line from another
// thread. Text that cannot be written is noted for consoleOutError().
void writeLine(std::ostream& out, std::string_view text);
// The same without the newline, for a prompt or the start of a line.
void writeText(std::ostream& out, std::string_view text);

// Test-only: redirects the console to the given streams (and terminal, if any) for this object's
// lifetime, and restores what was there before on destruction (scopes may nest). The streams
// and the terminal must outlive this object.
//
// Threads: construct it before any other thread may use the console and destroy it only after
// they have stopped using it; swapping streams under a thread that is writing is not supported.
// A stream itself is not synchronised, so two threads must not write to it at the same time
// (the shell guarantees that by waiting for each option's work before it prints again).
class ScopedConsoleForTesting {
 public:
  ScopedConsoleForTesting(std::istream& in, std::ostream& out, std::ostream& err,
                          editor::Terminal* terminal = nullptr);
  ~ScopedConsoleForTesting();

  ScopedConsoleForTesting(const ScopedConsoleForTesting&) = delete;
  ScopedConsoleForTesting& operator=(const ScopedConsoleForTesting&) = delete;

 private:
  std::istream* previousIn_;
  std::ostream* previousOut_;
  std::ostream* previousErr_;
  editor::Terminal* previousTerminal_;
  bool previousScoped_;
};

}  // namespace halvex
