// SPDX-License-Identifier: MIT
// The tool's shell and its process entry.
//
// HalvexShell.cpp is compiled twice: into the halvex_tool library without HALVEX_TOOL_MAIN,
// where it provides everything below, and into the halvextool executable with it, where it
// provides only main(). Tests link the library and drive halvexMain with a list they own.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "shell/CommandShell.h"

namespace halvex {

// A shell whose root command is connected to the server. Creating the root sets up the session
// (the queue, the client manager and the state-event handler), then waits up to 500 ms for the
// server's first state event before the first command runs.
class HalvexShell : public CommandShell {
 public:
  HalvexShell() = default;
  ~HalvexShell() override;

  std::shared_ptr<CommandBase> createRootCommand() override;
};

// One element per process argument, program name first; nothing is split or trimmed.
std::vector<std::string> makeArgumentList(int argc, char* argv[]);

// Refuses a device without a baseband radio, and one where neither the telephony daemon nor the
// baseband daemon runs unless the product needs neither. Prints the reason to standard output.
bool runStartupChecks();

// What main does after building the argument list: the start-up checks, then the shell on its
// own thread, then the platform run loop on this one. arguments must outlive the process, which
// the shell thread ends with exit(). Returns -1 when a check fails, and 0 only if the run loop
// ever returns.
int halvexMain(std::vector<std::string>& arguments);

// The shell thread's entry: copies the list at arguments, runs a HalvexShell over it and exits
// the process with 0 when the run succeeded, 1 otherwise. Never returns.
[[noreturn]] void* shellThreadMain(void* arguments);

}  // namespace halvex
