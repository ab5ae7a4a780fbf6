// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <string>

#include "halvex/trace/DiagConfig.h"

namespace diag::config {
namespace {

template <typename Enum>
std::string textOf(int value) {
  return toString(static_cast<Enum>(value));
}

TEST(DiagConfig, DisplayTextsEndAtTheLastEnumerator) {
  const std::pair<std::string, const char*> rows[] = {
      {textOf<Mode>(0), "Active on AP"},     {textOf<Mode>(3), "Passive external through software"},
      {textOf<Mode>(4), "Passive on AP"},    {textOf<Mode>(5), "Unknown"},
      {textOf<Mode>(255), "Unknown"},        {textOf<Mode>(-1), "Unknown"},
      {textOf<DuringAPSleep>(0), "Off"},     {textOf<DuringAPSleep>(2), "Lite"},
      {textOf<DuringAPSleep>(3), "Unknown"}, {textOf<DuringAPSleep>(-1), "Unknown"},
      {textOf<Recovery>(0), kNoneDMCFile},   {textOf<Recovery>(2), "Reconfigure"},
      {textOf<Recovery>(3), "Unknown"},      {textOf<Recovery>(-2147483647 - 1), "Unknown"},
  };
  for (const auto& [text, expected] : rows) {
    EXPECT_EQ(text, expected);
  }
  EXPECT_EQ(textOf<Mode>(kDefaultMode), "Active on AP");
}

}  // namespace
}  // namespace diag::config
