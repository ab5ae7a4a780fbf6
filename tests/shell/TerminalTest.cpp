// SPDX-License-Identifier: MIT
// The real terminal, on a pseudo-terminal: its modes, and that they come back on every way out.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/wait.h>
#include <termios.h>
#include <unistd.h>

#include <tuple>

#include "shell/editor/Terminal.h"
#include "tests/support/Pty.h"

namespace halvex::editor {
namespace {

using namespace std::chrono_literals;

auto modes(int fd) {
  termios t{};
  EXPECT_EQ(::tcgetattr(fd, &t), 0);
  return std::make_tuple(t.c_iflag, t.c_oflag, t.c_cflag, t.c_lflag,
                         std::vector<cc_t>(std::begin(t.c_cc), std::end(t.c_cc)));
}

bool ownsSignal(int signal) {
  struct sigaction action {};
  ::sigaction(signal, nullptr, &action);
  return action.sa_handler != SIG_DFL;
}

TEST(TerminalTest, RawModeLastsUntilLeftAndNoLonger) {
  const test::Pty pty(37);
  const auto before = modes(pty.slave);
  const std::unique_ptr<Terminal> terminal = openTerminal(pty.slave, pty.slave);
  ASSERT_TRUE(terminal);
  EXPECT_EQ(terminal->columns(), 37);

  ASSERT_TRUE(terminal->enterRaw());
  termios raw{};
  ::tcgetattr(pty.slave, &raw);
  EXPECT_EQ(raw.c_lflag & (ICANON | ECHO | ISIG | IEXTEN), 0u);
  EXPECT_EQ(raw.c_iflag & (ICRNL | IXON), 0u);
  EXPECT_NE(raw.c_oflag & OPOST, 0u);
  EXPECT_TRUE(ownsSignal(SIGTERM));
  pty.type("a\x03\x1a");
  char keys[8];
  EXPECT_TRUE(terminal->waitForInput(1s));
  EXPECT_EQ(terminal->read(keys, sizeof keys), 3);
  EXPECT_FALSE(terminal->waitForInput(0ms));

  terminal->leaveRaw();
  EXPECT_EQ(modes(pty.slave), before);
  EXPECT_FALSE(ownsSignal(SIGTERM));
  EXPECT_EQ(pty.readUntil("\x1b[?2004l"), "\x1b[?2004h\x1b[?2004l");

  const winsize unknown{};
  ::ioctl(pty.slave, TIOCSWINSZ, &unknown);
  EXPECT_EQ(terminal->columns(), 80);
  int pipeEnds[2];
  ASSERT_EQ(::pipe(pipeEnds), 0);
  EXPECT_FALSE(openTerminal(pipeEnds[0], pty.slave));
  EXPECT_FALSE(openTerminal(pty.slave, pipeEnds[1]));
  ::close(pipeEnds[0]);
  ::close(pipeEnds[1]);
}

// A process that ends in raw mode, by a signal or a crash, leaves the terminal as it found it,
// and ends the way it would have without the editor.
TEST(TerminalTest, EndingInRawModePutsTheTerminalBack) {
  constexpr int kFault = 0;
  for (const int signal : {SIGTERM, SIGHUP, SIGINT, SIGQUIT, SIGABRT, kFault}) {
    SCOPED_TRACE(signal);
    const test::Pty pty(80);
    const auto before = modes(pty.slave);
    const pid_t child = ::fork();
    ASSERT_NE(child, -1);
    if (child == 0) {
      openTerminal(pty.slave, pty.slave).release()->enterRaw();
      if (signal == kFault) {
        static volatile std::uintptr_t unmapped = 8;  // volatile: the compiler cannot see it
        *reinterpret_cast<volatile char*>(unmapped) = 0;
      }
      ::raise(signal);
      ::_exit(0);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    if (signal != kFault) {
      EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == signal) << status;
    } else {
      EXPECT_FALSE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }
    EXPECT_EQ(modes(pty.slave), before);
  }
}

}  // namespace
}  // namespace halvex::editor
