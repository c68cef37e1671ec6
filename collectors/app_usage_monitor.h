// AppUsageMonitor: foreground time of each application, one use_app_survey row per period.
#ifndef LOGMGR_COLLECTORS_APP_USAGE_MONITOR_H_
#define LOGMGR_COLLECTORS_APP_USAGE_MONITOR_H_

#include <stdint.h>

#include <map>
#include <string>

#include "base/clock.h"

namespace _CorvaneLogManager {

class ProviderRegistry;

class AppUsageMonitor {
 public:
  // Periods are written through |providers|' use_app_survey provider and timed by |clock|.
  AppUsageMonitor(ProviderRegistry* providers, ClockFn clock);
  // Removes the window property handler; the aul listeners stay until the process ends.
  ~AppUsageMonitor();

  int Start();
  void OnScreenState(bool on);

  // Platform handlers.
  static int LaunchHandler(int pid, void* monitor);
  static int DeadHandler(int pid, void* monitor);
  static unsigned char PropertyHandler(void* monitor, int eventType, void* event);

  // The active window changed to one of |pid| (steps after the X reads).
  void OnActiveWindow(int32_t pid);

 private:
  // The package of |pid|'s application into |packageId|; false when it is no application.
  bool PackageOfPid(int32_t pid, std::string* packageId);
  void Forget(int32_t pid);
  void Track(int32_t pid, const std::string& packageId);
  int Record(int32_t pid, int64_t now);

  // A process whose application was looked up, with a pidfd that says when that very process
  // has ended, so a reused pid is never taken for it.
  struct KnownProcess {
    int pidfd;
    std::string packageId;
  };

  ProviderRegistry* const providers;
  const ClockFn clock;
  std::map<int32_t, KnownProcess> known;
  std::map<int32_t, std::string> tracked;
  // The foreground process, or one of the markers in the .cc file.
  int32_t currentPid;
  // Start of the running period in ms; 0 before the first, negative while the foreground is
  // not tracked.
  int64_t periodStart = 0;
  bool listening = false;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_APP_USAGE_MONITOR_H_
