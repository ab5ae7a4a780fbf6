// SPDX-License-Identifier: MIT
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <string>
#include <vector>

#include "TestTree.h"
#include "shell/CommandShell.h"
#include "shell/Console.h"
#include "tests/support/FreshProcess.h"

namespace halvex::testing {
namespace {

using namespace std::string_literals;

const std::string P = prompt("/halvextool");
const std::string PL = prompt("/halvextool/logdump");
const std::string R = kRootHelp;
const std::string L = kLogdumpHelp;

// "r" has an option and a sub-command both named "dup" (alias "d"), and options named like the
// built-ins "help" and "cd".
std::shared_ptr<TestCommand> makeShadowTree() {
  return TestCommand::create("r", {}, [](TestCommand& r) {
    r.addEcho("dup");
    r.addEcho("help");
    r.addEcho("cd");
    const auto dup = r.addChild("dup", [](TestCommand& d) { d.addEcho("x"); });
    r.addSubCommand(std::vector<std::string>{"dup", "d"}, dup);
  });
}

struct ShellCase {
  std::vector<std::string> args;  // program name first; just the name means interactive
  std::string input;
  bool ok;
  std::string out;
  std::string err = "";
  std::string veto = "";  // a word that both the root and "logdump" refuse
  std::shared_ptr<TestCommand> (*tree)() = makeToolTree;
};

TEST(CommandShellTest, EvaluatesCommandsExactlyAsDocumented) {
  const std::string huge(10 << 20, 'w');
  const ShellCase cases[] = {
      // One-shot mode: the first failing command ends the run.
      {{"t", "logdump", "tel", "a", "help", "cd", "--", "logdump", "bb"},
       "",
       true,
       "tel(a,help,cd)\nbb()\n"},
      {{"t", "logdump"}, "", false, L},
      {{"t", "bogus"}, "", false, invalid("bogus") + R},
      {{"t", "cd"}, "", false, R},
      {{"t", "cd", "logdump", "x"}, "", false, R},
      {{"t", "cd", "logdump/nope"}, "", false, L},
      {{"t", "cd", "/"}, "", true, ""},
      {{"t", "logdump", "cd", ".."}, "", true, ""},
      {{"t", "cd", "logdump", "--", "tel"}, "", false, invalid("tel") + R},
      {{"t", "--"}, "", true, ""},
      {{"t", "logdump", "tel", "--", "x"}, "", false, "tel()\n" + invalid("x") + R},
      {{"t", "logdump", "tel", "fail", "--", "logdump", "bb"}, "", false, "tel(fail)\n"},
      {{"t", "help"}, "", true, R},
      {{"t", "logdump", "help"}, "", true, L},
      {{"t", "help", "me"}, "", false, invalid("help") + R},
      {{"t", "quit", "now"}, "", false, invalid("quit") + R},
      {{"t", "logdump", "back"}, "", false, invalid("back") + L},
      {{"t", "back"}, "", true, ""},
      {{"t", "logdump", "tel", "--", "exit", "--", "logdump", "bb"}, "", true, "tel()\n"},
      {{"t", "logdump tel"}, "", false, invalid("logdump tel") + R},
      {{"t", "logdump", "TEL"}, "", false, invalid("TEL") + L},
      {{"t", "logdump", "core"}, "", false, "", "refused core\n", "core"},
      {{"t", "logdump", "tel"}, "", false, "", "refused logdump\n", "logdump"},
      {{"t", "dup", "x"}, "", true, "dup(x)\n", "", "", makeShadowTree},
      {{"t", "help"}, "", true, "help()\n", "", "", makeShadowTree},
      {{"t", "d", "x"}, "", true, "x()\n", "", "", makeShadowTree},
      // Interactive mode: failures never end the run; end of input does, with false.
      {{"t"}, "", false, P},
      {{}, "quit\nlogdump tel\n", true, P},
      {{"t"}, "\n \t\r\nexit", true, P + P + P},
      {{"t"},
       "cd logdump\ntel x\ncd ..\ncd logdump/\nback\ncd ../logdump\ncd ..\nback\n",
       false,
       P + PL + "tel(x)\n" + PL + P + PL + P + PL + P + P},
      {{"t"}, "cd logdump -- tel\n", false, P + "tel()\n" + PL},
      {{"t"},
       "logdump tel -- logdump bb\nbogus\nlogdump tel -- logdump bb\n",
       false,
       P + "tel()\nbb()\n" + P + invalid("bogus") + R + P + "tel()\n" + P},
      {{"t"}, "logdump\nhelp\n", false, P + L + P + R + P},
      {{"t"}, "logdump tel -- logdump", false, P + "tel()\n" + L + P},
      {{"t"},
       "logdump tel\ncd logdump\ntel\n",
       false,
       P + P + PL + "tel()\n" + PL,
       "refused logdump\n",
       "logdump"},
      {{"t"}, "cd d\n", false, prompt("/r") + prompt("/r/dup"), "", "", makeShadowTree},
      // A 10 MB word stays whole, unknown or as an argument.
      {{"t"},
       huge + "\nlogdump tel " + huge + "\n",
       false,
       P + invalid(huge) + R + P + "tel(" + huge + ")\n" + P},
      // Bytes that are not ASCII whitespace belong to words; CR, VT and FF separate words.
      {{"t"},
       "logdump\rtel\r\nlogdump\vbb -- logdump\fcore\r\nte\0l\n\xff\n"s,
       false,
       P + "tel()\n" + P + "bb()\ncore()\n" + P + invalid("te\0l"s) + R + P + invalid("\xff") + R +
           P},
  };
  for (const ShellCase& c : cases) {
    std::string trace;
    for (const std::string& arg : c.args) {
      trace += "[" + arg + "]";
    }
    SCOPED_TRACE(trace + " input: " + c.input.substr(0, 100));
    const auto root = c.tree();
    root->vetoed.insert(c.veto);
    if (const auto logdump =
            std::dynamic_pointer_cast<TestCommand>(root->getSubCommand("logdump"))) {
      logdump->vetoed.insert(c.veto);
    }
    const ShellRun run = runShell(root, c.args, c.input);
    EXPECT_EQ(run.ok, c.ok);
    EXPECT_EQ(run.out, c.out);
    EXPECT_EQ(run.err, c.err);
  }
}

TEST(CommandShellTest, MissingRootEndsTheRunSilently) {
  EXPECT_FALSE(runShell(nullptr, {"t"}, "help\nquit\n").ok);
  EXPECT_EQ(runShell(nullptr, {"t", "help"}).out, "");
}

// A process started without its standard descriptors gets /dev/null in their place, so that
// nothing it opens later takes their numbers. Seen in a process of its own, which can close them.
TEST(ConsoleTest, ReservesTheStandardDescriptorsStartedWithout) {
  test::inFreshProcess([] {
    const int saved = ::fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 3);  // to report failures
    ASSERT_GE(saved, 3);
    for (int fd = STDIN_FILENO; fd <= STDERR_FILENO; ++fd) {
      ::close(fd);
    }
    reserveStandardDescriptors();
    std::string seen[3];
    for (int fd = STDIN_FILENO; fd <= STDERR_FILENO; ++fd) {
      std::error_code error;
      seen[fd] = std::filesystem::read_symlink("/proc/self/fd/" + std::to_string(fd), error);
    }
    ::dup2(saved, STDERR_FILENO);
    for (const std::string& target : seen) {
      EXPECT_EQ(target, "/dev/null");
    }
  });
}

}  // namespace
}  // namespace halvex::testing
