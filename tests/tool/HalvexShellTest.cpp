// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <chrono>
#include <set>
#include <string>
#include <tuple>
#include <vector>

#include "Tools/HalvexTool/HalvexShell.h"
#include "Tools/HalvexTool/ServerState.h"
#include "tests/support/FreshProcess.h"
#include "tests/tool/ToolTestSupport.h"

namespace halvex {
namespace {

using fake::FakePlatform;
using Calls = std::vector<std::string>;
using ToolStartup = tooltest::FreshTool;
using HalvexShellSession = tooltest::FreshTool;
using ServerState = tooltest::FreshTool;

TEST_F(ToolStartup, ChecksRadioThenDaemonsAskingOnlyWhatIsNeeded) {
  const std::string noRadio = "'halvextool' is not supported on this product.\n";
  const std::string refusal =
      "Telvane process is not running. Please run/load Telvane (or kelmond) and try again.\n";
  const Calls both = {"getRadioType", "isProcessRunning:Telvane", "getProductType"};
  Calls all = both;
  all.push_back("isProcessRunning:kelmond");
  // Radio, running processes, product, output, queries.
  const std::tuple<int, std::set<std::string>, int, std::string, Calls> rows[] = {
      {0, {"Telvane", "kelmond"}, 58, noRadio, {"getRadioType"}},
      {1, {"Telvane"}, 0, "", both},
      {2, {}, 58, "", both},
      {3, {"kelmond"}, 0, "", all},
      {1, {}, 57, refusal, all},
      {1, {"telvane", "kelmond2"}, 71, refusal, all},
  };
  for (const auto& [radio, running, product, out, queries] : rows) {
    SCOPED_TRACE(testing::Message() << "radio " << radio << " product " << product);
    FakePlatform::get().setDevice(
        {.radioType = radio, .productType = product, .runningProcesses = running});
    FakePlatform::get().clearCalls();
    tooltest::CapturedConsole console;
    EXPECT_EQ(runStartupChecks(), out.empty());
    EXPECT_EQ(console.out.str(), out);
    EXPECT_EQ(FakePlatform::get().calls(), queries);
  }
}

// The framework keeps its copy of the state handler, so the wait runs its full course; a state
// delivered during it counts for the first command. The root is named after the program.
TEST_F(HalvexShellSession, StartsTheServerSessionAndWaitsForItsState) {
  auto& platform = FakePlatform::get();
  platform.setDevice({.programName = "hx"});
  platform.setEventsOnDelivery(
      {{kEventServerStateChange,
        tooltest::dictOf({{kKeyServerState, MessageValue::string(kServerStateStarted)}})}});
  tooltest::ServerScript().install();
  tooltest::CapturedConsole console;
  console.in.str("logdump tel\n");
  const auto started = std::chrono::steady_clock::now();
  EXPECT_FALSE(HalvexShell().run({"hx"}));
  EXPECT_GE(std::chrono::steady_clock::now() - started, std::chrono::milliseconds(490));
  EXPECT_EQ(console.out.str(), "(/hx)>> Telephony log collection: Success\n" + tooltest::kPath +
                                   "T1.tar.gz\n(/hx)>> ");
  const Calls calls = platform.calls();
  ASSERT_GE(calls.size(), 5U);
  EXPECT_EQ(Calls(calls.begin(), calls.begin() + 5),
            (Calls{"CreateManager:halvextool", "RegisterEventHandler:ServerStateChange",
                   "EventsOff", "EventsOn", "getProgramName"}));
}

// Before any event: seen only in a process where nothing, not even a fixture, has sent one.
TEST(ServerStateAtStart, IsNotStarted) {
  test::inFreshProcess([] { EXPECT_FALSE(isServerStarted()); });
}

// Each row follows a "started" event, so every row shows that it overwrites the flag; "logdump"
// refuses all but "bb" while the flag is off.
TEST_F(ServerState, EveryEventOverwritesTheFlagThatLogdumpChecks) {
  const auto logdump = tooltest::makeLogdump();
  const auto state = [](MessageValue value) {
    return tooltest::dictOf({{kKeyServerState, std::move(value)}});
  };
  const MessageValue started = state(MessageValue::string(kServerStateStarted));
  const std::string text = kServerStateStarted;
  const MessageValue payloads[] = {
      started,
      state(MessageValue::string("Stopped")),
      state(MessageValue::boolean(true)),
      MessageValue::dict({}),
      MessageValue::null(),
      MessageValue::string(kServerStateStarted),
      state(MessageValue::string("started")),
      state(MessageValue::string(text + " ")),
      state(MessageValue::string(text.substr(0, 3))),
  };
  for (const MessageValue& payload : payloads) {
    SCOPED_TRACE(describe(payload));
    onServerStateChange(started, TaskGroup());
    onServerStateChange(payload, TaskGroup());
    const bool isStarted = payload == started;
    EXPECT_EQ(isServerStarted(), isStarted);
    for (const std::string option : {"tel", "core", "bb", "BB", "bb "}) {
      tooltest::CapturedConsole console;
      const bool allowed = isStarted || option == "bb";
      EXPECT_EQ(logdump->canExecute(option), allowed) << option;
      EXPECT_EQ(console.err.str(), allowed ? "" : tooltest::kRefusal) << option;
    }
  }
  EXPECT_TRUE(FakePlatform::get().serverRequests().empty());
}

}  // namespace
}  // namespace halvex
