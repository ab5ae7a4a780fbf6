// SPDX-License-Identifier: MIT
// The terminal through POSIX termios, for any Unix.
#include <poll.h>
#include <sys/ioctl.h>
#include <termios.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <mutex>

#include "shell/editor/Terminal.h"

namespace halvex::editor {

namespace {

constexpr std::string_view kPasteOn = "\x1b[?2004h";
constexpr std::string_view kPasteOff = "\x1b[?2004l";

constexpr std::array kEndingSignals{SIGTERM, SIGHUP, SIGINT, SIGQUIT, SIGABRT,
                                    SIGSEGV, SIGBUS, SIGFPE, SIGILL};

struct RawMode {
  int in;
  int out;
  termios saved;
};

// Set while a terminal is in raw mode; what the handlers and the exit hook put back. Only one
// terminal at a time can be in raw mode.
std::atomic<const RawMode*> gRaw{nullptr};
std::array<struct sigaction, kEndingSignals.size()> gPrevious{};

void writeAll(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t n = ::write(fd, bytes.data(), bytes.size());
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      return;
    }
    bytes.remove_prefix(static_cast<std::size_t>(n));
  }
}

// Async-signal-safe: tcsetattr and write only.
void restoreRawTerminal() {
  if (const RawMode* raw = gRaw.exchange(nullptr)) {
    writeAll(raw->out, kPasteOff);
    ::tcsetattr(raw->in, TCSANOW, &raw->saved);
  }
}

void putBackHandlers() {
  for (std::size_t i = 0; i < kEndingSignals.size(); ++i) {
    ::sigaction(kEndingSignals[i], &gPrevious[i], nullptr);
  }
}

void onEndingSignal(int signal, siginfo_t* info, void*) {
  const int savedErrno = errno;
  restoreRawTerminal();
  putBackHandlers();
  // A fault raised by an instruction comes again when the handler returns, now to the earlier
  // action; anything sent needs sending again.
  const bool fault =
      (signal == SIGSEGV || signal == SIGBUS || signal == SIGFPE || signal == SIGILL) &&
      info != nullptr && info->si_code > 0;
  if (!fault) {
    ::raise(signal);
  }
  errno = savedErrno;
}

void takeHandlers() {
  struct sigaction action {};
  action.sa_sigaction = onEndingSignal;
  action.sa_flags = SA_SIGINFO;
  sigemptyset(&action.sa_mask);
  for (std::size_t i = 0; i < kEndingSignals.size(); ++i) {
    ::sigaction(kEndingSignals[i], &action, &gPrevious[i]);
  }
}

class PosixTerminal final : public Terminal {
 public:
  PosixTerminal(int in, int out) : in_(in), out_(out) {
    static std::once_flag exitHook;
    std::call_once(exitHook, [] { std::atexit(restoreRawTerminal); });
  }

  ~PosixTerminal() override { leaveRaw(); }

  bool enterRaw() override {
    if (raw_) {
      return true;
    }
    termios saved{};
    if (::tcgetattr(in_, &saved) != 0) {
      return false;
    }
    termios raw = saved;
    raw.c_iflag &= ~static_cast<tcflag_t>(BRKINT | ICRNL | INPCK | ISTRIP | IXON);
    raw.c_cflag |= CS8;
    raw.c_lflag &= ~static_cast<tcflag_t>(ECHO | ICANON | IEXTEN | ISIG);
    raw.c_cc[VMIN] = 1;
    raw.c_cc[VTIME] = 0;
    mode_ = RawMode{in_, out_, saved};
    takeHandlers();
    gRaw.store(&mode_);
    // TCSANOW, not TCSAFLUSH: keys typed ahead while a command ran are the user's next line.
    if (::tcsetattr(in_, TCSANOW, &raw) != 0) {
      gRaw.store(nullptr);
      putBackHandlers();
      return false;
    }
    raw_ = true;
    writeAll(out_, kPasteOn);
    return true;
  }

  void leaveRaw() override {
    if (!raw_) {
      return;
    }
    raw_ = false;
    restoreRawTerminal();
    putBackHandlers();
  }

  int columns() override {
    winsize size{};
    if (::ioctl(out_, TIOCGWINSZ, &size) == 0 && size.ws_col > 0) {
      return size.ws_col;
    }
    return 80;
  }

  long read(char* buffer, std::size_t size) override {
    for (;;) {
      const ssize_t n = ::read(in_, buffer, size);
      if (n >= 0 || errno != EINTR) {
        return n;
      }
    }
  }

  bool waitForInput(std::chrono::milliseconds timeout) override {
    pollfd fd{in_, POLLIN, 0};
    return ::poll(&fd, 1, static_cast<int>(timeout.count())) > 0;
  }

  void write(std::string_view bytes) override { writeAll(out_, bytes); }

  void suspend() override {
    leaveRaw();
    // What the terminal does for Ctrl-Z outside raw mode: stop the whole foreground group.
    ::kill(0, SIGTSTP);
    enterRaw();
  }

 private:
  int in_;
  int out_;
  bool raw_ = false;
  RawMode mode_{};
};

}  // namespace

std::unique_ptr<Terminal> openTerminal(int in, int out) {
  if (::isatty(in) != 1 || ::isatty(out) != 1) {
    return nullptr;
  }
  return std::make_unique<PosixTerminal>(in, out);
}

}  // namespace halvex::editor
