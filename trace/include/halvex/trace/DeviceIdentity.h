// SPDX-License-Identifier: MIT
// The trace library's view of the device: radio, vendor, product, build type, boot arguments,
// and the system-log context the library logs under.
//
// Radio type 0 means no baseband radio; 1 to 10 are the known models, anything else an unknown
// radio. Vendor code 1 is the Qoro baseband family, 2 the Vimo family.
//
// Every function may be called from any thread and never fails. The functions ask the platform
// afresh on every call, so build or radio changes show at once, except these, which keep their
// first answer until process exit (concurrent first callers wait for it):
//   getRadioModelName, getBootArgs, getGlobalLogContext, getGlobalLogger.
#pragma once

#include <memory>
#include <string>

#include "platform/SystemLog.h"

namespace halvex::trace {

// Products that may run without either telephony daemon: 58 to 61, 69 and 70.
bool isDaemonCheckExempt();

bool isQoroVendor();
bool isVimoVendor();

// Radio types 1, 2 and 8.
bool isNonPCIRadio();
// The exact complement of isNonPCIRadio(), so also true without a radio and for unknown radios.
bool isPCIRadio();
bool isNotType9Or10Radio();

// The model code of radio types 1 to 10, "Unknown" otherwise. Asks for the radio type once per
// process; "Unknown" is kept as well.
std::string getRadioModelName();

// Build types are independent flags; these combinations ask lazily, left to right.
bool isCarrierOnlyBuild();        // asks carrier, then internal only for a carrier build
bool isInternalOrCarrierBuild();  // asks internal, then carrier only for a non-internal build

// The "boot-args" device property, or "" when there is none. The device's property map is read
// once per process through one shared DevicePropertyService and never refreshed.
std::string getBootArgs();

// The library's log context: its subsystem and the category "global". Built once.
const LogContext& getGlobalLogContext();

// The library's logger. The first call binds it to server, for good; later calls return the
// same logger and ignore their argument.
const Logger& getGlobalLogger(const std::shared_ptr<LogServer>& server);

}  // namespace halvex::trace
