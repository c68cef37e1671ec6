// PackageMonitor: package installs, updates and removals as manage_app_survey rows.
#ifndef LOGMGR_COLLECTORS_PACKAGE_MONITOR_H_
#define LOGMGR_COLLECTORS_PACKAGE_MONITOR_H_

#include <stdint.h>

namespace _CorvaneLogManager {

class PackageMonitor {
 public:
  PackageMonitor();
  ~PackageMonitor();

  // 0, or the negative pkgmgr result of listening (the client is then given up).
  int Start();
  int Stop();

  // The pkgmgr status callback; |userData| is the monitor.
  static int StatusHandler(int requestId, const char* packageType, const char* packageId,
                           const char* key, const char* value, const void* message, void* userData);

 private:
  int Record(const char* packageId);

  void* client;
  // Kind announced by the last "start" and not yet recorded: 0 install, 1 uninstall,
  // 2 update, -1 none.
  int32_t pendingType;
  bool listening = false;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_PACKAGE_MONITOR_H_
