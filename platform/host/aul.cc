// Host aul. Launch and death notices arrive as signals on the process's shared system-bus
// connection, attached to the GLib default main context, and count only from a trusted sender;
// a process's application is the one whose executable is the process's /proc/<pid>/exe, seen
// from inside the sysroot.
#include <aul.h>
#include <dbus/dbus-glib-lowlevel.h>
#include <dbus/dbus.h>
#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <string>

#include "platform/host/app_db.h"
#include "platform/host/sender_trust.h"

namespace {

const char kPath[] = "/aul/dbus_handler";
const char kInterface[] = "org.tizen.aul.signal";
const char kRule[] = "path='/aul/dbus_handler',type='signal',interface='org.tizen.aul.signal'";

struct Listener {
  int (*func)(int, void*) = nullptr;
  void* data = nullptr;
};

struct SignalBus {
  DBusConnection* conn = nullptr;
  Listener launch;
  Listener dead;
};

SignalBus g_bus;

// Never claims a message: the connection is shared with the rest of the process.
DBusHandlerResult OnMessage(DBusConnection* conn, DBusMessage* msg, void*) {
  if (!dbus_message_has_path(msg, kPath)) return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
  Listener* listener = nullptr;
  if (dbus_message_is_signal(msg, kInterface, "app_launch")) {
    listener = &g_bus.launch;
  } else if (dbus_message_is_signal(msg, kInterface, "app_dead")) {
    listener = &g_bus.dead;
  } else {
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
  }
  DBusError err;
  dbus_error_init(&err);
  dbus_uint32_t pid = 0;
  // Anything but a leading uint32 that fits a pid is not a notice we can pass on.
  if (!dbus_message_get_args(msg, &err, DBUS_TYPE_UINT32, &pid, DBUS_TYPE_INVALID)) {
    dbus_error_free(&err);
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
  }
  if (pid == 0 || pid > static_cast<dbus_uint32_t>(INT_MAX) || listener->func == nullptr)
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
  // Only the launchpad, never any local user, may say that a process started or ended.
  if (!logmgr_host::SignalSenderTrusted(conn, msg)) return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
  (void)listener->func(static_cast<int>(pid), listener->data);
  return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

int Connect() {
  if (g_bus.conn != nullptr) return 0;
  DBusError err;
  dbus_error_init(&err);
  // The shared connection, where the process's other platform signals arrive too: a sender
  // that pings the process's bus name afterwards then knows this notice has been handled.
  DBusConnection* conn = dbus_bus_get(DBUS_BUS_SYSTEM, &err);
  if (conn == nullptr) {
    dbus_error_free(&err);
    return -1;
  }
  dbus_bus_add_match(conn, kRule, &err);
  if (dbus_error_is_set(&err)) {
    dbus_error_free(&err);
    dbus_connection_unref(conn);
    return -1;
  }
  if (!dbus_connection_add_filter(conn, OnMessage, nullptr, nullptr)) {
    dbus_bus_remove_match(conn, kRule, nullptr);
    dbus_connection_unref(conn);
    return -1;
  }
  dbus_connection_setup_with_g_main(conn, nullptr);
  g_bus.conn = conn;
  return 0;
}

void DisconnectIfUnused() {
  if (g_bus.conn == nullptr || g_bus.launch.func != nullptr || g_bus.dead.func != nullptr) return;
  dbus_connection_remove_filter(g_bus.conn, OnMessage, nullptr);
  dbus_bus_remove_match(g_bus.conn, kRule, nullptr);
  dbus_connection_unref(g_bus.conn);  // shared: never closed here
  g_bus.conn = nullptr;
}

int Listen(Listener* listener, int (*func)(int, void*), void* data) {
  if (func != nullptr && Connect() != 0) return AUL_R_ERROR;
  listener->func = func;
  listener->data = data;
  DisconnectIfUnused();
  return AUL_R_OK;
}

// The sysroot prefix the kernel shows in /proc/<pid>/exe: the root resolved, without trailing
// slashes, "" for none. Resolved once per value of LOGMGR_SYSROOT, not once per lookup.
const std::string& ResolvedRoot() {
  thread_local std::string value;
  thread_local std::string prefix;
  thread_local bool known = false;
  const char* root = getenv("LOGMGR_SYSROOT");
  if (root == nullptr) root = "";
  if (known && value == root) return prefix;
  value = root;
  prefix.clear();
  if (root[0] != '\0') {
    char resolved[PATH_MAX];
    prefix = realpath(root, resolved) != nullptr ? resolved : root;
    while (prefix.size() > 1 && prefix.back() == '/') prefix.pop_back();
    if (prefix == "/") prefix.clear();
  }
  known = true;
  return prefix;
}

// The executable of |pid| as a device path in |out|: the sysroot prefix, if any, taken off.
bool DevicePathOfExe(int pid, char* out, size_t size) {
  if (pid <= 0) return false;
  char link[64];
  (void)snprintf(link, sizeof(link), "/proc/%d/exe", pid);
  char exe[PATH_MAX];
  ssize_t n = readlink(link, exe, sizeof(exe) - 1);
  if (n <= 0) return false;
  exe[n] = '\0';
  const std::string& prefix = ResolvedRoot();
  size_t skip = 0;
  if (!prefix.empty() && static_cast<size_t>(n) > prefix.size() &&
      memcmp(exe, prefix.data(), prefix.size()) == 0 && exe[prefix.size()] == '/')
    skip = prefix.size();
  (void)snprintf(out, size, "%s", exe + skip);
  return true;
}

int AppOfPid(int pid, char* buf, int len, std::string logmgr_host::AppRecord::*field) {
  if (buf == nullptr || len <= 0) return AUL_R_EINVAL;
  char exe[PATH_MAX];
  if (!DevicePathOfExe(pid, exe, sizeof(exe))) return AUL_R_ERROR;
  logmgr_host::AppRecord app;
  if (logmgr_host::AppDbFindFirst(logmgr_host::AppColumn::kExec, exe, &app) != 1)
    return AUL_R_ERROR;
  (void)snprintf(buf, static_cast<size_t>(len), "%s", (app.*field).c_str());
  return AUL_R_OK;
}

}  // namespace

extern "C" {

int aul_listen_app_launch_signal(int (*func)(int pid, void* data), void* data) {
  return Listen(&g_bus.launch, func, data);
}

int aul_listen_app_dead_signal(int (*func)(int pid, void* data), void* data) {
  return Listen(&g_bus.dead, func, data);
}

int aul_app_get_appid_bypid(int pid, char* appid, int len) {
  return AppOfPid(pid, appid, len, &logmgr_host::AppRecord::appId);
}

int aul_app_get_pkgname_bypid(int pid, char* pkgname, int len) {
  return AppOfPid(pid, pkgname, len, &logmgr_host::AppRecord::appId);
}

int aul_app_get_pkgid_bypid(int pid, char* pkgid, int len) {
  return AppOfPid(pid, pkgid, len, &logmgr_host::AppRecord::package);
}

}  // extern "C"
