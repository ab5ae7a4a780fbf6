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
#include <cstring>
#include <filesystem>
#include <map>
#include <regex>
#include <string>

#include "platform/DeviceQueries.h"
#include "platform/HelperClient.h"
#include "platform/ServerClient.h"
#include "platform/SystemLog.h"
#include "platform/linux/testing/BusTesting.h"
#include "tests/support/TestBus.h"

namespace halvex::test {
namespace {

namespace fs = std::filesystem;
using Fields = std::map<std::string, std::string>;

// Binds the socket the journal would, in a mount namespace of its own over a fresh /run, so that
// a journal running on the machine is neither disturbed nor in the way. Only root can, and before
// any thread starts: children and threads started later share the namespace.
class FakeJournal {
 public:
  FakeJournal() {
    sockaddr_un address{AF_UNIX, "/run/systemd/journal/socket"};
    std::error_code error;
    if (::geteuid() != 0) {
      problem_ = "only root can stand in for the journal";
    } else if (::unshare(CLONE_NEWNS) != 0 ||
               ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
               ::mount("tmpfs", "/run", "tmpfs", 0, "mode=0755") != 0 ||
               !fs::create_directories("/run/systemd/journal", error) ||
               ::bind(fd_, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
      problem_ = std::string("cannot stand in for the journal: ") + std::strerror(errno);
    }
  }
  ~FakeJournal() { ::close(fd_); }

  // Empty when the journal could be stood in for.
  const std::string& problem() const { return problem_; }

  // The next entry from subsystem and category, skipping everything else that is logged
  // meanwhile; an empty map when none came within five seconds. Fields are "KEY=value\n": the
  // tests log nothing that the protocol would have to send in its binary form.
  Fields receive(const std::string& subsystem, const std::string& category) {
    std::string data(1 << 20, '\0');
    pollfd ready{fd_, POLLIN, 0};
    while (::poll(&ready, 1, 5000) == 1) {
      const ssize_t got = ::recv(fd_, data.data(), data.size(), 0);
      Fields fields;
      for (std::size_t at = 0, end; got > 0 && at < static_cast<std::size_t>(got); at = end + 1) {
        end = data.find('\n', at);
        const std::size_t equals = data.find('=', at);
        fields[data.substr(at, equals - at)] = data.substr(equals + 1, end - equals - 1);
      }
      if (fields["SUBSYSTEM"] == subsystem && fields["CATEGORY"] == category)
        return fields;
    }
    return {};
  }

 private:
  int fd_ = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  std::string problem_;
};

// Entries carry message, priority, subsystem and category, and every request the platform makes
// leaves one: what it was, its code and how long it took; failures at warning priority, successes
// at debug.
TEST(SystemLogTest, EveryRequestIsLoggedWithItsOutcome) {
  FakeJournal journal;
  if (!journal.problem().empty())
    GTEST_SKIP() << journal.problem();
  auto server = LogServer::create();
  const LogContext context("org.halvex.test", "journal-test");
  const std::pair<LogLevel, std::string> rows[] = {
      {LogLevel::kError, "dump failed: 100%"},
      {LogLevel::kWarning, std::string("with\0nul", 8)},
      {LogLevel::kNotice, "notice"},
      {LogLevel::kInfo, "info"},
      {LogLevel::kDebug, ""},
  };
  int nextPriority = 3;
  for (const auto& [level, message] : rows) {
    server->write(context, level, message);
    Fields fields = journal.receive("org.halvex.test", "journal-test");
    EXPECT_EQ(fields["MESSAGE"], message);
    EXPECT_EQ(fields["PRIORITY"], std::to_string(nextPriority++));
    // The journal library names the program itself.
    EXPECT_EQ(fields["SYSLOG_IDENTIFIER"], program_invocation_short_name);
  }
  // A runaway message is cut, not sent whole.
  server->write(context, LogLevel::kError, std::string(100 * 1024, 'x'));
  EXPECT_EQ(journal.receive("org.halvex.test", "journal-test")["MESSAGE"],
            std::string(16 * 1024, 'x'));

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
  const std::tuple<const char*, std::string, const char*> expected[] = {
      {"device", "GetIdentity: code 0x00000000", "7"},
      {"server", "PerformCommand TraceDumpState: code 0x00000000", "7"},
      {"server", "PerformCommand Refused: code 0x00000007", "4"},
      {"helper", "Perform logdump.helper VarniskStatus: code 0x00000000", "7"},
  };
  for (const auto& [category, pattern, priority] : expected) {
    auto fields = journal.receive("org.halvex.platform", category);
    EXPECT_TRUE(
        std::regex_match(fields["MESSAGE"], std::regex(pattern + R"( in \d+\.\d{3} ms(: .*)?)")))
        << fields["MESSAGE"];
    EXPECT_EQ(fields["PRIORITY"], priority) << pattern;
  }
}

}  // namespace
}  // namespace halvex::test
