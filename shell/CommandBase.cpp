// SPDX-License-Identifier: MIT
#include "shell/CommandBase.h"

#include <iomanip>
#include <sstream>
#include <string_view>
#include <utility>

#include "shell/Console.h"

namespace halvex {

// Listings and lookups rely on std::string ordering bytes as unsigned values, so that names with
// bytes above 0x7F sort after ASCII ones on every platform, whatever the signedness of char.
static_assert(std::char_traits<char>::compare("\x80", "a", 1) > 0);
static_assert(std::char_traits<char>::compare("Z", "a", 1) < 0);

namespace {

constexpr int kFieldWidth = 16;
constexpr std::string_view kSeparator = "  -  ";
constexpr std::string_view kGreen = "\x1b[32m";
constexpr std::string_view kDefaultColour = "\x1b[39m";

// Starts a help line: TAB, then text right-justified in a 16-wide field (longer text is not cut).
std::ostringstream paddedLine(std::string_view text) {
  std::ostringstream line;
  line << '\t' << std::right << std::setw(kFieldWidth) << text;
  return line;
}

}  // namespace

CommandBase::CommandBase(std::string name, std::weak_ptr<CommandBase> parent)
    : parent_(std::move(parent)), name_(std::move(name)) {}

CommandBase::~CommandBase() = default;

void CommandBase::init() {
  // Held until registration is over so the parent cannot vanish halfway through.
  const std::shared_ptr<CommandBase> parent = parent_.lock();
  if (parent) {
    path_ = parent->path_;
  }
  path_ += '/';
  path_ += name_;
  registerCommands();
}

void CommandBase::printHelp() {
  std::ostream& out = consoleOut();
  writeLine(out, "");
  std::string title = "Options for command '";
  title.append(kGreen).append(name_).append(kDefaultColour).append("':");
  writeLine(out, title);
  writeLine(out, "");

  for (const auto& [optionName, handler] : options_) {
    std::ostringstream line = paddedLine(optionName);
    const auto help = optionHelp_.find(optionName);
    line << kSeparator << (help != optionHelp_.end() ? std::string_view(help->second) : "...");
    writeLine(out, line.str());
    writeLine(out, "");
  }

  for (const auto& [commandName, command] : subCommands_) {
    printSubCommandSummary(command, 0);
    writeLine(out, "");
  }

  std::ostringstream cd = paddedLine("cd");
  cd << kSeparator << "<sub-command>";
  writeLine(out, cd.str());
  for (const std::string_view word : {"help", "back", "quit"}) {
    writeLine(out, paddedLine(word).str());
  }
  writeLine(out, "");
}

bool CommandBase::canExecute(const std::string& /*word*/) {
  return true;
}

void CommandBase::addOption(const std::string& optionName, OptionHandler handler,
                            const std::string& description) {
  addOption(optionName, std::move(handler), description, {});
}

void CommandBase::addOption(const std::string& optionName, OptionHandler handler,
                            const std::string& description, std::vector<std::string> words) {
  if (!handler) {
    return;
  }
  options_[optionName] = std::move(handler);
  if (!description.empty()) {
    optionHelp_[optionName] = description;
  }
  if (!words.empty()) {
    optionWords_[optionName] = std::move(words);
  }
}

std::vector<std::string> CommandBase::getOptionWords(const std::string& optionName) const {
  const auto found = optionWords_.find(optionName);
  return found != optionWords_.end() ? found->second : std::vector<std::string>();
}

void CommandBase::addSubCommand(const std::string& commandName,
                                std::shared_ptr<CommandBase> command) {
  if (command) {
    subCommands_[commandName] = std::move(command);
  }
}

void CommandBase::addSubCommand(const std::vector<std::string>& names,
                                std::shared_ptr<CommandBase> command) {
  if (names.empty() || !command) {
    return;
  }
  subCommands_[names.front()] = command;
  for (std::size_t i = 1; i < names.size(); ++i) {
    subCommandAliases_[names[i]] = command;
  }
}

bool CommandBase::hasOption(const std::string& optionName) const {
  return options_.contains(optionName);
}

bool CommandBase::hasSubCommand(const std::string& commandName) const {
  return subCommands_.contains(commandName) || subCommandAliases_.contains(commandName);
}

std::shared_ptr<CommandBase> CommandBase::getSubCommand(const std::string& commandName) const {
  if (const auto found = subCommands_.find(commandName); found != subCommands_.end()) {
    return found->second;
  }
  if (const auto alias = subCommandAliases_.find(commandName); alias != subCommandAliases_.end()) {
    return alias->second;
  }
  return nullptr;
}

bool CommandBase::runOption(const std::string& optionName, std::vector<std::string> args) {
  const auto found = options_.find(optionName);
  if (found == options_.end()) {
    return false;
  }
  const TaskGroup group;
  // A copy, so the handler stays valid however long it runs.
  const OptionHandler handler = found->second;
  const bool result = handler(group, std::move(args));
  group.wait();
  return result;
}

void CommandBase::printSubCommandSummary(std::shared_ptr<CommandBase> command, std::size_t depth) {
  if (!command) {
    return;
  }
  const OptionTable options = command->getOptions();
  if (!options.empty()) {
    std::string list = "[";
    for (const auto& [optionName, handler] : options) {
      list.append(optionName).append("|");
    }
    list.back() = ']';

    std::ostringstream line;
    line << '\t';
    for (std::size_t i = 0; i < depth; ++i) {
      line << std::right << std::setw(kFieldWidth) << "";
    }
    if (depth == 0) {
      line << std::right << std::setw(kFieldWidth) << command->getName();
    } else {
      line << "     <" << command->getName() << '>';
    }
    line << kSeparator << list;
    writeLine(consoleOut(), line.str());
  }
  for (const auto& [commandName, child] : command->getSubCommands()) {
    printSubCommandSummary(child, depth + 1);
  }
}

}  // namespace halvex
