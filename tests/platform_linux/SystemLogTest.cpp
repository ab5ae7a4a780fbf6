// SPDX-License-Identifier: MIT
// The system log speaks the journal's native protocol; the test plays the journal: it binds the
// socket the journal would and reads the datagrams.
#include <gtest/gtest.h>
#include <poll.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <map>
#include <regex>
#include <string>
#include <vector>

#include "platform/DeviceQueries.h"
#include "platform/HelperClient.h"
#include "platform/ServerClient.h"
#include "platform/SystemLog.h"
#include "platform/linux/testing/BusTesting.h"
#include "tests/support/TestBus.h"

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

// Binds the socket the journal would. As root it does so in a mount namespace of its own, over a
// fresh /run, so that a journal running on the machine is neither disturbed nor in the way; it
// must then be made before any thread starts (the children and threads started later share the
// namespace). Otherwise it can only stand in where no journal runs.
class FakeJournal {
 public:
  FakeJournal() {
    if (::geteuid() == 0) {
      const bool isolated = ::unshare(CLONE_NEWNS) == 0 &&
                            ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
                            ::mount("tmpfs", "/run", "tmpfs", 0, "mode=0755") == 0;
      if (!isolated) {
        problem_ = std::string("cannot isolate /run: ") + std::strerror(errno);
        return;
      }
    } else if (fs::exists(kSocket)) {
      problem_ = "a journal runs on this machine and only root can stand in for it";
      return;
    }
    std::error_code error;
    fs::create_directories("/run/systemd/journal", error);
    fd_ = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, kSocket);
    if (fd_ < 0 || ::bind(fd_, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
      problem_ = std::string("cannot bind ") + kSocket + ": " + std::strerror(errno);
    } else {
      bound_ = true;
    }
  }

  ~FakeJournal() {
    if (fd_ >= 0) {
      ::close(fd_);
    }
    if (bound_) {
      ::unlink(kSocket);
    }
  }

  // Empty when the journal could be stood in for.
  const std::string& problem() const { return problem_; }

  // The next entry from subsystem and category, skipping everything else that is logged
  // meanwhile; an empty map when none came within five seconds.
  std::map<std::string, std::string> receive(const std::string& subsystem,
                                             const std::string& category) {
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
      if (fields["SUBSYSTEM"] == subsystem && fields["CATEGORY"] == category) {
        return fields;
      }
    }
  }

  static constexpr const char* kSocket = "/run/systemd/journal/socket";

 private:
  int fd_ = -1;
  bool bound_ = false;
  std::string problem_;
};

TEST(SystemLogTest, EntriesCarryMessagePrioritySubsystemAndCategory) {
  FakeJournal journal;
  if (!journal.problem().empty()) {
    GTEST_SKIP() << journal.problem();
  }
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
    const auto fields = journal.receive("org.halvex.test", category);
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
  EXPECT_EQ(journal.receive("org.halvex.test", category)["MESSAGE"], std::string(16 * 1024, 'x'));
}

// Every request the platform makes leaves one entry: what it was, its code and how long it took;
// failures at warning priority, successes at debug.
TEST(SystemLogTest, EveryRequestIsLoggedWithItsOutcome) {
  FakeJournal journal;
  if (!journal.problem().empty()) {
    GTEST_SKIP() << journal.problem();
  }
  PrivateBus bus;
  SimProcess sim(bus, R"({"server": {"commands": {"Refused": {"result": 7}}}})");
  bus::RunLoopThreadForTesting loop;
  EXPECT_EQ(device::getRadioType(), 1);
  auto manager = client::CreateManager("halvextool", WorkQueue::create("test.queue"));
  MessageValue reply;
  EXPECT_TRUE(client::PerformCommand(manager, kCommandTraceDumpState, {}, reply).ok());
  EXPECT_EQ(client::PerformCommand(manager, "Refused", {}, reply).code, 7);
  EXPECT_TRUE(
      HelperClient::create("logdump.helper", nullptr)
          ->perform(helper::kTaskDiagnosticsCollection, helper::kCommandVarniskStatus, {}, reply)
          .ok());

  const struct {
    const char* category;
    std::string pattern;
    const char* priority;
  } expected[] = {
      {"device", "GetIdentity: code 0x00000000", "7"},
      {"server", std::string("PerformCommand ") + kCommandTraceDumpState + ": code 0x00000000",
       "7"},
      {"server", "PerformCommand Refused: code 0x00000007", "4"},
      {"helper",
       std::string("Perform logdump.helper ") + helper::kCommandVarniskStatus + ": code 0x00000000",
       "7"},
  };
  for (const auto& entry : expected) {
    auto fields = journal.receive("org.halvex.platform", entry.category);
    EXPECT_TRUE(std::regex_match(fields["MESSAGE"],
                                 std::regex(entry.pattern + R"( in \d+\.\d{3} ms(: .*)?)")))
        << fields["MESSAGE"];
    EXPECT_EQ(fields["PRIORITY"], entry.priority) << entry.pattern;
  }
}

}  // namespace
}  // namespace halvex::test
