// SPDX-License-Identifier: MIT
#include "Tools/HalvexTool/ServerState.h"

#include <atomic>
#include <string>

#include "platform/ServerProtocol.h"

namespace halvex {

namespace {

// The only state shared between the queue and the shell thread besides task groups.
std::atomic<bool> serverStarted{false};

}  // namespace

bool isServerStarted() {
  return serverStarted.load();
}

void onServerStateChange(const MessageValue& payload, TaskGroup /*group*/) {
  std::string state;
  if (const MessageDict* dict = payload.asDict()) {
    state = dict->getString(kKeyServerState);
  }
  serverStarted.store(state == kServerStateStarted);
}

}  // namespace halvex
