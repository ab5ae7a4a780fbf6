// SPDX-License-Identifier: MIT
// The process runner the command-line and end-to-end tests stand on: if it lies, every test above
// it does. The private bus is exercised by every bus test.
#include <gtest/gtest.h>

#include "tests/support/Subprocess.h"

namespace halvex::test {
namespace {

using namespace std::chrono_literals;

TEST(RunProcess, PassesInputAndEnvironmentCollectsBothStreamsAndNeverHangs) {
  const struct {
    std::string script, input;
    std::chrono::milliseconds timeout;
    std::string expected;  // "STATUS|STDOUT|STDERR"
  } cases[] = {
      {"cat; echo \"$GREETING\" >&2; test -z \"$HOME\"; exit 3", "line one\nline two\n", 30s,
       "exit 3|line one\nline two\n|hello\n"},
      {"head -c 10; kill -TERM $$", std::string(1 << 20, 'x'), 30s, "signal 15|xxxxxxxxxx|"},
      {"echo started; exec sleep 30", "", 300ms, "timed out (signal 9)|started\n|"},
  };
  for (const auto& c : cases) {
    const RunResult result = runProcess({{"/bin/sh", "-c", c.script},
                                         {{"GREETING", "hello"}, {"HOME", std::nullopt}},
                                         c.input,
                                         c.timeout});
    EXPECT_EQ(result.status.describe() + "|" + result.out + "|" + result.err, c.expected);
  }
  EXPECT_THROW(runProcess({{"/nonexistent/program"}, {}, {}}), std::runtime_error);
}

}  // namespace
}  // namespace halvex::test
