// SPDX-License-Identifier: MIT
// The trace library's device-dependent rules and cached values, on the fake platform: each test
// starts from a device of its choosing and then reads the platform calls the code made. A test
// that reads a value the library keeps from its first use runs in a fresh process.
#include <gtest/gtest.h>

#include <climits>
#include <functional>
#include <latch>
#include <ostream>
#include <regex>
#include <set>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include "halvex/trace/DeviceIdentity.h"
#include "halvex/trace/DiagConfig.h"
#include "halvex/trace/LogLocations.h"
#include "halvex/trace/TraceCatalog.h"
#include "platform/fake/FakePlatform.h"
#include "tests/support/FreshProcess.h"

namespace halvex::trace {
namespace {

using Calls = std::vector<std::string>;

// Answers as device from now on and forgets every call made so far.
void useDevice(const fake::Device& device) {
  fake::FakePlatform::get().setDevice(device);
  fake::FakePlatform::get().clearCalls();
}

// The platform calls made since the last useDevice() or takeCalls(), in order.
Calls takeCalls() {
  Calls calls = fake::FakePlatform::get().calls();
  fake::FakePlatform::get().clearCalls();
  return calls;
}

TEST(DeviceIdentity, ProductExemptionAsksOnlyTheProduct) {
  const std::pair<int, bool> rows[] = {
      {57, false}, {58, true}, {59, true}, {60, true},  {61, true},       {62, false},
      {68, false}, {69, true}, {70, true}, {71, false}, {INT_MIN, false}, {INT_MAX, false}};
  for (const auto& [product, exempt] : rows) {
    useDevice({.productType = product});
    EXPECT_EQ(isDaemonCheckExempt(), exempt) << "product " << product;
    EXPECT_EQ(takeCalls(), Calls{"getProductType"});
  }
}

// Every combination of the three build flags, and exactly which flags each rule asks for.
TEST(DeviceIdentity, BuildTypeRulesAskLazilyAndAfresh) {
  for (int bits = 0; bits < 8; ++bits) {
    const bool internal = (bits & 1) != 0, carrier = (bits & 2) != 0, vendor = (bits & 4) != 0;
    SCOPED_TRACE(::testing::Message() << "internal/carrier/vendor bits " << bits);
    useDevice({.internalBuild = internal, .carrierBuild = carrier, .vendorBuild = vendor});

    EXPECT_EQ(isCarrierOnlyBuild(), carrier && !internal);
    EXPECT_EQ(takeCalls(),
              (carrier ? Calls{"isCarrierBuild", "isInternalBuild"} : Calls{"isCarrierBuild"}));
    EXPECT_EQ(isInternalOrCarrierBuild(), internal || carrier);
    EXPECT_EQ(takeCalls(),
              (internal ? Calls{"isInternalBuild"} : Calls{"isInternalBuild", "isCarrierBuild"}));
    EXPECT_EQ(diag::config::getShouldAlwaysFilter(), bits == 0);
    EXPECT_EQ(takeCalls(), (Calls{"isCarrierBuild", "isInternalBuild", "isVendorBuild"}));
    if (!internal && !carrier) {
      EXPECT_FALSE(isDumpLogIndicationSupported());
      EXPECT_EQ(takeCalls(), (Calls{"isInternalBuild", "isCarrierBuild"}));  // radio never asked
    }
  }
}

TEST(DeviceIdentity, GlobalLoggerKeepsTheFirstServer) {
  test::inFreshProcess([] {
    const auto first = LogServer::create(), second = LogServer::create();
    useDevice({});
    const Logger& logger = getGlobalLogger(first);
    EXPECT_EQ(&getGlobalLogger(second), &logger);
    EXPECT_EQ(logger.server(), first);
    EXPECT_EQ(takeCalls(), Calls{});
    logger.log(LogLevel::kNotice, "hello");
    const auto lines = fake::FakePlatform::get().logLines();
    ASSERT_EQ(lines.size(), 1U);
    EXPECT_EQ(lines[0].subsystem, getGlobalLogContext().subsystem());
    EXPECT_TRUE(std::regex_match(lines[0].subsystem, std::regex(R"([a-z]+(\.[a-z]+)+)")));
    EXPECT_EQ(lines[0].category + " " + lines[0].message, "global hello");
  });
}

template <typename Enum>
std::string textOf(int value) {
  return diag::config::toString(static_cast<Enum>(value));
}

TEST(DiagConfig, DisplayTextsEndAtTheLastEnumerator) {
  using namespace diag::config;
  const std::pair<std::string, const char*> rows[] = {
      {textOf<Mode>(0), "Active on AP"},     {textOf<Mode>(3), "Passive external through software"},
      {textOf<Mode>(4), "Passive on AP"},    {textOf<Mode>(5), "Unknown"},
      {textOf<Mode>(255), "Unknown"},        {textOf<Mode>(-1), "Unknown"},
      {textOf<DuringAPSleep>(0), "Off"},     {textOf<DuringAPSleep>(2), "Lite"},
      {textOf<DuringAPSleep>(3), "Unknown"}, {textOf<DuringAPSleep>(-1), "Unknown"},
      {textOf<Recovery>(0), kNoneDMCFile},   {textOf<Recovery>(2), "Reconfigure"},
      {textOf<Recovery>(3), "Unknown"},      {textOf<Recovery>(INT_MIN), "Unknown"},
  };
  for (const auto& [text, expected] : rows) {
    EXPECT_EQ(text, expected);
  }
  EXPECT_EQ(textOf<Mode>(kDefaultMode), "Active on AP");
}

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
  test::inFreshProcess([&] {
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
  });
}

INSTANTIATE_TEST_SUITE_P(Caches, CachedFirstCall, ::testing::ValuesIn(firstCalls()),
                         [](const auto& test) { return test.param.name; });

// Each radio-dependent rule against every radio type, on an internal build with tracing allowed:
// the radios it holds for, and that it asks the radio afresh while the permission stays cached.
TEST(TraceCatalog, RadioRulesAcrossEveryType) {
  test::inFreshProcess([] {
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
  });
}

// The permission is asked only when the radio leaves the answer open; that its first answer
// stays is checked with the other cached values.
TEST(TraceCatalog, PermissionIsAskedOnlyWhenNeeded) {
  test::inFreshProcess([] {
    for (int radio : {-1, 0, 11}) {
      useDevice({.radioType = radio, .traceAllowed = false});
      EXPECT_FALSE(isKernelPCITraceSupported() || isSupported("basebandipc")) << radio;
      EXPECT_EQ(takeCalls(), (Calls{"getRadioType", "getRadioType"})) << radio;
    }
    useDevice({.radioType = 8, .traceAllowed = false});
    EXPECT_FALSE(isKernelPCITraceSupported());
    EXPECT_EQ(takeCalls(), Calls{"getRadioType"});
    useDevice({.radioType = 9, .traceAllowed = false});
    EXPECT_FALSE(isSupported("BasebandIPC"));
    EXPECT_EQ(takeCalls(), (Calls{"getRadioType", "isTraceAllowed"}));
  });
}

// The catalogue once with tracing allowed and once, in its own process, with it denied. The
// first name that matches decides, and only its rule asks the platform.
class SupportedNames : public ::testing::TestWithParam<bool> {};

TEST_P(SupportedNames, FollowTheCatalogue) {
  test::inFreshProcess([&] {
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
  });
}

INSTANTIATE_TEST_SUITE_P(Permission, SupportedNames, ::testing::Bool());

}  // namespace
}  // namespace halvex::trace
