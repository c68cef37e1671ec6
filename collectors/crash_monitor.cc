#include "collectors/crash_monitor.h"

#include <dbus/dbus-glib-lowlevel.h>
#include <glib.h>
#include <pkgmgr-info.h>
#include <stdio.h>
#include <string.h>

#include "collectors/row_values.h"
#include "collectors/trusted_sender.h"
#include "include/base_log_provider.h"
#include "include/provider_registry.h"

namespace _CorvaneLogManager {

namespace {

const char kCrashInterface[] = "org.tizen.system.crash.Crash";
const char kCrashRule[] = "type='signal',interface='org.tizen.system.crash.Crash'";
// The only kind of application error written here.
const int kErrorTypeCrash = 1;

struct ErrorRows {
  BaseLogProvider* provider;
  int errorType;
};

int RecordApp(const pkgmgrinfo_appinfo_h handle, void* userData) {
  const ErrorRows* rows = static_cast<const ErrorRows*>(userData);
  char* appId = nullptr;
  (void)pkgmgrinfo_appinfo_get_appid(handle, &appId);
  if (rows->provider != nullptr && appId != nullptr) {
    char buffer[512];
    const char* values =
        RowValues(buffer, sizeof(buffer)).Text(appId).Number(rows->errorType).Get();
    // An id too long to store whole is not stored at all.
    if (values != nullptr) (void)rows->provider->InsertRow("app_id,type", values);
  }
  return 0;  // every application sharing the executable gets its row
}

void RecordAppsOfExecutable(BaseLogProvider* provider, const char* exePath, int errorType) {
  pkgmgrinfo_appinfo_filter_h filter = nullptr;
  if (pkgmgrinfo_appinfo_filter_create(&filter) != PMINFO_R_OK) return;
  ErrorRows rows = {provider, errorType};
  if (pkgmgrinfo_appinfo_filter_add_string(filter, PMINFO_APPINFO_PROP_APP_EXEC, exePath) ==
      PMINFO_R_OK)
    (void)pkgmgrinfo_appinfo_filter_foreach_appinfo(filter, RecordApp, &rows);
  (void)pkgmgrinfo_appinfo_filter_destroy(filter);
}

}  // namespace

int CrashMonitor::Start() {
  // Already watching: a retried start must not add the filter again (each crash would then
  // be written once per filter).
  if (bus != nullptr) return 0;
  DBusError err;
  dbus_error_init(&err);
  DBusConnection* connection = dbus_bus_get(DBUS_BUS_SYSTEM, &err);
  if (dbus_error_is_set(&err)) {
    g_print("Cannot get System BUS connection: %s\n", err.message);
    dbus_error_free(&err);
    return -1;
  }
  dbus_connection_setup_with_g_main(connection, nullptr);
  dbus_bus_add_match(connection, kCrashRule, &err);
  if (dbus_error_is_set(&err)) {
    dbus_error_free(&err);
    dbus_connection_unref(connection);
    return -1;
  }
  if (!dbus_connection_add_filter(connection, CrashFilter, this, nullptr)) {
    dbus_bus_remove_match(connection, kCrashRule, nullptr);
    dbus_connection_unref(connection);
    return -1;
  }
  bus = connection;
  return 0;
}

int CrashMonitor::Stop() {
  if (bus == nullptr) return 0;
  dbus_bus_remove_match(bus, kCrashRule, nullptr);
  dbus_connection_remove_filter(bus, CrashFilter, this);
  dbus_connection_unref(bus);
  bus = nullptr;
  return 0;
}

DBusHandlerResult CrashMonitor::CrashFilter(DBusConnection* connection, DBusMessage* message,
                                            void* monitor) {
  if (!dbus_message_is_signal(message, kCrashInterface, "ProcessCrashed"))
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
  DBusError err;
  dbus_error_init(&err);
  const char* processName = nullptr;
  const char* exePath = nullptr;
  if (!dbus_message_get_args(message, &err, DBUS_TYPE_STRING, &processName, DBUS_TYPE_STRING,
                             &exePath, DBUS_TYPE_INVALID)) {
    dbus_error_free(&err);
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
  }
  // Only the platform's crash service may report crashes.
  ProviderRegistry* providers =
      monitor != nullptr ? static_cast<CrashMonitor*>(monitor)->providers : nullptr;
  if (providers != nullptr && IsTrustedSender(connection, message))
    RecordAppsOfExecutable(providers->Lookup("report_app_error_survey"), exePath, kErrorTypeCrash);
  // Other filters on the shared connection still see the signal.
  return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

}  // namespace _CorvaneLogManager
