// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <climits>

#include "TraceTestSupport.h"
#include "halvex/trace/DeviceIdentity.h"
#include "halvex/trace/TraceCatalog.h"

namespace halvex::trace::tests {
namespace {

// Radio-dependent rules on an internal build with tracing allowed.
TEST(TraceCatalog, RadioRulesAcrossEveryType) {
  struct Row {
    int radio;
    bool nonPCI, not9Or10, coreDumpStatus, dumpLogIndication, kernelPCI, basebandIPC;
  };
  const Row rows[] = {
      {INT_MIN, false, true, false, false, false, false},
      {-1, false, true, false, false, false, false},
      {0, false, true, false, false, false, false},
      {1, true, true, true, true, false, true},
      {2, true, true, true, true, false, true},
      {3, false, true, true, true, true, true},
      {4, false, true, false, true, true, true},
      {5, false, true, false, false, true, true},
      {6, false, true, false, true, true, true},
      {7, false, true, false, false, true, true},
      {8, true, true, true, true, false, true},
      {9, false, false, false, true, true, true},
      {10, false, false, false, false, true, true},
      {11, false, true, false, false, false, false},
      {INT_MAX, false, true, false, false, false, false},
  };
  ASSERT_TRUE(isAllowed());
  for (const Row& row : rows) {
    SCOPED_TRACE(::testing::Message() << "radio " << row.radio);
    useDevice({.radioType = row.radio, .internalBuild = true});
    EXPECT_EQ(isNonPCIRadio(), row.nonPCI);
    EXPECT_EQ(isPCIRadio(), !row.nonPCI);
    EXPECT_EQ(isNotType9Or10Radio(), row.not9Or10);
    EXPECT_EQ(isCoreDumpStatusSupported(), row.coreDumpStatus);
    EXPECT_EQ(isKernelPCITraceSupported(), row.kernelPCI);
    EXPECT_EQ(isSupported(kBasebandIPC), row.basebandIPC);
    EXPECT_EQ(isDumpLogIndicationSupported(), row.dumpLogIndication);
    // Each rule asks the radio afresh; the permission stays cached.
    const Calls radioOnly(6, "getRadioType");
    Calls expected = radioOnly;
    expected.insert(expected.end(), {"isInternalBuild", "getRadioType"});
    EXPECT_EQ(takeCalls(), expected);
  }
}

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

  // A later grant is not seen: the first answer stands for the whole process.
  useDevice({.radioType = 9, .traceAllowed = true});
  EXPECT_FALSE(isKernelPCITraceSupported());
  EXPECT_FALSE(isSupported("IPC"));
  EXPECT_FALSE(isAllowed());
  EXPECT_EQ(takeCalls(), Calls{"getRadioType"});
}

// The catalogue once with tracing allowed and once, in its own process, with it denied.
class SupportedNames : public ::testing::TestWithParam<bool> {};

TEST_P(SupportedNames, FollowTheCatalogue) {
  const bool allowed = GetParam();
  struct Row {
    std::string name;
    int vendor;
    bool whenAllowed, whenDenied;
    Calls calls;
  };
  const Calls vendor{"getRadioVendor"};
  const Row rows[] = {
      {"Halvex", 0, true, true, {}},
      {"hALVEX", 3, true, true, {}},
      {std::string("HALVEX\0junk", 11), 0, true, true, {}},
      {"BASEBANDTRACE", 0, true, true, {}},
      {"coredump", 0, true, true, {}},
      {"pRoFiLe", 0, true, true, {}},
      {"DIAG", 2, true, true, vendor},
      {"diag", 1, false, false, vendor},
      {"Diag", 0, false, false, vendor},
      {"QoroTrace", 1, true, true, vendor},
      {"qorotrace", 2, false, false, vendor},
      {"QOROTRACE", 0, false, false, vendor},
      {"vimocoredump", 2, true, true, vendor},
      {"VimoCoreDump", 1, false, false, vendor},
      {"QoroCoreDump", 1, true, true, vendor},
      {"qorocoredump", 3, false, false, vendor},
      {"BasebandIPC", 0, true, false, {"getRadioType"}},
      {"ipc", 0, true, false, {}},
      {"COMPRESSION", 0, true, false, {}},
      {"tixo", 0, true, false, {}},
      {"SystemLogs", 0, true, false, {}},
      {"ddt", 0, true, false, {}},
      {"Settings", 0, true, false, {}},
      {"CSILog", 2, false, false, {}},
      {"TelephonyLog", 2, false, false, {}},
      {"", 0, false, false, {}},
      {"Halvex ", 0, false, false, {}},
      {"Snaptrail", 0, false, false, {}},
  };
  useDevice({.radioType = 4, .traceAllowed = allowed});
  EXPECT_EQ(isAllowed(), allowed);
  for (const Row& row : rows) {
    useDevice({.radioType = 4, .radioVendor = row.vendor, .traceAllowed = allowed});
    EXPECT_EQ(isSupported(row.name), allowed ? row.whenAllowed : row.whenDenied)
        << '"' << row.name << "\" vendor " << row.vendor;
    EXPECT_EQ(takeCalls(), row.calls) << '"' << row.name << '"';
  }
}

INSTANTIATE_TEST_SUITE_P(Permission, SupportedNames, ::testing::Bool());

}  // namespace
}  // namespace halvex::trace::tests
