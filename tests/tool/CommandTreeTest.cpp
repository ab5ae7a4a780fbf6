// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <memory>
#include <stdexcept>
#include <string>

#include "Tools/HalvexTool/HalvexCommand.h"
#include "Tools/HalvexTool/LogdumpCommand.h"
#include "Tools/HalvexTool/ServerState.h"
#include "tests/tool/ToolTestSupport.h"

namespace halvex {
namespace {

using tooltest::CapturedConsole;

MessageValue stateEvent(const char* state) {
  return tooltest::dictOf({{kKeyServerState, MessageValue::string(state)}});
}

TEST(LogdumpCommand, OnlyBasebandRunsWhileTheServerIsNotStarted) {
  auto logdump = tooltest::makeLogdump();
  struct Row {
    std::string option;
    bool started;
    bool allowed;
  };
  const Row rows[] = {
      {"tel", false, false},
      {"core", false, false},
      {"bb", false, true},
      {"tel", true, true},
      {"core", true, true},
      {"bb", true, true},
      // Refusal is by exact name: anything but "bb" needs the server.
      {"BB", false, false},
      {"bb ", false, false},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.option + (row.started ? " started" : " not started"));
    onServerStateChange(stateEvent(row.started ? kServerStateStarted : "Stopped"), TaskGroup());
    CapturedConsole console;
    EXPECT_EQ(logdump->canExecute(row.option), row.allowed);
    EXPECT_EQ(console.out.str(), "");
    EXPECT_EQ(console.err.str(),
              row.allowed ? "" : "Server is not running. Please try after server starts.\n");
  }
  // A refusal sends nothing to the server.
  EXPECT_TRUE(fake::FakePlatform::get().serverRequests().empty());
}

TEST(HalvexCommand, RootHoldsLogdumpWithThreeOptions) {
  WorkQueue queue = WorkQueue::create("test.queue");
  auto manager = client::CreateManager("halvextool", queue);
  auto root = HalvexCommand::create("halvextool", {}, manager, queue);

  EXPECT_EQ(root->getPath(), "/halvextool");
  EXPECT_TRUE(root->getOptions().empty());
  ASSERT_EQ(root->getSubCommands().size(), 1u);
  auto logdump = root->getSubCommand("logdump");
  ASSERT_NE(logdump, nullptr);
  EXPECT_EQ(logdump->getPath(), "/halvextool/logdump");
  EXPECT_EQ(logdump->getParent().lock(), root);
  EXPECT_TRUE(logdump->getSubCommands().empty());
  // The root lets "logdump" be entered whatever the server's state.
  onServerStateChange(MessageValue::null(), TaskGroup());
  CapturedConsole console;
  EXPECT_TRUE(root->canExecute("logdump"));

  logdump->printHelp();
  const std::string tab = "\t";
  EXPECT_EQ(console.out.str(),
            "\nOptions for command '\x1b[32mlogdump\x1b[39m':\n\n" +  //
                tab + std::string(14, ' ') +
                "bb  -  [nocompress] <reason> collect baseband logs only\n\n" +  //
                tab + std::string(12, ' ') +
                "core  -  [nocompress] [nonui] <reason> collect telephony logs with coredump\n\n" +
                tab + std::string(13, ' ') +
                "tel  -  [nocompress] [nonui] <reason> collect telephony logs\n\n" +  //
                tab + std::string(14, ' ') + "cd  -  <sub-command>\n" +               //
                tab + std::string(12, ' ') + "help\n" +                               //
                tab + std::string(12, ' ') + "back\n" +                               //
                tab + std::string(12, ' ') + "quit\n\n");
  EXPECT_EQ(console.err.str(), "");
}

TEST(HalvexCommand, RootWithoutAnOwnerCannotRegisterItsChildren) {
  WorkQueue queue = WorkQueue::create("test.queue");
  auto manager = client::CreateManager("halvextool", queue);
  HalvexCommand unowned("halvextool", {}, manager, queue);
  EXPECT_THROW(unowned.init(), std::bad_weak_ptr);
}

}  // namespace
}  // namespace halvex
