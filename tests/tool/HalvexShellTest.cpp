// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <streambuf>
#include <string>
#include <thread>
#include <vector>

#include "Tools/HalvexTool/HalvexShell.h"
#include "Tools/HalvexTool/ServerState.h"
#include "tests/tool/ToolTestSupport.h"

namespace halvex {
namespace {

using fake::FakePlatform;
using tooltest::CapturedConsole;
using tooltest::ServerScript;
using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

std::vector<std::string> startupQueries() {
  std::vector<std::string> queries;
  for (const std::string& call : FakePlatform::get().calls()) {
    if (call == "getRadioType" || call == "getProductType" ||
        call.starts_with("isProcessRunning")) {
      queries.push_back(call);
    }
  }
  return queries;
}

struct StartupRow {
  const char* what;
  int radio;
  std::set<std::string> running;
  int product;
  bool starts;
  std::vector<std::string> queries;
};

TEST(ToolStartup, ChecksRadioThenDaemonsAskingOnlyWhatIsNeeded) {
  const std::vector<std::string> telvaneAndExempt = {"getRadioType", "isProcessRunning:Telvane",
                                                     "getProductType"};
  std::vector<std::string> withKelmond = telvaneAndExempt;
  withKelmond.push_back("isProcessRunning:kelmond");
  const StartupRow rows[] = {
      {"no radio, daemons running", 0, {"Telvane", "kelmond"}, 58, false, {"getRadioType"}},
      {"Telvane running", 1, {"Telvane"}, 0, true, telvaneAndExempt},
      {"exempt product 58", 2, {}, 58, true, telvaneAndExempt},
      {"exempt product 70", 2, {}, 70, true, telvaneAndExempt},
      {"only kelmond", 3, {"kelmond"}, 0, true, withKelmond},
      {"nothing running", 1, {}, 0, false, withKelmond},
      {"nothing running, product 57", 1, {}, 57, false, withKelmond},
      {"names are exact", 1, {"telvane", "kelmond2"}, 71, false, withKelmond},
  };
  auto& platform = FakePlatform::get();
  for (const StartupRow& row : rows) {
    SCOPED_TRACE(row.what);
    fake::Device device;
    device.radioType = row.radio;
    device.runningProcesses = row.running;
    device.productType = row.product;
    platform.setDevice(device);
    platform.clearCalls();
    CapturedConsole console;
    std::string expected;
    if (row.starts) {
      EXPECT_TRUE(runStartupChecks());
    } else {
      // A refusal ends main before the shell thread exists.
      std::vector<std::string> arguments = {"halvextool", "logdump", "tel"};
      EXPECT_EQ(halvexMain(arguments), -1);
      EXPECT_EQ(platform.count("runMainLoop"), 0u);
      EXPECT_EQ(platform.count("CreateManager:halvextool"), 0u);
      expected = row.radio == 0 ? "'halvextool' is not supported on this product.\n"
                                : "Telvane process is not running. Please run/load Telvane (or "
                                  "kelmond) and try again.\n";
    }
    EXPECT_EQ(console.out.str(), expected);
    EXPECT_EQ(console.err.str(), "");
    EXPECT_EQ(startupQueries(), row.queries);
  }
}

TEST(ToolStartup, ArgumentsAreKeptWholeAndInOrder) {
  char program[] = "/usr/local/bin/halvextool";
  char spaced[] = "two words";
  char empty[] = "";
  char* argv[] = {program, spaced, empty, nullptr};
  EXPECT_EQ(makeArgumentList(3, argv),
            (std::vector<std::string>{"/usr/local/bin/halvextool", "two words", ""}));
  EXPECT_TRUE(makeArgumentList(0, argv).empty());
}

// The shell thread's entry ends the process with the shell's verdict. Death tests re-run this
// test in a child process, with the same fake set-up, so the shell runs there.
TEST(ToolStartupDeathTest, ShellThreadExitsWithTheRunsResult) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  ServerScript script;
  script.enabled = tooltest::failed(kResultTimeout);
  script.install();
  struct Row {
    std::vector<std::string> arguments;
    int status;
  };
  const Row rows[] = {
      {{"halvextool", "quit"}, 0},
      {{"halvextool", "logdump", "bb"}, 1},  // the enabled query fails
      {{"halvextool", "no-such-word"}, 1},
      {{"halvextool", "--"}, 0},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(testing::PrintToString(row.arguments));
    std::vector<std::string> arguments = row.arguments;
    EXPECT_EXIT(shellThreadMain(&arguments), testing::ExitedWithCode(row.status), "");
  }
}

TEST(ToolStartupDeathTest, MainRunsTheShellOnItsOwnThread) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  fake::Device device;
  device.runningProcesses = {"Telvane"};
  FakePlatform::get().setDevice(device);
  ServerScript script;
  script.enabled = tooltest::failed(kResultTimeout);
  script.install();
  // The fake run loop returns at once, so main's own return value is not what ends the process:
  // the shell thread does, while this thread idles.
  auto mainThenIdle = [](std::vector<std::string> arguments) {
    halvexMain(arguments);
    std::this_thread::sleep_for(std::chrono::seconds(30));
  };
  EXPECT_EXIT(mainThenIdle({"halvextool", "quit"}), testing::ExitedWithCode(0), "");
  EXPECT_EXIT(mainThenIdle({"halvextool", "logdump", "bb"}), testing::ExitedWithCode(1), "");
}

