// SPDX-License-Identifier: MIT
// halvex-sim on a private bus, seen through busctl. The backend tests, which run against it, check
// its request log, its timing, its faults and the processes it keeps.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <regex>
#include <set>
#include <sstream>
#include <thread>

#include "tests/support/TestBus.h"

namespace halvex::test {
namespace {

using namespace std::literals;
namespace fs = std::filesystem;

// What busctl prints for a call ("NAME METHOD [SIGNATURE VALUES...]" of org.halvex.NAME), or its
// error when the call fails; the current time shows as STAMP.
std::string call(const PrivateBus& bus, const std::string& words) {
  std::vector<std::string> args = {"--auto-start=no", "call"};
  std::istringstream in(words);
  for (std::string word; in >> word;) {
    args.push_back(word);
    if (args.size() == 3) {
      args.insert(args.end(), {"/org/halvex/" + word, "org.halvex." + word + "1"});
    }
  }
  args[2] = "org.halvex." + args[2];
  const RunResult run = bus.busctl(args);
  return std::regex_replace(run.status.code == 0 ? run.out : run.err,
                            std::regex(R"(\d{4}(-\d\d){5})"), "STAMP");
}

std::string perform(const std::string& command, const std::string& request = "0") {
  return "Server PerformCommand ssa{sv} t " + command + " " + request;
}

std::string property(const std::string& trace, const std::string& name) {
  return perform("GetTraceProperty", "2 TraceName s " + trace + " TracePropertyName s " + name);
}

const std::string kHelperStatus = "Helper Perform sisa{sv} logdump.helper 4 VarniskStatus ";

TEST(SimBus, AnswersAsTheScenarioSays) {
  const std::string custom = R"({"server": {"commands": {
      "TraceDumpState": {"result": 3760250881, "reply": "dict", "timestamp": null},
      "AsNull": {"reply": "null"},
      "AsInt": {"reply": "int64", "result": -1}, "AsBool": {"reply": "bool"}},
    "properties": {"SystemLogs": {"Mode": {"value": "3", "reply": "string", "result": 2}}},
    "state": {"payload": {"Z": 1, "A": {"nested": true}, "M": null}}},
    "helper": {"timestamp": null}})";
  const std::string absent = R"({"server": {"present": false}})";
  const std::string onDemand = R"({"server": {"state": {"when": "demand"}}})";
  const struct {
    std::string scenario, call, answer;
  } cases[] = {
      {"{}", "Device GetIdentity",
       R"(a{sv} 7 "RadioType" x 1 "RadioVendor" x 2 "ProductType" x 0 "InternalBuild" b true )"
       R"("CarrierBuild" b false "VendorBuild" b false "TraceAllowed" b true)"},
      // A change of identity is all or nothing.
      {"{}", "Simulator SetIdentity a{sv} 2 RadioVendor x 1 Colour s red",
       "Call failed: a key or a type that GetIdentity does not answer with"},
      {"{}", "Simulator SetIdentity a{sv} 1 RadioType b true",
       "Call failed: a key or a type that GetIdentity does not answer with"},
      {"{}", "Simulator SetIdentity a{sv} 1 RadioType d 1.5",
       "Call failed: the identity holds a value outside the message types"},
      {"{}", "Simulator SetIdentity a{sv} 2 RadioType x 9 InternalBuild b false", ""},
      {"{}", "Device GetIdentity",
       R"(a{sv} 7 "RadioType" x 9 "RadioVendor" x 2 "ProductType" x 0 "InternalBuild" b false )"
       R"("CarrierBuild" b false "VendorBuild" b false "TraceAllowed" b true)"},
      {"{}", property("BasebandTrace", "Enabled"),
       R"(isv 0 "" a{sv} 1 "TracePropertyValue" s "1")"},
      {"{}", property("SystemLogs", "Mode"), R"(isv 0 "" a{sv} 1 "TracePropertyValue" s "0")"},
      {"{}", property("X", "Y"), R"(isv 0 "" a{sv} 0)"},
      {"{}", perform("TraceDumpState"), R"(isv 0 "" a{sv} 1 "TimestampString" s "STAMP")"},
      {"{}", kHelperStatus + "0", R"(isv 0 "" a{sv} 1 "TimestampString" s "STAMP")"},
      {"{}", "Helper Explode",
       "Call failed: Unknown method Explode or interface org.halvex.Helper1."},
      // A value outside the message types is refused, not half-read.
      {"{}", kHelperStatus + "1 K d 1.5",
       "Call failed: the request holds a value outside the message types"},
      // Payload keys travel in the order written.
      {custom, "Server Subscribe s t",
       R"(a(sv) 1 "ServerStateChange" a{sv} 3 "Z" x 1 "A" a{sv} 1 "nested" b true "M" g "")"},
      {custom, perform("TraceDumpState"), R"(isv -534716415 "simulated failure" a{sv} 0)"},
      {custom, perform("AsNull"), R"(isv 0 "" g "")"},
      {custom, perform("AsInt"), R"(isv -1 "simulated failure" x 0)"},
      {custom, perform("AsBool"), R"(isv 0 "" b true)"},
      {custom, property("SystemLogs", "Mode"), R"(isv 2 "simulated failure" s "3")"},
      {custom, property("BasebandTrace", "Enabled"),
       R"(isv 0 "" a{sv} 1 "TracePropertyValue" s "1")"},
      {custom, kHelperStatus + "0", R"(isv 0 "" a{sv} 0)"},
      {absent, perform("Any"), R"(Call failed: Name "org.halvex.Server" does not exist)"},
      {absent, "Simulator EmitState", "Call failed: the server is not on the bus"},
      {onDemand, "Server Subscribe s t", "a(sv) 0"},
      {R"({"server": {"state": null}})", "Simulator EmitState",
       "Call failed: the scenario has no state event"},
      {R"({"device": {"present": false}})", "Simulator SetIdentity a{sv} 0",
       "Call failed: the device is not on the bus"},
  };
  PrivateBus bus;
  std::unique_ptr<SimProcess> sim;
  std::string running;
  for (const auto& c : cases) {
    if (c.scenario != running) {
      sim.reset();
      sim = std::make_unique<SimProcess>(bus, running = c.scenario);
    }
    EXPECT_EQ(call(bus, c.call), c.answer.empty() ? "" : c.answer + "\n")
        << c.call << " in " << c.scenario;
  }
}

