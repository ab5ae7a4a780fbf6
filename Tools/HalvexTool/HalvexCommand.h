// SPDX-License-Identifier: MIT
// The root of the tool's command tree, named after the running program. It talks to nobody; it
// only holds the "logdump" command.
#pragma once

#include <memory>
#include <string>

#include "Tools/HalvexTool/HalvexCommandBase.h"

namespace halvex {

class HalvexCommand : public HalvexCommandBase {
 public:
  // Owns the new command before init() runs, so the command can name itself as its children's
  // parent.
  static std::shared_ptr<HalvexCommand> create(std::string name, std::weak_ptr<CommandBase> parent,
                                               std::shared_ptr<client::Manager> manager,
                                               WorkQueue queue);

  HalvexCommand(std::string name, std::weak_ptr<CommandBase> parent,
                std::shared_ptr<client::Manager> manager, WorkQueue queue);
  ~HalvexCommand() override;

 protected:
  void registerCommands() override;
};

}  // namespace halvex
