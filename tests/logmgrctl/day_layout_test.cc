#include "tools/logmgrctl/day_layout.h"

#include <gtest/gtest.h>

namespace daypage {
namespace {

constexpr int64_t kMin = 60000;

class DayLayoutTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(ParseDate("2026-03-10", &day)); }
  int64_t At(int hour, int minute = 0) const { return day + hour * kHourMs + minute * kMin; }
  int64_t day = 0;
};

TEST_F(DayLayoutTest, ClipsPeriodsToTheDayAcrossMidnight) {
  Span out{};
  ASSERT_TRUE(ClipToDay({At(-1), At(1)}, day, &out));  // began yesterday
  EXPECT_EQ(out.start, day);
  EXPECT_EQ(out.end, At(1));
  ASSERT_TRUE(ClipToDay({At(23, 30), At(24, 45)}, day, &out));  // ends tomorrow
  EXPECT_EQ(out.start, At(23, 30));
  EXPECT_EQ(out.end, At(24));
  EXPECT_FALSE(ClipToDay({At(-2), At(0)}, day, &out)) << "ends at midnight: yesterday's";
  EXPECT_FALSE(ClipToDay({At(24), At(25)}, day, &out));
  EXPECT_FALSE(ClipToDay({At(5), At(4)}, day, &out)) << "negative length";
  ASSERT_TRUE(ClipToDay({At(0), At(0)}, day, &out)) << "a point at midnight is today's";
  EXPECT_EQ(out.end - out.start, 0);
  EXPECT_FALSE(ClipToDay({At(24), At(24)}, day, &out));
}

TEST_F(DayLayoutTest, OverlappingBarsGetTracksAndCountOnce) {
  int tracks = 0;
  // A bar, one overlapping it, one touching its end, a point inside the first two.
  std::vector<Span> spans = {
      {At(1), At(3)}, {At(2), At(4)}, {At(3), At(5)}, {At(2, 30), At(2, 30)}};
  std::vector<int> track = AssignTracks(spans, &tracks);
  EXPECT_EQ(tracks, 3);
  EXPECT_EQ(track[0], 0);
  EXPECT_EQ(track[1], 1);
  EXPECT_EQ(track[2], 0) << "touching ends share a track";
  EXPECT_EQ(track[3], 2) << "a point inside two bars";
  AssignTracks({}, &tracks);
  EXPECT_EQ(tracks, 1);

  EXPECT_EQ(UnionLength(spans), 4 * kHourMs);
  EXPECT_EQ(UnionLength({{At(1), At(5)}, {At(2), At(3)}, {At(6), At(6)}}), 4 * kHourMs);
  EXPECT_EQ(UnionLength({}), 0);
}

TEST_F(DayLayoutTest, WindowCoversWholeHoursAroundWhatIsDrawn) {
  Span all = ViewWindow({}, day);
  EXPECT_EQ(all.start, day);
  EXPECT_EQ(all.end, At(24));
  Span evening = ViewWindow({{At(21, 58), At(22, 10)}, {At(23, 1), At(23, 1)}}, day);
  EXPECT_EQ(evening.start, At(21));
  EXPECT_EQ(evening.end, At(24));
  Span point = ViewWindow({{At(7), At(7)}}, day);  // at least an hour
  EXPECT_EQ(point.start, At(7));
  EXPECT_EQ(point.end, At(8));
  Span late = ViewWindow({{At(24), At(24)}}, day);  // never past midnight
  EXPECT_EQ(late.start, At(23));
  EXPECT_EQ(late.end, At(24));
}

TEST_F(DayLayoutTest, PlacesBarsProportionallyAndKeepsPointsVisible) {
  Span window{At(20), At(24)};
  Box box = Place({At(21), At(22)}, window, 1000, 3);
  EXPECT_DOUBLE_EQ(box.x, 250);
  EXPECT_DOUBLE_EQ(box.width, 250);
  box = Place({At(22), At(22)}, window, 1000, 4);  // widened around its middle
  EXPECT_DOUBLE_EQ(box.x, 498);
  EXPECT_DOUBLE_EQ(box.width, 4);
  box = Place({At(24), At(24)}, window, 1000, 6);  // kept inside the box
  EXPECT_DOUBLE_EQ(box.x, 994);

  std::vector<int64_t> ticks = Ticks(window, 8);
  ASSERT_EQ(ticks.size(), 5u);  // hourly: 30 min steps would give 9
  EXPECT_EQ(ticks.front(), At(20));
  EXPECT_EQ(ticks.back(), At(24));
  EXPECT_EQ(Ticks({At(9, 7), At(10, 7)}, 8).front(), At(9, 10));
}

TEST_F(DayLayoutTest, DatesClocksAndDurations) {
  int64_t other;
  EXPECT_TRUE(ParseDate("2028-02-29", &other));
  for (const char* bad : {"2026-02-29", "2026-13-01", "2026-3-10", "2026-03-10x", "today", ""}) {
    SCOPED_TRACE(bad);
    EXPECT_FALSE(ParseDate(bad, &other));
  }
  EXPECT_EQ(FormatDate(At(23, 59)), "2026-03-10");
  EXPECT_EQ(FormatClock(At(21, 58) + 1234), "21:58:01.234");
  EXPECT_EQ(FormatHourMinute(At(24), day), "24:00");
  EXPECT_EQ(FormatHourMinute(At(0), day), "00:00");
  EXPECT_EQ(FormatDuration(2000), "2.000 s");
  EXPECT_EQ(FormatDuration(5 * kMin + 3000), "5 min 03 s");
  EXPECT_EQ(FormatDuration(2 * kHourMs + 5 * kMin), "2 h 05 min 00 s");

  // Sliced records are dated by their window's end; the last slice closes the day before.
  EXPECT_TRUE(RecordDay("001", "2026-03-11T00:00:00+0900", &other));
  EXPECT_EQ(other, day);
  EXPECT_TRUE(RecordDay("002", "2026-03-10T03:00:00+0900", &other));
  EXPECT_EQ(other, day);
  EXPECT_TRUE(RecordDay("007", "2026-03-10T00:00:00+0900", &other));
  EXPECT_EQ(other, day);
  EXPECT_TRUE(RecordDay("003", "2026-03-11T00:00:00+0900", &other));
  EXPECT_EQ(other, day + kDayMs);
  EXPECT_FALSE(RecordDay("001", "2026-03-11 00:00", &other));
}

TEST_F(DayLayoutTest, WallClockFollowsEachZone) {
  const int64_t utc = (day / 1000 + 10 * 3600) * 1000;  // 2026-03-10 10:00 UTC
  EXPECT_EQ(WallClockMs(utc, "Asia/Seoul"), At(19));
  EXPECT_EQ(WallClockMs(utc, "America/New_York"), At(6)) << "daylight saving since 8 March";
  EXPECT_EQ(WallClockMs(utc - 60 * kDayMs, "America/New_York"), At(5) - 60 * kDayMs);
  EXPECT_EQ(WallClockMs(utc, "Etc/UTC"), At(10));
  EXPECT_TRUE(IsZoneName("America/Argentina/Buenos_Aires"));
  for (const char* bad : {"", "../../etc/passwd", "/etc/localtime", "Europe/Berlin;x", "a b"}) {
    SCOPED_TRACE(bad);
    EXPECT_FALSE(IsZoneName(bad));
  }
}

}  // namespace
}  // namespace daypage
