// SPDX-License-Identifier: MIT
// The main thread's run loop.
#pragma once

namespace halvex::platform {

// Serves the platform's I/O on the calling thread (on a Linux host, the process's bus
// connection); no work of the program's own runs there. It does not return: the process ends by
// exit() from another thread.
void runMainLoop();

}  // namespace halvex::platform
