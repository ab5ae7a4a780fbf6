// SPDX-License-Identifier: MIT
// What TAB offers at the end of a partly typed line: the words the shell would accept there.
//
// The line's last command (after its last "--") is resolved word by word from the working
// command exactly as the shell evaluates it, except that canExecute is never asked (it may print
// a refusal). At the word being typed the candidates are the current command's options and
// sub-commands (not their aliases), "cd" and "help", and "back", "quit" and "exit" when it is the
// command's first word. After an option come the words the option declared, for as long as every
// word before is one of them; after "cd", one path whose last component may be a sub-command of
// the command the path has reached so far or "..". A word the shell would reject leaves nothing
// to offer. Names are compared byte for byte, as the shell does.
#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "shell/CommandBase.h"

namespace halvex {

struct Completion {
  // Where the text the candidates would replace begins; it ends where the given text ends.
  std::size_t start = 0;
  // Sorted, each starting with the text it would replace. A path candidate that can be walked
  // further ends in "/".
  std::vector<std::string> candidates;
};

Completion completeWord(const std::shared_ptr<CommandBase>& working, std::string_view text);

}  // namespace halvex
