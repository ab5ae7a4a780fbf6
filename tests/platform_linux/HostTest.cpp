// SPDX-License-Identifier: MIT
// The host backend beside the server's client: device queries, the helper client, the host's own
// facts (processes, boot arguments) and the system log, whose journal the test plays.
#include <gtest/gtest.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>
#include <map>
#include <optional>
#include <regex>
#include <set>
#include <string>
#include <thread>

#include "platform/DevicePropertyService.h"
#include "platform/DeviceQueries.h"
#include "platform/HelperClient.h"
#include "platform/ServerClient.h"
#include "platform/ServerProtocol.h"
#include "platform/SystemLog.h"
#include "platform/linux/testing/BusTesting.h"
#include "tests/platform_linux/Descriptors.h"
#include "tests/support/TestBus.h"

namespace halvex::test {
namespace {

namespace fs = std::filesystem;
using Fields = std::map<std::string, std::string>;

std::string askDevice() {
  return std::to_string(device::getRadioType()) + " " + std::to_string(device::getRadioVendor()) +
         " " + std::to_string(device::getProductType()) + " " +
         std::to_string(device::isInternalBuild()) + std::to_string(device::isCarrierBuild()) +
         std::to_string(device::isVendorBuild()) + std::to_string(device::isTraceAllowed());
}

// Only an answer is kept: a host whose device service was missing must not read as "no
// baseband" for good.
TEST(DeviceIdentityTest, KeptOnlyWhenAnswered) {
  PrivateBus bus;
  {
    SimProcess sim(bus, R"({"device": {"present": false}})");
    EXPECT_EQ(askDevice(), "0 0 0 0000");
  }
  SimProcess sim(bus, R"({"device": {"radio_type": 7, "radio_vendor": 1, "product_type": 58,
      "internal_build": false, "carrier_build": true, "vendor_build": true,
      "trace_allowed": false}})");
  EXPECT_EQ(askDevice(), "7 1 58 0110");
  EXPECT_EQ(askDevice(), "7 1 58 0110");
  ASSERT_EQ(sim.requestLog().size(), 1u);
  EXPECT_EQ(sim.requestLog()[0].dump(), R"({"method":"GetIdentity","service":"device"})");
}

