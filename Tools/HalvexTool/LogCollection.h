// SPDX-License-Identifier: MIT
// The three log collections behind "logdump tel", "logdump core" and "logdump bb", the queries
// they make first, and the lines that report where the logs went.
#pragma once

#include <string>
#include <vector>

#include "Tools/HalvexTool/HalvexCommandBase.h"
#include "platform/MessageDict.h"
#include "platform/Result.h"
#include "platform/TaskGroup.h"

namespace halvex {

// Each collection parses words (see parseDumpOptions) and sends its dump request through the
// command's manager. "tel" and "core" send it asynchronously and return true at once; their
// completion keeps group busy until it has printed the outcome. "bb" works synchronously, falls
// back to the helper when the server is down, and returns false only when the baseband-enabled
// query fails.
bool collectTelephonyLogs(const HalvexCommandBase& command, TaskGroup group,
                          std::vector<std::string> words);
bool collectTelephonyLogsWithCoredump(const HalvexCommandBase& command, TaskGroup group,
                                      std::vector<std::string> words);
bool collectBasebandLogs(const HalvexCommandBase& command, TaskGroup group,
                         std::vector<std::string> words);

// Completions of the two asynchronous dumps. compression is what the request asked for: it
// decides between the package and the pattern path.
void printTelephonyLogResult(const Result& result, const MessageValue& reply, bool compression);
void printCoredumpLogResult(const Result& result, const MessageValue& reply);

// True when the server reports the system-logs trace mode as 3, the mode in which the server
// already packs the logs itself. Any failure reads as another mode.
bool isSystemLogsTraceMode3(const HalvexCommandBase& command);

// The time stamp of the last collection according to the helper service, asked only on internal
// and carrier builds; empty when there is none or the helper fails.
std::string queryHelperTimestamp();

}  // namespace halvex
