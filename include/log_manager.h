// LogManager: the process-wide owner of every long-lived component and of their order of
// creation, start and stop.
#ifndef LOGMGR_INCLUDE_LOG_MANAGER_H_
#define LOGMGR_INCLUDE_LOG_MANAGER_H_

#include <memory>
#include <string>

namespace _CorvaneLogManager {

class PrefStore;
class ReportScheduler;
class AppUsageMonitor;
class PackageMonitor;
class CrashMonitor;
class DeviceStatusMonitor;
class ProviderRegistry;
class DbManager;
class UploadDbManager;

// Two process-wide switches, both off until initialisation turns them on. Index 1 gates the
// report job; nothing reads index 0.
bool GetRuntimeSwitch(unsigned index);
void SetRuntimeSwitch(unsigned index, bool on);

class LogManager {
 public:
  static LogManager* GetInstance();
  static void DestroyInstance();

  int Init();
  int Start();
  void Stop();
  void SetName();

  PrefStore* GetPrefStore() const { return prefStore.get(); }
  ReportScheduler* GetScheduler() const { return scheduler; }
  bool IsInitialised() const { return initialised; }
  const std::string& GetName() const { return name; }
  std::string GetDeviceId() const;

 private:
  LogManager();
  ~LogManager();
  int Construct();
  void ReleaseMonitors();

  std::unique_ptr<PrefStore> prefStore;
  ReportScheduler* scheduler = nullptr;
  std::unique_ptr<AppUsageMonitor> appUsageMonitor;
  std::unique_ptr<PackageMonitor> packageMonitor;
  std::unique_ptr<CrashMonitor> crashMonitor;
  std::unique_ptr<DeviceStatusMonitor> deviceStatusMonitor;
  ProviderRegistry* registry = nullptr;
  DbManager* dbManager = nullptr;
  UploadDbManager* uploadDbManager = nullptr;
  std::string name;
  bool initialised = false;
  // Leading start steps (providers, survey database, upload database) that have succeeded.
  int storageStepsDone = 0;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_INCLUDE_LOG_MANAGER_H_
