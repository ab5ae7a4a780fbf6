// SPDX-License-Identifier: MIT
#include "shell/Completion.h"

#include <algorithm>
#include <set>

#include "shell/CommandShell.h"

namespace halvex {

namespace {

Completion matching(std::size_t start, std::string_view typed, const std::set<std::string>& words) {
  Completion completion{start, {}};
  for (const std::string& word : words) {
    if (word.starts_with(typed)) {
      completion.candidates.push_back(word);
    }
  }
  return completion;
}

Completion completePath(std::shared_ptr<CommandBase> command, std::size_t start,
                        std::string_view typed) {
  const std::size_t slash = typed.rfind('/');
  const std::size_t componentStart = slash == std::string_view::npos ? 0 : slash + 1;
  for (const std::string& component :
       CommandShell::splitPath(std::string(typed.substr(0, componentStart)), '/')) {
    if (!CommandShell::stepPath(command, component)) {
      return {};
    }
  }
  std::set<std::string> words{"../"};
  for (const auto& [name, child] : command->getSubCommands()) {
    words.insert(child->getSubCommands().empty() ? name : name + "/");
  }
  return matching(start + componentStart, typed.substr(componentStart), words);
}

}  // namespace

Completion completeWord(const std::shared_ptr<CommandBase>& working, std::string_view text) {
  std::size_t start = text.size();
  while (start > 0 && !CommandShell::isWordSeparator(text[start - 1])) {
    --start;
  }
  const std::string_view typed = text.substr(start);
  std::vector<std::string> words = CommandShell::splitWords(std::string(text.substr(0, start)));
  const auto separator = std::find(words.rbegin(), words.rend(), "--");
  words.erase(words.begin(), separator.base());

  std::shared_ptr<CommandBase> command = working;
  for (std::size_t i = 0; i < words.size(); ++i) {
    const std::string& word = words[i];
    const std::size_t following = words.size() - i - 1;
    if (word == "cd") {
      return following == 0 ? completePath(command, start, typed) : Completion{};
    }
    if (command->hasOption(word)) {
      const std::vector<std::string> declared = command->getOptionWords(word);
      const bool onlyDeclared = std::all_of(words.begin() + static_cast<std::ptrdiff_t>(i + 1),
                                            words.end(), [&](const std::string& argument) {
                                              return std::find(declared.begin(), declared.end(),
                                                               argument) != declared.end();
                                            });
      return onlyDeclared ? matching(start, typed, {declared.begin(), declared.end()})
                          : Completion{};
    }
    if (!command->hasSubCommand(word)) {
      return {};
    }
    command = command->getSubCommand(word);
  }

  std::set<std::string> accepted{"cd", "help"};
  if (words.empty()) {
    accepted.insert({"back", "quit", "exit"});
  }
  for (const auto& [name, handler] : command->getOptions()) {
    accepted.insert(name);
  }
  for (const auto& [name, child] : command->getSubCommands()) {
    accepted.insert(name);
  }
  return matching(start, typed, accepted);
}

}  // namespace halvex
