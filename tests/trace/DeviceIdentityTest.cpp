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
      {57, false}, {58, true},  {59, true},       {60, true},       {61, true},
      {62, false}, {68, false}, {69, true},       {70, true},       {71, false},
      {0, false},  {-1, false}, {INT_MIN, false}, {INT_MAX, false},
  };
  for (const auto& [product, exempt] : rows) {
    useDevice({.productType = product});
    EXPECT_EQ(isDaemonCheckExempt(), exempt) << "product " << product;
    EXPECT_EQ(takeCalls(), Calls{"getProductType"});
  }
}

// Every combination of the three build flags, and exactly which flags each rule asks for.
TEST(DeviceIdentity, BuildTypeRulesAskLazilyAndAfresh) {
  for (int bits = 0; bits < 8; ++bits) {
    const bool internal = (bits & 1) != 0;
    const bool carrier = (bits & 2) != 0;
    const bool vendor = (bits & 4) != 0;
    SCOPED_TRACE(::testing::Message()
                 << "internal " << internal << " carrier " << carrier << " vendor " << vendor);
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
      // Without an internal or carrier build the radio is never asked.
      EXPECT_FALSE(isDumpLogIndicationSupported());
      EXPECT_EQ(takeCalls(), (Calls{"isInternalBuild", "isCarrierBuild"}));
    }
  }
}

class RadioModelName : public ::testing::TestWithParam<int> {};

TEST_P(RadioModelName, IsAskedOnceAndKeptForGood) {
  const int radio = GetParam();
  useDevice({.radioType = radio});
  const std::string name = getRadioModelName();
  if (radio >= 1 && radio <= 10) {
    // A model code: two to five letters or digits with at most one dot.
    EXPECT_TRUE(std::regex_match(name, std::regex(R"([A-Za-z0-9]+\.?[A-Za-z0-9]*)")));
    EXPECT_GE(name.size(), 2u);
    EXPECT_LE(name.size(), 5u);
  } else {
    EXPECT_EQ(name, "Unknown");
  }
  useDevice({.radioType = radio == 5 ? 6 : 5});
  EXPECT_EQ(getRadioModelName(), name);
  EXPECT_EQ(takeCalls(), Calls{});
}

INSTANTIATE_TEST_SUITE_P(Types, RadioModelName,
                         ::testing::Values(INT_MIN, -1, 0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11));

TEST(DeviceIdentity, BootArgsComeFromOnePropertyMapRead) {
  useDevice({.properties = {{"boot-args", "debug=0x14"}, {"serial", "X1"}}});
  EXPECT_EQ(getBootArgs(), "debug=0x14");
  EXPECT_EQ(takeCalls(), (Calls{"DevicePropertyService::create", "getPropertyMap"}));
  useDevice({.properties = {{"boot-args", "changed"}}});
  EXPECT_EQ(getBootArgs(), "debug=0x14");
  EXPECT_EQ(takeCalls(), Calls{});
}

TEST(DeviceIdentity, BootArgsAreEmptyWithoutTheProperty) {
  useDevice({.properties = {{"serial", "X1"}}});
  EXPECT_EQ(getBootArgs(), "");
  EXPECT_EQ(getBootArgs(), "");
  EXPECT_EQ(takeCalls(), (Calls{"DevicePropertyService::create", "getPropertyMap"}));
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

}  // namespace
}  // namespace halvex::trace::tests
