// PackageMonitor: package installs, updates and removals as manage_app_survey rows.
#ifndef LOGMGR_COLLECTORS_PACKAGE_MONITOR_H_
#define LOGMGR_COLLECTORS_PACKAGE_MONITOR_H_

namespace _CorvaneLogManager {

class PackageMonitor {
 public:
  int Start();
  int Stop();
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_PACKAGE_MONITOR_H_
