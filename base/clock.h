// The daemon's one wall clock and its one local-midnight rule, shared by every layer.
#ifndef LOGMGR_BASE_CLOCK_H_
#define LOGMGR_BASE_CLOCK_H_

#include <stdint.h>
#include <sys/time.h>
#include <time.h>

namespace _CorvaneLogManager {

// Milliseconds since the epoch on the wall clock: a time change moves it, as rows expect.
inline int64_t WallClockMs() {
  struct timeval tv;
  gettimeofday(&tv, nullptr);
  return static_cast<int64_t>(tv.tv_sec) * 1000 + tv.tv_usec / 1000;
}

// The clock a part is handed; tests hand one they control.
using ClockFn = int64_t (*)();

// Midnight of |now|'s local day, moved back |days| days through mktime (so month ends, leap
// days and summer time are normalised); 0 when the local time cannot be had.
inline time_t LocalMidnightDaysBefore(time_t now, int days) {
  struct tm tm;
  if (localtime_r(&now, &tm) == nullptr) return 0;
  tm.tm_hour = 0;
  tm.tm_min = 0;
  tm.tm_sec = 0;
  tm.tm_mday -= days;
  tm.tm_isdst = -1;
  return mktime(&tm);
}

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_BASE_CLOCK_H_
