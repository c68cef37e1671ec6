#include "collectors/app_usage_monitor.h"

#include <Ecore.h>
#include <Ecore_X.h>
#include <aul.h>
#include <errno.h>
#include <pkgmgr-info.h>
#include <poll.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "collectors/row_values.h"
#include "include/base_log_provider.h"
#include "include/provider_registry.h"

namespace _CorvaneLogManager {

namespace {

// Lock screen and home screens: their foreground time is not application use.
const char* const kExcludedPackages[] = {"com.corvane.lockscreen", "com.corvane.w-home",
                                         "Homescreen", "com.corvane.homescreen"};

const int64_t kMinDeathPeriodMs = 150;
// Processes remembered before the ones that ended unannounced are let go.
const size_t kKnownSweepAt = 64;
const int64_t kMaxPeriodMs = 604799999;  // just under seven days

// Foreground markers that are no process: no window seen yet, and the screen off (which no
// activation ends until the screen comes on again).
const int32_t kNoForegroundPid = -1;
const int32_t kScreenOffPid = -2;
// Period start while the foreground is not tracked: far enough back that no row is written.
const int64_t kUntrackedPeriodStart = -1;

// One monitor per process, so the handler lives beside it rather than in it.
Ecore_Event_Handler* g_propertyEventHandler = nullptr;

bool IsExcluded(const std::string& packageId) {
  if (packageId.empty()) return true;
  for (const char* excluded : kExcludedPackages)
    if (packageId == excluded) return true;
  return false;
}

std::string PackageOfApp(const char* appId) {
  std::string packageId;
  pkgmgrinfo_appinfo_h info = nullptr;
  if (pkgmgrinfo_appinfo_get_appinfo(appId, &info) != PMINFO_R_OK) return packageId;
  char* pkgid = nullptr;
  if (pkgmgrinfo_appinfo_get_pkgid(info, &pkgid) == PMINFO_R_OK && pkgid != nullptr)
    packageId = pkgid;
  (void)pkgmgrinfo_appinfo_destroy_appinfo(info);
  return packageId;
}

// A handle on the process itself rather than on its number; -1 where the kernel has none, and
// then the process is looked up at every activation.
int OpenPidfd(int32_t pid) {
#ifdef SYS_pidfd_open
  return static_cast<int>(syscall(SYS_pidfd_open, static_cast<pid_t>(pid), 0));
#else
  (void)pid;
  return -1;
#endif
}

// A pidfd turns readable when its process ends; a poll that fails counts as ended.
bool Ended(int pidfd) {
  struct pollfd p = {pidfd, POLLIN, 0};
  int rc;
  do {
    rc = poll(&p, 1, 0);
  } while (rc < 0 && errno == EINTR);
  return rc != 0;
}

// Starts watching the root window's properties once; an X connection is needed for it.
int InstallPropertyHandler(void* monitor) {
  if (g_propertyEventHandler != nullptr) return 0;
  if (ecore_x_init(nullptr) == 0) return -1;  // no display: windows cannot be followed
  Ecore_X_Window root = ecore_x_window_root_first_get();
  ecore_x_event_mask_set(root, ECORE_X_EVENT_MASK_WINDOW_PROPERTY);
  g_propertyEventHandler = ecore_event_handler_add(ECORE_X_EVENT_WINDOW_PROPERTY,
                                                   &AppUsageMonitor::PropertyHandler, monitor);
  return g_propertyEventHandler != nullptr ? 0 : -1;
}

}  // namespace

AppUsageMonitor::AppUsageMonitor(ProviderRegistry* registry, ClockFn clockFn)
    : providers(registry), clock(clockFn), currentPid(kNoForegroundPid) {}

AppUsageMonitor::~AppUsageMonitor() {
  if (g_propertyEventHandler != nullptr) {
    (void)ecore_event_handler_del(g_propertyEventHandler);
    g_propertyEventHandler = nullptr;
  }
  for (auto& entry : known) close(entry.second.pidfd);
}

int AppUsageMonitor::Start() {
  if (listening) return 0;  // a retried start registers once
  if (aul_listen_app_launch_signal(LaunchHandler, this) != AUL_R_OK) return -1;
  if (aul_listen_app_dead_signal(DeadHandler, this) != AUL_R_OK) return -1;
  listening = true;
  return 0;
}

// An application does not change under a running process, so a process already looked up is
// answered from memory for as long as it runs (a process alive is the one its pidfd holds).
bool AppUsageMonitor::PackageOfPid(int32_t pid, std::string* packageId) {
  auto it = known.find(pid);
  if (it != known.end()) {
    if (!Ended(it->second.pidfd)) {
      *packageId = it->second.packageId;
      return true;
    }
    // Ended without its death announced: the pid may be another application's now, and what
    // was tracked under it is the old process's.
    Forget(pid);
    tracked.erase(pid);
  }
  int pidfd = OpenPidfd(pid);
  char appId[512];
  memset(appId, 0, sizeof(appId));
  bool found = aul_app_get_appid_bypid(pid, appId, sizeof(appId)) == AUL_R_OK;
  if (found) *packageId = PackageOfApp(appId);
  // Kept only for a process still running after the lookup, so the one the lookup saw, and
  // only with a package: an empty one may be an app database that could not be read.
  if (pidfd >= 0 && (!found || packageId->empty() || Ended(pidfd))) {
    close(pidfd);
    pidfd = -1;
  }
  if (pidfd >= 0) {
    if (known.size() >= kKnownSweepAt) {
      for (auto entry = known.begin(); entry != known.end();) {
        if (Ended(entry->second.pidfd)) {
          close(entry->second.pidfd);
          entry = known.erase(entry);
        } else {
          ++entry;
        }
      }
    }
    known[pid] = KnownProcess{pidfd, *packageId};
  }
  return found;
}

void AppUsageMonitor::Forget(int32_t pid) {
  auto it = known.find(pid);
  if (it == known.end()) return;
  close(it->second.pidfd);
  known.erase(it);
}

void AppUsageMonitor::Track(int32_t pid, const std::string& packageId) {
  (void)tracked.emplace(pid, packageId);  // an entry already there is kept
}

int AppUsageMonitor::LaunchHandler(int pid, void* data) {
  AppUsageMonitor* monitor = static_cast<AppUsageMonitor*>(data);
  if (monitor == nullptr) return -1;
  std::string packageId;
  if (!monitor->PackageOfPid(pid, &packageId)) return -1;
  if (InstallPropertyHandler(data) != 0) return -1;
  if (IsExcluded(packageId)) return 0;
  monitor->Track(pid, packageId);
  return 0;
}

int AppUsageMonitor::DeadHandler(int pid, void* data) {
  AppUsageMonitor* monitor = static_cast<AppUsageMonitor*>(data);
  if (monitor == nullptr) return -1;
  // Any tracked process, foreground or not, closes with the time since the period began.
  int64_t now = monitor->clock();
  if (monitor->periodStart >= 1 && now - monitor->periodStart >= kMinDeathPeriodMs &&
      monitor->tracked.count(pid) != 0)
    (void)monitor->Record(pid, now);
  monitor->tracked.erase(pid);
  monitor->Forget(pid);
  return 0;
}

unsigned char AppUsageMonitor::PropertyHandler(void* data, int, void* event) {
  AppUsageMonitor* monitor = static_cast<AppUsageMonitor*>(data);
  Ecore_X_Event_Window_Property* property = static_cast<Ecore_X_Event_Window_Property*>(event);
  if (monitor == nullptr || property == nullptr ||
      property->atom != ecore_x_atom_get("_NET_ACTIVE_WINDOW"))
    return ECORE_CALLBACK_PASS_ON;
  Ecore_X_Window active = 0;
  if (ecore_x_window_prop_window_get(property->win, property->atom, &active, 1) == -1)
    return ECORE_CALLBACK_PASS_ON;
  int pid = 0;
  if (!ecore_x_netwm_pid_get(active, &pid)) return ECORE_CALLBACK_PASS_ON;
  // Only a named window is taken for an activation.
  char* name = nullptr;
  (void)ecore_x_netwm_name_get(active, &name);
  if (name == nullptr) return ECORE_CALLBACK_PASS_ON;
  free(name);
  monitor->OnActiveWindow(pid);
  return ECORE_CALLBACK_PASS_ON;
}

void AppUsageMonitor::OnActiveWindow(int32_t pid) {
  std::string packageId;
  // A window of no application (a system popup) leaves the running period alone on purpose.
  if (!PackageOfPid(pid, &packageId)) return;
  if (!IsExcluded(packageId)) Track(pid, packageId);
  if (currentPid != pid && currentPid != kScreenOffPid) {
    // One reading ends the old period and starts the new one, so no time falls between them.
    int64_t now = clock();
    if (tracked.count(currentPid) != 0) (void)Record(currentPid, now);
    periodStart = tracked.count(pid) != 0 ? now : kUntrackedPeriodStart;
  }
  currentPid = pid;
}

void AppUsageMonitor::OnScreenState(bool on) {
  if (!on) {
    if (tracked.count(currentPid) != 0) (void)Record(currentPid, clock());
    currentPid = kScreenOffPid;
    return;
  }
  periodStart = clock();
  if (ecore_x_init(nullptr) == 0) return;
  int pid = 0;
  if (!ecore_x_netwm_pid_get(ecore_x_window_focus_get(), &pid)) return;
  currentPid = pid;
  (void)LaunchHandler(pid, this);
}

int AppUsageMonitor::Record(int32_t pid, int64_t now) {
  BaseLogProvider* provider = providers != nullptr ? providers->Lookup("use_app_survey") : nullptr;
  if (provider == nullptr) return -1;
  // An untracked foreground's period lands far above the bound and is dropped here.
  int64_t duration = now - periodStart;
  if (duration < 1 || duration > kMaxPeriodMs) return -1;
  char buffer[512];
  const char* values =
      RowValues(buffer, sizeof(buffer)).Text(tracked[pid].c_str()).Number(duration).Get();
  if (values == nullptr) return -1;
  return provider->InsertRow("app_id,duration", values);
}

}  // namespace _CorvaneLogManager
