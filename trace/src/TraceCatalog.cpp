// SPDX-License-Identifier: MIT
#include "halvex/trace/TraceCatalog.h"

#include "halvex/trace/DeviceIdentity.h"
#include "platform/DeviceQueries.h"

namespace halvex::trace {

const char* const kHalvex = "Halvex";
const char* const kBasebandTrace = "BasebandTrace";
const char* const kCoreDump = "CoreDump";
const char* const kQoroTrace = "QoroTrace";
const char* const kQoroCoreDump = "QoroCoreDump";
const char* const kVimoCoreDump = "VimoCoreDump";
const char* const kDIAG = "DIAG";
const char* const kIPC = "IPC";
const char* const kBasebandIPC = "BasebandIPC";
const char* const kCSI = "CSILog";
const char* const kTEL = "TelephonyLog";
const char* const kCompression = "Compression";
const char* const kSnaptrail = "Tixo";
const char* const kSystemLogs = "SystemLogs";
const char* const kProfile = "Profile";
const char* const kTraceDDT = "DDT";

const char* const kTelvaneCrashReason = "** Telvane crash was detected";
const char* const kSnaptrailDumpingReason = "Snaptrail dumping";
const char* const kBasebandRemarkoDumpingReason = "Remarko dumping";

namespace {

// The library's own settings trace; not published.
const char* const kSettings = "Settings";

// Plain ASCII folding: a locale must not make two different names equal.
char foldAscii(char c) {
  return (c >= 'A' && c <= 'Z') ? static_cast<char>(c - 'A' + 'a') : c;
}

bool equalIgnoringAsciiCase(const char* a, const char* b) {
  for (; *a != '\0' && *b != '\0'; ++a, ++b) {
    if (foldAscii(*a) != foldAscii(*b)) {
      return false;
    }
  }
  return *a == *b;
}

bool always() {
  return true;
}

bool radioInRangeAndAllowed() {
  const int radio = device::getRadioType();
  return radio >= 1 && radio <= 10 && isAllowed();
}

struct Rule {
  const char* const& name;
  bool (*supported)();
};

// Searched in order; the first name that matches decides. Referencing the names keeps the table
// constant-initialized, so it is ready even for callers running during static initialization.
const Rule kRules[] = {
    {kHalvex, always},
    {kDIAG, isVimoVendor},
    {kQoroTrace, isQoroVendor},
    {kBasebandTrace, always},
    {kVimoCoreDump, isVimoVendor},
    {kQoroCoreDump, isQoroVendor},
    {kCoreDump, always},
    {kBasebandIPC, radioInRangeAndAllowed},
    {kIPC, isAllowed},
    {kCompression, isAllowed},
    {kSnaptrail, isAllowed},
    {kSystemLogs, isAllowed},
    {kProfile, always},
    {kTraceDDT, isAllowed},
    {kSettings, isAllowed},
};

// Whether bit `index` of a mask `width` bits wide is set. Callers subtract in unsigned
// arithmetic, so radio types below the mask's first type wrap to huge indexes and fall outside.
bool inMask(unsigned mask, unsigned width, unsigned index) {
  return index < width && ((mask >> index) & 1u) != 0;
}

}  // namespace

bool isAllowed() {
  static const bool allowed = device::isTraceAllowed();
  return allowed;
}

bool isSupported(std::string name) {  // NOLINT(performance-unnecessary-value-param)
  for (const Rule& rule : kRules) {
    if (equalIgnoringAsciiCase(name.c_str(), rule.name)) {
      return rule.supported();
    }
  }
  return false;
}

bool isKernelPCITraceSupported() {
  return inMask(0x6F8u, 11, static_cast<unsigned>(device::getRadioType())) && isAllowed();
}

bool isCoreDumpStatusSupported() {
  return inMask(0x87u, 8, static_cast<unsigned>(device::getRadioType()) - 1u);
}

bool isDumpLogIndicationSupported() {
  return isInternalOrCarrierBuild() &&
         inMask(0x1AFu, 9, static_cast<unsigned>(device::getRadioType()) - 1u);
}

}  // namespace halvex::trace
