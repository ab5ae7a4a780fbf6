// SPDX-License-Identifier: MIT
// The daemon check against the real process table, where the simulator keeps processes with the
// names it is given alive while it runs.
#include <gtest/gtest.h>
#include <unistd.h>

#include <string>

#include "tests/tool_e2e/ToolRun.h"

namespace halvex::e2e {
namespace {

TEST(DaemonCheck, EitherDaemonByItsExactNameLetsTheToolStart) {
  if (::getpid() != 1) {
    GTEST_SKIP() << "needs a pid namespace of its own, so that no other process on the machine "
                    "can be named like a daemon; run the suite as root";
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
