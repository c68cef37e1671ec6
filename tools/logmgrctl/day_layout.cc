#include "tools/logmgrctl/day_layout.h"

#include <stdio.h>
#include <stdlib.h>
#include <time.h>

#include <algorithm>
#include <numeric>

namespace daypage {
namespace {

int64_t FloorDiv(int64_t a, int64_t b) { return a / b - ((a % b != 0) && ((a < 0) != (b < 0))); }

// Days since 1970-01-01 of a proleptic Gregorian date, and back (H. Hinnant's algorithms).
int64_t DaysFromCivil(int64_t y, unsigned m, unsigned d) {
  y -= m <= 2;
  const int64_t era = FloorDiv(y, 400);
  const unsigned yoe = static_cast<unsigned>(y - era * 400);
  const unsigned doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
  const unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
  return era * 146097 + static_cast<int64_t>(doe) - 719468;
}

void CivilFromDays(int64_t z, int64_t* y, unsigned* m, unsigned* d) {
  z += 719468;
  const int64_t era = FloorDiv(z, 146097);
  const unsigned doe = static_cast<unsigned>(z - era * 146097);
  const unsigned yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
  const unsigned doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
  const unsigned mp = (5 * doy + 2) / 153;
  *d = doy - (153 * mp + 2) / 5 + 1;
  *m = mp < 10 ? mp + 3 : mp - 9;
  *y = static_cast<int64_t>(yoe) + era * 400 + (*m <= 2);
}

bool Digits(const std::string& text, size_t pos, size_t count, unsigned* value) {
  if (pos + count > text.size()) return false;
  *value = 0;
  for (size_t i = pos; i < pos + count; ++i) {
    if (text[i] < '0' || text[i] > '9') return false;
    *value = *value * 10 + static_cast<unsigned>(text[i] - '0');
  }
  return true;
}

// Date at the start of |text| ("YYYY-MM-DD"), validated against the calendar.
bool ParseDatePrefix(const std::string& text, int64_t* dayStart) {
  unsigned y, m, d;
  if (!Digits(text, 0, 4, &y) || text.size() < 10 || text[4] != '-' || text[7] != '-' ||
      !Digits(text, 5, 2, &m) || !Digits(text, 8, 2, &d) || m < 1 || m > 12 || d < 1) {
    return false;
  }
  int64_t days = DaysFromCivil(y, m, d);
  int64_t year;
  unsigned month, day;
  CivilFromDays(days, &year, &month, &day);
  if (month != m || day != d) return false;  // 2026-02-30 and the like
  *dayStart = days * kDayMs;
  return true;
}

}  // namespace

bool IsZoneName(const std::string& zone) {
  if (zone.empty() || zone.size() > 64 || zone[0] == '/' || zone.find("..") != std::string::npos)
    return false;
  for (char c : zone) {
    bool ok = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') ||
              c == '/' || c == '_' || c == '-' || c == '+';
    if (!ok) return false;
  }
  return true;
}

int64_t WallClockMs(int64_t utcMs, const std::string& zone) {
  // TZ is switched only when the zone changes: rows of one zone cost one tzset.
  static std::string current = "\x01";
  static const std::string original = getenv("TZ") != nullptr ? getenv("TZ") : "\x01";
  const std::string wanted = IsZoneName(zone) ? ":" + zone : original;
  if (wanted != current) {
    if (wanted == "\x01") {
      unsetenv("TZ");
    } else {
      setenv("TZ", wanted.c_str(), 1);
    }
    tzset();
    current = wanted;
  }
  time_t seconds = static_cast<time_t>(FloorDiv(utcMs, 1000));
  struct tm tm;
  if (localtime_r(&seconds, &tm) == nullptr) return utcMs;
  return utcMs + static_cast<int64_t>(tm.tm_gmtoff) * 1000;
}

bool ParseDate(const std::string& text, int64_t* dayStart) {
  return text.size() == 10 && ParseDatePrefix(text, dayStart);
}

int64_t DayOf(int64_t wallMs) { return FloorDiv(wallMs, kDayMs) * kDayMs; }

std::string FormatDate(int64_t wallMs) {
  int64_t y;
  unsigned m, d;
  CivilFromDays(FloorDiv(wallMs, kDayMs), &y, &m, &d);
  char text[32];
  snprintf(text, sizeof(text), "%04lld-%02u-%02u", static_cast<long long>(y), m, d);
  return text;
}

std::string FormatClock(int64_t wallMs) {
  int64_t ms = wallMs - DayOf(wallMs);
  char text[32];
  snprintf(text, sizeof(text), "%02d:%02d:%02d.%03d", static_cast<int>(ms / kHourMs),
           static_cast<int>(ms / 60000 % 60), static_cast<int>(ms / 1000 % 60),
           static_cast<int>(ms % 1000));
  return text;
}

std::string FormatHourMinute(int64_t wallMs, int64_t dayStart) {
  int64_t ms = wallMs - dayStart;
  char text[48];
  snprintf(text, sizeof(text), "%02lld:%02lld", static_cast<long long>(FloorDiv(ms, kHourMs)),
           static_cast<long long>(FloorDiv(ms, 60000) - FloorDiv(ms, kHourMs) * 60));
  return text;
}

std::string FormatDuration(int64_t ms) {
  char text[64];
  const char* sign = ms < 0 ? "-" : "";
  int64_t a = ms < 0 ? -ms : ms;
  long long h = a / kHourMs, m = a / 60000 % 60, s = a / 1000 % 60;
  if (a < 60000) {
    snprintf(text, sizeof(text), "%s%lld.%03lld s", sign, s, static_cast<long long>(a % 1000));
  } else if (a < kHourMs) {
    snprintf(text, sizeof(text), "%s%lld min %02lld s", sign, m, s);
  } else {
    snprintf(text, sizeof(text), "%s%lld h %02lld min %02lld s", sign, h, m, s);
  }
  return text;
}

bool RecordDay(const std::string& activity, const std::string& dateText, int64_t* dayStart) {
  int64_t day;
  unsigned h, m, s;
  if (!ParseDatePrefix(dateText, &day) || dateText.size() < 19 || dateText[10] != 'T' ||
      !Digits(dateText, 11, 2, &h) || !Digits(dateText, 14, 2, &m) ||
      !Digits(dateText, 17, 2, &s)) {
    return false;
  }
  bool windowEnd = activity == "001" || activity == "002" || activity == "004";
  *dayStart = (windowEnd && h == 0 && m == 0 && s == 0) ? day - kDayMs : day;
  return true;
}

bool ClipToDay(Span period, int64_t dayStart, Span* clipped) {
  const int64_t dayEnd = dayStart + kDayMs;
  if (period.end < period.start || period.start >= dayEnd) return false;
  // A period ending at midnight belongs to the day before; a point at midnight to this one.
  if (period.end < dayStart || (period.end == dayStart && period.start < dayStart)) return false;
  clipped->start = std::max(period.start, dayStart);
  clipped->end = std::min(period.end, dayEnd);
  return true;
}

std::vector<int> AssignTracks(const std::vector<Span>& spans, int* tracks) {
  std::vector<size_t> order(spans.size());
  std::iota(order.begin(), order.end(), 0);
  std::stable_sort(order.begin(), order.end(), [&](size_t a, size_t b) {
    return spans[a].start != spans[b].start ? spans[a].start < spans[b].start
                                            : spans[a].end < spans[b].end;
  });
  std::vector<int64_t> trackEnds;
  std::vector<int> assigned(spans.size(), 0);
  for (size_t i : order) {
    size_t t = 0;
    while (t < trackEnds.size() && trackEnds[t] > spans[i].start) ++t;
    if (t == trackEnds.size()) trackEnds.push_back(0);
    trackEnds[t] = spans[i].end;
    assigned[i] = static_cast<int>(t);
  }
  *tracks = static_cast<int>(std::max<size_t>(trackEnds.size(), 1));
  return assigned;
}

int64_t UnionLength(std::vector<Span> spans) {
  std::sort(spans.begin(), spans.end(),
            [](const Span& a, const Span& b) { return a.start < b.start; });
  int64_t total = 0, coveredTo = INT64_MIN;
  for (const Span& s : spans) {
    int64_t from = std::max(s.start, coveredTo);
    if (s.end > from) total += s.end - from;
    coveredTo = std::max(coveredTo, s.end);
  }
  return total;
}

Span ViewWindow(const std::vector<Span>& drawn, int64_t dayStart) {
  const int64_t dayEnd = dayStart + kDayMs;
  if (drawn.empty()) return {dayStart, dayEnd};
  int64_t lo = dayEnd, hi = dayStart;
  for (const Span& s : drawn) {
    lo = std::min(lo, s.start);
    hi = std::max(hi, s.end);
  }
  lo = std::max(dayStart, dayStart + FloorDiv(lo - dayStart, kHourMs) * kHourMs);
  hi = std::min(dayEnd, dayStart - FloorDiv(dayStart - hi, kHourMs) * kHourMs);
  if (hi - lo < kHourMs) {
    if (lo + kHourMs <= dayEnd) {
      hi = lo + kHourMs;
    } else {
      lo = hi - kHourMs;
    }
  }
  return {lo, hi};
}

Box Place(Span span, Span window, double width, double minWidth) {
  const double scale = width / static_cast<double>(window.end - window.start);
  double x = static_cast<double>(span.start - window.start) * scale;
  double w = static_cast<double>(span.end - span.start) * scale;
  if (w < minWidth) {
    x += (w - minWidth) / 2;
    w = minWidth;
  }
  x = std::min(std::max(x, 0.0), width - w);
  return {x, w};
}

std::vector<int64_t> Ticks(Span window, int maxTicks) {
  static const int64_t kStepMinutes[] = {1, 5, 10, 15, 30, 60, 120, 180, 240, 360, 720};
  int64_t step = 1440 * 60000;
  for (int64_t minutes : kStepMinutes) {
    if ((window.end - window.start) / (minutes * 60000) + 1 <= maxTicks) {
      step = minutes * 60000;
      break;
    }
  }
  std::vector<int64_t> ticks;
  for (int64_t t = -FloorDiv(-window.start, step) * step; t <= window.end; t += step)
    ticks.push_back(t);
  return ticks;
}

}  // namespace daypage
