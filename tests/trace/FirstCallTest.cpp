// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <functional>
#include <latch>
#include <ostream>
#include <string>
#include <thread>
#include <vector>

#include "TraceTestSupport.h"
#include "halvex/trace/DeviceIdentity.h"
#include "halvex/trace/LogLocations.h"
#include "halvex/trace/TraceCatalog.h"

namespace halvex::trace::tests {
namespace {

struct FirstCall {
  const char* name;
  std::function<std::string()> call;
  std::string expected;  // empty: any value, as long as every thread gets it
  Calls queries;
};

// Names the case in test output instead of dumping its bytes.
void PrintTo(const FirstCall& first, std::ostream* out) {
  *out << first.name;
}

class CachedFirstCall : public ::testing::TestWithParam<FirstCall> {};

// Many threads make the first call at once: the platform is asked once and all see one value.
TEST_P(CachedFirstCall, RunsOnceForConcurrentCallers) {
  const FirstCall& first = GetParam();
  useDevice({.radioType = 3, .radioVendor = 1, .properties = {{"boot-args", "-v"}}});
  constexpr int kThreads = 8;
  std::latch start(kThreads);
  std::vector<std::string> results(kThreads);
  std::vector<std::thread> threads;
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&, i] {
      start.arrive_and_wait();
      results[static_cast<std::size_t>(i)] = first.call();
    });
  }
  for (auto& thread : threads) {
    thread.join();
  }
  EXPECT_EQ(takeCalls(), first.queries);
  EXPECT_EQ(results, std::vector<std::string>(kThreads, results[0]));
  if (!first.expected.empty()) {
    EXPECT_EQ(results[0], first.expected);
  }
}

INSTANTIATE_TEST_SUITE_P(
    Caches, CachedFirstCall,
    ::testing::Values(
        FirstCall{"RadioModelName", getRadioModelName, "", {"getRadioType"}},
        FirstCall{
            "BootArgs", getBootArgs, "-v", {"DevicePropertyService::create", "getPropertyMap"}},
        FirstCall{"Permission",
                  [] { return std::string(isAllowed() ? "yes" : "no"); },
                  "yes",
                  {"isTraceAllowed"}},
        FirstCall{"TraceDirSuffix", getBasebandTraceDirSuffix, "-bb-trace", {"getRadioVendor"}},
        FirstCall{"CoreDumpDirSuffix", getCoreDumpDirSuffix, "-coredump", {"getRadioVendor"}}),
    [](const auto& test) { return std::string(test.param.name); });

}  // namespace
}  // namespace halvex::trace::tests
