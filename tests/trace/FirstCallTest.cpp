// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <climits>
#include <functional>
#include <latch>
#include <ostream>
#include <regex>
#include <string>
#include <thread>
#include <vector>

#include "TraceTestSupport.h"
#include "halvex/trace/DeviceIdentity.h"
#include "halvex/trace/LogLocations.h"
#include "halvex/trace/TraceCatalog.h"

namespace halvex::trace::tests {
namespace {

// A value the library takes from the platform once per process: the device it first meets, the
// answer it must give there (a regular expression) and the only query that answer may take.
struct FirstCall {
  std::string name;
  std::function<std::string()> call;
  fake::Device device;
  std::string answer;
  Calls queries;
};

// Names the case in test listings instead of dumping its bytes.
void PrintTo(const FirstCall& first, std::ostream* out) {
  *out << first.name;
}

std::vector<FirstCall> firstCalls() {
  std::vector<FirstCall> all;
  const auto add = [&all](std::string name, std::function<std::string()> call, fake::Device device,
                          std::string answer, Calls queries) {
    all.push_back({std::move(name), std::move(call), std::move(device), std::move(answer),
                   std::move(queries)});
  };
  const Calls properties = {"DevicePropertyService::create", "getPropertyMap"};
  add("BootArgs", getBootArgs, {.properties = {{"boot-args", "-v"}, {"x", "y"}}}, "-v", properties);
  add("NoBootArgs", getBootArgs, {.properties = {{"x", "y"}}}, "", properties);
  const auto allowed = [] { return std::string(isAllowed() ? "yes" : "no"); };
  add("Allowed", allowed, {}, "yes", {"isTraceAllowed"});
  add("Denied", allowed, {.traceAllowed = false}, "no", {"isTraceAllowed"});
  for (int radio : {INT_MIN, -1, 0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11}) {
    // Known radios have a code of two to five letters or digits, at most one of them a dot.
    std::string id = std::to_string(radio);
    id.replace(0, radio < 0 ? 1U : 0U, radio < 0 ? "Minus" : "");
    add("RadioModel" + id, getRadioModelName, {.radioType = radio},
        radio >= 1 && radio <= 10 ? R"((?=.{2,5}$)[A-Za-z0-9]*\.?[A-Za-z0-9]*)" : "Unknown",
        {"getRadioType"});
  }
  for (int vendor : {0, 1, 2, 3}) {
    const std::string id = std::to_string(vendor);
    add("TraceSuffixOfVendor" + id, getBasebandTraceDirSuffix, {.radioVendor = vendor},
        vendor == 1 ? "-bb-trace" : "-diag", {"getRadioVendor"});
    add("CoreDumpSuffixOfVendor" + id, getCoreDumpDirSuffix, {.radioVendor = vendor},
        vendor == 1 ? "-coredump" : "-cd", {"getRadioVendor"});
  }
  return all;
}

class CachedFirstCall : public ::testing::TestWithParam<FirstCall> {};

// Many threads make the first call at once: the platform is asked once and all see one value,
// which stays when the device changes later.
TEST_P(CachedFirstCall, AsksOnceAndKeepsTheAnswer) {
  const FirstCall& first = GetParam();
  useDevice(first.device);
  constexpr int kThreads = 8;
  std::latch start(kThreads);
  std::vector<std::string> results(kThreads);
  {
    std::vector<std::jthread> threads;
    for (std::size_t i = 0; i < kThreads; ++i) {
      threads.emplace_back([&, i] {
        start.arrive_and_wait();
        results[i] = first.call();
      });
    }
  }
  EXPECT_EQ(takeCalls(), first.queries);
  EXPECT_EQ(results, std::vector<std::string>(kThreads, results[0]));
  EXPECT_TRUE(std::regex_match(results[0], std::regex(first.answer))) << results[0];
  useDevice({.radioType = first.device.radioType == 5 ? 6 : 5,
             .radioVendor = first.device.radioVendor == 1 ? 2 : 1,
             .traceAllowed = !first.device.traceAllowed,
             .properties = {{"boot-args", "changed"}}});
  EXPECT_EQ(first.call(), results[0]);
  EXPECT_EQ(takeCalls(), Calls{});
}

INSTANTIATE_TEST_SUITE_P(Caches, CachedFirstCall, ::testing::ValuesIn(firstCalls()),
                         [](const auto& test) { return test.param.name; });

}  // namespace
}  // namespace halvex::trace::tests
