// SPDX-License-Identifier: MIT
#include "shell/Console.h"

#include <atomic>
#include <iostream>

namespace halvex {

namespace {

// Atomic only so that a reader on another thread never sees a torn pointer; the ordering
// contract is the one stated in the header.
std::atomic<std::istream*> gIn{&std::cin};
std::atomic<std::ostream*> gOut{&std::cout};
std::atomic<std::ostream*> gErr{&std::cerr};

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

void writeLine(std::ostream& out, std::string_view text) {
  out << text << '\n' << std::flush;
}

ScopedConsoleForTesting::ScopedConsoleForTesting(std::istream& in, std::ostream& out,
                                                 std::ostream& err)
    : previousIn_(gIn.exchange(&in, std::memory_order_acq_rel)),
      previousOut_(gOut.exchange(&out, std::memory_order_acq_rel)),
      previousErr_(gErr.exchange(&err, std::memory_order_acq_rel)) {}

ScopedConsoleForTesting::~ScopedConsoleForTesting() {
  gIn.store(previousIn_, std::memory_order_release);
  gOut.store(previousOut_, std::memory_order_release);
  gErr.store(previousErr_, std::memory_order_release);
}

}  // namespace halvex
