// SPDX-License-Identifier: MIT
// What every fuzz target shares: a reader that turns the fuzzer's bytes into choices, and the
// check that stops the run with a message when a property does not hold.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>
#include <vector>

namespace halvex::fuzz {

// Prints what failed and aborts, which libFuzzer reports as a crash and keeps the input for.
// The detail is cut short: a value near the size limits describes itself in megabytes.
[[noreturn]] inline void fail(const char* property, std::string_view detail = {}) {
  constexpr std::size_t kShown = 2000;
  std::fprintf(stderr, "property failed: %s\n%.*s%s\n", property,
               static_cast<int>(std::min(detail.size(), kShown)), detail.data(),
               detail.size() > kShown ? " ..." : "");
  std::abort();
}

inline void check(bool holds, const char* property) {
  if (!holds) {
    fail(property);
  }
}

// detail() makes the message, only when the property fails: it may describe large values.
template <typename Detail>
inline void check(bool holds, const char* property, const Detail& detail) {
  if (!holds) {
    fail(property, detail());
  }
}

// The same with a message already at hand.
inline void check(bool holds, const char* property, const std::string& detail) {
  if (!holds) {
    fail(property, detail);
  }
}

// The pieces of text between separators, as getline would read them: a trailing separator ends
// the last piece rather than starting an empty one.
inline std::vector<std::string> split(const std::string& text, char separator) {
  std::vector<std::string> parts;
  std::size_t start = 0;
  while (start < text.size()) {
    const std::size_t end = std::min(text.find(separator, start), text.size());
    parts.push_back(text.substr(start, end - start));
    start = end + 1;
  }
  return parts;
}

// Reads the input front to back. Past the end every read yields zeros, so that any input, the
// empty one included, describes a complete and small value.
class FuzzInput {
 public:
  FuzzInput(const std::uint8_t* data, std::size_t size) : data_(data), size_(size) {}

  bool empty() const { return pos_ == size_; }

  std::uint8_t byte() { return pos_ < size_ ? data_[pos_++] : 0; }

  // Little-endian, from sizeof(Int) bytes.
  template <typename Int>
  Int integer() {
    std::uint64_t bits = 0;
    for (std::size_t i = 0; i < sizeof(Int); ++i) {
      bits |= std::uint64_t{byte()} << (8 * i);
    }
    return static_cast<Int>(bits);
  }

  // A length byte, then up to that many bytes.
  std::string text() { return bytes(byte()); }

  std::string bytes(std::size_t count) {
    const std::size_t take = count < size_ - pos_ ? count : size_ - pos_;
    std::string out(reinterpret_cast<const char*>(data_ + pos_), take);
    pos_ += take;
    return out;
  }

  std::string rest() { return bytes(size_ - pos_); }

 private:
  const std::uint8_t* data_;
  std::size_t size_;
  std::size_t pos_ = 0;
};

}  // namespace halvex::fuzz
