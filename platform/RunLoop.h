// SPDX-License-Identifier: MIT
// The main thread's run loop.
#pragma once

namespace halvex::platform {

// Serves the main thread's platform events. Nothing in the program stops it; the process ends by
// exit() from another thread. Returns only if the backend's loop itself fails.
void runMainLoop();

}  // namespace halvex::platform
