#include "include/daemon_lifecycle.h"

#include <Ecore.h>
#include <dbus/dbus-glib-lowlevel.h>
#include <dbus/dbus-glib.h>
#include <dbus/dbus.h>
#include <glib-object.h>
#include <signal.h>
#include <unistd.h>
#include <vconf.h>

#include "collectors/trusted_sender.h"
#include "include/log_manager.h"
#include "platform/main_loop_glib.h"
#include "reporting/report_scheduler.h"

namespace _CorvaneLogManager {

namespace {

const char kConsentKey[] = "db/setting/report_diagnostic_info";
const char kPowerOffRule[] = "type='signal',interface='org.tizen.system.deviced.PowerOff'";

// A failed start is tried again after this pause, doubled on every failure up to the cap:
// prompt for a person fixing the obstacle, cheap for the battery while it stays.
const double kFirstRetryDelay = 0.01;
const double kMaxRetryDelay = 1.0;

// Set by the power-off filter and the exit-signal handler so the shutdown runs once.
bool g_shutdownLatch = false;
bool g_consentWatched = false;
double g_retryDelay = kFirstRetryDelay;

[[noreturn]] void Shutdown();

void OnConsentChanged(keynode_t*, void* data) {
  auto* instance = static_cast<LogManager*>(data);
  int consent = -1;
  if (vconf_get_bool(kConsentKey, &consent) < 0) return;
  if (consent || instance == nullptr) return;
  if (!instance->IsInitialised()) return;
  ReportScheduler* scheduler = instance->GetScheduler();
  if (scheduler == nullptr) return;
  if (scheduler->IsRunning()) return;  // the job's end re-checks consent
  Shutdown();
}

Eina_Bool OnStartIdle(void* data);

Eina_Bool OnRetryTimer(void* data) {
  (void)ecore_idler_add(OnStartIdle, data);
  return ECORE_CALLBACK_CANCEL;
}

// Tried until the start succeeds; each retry resumes where the last one stopped.
Eina_Bool OnStartIdle(void* data) {
  auto* instance = static_cast<LogManager*>(data);
  bool started = false;
  if (!g_consentWatched)
    g_consentWatched = vconf_notify_key_changed(kConsentKey, OnConsentChanged, instance) == 0;
  if (g_consentWatched && instance != nullptr) started = instance->Init() == 0;
  if (started) return ECORE_CALLBACK_CANCEL;
  // Without a timer the idler stays, which retries at every idle turn instead.
  if (ecore_timer_add(g_retryDelay, OnRetryTimer, instance) == nullptr) return ECORE_CALLBACK_RENEW;
  g_retryDelay = g_retryDelay * 2 < kMaxRetryDelay ? g_retryDelay * 2 : kMaxRetryDelay;
  return ECORE_CALLBACK_CANCEL;
}

DBusHandlerResult OnPowerOffFilter(DBusConnection* connection, DBusMessage* message, void*) {
  // Every ChangeState ends the daemon, whatever state it announces, but only when the
  // platform sent it: a stop on anyone's word would exit 0 and never be restarted.
  if (dbus_message_is_signal(message, "org.tizen.system.deviced.PowerOff", "ChangeState") &&
      !g_shutdownLatch && IsTrustedSender(connection, message)) {
    g_shutdownLatch = true;
    Shutdown();
  }
  return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

Eina_Bool OnExitSignal(void*, int, void*) {
  if (!g_shutdownLatch) {
    g_shutdownLatch = true;
    Shutdown();
  }
  return 1;
}

void Shutdown() {
  (void)vconf_ignore_key_changed(kConsentKey, OnConsentChanged);
  LogManager* instance = LogManager::GetInstance();
  if (instance != nullptr) {
    instance->Stop();
    LogManager::DestroyInstance();
  }
  _exit(0);
}

void WatchPowerOff() {
  DBusError error;
  dbus_error_init(&error);
  DBusConnection* connection = dbus_bus_get(DBUS_BUS_SYSTEM, &error);
  if (dbus_error_is_set(&error)) {
    dbus_error_free(&error);
    return;
  }
  dbus_connection_setup_with_g_main(connection, nullptr);
  if (dbus_error_is_set(&error)) {
    dbus_error_free(&error);
    return;
  }
  dbus_bus_add_match(connection, kPowerOffRule, &error);
  if (dbus_error_is_set(&error)) {
    dbus_error_free(&error);
    return;
  }
  if (!dbus_connection_add_filter(connection, OnPowerOffFilter, nullptr, nullptr)) {
    dbus_bus_remove_match(connection, kPowerOffRule, nullptr);
  }
}

// The end of a report run, on the worker: a consent withdrawn meanwhile ends the process
// through SIGTERM, so the stop runs on the main loop.
void RecheckConsentAfterRun(void*) {
  int consent = -1;
  if (vconf_get_bool(kConsentKey, &consent) < 0 || consent) return;
  (void)kill(getpid(), SIGTERM);
}

// The daemon writes no diagnostics: EFL's own log (with its backtrace banners when a module
// cannot reach the bus) goes nowhere, and the exit status tells how a start ended.
void QuietLog(const Eina_Log_Domain*, Eina_Log_Level, const char*, const char*, int, const char*,
              void*, va_list) {}

}  // namespace

int RunDaemon() {
  int consent = -1;
  eina_log_print_cb_set(QuietLog, nullptr);
  if (ecore_init() == 0) return -1;
  (void)logmgr_main_loop_glib_integrate();
  G_GNUC_BEGIN_IGNORE_DEPRECATIONS
  g_type_init();  // a no-op on current GLib, needed on the device's
  G_GNUC_END_IGNORE_DEPRECATIONS

  GError* gerror = nullptr;
  DBusGConnection* connection = dbus_g_bus_get(DBUS_BUS_SYSTEM, &gerror);
  if (connection == nullptr) {
    if (gerror != nullptr) g_error_free(gerror);
    return -1;
  }
  // The proxy and the connection live until the process ends.
  DBusGProxy* proxy = dbus_g_proxy_new_for_name(connection, "org.freedesktop.DBus",
                                                "/org/freedesktop/DBus", "org.freedesktop.DBus");
  if (proxy == nullptr) return -1;
  guint reply = 0;
  // Flags 0: queue behind an existing owner. The reply code is deliberately not examined: a
  // daemon only queued for the name carries on as if it owned it.
  (void)dbus_g_proxy_call(proxy, "RequestName", &gerror, G_TYPE_STRING, "com.corvane.logmgr",
                          G_TYPE_UINT, 0, G_TYPE_INVALID, G_TYPE_UINT, &reply, G_TYPE_INVALID);
  if (gerror != nullptr) {
    g_error_free(gerror);
    return -1;
  }

  if (vconf_get_bool(kConsentKey, &consent) < 0) return 0;
  if (!consent) return 0;

  LogManager* instance = LogManager::GetInstance();
  if (instance == nullptr) return -1;
  if (instance->GetScheduler() != nullptr)
    instance->GetScheduler()->SetRunEndHook(RecheckConsentAfterRun, nullptr);
  (void)ecore_idler_add(OnStartIdle, instance);
  WatchPowerOff();
  (void)ecore_event_handler_add(ECORE_EVENT_SIGNAL_EXIT, OnExitSignal, nullptr);

  ecore_main_loop_begin();
  ecore_shutdown();
  return 0;
}

}  // namespace _CorvaneLogManager
