// SPDX-License-Identifier: MIT
// The real halvextool against halvex-sim on a private bus, each run compared whole: exit status,
// both output streams and the requests the simulated device received.
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <termios.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <tuple>
#include <vector>

#include "tests/support/Pty.h"
#include "tests/support/TestBus.h"

namespace halvex::e2e {
namespace {

const std::string kPrompt = "(/halvextool)>> ";
const std::string kPath = "Path = /var/wireless/Library/Logs/Faultkeep/Baseband/log-bb-";
const std::string kTel = "Telephony log collection: ";
const std::string kModeQuery =
    "halvextool GetTraceProperty TraceName='SystemLogs' TracePropertyName='Mode'";
const std::string kTelDump =
    "halvextool TraceDumpState TraceAction='CollectTelephonyLogs' "
    "TraceDumpStateReason='[halvextool] User triggered' TraceDumpStatePerformCompression=true";

std::vector<std::string> commandRequests(const test::SimProcess& sim) {
  std::vector<std::string> lines;
  for (const nlohmann::json& entry : sim.requestLog()) {
    if (!entry.contains("command")) {
      continue;  // subscriptions and device identity queries
    }
    std::string line = entry.value("client", "") + " " + entry.value("command", "");
    line += entry.contains("task") ? " task=" + entry["task"].dump() : "";
    for (const nlohmann::json& key : entry["keys"]) {
      const nlohmann::json& value = key["value"];
      line += " " + key.value("key", "") + "=" +
              (value.is_string() ? "'" + value.get<std::string>() + "'" : value.dump());
    }
    lines.push_back(line);
  }
  return lines;
}

// Runs the tool with words, or interactively (no words) reading input to its end, on a device
// that plays scenario, and compares everything. Requests read "client command key=value ...",
// strings in single quotes.
void runSession(const char* what, const std::string& scenario, std::vector<std::string> words,
                const std::string& input, const std::string& status, const std::string& out,
                const std::string& err, const std::vector<std::string>& requests) {
  SCOPED_TRACE(what);
  test::PrivateBus bus;
  test::SimProcess sim(bus, scenario);
  words.insert(words.begin(), HALVEXTOOL_BINARY);
  const test::RunResult run = test::runProcess({.args = words, .env = {}, .input = input});
  EXPECT_EQ(run.status.describe(), status);
  EXPECT_EQ(run.out, out);
  EXPECT_EQ(run.err, err);
  EXPECT_EQ(commandRequests(sim), requests);
}

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

std::string bbDump(const char* compression, const char* reason = "User triggered") {
  return std::string("halvextool TraceDumpState TraceDumpStateReason='[halvextool] ") + reason +
         "' TraceAction='CollectBasebandLogs' TraceDumpStatePerformCompression=" + compression;
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
  runSession("no server, telephony", exempt(R"({"present": false})"), {"logdump", "tel"}, "",
             "exit 1", "", kRefusal, {});
  // An argument with a space stays one word.
  runSession("helper fallback", exempt(R"({"commands": {"TraceDumpState": {"result": -534716415}}},
                                          "helper": {"timestamp": "H9"})"),
             {"logdump", "bb", "modem stuck"}, "", "exit 0",
             "Baseband log collection: Success (Halvex not running)\n" + kPath + "H9-diag\n", "",
             {kEnabledQuery, kModeQuery, bbDump("true", "modem stuck"),
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
      "state": {"payload": {"ServerState": "Started"}, "when": "after", "after_ms": 1000},
      "properties": {"BasebandTrace": {"Enabled": {"value": "1", "delay_ms": 2000}}}})"),
             {}, "logdump tel\nlogdump bb\nlogdump tel\nquit\n", "exit 0",
             kPrompt + kPrompt + kRunning + kPath + "T3.tar.gz\n" + kPrompt + kTel + "Success\n" +
                 kPath + "T3.tar.gz\n" + kPrompt,
             kRefusal, {kEnabledQuery, kModeQuery, bbDump("true"), kModeQuery, kTelDump});
  runSession("server dies during a dump",
             exempt(R"({"commands": {"TraceDumpState": {"fault": "exit"}}})"), {},
             "logdump tel\nquit\n", "exit 0", kPrompt + kTel + "Failed\n" + kPrompt, "",
             {kModeQuery, kTelDump});
}

TEST(ToolSession, OutputThatCannotBeWrittenFailsTheRun) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, stamped("T"));
  const test::TempDir dir;
  // The last runs into a file size limit after a few hundred bytes written well, mid-help.
  const std::string limited = "trap '' XFSZ; ulimit -f 1; exec \"$0\" >" +
                              (dir.path() / "out").string() + " <<EOF\n" + std::string(40, 'x') +
                              "\n" + std::string(20, 'x') + "\nEOF";
  for (const auto& [shell, reason] :
       {std::pair{std::string("exec \"$0\" logdump tel >/dev/full"), "No space left on device"},
        {"exec \"$0\" logdump tel >&-", "Bad file descriptor"},
        {limited, "File too large"}}) {
    SCOPED_TRACE(shell);
    const test::RunResult run = test::runProcess(
        {.args = {"/bin/sh", "-c", shell, HALVEXTOOL_BINARY}, .env = {}, .input = ""});
    EXPECT_EQ(run.status.describe(), "exit 1");
    EXPECT_EQ(run.err, std::string("halvextool: write error: ") + reason + "\n");
  }
}

auto terminalModes(int fd) {
  termios t{};
  EXPECT_EQ(::tcgetattr(fd, &t), 0);
  return std::make_tuple(t.c_iflag, t.c_oflag, t.c_cflag, t.c_lflag,
                         std::vector<cc_t>(std::begin(t.c_cc), std::end(t.c_cc)));
}

