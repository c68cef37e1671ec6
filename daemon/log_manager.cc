#include "include/log_manager.h"

#include <new>

#include "base/clock.h"
#include "collectors/app_usage_monitor.h"
#include "collectors/crash_monitor.h"
#include "collectors/device_status_monitor.h"
#include "collectors/package_monitor.h"
#include "include/provider_registry.h"
#include "reporting/report_context.h"
#include "reporting/report_scheduler.h"
#include "storage/db_manager.h"
#include "storage/pref_store.h"
#include "storage/status_snapshot_store.h"

namespace _CorvaneLogManager {

namespace {
LogManager* g_instance = nullptr;
}  // namespace

LogManager* LogManager::GetInstance() {
  if (g_instance != nullptr) return g_instance;
  LogManager* manager = new (std::nothrow) LogManager();
  if (manager == nullptr) return nullptr;
  // Stored before construction finishes: a failed construction still leaves the half-built
  // instance for the next call. Deliberate; the first caller treats null as fatal.
  g_instance = manager;
  if (manager->Construct() != 0) return nullptr;
  return manager;
}

void LogManager::DestroyInstance() {
  delete g_instance;
  g_instance = nullptr;
}

LogManager::LogManager() = default;

// Stop releases the components in their order; only a destroy without a stop frees any here.
LogManager::~LogManager() = default;

int LogManager::Construct() {
  prefStore.reset(new (std::nothrow) PrefStore());
  if (prefStore == nullptr) return -1;
  if (prefStore->Create() == -1) {
    prefStore.reset();
    return -1;
  }

  // The monitors look their providers up when they write, so they take the registry now,
  // though the providers are only made by Init.
  ProviderRegistry* providers = ProviderRegistry::GetInstance();
  if (providers == nullptr) return -1;
  appUsageMonitor.reset(new (std::nothrow) AppUsageMonitor(providers, WallClockMs));
  packageMonitor.reset(new (std::nothrow) PackageMonitor(providers));
  crashMonitor.reset(new (std::nothrow) CrashMonitor(providers));
  deviceStatusMonitor.reset(new (std::nothrow)
                                DeviceStatusMonitor(providers, prefStore.get(), WallClockMs));
  scheduler = new (std::nothrow) ReportScheduler();
  if (appUsageMonitor == nullptr || packageMonitor == nullptr || deviceStatusMonitor == nullptr ||
      crashMonitor == nullptr || scheduler == nullptr) {
    ReleaseMonitors();  // the preference store stays
    return -1;
  }
  ReportContext report;
  report.prefs = prefStore.get();
  report.providers = providers;
  report.survey = DbManager::GetInstance();
  report.queue = UploadDbManager::GetInstance();
  report.appId = &name;
  report.reportEnabled = [] { return GetRuntimeSwitch(1); };
  return scheduler->Create(report) != 0 ? -1 : 0;
}

void LogManager::ReleaseMonitors() {
  appUsageMonitor.reset();
  packageMonitor.reset();
  crashMonitor.reset();
  deviceStatusMonitor.reset();
  delete scheduler;
  scheduler = nullptr;
}

int LogManager::Init() {
  // Nothing is undone on failure: the start idler retries, and a retry resumes. Storage steps
  // that succeeded are skipped and the monitors' starts skip what they registered, so no
  // provider, bus object, filter or watch is made twice however often the start fails.
  if (initialised) return 0;
  registry = ProviderRegistry::GetInstance();
  if (registry == nullptr) return -1;
  dbManager = DbManager::GetInstance();
  if (dbManager == nullptr) return -1;
  uploadDbManager = UploadDbManager::GetInstance();
  if (uploadDbManager == nullptr) return -1;
  int (*const storageSteps[])(LogManager*) = {
      [](LogManager* m) { return m->registry->CreateProviders(); },
      [](LogManager* m) { return m->dbManager->Init(); },
      [](LogManager* m) { return m->uploadDbManager->Init(); },
  };
  for (; storageStepsDone < 3; ++storageStepsDone) {
    if (storageSteps[storageStepsDone](this) != 0) return -1;
  }
  SetRuntimeSwitch(0, true);
  SetRuntimeSwitch(1, true);
  SetName();
  if (Start() != 0) return -1;
  (void)scheduler->Init();
  initialised = true;
  return 0;
}

int LogManager::Start() {
  if (appUsageMonitor != nullptr && appUsageMonitor->Start() != 0) return -1;
  if (packageMonitor != nullptr && packageMonitor->Start() != 0) return -1;
  if (crashMonitor != nullptr && crashMonitor->Start() != 0) return -1;
  if (deviceStatusMonitor == nullptr) return 0;
  DbConnection* survey = dbManager != nullptr ? dbManager->GetConnection() : nullptr;
  if (deviceStatusMonitor->Recover(StatusSnapshotStore::GetInstance(), survey, name) != 0 ||
      deviceStatusMonitor->Start() != 0)
    return -1;
  deviceStatusMonitor->SetAppUsageMonitor(appUsageMonitor.get());
  return 0;
}

void LogManager::Stop() {
  initialised = false;
  if (scheduler != nullptr) {
    scheduler->Stop();
    delete scheduler;
    scheduler = nullptr;
  }

  // Written before any database closes, so a restart can close the periods left open.
  if (prefStore != nullptr)
    (void)prefStore->SetLastShutdownTime(static_cast<int32_t>(WallClockMs() / 1000));

  if (dbManager != nullptr) DbManager::CloseInstance();
  if (uploadDbManager != nullptr) UploadDbManager::CloseInstance();
  if (prefStore != nullptr) {
    (void)prefStore->Close();
    prefStore.reset();
  }
  if (registry != nullptr) ProviderRegistry::Release();

  if (packageMonitor != nullptr) (void)packageMonitor->Stop();
  if (crashMonitor != nullptr) (void)crashMonitor->Stop();
  if (deviceStatusMonitor != nullptr) (void)deviceStatusMonitor->Stop();
  appUsageMonitor.reset();
  packageMonitor.reset();
  crashMonitor.reset();
  deviceStatusMonitor.reset();

  registry = nullptr;
  dbManager = nullptr;
  uploadDbManager = nullptr;
  storageStepsDone = 0;
}

void LogManager::SetName() { name = "com.corvane.logmanager"; }

std::string LogManager::GetDeviceId() const { return CachedDeviceId(); }

}  // namespace _CorvaneLogManager
