// SPDX-License-Identifier: MIT
#include "Tools/HalvexTool/LogCollection.h"

#include <cstdint>
#include <memory>
#include <string_view>
#include <utility>

#include "Tools/HalvexTool/DumpOptions.h"
#include "halvex/trace/DeviceIdentity.h"
#include "halvex/trace/DiagConfig.h"
#include "halvex/trace/LogLocations.h"
#include "platform/HelperClient.h"
#include "platform/ServerClient.h"
#include "platform/ServerProtocol.h"
#include "shell/Console.h"

namespace halvex {

namespace {

constexpr const char* kHelperServiceName = "logdump.helper";
constexpr std::int64_t kHelperTimeout = 1500;

// A reply that is not a dictionary reads as an empty one.
std::string readString(const MessageValue& reply, const char* key, std::string_view fallback) {
  const MessageDict* dict = reply.asDict();
  return dict != nullptr ? dict->getString(key, fallback) : std::string(fallback);
}

std::string snapshotName(const std::string& timestamp) {
  return std::string(trace::kSnapshotFolder) + trace::kLogDirPrefix + timestamp;
}

std::string packagePath(const std::string& timestamp) {
  return snapshotName(timestamp) + trace::kLogPackageExtension;
}

// The server decides the suffix of an uncompressed set; "-*" tells the user to look for it.
std::string patternPath(const std::string& timestamp) {
  return snapshotName(timestamp) + "-*";
}

std::string folderPath(const std::string& timestamp) {
  return snapshotName(timestamp) + trace::getBasebandTraceDirSuffix();
}

std::string scratchPath() {
  return std::string(trace::kScratchFolder) + diag::config::kDIAGScratchDir;
}

void printLine(const std::string& text) {
  writeLine(consoleOut(), text);
}

const char* outcome(const Result& result) {
  return result.ok() ? "Success" : "Failed";
}

struct DumpOptions {
  bool compress = true;
  bool nonui = false;
  std::string reason;
};

DumpOptions parseWords(std::vector<std::string> words) {
  DumpOptions options;
  parseDumpOptions(words, options.compress, options.reason, options.nonui);
  return options;
}

bool isBasebandTraceEnabled(const std::string& value) {
  return value == "1" || value == "true";
}

}  // namespace

bool isSystemLogsTraceMode3(const HalvexCommandBase& command) {
  MessageDict request;
  request.set(kKeyTraceName, MessageValue::string(kTraceSystemLogs));
  request.set(kKeyTracePropertyName, MessageValue::string(kKeyTraceMode));
  MessageValue reply;
  // A failed query leaves the reply null, which reads as no value: another mode.
  client::PerformCommand(command.manager(), kCommandGetTraceProperty, request, reply);
  std::int32_t mode = 0;
  return parseTraceValue(readString(reply, kKeyTracePropertyValue, ""), mode) && mode == 3;
}

bool collectTelephonyLogs(const HalvexCommandBase& command, TaskGroup group,
                          std::vector<std::string> words) {
  const TaskGroupHold busyWhileIssuing(group);
  const DumpOptions options = parseWords(std::move(words));
  const bool compression = options.compress && !isSystemLogsTraceMode3(command);

  MessageDict request;
  request.set(kKeyTraceAction, MessageValue::string(kCollectTelephonyLogs));
  request.set(kKeyTraceDumpStateReason, MessageValue::string(options.reason));
  request.set(kKeyTraceDumpStatePerformCompression, MessageValue::boolean(compression));
  if (options.nonui) {
    request.set(kKeyTraceUserConfirmation, MessageValue::boolean(false));
  }

  // Every copy of the completion holds the group, so the shell waits until the framework has run
  // and dropped its copy. The completion must not reach back into the command.
  const client::Completion completion = [hold = TaskGroupHold(group), compression](
                                            const Result& result, const MessageValue& reply) {
    printTelephonyLogResult(result, reply, compression);
  };
  client::PerformCommand(command.manager(), kCommandTraceDumpState, completion, request);
  return true;
}

void printTelephonyLogResult(const Result& result, const MessageValue& reply, bool compression) {
  printLine(std::string("Telephony log collection: ") + outcome(result));
  if (!result.ok() || !reply.isDict()) {
    return;
  }
  const std::string timestamp = readString(reply, kKeyTimestampString, "");
  printLine("Path = " + (compression ? packagePath(timestamp) : patternPath(timestamp)));
}

bool collectTelephonyLogsWithCoredump(const HalvexCommandBase& command, TaskGroup group,
                                      std::vector<std::string> words) {
  const TaskGroupHold busyWhileIssuing(group);
  const DumpOptions options = parseWords(std::move(words));

  MessageDict request;
  request.set(kKeyBasebandResetType, MessageValue::string(kBasebandResetTypeHard));
  request.set(kKeyBasebandResetSubType, MessageValue::string(kBasebandResetSubTypeOtherErrors));
  request.set(kKeyTraceAction, MessageValue::string(kCollectTelephonyLogsWithCoredump));
  request.set(kKeyBasebandResetReason, MessageValue::string(options.reason));
  request.set(kKeyTraceDumpStatePerformCompression, MessageValue::boolean(options.compress));
  if (options.nonui) {
    request.set(kKeyTraceUserConfirmation, MessageValue::boolean(false));
  }

  const client::Completion completion = [hold = TaskGroupHold(group)](const Result& result,
                                                                      const MessageValue& reply) {
    printCoredumpLogResult(result, reply);
  };
  client::PerformCommand(command.manager(), kCommandTraceDumpState, completion, request);
  return true;
}

void printCoredumpLogResult(const Result& result, const MessageValue& reply) {
  printLine(std::string("Telephony log collection with Coredump: ") + outcome(result));
  if (!result.ok() || !reply.isDict()) {
    return;
  }
  // A core dump always lands as a folder whose suffix the server picks, compressed or not.
  printLine("Path = " + patternPath(readString(reply, kKeyTimestampString, "")));
}

bool collectBasebandLogs(const HalvexCommandBase& command, TaskGroup /*group*/,
                         std::vector<std::string> words) {
  MessageDict enabledQuery;
  enabledQuery.set(kKeyTraceName, MessageValue::string(kTraceBaseband));
  enabledQuery.set(kKeyTracePropertyName, MessageValue::string(kKeyTraceEnabled));
  MessageValue enabledReply;
  const Result enabledResult = client::PerformCommand(command.manager(), kCommandGetTraceProperty,
                                                      enabledQuery, enabledReply);
  if (!enabledResult.ok() || !enabledReply.isDict()) {
    printLine("Baseband log collection: Failed");
    return enabledResult.ok();
  }
  if (!isBasebandTraceEnabled(readString(enabledReply, kKeyTracePropertyValue, kUnknown))) {
    printLine("Baseband logs are not enabled");
    return true;
  }

  // "nonui" is accepted but means nothing here: this dump never asks the user.
  const DumpOptions options = parseWords(std::move(words));
  const bool compression = options.compress && !isSystemLogsTraceMode3(command);

  MessageDict request;
  request.set(kKeyTraceDumpStateReason, MessageValue::string(options.reason));
  request.set(kKeyTraceAction, MessageValue::string(kCollectBasebandLogs));
  request.set(kKeyTraceDumpStatePerformCompression, MessageValue::boolean(compression));
  MessageValue reply;
  const Result result =
      client::PerformCommand(command.manager(), kCommandTraceDumpState, request, reply);

  if (result.code == kResultServerNotRunning) {
    // Without the server nothing was packed: the logs are wherever the last collection the helper
    // knows of put them, or still in the scratch folder.
    const std::string timestamp = queryHelperTimestamp();
    printLine("Baseband log collection: Success (Halvex not running)");
    printLine("Path = " + (timestamp.empty() ? scratchPath() : folderPath(timestamp)));
  } else if (result.ok()) {
    const std::string timestamp = readString(reply, kKeyTimestampString, "");
    printLine("Baseband log collection: Success (Halvex running)");
    printLine("Path = " + (compression ? packagePath(timestamp) : folderPath(timestamp)));
  } else {
    printLine("Baseband log collection: Failed");
  }
  return true;
}

std::string queryHelperTimestamp() {
  if (!trace::isInternalOrCarrierBuild()) {
    return {};
  }
  const std::shared_ptr<HelperClient> helperClient =
      HelperClient::create(kHelperServiceName, nullptr);
  if (!helperClient) {
    return {};
  }
  MessageDict request;
  request.set(helper::kKeyTimeout, MessageValue::int64(kHelperTimeout));
  MessageValue reply = MessageValue::dict(MessageDict());
  const Result result = helperClient->perform(helper::kTaskDiagnosticsCollection,
                                              helper::kCommandVarniskStatus, request, reply);
  if (!result.ok()) {
    return {};
  }
  return readString(reply, helper::kKeyTimestampString, "");
}

}  // namespace halvex
