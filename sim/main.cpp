// SPDX-License-Identifier: MIT
// halvex-sim: the simulated device, baseband-manager server and log-dump helper on the system
// bus, driven by a scenario file. See docs/simulator.md.
#include <fcntl.h>
#include <signal.h>

#include <cstdio>
#include <cstdlib>
#include <exception>
#include <string>
#include <string_view>

#include "sim/Daemon.h"
#include "sim/Scenario.h"

namespace {

constexpr int kUsageOrScenarioError = 2;

const char kUsage[] =
    "usage: halvex-sim --scenario FILE [--request-log FILE] [--log-root DIR] [--ready-fd N]\n";

int usage(const std::string& problem) {
  std::fprintf(stderr, "halvex-sim: %s\n%s", problem.c_str(), kUsage);
  return kUsageOrScenarioError;
}

}  // namespace

int main(int argc, char** argv) {
  std::string scenarioPath;
  halvex::sim::DaemonOptions options;
  for (int i = 1; i < argc; ++i) {
    const std::string_view arg = argv[i];
    if (arg == "--help" || arg == "-h") {
      std::fputs(kUsage, stdout);
      return 0;
    }
    if (i + 1 >= argc)
      return usage(std::string(arg) + " needs a value");
    const std::string value = argv[++i];
    if (arg == "--scenario") {
      scenarioPath = value;
    } else if (arg == "--request-log") {
      options.requestLog = value;
    } else if (arg == "--log-root") {
      options.logRoot = value;
    } else if (arg == "--ready-fd") {
      char* end = nullptr;
      const long fd = std::strtol(value.c_str(), &end, 10);
      if (value.empty() || *end != '\0' || fd < 0 || fd > 65535 ||
          ::fcntl(static_cast<int>(fd), F_GETFD) < 0) {
        return usage("--ready-fd: " + value + " is not an open file descriptor");
      }
      options.readyFd = static_cast<int>(fd);
      // The processes the simulator starts must not hold the reader's pipe open.
      ::fcntl(options.readyFd, F_SETFD, FD_CLOEXEC);
    } else {
      return usage("unknown argument " + std::string(arg));
    }
  }
  if (scenarioPath.empty())
    return usage("--scenario is required");

  halvex::sim::Scenario scenario;
  try {
    scenario = halvex::sim::loadScenario(scenarioPath);
  } catch (const std::exception& e) {
    std::fprintf(stderr, "%s\n", e.what());
    return kUsageOrScenarioError;
  }

  // A reader of the ready pipe or of a reply may go away; that must not end the simulator.
  ::signal(SIGPIPE, SIG_IGN);
  try {
    halvex::sim::Daemon daemon(std::move(scenario), std::move(options));
    return daemon.run();
  } catch (const std::exception& e) {
    std::fprintf(stderr, "halvex-sim: %s\n", e.what());
    return 1;
  }
}
