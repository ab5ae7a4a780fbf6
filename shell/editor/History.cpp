// SPDX-License-Identifier: MIT
#include "shell/editor/History.h"

#include <utility>

namespace halvex::editor {

void History::add(std::string line) {
  if (line.find_first_not_of(" \t\n\v\f\r") == std::string::npos || line.size() > kMaxBytes ||
      (!lines_.empty() && lines_.back() == line)) {
    return;
  }
  bytes_ += line.size();
  lines_.push_back(std::move(line));
  while (lines_.size() > kMaxLines || bytes_ > kMaxBytes) {
    bytes_ -= lines_.front().size();
    lines_.pop_front();
  }
}

std::optional<History::Match> History::searchBackward(std::string_view text,
                                                      std::size_t index) const {
  for (std::size_t i = index < lines_.size() ? index + 1 : lines_.size(); i-- > 0;) {
    const std::size_t offset = lines_[i].find(text);
    if (offset != std::string::npos) {
      return Match{i, offset};
    }
  }
  return std::nullopt;
}

}  // namespace halvex::editor
