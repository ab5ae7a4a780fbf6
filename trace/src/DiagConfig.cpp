// SPDX-License-Identifier: MIT
#include "halvex/trace/DiagConfig.h"

#include <cstddef>
#include <cstdint>

#include "platform/DeviceQueries.h"

namespace diag::config {

const char* const kTempEnabledKey = "Enabled_Temp";
const char* const kTempModeKey = "Mode_Temp";
const char* const kPrimaryDMCFileKey = "File";
const char* const kSecondaryDMCFileKey = "File_Secondary";
const char* const kExtraDMCFileKey = "File_Extra";
const char* const kSleepDMCFileKey = "File_Sleep";
const char* const kEnabledDuringSleepKey = "Enabled_During_Sleep";
const char* const kUseThresholdKey = "Use_Threshold";
const char* const kHighWatermarkKey = "High_Watermark";
const char* const kLowWatermarkKey = "Low_Watermark";
const char* const kBufferingOnAPAwake = "Buffering_On_AP_Awake";
const char* const kStallDetectionKey = "Stall_Detection";
const char* const kStallDetectionRecoveryKey = "Stall_Detection_Recovery";
const char* const kKeepScratchLogsKey = "KeepScratchLogs";

const char* const kDefaultPrimaryDMCFile = "Default";
const char* const kDefaultSecondaryDMCFile = "None";
const char* const kDefaultExtraDMCFile = "None";
const char* const kDefaultSleepDMCFile = "Sleep";
const char* const kThroughputDMCFile = "Tput";
const char* const kNoneDMCFile = "None";

const char* const kDIAGScratchDir = "DIAG.scratch";
const char* const kADPLScratchDir = "DPL.scratch";

namespace {

// Indexed by enumerator value.
const char* const kModeTexts[] = {
    "Active on AP",
    "Active external through dock",
    "Passive external through dock",
    "Passive external through software",
    "Passive on AP",
};
const char* const kDuringAPSleepTexts[] = {"Off", "Full", "Lite"};
const char* const kRecoveryTexts[] = {"None", "Reset Baseband", "Reconfigure"};

// Read as unsigned, negative values land beyond every table.
template <typename Enum, std::size_t N>
const char* textOf(Enum value, const char* const (&texts)[N]) {
  const auto index = static_cast<std::uint32_t>(value);
  return index < N ? texts[index] : "Unknown";
}

}  // namespace

const char* toString(Mode mode) {
  return textOf(mode, kModeTexts);
}

const char* toString(DuringAPSleep behaviour) {
  return textOf(behaviour, kDuringAPSleepTexts);
}

const char* toString(Recovery recovery) {
  return textOf(recovery, kRecoveryTexts);
}

bool getShouldAlwaysFilter() {
  // All three flags are asked every time, in this order, with no short cut.
  const bool carrier = halvex::device::isCarrierBuild();
  const bool internal = halvex::device::isInternalBuild();
  const bool vendor = halvex::device::isVendorBuild();
  return !carrier && !internal && !vendor;
}

}  // namespace diag::config
