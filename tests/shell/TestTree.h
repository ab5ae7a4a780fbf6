// SPDX-License-Identifier: MIT
// Command trees built in test code, and a runner that drives a shell through string streams.
#pragma once

#include <functional>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

#include "shell/CommandBase.h"
#include "shell/CommandShell.h"
#include "shell/Console.h"

namespace halvex::testing {

// A command whose options and children come from a setup function run by registerCommands().
class TestCommand : public CommandBase {
 public:
  using Setup = std::function<void(TestCommand&)>;
  using CommandBase::CommandBase;

  static std::shared_ptr<TestCommand> create(std::string name,
                                             std::weak_ptr<CommandBase> parent = {},
                                             Setup setup = {}) {
    auto command = std::make_shared<TestCommand>(std::move(name), std::move(parent));
    command->setup_ = std::move(setup);
    command->init();
    return command;
  }

  std::shared_ptr<TestCommand> addChild(const std::string& name, Setup setup = {}) {
    auto child = create(name, shared_from_this(), std::move(setup));
    addSubCommand(name, child);
    return child;
  }

  // An option that prints "name(arg,arg)" and fails when its first argument is "fail".
  void addEcho(const std::string& name, const std::string& description = "",
               std::vector<std::string> words = {}) {
    addOption(
        name,
        [name](TaskGroup, std::vector<std::string> args) {
          std::string line = name + "(";
          for (std::size_t i = 0; i < args.size(); ++i) {
            line += (i == 0 ? "" : ",") + args[i];
          }
          writeLine(consoleOut(), line + ")");
          return args.empty() || args.front() != "fail";
        },
        description, std::move(words));
  }

  bool canExecute(const std::string& word) override {
    if (vetoed.contains(word)) {
      writeLine(consoleErr(), "refused " + word);
      return false;
    }
    return true;
  }

  void registerCommands() override {
    if (setup_) {
      setup_(*this);
    }
  }

  std::set<std::string> vetoed;

 private:
  Setup setup_;
};

// Shaped like the tool's own tree: "halvextool" with the sub-command "logdump".
inline std::shared_ptr<TestCommand> makeToolTree() {
  return TestCommand::create("halvextool", {}, [](TestCommand& root) {
    root.addChild("logdump", [](TestCommand& logdump) {
      logdump.addEcho("tel", "[nocompress] [nonui] <reason> collect telephony logs",
                      {"nocompress", "nonui"});
      logdump.addEcho("core", "[nocompress] [nonui] <reason> collect telephony logs with coredump",
                      {"nocompress", "nonui"});
      logdump.addEcho("bb", "[nocompress] <reason> collect baseband logs only", {"nocompress"});
    });
  });
}

inline const std::string kBuiltinsHelp =
    "\t              cd  -  <sub-command>\n"
    "\t            help\n\t            back\n\t            quit\n\n";

inline const std::string kRootHelp =
    "\nOptions for command '\x1b[32mhalvextool\x1b[39m':\n\n"
    "\t         logdump  -  [bb|core|tel]\n\n" +
    kBuiltinsHelp;

inline const std::string kLogdumpHelp =
    "\nOptions for command '\x1b[32mlogdump\x1b[39m':\n\n"
    "\t              bb  -  [nocompress] <reason> collect baseband logs only\n\n"
    "\t            core  -  [nocompress] [nonui] <reason> collect telephony logs with coredump\n\n"
    "\t             tel  -  [nocompress] [nonui] <reason> collect telephony logs\n\n" +
    kBuiltinsHelp;

inline std::string invalid(const std::string& word) {
  return "\nInvalid command option '\x1b[31m" + word + "\x1b[39m'";
}

inline std::string prompt(const std::string& path) {
  return "(" + path + ")>> ";
}

struct ShellRun {
  bool ok;
  std::string out, err;
};

inline ShellRun runShell(std::shared_ptr<CommandBase> root, std::vector<std::string> args,
                         const std::string& input = "") {
  struct Shell : CommandShell {
    std::shared_ptr<CommandBase> root;
    std::shared_ptr<CommandBase> createRootCommand() override { return root; }
  } shell;
  shell.root = std::move(root);
  std::istringstream in(input);
  std::ostringstream out, err;
  ScopedConsoleForTesting console(in, out, err);
  const bool ok = shell.run(std::move(args));
  return {ok, out.str(), err.str()};
}

}  // namespace halvex::testing
