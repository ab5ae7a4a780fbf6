// SPDX-License-Identifier: MIT
// Questions about the device the program runs on. All functions may be called from any thread and
// never fail: a device that cannot answer reads as having no radio (type 0), vendor and product 0,
// and every build flag false.
//
// What is kept: the identity (the seven answers from getRadioType to isTraceAllowed) may be kept
// between calls, but never an identity that could not be asked, and a change shows at the first
// call after the backend can know of it. The Linux backend keeps the device service's last answer
// and drops it when the service signals that its identity changed, leaves the bus, or another
// process takes its name, or when the connection to the bus closes. isProcessRunning and
// getProgramName look afresh at every call.
#pragma once

#include <string>

namespace halvex::device {

int getRadioType();
int getRadioVendor();
int getProductType();
bool isInternalBuild();
bool isCarrierBuild();
bool isVendorBuild();
bool isTraceAllowed();

// True when a process whose name is exactly name is running.
bool isProcessRunning(const std::string& name);

// The name the process was started under, without directories.
std::string getProgramName();

}  // namespace halvex::device
