// SPDX-License-Identifier: MIT
#include <unistd.h>

#include "platform/RunLoop.h"

namespace halvex::platform {

// The host has no main-thread events to serve; the thread only has to stay alive and idle.
void runMainLoop() {
  for (;;) {
    pause();
  }
}

}  // namespace halvex::platform
