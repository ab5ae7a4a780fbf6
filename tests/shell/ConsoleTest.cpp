// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <iostream>
#include <sstream>

#include "shell/Console.h"

namespace halvex {
namespace {

TEST(ConsoleTest, ScopesRedirectAndRestoreInNestingOrder) {
  std::istringstream in;
  std::ostringstream outer;
  std::ostringstream inner;
  {
    ScopedConsoleForTesting outerScope(in, outer, outer);
    {
      ScopedConsoleForTesting innerScope(in, inner, inner);
      writeLine(consoleErr(), "inner");
    }
    EXPECT_EQ(&consoleIn(), &in);
    writeLine(consoleOut(), std::string_view("a\0b", 3));
  }
  EXPECT_EQ(&consoleIn(), &std::cin);
  EXPECT_EQ(&consoleOut(), &std::cout);
  EXPECT_EQ(&consoleErr(), &std::cerr);
  EXPECT_EQ(inner.str(), "inner\n");
  EXPECT_EQ(outer.str(), std::string("a\0b\n", 4));
}

}  // namespace
}  // namespace halvex
