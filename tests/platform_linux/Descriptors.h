// SPDX-License-Identifier: MIT
// The process's descriptors, for tests that exhaust or count them.
#pragma once

#include <sys/resource.h>
#include <unistd.h>

#include <filesystem>

namespace halvex::test {

// Makes every descriptor the process opens fail (EMFILE) for as long as it lives.
class NoMoreDescriptors {
 public:
  // Why a build cannot run out of descriptors and go on; empty when it can.
  static const char* impossible() {
#ifdef HALVEX_TEST_VPTR_CHECKS
    return "UBSan's checks of virtual calls need a descriptor of their own";
#else
    return "";
#endif
  }

  NoMoreDescriptors() {
    ::getrlimit(RLIMIT_NOFILE, &saved_);
    const int lowestFree = ::dup(0);
    ::close(lowestFree);
    rlimit none = saved_;
    none.rlim_cur = static_cast<rlim_t>(lowestFree);
    ::setrlimit(RLIMIT_NOFILE, &none);
  }
  ~NoMoreDescriptors() { ::setrlimit(RLIMIT_NOFILE, &saved_); }
  NoMoreDescriptors(const NoMoreDescriptors&) = delete;
  NoMoreDescriptors& operator=(const NoMoreDescriptors&) = delete;

 private:
  rlimit saved_{};
};

inline int openDescriptors() {
  int count = 0;
  for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    ++count;
  }
  return count;
}

}  // namespace halvex::test