// The opening tags of interface in introspection XML, attributes sorted: layout, comments and
// attribute order do not count, names, types, directions and order do.
std::vector<std::string> members(const std::string& xml, const std::string& interface) {
  const std::string text = std::regex_replace(xml, std::regex("<!--[^]*?-->"), "");
  const std::size_t begin = text.find("<interface name=\"" + interface + "\"");
  if (begin == std::string::npos) {
    return {};
  }
  const std::string body = text.substr(begin, text.find("</interface>", begin) - begin);
  const std::regex tag(R"(<(\w+)([^>]*)>)"), attribute(R"re(\w+="[^"]*")re");
  std::vector<std::string> tags;
  for (std::sregex_iterator t(body.begin(), body.end(), tag), last; t != last; ++t) {
    const std::string attributes = (*t)[2];
    std::vector<std::string> sorted(
        std::sregex_token_iterator(attributes.begin(), attributes.end(), attribute), {});
    std::sort(sorted.begin(), sorted.end());
    std::string line = (*t)[1];
    for (const std::string& a : sorted) {
      line += " " + a;
    }
    tags.push_back(line);
  }
  return tags;
}

TEST(SimBus, IntrospectionMatchesTheInstalledInterfaceFiles) {
  PrivateBus bus;
  SimProcess sim(bus, "{}");
  for (const std::string name : {"Server", "Helper", "Device", "Simulator"}) {
    const std::string interface = "org.halvex." + name + "1";
    std::ifstream file(std::string(HALVEX_INTERFACE_DIR) + "/" + interface + ".xml");
    const std::string xml{std::istreambuf_iterator<char>(file), {}};
    const RunResult live =
        bus.busctl({"introspect", "--xml-interface", "org.halvex." + name, "/org/halvex/" + name});
    ASSERT_EQ(live.status.describe(), "exit 0") << live.err;
    EXPECT_EQ(members(live.out, interface), members(xml, interface));
    EXPECT_GT(members(xml, interface).size(), 2U) << interface;
  }
}

TEST(SimBus, LogRootHoldsWhatTheToolWouldPrint) {
  PrivateBus bus;
  SimProcess sim(bus, R"({"device": {"radio_vendor": 1},
    "server": {"commands": {"TraceDumpState": {"timestamp": "T1"}}},
    "helper": {"timestamp": "H1"}})",
                 {.logRoot = true});
  const fs::path snapshot = sim.logRoot() / "var/wireless/Library/Logs/Faultkeep/Baseband";
  EXPECT_TRUE(fs::is_directory(sim.logRoot() / "var/wireless/Library/Logs/Halvex/DIAG.scratch"));
  const std::pair<std::string, std::string> dumps[] = {
      {"CollectTelephonyLogs", "true"},
      {"CollectTelephonyLogs", "false"},
      {"CollectTelephonyLogsWithCoredump", "false"},
      {"CollectBasebandLogs", "false"},
      {"SomethingElse", "false"}};
  for (const auto& [action, compression] : dumps) {
    call(bus, perform("TraceDumpState", "2 TraceAction s " + action +
                                            " TraceDumpStatePerformCompression b " + compression));
  }
  call(bus, kHelperStatus + "0");
  // Each set where the tool says, and nothing else, not even what a package was made from.
  std::set<std::string> sets;
  for (const auto& entry : fs::directory_iterator(snapshot)) {
    sets.insert(entry.path().filename());
  }
  EXPECT_EQ(sets,
            (std::set<std::string>{"log-bb-H1-bb-trace", "log-bb-T1-bb-trace", "log-bb-T1-coredump",
                                   "log-bb-T1-tel", "log-bb-T1.tar.gz"}));
  const RunResult listing =
      runProcess({{"/usr/bin/tar", "tzf", (snapshot / "log-bb-T1.tar.gz").string()}, {}, {}});
  for (const std::string file : {"summary.txt", "baseband.log", "telephony.log"}) {
    EXPECT_NE(listing.out.find("log-bb-T1/" + file + "\n"), std::string::npos) << listing.err;
    EXPECT_TRUE(fs::is_regular_file(snapshot / "log-bb-T1-tel" / file));
  }
}

