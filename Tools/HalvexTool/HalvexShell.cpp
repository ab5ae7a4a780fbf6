// SPDX-License-Identifier: MIT
// Compiled twice; see HalvexShell.h.
#include "Tools/HalvexTool/HalvexShell.h"

#ifndef HALVEX_TOOL_MAIN

#include <pthread.h>

#include <chrono>
#include <cstddef>
#include <cstdlib>
#include <optional>
#include <string>
#include <system_error>
#include <utility>

#include "Tools/HalvexTool/HalvexCommand.h"
#include "Tools/HalvexTool/ServerState.h"
#include "halvex/trace/DeviceIdentity.h"
#include "platform/DeviceQueries.h"
#include "platform/RunLoop.h"
#include "platform/ServerClient.h"
#include "platform/ServerProtocol.h"
#include "platform/TaskGroup.h"
#include "platform/WorkQueue.h"
#include "shell/Console.h"

namespace halvex {

namespace {

// Long enough for a running server to answer the subscription with its state, short enough not
// to be noticed at start-up. The framework keeps its copy of the handler, so the wait normally
// runs out rather than ends early.
constexpr std::chrono::milliseconds kServerStateWait{500};

constexpr const char* kUnsupportedMessage = "'halvextool' is not supported on this product.";
constexpr const char* kDaemonsNotRunningMessage =
    "Telvane process is not running. Please run/load Telvane (or kelmond) and try again.";

}  // namespace

HalvexShell::~HalvexShell() = default;

std::shared_ptr<CommandBase> HalvexShell::createRootCommand() {
  WorkQueue queue = WorkQueue::create("halvextool.queue");
  std::shared_ptr<client::Manager> manager = client::CreateManager("halvextool", queue);

  TaskGroup startupGroup;
  startupGroup.enter();
  {
    // Every copy of the handler holds startupGroup; the manager keeps one for as long as the
    // handler is registered.
    client::EventHandler handler = [manager, hold = TaskGroupHold(startupGroup)](
                                       const MessageValue& payload, TaskGroup group) {
      onServerStateChange(payload, std::move(group));
    };
    client::RegisterEventHandler(manager, kEventServerStateChange, handler);
    // Off and on again makes the framework deliver the server's current state.
    client::EventsOff(manager);
    client::EventsOn(manager);
  }
  startupGroup.leave();
  startupGroup.waitFor(kServerStateWait);

  return HalvexCommand::create(device::getProgramName(), {}, std::move(manager), std::move(queue));
}

std::vector<std::string> makeArgumentList(int argc, char* argv[]) {
  std::vector<std::string> arguments;
  arguments.reserve(argc > 0 ? static_cast<std::size_t>(argc) : 0);
  for (int i = 0; i < argc; ++i) {
    arguments.emplace_back(argv[i]);
  }
  return arguments;
}

bool runStartupChecks() {
  if (device::getRadioType() == 0) {
    writeLine(consoleOut(), kUnsupportedMessage);
    return false;
  }
  // Both are asked, in this order; the baseband daemon only matters when neither holds.
  const bool telvaneRunning = device::isProcessRunning("Telvane");
  const bool exempt = trace::isDaemonCheckExempt();
  if (!telvaneRunning && !exempt && !device::isProcessRunning("kelmond")) {
    writeLine(consoleOut(), kDaemonsNotRunningMessage);
    return false;
  }
  return true;
}

int halvexMain(std::vector<std::string>& arguments) {
  reserveStandardDescriptors();
  if (!runStartupChecks()) {
    return -1;
  }
  pthread_t shellThread{};
  const int ret = pthread_create(&shellThread, nullptr, shellThreadMain, &arguments);
  if (ret != 0) {
    // Not assert(): a release build must not carry on without its shell.
    writeLine(consoleErr(), device::getProgramName() + ": cannot start the shell thread: " +
                                std::generic_category().message(ret));
    std::abort();
  }
  platform::runMainLoop();
  return 0;
}

void* shellThreadMain(void* arguments) {
  std::vector<std::string> list = *static_cast<const std::vector<std::string>*>(arguments);
  // Never destroyed: exit() ends the process with the shell, its tree and its session alive.
  auto shell = std::make_shared<HalvexShell>();
  int status = shell->run(std::move(list)) ? 0 : 1;
  // As the standard tools do: output that was lost makes the run a failure, and says why.
  if (std::optional<std::string> lost = consoleOutError()) {
    writeLine(consoleErr(), device::getProgramName() + ": " + *lost);
    status = 1;
  }
  std::exit(status);  // NOLINT(concurrency-mt-unsafe), see .clang-tidy
}

}  // namespace halvex

#else  // HALVEX_TOOL_MAIN

int main(int argc, char* argv[]) {
  // Lives in this frame for good: main does not come back from the run loop, and the shell
  // thread reads the list through its address.
  std::vector<std::string> arguments = halvex::makeArgumentList(argc, argv);
  return halvex::halvexMain(arguments);
}

#endif  // HALVEX_TOOL_MAIN
