// CrashMonitor: application crashes as report_app_error_survey rows.
#ifndef LOGMGR_COLLECTORS_CRASH_MONITOR_H_
#define LOGMGR_COLLECTORS_CRASH_MONITOR_H_

namespace _CorvaneLogManager {

class CrashMonitor {
 public:
  int Start();
  int Stop();
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_CRASH_MONITOR_H_
