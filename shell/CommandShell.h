// SPDX-License-Identifier: MIT
// A line-oriented shell over a tree of CommandBase commands.
//
// run() either evaluates its arguments once (one-shot mode) or, when there are none after the
// program name, prompts on consoleOut() and evaluates the lines of consoleIn() until "quit",
// "exit" or the end of input (interactive mode). A line is split into words at ASCII whitespace
// and into commands at "--". Each command's words are resolved from the front against the
// current command: "cd <path>", an option (which takes every remaining word as its arguments), a
// sub-command (descend and go on), "help" as the last word, or "back"/"quit"/"exit" as the only
// word. Anything else is reported as an invalid option followed by the current command's help.
//
// Threads: run() and everything it calls runs on the calling thread (the shell thread). It blocks
// while an option's asynchronous work completes (see CommandBase::runOption), so output from
// that work never interleaves with the prompt.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "shell/CommandBase.h"

namespace halvex {

namespace editor {
class LineEditor;
}

class CommandShell {
 public:
  CommandShell();
  virtual ~CommandShell();

  CommandShell(const CommandShell&) = delete;
  CommandShell& operator=(const CommandShell&) = delete;

  // Call once. args is the process's argument list, program name first; an empty list counts as
  // the program name alone. Returns true after "quit" or "exit", or in one-shot mode when every
  // command succeeded (evaluation stops at the first failure). Returns false when the root
  // cannot be created, when a one-shot command fails, or when interactive input ends.
  bool run(std::vector<std::string> args);

  // Words of line, separated by runs of space, \t, \n, \v, \f and \r. Every other byte, NUL and
  // bytes above 0x7F included, belongs to a word; there is no quoting.
  static std::vector<std::string> splitWords(const std::string& line);

  // Space, \t, \n, \v, \f and \r: exactly what formatted extraction skips in the classic locale
  // (deliberately not isspace(), whose answer for bytes above 0x7F depends on the C locale).
  static bool isWordSeparator(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\v' || c == '\f' || c == '\r';
  }

  // Groups words into commands at each "--", which is dropped; empty commands are dropped too.
  static std::vector<std::vector<std::string>> splitCommands(std::vector<std::string> words);

  // One component of a "cd" path from command: a sub-command (names and aliases) or "..", the
  // parent, which at the root stays put. False, with command unchanged, for anything else.
  static bool stepPath(std::shared_ptr<CommandBase>& command, const std::string& component);

  // Components of text between separators; empty components vanish. As the separators become
  // whitespace before splitting, whitespace inside text also splits components.
  static std::vector<std::string> splitPath(const std::string& text, char separator);

 protected:
  // Builds the tree. Called once, first thing in run(), on the shell thread; it may block. A
  // null result makes run() return false.
  virtual std::shared_ptr<CommandBase> createRootCommand() = 0;

  // The built-in "cd": walks the single path in words from the current command (a leading "/"
  // does not mean the root; ".." is the parent, and stays put at the root) without asking
  // canExecute. On success the working command follows, in interactive mode. False for anything
  // but exactly one word, or a component that is neither a sub-command nor ".."; the current
  // command is then where the walk stopped.
  bool changeCommand(const std::vector<std::string>& words);

 private:
  enum class Outcome { kEnded, kQuit };

  // Evaluates one command's words; commandOk records whether it succeeded.
  Outcome evaluate(const std::vector<std::string>& words, bool& commandOk);
  void reportInvalid(const std::string& word);
  // Shows the prompt and reads the next line; false when input has ended.
  bool readLine(const std::string& prompt, std::string& line);

  std::shared_ptr<CommandBase> rootCommand_;
  // What the prompt shows and every interactive command starts from. Null in one-shot mode,
  // which is how run() tells the modes apart.
  std::shared_ptr<CommandBase> workingCommand_;
  // What the words of the command being evaluated are resolved against.
  std::shared_ptr<CommandBase> currentCommand_;
  // Edits the interactive lines when the console is a terminal; null when it is not, and then
  // the lines are read exactly as they come.
  std::unique_ptr<editor::LineEditor> editor_;
};

}  // namespace halvex