TEST(HalvexShell, RootIsNamedAfterTheProgramAfterTheStateWait) {
  auto& platform = FakePlatform::get();
  for (const std::string name : {"halvextool", "hx"}) {
    SCOPED_TRACE(name);
    fake::Device device;
    device.programName = name;
    platform.setDevice(device);
    platform.clearCalls();
    HalvexShell shell;
    const auto started = Clock::now();
    auto root = shell.createRootCommand();
    const auto took = Clock::now() - started;
    ASSERT_NE(root, nullptr);
    EXPECT_EQ(root->getPath(), "/" + name);
    ASSERT_NE(root->getSubCommand("logdump"), nullptr);
    EXPECT_EQ(root->getSubCommand("logdump")->getPath(), "/" + name + "/logdump");
    // The framework keeps its copy of the handler, so the wait runs its full course.
    EXPECT_GE(took, milliseconds(490));
    EXPECT_LT(took, milliseconds(3000));
    EXPECT_EQ(platform.calls(),
              (std::vector<std::string>{"CreateManager:halvextool",
                                        "RegisterEventHandler:ServerStateChange", "EventsOff",
                                        "EventsOn", "getProgramName"}));
  }
}

MessageValue stateEvent(const char* state) {
  return tooltest::dictOf({{kKeyServerState, MessageValue::string(state)}});
}

TEST(HalvexShell, StateDeliveredDuringTheWaitCountsForTheFirstCommand) {
  auto& platform = FakePlatform::get();
  platform.setEventsOnDelivery({{kEventServerStateChange, stateEvent(kServerStateStarted)}});
  ServerScript().install();
  CapturedConsole console;
  HalvexShell shell;
  const auto started = Clock::now();
  EXPECT_TRUE(shell.run({"halvextool", "logdump", "tel"}));
  EXPECT_GE(Clock::now() - started, milliseconds(490));
  EXPECT_EQ(console.out.str(), "Telephony log collection: Success\nPath = " +
                                   std::string(tooltest::kSnapshot) + "T1.tar.gz\n");
  EXPECT_EQ(console.err.str(), "");
}

TEST(HalvexShell, OneShotRefusalWithoutStateEvent) {
  CapturedConsole console;
  HalvexShell shell;
  EXPECT_FALSE(shell.run({"halvextool", "logdump", "core"}));
  EXPECT_EQ(console.out.str(), "");
  EXPECT_EQ(console.err.str(), "Server is not running. Please try after server starts.\n");
  EXPECT_TRUE(FakePlatform::get().serverRequests().empty());
}

// Feeds the shell one line at a time, running a step just before the shell reads each line, so
// that a test can act between two prompts.
class ScriptedInput : public std::streambuf {
 public:
  struct Line {
    std::function<void()> before;
    std::string text;
  };
  explicit ScriptedInput(std::vector<Line> lines) : lines_(std::move(lines)) {}

 protected:
  int_type underflow() override {
    if (gptr() != egptr()) {
      return traits_type::to_int_type(*gptr());
    }
    if (next_ == lines_.size()) {
      return traits_type::eof();
    }
    Line& line = lines_[next_++];
    if (line.before) {
      line.before();
    }
    current_ = line.text + "\n";
    setg(current_.data(), current_.data(), current_.data() + current_.size());
    return traits_type::to_int_type(*gptr());
  }

 private:
  std::vector<Line> lines_;
  std::size_t next_ = 0;
  std::string current_;
};

// Delivers a state event and waits until the queue has handled it.
std::function<void()> serverBecomes(const char* state, bool started) {
  return [state, started] {
    ASSERT_EQ(FakePlatform::get().deliverEvent(kEventServerStateChange, stateEvent(state)), 1u);
    const auto deadline = Clock::now() + std::chrono::seconds(5);
    while (isServerStarted() != started && Clock::now() < deadline) {
      std::this_thread::sleep_for(milliseconds(1));
    }
    ASSERT_EQ(isServerStarted(), started);
  };
}

TEST(HalvexShell, LaterStateEventsStillMoveTheFlag) {
  ServerScript().install();
  ScriptedInput script({
      {nullptr, "logdump tel"},
      {serverBecomes(kServerStateStarted, true), "logdump tel"},
      {serverBecomes("Stopping", false), "logdump core"},
  });
  std::istream input(&script);
  std::ostringstream out;
  std::ostringstream err;
  ScopedConsoleForTesting console(input, out, err);

  HalvexShell shell;
  EXPECT_FALSE(shell.run({"halvextool"}));  // input ends
  const std::string prompt = "(/halvextool)>> ";
  EXPECT_EQ(out.str(), prompt + prompt + "Telephony log collection: Success\nPath = " +
                           tooltest::kSnapshot + "T1.tar.gz\n" + prompt + prompt);
  const std::string refusal = "Server is not running. Please try after server starts.\n";
  EXPECT_EQ(err.str(), refusal + refusal);
}

}  // namespace
}  // namespace halvex
