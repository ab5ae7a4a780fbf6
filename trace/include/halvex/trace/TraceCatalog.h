// SPDX-License-Identifier: MIT
// The catalogue of trace names and the rules that decide which traces this device supports.
//
// Trace names are matched ignoring ASCII letter case; the constants hold their canonical forms.
// Every rule asks the platform afresh on each call (radio type, vendor, build type), except the
// trace permission, which is asked once per process by isAllowed() and kept until exit: every rule
// that depends on the permission reads it through isAllowed(), so the platform is asked at most
// once. All functions may be called from any thread, never fail and never throw.
#pragma once

#include <string>

namespace halvex::trace {

// Trace names.
extern const char* const kHalvex;
extern const char* const kBasebandTrace;
extern const char* const kCoreDump;
extern const char* const kQoroTrace;
extern const char* const kQoroCoreDump;
extern const char* const kVimoCoreDump;
extern const char* const kDIAG;
extern const char* const kIPC;
extern const char* const kBasebandIPC;
extern const char* const kCSI;
extern const char* const kTEL;
extern const char* const kCompression;
extern const char* const kSnaptrail;
extern const char* const kSystemLogs;
extern const char* const kProfile;
// Files of this trace carry kDDTFilePostFix (LogLocations.h).
extern const char* const kTraceDDT;

// Causes a log dump can record.
extern const char* const kTelvaneCrashReason;
extern const char* const kSnaptrailDumpingReason;
extern const char* const kBasebandRemarkoDumpingReason;

// The platform's trace permission. Asked on the first call only; concurrent first callers wait
// for that one answer.
bool isAllowed();

// Whether the named trace is supported on this device. The name is compared as a C string, so
// anything after an embedded NUL is ignored. Names outside the catalogue, including kCSI and kTEL,
// are never supported.
bool isSupported(std::string name);

// Radio types 3 to 7, 9 and 10, and only while tracing is allowed. Other radios do not consult
// the permission at all.
bool isKernelPCITraceSupported();

// Radio types 1, 2, 3 and 8.
bool isCoreDumpStatusSupported();

// Internal or carrier builds with radio type 1, 2, 3, 4, 6, 8 or 9; other builds never ask for
// the radio type. The indication itself is the file kDumpIndicationFilePath (LogLocations.h).
bool isDumpLogIndicationSupported();

}  // namespace halvex::trace
