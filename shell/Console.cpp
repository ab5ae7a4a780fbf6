// SPDX-License-Identifier: MIT
#include "shell/Console.h"

#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <iostream>
#include <system_error>

#include "shell/editor/Terminal.h"

namespace halvex {

namespace {

// Atomic only so that a reader on another thread never sees a torn pointer; the ordering
// contract is the one stated in the header.
std::atomic<std::istream*> gIn{&std::cin};
std::atomic<std::ostream*> gOut{&std::cout};
std::atomic<std::ostream*> gErr{&std::cerr};
std::atomic<editor::Terminal*> gTerminal{nullptr};
std::atomic<bool> gScoped{false};
// Set at start-up, read at the end, both on one thread before and after the others run.
bool gStandardOutputClosed = false;
// Why the standard output first lost something: stdio drops what it could not write, so this
// is the one chance to learn the reason. -1 when it is not known.
std::atomic<int> gFirstLoss{0};

void noteLoss(const std::ostream& out) {
  if (&out == &std::cout && !out.good()) {
    int none = 0;
    gFirstLoss.compare_exchange_strong(none, errno != 0 ? errno : -1, std::memory_order_relaxed);
  }
}

void write(std::ostream& out, std::string_view text, bool newline) {
  out << text;
  if (newline) {
    out << '\n';
  }
  out << std::flush;
  noteLoss(out);
}

}  // namespace

std::istream& consoleIn() {
  return *gIn.load(std::memory_order_acquire);
}

std::ostream& consoleOut() {
  return *gOut.load(std::memory_order_acquire);
}

std::ostream& consoleErr() {
  return *gErr.load(std::memory_order_acquire);
}

editor::Terminal* consoleTerminal() {
  if (gScoped.load(std::memory_order_acquire)) {
    return gTerminal.load(std::memory_order_acquire);
  }
  // Never destroyed, so that no thread can find it gone while the process exits; the terminal
  // itself puts its modes back at exit.
  static editor::Terminal* const standard =
      editor::openTerminal(STDIN_FILENO, STDOUT_FILENO).release();
  return standard;
}

void reserveStandardDescriptors() {
  for (int fd = STDIN_FILENO; fd <= STDERR_FILENO; ++fd) {
    if (::fcntl(fd, F_GETFD) == -1 && errno == EBADF) {
      // open() returns the lowest free number: this one.
      ::open("/dev/null", fd == STDIN_FILENO ? O_RDONLY : O_WRONLY);
      gStandardOutputClosed = gStandardOutputClosed || fd == STDOUT_FILENO;
    }
  }
}

std::optional<std::string> consoleOutError() {
  std::ostream& out = consoleOut();
  writeText(out, "");
  if (&out != &std::cout) {
    return out.good() ? std::nullopt : std::optional<std::string>("write error");
  }
  if (!gStandardOutputClosed && out.good() && std::fflush(stdout) == 0 &&
      std::ferror(stdout) == 0) {
    return std::nullopt;
  }
  const int error = gStandardOutputClosed ? EBADF : gFirstLoss.load(std::memory_order_relaxed);
  std::string reason = "write error";
  if (error > 0) {
    reason.append(": ").append(std::generic_category().message(error));
  }
  return reason;
}

void writeText(std::ostream& out, std::string_view text) {
  write(out, text, false);
}

void writeLine(std::ostream& out, std::string_view text) {
  write(out, text, true);
}

ScopedConsoleForTesting::ScopedConsoleForTesting(std::istream& in, std::ostream& out,
                                                 std::ostream& err, editor::Terminal* terminal)
    : previousIn_(gIn.exchange(&in, std::memory_order_acq_rel)),
      previousOut_(gOut.exchange(&out, std::memory_order_acq_rel)),
      previousErr_(gErr.exchange(&err, std::memory_order_acq_rel)),
      previousTerminal_(gTerminal.exchange(terminal, std::memory_order_acq_rel)),
      previousScoped_(gScoped.exchange(true, std::memory_order_acq_rel)) {}

ScopedConsoleForTesting::~ScopedConsoleForTesting() {
  gIn.store(previousIn_, std::memory_order_release);
  gOut.store(previousOut_, std::memory_order_release);
  gErr.store(previousErr_, std::memory_order_release);
  gTerminal.store(previousTerminal_, std::memory_order_release);
  gScoped.store(previousScoped_, std::memory_order_release);
}

}  // namespace halvex
