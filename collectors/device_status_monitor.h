// DeviceStatusMonitor: screen, charger, headset, Wi-Fi and Bluetooth periods and device events,
// written as feature rows of use_app_feature_survey.
#ifndef LOGMGR_COLLECTORS_DEVICE_STATUS_MONITOR_H_
#define LOGMGR_COLLECTORS_DEVICE_STATUS_MONITOR_H_

#include <stdint.h>

namespace _CorvaneLogManager {

class AppUsageMonitor;
class StatusSnapshotStore;

class DeviceStatusMonitor {
 public:
  // Restart recovery and the initial snapshot; runs before Start.
  int Recover();
  // Registers every event source.
  int Start();
  int Stop();
  void SetAppUsageMonitor(AppUsageMonitor* monitor) { appUsage = monitor; }

  // Opens a period unless one is open already (the first start wins, with its extra).
  int StartFeature(const char* code, const char* extra);
  // Closes the open period at |endTime| (ms) and writes its row if its length is plausible.
  int EndFeature(const char* code, int64_t endTime);
  int RecordChargeState(int connected);
  int RecordUnlock();
  int RecordCapture();
  int SetScreenState(int on);

 private:
  int WriteEvent(const char* code);
  int RecoverAndSample();

  AppUsageMonitor* appUsage = nullptr;
  StatusSnapshotStore* snapshots = nullptr;
  bool recovered = false;
  bool earlyKeysWatched = false;
  bool started = false;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_DEVICE_STATUS_MONITOR_H_
