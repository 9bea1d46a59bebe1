// Reading dates by pattern: strict widths and literals, real dates only, and
// the zone offset's sign.
#include <gtest/gtest.h>

#include "common/DateText.h"

namespace {

using namespace std::chrono;

constexpr const char* kPlain = "yyyy-MM-dd HH:mm:ss ZZZ";
constexpr const char* kMillis = "yyyy-MM-dd HH:mm:ss.SSS ZZZ";

vtc::Date utc(int y, unsigned m, unsigned d, int h, int min, int s, int ms = 0) {
  return time_point_cast<vtc::Date::duration>(sys_days(year(y) / month(m) / day(d)) + hours(h) +
                                              minutes(min) + seconds(s) + milliseconds(ms));
}

TEST(DateText, ZonesShiftToUtcAndTheWholeTextMustMatchItsPattern) {
  EXPECT_EQ(vtc::dates::parse("2011-03-04 10:20:30 +0100", kPlain), utc(2011, 3, 4, 9, 20, 30));
  EXPECT_EQ(vtc::dates::parse("2011-03-04 22:50:30 -0830", kPlain), utc(2011, 3, 5, 7, 20, 30));
  EXPECT_EQ(vtc::dates::parse("2011-03-04 10:20:30.250 +0000", kMillis),
            utc(2011, 3, 4, 10, 20, 30, 250));
  EXPECT_EQ(vtc::dates::parse("2012-02-29 00:00:00 +0000", kPlain), utc(2012, 2, 29, 0, 0, 0));

  for (const char* wrong :
       {"2011-03-04 10:20:30.250 +0100",  // the other pattern
        "2011-03-04 10:20:30 +0100 ", "2011-03-04 10:20:30", "2011-3-04 10:20:30 +0100",
        "2011-02-29 10:20:30 +0100", "2011-03-04 24:00:00 +0100", "2011-03-04 10:20:30 0100",
        "yesterday", ""})
    EXPECT_FALSE(vtc::dates::parse(wrong, kPlain)) << wrong;
  EXPECT_FALSE(vtc::dates::parse("2011-03-04 10:20:30 +0100", kMillis));
}

}  // namespace
