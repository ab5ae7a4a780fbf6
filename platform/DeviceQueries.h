// SPDX-License-Identifier: MIT
// Questions about the device the program runs on. Each call asks afresh; nothing is cached
// here. All functions may be called from any thread and never fail: a device that cannot answer
// reads as having no radio (type 0), vendor and product 0, and every build flag false.
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
