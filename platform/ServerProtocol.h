// SPDX-License-Identifier: MIT
// Names of the baseband-manager server's protocol and of the log-dump helper service: commands,
// events, keys and values. Each value is defined once, in ServerProtocol.cpp; the simulator and
// the tool both use these definitions.
#pragma once

#include <cstdint>

namespace halvex {

// Commands.
extern const char* const kCommandTraceDumpState;
extern const char* const kCommandGetTraceProperty;

// Events and their keys and values.
extern const char* const kEventServerStateChange;
extern const char* const kKeyServerState;
extern const char* const kServerStateStarted;

// Request keys.
extern const char* const kKeyTraceAction;
extern const char* const kKeyTraceDumpStateReason;
extern const char* const kKeyBasebandResetReason;
extern const char* const kKeyTraceDumpStatePerformCompression;
extern const char* const kKeyTraceUserConfirmation;
extern const char* const kKeyBasebandResetType;
extern const char* const kKeyBasebandResetSubType;
extern const char* const kKeyTraceName;
extern const char* const kKeyTracePropertyName;

// Reply keys.
extern const char* const kKeyTracePropertyValue;
extern const char* const kKeyTimestampString;

// Values.
extern const char* const kCollectTelephonyLogs;
extern const char* const kCollectTelephonyLogsWithCoredump;
extern const char* const kCollectBasebandLogs;
extern const char* const kBasebandResetTypeHard;
extern const char* const kBasebandResetSubTypeOtherErrors;
extern const char* const kTraceBaseband;
extern const char* const kTraceSystemLogs;
extern const char* const kKeyTraceEnabled;
extern const char* const kKeyTraceMode;
extern const char* const kUnknown;

namespace helper {

// Tasks under which a helper service runs a command.
enum TaskID : std::int32_t {
  kTaskGeneral = 0,
  kTaskDiagnosticsCollection = 4,
};

extern const char* const kCommandVarniskStatus;
extern const char* const kKeyTimeout;
extern const char* const kKeyTimestampString;

}  // namespace helper
}  // namespace halvex
