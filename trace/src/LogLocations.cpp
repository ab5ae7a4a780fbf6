// SPDX-License-Identifier: MIT
#include "halvex/trace/LogLocations.h"

#include "halvex/trace/DeviceIdentity.h"

namespace halvex::trace {

const char* const kScratchFolder = "/var/wireless/Library/Logs/Halvex/";
const char* const kTrashFolder = "/var/wireless/Library/Logs/halvex.trash/";
const char* const kSnapshotFolder = "/var/wireless/Library/Logs/Faultkeep/Baseband/";
const char* const kWorkspaceFolder = "/var/wireless/Library/Logs/halvex.workspace/";
const char* const kUncompressedFolder = "/var/wireless/Library/Logs/halvex.workspace/uncompressed/";
const char* const kPendingCompressionFolder =
    "/var/wireless/Library/Logs/halvex.workspace/pending/";
const char* const kMobileFaultkeepFolder = "/var/mobile/Library/Logs/Faultkeep/";
const char* const kVarniskFolder = "/var/mobile/Library/Logs/Faultkeep/DiagnosticLogs/varnisk/";

const char* const kDumpIndicationFilePath = "/tmp/Halvex.dumping";
const char* const kNumberOfLogsInSnapshotPath = "Trace::NumberOfLogsInSnapshotPath";

const char* const kLogPrefixCommon = "log-";
const char* const kLogDirPrefix = "log-bb-";
const char* const kLogTVCrashPrefix = "log-tv-";
const char* const kVarniskPrefix = "varnisk_";
const char* const kHalvexPostfix = "halvex";
const char* const kHalvexLogSummaryExtension = ".json";
const char* const kLogPackageExtension = ".tar.gz";
const char* const kDDTFilePostFix = "-ddt";

const char* const kQoroTraceSnapshotDirectorySuffix = "-bb-trace";
const char* const kVimoTraceSnapshotDirectorySuffix = "-diag";
const char* const kQoroCoreDumpSnapshotDirectorySuffix = "-coredump";
const char* const kVimoCoreDumpSnapshotDirectorySuffix = "-cd";

std::string getBasebandTraceDirSuffix() {
  static const std::string suffix =
      isQoroVendor() ? kQoroTraceSnapshotDirectorySuffix : kVimoTraceSnapshotDirectorySuffix;
  return suffix;
}

std::string getCoreDumpDirSuffix() {
  static const std::string suffix =
      isQoroVendor() ? kQoroCoreDumpSnapshotDirectorySuffix : kVimoCoreDumpSnapshotDirectorySuffix;
  return suffix;
}

}  // namespace halvex::trace
