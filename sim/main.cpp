// SPDX-License-Identifier: MIT
// halvex-sim: the simulated device, baseband-manager server and log-dump helper on the system
// bus, driven by a scenario file. See docs/simulator.md and halvex-sim(8).
#include <fcntl.h>
#include <getopt.h>
#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <exception>
#include <string>
#include <string_view>

#include "sim/Daemon.h"
#include "sim/Scenario.h"

namespace {

constexpr int kUsageOrScenarioError = 2;

// Set by the build from the installation directories.
constexpr const char* kDefaultScenarios[] = {HALVEX_SIM_CONFIG_SCENARIO,
                                             HALVEX_SIM_DEFAULT_SCENARIO};

const char kUsage[] =
    "usage: halvex-sim [--scenario FILE] [--request-log FILE] [--log-root DIR] [--ready-fd N]\n"
    "       halvex-sim --help | --version\n"
    "\n"
    "Plays the device identity, the baseband-manager server and the log-dump helper on the\n"
    "system bus, as a JSON scenario says.\n"
    "\n"
    "  --scenario FILE     the scenario; without it " HALVEX_SIM_CONFIG_SCENARIO
    "\n"
    "                      if that exists, else " HALVEX_SIM_DEFAULT_SCENARIO
    "\n"
    "  --request-log FILE  append every request received to FILE, one JSON line each\n"
    "  --log-root DIR      write the logs of each successful collection under DIR\n"
    "  --ready-fd N        write \"ready\" to descriptor N once every name is owned\n"
    "  -h, --help          print this help and exit\n"
    "  -V, --version       print the version and exit\n"
    "\n"
    "See halvex-sim(8).\n";

enum OptionId { kScenario = 1, kRequestLog, kLogRoot, kReadyFd };

const option kOptions[] = {{"scenario", required_argument, nullptr, kScenario},
                           {"request-log", required_argument, nullptr, kRequestLog},
                           {"log-root", required_argument, nullptr, kLogRoot},
                           {"ready-fd", required_argument, nullptr, kReadyFd},
                           {"help", no_argument, nullptr, 'h'},
                           {"version", no_argument, nullptr, 'V'},
                           {nullptr, 0, nullptr, 0}};

int commandLineError(const std::string& problem) {
  std::fprintf(stderr, "halvex-sim: %s (see --help)\n", problem.c_str());
  return kUsageOrScenarioError;
}

std::string optionName(int id) {
  for (const option& o : kOptions) {
    if (o.name != nullptr && o.val == id) {
      return std::string("--") + o.name;
    }
  }
  return std::string("-") + static_cast<char>(id);
}

// What getopt_long refused: argv[optind - 1] is the element it stopped at for a long option; a
// short one is only known by its letter, which may sit inside a cluster such as -hx.
std::string refusal(int id, const char* arg) {
  const std::string_view text = arg;
  if (text.substr(0, 2) != "--") {
    return "unknown option -" + std::string(1, static_cast<char>(id));
  }
  const std::string name(text.substr(0, text.find('=')));
  return id != 0 ? name + " takes no value" : "unknown or ambiguous option " + name;
}

}  // namespace

int main(int argc, char** argv) {
  std::string scenarioPath;
  halvex::sim::DaemonOptions options;
  // Our own messages, one line each; "+" stops at the first word that is not an option.
  opterr = 0;
  int id = 0;
  // NOLINTNEXTLINE(concurrency-mt-unsafe), see .clang-tidy
  while ((id = getopt_long(argc, argv, "+:hV", kOptions, nullptr)) != -1) {
    switch (id) {
      case 'h': std::fputs(kUsage, stdout); return 0;
      case 'V': std::puts("halvex-sim " HALVEX_VERSION); return 0;
      case kScenario: scenarioPath = optarg; break;
      case kRequestLog: options.requestLog = optarg; break;
      case kLogRoot: options.logRoot = optarg; break;
      case kReadyFd: {
        const std::string value = optarg;
        char* end = nullptr;
        const long fd = std::strtol(value.c_str(), &end, 10);
        if (value.empty() || *end != '\0' || fd < 0 || fd > 65535 ||
            ::fcntl(static_cast<int>(fd), F_GETFD) < 0) {
          return commandLineError("--ready-fd: " + value + " is not an open file descriptor");
        }
        options.readyFd = static_cast<int>(fd);
        // The processes the simulator starts must not hold the reader's pipe open.
        ::fcntl(options.readyFd, F_SETFD, FD_CLOEXEC);
        break;
      }
      case ':': return commandLineError(optionName(optopt) + " needs a value");
      default: return commandLineError(refusal(optopt, argv[optind - 1]));
    }
  }
  if (optind < argc) {
    return commandLineError(std::string("unexpected argument ") + argv[optind]);
  }

  if (scenarioPath.empty()) {
    for (const char* candidate : kDefaultScenarios) {
      if (::access(candidate, F_OK) == 0) {
        scenarioPath = candidate;
        break;
      }
    }
  }
  if (scenarioPath.empty()) {
    std::fprintf(stderr, "halvex-sim: no --scenario given, and neither %s nor %s exists\n",
                 kDefaultScenarios[0], kDefaultScenarios[1]);
    return kUsageOrScenarioError;
  }

  halvex::sim::Scenario scenario;
  try {
    scenario = halvex::sim::loadScenario(scenarioPath);
  } catch (const std::exception& e) {
    std::fprintf(stderr, "%s\n", e.what());
    return kUsageOrScenarioError;
  }
  options.scenarioPath = scenarioPath;

  // A reader of the ready pipe or of a reply may go away; that must not end the simulator.
  ::signal(SIGPIPE, SIG_IGN);
  try {
    halvex::sim::Daemon daemon(scenario, std::move(options));
    return daemon.run();
  } catch (const std::exception& e) {
    std::fprintf(stderr, "halvex-sim: %s\n", e.what());
    return 1;
  }
}
