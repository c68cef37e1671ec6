// Local midnight N days before a moment: the day boundary of the whole report cycle.
#ifndef LOGMGR_REPORTING_LOCAL_MIDNIGHT_H_
#define LOGMGR_REPORTING_LOCAL_MIDNIGHT_H_

#include <time.h>

namespace _CorvaneLogManager {

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

#endif  // LOGMGR_REPORTING_LOCAL_MIDNIGHT_H_
