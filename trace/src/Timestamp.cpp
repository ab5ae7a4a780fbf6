// SPDX-License-Identifier: MIT
#include "halvex/trace/Timestamp.h"

#include <cstddef>
#include <cstdio>
#include <ctime>
#include <string>

namespace halvex::trace {

Timestamp::Timestamp() {
  timeval wall{};
  now(wall);
  times_[kWallClock] = wall;
}

void Timestamp::set(const timeval& time, TimeDomain domain) {
  times_[domain] = time;
}

bool Timestamp::get(timeval& time, TimeDomain domain) const {
  const auto found = times_.find(domain);
  if (found == times_.end()) {
    time.tv_sec = 0;
    time.tv_usec = 0;
    return false;
  }
  time = found->second;
  return true;
}

void Timestamp::now(timeval& time) {
  gettimeofday(&time, nullptr);
}

std::string Timestamp::asString(TimeDomain domain, Format format) const {
  timeval time{};
  get(time, domain);
  const long long milliseconds = static_cast<long long>(time.tv_usec) / 1000;

  if ((format & (kFormatDate | kFormatDateWithZone)) == 0) {
    // Unpadded on purpose (5 ms reads ".5"): names already written in this form must keep
    // sorting and parsing the same way. Only the date forms pad.
    std::string text = std::to_string(static_cast<long long>(time.tv_sec));
    if ((format & kFormatMicroseconds) != 0) {
      text += '.';
      text += std::to_string(static_cast<long long>(time.tv_usec));
    } else if ((format & kFormatMilliseconds) != 0) {
      text += '.';
      text += std::to_string(milliseconds);
    }
    return text;
  }

  const time_t seconds = time.tv_sec;
  tm local{};
  localtime_r(&seconds, &local);
  const char* pattern =
      (format & kFormatDateWithZone) != 0 ? "%Y.%m.%d_%H-%M-%S%z" : "%Y-%m-%d-%H-%M-%S";
  char buffer[64] = {};
  const std::size_t length = strftime(buffer, sizeof buffer, pattern, &local);
  std::string text(buffer, length);
  if ((format & kFormatMilliseconds) != 0) {
    char fraction[32] = {};
    std::snprintf(fraction, sizeof fraction, "-%03lld", milliseconds);
    text += fraction;
  }
  return text;
}

}  // namespace halvex::trace
