// SPDX-License-Identifier: MIT
// The fixtures the bus and end-to-end tests stand on: if these lie, every test above them does.
#include <gtest/gtest.h>

#include <cstdlib>

#include "tests/support/TestBus.h"

namespace halvex::test {
namespace {

using namespace std::chrono_literals;

TEST(RunProcess, PassesInputEnvironmentAndCollectsBothStreams) {
  RunOptions run;
  run.args = {"/bin/sh", "-c", "cat; echo \"$GREETING\" >&2; test -z \"$HOME\"; exit 3"};
  run.env = {{"GREETING", "hello"}, {"HOME", std::nullopt}};
  run.input = "line one\nline two\n";
  const RunResult result = runProcess(run);
  EXPECT_TRUE(result.status.exited);
  EXPECT_EQ(result.status.code, 3) << result.status.describe();
  EXPECT_EQ(result.out, "line one\nline two\n");
  EXPECT_EQ(result.err, "hello\n");
}

TEST(RunProcess, LargeInputToAChildThatStopsReadingDoesNotKillTheTest) {
  RunOptions run;
  run.args = {"/bin/sh", "-c", "head -c 10; exit 0"};
  run.input.assign(1 << 20, 'x');
  const RunResult result = runProcess(run);
  EXPECT_EQ(result.status.describe(), "exit 0");
  EXPECT_EQ(result.out, std::string(10, 'x'));
}

TEST(RunProcess, KillsAChildThatOverstaysItsTimeout) {
  RunOptions run;
  run.args = {"/bin/sh", "-c", "echo started; exec sleep 30"};
  run.timeout = 300ms;
  const auto start = std::chrono::steady_clock::now();
  const RunResult result = runProcess(run);
  EXPECT_LT(std::chrono::steady_clock::now() - start, 5s);
  EXPECT_TRUE(result.status.timedOut);
  EXPECT_EQ(result.status.signal, 9);
  EXPECT_EQ(result.out, "started\n");
}

TEST(RunProcess, ReportsAProgramThatCannotStart) {
  RunOptions run;
  run.args = {"/nonexistent/program"};
  EXPECT_THROW(runProcess(run), std::runtime_error);
}

TEST(PrivateBus, PointsTheSystemBusAtAPrivateDaemonAndStops) {
  PrivateBus bus;
  ASSERT_NE(std::getenv("DBUS_SYSTEM_BUS_ADDRESS"), nullptr);
  EXPECT_EQ(bus.address(), std::getenv("DBUS_SYSTEM_BUS_ADDRESS"));
  RunResult names = bus.busctl({"list", "--no-legend"});
  EXPECT_EQ(names.status.describe(), "exit 0") << names.err;
  EXPECT_NE(names.out.find("org.freedesktop.DBus"), std::string::npos) << names.out;

  bus.stop();
  names = bus.busctl({"list", "--no-legend"});
  EXPECT_NE(names.status.code, 0);
}

}  // namespace
}  // namespace halvex::test
