// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <chrono>
#include <future>
#include <optional>
#include <string>
#include <vector>

#include "tests/tool/ToolTestSupport.h"

namespace halvex {
namespace {

using fake::FakePlatform;
using tooltest::failed;
using tooltest::kPath;
using tooltest::ok;
using tooltest::ServerScript;
using LogCollection = tooltest::FreshTool;

const std::string kScratch = "Path = /var/wireless/Library/Logs/Halvex/DIAG.scratch\n";

struct Outcome {
  std::string out;
  bool result;
};

// Runs the option the way the shell does, so the wait for its completion is included.
Outcome runLogdump(const std::vector<std::string>& words) {
  tooltest::CapturedConsole console;
  const bool result =
      tooltest::makeLogdump()->runOption(words[0], {words.begin() + 1, words.end()});
  EXPECT_EQ(console.err.str(), "");
  return {console.out.str(), result};
}

fake::Answer property(const std::string& text) {
  return tooltest::valued(kKeyTracePropertyValue, text);
}

TEST_F(LogCollection, OutcomesOfEveryCollection) {
  const std::string tel = "Telephony log collection: Success\n";
  const std::string core = "Telephony log collection with Coredump: Success\n";
  const std::string running = "Baseband log collection: Success (Halvex running)\n" + kPath;
  const std::string down = "Baseband log collection: Success (Halvex not running)\n";
  const std::string bbFailed = "Baseband log collection: Failed\n";
  const std::string off = "Baseband logs are not enabled\n";
  const fake::Answer empty = ok(MessageValue::dict({}));
  const ServerScript notRunning{.dump = failed(kResultServerNotRunning)};
  const auto helperSays = [](const char* timestamp) {
    return ok(tooltest::dictOf({{helper::kKeyTimestampString, MessageValue::string(timestamp)}}));
  };
  struct Row {
    std::vector<std::string> words;
    ServerScript script;
    std::string out;
    fake::Device device = {};                 // vendor 1: folders end in "-bb-trace"
    std::optional<fake::Answer> helper = {};  // none: the helper fails
    bool helperCreatable = true;
    bool result = true;
  };
  const Row rows[] = {
      {{"tel"}, {}, tel + kPath + "T1.tar.gz\n"},
      {{"tel", "nocompress"}, {}, tel + kPath + "T1-*\n"},
      {{"tel"}, {.dump = empty}, tel + kPath + ".tar.gz\n"},
      {{"tel"}, {.dump = ok(MessageValue::string("T1"))}, tel},
      {{"tel"}, notRunning, "Telephony log collection: Failed\n"},
      {{"core"}, {}, core + kPath + "T1-*\n"},
      {{"core", "nocompress"}, {}, core + kPath + "T1-*\n"},
      {{"core"}, {.dump = ok(MessageValue::int64(7))}, core},
      {{"core"}, {.dump = failed(-1)}, "Telephony log collection with Coredump: Failed\n"},
      {{"bb"}, {.enabled = failed(kResultTimeout)}, bbFailed, {}, {}, true, false},
      {{"bb"}, {.enabled = ok(MessageValue::string("1"))}, bbFailed},
      {{"bb"}, {.enabled = property("TRUE")}, off},
      {{"bb"}, {.enabled = empty}, off},
      {{"bb"}, {.enabled = property("true")}, running + "T1.tar.gz\n"},
      {{"bb", "nocompress"}, {}, running + "T1-bb-trace\n"},
      {{"bb"}, {.dump = ok(MessageValue::null())}, running + ".tar.gz\n"},
      {{"bb"}, {.dump = failed(kResultServerGone)}, bbFailed},
      // System-logs trace mode 3 turns compression off for "tel" and "bb".
      {{"tel"}, {.mode = property("3")}, tel + kPath + "T1-*\n"},
      {{"bb"}, {.mode = property("0x3")}, running + "T1-bb-trace\n"},
      {{"bb"}, {.mode = empty}, running + "T1.tar.gz\n"},
      {{"tel"}, {.mode = failed(kResultTimeout)}, tel + kPath + "T1.tar.gz\n"},
      {{"bb"}, {.mode = ok(MessageValue::string("3"))}, running + "T1.tar.gz\n"},
      // A server that is down leaves the logs where the helper says, asked on internal and
      // carrier builds only, or else in the scratch folder; compression plays no part.
      {{"bb"}, notRunning, down + kScratch},
      {{"bb"},
       notRunning,
       down + kPath + "H9-bb-trace\n",
       {.internalBuild = true},
       helperSays("H9")},
      {{"bb"},
       notRunning,
       down + kPath + "H9-bb-trace\n",
       {.carrierBuild = true},
       helperSays("H9")},
      {{"bb"}, notRunning, down + kScratch, {.vendorBuild = true}, helperSays("H9")},
      {{"bb"}, notRunning, down + kScratch, {.internalBuild = true}},
      {{"bb"}, notRunning, down + kScratch, {.internalBuild = true}, helperSays("")},
      {{"bb"}, notRunning, down + kScratch, {.internalBuild = true}, helperSays("H9"), false},
  };
  auto& platform = FakePlatform::get();
  for (const Row& row : rows) {
    SCOPED_TRACE(testing::Message() << "row " << &row - rows);
    row.script.install();
    platform.setDevice(row.device);
    platform.setHelperCreatable(row.helperCreatable);
    platform.setHelperResponder(nullptr);
    if (row.helper) {
      platform.setHelperResponder([answer = *row.helper](auto...) { return answer; });
    }
    const Outcome outcome = runLogdump(row.words);
    EXPECT_EQ(outcome.out, row.out);
    EXPECT_EQ(outcome.result, row.result);
  }
}

// Each request as "command sync|async {keys}", so that a row states every request in order.
TEST_F(LogCollection, RequestsFollowTheWordsInKeyOrder) {
  ServerScript().install();
  const std::string core =
      R"(TraceDumpState async {"BasebandResetType": "Hard", "BasebandResetSubType": )"
      R"("OtherErrors", "TraceAction": "CollectTelephonyLogsWithCoredump", )";
  const std::pair<std::vector<std::string>, std::vector<std::string>> rows[] = {
      {{"core", "nonui", "why"},
       {core + R"("BasebandResetReason": "[halvextool] why", )"
               R"("TraceDumpStatePerformCompression": true, "TraceUserConfirmation": false})"}},
      {{"core", "nocompress"},
       {core + R"("BasebandResetReason": "[halvextool] User triggered", )"
               R"("TraceDumpStatePerformCompression": false})"}},
      {{"bb", "nonui", "nocompress", "modem"},
       {R"(GetTraceProperty sync {"TraceName": "BasebandTrace", "TracePropertyName": "Enabled"})",
        R"(TraceDumpState sync {"TraceDumpStateReason": "[halvextool] modem", "TraceAction": )"
        R"("CollectBasebandLogs", "TraceDumpStatePerformCompression": false})"}},
  };
  for (const auto& [words, expected] : rows) {
    SCOPED_TRACE(testing::PrintToString(words));
    FakePlatform::get().clearRequests();
    runLogdump(words);
    std::vector<std::string> requests;
    for (const fake::ServerRequest& request : FakePlatform::get().serverRequests()) {
      EXPECT_EQ(request.client, "halvextool");
      requests.push_back(request.command + (request.asynchronous ? " async " : " sync ") +
                         describe(MessageValue::dict(request.request)));
    }
    EXPECT_EQ(requests, expected);
  }
}

// The shell's wait covers the completion: runOption must not return before it has run.
TEST_F(LogCollection, AsynchronousOptionsReturnOnlyAfterTheirCompletion) {
  ServerScript().install();
  tooltest::CapturedConsole console;
  const auto logdump = tooltest::makeLogdump();
  auto& platform = FakePlatform::get();
  for (const std::string option : {"tel", "core"}) {
    SCOPED_TRACE(option);
    console.out.str("");
    platform.holdCompletions(true);
    auto running = std::async(std::launch::async, [&] { return logdump->runOption(option, {}); });
    EXPECT_EQ(running.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);
    EXPECT_EQ(console.out.str(), "");
    platform.holdCompletions(false);
    EXPECT_EQ(platform.releaseCompletions(), 1U);
    EXPECT_TRUE(running.get());
    EXPECT_NE(console.out.str().find("Success\nPath = "), std::string::npos) << console.out.str();
  }
}

}  // namespace
}  // namespace halvex
