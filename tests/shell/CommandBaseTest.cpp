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

using namespace std::chrono_literals;

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

TEST(CommandHelpTest, ListingsAreExactAndFlushedLineByLine) {
  const auto tool = makeToolTree();
  // "top" has one sub-command "a" (options x, y) with its own sub-command "b" (option z).
  const auto nested = TestCommand::create("top", {}, [](TestCommand& top) {
    top.addChild("a", [](TestCommand& a) {
      a.addEcho("y");
      a.addEcho("x");
      a.addChild("b", [](TestCommand& b) { b.addEcho("z"); });
    });
  });
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
  const struct {
    std::shared_ptr<CommandBase> command;
    std::string expected;
  } cases[] = {
      {tool, kRootHelp},
      {tool->getSubCommand("logdump"), kLogdumpHelp},
      {nested,
       "\nOptions for command '\x1b[32mtop\x1b[39m':\n\n"
       "\t               a  -  [x|y]\n"
       "\t                     <b>  -  [z]\n\n" +
           kBuiltinsHelp},
      {nested->getSubCommand("a")->getSubCommand("b"),
       "\nOptions for command '\x1b[32mb\x1b[39m':\n\n\t               z  -  ...\n\n" +
           kBuiltinsHelp},
      {TestCommand::create("bare"),
       "\nOptions for command '\x1b[32mbare\x1b[39m':\n\n" + kBuiltinsHelp},
      // Byte order (upper case, lower case, then bytes above 0x7F); "..." for a missing
      // description; long names uncut; a sub-command without options shows only its children;
      // aliases never show.
      {mixed,
       "\nOptions for command '\x1b[32mmix\x1b[39m':\n\n"
       "\t            Zeta  -  upper\n\n"
       "\taveryveryverylongoption  -  ...\n\n"
       "\t            \x80raw  -  high\n\n"
       "\taveryveryverylongcommand  -  [o]\n\n"
       "\t                     <leaf>  -  [go]\n\n"
       "\t                     <leaf>  -  [go]\n\n" +
           kBuiltinsHelp},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.command->getName());
    std::istringstream in;
    FlushCountingBuf buf;
    std::ostream out(&buf);
    std::ostringstream err;
    ScopedConsoleForTesting console(in, out, err);
    c.command->printHelp();
    EXPECT_EQ(buf.str(), c.expected);
    EXPECT_EQ(buf.syncs, std::count(c.expected.begin(), c.expected.end(), '\n'));
  }
}

TEST(CommandModelTest, PathsComeFromTheParentAtInitAndChildrenMayOutliveIt) {
  auto root = makeToolTree();
  const auto child = root->getSubCommand("logdump");
  EXPECT_EQ(root->getPath(), "/halvextool");
  EXPECT_EQ(child->getPath(), "/halvextool/logdump");
  root.reset();
  EXPECT_EQ(child->getParent().lock(), nullptr);

  std::weak_ptr<CommandBase> gone = TestCommand::create("gone");
  EXPECT_EQ(TestCommand::create("orphan", gone)->getPath(), "/orphan");
}

TEST(CommandModelTest, RegistrationAndLookupRules) {
  std::vector<std::string> ran;
  const auto recorder = [&ran](std::string tag) {
    return [&ran, tag](TaskGroup, std::vector<std::string>) {
      ran.push_back(tag);
      return true;
    };
  };
  const auto command = TestCommand::create("c");
  command->addOption("none", OptionHandler(), "dropped");
  EXPECT_FALSE(command->hasOption("none"));
  command->addOption("none", recorder("late"), "");  // proves "dropped" was not kept
  command->addOption("tel", recorder("first"), "kept");
  command->addOption("tel", recorder("second"), "");

  const auto child = TestCommand::create("child", command);
  command->addSubCommand(std::vector<std::string>{"child", "alias"}, child);
  command->addSubCommand(std::vector<std::string>{}, child);
  command->addSubCommand("null", nullptr);

  EXPECT_TRUE(command->runOption("tel", {}));
  EXPECT_EQ(ran, std::vector<std::string>{"second"});
  for (const char* miss : {"TEL", "te", "tel ", "ALIAS", "null"}) {
    EXPECT_FALSE(command->hasOption(miss)) << miss;
    EXPECT_FALSE(command->hasSubCommand(miss)) << miss;
    EXPECT_EQ(command->getSubCommand(miss), nullptr) << miss;
  }
  EXPECT_FALSE(command->runOption("nope", {}));
  EXPECT_FALSE(command->hasOption("nope"));

  EXPECT_TRUE(command->hasSubCommand("alias"));
  EXPECT_EQ(command->getSubCommand("alias"), child);
  EXPECT_EQ(command->getSubCommands().size(), 1U);
  EXPECT_EQ(command->getSubCommands().count("alias"), 0U);

  std::ostringstream out;
  std::istringstream in;
  ScopedConsoleForTesting console(in, out, out);
  command->printHelp();
  EXPECT_NE(out.str().find("none  -  ...\n"), std::string::npos);
  EXPECT_NE(out.str().find("tel  -  kept\n"), std::string::npos);
}

TEST(CommandModelTest, InitOnAnUnownedCommandThrowsBadWeakPtr) {
  TestCommand unowned("root", {}, [](TestCommand& root) { root.addChild("child"); });
  EXPECT_THROW(unowned.init(), std::bad_weak_ptr);
}

// Both leaves happen later on the queue (the first one not before the handler is returning), so
// only a runOption that waits for the group sees both; it must still report the handler's result.
TEST(CommandModelTest, RunOptionWaitsForEveryLeaveAndKeepsTheHandlersResult) {
  for (const bool handlerResult : {true, false}) {
    const WorkQueue queue = WorkQueue::create("shell.test");
    std::atomic<int> leaves{0};
    std::promise<void> returning;
    const auto command = TestCommand::create("c");
    command->addOption(
        "async",
        [&](TaskGroup group, std::vector<std::string>) {
          group.enter();
          group.enter();
          queue.post([group, &leaves, done = returning.get_future().share()] {
            EXPECT_EQ(done.wait_for(10s), std::future_status::ready);
            leaves.fetch_add(1);
            group.leave();
          });
          queue.post([group, &leaves] {
            leaves.fetch_add(1);
            group.leave();
          });
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
