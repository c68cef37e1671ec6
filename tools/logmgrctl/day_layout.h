// Arithmetic of the day page: local wall-clock times, clipping periods to the day, lanes that
// share no pixels, the visible window and its ticks. No I/O, so it is tested on its own.
#ifndef LOGMGR_TOOLS_LOGMGRCTL_DAY_LAYOUT_H_
#define LOGMGR_TOOLS_LOGMGRCTL_DAY_LAYOUT_H_

#include <stdint.h>

#include <string>
#include <vector>

namespace daypage {

constexpr int64_t kHourMs = 3600000;
constexpr int64_t kDayMs = 24 * kHourMs;

// Local wall-clock milliseconds count as if the zone were UTC: every local day is then 24 h
// long and starts at a multiple of kDayMs, whatever daylight saving does to the real clock.
struct Span {
  int64_t start;
  int64_t end;
};

// Wall-clock ms of the instant |utcMs| in the tz database zone |zone|; an empty or malformed
// name means the process's own zone. Switches the process's TZ while it works.
int64_t WallClockMs(int64_t utcMs, const std::string& zone);

// A zone name safe to hand to TZ: tz database style, no "..", no leading "/".
bool IsZoneName(const std::string& zone);

// "YYYY-MM-DD" to the wall-clock ms of that day's midnight; false for anything else.
bool ParseDate(const std::string& text, int64_t* dayStart);

int64_t DayOf(int64_t wallMs);            // the midnight starting the day of |wallMs|
std::string FormatDate(int64_t wallMs);   // "YYYY-MM-DD"
std::string FormatClock(int64_t wallMs);  // "HH:MM:SS.mmm"
// "HH:MM" counted from |dayStart|, so the midnight ending the day is "24:00".
std::string FormatHourMinute(int64_t wallMs, int64_t dayStart);
std::string FormatDuration(int64_t ms);  // "12.345 s", "5 min 03 s", "2 h 05 min 03 s"

// The day (midnight, wall ms) a report record belongs to, from its activity and the "date"
// of its body ("YYYY-MM-DDTHH:MM:SS+zzzz", local). Sliced records are dated by the end of
// their window, so one dated at midnight closes the previous day. false when unreadable.
bool RecordDay(const std::string& activity, const std::string& dateText, int64_t* dayStart);

// The part of |period| inside the day starting at |dayStart|. A period of negative length, or
// one that misses the day, gives false; a zero-length one inside the day is kept as a point.
bool ClipToDay(Span period, int64_t dayStart, Span* clipped);

// A track per span (in input order) so that spans sharing a track never overlap; touching
// ends do not count as overlap. |tracks| receives the number of tracks used.
std::vector<int> AssignTracks(const std::vector<Span>& spans, int* tracks);

// Time covered by at least one of |spans|: overlaps count once.
int64_t UnionLength(std::vector<Span> spans);

// The part of the day the timeline shows: whole hours around everything drawn, at least one
// hour, inside the day; the whole day when nothing is drawn.
Span ViewWindow(const std::vector<Span>& drawn, int64_t dayStart);

// Horizontal place of |span| in a box |width| wide showing |window|. Anything narrower than
// |minWidth| is widened around its middle so it stays visible and hoverable; the result is
// kept inside the box.
struct Box {
  double x;
  double width;
};
Box Place(Span span, Span window, double width, double minWidth);

// Tick times in |window| at a whole step of minutes giving at most |maxTicks| ticks.
std::vector<int64_t> Ticks(Span window, int maxTicks);

}  // namespace daypage

#endif  // LOGMGR_TOOLS_LOGMGRCTL_DAY_LAYOUT_H_
