// PackageMonitor: package installs, updates and removals as manage_app_survey rows.
#ifndef LOGMGR_COLLECTORS_PACKAGE_MONITOR_H_
#define LOGMGR_COLLECTORS_PACKAGE_MONITOR_H_

#include <stdint.h>

namespace _CorvaneLogManager {

class ProviderRegistry;

class PackageMonitor {
 public:
  // Rows are written through |providers|' manage_app_survey provider.
  explicit PackageMonitor(ProviderRegistry* providers);
  ~PackageMonitor();

  // 0, or the negative pkgmgr result of listening (the client is then given up).
  int Start();
  int Stop();

  // The pkgmgr status callback; |userData| is the monitor.
  static int StatusHandler(int requestId, const char* packageType, const char* packageId,
                           const char* key, const char* value, const void* message, void* userData);

 private:
  int Record(const char* packageId);

  ProviderRegistry* const providers;
  void* client;
  // Kind announced by the last "start" and not yet recorded (the row's type column), or none.
  int32_t pendingType;
  bool listening = false;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_PACKAGE_MONITOR_H_
