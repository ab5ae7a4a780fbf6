// SPDX-License-Identifier: MIT
// The terminal the line editor works on: its modes, its size, and the bytes that go in and out.
//
// The editor puts the terminal into raw mode only while it edits a line and puts it back before
// the line is evaluated, so anything a command prints, and Ctrl-C while it runs, behave as they
// do without the editor. Raw mode here means: no echo, no line discipline, no signals from keys
// (Ctrl-C, Ctrl-Z and Ctrl-\ arrive as bytes), no flow control and no CR-to-NL translation, but
// output processing kept; and bracketed paste on.
//
// openTerminal() gives the real one. As long as it is in raw mode it puts the terminal back as
// it found it on every way out it can see: a normal exit, a signal that ends the process
// (SIGTERM, SIGHUP, SIGINT, SIGQUIT, SIGABRT) and a crash (SIGSEGV, SIGBUS, SIGFPE, SIGILL); the
// signal then goes on to do what it did before. Outside raw mode it has no signal handlers.
//
// Threads: one thread uses a Terminal; the restoring on the way out may run on any.
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <string_view>

namespace halvex::editor {

class Terminal {
 public:
  virtual ~Terminal() = default;

  // False when the terminal cannot be put into raw mode; it is then left as it was.
  virtual bool enterRaw() = 0;
  virtual void leaveRaw() = 0;

  // The width in columns, asked afresh at each call (80 when the terminal cannot say).
  virtual int columns() = 0;

  // Blocks until input comes: the number of bytes read, 0 at the end of input, -1 on an error.
  virtual long read(char* buffer, std::size_t size) = 0;
  // Whether input is waiting or comes within timeout.
  virtual bool waitForInput(std::chrono::milliseconds timeout) = 0;
  virtual void write(std::string_view bytes) = 0;

  // Stops the process as Ctrl-Z does outside the editor: raw mode is left first and entered
  // again once the process is continued.
  virtual void suspend() = 0;
};

// The terminal on the given descriptors, or null unless both are terminals.
std::unique_ptr<Terminal> openTerminal(int in, int out);

}  // namespace halvex::editor
