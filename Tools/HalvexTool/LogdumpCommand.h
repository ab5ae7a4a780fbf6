// SPDX-License-Identifier: MIT
// "logdump": the log collections "tel", "core" and "bb".
#pragma once

#include <memory>
#include <string>

#include "Tools/HalvexTool/HalvexCommandBase.h"

namespace halvex {

// Printed to standard error when an option that needs the server is refused.
extern const char* const kServerNotRunningMessage;

class LogdumpCommand : public HalvexCommandBase {
 public:
  static std::shared_ptr<LogdumpCommand> create(std::string name, std::weak_ptr<CommandBase> parent,
                                                std::shared_ptr<client::Manager> manager,
                                                WorkQueue queue);

  LogdumpCommand(std::string name, std::weak_ptr<CommandBase> parent,
                 std::shared_ptr<client::Manager> manager, WorkQueue queue);
  ~LogdumpCommand() override;

  // "bb" always runs, since it has a way around a server that is down; everything else waits
  // for the server to have reported itself started.
  bool canExecute(const std::string& name) override;

 protected:
  void registerCommands() override;
};

}  // namespace halvex
