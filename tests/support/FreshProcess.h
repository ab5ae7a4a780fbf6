// SPDX-License-Identifier: MIT
// Part of a test run in a new process of the test program, for what only a process that has
// done nothing yet shows: a value a library caches on first use, a flag's value at start.
//
// The program is started afresh, as gtest's thread-safe death tests are (it is one): the child
// runs the same test up to this point, then the body, so it inherits nothing that earlier tests
// left behind in the parent. The body's failures are printed and fail the test in the parent.
// Header-only, so any test program can use it without linking the bus fixtures.
#pragma once

#include <gtest/gtest-spi.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <functional>
#include <iostream>
#include <string>

namespace halvex::test {

namespace detail {

// In the child: runs body, prints what failed (gtest's own printer is off in a death test's
// child) and exits with 1 if anything did.
[[noreturn]] inline void runAndExit(const std::function<void()>& body) {
  ::testing::TestPartResultArray results;
  {
    const ::testing::ScopedFakeTestPartResultReporter reporter(
        ::testing::ScopedFakeTestPartResultReporter::INTERCEPT_ALL_THREADS, &results);
    body();
  }
  bool failed = false;
  for (int i = 0; i < results.size(); ++i) {
    failed = failed || results.GetTestPartResult(i).failed();
    std::cerr << results.GetTestPartResult(i);
  }
  std::exit(failed ? 1 : 0);
}

}  // namespace detail

inline void inFreshProcess(const std::function<void()>& body) {
  const std::string style = GTEST_FLAG_GET(death_test_style);
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(detail::runAndExit(body), ::testing::ExitedWithCode(0), "");
  GTEST_FLAG_SET(death_test_style, style);
}

}  // namespace halvex::test
