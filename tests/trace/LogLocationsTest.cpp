// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <string>

#include "TraceTestSupport.h"
#include "halvex/trace/DeviceIdentity.h"
#include "halvex/trace/DiagConfig.h"
#include "halvex/trace/LogLocations.h"

namespace halvex::trace::tests {
namespace {

class SnapshotSuffixes : public ::testing::TestWithParam<int> {};

TEST_P(SnapshotSuffixes, FollowTheFirstVendorAnswerOfEachFunction) {
  const int vendor = GetParam();
  const bool qoro = vendor == 1;
  useDevice({.radioVendor = vendor});
  EXPECT_EQ(isQoroVendor(), qoro);
  EXPECT_EQ(isVimoVendor(), vendor == 2);
  takeCalls();

  EXPECT_EQ(getCoreDumpDirSuffix(), qoro ? "-coredump" : "-cd");
  EXPECT_EQ(takeCalls(), Calls{"getRadioVendor"});
  EXPECT_EQ(getBasebandTraceDirSuffix(), qoro ? "-bb-trace" : "-diag");
  EXPECT_EQ(takeCalls(), Calls{"getRadioVendor"});

  useDevice({.radioVendor = qoro ? 2 : 1});
  EXPECT_EQ(getCoreDumpDirSuffix(), qoro ? "-coredump" : "-cd");
  EXPECT_EQ(getBasebandTraceDirSuffix(), qoro ? "-bb-trace" : "-diag");
  EXPECT_EQ(takeCalls(), Calls{});
}

INSTANTIATE_TEST_SUITE_P(Vendors, SnapshotSuffixes, ::testing::Values(0, 1, 2, 3));

// The names the tool reports after a collection, built the way it builds them.
TEST(LogLocations, ComposedNamesReadAsOnTheDevice) {
  useDevice({.radioVendor = 2});
  const std::string stamp = "2024-01-02-03-04-05";
  const std::string snapshot = std::string(kSnapshotFolder) + kLogDirPrefix + stamp;
  EXPECT_EQ(snapshot + kLogPackageExtension,
            "/var/wireless/Library/Logs/Faultkeep/Baseband/log-bb-2024-01-02-03-04-05.tar.gz");
  EXPECT_EQ(snapshot + getBasebandTraceDirSuffix(),
            "/var/wireless/Library/Logs/Faultkeep/Baseband/log-bb-2024-01-02-03-04-05-diag");
  EXPECT_EQ(std::string(kScratchFolder) + diag::config::kDIAGScratchDir,
            "/var/wireless/Library/Logs/Halvex/DIAG.scratch");
}

}  // namespace
}  // namespace halvex::trace::tests
