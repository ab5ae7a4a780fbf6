// SPDX-License-Identifier: MIT
// Where baseband and telephony logs live on the device and how their folders and files are
// named. Every folder path is absolute and ends with "/". The two scratch-folder names that lie
// inside kScratchFolder are diag::config::kDIAGScratchDir and kADPLScratchDir (DiagConfig.h).
//
// A collected log set is named by plain concatenation with the time-stamp text T that the server
// or helper hands back:
//   package: kSnapshotFolder + kLogDirPrefix + T + kLogPackageExtension (no folder suffix)
//   folder:  kSnapshotFolder + kLogDirPrefix + T + getBasebandTraceDirSuffix()
#pragma once

#include <string>

namespace halvex::trace {

// Folders. The snapshot tree belongs to the wireless user, the crash-reporting and whole-system
// diagnostic trees to the mobile user.
extern const char* const kScratchFolder;
extern const char* const kTrashFolder;
extern const char* const kSnapshotFolder;
extern const char* const kWorkspaceFolder;
extern const char* const kUncompressedFolder;
extern const char* const kPendingCompressionFolder;
extern const char* const kMobileFaultkeepFolder;
extern const char* const kVarniskFolder;

// Files and keys.
extern const char* const kDumpIndicationFilePath;
// The trace property holding how many logs the snapshot folder keeps.
extern const char* const kNumberOfLogsInSnapshotPath;

// Name parts.
extern const char* const kLogPrefixCommon;
extern const char* const kLogDirPrefix;
extern const char* const kLogTVCrashPrefix;
extern const char* const kVarniskPrefix;
extern const char* const kHalvexPostfix;
extern const char* const kHalvexLogSummaryExtension;
extern const char* const kLogPackageExtension;
extern const char* const kDDTFilePostFix;

// Snapshot-folder suffixes: the Qoro pair for radio vendor code 1, the Vimo pair for any other.
extern const char* const kQoroTraceSnapshotDirectorySuffix;
extern const char* const kVimoTraceSnapshotDirectorySuffix;
extern const char* const kQoroCoreDumpSnapshotDirectorySuffix;
extern const char* const kVimoCoreDumpSnapshotDirectorySuffix;

// The suffix of a baseband trace (resp. core-dump) snapshot folder, chosen by the radio vendor.
// Each function asks for the vendor once, on its own first call, and keeps its choice until
// process exit: a later change of vendor is not seen. Safe from any thread; concurrent first
// callers wait for the one choice.
std::string getBasebandTraceDirSuffix();
std::string getCoreDumpDirSuffix();

}  // namespace halvex::trace