// What a user at a terminal does: complete, run, recall, edit, run again, leave with Ctrl-D.
TEST(ToolTerminal, EditsLinesAndLeavesTheTerminalAsItWas) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, stamped("T"));
  const test::Pty pty(100);
  const auto before = terminalModes(pty.slave);
  const pid_t tool =
      test::spawnChild({HALVEXTOOL_BINARY}, {}, {{pty.slave, 0}, {pty.slave, 1}, {pty.slave, 2}});
  pty.readUntil(kPrompt);
  pty.type("lo\tt\tab\r");
  EXPECT_NE(pty.readUntil(kTel + "Success").find(kPrompt + "logdump tel ab\x1b[K"),
            std::string::npos);
  pty.readUntil(kPrompt);
  pty.type("\x1b[A\x1b[D\x7f\r");
  EXPECT_NE(pty.readUntil(kTel + "Success").find(kPrompt + "logdump tel b\x1b[K"),
            std::string::npos);
  pty.readUntil(kPrompt);
  pty.type("\x04");
  EXPECT_EQ(test::waitChild(tool, std::chrono::seconds(10)).describe(), "exit 1");
  EXPECT_EQ(terminalModes(pty.slave), before);
  const std::vector<std::string> requests = commandRequests(sim);
  ASSERT_EQ(requests.size(), 4u);
  EXPECT_NE(requests[1].find("Reason='[halvextool] ab'"), std::string::npos);
  EXPECT_NE(requests[3].find("Reason='[halvextool] b'"), std::string::npos);
}

// With only its input on a terminal, the tool reads and prints exactly as it does from a pipe.
TEST(ToolTerminal, OutputElsewhereGetsThePlainShell) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, stamped("T"));
  const test::Pty pty(80);
  const int out = ::memfd_create("out", 0);
  const pid_t tool = test::spawnChild({HALVEXTOOL_BINARY}, {}, {{pty.slave, 0}, {out, 1}});
  pty.type("logdump tel\rquit\r");
  EXPECT_EQ(test::waitChild(tool, std::chrono::seconds(10)).describe(), "exit 0");
  std::string printed(4096, '\0');
  printed.resize(static_cast<std::size_t>(
      std::max<ssize_t>(::pread(out, printed.data(), printed.size(), 0), 0)));
  ::close(out);
  EXPECT_EQ(printed, kPrompt + kTel + "Success\n" + kPath + "T.tar.gz\n" + kPrompt);
}

// The device's build changes while a session runs: the next baseband collection, which asks the
// helper only on an internal or carrier build, follows it.
TEST(ToolTerminal, TheHelperFallbackFollowsTheBuildChangingMidSession) {
  test::PrivateBus bus;
  test::SimProcess sim(bus, exempt(R"({"commands": {"TraceDumpState": {"result": -534716415}}},
                                       "helper": {"timestamp": "H9"})"));
  const test::Pty pty(200);
  const pid_t tool =
      test::spawnChild({HALVEXTOOL_BINARY}, {}, {{pty.slave, 0}, {pty.slave, 1}, {pty.slave, 2}});
  pty.readUntil(kPrompt);
  const auto collect = [&pty] {
    pty.type("logdump bb nocompress\r");
    pty.readUntil("Baseband log collection: ");
    return pty.readUntil(kPrompt);
  };
  const std::string helped = kPath + "H9-diag";
  const std::string scratch = "Path = /var/wireless/Library/Logs/Halvex/DIAG.scratch";
  EXPECT_NE(collect().find(helped), std::string::npos);
  const auto setBuild = [&sim](const char* key, const char* value) {
    return sim.callControl("SetIdentity", "a{sv}", {"1", key, "b", value}).status.code;
  };
  ASSERT_EQ(setBuild("InternalBuild", "false"), 0);
  EXPECT_NE(collect().find(scratch), std::string::npos);
  ASSERT_EQ(setBuild("CarrierBuild", "true"), 0);
  EXPECT_NE(collect().find(helped), std::string::npos);
  pty.type("\x04");
  EXPECT_EQ(test::waitChild(tool, std::chrono::seconds(10)).describe(), "exit 1");
  const std::vector<std::string> requests = commandRequests(sim);
  EXPECT_EQ(std::count(requests.begin(), requests.end(),
                       "logdump.helper VarniskStatus task=4 Timeout=1500"),
            2);
}

// The simulator keeps processes with the names it is given alive while it runs.
TEST(DaemonCheck, EitherDaemonByItsExactNameLetsTheToolStart) {
  if (::getpid() != 1) {
    GTEST_SKIP() << "needs a pid namespace of its own, where no other process can be named like a "
                    "daemon: ctest run as root makes one (tests/own-pid-namespace.sh)";
  }
  const auto product57 = [](const std::string& processes) {
    return R"({"device": {"product_type": 57}, "processes": )" + processes +
           R"(, "server": {"commands": {"TraceDumpState": {"timestamp": "T"}}}})";
  };
  const std::string started = kTel + "Success\n" + kPath + "T.tar.gz\n";
  runSession(
      "neither", product57(R"(["telvane", "Kelmond", "Telvane2"])"), {"logdump", "tel"}, "",
      "exit 255",
      "Telvane process is not running. Please run/load Telvane (or kelmond) and try again.\n", "",
      {});
  for (const char* daemon : {"Telvane", "kelmond"}) {
    runSession(daemon, product57(std::string("[\"") + daemon + "\"]"), {"logdump", "tel"}, "",
               "exit 0", started, "", {kModeQuery, kTelDump});
  }
}

}  // namespace
}  // namespace halvex::e2e
