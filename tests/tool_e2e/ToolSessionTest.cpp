// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <string>

#include "tests/tool_e2e/ToolRun.h"

namespace halvex::e2e {
namespace {

using nlohmann::json;

TEST(ToolSession, NoRadioRefusesToStart) {
  test::PrivateBus bus;
  // Without the device service the host has no radio.
  test::SimProcess sim(bus, R"({"device": {"present": false}, "processes": []})");
  const test::RunResult run = runTool({"logdump", "tel"});
  EXPECT_EQ(run.status.describe(), "exit 255");
  EXPECT_EQ(run.out, "'halvextool' is not supported on this product.\n");
  EXPECT_EQ(run.err, "");
  EXPECT_TRUE(commandRequests(sim).empty());
}

TEST(ToolSession, OneShotTelephonyWithReasonAndNonui) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, "{" + kExemptDevice + R"(,
    "server": {"commands": {"TraceDumpState": {"timestamp": "20261122-101500"}}}})");
  // One argument with a space stays one word: the reason.
  const test::RunResult run = runTool({"logdump", "tel", "nonui", "modem stuck"});
  EXPECT_EQ(run.status.describe(), "exit 0");
  EXPECT_EQ(run.out,
            "Telephony log collection: Success\nPath = " + kSnapshot + "20261122-101500.tar.gz\n");
  EXPECT_EQ(run.err, "");
  EXPECT_EQ(
      commandRequests(sim),
      (std::vector<json>{
          modeQuery(),
          serverRequest("TraceDumpState", {key("TraceAction", "CollectTelephonyLogs"),
                                           key("TraceDumpStateReason", "[halvextool] modem stuck"),
                                           key("TraceDumpStatePerformCompression", true),
                                           key("TraceUserConfirmation", false)}),
      }));
}

// A reason that is not UTF-8 cannot be sent as a string: the dump still goes, with a null reason.
TEST(ToolSession, AReasonTheBusCannotCarryTravelsAsNull) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, "{" + kExemptDevice + R"(,
    "server": {"commands": {"TraceDumpState": {"timestamp": "T2"}}}})");
  const test::RunResult run = runTool({"logdump", "tel", "nocompress", "caf\xe9"});
  EXPECT_EQ(run.status.describe(), "exit 0");
  EXPECT_EQ(run.out, "Telephony log collection: Success\nPath = " + kSnapshot + "T2-*\n");
  EXPECT_EQ(run.err, "");
  EXPECT_EQ(commandRequests(sim),
            (std::vector<json>{serverRequest(
                "TraceDumpState",
                {key("TraceAction", "CollectTelephonyLogs"),
                 {{"key", "TraceDumpStateReason"}, {"type", "null"}, {"value", nullptr}},
                 key("TraceDumpStatePerformCompression", false)})}));
}

TEST(ToolSession, OneShotCoredumpInSystemLogsMode3) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, "{" + kExemptDevice + R"(,
    "server": {"commands": {"TraceDumpState": {"timestamp": "T7"}},
               "properties": {"SystemLogs": {"Mode": {"value": "0x3"}}}}})");
  const test::RunResult run = runTool({"logdump", "core", "nocompress", "crash1", "nonui"});
  EXPECT_EQ(run.status.describe(), "exit 0");
  EXPECT_EQ(run.out,
            "Telephony log collection with Coredump: Success\nPath = " + kSnapshot + "T7-*\n");
  EXPECT_EQ(run.err, "");
  // No mode query, and "nonui" after the reason is not an option any more.
  EXPECT_EQ(commandRequests(sim),
            (std::vector<json>{serverRequest(
                "TraceDumpState",
                {key("BasebandResetType", "Hard"), key("BasebandResetSubType", "OtherErrors"),
                 key("TraceAction", "CollectTelephonyLogsWithCoredump"),
                 key("BasebandResetReason", "[halvextool] crash1"),
                 key("TraceDumpStatePerformCompression", false)})}));
}

TEST(ToolSession, ServerAbsentRefusesTelephonyAndFailsBaseband) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, "{" + kExemptDevice + R"(, "server": {"present": false}})");
  const test::RunResult tel = runTool({"logdump", "tel"});
  EXPECT_EQ(tel.status.describe(), "exit 1");
  EXPECT_EQ(tel.out, "");
  EXPECT_EQ(tel.err, kRefusal);
  // "bb" is never refused, but it cannot learn whether baseband logs are enabled.
  const test::RunResult bb = runTool({"logdump", "bb"});
  EXPECT_EQ(bb.status.describe(), "exit 1");
  EXPECT_EQ(bb.out, "Baseband log collection: Failed\n");
  EXPECT_EQ(bb.err, "");
  EXPECT_TRUE(commandRequests(sim).empty());
}

TEST(ToolSession, BasebandFallsBackToTheHelperWhenTheServerReportsItselfDown) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, "{" + kExemptDevice + R"(,
    "server": {"commands": {"TraceDumpState": {"result": -534716415}}},
    "helper": {"timestamp": "20261122-090000"}})");
  const test::RunResult run = runTool({"logdump", "bb"});
  EXPECT_EQ(run.status.describe(), "exit 0");
  // Vendor 2 folders end in "-diag"; compression plays no part without the server.
  EXPECT_EQ(run.out, "Baseband log collection: Success (Halvex not running)\nPath = " + kSnapshot +
                         "20261122-090000-diag\n");
  EXPECT_EQ(run.err, "");
  const auto requests = commandRequests(sim);
  ASSERT_EQ(requests.size(), 4u);
  EXPECT_EQ(requests[0], serverRequest("GetTraceProperty", {key("TraceName", "BasebandTrace"),
                                                            key("TracePropertyName", "Enabled")}));
  EXPECT_EQ(requests[1], modeQuery());
  EXPECT_EQ(requests[2]["command"], "TraceDumpState");
  EXPECT_EQ(requests[3],
            (json{{"service", "helper"},
                  {"method", "Perform"},
                  {"client", "logdump.helper"},
                  {"task", 4},
                  {"command", "VarniskStatus"},
                  {"keys", {{{"key", "Timeout"}, {"type", "int64"}, {"value", 1500}}}}}));
}

