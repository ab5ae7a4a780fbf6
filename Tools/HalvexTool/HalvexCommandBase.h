// SPDX-License-Identifier: MIT
// The base of every command that talks to the server: a command that also carries the tool's
// one connection to the server and the queue its callbacks arrive on.
#pragma once

#include <memory>
#include <string>

#include "platform/ServerClient.h"
#include "platform/WorkQueue.h"
#include "shell/CommandBase.h"

namespace halvex {

class HalvexCommandBase : public CommandBase {
 public:
  HalvexCommandBase(std::string name, std::weak_ptr<CommandBase> parent,
                    std::shared_ptr<client::Manager> manager, WorkQueue queue);
  ~HalvexCommandBase() override;

  const std::shared_ptr<client::Manager>& manager() const { return manager_; }
  const WorkQueue& queue() const { return queue_; }

 private:
  // Shared by the whole tree. The queue is only stored and handed to children: completions and
  // events arrive on it through the manager, the commands never post to it themselves.
  std::shared_ptr<client::Manager> manager_;
  WorkQueue queue_;
};

}  // namespace halvex