// A device identity service of the test's own, on a thread of its own: it answers GetIdentity
// with the radio type it is set to and counts the questions; it can signal a change and give up
// its name, and it lets another take the name.
class DeviceService {
 public:
  explicit DeviceService(std::int64_t radioType, std::uint64_t nameFlags = 0)
      : radio(radioType), thread_([this, nameFlags](const std::stop_token& stop) {
          sd_bus* bus = nullptr;
          const bool ok =
              sd_bus_open_system(&bus) >= 0 &&
              sd_bus_add_object(bus, nullptr, "/org/halvex/Device", &answer, this) >= 0 &&
              sd_bus_request_name(bus, "org.halvex.Device",
                                  nameFlags | SD_BUS_NAME_ALLOW_REPLACEMENT) >= 0;
          ready_.set_value(ok);
          while (ok && !stop.stop_requested()) {
            if (signal_.exchange(false)) {
              sd_bus_emit_signal(bus, "/org/halvex/Device", "org.halvex.Device1", "IdentityChanged",
                                 "");
            }
            if (leave_.exchange(false)) {
              sd_bus_release_name(bus, "org.halvex.Device");
            }
            if (sd_bus_process(bus, nullptr) == 0) {
              sd_bus_wait(bus, 10'000);
            }
          }
          sd_bus_flush_close_unref(bus);
        }) {
    if (!ready_.get_future().get()) {
      throw std::runtime_error("the test's device service could not start");
    }
  }
  void signalChange() { signal_ = true; }
  void leave() { leave_ = true; }

  std::atomic<std::int64_t> radio;
  std::atomic<int> asked{0};

 private:
  static int answer(sd_bus_message* call, void* userdata, sd_bus_error*) {
    auto* self = static_cast<DeviceService*>(userdata);
    ++self->asked;
    return sd_bus_reply_method_return(call, "a{sv}", 1, "RadioType", "x", self->radio.load());
  }
  std::promise<bool> ready_;
  std::atomic<bool> signal_{false}, leave_{false};
  std::jthread thread_;
};

// True once the radio type asked reads expected; fails after a while.
bool radioBecomes(int expected) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  while (device::getRadioType() != expected) {
    if (std::chrono::steady_clock::now() > deadline) {
      return false;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  return true;
}

// The identity is kept between questions until the device service says it changed, leaves the
// bus, or another process takes its name, or the bus goes: then the next question asks again.
// With a run loop reading the connection and without one alike.
TEST(DeviceIdentityTest, KeptUntilTheServiceSaysOtherwise) {
  PrivateBus bus;
  std::optional<bus::RunLoopThreadForTesting> loop;
  for (const bool withLoop : {false, true}) {
    SCOPED_TRACE(withLoop ? "with a run loop" : "without a run loop");
    if (withLoop) {
      loop.emplace();
    }
    std::optional<DeviceService> first(std::in_place, 1), second;
    ASSERT_TRUE(radioBecomes(1));
    // The service's taking its name may be read while the first question is out, and then the
    // next one asks again: only from there is the answer kept.
    EXPECT_EQ(device::getRadioType(), 1);
    const int asked = first->asked;
    first->radio = 2;  // unsaid, so unseen
    EXPECT_EQ(device::getRadioType(), 1);
    EXPECT_EQ(first->asked, asked);
    first->signalChange();
    ASSERT_TRUE(radioBecomes(2));
    EXPECT_EQ(first->asked, asked + 1);
    second.emplace(3, SD_BUS_NAME_REPLACE_EXISTING);
    ASSERT_TRUE(radioBecomes(3));
    second->leave();
    ASSERT_TRUE(radioBecomes(0));
    second.reset();
    first.reset();
    {
      DeviceService beforeRestart(4);
      ASSERT_TRUE(radioBecomes(4));
      bus.restart();
    }
    DeviceService afterRestart(5);
    ASSERT_TRUE(radioBecomes(5));
    EXPECT_EQ(afterRestart.asked, 1);
  }
}

// The match rules the bus keeps for all its connections.
int matchRules(const PrivateBus& bus) {
  const RunResult stats = bus.busctl({"call", "org.freedesktop.DBus", "/org/freedesktop/DBus",
                                      "org.freedesktop.DBus.Debug.Stats", "GetStats"});
  std::smatch found;
  return std::regex_search(stats.out, found, std::regex(R"("MatchRules" u (\d+))"))
             ? std::stoi(found[1])
             : -1;
}

// Requests of every kind, events switched on, managers come and gone, process checks and bus
// restarts, over and over: the process's descriptors and the bus's match rules do not grow.
TEST(LeakTest, RepeatedWorkLeavesNothingBehind) {
  PrivateBus bus;
  bus::RunLoopThreadForTesting loop;
  const WorkQueue queue = WorkQueue::create("test.queue");
  std::set<std::pair<int, int>> seen;  // descriptors and match rules after each piece of work
  for (int round = 0; round < 3; ++round) {
    SimProcess sim(bus, "{}");
    for (int i = 0; i < 20; ++i) {
      auto manager = client::CreateManager("halvextool", queue);
      auto stated = std::make_shared<std::promise<void>>();
      client::RegisterEventHandler(
          manager, kEventServerStateChange,
          [stated](const MessageValue&, TaskGroup) { stated->set_value(); });
      client::EventsOn(manager);
      ASSERT_EQ(stated->get_future().wait_for(std::chrono::seconds(5)), std::future_status::ready);
      MessageValue reply;
      EXPECT_TRUE(client::PerformCommand(manager, kCommandTraceDumpState, {}, reply).ok());
      std::promise<Result> answered;
      client::PerformCommand(manager, kCommandTraceDumpState,
                             [&answered](Result result, const MessageValue&) {
                               answered.set_value(std::move(result));
                             },
                             {});
      EXPECT_TRUE(answered.get_future().get().ok());
      EXPECT_TRUE(HelperClient::create("logdump.helper", nullptr)
                      ->perform(helper::kTaskDiagnosticsCollection, helper::kCommandVarniskStatus,
                                {}, reply)
                      .ok());
      EXPECT_EQ(device::getRadioType(), 1);
      EXPECT_FALSE(device::isProcessRunning("halvex-absent"));
      manager.reset();
      // The first round opens what lasts (the journal's socket, say).
      if (round > 0) {
        seen.emplace(openDescriptors(), matchRules(bus));
      }
    }
    bus.restart();
  }
  ASSERT_EQ(seen.size(), 1u);
  EXPECT_GT(seen.begin()->second, 0);
}

// Only plain names name a service. The reply comes in as an empty dictionary and is left alone
// when the request fails.
TEST(HelperClientTest, PerformRunsTheCommandInTheService) {
  const std::string tooLong(300, 'h');
  for (const char* name : {static_cast<const char*>(nullptr), "", "two words", "tab\there",
                           "del\x7f", "\xc3\xa9t\xc3\xa9", tooLong.c_str()}) {
    EXPECT_EQ(HelperClient::create(name, nullptr), nullptr) << (name ? name : "(null)");
  }
  PrivateBus bus;
  MessageDict request;
  request.set(helper::kKeyTimeout, MessageValue::int64(1500));
  const struct {
    const char* scenario;
    const char* command;
    std::int32_t code;
    const char* reply;
  } cases[] = {
      {R"({"helper": {"timestamp": "H"}})", helper::kCommandVarniskStatus, 0,
       R"({"TimestampString": "H"})"},
      {R"({"helper": {"result": 9}})", helper::kCommandVarniskStatus, 9, "{}"},
      {"{}", "Bad\xff", kResultInvalidRequest, "{}"},
  };
  for (const auto& c : cases) {
    SimProcess sim(bus, c.scenario);
    auto helper = HelperClient::create("logdump.helper", nullptr);
    ASSERT_TRUE(helper);
    MessageValue reply = MessageValue::dict({});
    Result result = helper->perform(helper::kTaskDiagnosticsCollection, c.command, request, reply);
    EXPECT_EQ(result.code, c.code) << c.scenario << ": " << result.message;
    EXPECT_EQ(describe(reply), c.reply) << c.scenario;
    if (&c == &cases[0]) {
      EXPECT_EQ(sim.requestLog().at(0).dump(),
                R"({"client":"logdump.helper","command":"VarniskStatus","keys":[)"
                R"({"key":"Timeout","type":"int64","value":1500}],"method":"Perform",)"
                R"("service":"helper","task":4})");
    }
  }
}

// The simulator keeps the processes a scenario names, for as long as it runs.
TEST(ProcessCheckTest, FindsProcessesByTheirWholeName) {
  // Unique per test process, so that parallel tests cannot see each other's processes. The long
  // name is cut to 15 bytes in the kernel's view; the short one is not.
  const std::string pid = std::to_string(getpid());
  const std::string longName = "halvex-long-process-name-" + pid;
  const std::string shortName = "hx" + pid.substr(0, 8);
  EXPECT_FALSE(device::isProcessRunning(longName));
  PrivateBus bus;
  SimProcess sim(bus, R"({"processes": [")" + longName + R"(", ")" + shortName + R"("]})");
  EXPECT_TRUE(device::isProcessRunning(longName));
  EXPECT_TRUE(device::isProcessRunning(shortName));
  for (const std::string& wrong : {longName.substr(0, 15), longName + "x",
                                   shortName.substr(0, shortName.size() - 1), std::string()}) {
    EXPECT_FALSE(device::isProcessRunning(wrong)) << wrong;
  }
  // Even a simulator killed outright takes them along.
  sim.kill(SIGKILL);
  EXPECT_EQ(sim.waitExit().signal, SIGKILL);
  const auto running = [&] {
    return device::isProcessRunning(longName) || device::isProcessRunning(shortName);
  };
  for (const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(15);
       running() && std::chrono::steady_clock::now() < deadline;) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  EXPECT_FALSE(running());
  // An ended process keeps its name until it is reaped.
  const pid_t child = fork();
  if (child == 0) {
    prctl(PR_SET_NAME, shortName.c_str());
    _exit(0);
  }
  siginfo_t ended{};
  ASSERT_EQ(waitid(P_PID, static_cast<id_t>(child), &ended, WEXITED | WNOWAIT), 0);
  EXPECT_FALSE(device::isProcessRunning(shortName));
  waitpid(child, nullptr, 0);
  EXPECT_EQ(device::getProgramName(), "platform_linux_bus_test");
}

TEST(DevicePropertyTest, BootArgumentsAreTheKernelCommandLine) {
  std::string line;
  std::getline(std::ifstream("/proc/cmdline"), line);
  EXPECT_EQ(DevicePropertyService::create()->getPropertyMap()["boot-args"], line);

  // Whatever the file holds: no more than 64 KiB of it, without its trailing terminators.
  if (::geteuid() != 0 || ::unshare(CLONE_NEWNS) != 0 ||
      ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
    GTEST_SKIP() << "only root can stand a file in for /proc/cmdline";
  }
  TempDir dir;
  const fs::path fake = dir.path() / "cmdline";
  const std::pair<std::string, std::string> cases[] = {
      {std::string(70000, 'a'), std::string(std::size_t{64} * 1024, 'a')},
      {std::string("quiet x=1\n\0\n\0", 13), "quiet x=1"},
  };
  for (const auto& [content, expected] : cases) {
    std::ofstream(fake, std::ios::binary) << content;
    ASSERT_EQ(::mount(fake.c_str(), "/proc/cmdline", nullptr, MS_BIND, nullptr), 0)
        << std::strerror(errno);
    EXPECT_EQ(DevicePropertyService::create()->getPropertyMap()["boot-args"], expected);
    ::umount("/proc/cmdline");
  }
}

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
      if (fields["SUBSYSTEM"] == subsystem && fields["CATEGORY"] == category) {
        return fields;
      }
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
  if (!journal.problem().empty()) {
    GTEST_SKIP() << journal.problem();
  }
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
  server->write(context, LogLevel::kError, std::string(std::size_t{100} * 1024, 'x'));
  EXPECT_EQ(journal.receive("org.halvex.test", "journal-test")["MESSAGE"],
            std::string(std::size_t{16} * 1024, 'x'));

  // Before any thread starts: a bus that cannot be reached reads as no radio, and says why.
  ASSERT_EQ(setenv("DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nonexistent/bus", 1), 0);
  EXPECT_EQ(device::getRadioType(), 0);
  // So does a process check that cannot read /proc, which otherwise only says "not running".
  const bool exhaustible = *NoMoreDescriptors::impossible() == '\0';
  if (exhaustible) {
    NoMoreDescriptors exhausted;
    EXPECT_FALSE(device::isProcessRunning("Telvane"));
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
  const std::tuple<const char*, std::string, const char*> expected[] = {
      {"device",
       "GetIdentity: code 0xE020E001 in \\S+ ms: no system bus: No such file or directory", "4"},
      {"device", "process check for Telvane: cannot read /proc: Too many open files", "4"},
      {"device", "GetIdentity: code 0x00000000 in \\S+ ms", "7"},
      {"server", "PerformCommand TraceDumpState: code 0x00000000 in \\S+ ms", "7"},
      {"server", "PerformCommand Refused: code 0x00000007 in \\S+ ms(: .*)?", "4"},
      {"helper", "Perform logdump.helper VarniskStatus: code 0x00000000 in \\S+ ms", "7"},
  };
  for (const auto& [category, pattern, priority] : expected) {
    if (!exhaustible && pattern.starts_with("process check")) {
      continue;
    }
    auto fields = journal.receive("org.halvex.platform", category);
    EXPECT_TRUE(std::regex_match(fields["MESSAGE"], std::regex(pattern))) << fields["MESSAGE"];
    EXPECT_EQ(fields["PRIORITY"], priority) << pattern;
  }
}

}  // namespace
}  // namespace halvex::test
