// SPDX-License-Identifier: MIT
// Names and defaults of the baseband's diagnostic ("DIAG") logging settings. Only the names are
// published here; where the settings are stored and who reads them is up to their users.
#pragma once

#include <cstdint>

namespace diag::config {

// Setting keys. "Buffering_On_AP_Awake" has always been published without a "Key" ending, and
// users spell it that way.
extern const char* const kTempEnabledKey;
extern const char* const kTempModeKey;
extern const char* const kPrimaryDMCFileKey;
extern const char* const kSecondaryDMCFileKey;
extern const char* const kExtraDMCFileKey;
extern const char* const kSleepDMCFileKey;
extern const char* const kEnabledDuringSleepKey;
extern const char* const kUseThresholdKey;
extern const char* const kHighWatermarkKey;
extern const char* const kLowWatermarkKey;
extern const char* const kBufferingOnAPAwake;
extern const char* const kStallDetectionKey;
extern const char* const kStallDetectionRecoveryKey;
extern const char* const kKeepScratchLogsKey;

// DMC file choices. "None" means no file.
extern const char* const kDefaultPrimaryDMCFile;
extern const char* const kDefaultSecondaryDMCFile;
extern const char* const kDefaultExtraDMCFile;
extern const char* const kDefaultSleepDMCFile;
extern const char* const kThroughputDMCFile;
extern const char* const kNoneDMCFile;

// Folder names directly inside halvex::trace::kScratchFolder (LogLocations.h), no trailing "/".
extern const char* const kDIAGScratchDir;
extern const char* const kADPLScratchDir;

// Numeric defaults. Flags are 1 for on and 0 for off.
inline constexpr std::int32_t kDefaultMode = 0;  // Mode::kActiveOnAP
inline constexpr std::int32_t kDefaultHistory = 256;
inline constexpr std::int32_t kDefaultWatchHistory = 64;
inline constexpr std::int32_t kMaxHistory = 2048;
inline constexpr std::int32_t kDefaultADPLHistory = 128;
inline constexpr std::int32_t kDefaultUseThreshold = 1;
inline constexpr std::int32_t kDefaultHighWatermark = 95;
inline constexpr std::int32_t kDefaultLowWatermark = 1;
inline constexpr std::int32_t kDefaultStallDetection = 0;

// The values are stored settings: never renumber them.
enum class Mode : std::int32_t {
  kActiveOnAP = 0,
  kActiveExternalThroughDock = 1,
  kPassiveExternalThroughDock = 2,
  kPassiveExternalThroughSoftware = 3,
  kPassiveOnAP = 4,
};

// Logging while the application processor sleeps.
enum class DuringAPSleep : std::int32_t {
  kOff = 0,
  kFull = 1,
  kLite = 2,
};

// What is done when a stall is detected.
enum class Recovery : std::int32_t {
  kNone = 0,
  kResetBaseband = 1,
  kReconfigure = 2,
};

// Display texts. Values read from storage may be anything, so every value outside the
// enumeration, negative ones included, gives "Unknown". Never null; the text is static.
const char* toString(Mode mode);
const char* toString(DuringAPSleep behaviour);
const char* toString(Recovery recovery);

// True when diagnostic logging must always be filtered: on builds that are none of carrier,
// internal and vendor. Asks the platform for all three build flags on every call.
bool getShouldAlwaysFilter();

}  // namespace diag::config
