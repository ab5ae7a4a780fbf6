// SPDX-License-Identifier: MIT
// A node of the command tree the shell walks: a named command with options (actions) and
// sub-commands (children).
//
// Ownership: commands live in shared pointers only. A parent owns its children through its
// sub-command table; a child refers to its parent weakly, so the tree has no cycles and a child
// may outlive its parent (its getParent() then no longer locks). A command must not be registered
// below itself: listings walk the tree recursively. Every concrete command has a factory that
// creates it, hands it to a shared pointer and only then calls init(); a registerCommands() that
// calls shared_from_this() on a command nobody owns yet throws std::bad_weak_ptr out of init().
//
// Threads: every operation runs on the shell's thread and none takes a lock. The one thing that
// crosses threads is the TaskGroup given to an option handler (see runOption). Handlers and the
// work they start must not change any command's tables.
//
// Tables are std::map keyed by std::string, which compares bytes as unsigned char: "Z" < "a" <
// "\x80". Lookups are exact and case-sensitive. Help listings follow that key order, not the
// order of registration.
#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/TaskGroup.h"

namespace halvex {

// An option's action: the group to hold while asynchronous work is outstanding, and the words
// that followed the option on the input line. Returns true on success.
using OptionHandler = std::function<bool(TaskGroup, std::vector<std::string>)>;

class CommandBase : public std::enable_shared_from_this<CommandBase> {
 public:
  using OptionTable = std::map<std::string, OptionHandler>;
  using DescriptionTable = std::map<std::string, std::string>;
  using SubCommandTable = std::map<std::string, std::shared_ptr<CommandBase>>;

  // Only stores its arguments; the path and the tables stay empty until init().
  CommandBase(std::string name, std::weak_ptr<CommandBase> parent);
  virtual ~CommandBase();

  CommandBase(const CommandBase&) = delete;
  CommandBase& operator=(const CommandBase&) = delete;

  // Called once by the factory. Sets the path to the parent's path (if the parent is still
  // alive), "/" and the name, then calls registerCommands(). Because a parent's path is set
  // before its registerCommands() runs, children created there get the full path.
  virtual void init();

  // Writes the help listing to consoleOut(), each line newline-terminated and flushed.
  virtual void printHelp();

  // Asked by the shell before it runs this command's option `word` or enters its sub-command
  // `word` (not for "cd"). An override that says no prints its own reason. Default: true.
  virtual bool canExecute(const std::string& word);

  // Registers this command's options and children; called only by init().
  virtual void registerCommands() = 0;

  // Stores handler under optionName, replacing an earlier one. A non-empty description replaces
  // the shown text; an empty one keeps whatever was there. An empty handler is ignored entirely.
  void addOption(const std::string& optionName, OptionHandler handler,
                 const std::string& description);

  // As above, and declares the words the option takes before any word of the user's own (flags
  // such as "nocompress"); completion offers them. An empty list keeps what was declared before.
  void addOption(const std::string& optionName, OptionHandler handler,
                 const std::string& description, std::vector<std::string> words);

  // Registers command as the child commandName, replacing an earlier one. Neither its name nor
  // its parent is checked. A null command is ignored: the shell could not enter it.
  void addSubCommand(const std::string& commandName, std::shared_ptr<CommandBase> command);

  // The first name is the child's name, every further one an alias that the shell accepts but
  // listings never show. An empty list or a null command is ignored.
  void addSubCommand(const std::vector<std::string>& names, std::shared_ptr<CommandBase> command);

  bool hasOption(const std::string& optionName) const;
  // The words the option declared; empty when it declared none or is not registered.
  std::vector<std::string> getOptionWords(const std::string& optionName) const;
  // Names and aliases both count.
  bool hasSubCommand(const std::string& commandName) const;
  // The child registered under commandName or that alias, else null. Never adds an entry.
  std::shared_ptr<CommandBase> getSubCommand(const std::string& commandName) const;

  // Runs the option's handler with a new TaskGroup and args, then blocks, with no time-out,
  // until the group is empty, and returns the handler's result (which is fixed when the handler
  // returns, whatever its asynchronous work finds later). A handler that starts asynchronous work
  // enters the group first and makes sure the work leaves it when done; one that never leaves
  // blocks the shell for good. An unregistered name returns false and runs nothing.
  bool runOption(const std::string& optionName, std::vector<std::string> args);

  const std::string& getName() const { return name_; }
  std::string getPath() const { return path_; }
  std::weak_ptr<CommandBase> getParent() const { return parent_; }
  OptionTable getOptions() const { return options_; }
  // Aliases are not included.
  SubCommandTable getSubCommands() const { return subCommands_; }

  // One help line for command if it has options ("name  -  [a|b]", indented by depth), then the
  // same for each of its sub-commands at depth + 1. printHelp() calls it with depth 0.
  void printSubCommandSummary(std::shared_ptr<CommandBase> command, std::size_t depth);

 private:
  // The trailing underscores keep a derived class's parameters called `name` or `parent` from
  // shadowing these members under -Wshadow.
  std::weak_ptr<CommandBase> parent_;
  std::string name_;
  std::string path_;
  OptionTable options_;
  DescriptionTable optionHelp_;
  std::map<std::string, std::vector<std::string>> optionWords_;
  SubCommandTable subCommands_;
  SubCommandTable subCommandAliases_;
};

}  // namespace halvex
