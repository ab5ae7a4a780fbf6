// SPDX-License-Identifier: MIT
// Start-up against the real process table: the simulator keeps processes with the daemons'
// names alive for as long as it runs.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <string>

#include "tests/tool_e2e/ToolRun.h"

namespace halvex::e2e {
namespace {

// Processes on this machine whose name is exactly one of the daemons', as "pid name".
std::string daemonsRunningElsewhere() {
  std::string found;
  for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
    std::ifstream comm(entry.path() / "comm");
    std::string name;
    if (std::getline(comm, name) && (name == "Telvane" || name == "kelmond")) {
      found += entry.path().filename().string() + " " + name + "; ";
    }
  }
  return found;
}

TEST(DaemonCheck, NeitherDaemonOnAnOrdinaryProductRefusesToStart) {
  // Tests that keep such processes alive hold the daemon_names lock; anything else is a process
  // this test cannot control.
  ASSERT_EQ(daemonsRunningElsewhere(), "") << "processes named like the daemons already run";
  test::PrivateBus bus;
  test::SimProcess sim(bus, R"({"device": {"product_type": 57}, "processes": ["telvane"]})");
  const test::RunResult run = runTool({"logdump", "tel"});
  EXPECT_EQ(run.status.describe(), "exit 255");
  EXPECT_EQ(
      run.out,
      "Telvane process is not running. Please run/load Telvane (or kelmond) and try again.\n");
  EXPECT_EQ(run.err, "");
}

TEST(DaemonCheck, EitherDaemonLetsTheToolStart) {
  for (const std::string daemon : {"Telvane", "kelmond"}) {
    SCOPED_TRACE(daemon);
    test::PrivateBus bus;
    test::SimProcess sim(
        bus, R"({"device": {"product_type": 0}, "processes": [")" + daemon +
                 R"("], "server": {"commands": {"TraceDumpState": {"timestamp": "T"}}}})");
    const test::RunResult run = runTool({"logdump", "tel"});
    EXPECT_EQ(run.status.describe(), "exit 0");
    EXPECT_EQ(run.out, "Telephony log collection: Success\nPath = " + kSnapshot + "T.tar.gz\n");
    EXPECT_EQ(run.err, "");
  }
}

}  // namespace
}  // namespace halvex::e2e
