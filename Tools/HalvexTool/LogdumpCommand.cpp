// SPDX-License-Identifier: MIT
#include "Tools/HalvexTool/LogdumpCommand.h"

#include <utility>
#include <vector>

#include "Tools/HalvexTool/LogCollection.h"
#include "Tools/HalvexTool/ServerState.h"
#include "platform/TaskGroup.h"
#include "shell/Console.h"

namespace halvex {

const char* const kServerNotRunningMessage =
    "Server is not running. Please try after server starts.";

namespace {

using Collection = bool (*)(const HalvexCommandBase&, TaskGroup, std::vector<std::string>);

// The handler lives in the command's own option table, so it must not own the command.
OptionHandler bindCollection(std::weak_ptr<CommandBase> weakCommand, Collection collection) {
  return [weakCommand = std::move(weakCommand), collection](TaskGroup group,
                                                            std::vector<std::string> words) {
    std::shared_ptr<CommandBase> command = weakCommand.lock();
    if (!command) {
      return false;
    }
    return collection(static_cast<const HalvexCommandBase&>(*command), std::move(group),
                      std::move(words));
  };
}

}  // namespace

std::shared_ptr<LogdumpCommand> LogdumpCommand::create(std::string name,
                                                       std::weak_ptr<CommandBase> parent,
                                                       std::shared_ptr<client::Manager> manager,
                                                       WorkQueue queue) {
  auto command = std::make_shared<LogdumpCommand>(std::move(name), std::move(parent),
                                                  std::move(manager), std::move(queue));
  command->init();
  return command;
}

LogdumpCommand::LogdumpCommand(std::string name, std::weak_ptr<CommandBase> parent,
                               std::shared_ptr<client::Manager> manager, WorkQueue queue)
    : HalvexCommandBase(std::move(name), std::move(parent), std::move(manager), std::move(queue)) {}

LogdumpCommand::~LogdumpCommand() = default;

bool LogdumpCommand::canExecute(const std::string& name) {
  if (name == "bb" || isServerStarted()) {
    return true;
  }
  writeLine(consoleErr(), kServerNotRunningMessage);
  return false;
}

void LogdumpCommand::registerCommands() {
  std::weak_ptr<CommandBase> self = weak_from_this();
  // The words each collection takes before its reason, for completion at a terminal.
  addOption("tel", bindCollection(self, collectTelephonyLogs),
            "[nocompress] [nonui] <reason> collect telephony logs", {"nocompress", "nonui"});
  addOption("core", bindCollection(self, collectTelephonyLogsWithCoredump),
            "[nocompress] [nonui] <reason> collect telephony logs with coredump",
            {"nocompress", "nonui"});
  addOption("bb", bindCollection(self, collectBasebandLogs),
            "[nocompress] <reason> collect baseband logs only", {"nocompress"});
}

}  // namespace halvex
