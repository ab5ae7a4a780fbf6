// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <future>
#include <string>
#include <vector>

#include "TestTree.h"
#include "platform/WorkQueue.h"
#include "shell/CommandBase.h"

namespace halvex::testing {
namespace {

// Counts flushes, to check that every line of a listing is flushed on its own.
class FlushCountingBuf : public std::stringbuf {
 public:
  int syncs = 0;

 protected:
  int sync() override {
    ++syncs;
    return std::stringbuf::sync();
  }
};

// Byte order (upper case, lower case, then bytes above 0x7F); "..." for a missing description;
// long names uncut; a sub-command without options shows only its children, one level further in;
// aliases never show. The tool-shaped tree's listings are checked through the shell.
TEST(CommandHelpTest, ListingsAreExactAndFlushedLineByLine) {
  const auto mixed = TestCommand::create("mix", {}, [](TestCommand& mix) {
    mix.addEcho("\x80raw", "high");
    mix.addEcho("averyveryverylongoption");
    mix.addEcho("Zeta", "upper");
    const auto group = mix.addChild("group", [](TestCommand& g) {
      g.addChild("leaf", [](TestCommand& leaf) { leaf.addEcho("go"); });
    });
    mix.addSubCommand(std::vector<std::string>{"grp", "g"}, group);
    mix.addChild("averyveryverylongcommand", [](TestCommand& c) { c.addEcho("o"); });
  });
  const std::string expected =
      "\nOptions for command '\x1b[32mmix\x1b[39m':\n\n"
      "\t            Zeta  -  upper\n\n"
      "\taveryveryverylongoption  -  ...\n\n"
      "\t            \x80raw  -  high\n\n"
      "\taveryveryverylongcommand  -  [o]\n\n"
      "\t                     <leaf>  -  [go]\n\n"
      "\t                     <leaf>  -  [go]\n\n" +
      kBuiltinsHelp;
  std::istringstream in;
  FlushCountingBuf buf;
  std::ostream out(&buf);
  ScopedConsoleForTesting console(in, out, out);
  mixed->printHelp();
  EXPECT_EQ(buf.str(), expected);
  EXPECT_EQ(buf.syncs, std::count(expected.begin(), expected.end(), '\n'));
}

TEST(CommandModelTest, PathsComeFromTheParentAtInitAndChildrenMayOutliveIt) {
  auto root = makeToolTree();
  const auto child = root->getSubCommand("logdump");
  EXPECT_EQ(child->getPath(), "/halvextool/logdump");
  root.reset();
  EXPECT_EQ(child->getParent().lock(), nullptr);
  std::weak_ptr<CommandBase> gone = TestCommand::create("gone");
  EXPECT_EQ(TestCommand::create("orphan", gone)->getPath(), "/orphan");
}

// An empty handler is dropped, a later one replaces an earlier one but keeps its description
// unless given a new one; aliases reach the child but are not sub-commands of their own.
TEST(CommandModelTest, RegistrationAndLookupRules) {
  std::vector<std::string> ran;
  const auto recorder = [&ran](const std::string& tag) {
    return [&ran, tag](TaskGroup, const std::vector<std::string>&) {
      ran.push_back(tag);
      return true;
    };
  };
  const auto command = TestCommand::create("c");
  command->addOption("none", OptionHandler(), "dropped");
  EXPECT_FALSE(command->hasOption("none"));
  command->addOption("none", recorder("late"), "");
  command->addOption("tel", recorder("first"), "kept");
  command->addOption("tel", recorder("second"), "");
  const auto child = TestCommand::create("child", command);
  command->addSubCommand(std::vector<std::string>{"child", "alias"}, child);
  command->addSubCommand(std::vector<std::string>{}, child);
  command->addSubCommand("null", nullptr);

  EXPECT_TRUE(command->runOption("tel", {}));
  EXPECT_EQ(ran, std::vector<std::string>{"second"});
  EXPECT_FALSE(command->runOption("nope", {}));
  for (const char* miss : {"TEL", "te", "tel ", "ALIAS", "null", "nope"}) {
    EXPECT_FALSE(command->hasOption(miss) || command->hasSubCommand(miss)) << miss;
    EXPECT_EQ(command->getSubCommand(miss), nullptr) << miss;
  }
  EXPECT_EQ(command->getSubCommand("alias"), child);
  EXPECT_EQ(command->getSubCommands().size(), 1U);
  std::ostringstream out;
  std::istringstream in;
  ScopedConsoleForTesting console(in, out, out);
  command->printHelp();
  EXPECT_NE(out.str().find("none  -  ...\n"), std::string::npos);
  EXPECT_NE(out.str().find("tel  -  kept\n"), std::string::npos);
}

// Both leaves happen later on the queue, the first not before the handler is returning, so only a
// runOption that waits for the group sees both; it must still report the handler's result.
TEST(CommandModelTest, RunOptionWaitsForEveryLeaveAndKeepsTheHandlersResult) {
  for (const bool handlerResult : {true, false}) {
    const WorkQueue queue = WorkQueue::create("shell.test");
    std::atomic<int> leaves{0};
    std::promise<void> returning;
    const auto command = TestCommand::create("c");
    const auto leave = [&leaves](TaskGroup group) {
      leaves.fetch_add(1);
      group.leave();
    };
    command->addOption(
        "async",
        [&](TaskGroup group, const std::vector<std::string>&) {
          group.enter();
          group.enter();
          queue.post([=, done = returning.get_future().share()] {
            EXPECT_EQ(done.wait_for(std::chrono::seconds(10)), std::future_status::ready);
            leave(group);
          });
          queue.post([=] { leave(group); });
          returning.set_value();
          return handlerResult;
        },
        "");
    EXPECT_EQ(command->runOption("async", {}), handlerResult);
    EXPECT_EQ(leaves.load(), 2);
  }
}

}  // namespace
}  // namespace halvex::testing
