// SPDX-License-Identifier: MIT
// What the simulator writes for a person to find from the tool's "Path = ..." line (the writing
// itself shows on the bus, in SimBusTest).
#include <gtest/gtest.h>

#include <filesystem>

#include "halvex/trace/DiagConfig.h"
#include "halvex/trace/LogLocations.h"
#include "platform/ServerProtocol.h"
#include "sim/LogSetWriter.h"
#include "tests/support/TestBus.h"

namespace halvex::sim {
namespace {

namespace fs = std::filesystem;
const std::string kBase = "/var/wireless/Library/Logs/Faultkeep/Baseband/log-bb-T1";

TEST(LogSetPaths, MatchTheToolsOwnLocations) {
  EXPECT_EQ(paths::kSnapshotFolder, trace::kSnapshotFolder);
  EXPECT_EQ(paths::kScratchFolder, trace::kScratchFolder);
  EXPECT_EQ(paths::kDIAGScratchDir, diag::config::kDIAGScratchDir);
  EXPECT_EQ(paths::kLogDirPrefix, trace::kLogDirPrefix);
  EXPECT_EQ(paths::kLogPackageExtension, trace::kLogPackageExtension);
  EXPECT_EQ(paths::kQoroTraceSuffix, trace::kQoroTraceSnapshotDirectorySuffix);
  EXPECT_EQ(paths::kVimoTraceSuffix, trace::kVimoTraceSnapshotDirectorySuffix);
  EXPECT_EQ(paths::kQoroCoreDumpSuffix, trace::kQoroCoreDumpSnapshotDirectorySuffix);
  EXPECT_EQ(paths::kVimoCoreDumpSuffix, trace::kVimoCoreDumpSnapshotDirectorySuffix);
}

TEST(LogSetPaths, FollowTheFormTheToolPrints) {
  // What the tool prints and what is written, after kBase.
  const std::tuple<const char*, bool, std::int64_t, std::string, std::string, bool> cases[] = {
      {kCollectTelephonyLogs, true, 2, ".tar.gz", ".tar.gz", true},
      {kCollectTelephonyLogs, false, 2, "-*", "-tel", false},
      {kCollectTelephonyLogsWithCoredump, false, 1, "-*", "-coredump", false},
      {kCollectTelephonyLogsWithCoredump, true, 2, "-*", "-cd.tar.gz", true},
      {kCollectBasebandLogs, true, 1, ".tar.gz", ".tar.gz", true},
      {kCollectBasebandLogs, false, 1, "-bb-trace", "-bb-trace", false},
      {kCollectBasebandLogs, false, 0, "-diag", "-diag", false},
  };
  for (const auto& [action, compression, vendor, printed, written, package] : cases) {
    MessageDict request;
    request.set(kKeyTraceAction, MessageValue::string(action));
    request.set(kKeyTraceDumpStatePerformCompression, MessageValue::boolean(compression));
    const auto set = logSetForDump(request, "T1", vendor);
    ASSERT_TRUE(set.has_value()) << action;
    EXPECT_EQ(std::tie(set->printed, set->written, set->package),
              std::make_tuple(kBase + printed, kBase + written, package))
        << action << " " << compression << " " << vendor;
  }
  MessageDict other;
  other.set(kKeyTraceAction, MessageValue::string("SomethingElse"));
  EXPECT_FALSE(logSetForDump(other, "T1", 1).has_value());
  // A compression flag of the wrong type counts as not asked for.
  MessageDict odd;
  odd.set(kKeyTraceAction, MessageValue::string(kCollectTelephonyLogs));
  odd.set(kKeyTraceDumpStatePerformCompression, MessageValue::string("true"));
  EXPECT_EQ(logSetForDump(odd, "T1", 1)->written, kBase + "-tel");
  EXPECT_EQ(logSetForHelper("T1", 1).printed, kBase + "-bb-trace");
  EXPECT_EQ(logSetForHelper("T1", 2).written, kBase + "-diag");
}

TEST(LogSetWriter, RefusesATimestampThatLeavesTheSnapshotFolder) {
  halvex::test::TempDir root;
  const LogSetWriter writer((root.path() / "device").string());
  const LogSet escape = logSetForHelper("x/../../../../../../../escaped", 1);
  EXPECT_FALSE(writer.write(escape, ""));
  EXPECT_FALSE(fs::exists(root.path() / "escaped-bb-trace"));
  EXPECT_FALSE(fs::exists(root.path() / "device/var/wireless/Library/Logs/escaped-bb-trace"));
}

}  // namespace
}  // namespace halvex::sim
