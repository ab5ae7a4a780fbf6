// SPDX-License-Identifier: MIT
// The system log speaks the journal's native protocol. Where no journal runs (containers, CI),
// the test plays the journal: it binds the socket the journal would and reads the datagram.
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <map>
#include <string>
#include <vector>

#include "platform/SystemLog.h"

namespace halvex::test {
namespace {

namespace fs = std::filesystem;

// One entry of the native protocol: "KEY=value\n", or for a value holding a newline "KEY\n", its
// length as 64-bit little endian, the value and "\n".
std::map<std::string, std::string> parseEntry(const std::string& data) {
  std::map<std::string, std::string> fields;
  std::size_t at = 0;
  while (at < data.size()) {
    const std::size_t end = data.find('\n', at);
    if (end == std::string::npos) {
      ADD_FAILURE() << "unterminated field at " << at;
      break;
    }
    const std::string line = data.substr(at, end - at);
    const std::size_t equals = line.find('=');
    if (equals != std::string::npos) {
      fields[line.substr(0, equals)] = line.substr(equals + 1);
      at = end + 1;
      continue;
    }
    std::uint64_t length = 0;
    if (end + 1 + sizeof length > data.size()) {
      ADD_FAILURE() << "truncated binary field " << line;
      break;
    }
    for (std::size_t i = 0; i < sizeof length; ++i) {
      length |= std::uint64_t{static_cast<unsigned char>(data[end + 1 + i])} << (8 * i);
    }
    const std::size_t value = end + 1 + sizeof length;
    if (value + length + 1 > data.size()) {
      ADD_FAILURE() << "binary field " << line << " runs past the entry";
      break;
    }
    fields[line] = data.substr(value, length);
    at = value + length + 1;
  }
  return fields;
}

class FakeJournal {
 public:
  FakeJournal() {
    for (fs::path dir : {fs::path("/run/systemd"), fs::path("/run/systemd/journal")}) {
      if (!fs::exists(dir) && fs::create_directory(dir)) {
        created_.push_back(dir);
      }
    }
    fd_ = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, kSocket);
    bound_ =
        fd_ >= 0 && ::bind(fd_, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
  }

  ~FakeJournal() {
    if (fd_ >= 0) {
      ::close(fd_);
    }
    if (bound_) {
      ::unlink(kSocket);
    }
    for (auto dir = created_.rbegin(); dir != created_.rend(); ++dir) {
      std::error_code ignored;
      fs::remove(*dir, ignored);
    }
  }

  bool bound() const { return bound_; }

  // The next entry whose CATEGORY is category, skipping what other processes on this machine
  // log meanwhile; an empty map when none came within five seconds.
  std::map<std::string, std::string> receive(const std::string& category) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    std::string data(1 << 20, '\0');
    for (;;) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      pollfd ready{fd_, POLLIN, 0};
      if (left.count() <= 0 || ::poll(&ready, 1, static_cast<int>(left.count())) != 1) {
        return {};
      }
      const ssize_t got = ::recv(fd_, data.data(), data.size(), 0);
      if (got <= 0) {
        return {};
      }
      auto fields = parseEntry(data.substr(0, static_cast<std::size_t>(got)));
      if (fields["CATEGORY"] == category) {
        return fields;
      }
    }
  }

  static constexpr const char* kSocket = "/run/systemd/journal/socket";

 private:
  int fd_ = -1;
  bool bound_ = false;
  std::vector<fs::path> created_;
};

TEST(SystemLogTest, EntriesCarryMessagePrioritySubsystemAndCategory) {
  if (fs::exists(FakeJournal::kSocket)) {
    GTEST_SKIP() << "a journal runs on this machine; its entries are not ours to read";
  }
  FakeJournal journal;
  ASSERT_TRUE(journal.bound()) << std::strerror(errno);
  auto server = LogServer::create();
  ASSERT_TRUE(server);
  const std::string category = "journal-test-" + std::to_string(::getpid());

  const struct {
    LogLevel level;
    std::string message;
    const char* priority;
  } rows[] = {
      {LogLevel::kError, "dump failed: 100%", "3"},
      {LogLevel::kNotice, "two\nlines", "5"},
      {LogLevel::kInfo, std::string("with\0nul", 8), "6"},
      {LogLevel::kDebug, "", "7"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.priority);
    server->write(LogContext("org.halvex.test", category), row.level, row.message);
    const auto fields = journal.receive(category);
    // The journal library names the program itself.
    EXPECT_EQ(fields, (std::map<std::string, std::string>{
                          {"MESSAGE", row.message},
                          {"PRIORITY", row.priority},
                          {"SUBSYSTEM", "org.halvex.test"},
                          {"CATEGORY", category},
                          {"SYSLOG_IDENTIFIER", program_invocation_short_name}}));
  }

  // A runaway message is cut, not sent whole.
  server->write(LogContext("org.halvex.test", category), LogLevel::kError,
                std::string(100 * 1024, 'x'));
  EXPECT_EQ(journal.receive(category)["MESSAGE"], std::string(16 * 1024, 'x'));
}

}  // namespace
}  // namespace halvex::test
