// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <climits>
#include <regex>

#include "TraceTestSupport.h"
#include "halvex/trace/DeviceIdentity.h"
#include "halvex/trace/DiagConfig.h"
#include "halvex/trace/TraceCatalog.h"

namespace halvex::trace::tests {
namespace {

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
  const auto first = LogServer::create();
  const auto second = LogServer::create();
  useDevice({});
  const Logger& logger = getGlobalLogger(first);
  EXPECT_EQ(&getGlobalLogger(second), &logger);
  EXPECT_EQ(logger.server(), first);
  EXPECT_EQ(takeCalls(), Calls{});

  logger.log(LogLevel::kNotice, "hello");
  const auto lines = fake::FakePlatform::get().logLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].subsystem, getGlobalLogContext().subsystem());
  EXPECT_TRUE(std::regex_match(lines[0].subsystem, std::regex(R"([a-z]+(\.[a-z]+)+)")));
  EXPECT_EQ(lines[0].category, "global");
  EXPECT_EQ(lines[0].message, "hello");
}

template <typename Enum>
std::string textOf(int value) {
  return diag::config::toString(static_cast<Enum>(value));
}

TEST(DiagConfig, DisplayTextsEndAtTheLastEnumerator) {
  using namespace diag::config;
  const std::pair<std::string, const char*> rows[] = {
      {textOf<Mode>(0), "Active on AP"},
      {textOf<Mode>(3), "Passive external through software"},
      {textOf<Mode>(4), "Passive on AP"},
      {textOf<Mode>(5), "Unknown"},
      {textOf<Mode>(255), "Unknown"},
      {textOf<Mode>(-1), "Unknown"},
      {textOf<DuringAPSleep>(0), "Off"},
      {textOf<DuringAPSleep>(2), "Lite"},
      {textOf<DuringAPSleep>(3), "Unknown"},
      {textOf<DuringAPSleep>(-1), "Unknown"},
      {textOf<Recovery>(0), kNoneDMCFile},
      {textOf<Recovery>(2), "Reconfigure"},
      {textOf<Recovery>(3), "Unknown"},
      {textOf<Recovery>(INT_MIN), "Unknown"},
      {textOf<Mode>(kDefaultMode), "Active on AP"},
  };
  for (const auto& [text, expected] : rows) {
    EXPECT_EQ(text, expected);
  }
}

}  // namespace
}  // namespace halvex::trace::tests
