// SPDX-License-Identifier: MIT
#include <gtest/gtest.h>

#include <cstdlib>
#include <ctime>
#include <optional>
#include <string>
#include <utility>

#include "halvex/trace/Timestamp.h"

namespace halvex::trace {
namespace {

using Format = Timestamp::Format;

// The local time zone for this object's lifetime; the process's own comes back afterwards.
class ScopedZone {
 public:
  explicit ScopedZone(const char* zone) {
    if (const char* saved = std::getenv("TZ")) {
      saved_ = saved;
    }
    setenv("TZ", zone, 1);
    tzset();
  }
  ~ScopedZone() {
    if (saved_) {
      setenv("TZ", saved_->c_str(), 1);
    } else {
      unsetenv("TZ");
    }
    tzset();
  }
  ScopedZone(const ScopedZone&) = delete;
  ScopedZone& operator=(const ScopedZone&) = delete;

 private:
  std::optional<std::string> saved_;
};

Timestamp stampAt(long seconds, long microseconds, Timestamp::TimeDomain domain) {
  Timestamp stamp;
  stamp.set(timeval{seconds, microseconds}, domain);
  return stamp;
}

// 1700000000 s and 5000 us, in UTC and in zones east and west of it. Bits beyond the four
// flags change nothing.
TEST(Timestamp, RendersEveryFormInEveryZone) {
  struct Row {
    Format format;
    const char* utc;
    const char* east;  // +05:30
    const char* west;  // -08:00
  };
  const Row rows[] = {
      {0x00, "1700000000", "1700000000", "1700000000"},
      {0x08, "1700000000.5", "1700000000.5", "1700000000.5"},
      {0x04, "1700000000.5000", "1700000000.5000", "1700000000.5000"},
      {0x0C, "1700000000.5000", "1700000000.5000", "1700000000.5000"},
      {0x122, "1700000000", "1700000000", "1700000000"},
      {0x01, "2023-11-14-22-13-20", "2023-11-15-03-43-20", "2023-11-14-14-13-20"},
      {0x05, "2023-11-14-22-13-20", "2023-11-15-03-43-20", "2023-11-14-14-13-20"},
      {0x09, "2023-11-14-22-13-20-005", "2023-11-15-03-43-20-005", "2023-11-14-14-13-20-005"},
      {0x10, "2023.11.14_22-13-20+0000", "2023.11.15_03-43-20+0530", "2023.11.14_14-13-20-0800"},
      {0x11, "2023.11.14_22-13-20+0000", "2023.11.15_03-43-20+0530", "2023.11.14_14-13-20-0800"},
      {0x18, "2023.11.14_22-13-20+0000-005", "2023.11.15_03-43-20+0530-005",
       "2023.11.14_14-13-20-0800-005"},
  };
  const Timestamp stamp = stampAt(1700000000, 5000, Timestamp::kBaseband);
  const std::pair<const char*, const char * Row::*> zones[] = {
      {"UTC0", &Row::utc}, {"<+0530>-5:30", &Row::east}, {"<-08>8", &Row::west}};
  for (const auto& [zone, column] : zones) {
    const ScopedZone scoped(zone);
    for (const Row& row : rows) {
      EXPECT_EQ(stamp.asString(Timestamp::kBaseband, row.format), row.*column)
          << zone << " format " << row.format;
    }
  }
}

TEST(Timestamp, FractionsAndMissingDomains) {
  const ScopedZone utc("UTC0");
  const Format date = Timestamp::kFormatDate;
  const Format ms = Timestamp::kFormatMilliseconds;
  // Milliseconds are cut, not rounded.
  const Timestamp high = stampAt(1700000000, 999999, Timestamp::kMonotonic);
  EXPECT_EQ(high.asString(Timestamp::kMonotonic, ms), "1700000000.999");
  EXPECT_EQ(high.asString(Timestamp::kMonotonic, date | ms), "2023-11-14-22-13-20-999");
  EXPECT_EQ(high.asString(Timestamp::kMonotonic, Timestamp::kFormatMicroseconds),
            "1700000000.999999");
  // A domain never set reads as zero.
  EXPECT_EQ(high.asString(static_cast<Timestamp::TimeDomain>(77), ms), "0.0");
  EXPECT_EQ(high.asString(Timestamp::kBaseband, date), "1970-01-01-00-00-00");
}

// A new stamp holds the wall-clock time of its creation and nothing else; copies are independent.
TEST(Timestamp, GetSetAndIndependentCopies) {
  const auto asPair = [](const timeval& t) { return std::pair(t.tv_sec, t.tv_usec); };
  timeval before{};
  timeval wall{};
  timeval after{};
  Timestamp::now(before);
  Timestamp stamp;
  Timestamp::now(after);
  ASSERT_TRUE(stamp.get(wall, Timestamp::kWallClock));
  EXPECT_LE(asPair(before), asPair(wall));
  EXPECT_LE(asPair(wall), asPair(after));
  timeval read{7, 8};
  EXPECT_FALSE(stamp.get(read, Timestamp::kMonotonic));
  EXPECT_EQ(asPair(read), std::pair(0L, 0L));

  const Timestamp copy = stamp;
  stamp.set(timeval{42, 43}, Timestamp::kWallClock);
  stamp.set(timeval{44, 45}, Timestamp::kMonotonic);
  ASSERT_TRUE(stamp.get(read, Timestamp::kWallClock));
  EXPECT_EQ(asPair(read), std::pair(42L, 43L));
  ASSERT_TRUE(copy.get(read, Timestamp::kWallClock));
  EXPECT_EQ(asPair(read), asPair(wall));
  EXPECT_FALSE(copy.get(read, Timestamp::kMonotonic));
}

}  // namespace
}  // namespace halvex::trace
