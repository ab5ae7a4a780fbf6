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

struct DumpCase {
  const char* action;
  bool compression;
  std::int64_t vendor;
  std::string printed;
  std::string written;
  bool package;
};

TEST(LogSetPaths, FollowTheFormTheToolPrints) {
  const DumpCase cases[] = {
      {kCollectTelephonyLogs, true, 2, kBase + ".tar.gz", kBase + ".tar.gz", true},
      {kCollectTelephonyLogs, false, 2, kBase + "-*", kBase + "-tel", false},
      {kCollectTelephonyLogsWithCoredump, false, 1, kBase + "-*", kBase + "-coredump", false},
      {kCollectTelephonyLogsWithCoredump, true, 2, kBase + "-*", kBase + "-cd.tar.gz", true},
      {kCollectBasebandLogs, true, 1, kBase + ".tar.gz", kBase + ".tar.gz", true},
      {kCollectBasebandLogs, false, 1, kBase + "-bb-trace", kBase + "-bb-trace", false},
      {kCollectBasebandLogs, false, 0, kBase + "-diag", kBase + "-diag", false},
  };
  for (const DumpCase& c : cases) {
    SCOPED_TRACE(std::string(c.action) + (c.compression ? " compressed" : " plain") + " vendor " +
                 std::to_string(c.vendor));
    MessageDict request;
    request.set(kKeyTraceAction, MessageValue::string(c.action));
    request.set(kKeyTraceDumpStatePerformCompression, MessageValue::boolean(c.compression));
    const auto set = logSetForDump(request, "T1", c.vendor);
    ASSERT_TRUE(set.has_value());
    EXPECT_EQ(set->printed, c.printed);
    EXPECT_EQ(set->written, c.written);
    EXPECT_EQ(set->package, c.package);
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
