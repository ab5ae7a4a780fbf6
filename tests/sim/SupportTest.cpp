// SPDX-License-Identifier: MIT
// The fixtures the bus and end-to-end tests stand on: if these lie, every test above them does.
#include <gtest/gtest.h>

#include <cstdlib>

#include "tests/support/TestBus.h"

namespace halvex::test {
namespace {

using namespace std::chrono_literals;

TEST(RunProcess, PassesInputAndEnvironmentCollectsBothStreamsAndNeverHangs) {
  const struct {
    std::vector<std::string> args;
    std::string input;
    std::chrono::milliseconds timeout;
    std::string expected;  // "STATUS|STDOUT|STDERR"
  } cases[] = {
      {{"/bin/sh", "-c", "cat; echo \"$GREETING\" >&2; test -z \"$HOME\"; exit 3"},
       "line one\nline two\n",
       30s,
       "exit 3|line one\nline two\n|hello\n"},
      // A child that stops reading a large input must not take the test down with SIGPIPE.
      {{"/bin/sh", "-c", "head -c 10; exit 0"},
       std::string(1 << 20, 'x'),
       30s,
       "exit 0|xxxxxxxxxx|"},
      {{"/bin/sh", "-c", "echo started; exec sleep 30"},
       "",
       300ms,
       "timed out (signal 9)|started\n|"},
  };
  for (const auto& c : cases) {
    const RunResult result =
        runProcess({c.args, {{"GREETING", "hello"}, {"HOME", std::nullopt}}, c.input, c.timeout});
    EXPECT_EQ(result.status.describe() + "|" + result.out + "|" + result.err, c.expected);
  }
  EXPECT_THROW(runProcess({{"/nonexistent/program"}, {}, {}}), std::runtime_error);
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
