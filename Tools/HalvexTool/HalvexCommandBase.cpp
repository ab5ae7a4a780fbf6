// SPDX-License-Identifier: MIT
#include "Tools/HalvexTool/HalvexCommandBase.h"

#include <utility>

namespace halvex {

HalvexCommandBase::HalvexCommandBase(std::string name, std::weak_ptr<CommandBase> parent,
                                     std::shared_ptr<client::Manager> manager, WorkQueue queue)
    : CommandBase(std::move(name), std::move(parent)),
      manager_(std::move(manager)),
      queue_(std::move(queue)) {}

HalvexCommandBase::~HalvexCommandBase() = default;

}  // namespace halvex
