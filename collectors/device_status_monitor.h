// DeviceStatusMonitor: screen, charger, headset, Wi-Fi and Bluetooth periods and device events.
#ifndef LOGMGR_COLLECTORS_DEVICE_STATUS_MONITOR_H_
#define LOGMGR_COLLECTORS_DEVICE_STATUS_MONITOR_H_

namespace _CorvaneLogManager {

class AppUsageMonitor;

class DeviceStatusMonitor {
 public:
  // Restart recovery and the initial snapshot; runs before Start.
  int Recover();
  int Start();
  int Stop();
  void SetAppUsageMonitor(AppUsageMonitor* monitor) { appUsage = monitor; }

 private:
  AppUsageMonitor* appUsage = nullptr;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_DEVICE_STATUS_MONITOR_H_
