// SPDX-License-Identifier: MIT
#include <unistd.h>

#include "detail/ProcessBus.h"
#include "platform/RunLoop.h"

namespace halvex::platform {

// The main thread serves the process's bus connection. Should the loop fail to start or fail
// later, every request it had taken has completed by then, callers serve their requests
// themselves from then on, and the thread stays idle, so that the shell thread still ends the
// process with its own status.
void runMainLoop() {
  bus::ProcessBus::instance().run();
  for (;;) {
    pause();
  }
}

}  // namespace halvex::platform
