// SPDX-License-Identifier: MIT
// The lines entered in this process, oldest first, for Up, Down and Ctrl-R. Nothing is kept on
// disk: the tool keeps no state between runs.
//
// Bounded by lines and by bytes: the oldest lines go first, and a line bigger than the whole
// byte budget (a pasted file, say) is not kept at all. A blank line, or the same line as the
// newest, is not added.
#pragma once

#include <cstddef>
#include <deque>
#include <optional>
#include <string>
#include <string_view>

namespace halvex::editor {

class History {
 public:
  static constexpr std::size_t kMaxLines = 1000;
  static constexpr std::size_t kMaxBytes = 4u << 20;

  void add(std::string line);

  std::size_t size() const { return lines_.size(); }
  const std::string& at(std::size_t index) const { return lines_[index]; }

  // The newest line at or before index that contains text, with the offset of the match.
  struct Match {
    std::size_t index;
    std::size_t offset;
  };
  std::optional<Match> searchBackward(std::string_view text, std::size_t index) const;

 private:
  std::deque<std::string> lines_;
  std::size_t bytes_ = 0;
};

}  // namespace halvex::editor
