// AppUsageMonitor: foreground time of each application, one use_app_survey row per period.
#ifndef LOGMGR_COLLECTORS_APP_USAGE_MONITOR_H_
#define LOGMGR_COLLECTORS_APP_USAGE_MONITOR_H_

namespace _CorvaneLogManager {

class AppUsageMonitor {
 public:
  int Start();
  void OnScreenState(int on);
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_APP_USAGE_MONITOR_H_
