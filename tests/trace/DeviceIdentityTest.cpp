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

class RadioModelName : public ::testing::TestWithParam<int> {};

TEST_P(RadioModelName, IsAskedOnceAndKeptForGood) {
  const int radio = GetParam();
  useDevice({.radioType = radio});
  const std::string name = getRadioModelName();
  if (radio >= 1 && radio <= 10) {
    // Two to five letters or digits, at most one of them a dot.
    EXPECT_TRUE(std::regex_match(name, std::regex(R"((?=.{2,5}$)[A-Za-z0-9]*\.?[A-Za-z0-9]*)")))
        << name;
  } else {
    EXPECT_EQ(name, "Unknown");
  }
  useDevice({.radioType = radio == 5 ? 6 : 5});
  EXPECT_EQ(getRadioModelName(), name);
  EXPECT_EQ(takeCalls(), Calls{});
}

INSTANTIATE_TEST_SUITE_P(Types, RadioModelName,
                         ::testing::Values(INT_MIN, -1, 0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11));

// The property map is read once, so a later change or absence of "boot-args" is never seen.
class BootArgs : public ::testing::TestWithParam<bool> {};

TEST_P(BootArgs, ComeFromOnePropertyMapRead) {
  const std::string expected = GetParam() ? "debug=0x14" : "";
  fake::Device device{.properties = {{"serial", "X1"}}};
  if (GetParam()) {
    device.properties["boot-args"] = expected;
  }
  useDevice(device);
  EXPECT_EQ(getBootArgs(), expected);
  EXPECT_EQ(takeCalls(), (Calls{"DevicePropertyService::create", "getPropertyMap"}));
  useDevice({.properties = {{"boot-args", "changed"}}});
  EXPECT_EQ(getBootArgs(), expected);
  EXPECT_EQ(takeCalls(), Calls{});
}

INSTANTIATE_TEST_SUITE_P(WithAndWithout, BootArgs, ::testing::Bool());

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

}  // namespace
}  // namespace halvex::trace::tests
