// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <string>

#include "tests/tool_e2e/ToolRun.h"

namespace halvex::e2e {
namespace {

// Product 58 needs neither daemon, so these runs do not depend on the process table.
std::string exempt(const std::string& server) {
  return R"({"device": {"product_type": 58}, "server": )" + server + "}";
}

std::string stamped(const std::string& timestamp) {
  return exempt(R"({"commands": {"TraceDumpState": {"timestamp": ")" + timestamp + R"("}}})");
}

const std::string kEnabledQuery =
    "halvextool GetTraceProperty TraceName='BasebandTrace' TracePropertyName='Enabled'";
const std::string kRunning = "Baseband log collection: Success (Halvex running)\n";
const std::string kRefusal = "Server is not running. Please try after server starts.\n";

std::string bbDump(const char* compression) {
  return std::string("halvextool TraceDumpState TraceDumpStateReason='[halvextool] User ") +
         "triggered' TraceAction='CollectBasebandLogs' TraceDumpStatePerformCompression=" +
         compression;
}

TEST(ToolSession, OneShotRuns) {
  runSession("no radio", R"({"device": {"present": false}})", {"logdump", "tel"}, "", "exit 255",
             "'halvextool' is not supported on this product.\n", "", {});
  // An argument that is not UTF-8 travels as null.
  runSession("unsendable reason", stamped("T2"), {"logdump", "tel", "nonui", "caf\xe9"}, "",
             "exit 0", kTel + "Success\n" + kPath + "T2.tar.gz\n", "",
             {kModeQuery,
              "halvextool TraceDumpState TraceAction='CollectTelephonyLogs' "
              "TraceDumpStateReason=null TraceDumpStatePerformCompression=true "
              "TraceUserConfirmation=false"});
  // An argument with a space stays one word.
  runSession("coredump", stamped("T7"), {"logdump", "core", "nocompress", "crash 1", "nonui"}, "",
             "exit 0", "Telephony log collection with Coredump: Success\n" + kPath + "T7-*\n", "",
             {"halvextool TraceDumpState BasebandResetType='Hard' "
              "BasebandResetSubType='OtherErrors' TraceAction='CollectTelephonyLogsWithCoredump' "
              "BasebandResetReason='[halvextool] crash 1' TraceDumpStatePerformCompression=false"});
  runSession("no server, telephony", exempt(R"({"present": false})"), {"logdump", "tel"}, "",
             "exit 1", "", kRefusal, {});
  runSession("no server, baseband", exempt(R"({"present": false})"), {"logdump", "bb"}, "",
             "exit 1", "Baseband log collection: Failed\n", "", {});
  runSession("helper fallback", exempt(R"({"commands": {"TraceDumpState": {"result": -534716415}}},
                                          "helper": {"timestamp": "H9"})"),
             {"logdump", "bb"}, "", "exit 0",
             "Baseband log collection: Success (Halvex not running)\n" + kPath + "H9-diag\n", "",
             {kEnabledQuery, kModeQuery, bbDump("true"),
              "logdump.helper VarniskStatus task=4 Timeout=1500"});
}

TEST(ToolSession, InteractiveRuns) {
  const std::string inLogdump = "(/halvextool/logdump)>> ";
  runSession("navigation", stamped("T1"), {},
             "\nlogdump tel nocompress\ncd logdump\nhelp\nbb nocompress -- back\nquit\n", "exit 0",
             kPrompt + kPrompt + kTel + "Success\n" + kPath + "T1-*\n" + kPrompt + inLogdump +
                 "\nOptions for command '\x1b[32mlogdump\x1b[39m':\n\n"
                 "\t              bb  -  [nocompress] <reason> collect baseband logs only\n\n"
                 "\t            core  -  [nocompress] [nonui] <reason> collect telephony logs "
                 "with coredump\n\n"
                 "\t             tel  -  [nocompress] [nonui] <reason> collect telephony logs\n\n"
                 "\t              cd  -  <sub-command>\n\t            help\n\t            back\n"
                 "\t            quit\n\n" +
                 inLogdump + kRunning + kPath + "T1-diag\n" + kPrompt,
             "",
             {"halvextool TraceDumpState TraceAction='CollectTelephonyLogs' TraceDumpStateReason="
              "'[halvextool] User triggered' TraceDumpStatePerformCompression=false",
              kEnabledQuery, bbDump("false")});
  // The server takes its name during the start-up wait and reports its state after it, while
  // the baseband query is kept waiting: the second "tel" finds the server started.
  runSession("state after the wait",
             exempt(R"({"appear_after_ms": 300, "commands": {"TraceDumpState": {"timestamp": "T3"}},
                        "state": {"payload": {"ServerState": "Started"}, "when": "after",
                                  "after_ms": 1000},
                        "properties": {"BasebandTrace": {"Enabled": {"value": "1",
                                                                     "delay_ms": 2000}}}})"),
             {}, "logdump tel\nlogdump bb\nlogdump tel\nquit\n", "exit 0",
             kPrompt + kPrompt + kRunning + kPath + "T3.tar.gz\n" + kPrompt + kTel + "Success\n" +
                 kPath + "T3.tar.gz\n" + kPrompt,
             kRefusal, {kEnabledQuery, kModeQuery, bbDump("true"), kModeQuery, kTelDump});
  runSession("server dies during a dump",
             exempt(R"({"commands": {"TraceDumpState": {"fault": "exit"}}})"), {},
             "logdump tel\nquit\n", "exit 0", kPrompt + kTel + "Failed\n" + kPrompt, "",
             {kModeQuery, kTelDump});
}

}  // namespace
}  // namespace halvex::e2e