TEST(ToolSession, InteractiveSessionNavigatesAndCollects) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, "{" + kExemptDevice + R"(,
    "server": {"commands": {"TraceDumpState": {"timestamp": "T1"}}}})");
  const test::RunResult run =
      runTool({}, "\nlogdump tel nocompress\ncd logdump\nbb nocompress -- back\nhelp\nquit\n");
  EXPECT_EQ(run.status.describe(), "exit 0");
  const std::string inLogdump = "(/halvextool/logdump)>> ";
  EXPECT_EQ(
      run.out,
      kPrompt + kPrompt + "Telephony log collection: Success\nPath = " + kSnapshot + "T1-*\n" +
          kPrompt + inLogdump + "Baseband log collection: Success (Halvex running)\nPath = " +
          kSnapshot + "T1-diag\n" + kPrompt + "\nOptions for command '\x1b[32mhalvextool" +
          "\x1b[39m':\n\n\t" + std::string(9, ' ') + "logdump  -  [bb|core|tel]\n\n\t" +
          std::string(14, ' ') + "cd  -  <sub-command>\n\t" + std::string(12, ' ') + "help\n\t" +
          std::string(12, ' ') + "back\n\t" + std::string(12, ' ') + "quit\n\n" + kPrompt);
  EXPECT_EQ(run.err, "");
  const auto requests = commandRequests(sim);
  ASSERT_EQ(requests.size(), 3u);
  EXPECT_EQ(requests[0]["keys"][2], key("TraceDumpStatePerformCompression", false));
  EXPECT_EQ(requests[1]["command"], "GetTraceProperty");
  EXPECT_EQ(requests[2]["keys"][1], key("TraceAction", "CollectBasebandLogs"));
}

TEST(ToolSession, InteractiveEndOfInputFails) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, "{" + kExemptDevice + "}");
  const test::RunResult run = runTool({}, "logdump");
  EXPECT_EQ(run.status.describe(), "exit 1");
  // "logdump" alone shows its help and fails; end of input then ends the run without a newline.
  EXPECT_TRUE(run.out.starts_with(kPrompt + "\nOptions for command '\x1b[32mlogdump\x1b[39m':\n"))
      << run.out;
  EXPECT_TRUE(run.out.ends_with("quit\n\n" + kPrompt)) << run.out;
  EXPECT_EQ(run.err, "");
}

TEST(ToolSession, ServerThatAppearsLaterIsUsedOnceItReportsItsState) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, "{" + kExemptDevice + R"(,
    "server": {"present": false, "commands": {"TraceDumpState": {"timestamp": "T3"}}}})");
  InteractiveTool tool;
  tool.send("logdump tel\n");
  ASSERT_TRUE(tool.waitUntil([](auto&, const std::string& err) { return err == kRefusal; }))
      << tool.err();

  ASSERT_EQ(sim.callControl("SetServerPresent", "b", {"true"}).status.describe(), "exit 0");
  // The state event comes through the tool's own subscription; retry until it has landed.
  const std::string success =
      "Telephony log collection: Success\nPath = " + kSnapshot + "T3.tar.gz\n";
  bool collected = false;
  for (int attempt = 0; attempt < 50 && !collected; ++attempt) {
    const std::size_t refusals = occurrences(tool.err(), kRefusal);
    tool.send("logdump tel\n");
    ASSERT_TRUE(tool.waitUntil([&](const std::string& out, const std::string& err) {
      return out.ends_with(success + kPrompt) || occurrences(err, kRefusal) > refusals;
    }));
    collected = tool.out().ends_with(success + kPrompt);
    if (!collected) {
      std::this_thread::sleep_for(100ms);
    }
  }
  ASSERT_TRUE(collected) << tool.out() << tool.err();
  tool.send("quit\n");
  EXPECT_EQ(tool.finish().describe(), "exit 0");
  // Every refused attempt showed its prompt and nothing else.
  const std::size_t refusals = occurrences(tool.err(), kRefusal);
  std::string expected;
  for (std::size_t i = 0; i <= refusals; ++i) {
    expected += kPrompt;
  }
  EXPECT_EQ(tool.out(), expected + success + kPrompt);
  EXPECT_EQ(tool.err().size(), refusals * kRefusal.size());
}

TEST(ToolSession, ServerDyingDuringTelephonyCollectionFailsWithoutHanging) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, "{" + kExemptDevice + R"(,
    "server": {"commands": {"TraceDumpState": {"fault": "exit"}}}})");
  InteractiveTool tool;
  tool.send("logdump tel\n");
  ASSERT_TRUE(tool.waitUntil([](const std::string& out, auto&) {
    return out.ends_with("Telephony log collection: Failed\n" + kPrompt);
  })) << tool.out();
  EXPECT_TRUE(sim.waitExit().exited);
  tool.send("quit\n");
  EXPECT_EQ(tool.finish().describe(), "exit 0");
  EXPECT_EQ(tool.out(), kPrompt + "Telephony log collection: Failed\n" + kPrompt);
  EXPECT_EQ(tool.err(), "");
}

}  // namespace
}  // namespace halvex::e2e
