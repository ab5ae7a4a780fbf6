// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <string>

#include "TestTree.h"
#include "shell/Completion.h"

namespace halvex::testing {
namespace {

// "r" with the child "a", which has the child "b" with the option "x".
std::shared_ptr<TestCommand> makeDeepTree() {
  return TestCommand::create("r", {}, [](TestCommand& r) {
    r.addChild("a",
               [](TestCommand& a) { a.addChild("b", [](TestCommand& b) { b.addEcho("x"); }); });
  });
}

TEST(CompletionTest, OffersWhatTheShellWouldAcceptThere) {
  const struct {
    std::string working;  // a path below the root, "" for the root
    std::string text;
    std::string candidates;  // space-separated
    std::size_t start;
    std::shared_ptr<TestCommand> (*tree)() = makeToolTree;
  } cases[] = {
      {"", "", "back cd exit help logdump quit", 0},
      {"", "  lo", "logdump", 2},
      {"", "logdump ", "bb cd core help tel", 8},
      {"", "logdump c", "cd core", 8},
      {"logdump", "", "back bb cd core exit help quit tel", 0},
      {"", "logdump tel ", "nocompress nonui", 12},
      {"", "logdump tel nonui no", "nocompress nonui", 18},
      {"", "logdump bb ", "nocompress", 11},
      {"", "logdump tel reason ", "", 0},
      {"", "logdump tel -- logdump tel -- l", "logdump", 30},
      {"", "help ", "", 0},
      {"", "bogus ", "", 0},
      {"", "logdump\tTEL ", "", 0},
      {"", "cd ", "../ logdump", 3},
      {"", "cd ../lo", "logdump", 6},
      {"", "cd logdump ", "", 0},
      {"", "logdump cd ", "../", 11},
      {"", "cd nope/", "", 0},
      {"", "cd ", "../ a/", 3, makeDeepTree},
      {"", "cd a/", "../ b", 5, makeDeepTree},
      {"", "a b ", "cd help x", 4, makeDeepTree},
      {"a", "cd ../a/b/.", "../", 10, makeDeepTree},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE("[" + c.working + "] " + c.text);
    const std::shared_ptr<CommandBase> root = c.tree();
    const std::shared_ptr<CommandBase> working =
        c.working.empty() ? root : root->getSubCommand(c.working);
    const Completion completion = completeWord(working, c.text);
    std::string candidates;
    for (const std::string& candidate : completion.candidates) {
      candidates += (candidates.empty() ? "" : " ") + candidate;
    }
    EXPECT_EQ(candidates, c.candidates);
    if (!completion.candidates.empty()) {
      EXPECT_EQ(completion.start, c.start);
    }
  }
}

}  // namespace
}  // namespace halvex::testing
