// SPDX-License-Identifier: MIT
// Whether the server has started, as its latest state event says. Written on the client
// framework's queue, read on the shell thread.
#pragma once

#include "platform/MessageDict.h"
#include "platform/TaskGroup.h"

namespace halvex {

// False until a state event says otherwise.
bool isServerStarted();

// Handler body for kEventServerStateChange. Every event overwrites the flag: it is set only when
// the payload is a dictionary whose kKeyServerState is exactly kServerStateStarted, and cleared
// by anything else, malformed payloads included. The group is the framework's and is not used.
void onServerStateChange(const MessageValue& payload, TaskGroup group);

}  // namespace halvex
