// SPDX-License-Identifier: MIT
// One moment as seen in several time domains, rendered as text for log and file names.
//
// A plain value: copies are deep and independent. No internal locking: concurrent const calls on
// one object are safe, set() must not run concurrently with any other call on the same object.
#pragma once

#include <sys/time.h>

#include <cstdint>
#include <map>
#include <string>

namespace halvex::trace {

class Timestamp {
 public:
  // Any other value is a valid key as well; only kWallClock is read from the platform.
  enum TimeDomain : std::int32_t {
    kWallClock = 0,  // time of day since the epoch, as gettimeofday gives it
    kMonotonic = 1,
    kBaseband = 2,
  };

  // Flags; bits other than these are ignored. Without kFormatDate and kFormatDateWithZone the
  // text is numeric: seconds since the epoch, with an unpadded fraction when asked for.
  using Format = std::uint32_t;
  // Local time as "%Y-%m-%d-%H-%M-%S".
  static constexpr Format kFormatDate = 0x01;
  // Numeric form only: "." and the microseconds. Wins over kFormatMilliseconds.
  static constexpr Format kFormatMicroseconds = 0x04;
  // "." and the milliseconds in the numeric form; "-" and three digits in the date forms.
  static constexpr Format kFormatMilliseconds = 0x08;
  // Local time as "%Y.%m.%d_%H-%M-%S%z". Wins over kFormatDate.
  static constexpr Format kFormatDateWithZone = 0x10;

  // Holds the current wall-clock time under kWallClock and nothing else.
  Timestamp();

  // Replaces any earlier entry of the domain.
  void set(const timeval& time, TimeDomain domain);
  // False, with both fields of time set to 0, when the domain has no entry.
  bool get(timeval& time, TimeDomain domain) const;

  // The current wall-clock time.
  static void now(timeval& time);

  // A domain without an entry renders as the epoch; that is not an error. Date forms use the
  // process's time zone.
  std::string asString(TimeDomain domain, Format format) const;

 private:
  std::map<TimeDomain, timeval> times_;
};

}  // namespace halvex::trace
