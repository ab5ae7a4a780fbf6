// SPDX-License-Identifier: MIT
#include <unistd.h>

#include "platform/RunLoop.h"
#include "platform/linux/detail/ProcessBus.h"

namespace halvex::platform {

// The main thread serves the process's bus connection. Should the loop ever fail, every request
// has completed by then and the thread stays idle instead, so that the shell thread still ends
// the process with its own status.
void runMainLoop() {
  bus::ProcessBus::instance().run();
  for (;;) {
    pause();
  }
}

}  // namespace halvex::platform
