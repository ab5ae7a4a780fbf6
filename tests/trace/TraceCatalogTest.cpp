// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <climits>
#include <functional>
#include <set>

#include "TraceTestSupport.h"
#include "halvex/trace/DeviceIdentity.h"
#include "halvex/trace/TraceCatalog.h"

namespace halvex::trace::tests {
namespace {

// Each radio-dependent rule against every radio type, on an internal build with tracing allowed:
// the radios it holds for, and that it asks the radio afresh while the permission stays cached.
TEST(TraceCatalog, RadioRulesAcrossEveryType) {
  const std::set<int> none = {INT_MIN, -1, 0, 11, INT_MAX};
  const std::tuple<const char*, std::function<bool()>, std::set<int>> rules[] = {
      {"nonPCI", isNonPCIRadio, {1, 2, 8}},
      {"PCI", isPCIRadio, {INT_MIN, -1, 0, 3, 4, 5, 6, 7, 9, 10, 11, INT_MAX}},
      {"not9Or10", isNotType9Or10Radio, {INT_MIN, -1, 0, 1, 2, 3, 4, 5, 6, 7, 8, 11, INT_MAX}},
      {"coreDumpStatus", isCoreDumpStatusSupported, {1, 2, 3, 8}},
      {"kernelPCI", isKernelPCITraceSupported, {3, 4, 5, 6, 7, 9, 10}},
      {"basebandIPC", [] { return isSupported(kBasebandIPC); }, {1, 2, 3, 4, 5, 6, 7, 8, 9, 10}},
      {"dumpLogIndication", isDumpLogIndicationSupported, {1, 2, 3, 4, 6, 8, 9}},
  };
  ASSERT_TRUE(isAllowed());
  for (const auto& [name, rule, holds] : rules) {
    for (int radio : {INT_MIN, -1, 0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, INT_MAX}) {
      useDevice({.radioType = radio, .internalBuild = true});
      EXPECT_EQ(rule(), holds.contains(radio)) << name << " radio " << radio;
      const Calls asked = std::string(name) == "dumpLogIndication"
                              ? Calls{"isInternalBuild", "getRadioType"}
                              : Calls{"getRadioType"};
      EXPECT_EQ(takeCalls(), asked) << name << " radio " << radio;
    }
  }
}

// The permission is asked only for a radio in range, once, and its first answer stands.
TEST(TraceCatalog, PermissionIsAskedOnlyInRangeAndOnlyOnce) {
  for (int radio : {-1, 0, 11}) {
    useDevice({.radioType = radio, .traceAllowed = false});
    EXPECT_FALSE(isKernelPCITraceSupported());
    EXPECT_FALSE(isSupported("basebandipc"));
    EXPECT_EQ(takeCalls(), (Calls{"getRadioType", "getRadioType"})) << "radio " << radio;
  }
  useDevice({.radioType = 8, .traceAllowed = false});
  EXPECT_FALSE(isKernelPCITraceSupported());
  EXPECT_EQ(takeCalls(), Calls{"getRadioType"});
  useDevice({.radioType = 9, .traceAllowed = false});
  EXPECT_FALSE(isSupported("BasebandIPC"));
  EXPECT_EQ(takeCalls(), (Calls{"getRadioType", "isTraceAllowed"}));
  useDevice({.radioType = 9, .traceAllowed = true});
  EXPECT_FALSE(isKernelPCITraceSupported());
  EXPECT_FALSE(isSupported("IPC"));
  EXPECT_EQ(takeCalls(), Calls{"getRadioType"});
}

// The catalogue once with tracing allowed and once, in its own process, with it denied. The
// first name that matches decides, and only its rule asks the platform.
class SupportedNames : public ::testing::TestWithParam<bool> {};

TEST_P(SupportedNames, FollowTheCatalogue) {
  const bool allowed = GetParam();
  struct Group {
    std::vector<std::string> names;
    int vendor;
    bool whenAllowed, whenDenied;
    const char* asks;
  };
  const char* const vendor = "getRadioVendor";
  const Group groups[] = {
      {{"Halvex", std::string("HALVEX\0junk", 11), "BASEBANDTRACE"}, 0, true, true, ""},
      {{"coredump", "pRoFiLe"}, 0, true, true, ""},
      {{"DIAG", "vimocoredump"}, 2, true, true, vendor},
      {{"QoroTrace", "QoroCoreDump"}, 1, true, true, vendor},
      {{"diag", "VimoCoreDump"}, 1, false, false, vendor},
      {{"qorotrace"}, 2, false, false, vendor},
      {{"qorocoredump"}, 3, false, false, vendor},
      {{"BasebandIPC"}, 0, true, false, "getRadioType"},
      {{"ipc", "COMPRESSION", "tixo", "SystemLogs", "ddt", "Settings"}, 0, true, false, ""},
      {{"CSILog", "TelephonyLog", "", "Halvex ", "Snaptrail"}, 2, false, false, ""},
  };
  useDevice({.radioType = 4, .traceAllowed = allowed});
  EXPECT_EQ(isAllowed(), allowed);
  for (const Group& group : groups) {
    for (const std::string& name : group.names) {
      SCOPED_TRACE('"' + name + "\" vendor " + std::to_string(group.vendor));
      useDevice({.radioType = 4, .radioVendor = group.vendor, .traceAllowed = allowed});
      EXPECT_EQ(isSupported(name), allowed ? group.whenAllowed : group.whenDenied);
      EXPECT_EQ(takeCalls(), *group.asks != '\0' ? Calls{group.asks} : Calls{});
    }
  }
}

INSTANTIATE_TEST_SUITE_P(Permission, SupportedNames, ::testing::Bool());

}  // namespace
}  // namespace halvex::trace::tests
