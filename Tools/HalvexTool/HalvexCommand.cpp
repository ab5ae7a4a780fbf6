// SPDX-License-Identifier: MIT
#include "Tools/HalvexTool/HalvexCommand.h"

#include <utility>

#include "Tools/HalvexTool/LogdumpCommand.h"

namespace halvex {

std::shared_ptr<HalvexCommand> HalvexCommand::create(std::string name,
                                                     std::weak_ptr<CommandBase> parent,
                                                     std::shared_ptr<client::Manager> manager,
                                                     WorkQueue queue) {
  auto command = std::make_shared<HalvexCommand>(std::move(name), std::move(parent),
                                                 std::move(manager), std::move(queue));
  command->init();
  return command;
}

HalvexCommand::HalvexCommand(std::string name, std::weak_ptr<CommandBase> parent,
                             std::shared_ptr<client::Manager> manager, WorkQueue queue)
    : HalvexCommandBase(std::move(name), std::move(parent), std::move(manager), std::move(queue)) {}

HalvexCommand::~HalvexCommand() = default;

void HalvexCommand::registerCommands() {
  // Throws std::bad_weak_ptr when this command was built without an owner: children must be able
  // to reach their parent.
  std::shared_ptr<CommandBase> self = shared_from_this();
  addSubCommand("logdump", LogdumpCommand::create("logdump", self, manager(), queue()));
}

}  // namespace halvex
