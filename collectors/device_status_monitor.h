// DeviceStatusMonitor: screen, charger, headset, Wi-Fi and Bluetooth periods and device events,
// written as feature rows of use_app_feature_survey.
#ifndef LOGMGR_COLLECTORS_DEVICE_STATUS_MONITOR_H_
#define LOGMGR_COLLECTORS_DEVICE_STATUS_MONITOR_H_

#include <stdint.h>

#include <string>

#include "base/clock.h"

namespace _CorvaneLogManager {

class AppUsageMonitor;
class DbConnection;
class PrefStore;
class ProviderRegistry;
class StatusSnapshotStore;

class DeviceStatusMonitor {
 public:
  // Rows are written through |providers|' use_app_feature_survey provider; |prefs| holds the
  // last shutdown time, and |clock| times the periods.
  DeviceStatusMonitor(ProviderRegistry* providers, PrefStore* prefs, ClockFn clock);

  // Restart recovery and the initial snapshot; runs before Start. Open periods are kept in
  // |snapshots|, |survey| tells when a crashed run was last active, and |appId| is written
  // on every row.
  int Recover(StatusSnapshotStore* snapshots, DbConnection* survey, const std::string& appId);
  // Registers every event source.
  int Start();
  int Stop();
  void SetAppUsageMonitor(AppUsageMonitor* monitor) { appUsage = monitor; }

  // Opens a period unless one is open already (the first start wins, with its extra).
  int StartFeature(const char* code, const char* extra);
  // Closes the open period at |endTime| (ms) and writes its row if its length is plausible.
  int EndFeature(const char* code, int64_t endTime);
  int RecordChargeState(bool connected);
  int RecordUnlock();
  int RecordCapture();
  int SetScreenState(bool on);
  int64_t Now() const { return clock(); }

 private:
  int InsertRow(const char* code, const char* extra, const long long* value);
  int WriteEvent(const char* code);
  int RecoverAndSample(DbConnection* survey);

  ProviderRegistry* const providers;
  PrefStore* const prefs;
  const ClockFn clock;
  std::string appId;
  AppUsageMonitor* appUsage = nullptr;
  StatusSnapshotStore* snapshots = nullptr;
  bool recovered = false;
  bool earlyKeysWatched = false;
  bool started = false;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_DEVICE_STATUS_MONITOR_H_
