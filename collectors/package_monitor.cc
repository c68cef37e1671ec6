#include "collectors/package_monitor.h"

#include <package-manager.h>
#include <stdio.h>
#include <string.h>

#include "collectors/row_values.h"
#include "include/base_log_provider.h"
#include "include/provider_registry.h"

namespace _CorvaneLogManager {

namespace {

const int kStatusTypes =
    PKGMGR_CLIENT_STATUS_INSTALL | PKGMGR_CLIENT_STATUS_UNINSTALL | PKGMGR_CLIENT_STATUS_UPGRADE;

// The type column of manage_app_survey, and the kind of a request not announced.
const int32_t kKindInstall = 0;
const int32_t kKindUninstall = 1;
const int32_t kKindUpdate = 2;
const int32_t kKindNone = -1;

}  // namespace

PackageMonitor::PackageMonitor(ProviderRegistry* registry)
    : providers(registry), client(nullptr), pendingType(kKindNone) {
  client = pkgmgr_client_new(PC_LISTENING);
}

PackageMonitor::~PackageMonitor() { (void)Stop(); }

int PackageMonitor::Start() {
  if (listening) return 0;  // a retried start listens once
  // A client given up by a failed listen is made anew, so that a retry can listen again.
  if (client == nullptr) client = pkgmgr_client_new(PC_LISTENING);
  (void)pkgmgr_client_set_status_type(client, kStatusTypes);
  int result = pkgmgr_client_listen_status(client, StatusHandler, this);
  if (result < 0) {
    (void)pkgmgr_client_free(client);
    client = nullptr;
    return result;
  }
  listening = true;
  return 0;
}

int PackageMonitor::Stop() {
  if (client != nullptr) (void)pkgmgr_client_free(client);
  client = nullptr;
  listening = false;
  return 0;
}

int PackageMonitor::StatusHandler(int, const char*, const char* packageId, const char* key,
                                  const char* value, const void*, void* userData) {
  PackageMonitor* monitor = static_cast<PackageMonitor*>(userData);
  if (monitor == nullptr) return -1;
  if (key == nullptr || value == nullptr) return 0;
  if (strcmp(key, "start") == 0) {
    if (strcmp(value, "install") == 0) {
      monitor->pendingType = kKindInstall;
    } else if (strcmp(value, "uninstall") == 0) {
      monitor->pendingType = kKindUninstall;
    } else if (strcmp(value, "update") == 0) {
      monitor->pendingType = kKindUpdate;
    }
  }
  // A failed "end" deliberately keeps the kind pending: a later successful end records it.
  if (strcmp(key, "end") == 0 && strcmp(value, "ok") == 0 && monitor->pendingType != kKindNone) {
    (void)monitor->Record(packageId != nullptr ? packageId : "");
    monitor->pendingType = kKindNone;
  }
  return 0;
}

int PackageMonitor::Record(const char* packageId) {
  BaseLogProvider* provider =
      providers != nullptr ? providers->Lookup("manage_app_survey") : nullptr;
  if (provider == nullptr) return -1;
  // The package id comes from whoever sent the status: stored verbatim, or refused when it
  // does not fit whole.
  char buffer[132];
  const char* values = RowValues(buffer, sizeof(buffer)).Text(packageId).Number(pendingType).Get();
  if (values == nullptr) return -1;
  return provider->InsertRow("installed_app_id,type", values) != 0 ? -1 : 0;
}

}  // namespace _CorvaneLogManager
