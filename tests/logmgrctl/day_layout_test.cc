#include "tools/logmgrctl/day_layout.h"

#include <gtest/gtest.h>

#include <tuple>
#include <utility>

namespace daypage {
namespace {

constexpr int64_t kMin = 60000;

class DayLayoutTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(ParseDate("2026-03-10", &day)); }
  int64_t At(int hour, int minute = 0) const { return day + hour * kHourMs + minute * kMin; }
  // [start, end] of a span; {-1, -1} for a period not on the day.
  static std::pair<int64_t, int64_t> P(Span span) { return {span.start, span.end}; }
  std::pair<int64_t, int64_t> Clip(int64_t start, int64_t end) const {
    Span out{-1, -1};
    return ClipToDay({start, end}, day, &out) ? P(out) : P({-1, -1});
  }
  int64_t day = 0;
};

TEST_F(DayLayoutTest, ClipsPeriodsToTheDayAcrossMidnight) {
  EXPECT_EQ(Clip(At(-1), At(1)), P({day, At(1)}));                   // began yesterday
  EXPECT_EQ(Clip(At(23, 30), At(24, 45)), P({At(23, 30), At(24)}));  // ends tomorrow
  EXPECT_EQ(Clip(At(-2), At(0)), P({-1, -1})) << "ends at midnight: yesterday's";
  EXPECT_EQ(Clip(At(24), At(25)), P({-1, -1}));
  EXPECT_EQ(Clip(At(5), At(4)), P({-1, -1})) << "negative length";
  EXPECT_EQ(Clip(At(0), At(0)), P({day, day})) << "a point at midnight is today's";
  EXPECT_EQ(Clip(At(24), At(24)), P({-1, -1}));
}

TEST_F(DayLayoutTest, OverlappingBarsGetTracksAndCountOnce) {
  int tracks = 0;
  // A bar, one overlapping it, one touching its end, a point inside the first two.
  std::vector<Span> spans = {
      {At(1), At(3)}, {At(2), At(4)}, {At(3), At(5)}, {At(2, 30), At(2, 30)}};
  // Touching ends share a track; the point inside two bars needs a third.
  EXPECT_EQ(AssignTracks(spans, &tracks), (std::vector<int>{0, 1, 0, 2}));
  EXPECT_EQ(tracks, 3);
  AssignTracks({}, &tracks);
  EXPECT_EQ(tracks, 1);

  EXPECT_EQ(UnionLength(spans), 4 * kHourMs);
  EXPECT_EQ(UnionLength({{At(1), At(5)}, {At(2), At(3)}, {At(6), At(6)}}), 4 * kHourMs);
  EXPECT_EQ(UnionLength({}), 0);
}

TEST_F(DayLayoutTest, WindowCoversWholeHoursAroundWhatIsDrawn) {
  EXPECT_EQ(P(ViewWindow({}, day)), P({day, At(24)}));
  EXPECT_EQ(P(ViewWindow({{At(21, 58), At(22, 10)}, {At(23, 1), At(23, 1)}}, day)),
            P({At(21), At(24)}));
  EXPECT_EQ(P(ViewWindow({{At(7), At(7)}}, day)), P({At(7), At(8)}));      // at least an hour
  EXPECT_EQ(P(ViewWindow({{At(24), At(24)}}, day)), P({At(23), At(24)}));  // never past midnight
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
  for (auto [activity, date, expected] :
       {std::make_tuple("001", "2026-03-11T00:00:00+0900", day),
        std::make_tuple("002", "2026-03-10T03:00:00+0900", day),
        std::make_tuple("007", "2026-03-10T00:00:00+0900", day),
        std::make_tuple("003", "2026-03-11T00:00:00+0900", day + kDayMs)}) {
    other = -1;
    EXPECT_TRUE(RecordDay(activity, date, &other)) << activity;
    EXPECT_EQ(other, expected) << activity;
  }
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
