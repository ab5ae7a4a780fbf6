// SPDX-License-Identifier: MIT
#include "platform/ServerProtocol.h"

namespace halvex {

const char* const kCommandTraceDumpState = "TraceDumpState";
const char* const kCommandGetTraceProperty = "GetTraceProperty";

const char* const kEventServerStateChange = "ServerStateChange";
const char* const kKeyServerState = "ServerState";
const char* const kServerStateStarted = "Started";

const char* const kKeyTraceAction = "TraceAction";
const char* const kKeyTraceDumpStateReason = "TraceDumpStateReason";
const char* const kKeyBasebandResetReason = "BasebandResetReason";
const char* const kKeyTraceDumpStatePerformCompression = "TraceDumpStatePerformCompression";
const char* const kKeyTraceUserConfirmation = "TraceUserConfirmation";
const char* const kKeyBasebandResetType = "BasebandResetType";
const char* const kKeyBasebandResetSubType = "BasebandResetSubType";
const char* const kKeyTraceName = "TraceName";
const char* const kKeyTracePropertyName = "TracePropertyName";

const char* const kKeyTracePropertyValue = "TracePropertyValue";
const char* const kKeyTimestampString = "TimestampString";

const char* const kCollectTelephonyLogs = "CollectTelephonyLogs";
const char* const kCollectTelephonyLogsWithCoredump = "CollectTelephonyLogsWithCoredump";
const char* const kCollectBasebandLogs = "CollectBasebandLogs";
const char* const kBasebandResetTypeHard = "Hard";
const char* const kBasebandResetSubTypeOtherErrors = "OtherErrors";
const char* const kTraceBaseband = "BasebandTrace";
const char* const kTraceSystemLogs = "SystemLogs";
const char* const kKeyTraceEnabled = "Enabled";
const char* const kKeyTraceMode = "Mode";
const char* const kUnknown = "Unknown";

namespace helper {

const char* const kCommandVarniskStatus = "VarniskStatus";
const char* const kKeyTimeout = "Timeout";
const char* const kKeyTimestampString = "TimestampString";

}  // namespace helper
}  // namespace halvex