// The next datagram on a stand-in for the service manager's notification socket.
std::string nextNotification(int socket) {
  pollfd ready{socket, POLLIN, 0};
  char text[512];
  const ssize_t n = ::poll(&ready, 1, 10'000) == 1 ? ::recv(socket, text, sizeof text, 0) : -1;
  return n < 0 ? "(nothing)" : std::string(text, static_cast<std::size_t>(n));
}

TEST(SimBus, NotifiesTheServiceManagerAndEndsWithTheRightStatus) {
  // One simulator a bus: the control name is unique.
  PrivateBus bus, otherBus, doomedBus;
  TempDir dir;
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  const std::string socketPath = (dir.path() / "notify").string();
  socketPath.copy(address.sun_path, sizeof address.sun_path - 1);
  const int manager = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  ASSERT_EQ(::bind(manager, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  ::setenv("NOTIFY_SOCKET", socketPath.c_str(), 1);
  SimProcess stopped(bus, "{}");
  ::unsetenv("NOTIFY_SOCKET");
  SimProcess quitting(otherBus, "{}");
  SimProcess orphaned(doomedBus, "{}");
  EXPECT_THAT(nextNotification(manager),
              testing::StartsWith("READY=1\nSTATUS=Serving org.halvex.Simulator, "
                                  "org.halvex.Device, org.halvex.Helper, org.halvex.Server from "));
  stopped.kill(SIGTERM);
  EXPECT_EQ(stopped.waitExit().describe(), "exit 0");
  EXPECT_EQ(nextNotification(manager), "STOPPING=1");
  ::close(manager);
  EXPECT_EQ(quitting.callControl("Quit").status.describe(), "exit 0");
  EXPECT_EQ(quitting.waitExit().describe(), "exit 0");
  doomedBus.stop();
  EXPECT_EQ(orphaned.waitExit().describe(), "exit 1");
}

TEST(SimCommandLine, AnswersInOneLineWithTheRightStatus) {
  TempDir dir;
  std::ofstream(dir.path() / "bad.json")
      << R"({"server": {"commands": {"TraceDumpState": {"result": "0"}}}})";
  std::ofstream(dir.path() / "broken.json") << "{\n  \"server\": \n";
  const std::string bad = (dir.path() / "bad.json").string();
  const std::string broken = (dir.path() / "broken.json").string();
  const std::string none = (dir.path() / "none.json").string();
  const auto usage = [](const std::string& problem) {
    return "exit 2||halvex-sim: " + problem + " (see --help)\n";
  };
  // "STATUS|STDOUT|STDERR"
  std::vector<std::pair<std::vector<std::string>, std::string>> cases = {
      {{"--scenario=" + bad},
       "exit 2||" + bad +
           ": /server/commands/TraceDumpState/result: expected an integer, got a string\n"},
      {{"--scenario", broken},
       "exit 2||" + broken +
           ": (top level): not valid JSON at line 3, column 1 (syntax error while parsing value - "
           "unexpected end of input; expected '[', '{', or a literal)\n"},
      {{"--scenario", none}, "exit 2||" + none + ": cannot be read: No such file or directory\n"},
      {{"--version"}, "exit 0|halvex-sim " HALVEX_VERSION "\n|"},
      {{"--scenario", bad, "--bogus", "x"}, usage("unknown or ambiguous option --bogus")},
      {{"--help=x"}, usage("--help takes no value")},
      {{"--log-root", "/tmp", "--scenario"}, usage("--scenario needs a value")},
      {{"--scenario", bad, "stray"}, usage("unexpected argument stray")},
      {{"--scenario", bad, "--ready-fd", "999"},
       usage("--ready-fd: 999 is not an open file descriptor")},
  };
  // Without --scenario the installed defaults are read, which a development machine lacks.
  if (!fs::exists(HALVEX_SIM_CONFIG_SCENARIO) && !fs::exists(HALVEX_SIM_DEFAULT_SCENARIO)) {
    cases.push_back(
        {{},
         "exit 2||halvex-sim: no --scenario given, and neither " HALVEX_SIM_CONFIG_SCENARIO
         " nor " HALVEX_SIM_DEFAULT_SCENARIO " exists\n"});
  }
  for (auto [args, expected] : cases) {
    args.insert(args.begin(), simPath());
    const RunResult result = runProcess({args, {}, {}});
    EXPECT_EQ(result.status.describe() + "|" + result.out + "|" + result.err, expected);
  }
}

}  // namespace
}  // namespace halvex::test
