// SPDX-License-Identifier: MIT
#include "shell/CommandShell.h"

#include <cstddef>
#include <istream>
#include <ostream>
#include <utility>

#include "shell/Completion.h"
#include "shell/Console.h"
#include "shell/editor/LineEditor.h"

namespace halvex {

CommandShell::CommandShell() = default;
CommandShell::~CommandShell() = default;

bool CommandShell::run(std::vector<std::string> args) {
  rootCommand_ = createRootCommand();
  if (!rootCommand_) {
    return false;
  }
  currentCommand_ = rootCommand_;
  if (!args.empty()) {
    args.erase(args.begin());
  }
  if (args.empty()) {
    workingCommand_ = rootCommand_;
    if (editor::Terminal* terminal = consoleTerminal()) {
      editor_ = std::make_unique<editor::LineEditor>(*terminal, [this](std::string_view before) {
        return completeWord(workingCommand_, before);
      });
    }
  }

  std::vector<std::vector<std::string>> batch = splitCommands(std::move(args));
  // Once any command of the run has failed, every later batch runs only its first command.
  bool runOk = true;
  std::string line;
  for (;;) {
    bool commandOk = true;
    for (const std::vector<std::string>& command : batch) {
      if (evaluate(command, commandOk) == Outcome::kQuit) {
        return true;
      }
      currentCommand_ = workingCommand_ ? workingCommand_ : rootCommand_;
      runOk = runOk && commandOk;
      if (!runOk) {
        break;
      }
    }
    if (!workingCommand_) {
      return runOk;
    }

    currentCommand_ = workingCommand_;
    if (!readLine('(' + workingCommand_->getPath() + ")>> ", line)) {
      return false;
    }
    batch = splitCommands(splitWords(line));
  }
}

CommandShell::Outcome CommandShell::evaluate(const std::vector<std::string>& words,
                                             bool& commandOk) {
  const std::size_t count = words.size();
  for (std::size_t i = 0; i < count; ++i) {
    const std::string& word = words[i];
    const bool last = i + 1 == count;
    const auto rest = [&] {
      return std::vector<std::string>(words.begin() + static_cast<std::ptrdiff_t>(i + 1),
                                      words.end());
    };

    if (word == "cd") {
      if (!changeCommand(rest())) {
        currentCommand_->printHelp();
        commandOk = false;
      }
      return Outcome::kEnded;
    }
    if (currentCommand_->hasOption(word)) {
      commandOk = currentCommand_->canExecute(word) && currentCommand_->runOption(word, rest());
      return Outcome::kEnded;
    }
    if (currentCommand_->hasSubCommand(word)) {
      if (!currentCommand_->canExecute(word)) {
        commandOk = false;
        return Outcome::kEnded;
      }
      currentCommand_ = currentCommand_->getSubCommand(word);
      if (last) {
        // Naming a sub-command without saying what to do in it shows what it offers.
        currentCommand_->printHelp();
        commandOk = false;
        return Outcome::kEnded;
      }
      commandOk = true;
      continue;
    }
    if (word == "help" && last) {
      currentCommand_->printHelp();
      return Outcome::kEnded;
    }
    if (count == 1 && word == "back") {
      if (workingCommand_) {
        if (std::shared_ptr<CommandBase> parent = workingCommand_->getParent().lock()) {
          workingCommand_ = std::move(parent);
        }
      }
      return Outcome::kEnded;
    }
    if (count == 1 && (word == "quit" || word == "exit")) {
      return Outcome::kQuit;
    }
    reportInvalid(word);
    commandOk = false;
    return Outcome::kEnded;
  }
  return Outcome::kEnded;
}

bool CommandShell::readLine(const std::string& prompt, std::string& line) {
  if (editor_) {
    std::optional<std::string> edited = editor_->readLine(prompt);
    if (!edited) {
      return false;
    }
    line = std::move(*edited);
    return true;
  }
  writeText(consoleOut(), prompt);
  // A last line without a newline still counts; only a read that gets nothing ends the run.
  return static_cast<bool>(std::getline(consoleIn(), line));
}

void CommandShell::reportInvalid(const std::string& word) {
  std::ostream& out = consoleOut();
  writeText(out, "\n");
  // No newline: the help listing that follows starts with its own.
  writeText(out, "Invalid command option '\x1b[31m" + word + "\x1b[39m'");
  currentCommand_->printHelp();
}

bool CommandShell::changeCommand(const std::vector<std::string>& words) {
  if (words.size() != 1) {
    return false;
  }
  for (const std::string& component : splitPath(words.front(), '/')) {
    if (!stepPath(currentCommand_, component)) {
      return false;
    }
  }
  if (workingCommand_) {
    workingCommand_ = currentCommand_;
  }
  return true;
}

bool CommandShell::stepPath(std::shared_ptr<CommandBase>& command, const std::string& component) {
  if (command->hasSubCommand(component)) {
    command = command->getSubCommand(component);
  } else if (component == "..") {
    if (std::shared_ptr<CommandBase> parent = command->getParent().lock()) {
      command = std::move(parent);
    }
  } else {
    return false;
  }
  return true;
}

std::vector<std::string> CommandShell::splitWords(const std::string& line) {
  std::vector<std::string> words;
  const std::size_t size = line.size();
  std::size_t pos = 0;
  while (pos < size) {
    while (pos < size && isWordSeparator(line[pos])) {
      ++pos;
    }
    const std::size_t start = pos;
    while (pos < size && !isWordSeparator(line[pos])) {
      ++pos;
    }
    if (pos > start) {
      words.emplace_back(line, start, pos - start);
    }
  }
  return words;
}

std::vector<std::vector<std::string>> CommandShell::splitCommands(std::vector<std::string> words) {
  std::vector<std::vector<std::string>> batch;
  std::vector<std::string> open;
  for (std::string& word : words) {
    if (word == "--") {
      if (!open.empty()) {
        batch.push_back(std::move(open));
        open.clear();
      }
    } else {
      open.push_back(std::move(word));
    }
  }
  if (!open.empty()) {
    batch.push_back(std::move(open));
  }
  return batch;
}

std::vector<std::string> CommandShell::splitPath(const std::string& text, char separator) {
  std::string spaced = text;
  for (char& c : spaced) {
    if (c == separator) {
      c = ' ';
    }
  }
  return splitWords(spaced);
}

}  // namespace halvex
