// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <future>
#include <string>
#include <vector>

#include "Tools/HalvexTool/DumpOptions.h"
#include "Tools/HalvexTool/LogCollection.h"
#include "tests/tool/ToolTestSupport.h"

namespace halvex {
namespace {

using fake::FakePlatform;
using tooltest::CapturedConsole;
using tooltest::dumped;
using tooltest::failed;
using tooltest::kSnapshot;
using tooltest::ok;
using tooltest::propertyValue;
using tooltest::ServerScript;

constexpr const char* kScratch = "/var/wireless/Library/Logs/Halvex/DIAG.scratch";

struct Outcome {
  std::string out;
  std::string err;
  bool result;
};

// Runs the option the way the shell does, so the wait for its completion is included.
Outcome runLogdump(const std::string& option, std::vector<std::string> words = {}) {
  CapturedConsole console;
  auto logdump = tooltest::makeLogdump();
  const bool result = logdump->runOption(option, std::move(words));
  return {console.out.str(), console.err.str(), result};
}

struct Row {
  const char* what;
  ServerScript script;
  std::vector<std::string> words;
  std::string out;
  bool result;
};

void checkRows(const std::string& option, const std::vector<Row>& rows) {
  for (const Row& row : rows) {
    SCOPED_TRACE(std::string(option) + ": " + row.what);
    row.script.install();
    const Outcome outcome = runLogdump(option, row.words);
    EXPECT_EQ(outcome.out, row.out);
    EXPECT_EQ(outcome.err, "");
    EXPECT_EQ(outcome.result, row.result);
  }
}

ServerScript withDump(fake::Answer dump) {
  ServerScript script;
  script.dump = std::move(dump);
  return script;
}

TEST(LogCollection, TelephonyOutcomes) {
  const std::string success = "Telephony log collection: Success\n";
  checkRows(
      "tel",
      {
          {"compressed",
           withDump(dumped("T1")),
           {},
           success + "Path = " + kSnapshot + "T1.tar.gz\n",
           true},
          {"uncompressed",
           withDump(dumped("T1")),
           {"nocompress"},
           success + "Path = " + kSnapshot + "T1-*\n",
           true},
          {"reply without time stamp",
           withDump(ok(MessageValue::dict({}))),
           {},
           success + "Path = " + kSnapshot + ".tar.gz\n",
           true},
          {"reply not a dictionary", withDump(ok(MessageValue::string("T1"))), {}, success, true},
          {"null reply", withDump(ok(MessageValue::null())), {}, success, true},
          {"server gone",
           withDump(failed(kResultServerGone)),
           {},
           "Telephony log collection: Failed\n",
           true},
          {"server not running",
           withDump(failed(kResultServerNotRunning)),
           {},
           "Telephony log collection: Failed\n",
           true},
      });
}

TEST(LogCollection, CoredumpOutcomesAlwaysReportThePattern) {
  const std::string success = "Telephony log collection with Coredump: Success\n";
  checkRows("core",
            {
                {"compressed",
                 withDump(dumped("T2")),
                 {},
                 success + "Path = " + kSnapshot + "T2-*\n",
                 true},
                {"uncompressed",
                 withDump(dumped("T2")),
                 {"nocompress"},
                 success + "Path = " + kSnapshot + "T2-*\n",
                 true},
                {"reply not a dictionary", withDump(ok(MessageValue::int64(7))), {}, success, true},
                {"failed",
                 withDump(failed(-1)),
                 {},
                 "Telephony log collection with Coredump: Failed\n",
                 true},
            });
}

TEST(LogCollection, BasebandOutcomes) {
  ServerScript queryFails;
  queryFails.enabled = failed(kResultTimeout);
  ServerScript queryNotDict;
  queryNotDict.enabled = ok(MessageValue::string("1"));
  auto enabledAs = [](fake::Answer answer) {
    ServerScript script;
    script.enabled = std::move(answer);
    return script;
  };
  const std::string notEnabled = "Baseband logs are not enabled\n";
  const std::string running = "Baseband log collection: Success (Halvex running)\n";
  const std::string failedLine = "Baseband log collection: Failed\n";

  // The default fake device has vendor 1: folders end in "-bb-trace". The helper is not
  // configured, so a server that is down yields the scratch path here.
  checkRows("bb",
            {
                {"enabled query fails", queryFails, {}, failedLine, false},
                {"enabled reply not a dictionary", queryNotDict, {}, failedLine, true},
                {"enabled upper case", enabledAs(propertyValue("TRUE")), {}, notEnabled, true},
                {"enabled yes", enabledAs(propertyValue("yes")), {}, notEnabled, true},
                {"enabled 0", enabledAs(propertyValue("0")), {}, notEnabled, true},
                {"enabled missing", enabledAs(ok(MessageValue::dict({}))), {}, notEnabled, true},
                {"enabled true",
                 enabledAs(propertyValue("true")),
                 {},
                 running + "Path = " + kSnapshot + "T1.tar.gz\n",
                 true},
                {"compressed",
                 withDump(dumped("T3")),
                 {},
                 running + "Path = " + kSnapshot + "T3.tar.gz\n",
                 true},
                {"uncompressed",
                 withDump(dumped("T3")),
                 {"nocompress"},
                 running + "Path = " + kSnapshot + "T3-bb-trace\n",
                 true},
                {"dump reply not a dictionary",
                 withDump(ok(MessageValue::null())),
                 {},
                 running + "Path = " + kSnapshot + ".tar.gz\n",
                 true},
                {"server not running",
                 withDump(failed(kResultServerNotRunning)),
                 {},
                 "Baseband log collection: Success (Halvex not running)\nPath = " +
                     std::string(kScratch) + "\n",
                 true},
                {"other failure", withDump(failed(kResultServerGone)), {}, failedLine, true},
            });
}

// Each request as "command sync|async {keys}", so a row states every request in order.
std::string sent(const std::string& command, bool asynchronous, const MessageDict& request) {
  return command + (asynchronous ? " async " : " sync ") + describe(MessageValue::dict(request));
}

TEST(LogCollection, RequestsFollowTheWordsInKeyOrder) {
  ServerScript().install();
  auto str = [](const char* text) { return MessageValue::string(text); };
  auto flag = [](bool value) { return MessageValue::boolean(value); };
  const std::string modeQuery =
      sent(kCommandGetTraceProperty, false,
           *tooltest::dictOf({{kKeyTraceName, str(kTraceSystemLogs)},
                              {kKeyTracePropertyName, str(kKeyTraceMode)}})
                .asDict());
  const std::string enabledQuery =
      sent(kCommandGetTraceProperty, false,
           *tooltest::dictOf({{kKeyTraceName, str(kTraceBaseband)},
                              {kKeyTracePropertyName, str(kKeyTraceEnabled)}})
                .asDict());
  // The dump requests; a trailing confirmation key appears only with "nonui".
  auto dump = [&](std::vector<std::pair<std::string, MessageValue>> keys, bool confirmation,
                  bool asynchronous) {
    if (confirmation) {
      keys.emplace_back(kKeyTraceUserConfirmation, flag(false));
    }
    return sent(kCommandTraceDumpState, asynchronous, *tooltest::dictOf(keys).asDict());
  };
  auto tel = [&](const char* reason, bool compression, bool confirmation) {
    return dump({{kKeyTraceAction, str(kCollectTelephonyLogs)},
                 {kKeyTraceDumpStateReason, str(reason)},
                 {kKeyTraceDumpStatePerformCompression, flag(compression)}},
                confirmation, true);
  };
  auto core = [&](const char* reason, bool compression, bool confirmation) {
    return dump({{kKeyBasebandResetType, str(kBasebandResetTypeHard)},
                 {kKeyBasebandResetSubType, str(kBasebandResetSubTypeOtherErrors)},
                 {kKeyTraceAction, str(kCollectTelephonyLogsWithCoredump)},
                 {kKeyBasebandResetReason, str(reason)},
                 {kKeyTraceDumpStatePerformCompression, flag(compression)}},
                confirmation, true);
  };
  auto bb = [&](const char* reason, bool compression) {
    return dump({{kKeyTraceDumpStateReason, str(reason)},
                 {kKeyTraceAction, str(kCollectBasebandLogs)},
                 {kKeyTraceDumpStatePerformCompression, flag(compression)}},
                false, false);
  };
  struct RequestRow {
    std::string option;
    std::vector<std::string> words;
    std::vector<std::string> requests;
  };
  const RequestRow rows[] = {
      {"tel", {}, {modeQuery, tel(kDefaultReason, true, false)}},
      {"tel", {"nonui"}, {modeQuery, tel(kDefaultReason, true, true)}},
      {"tel", {"nocompress", "nonui", "crash1"}, {tel("[halvextool] crash1", false, true)}},
      {"tel", {"crash1", "nocompress"}, {modeQuery, tel("[halvextool] crash1", true, false)}},
      {"core", {}, {core(kDefaultReason, true, false)}},
      {"core", {"nonui", "why"}, {core("[halvextool] why", true, true)}},
      {"core", {"nocompress"}, {core(kDefaultReason, false, false)}},
      {"bb", {}, {enabledQuery, modeQuery, bb(kDefaultReason, true)}},
      {"bb", {"nonui", "nocompress", "modem"}, {enabledQuery, bb("[halvextool] modem", false)}},
  };
  for (const RequestRow& row : rows) {
    SCOPED_TRACE(row.option + " " + testing::PrintToString(row.words));
    const std::size_t before = FakePlatform::get().serverRequests().size();
    runLogdump(row.option, row.words);
    std::vector<std::string> requests;
    for (const fake::ServerRequest& request : tooltest::requestsSince(before)) {
      EXPECT_EQ(request.client, "halvextool");
      requests.push_back(sent(request.command, request.asynchronous, request.request));
    }
    EXPECT_EQ(requests, row.requests);
  }
}

TEST(LogCollection, SystemLogsMode3TurnsCompressionOff) {
  ServerScript absent;
  absent.mode = ok(MessageValue::dict({}));
  ServerScript queryFails;
  queryFails.mode = failed(kResultTimeout);
  ServerScript notDict;
  notDict.mode = ok(MessageValue::string("3"));
  auto modeAs = [](const char* text) {
    ServerScript script;
    script.mode = propertyValue(text);
    return script;
  };
  struct ModeRow {
    const char* what;
    ServerScript script;
    bool compression;
  };
  const ModeRow rows[] = {
      {"3", modeAs("3"), false},
      {"0x3", modeAs("0x3"), false},
      {"003", modeAs("003"), false},
      {"lite", modeAs("lite"), true},
      {"0", modeAs("0"), true},
      {"4", modeAs("4"), true},
      {"true", modeAs("true"), true},
      {"3 with a blank", modeAs("3 "), true},
      {"missing value", absent, true},
      {"failed query", queryFails, true},
      {"reply not a dictionary", notDict, true},
  };
  for (const ModeRow& row : rows) {
    SCOPED_TRACE(row.what);
    row.script.install();
    for (const std::string option : {"tel", "bb"}) {
      const std::size_t before = FakePlatform::get().serverRequests().size();
      const Outcome outcome = runLogdump(option);
      const auto requests = tooltest::requestsSince(before);
      ASSERT_FALSE(requests.empty());
      const MessageValue* sent = requests.back().request.get(kKeyTraceDumpStatePerformCompression);
      ASSERT_NE(sent, nullptr);
      EXPECT_EQ(*sent, MessageValue::boolean(row.compression)) << option;
      const std::string uncompressedEnd = option == "tel" ? "T1-*\n" : "T1-bb-trace\n";
      EXPECT_TRUE(outcome.out.ends_with(row.compression ? "T1.tar.gz\n" : uncompressedEnd))
          << option << ": " << outcome.out;
    }
  }
  // "core" sends what the user asked even in mode 3, without asking.
  modeAs("3").install();
  const std::size_t before = FakePlatform::get().serverRequests().size();
  runLogdump("core");
  const auto requests = tooltest::requestsSince(before);
  ASSERT_EQ(requests.size(), 1u);
  EXPECT_EQ(*requests[0].request.get(kKeyTraceDumpStatePerformCompression),
            MessageValue::boolean(true));
}

struct HelperRow {
  const char* what;
  bool internal;
  bool carrier;
  bool creatable;
  std::function<fake::Answer()> helper;  // empty: no responder, the helper fails
  std::string path;
  bool contacted;
};

TEST(LogCollection, ServerDownFallsBackToTheHelperOnInternalAndCarrierBuilds) {
  auto answers = [](fake::Answer answer) { return [answer] { return answer; }; };
  const std::string folder = std::string(kSnapshot) + "H9-bb-trace";
  const HelperRow rows[] = {
      {"internal build", true, false, true,
       answers(ok(tooltest::dictOf({{helper::kKeyTimestampString, MessageValue::string("H9")}}))),
       folder, true},
      {"carrier build", false, true, true,
       answers(ok(tooltest::dictOf({{helper::kKeyTimestampString, MessageValue::string("H9")}}))),
       folder, true},
      {"vendor-only build", false, false, true,
       answers(ok(tooltest::dictOf({{helper::kKeyTimestampString, MessageValue::string("H9")}}))),
       kScratch, false},
      {"helper fails", true, false, true, nullptr, kScratch, true},
      {"helper answers empty", true, false, true,
       answers(ok(tooltest::dictOf({{helper::kKeyTimestampString, MessageValue::string("")}}))),
       kScratch, true},
      {"helper answers no dictionary", true, false, true, answers(ok(MessageValue::string("H9"))),
       kScratch, true},
      {"no helper client", true, false, false, nullptr, kScratch, true},
  };
  ServerScript script;
  script.dump = failed(kResultServerNotRunning);
  script.install();
  auto& platform = FakePlatform::get();
  for (const HelperRow& row : rows) {
    SCOPED_TRACE(row.what);
    fake::Device device;
    device.internalBuild = row.internal;
    device.carrierBuild = row.carrier;
    device.vendorBuild = !row.internal && !row.carrier;
    platform.setDevice(device);
    platform.setHelperCreatable(row.creatable);
    if (row.helper) {
      platform.setHelperResponder([answer = row.helper](helper::TaskID, const std::string&,
                                                        const MessageDict&) { return answer(); });
    } else {
      platform.setHelperResponder(nullptr);
    }
    platform.clearCalls();
    const std::size_t before = platform.helperRequests().size();
    // Compression was asked for; it plays no part once the server is down.
    const Outcome outcome = runLogdump("bb");
    EXPECT_EQ(outcome.out,
              "Baseband log collection: Success (Halvex not running)\nPath = " + row.path + "\n");
    EXPECT_EQ(outcome.result, true);
    EXPECT_EQ(platform.count("HelperClient::create:logdump.helper"), row.contacted ? 1u : 0u);
    const auto helperRequests = platform.helperRequests();
    if (row.contacted && row.creatable) {
      ASSERT_EQ(helperRequests.size(), before + 1);
      const fake::HelperRequest& sent = helperRequests.back();
      EXPECT_EQ(sent.service, "logdump.helper");
      EXPECT_EQ(sent.task, helper::kTaskDiagnosticsCollection);
      EXPECT_EQ(sent.command, helper::kCommandVarniskStatus);
      EXPECT_EQ(sent.request,
                *tooltest::dictOf({{helper::kKeyTimeout, MessageValue::int64(1500)}}).asDict());
    } else {
      EXPECT_EQ(helperRequests.size(), before);
    }
  }
}

// The suffix is chosen once per process, so each vendor needs a test of its own.
void expectUncompressedBasebandFolder(int vendor, const std::string& suffix) {
  fake::Device device;
  device.radioVendor = vendor;
  FakePlatform::get().setDevice(device);
  withDump(dumped("T5")).install();
  EXPECT_EQ(runLogdump("bb", {"nocompress"}).out,
            "Baseband log collection: Success (Halvex running)\nPath = " + std::string(kSnapshot) +
                "T5" + suffix + "\n");
}

TEST(LogCollection, FolderSuffixOfVendor1) {
  expectUncompressedBasebandFolder(1, "-bb-trace");
}

TEST(LogCollection, FolderSuffixOfVendor2) {
  expectUncompressedBasebandFolder(2, "-diag");
}

TEST(LogCollection, FolderSuffixOfVendor0) {
  expectUncompressedBasebandFolder(0, "-diag");
}

// The shell's wait covers the completion: runOption must not return before it has run.
TEST(LogCollection, AsynchronousOptionsReturnOnlyAfterTheirCompletion) {
  ServerScript().install();
  CapturedConsole console;
  auto logdump = tooltest::makeLogdump();
  auto& platform = FakePlatform::get();
  for (const std::string option : {"tel", "core"}) {
    SCOPED_TRACE(option);
    console.out.str("");
    platform.holdCompletions(true);
    auto running = std::async(std::launch::async, [&] { return logdump->runOption(option, {}); });
    EXPECT_EQ(running.wait_for(std::chrono::milliseconds(200)), std::future_status::timeout);
    EXPECT_EQ(console.out.str(), "");
    platform.holdCompletions(false);
    EXPECT_EQ(platform.releaseCompletions(), 1u);
    EXPECT_TRUE(running.get());
    EXPECT_TRUE(console.out.str().find("Success\nPath = ") != std::string::npos)
        << console.out.str();
  }
}

}  // namespace
}  // namespace halvex
