// SPDX-License-Identifier: MIT
#include "tests/support/Pty.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <pty.h>
#include <unistd.h>

#include <cerrno>
#include <stdexcept>
#include <utility>

namespace halvex::test {

Pty::Pty(int columns) {
  winsize size{};
  size.ws_row = 24;
  size.ws_col = static_cast<unsigned short>(columns);
  if (::openpty(&master, &slave, nullptr, nullptr, &size) != 0) {
    throw std::runtime_error("openpty failed");
  }
}

Pty::~Pty() {
  ::close(master);
  ::close(slave);
}

void Pty::type(std::string_view keys) const {
  while (!keys.empty()) {
    const ssize_t n = ::write(master, keys.data(), keys.size());
    if (n < 0 && errno == EINTR) {
      continue;
    }
    ASSERT_GT(n, 0) << "typing failed";
    keys.remove_prefix(static_cast<std::size_t>(n));
  }
}

std::string Pty::readUntil(std::string_view text, std::chrono::milliseconds timeout) const {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  std::string screen = std::move(unread_);
  unread_.clear();
  while (screen.find(text) == std::string::npos) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    pollfd fd{master, POLLIN, 0};
    if (left.count() <= 0 || ::poll(&fd, 1, static_cast<int>(left.count())) <= 0) {
      ADD_FAILURE() << "the screen never showed \"" << text << "\"; it shows: " << screen;
      break;
    }
    char buffer[4096];
    const ssize_t n = ::read(master, buffer, sizeof buffer);
    if (n <= 0) {
      ADD_FAILURE() << "the terminal closed before showing \"" << text << "\": " << screen;
      break;
    }
    screen.append(buffer, static_cast<std::size_t>(n));
  }
  if (const std::size_t found = screen.find(text); found != std::string::npos) {
    unread_ = screen.substr(found + text.size());
    screen.resize(found + text.size());
  }
  return screen;
}

}  // namespace halvex::test
