#include "collectors/device_status_monitor.h"

#include <bluetooth.h>
#include <dbus/dbus-glib-lowlevel.h>
#include <dbus/dbus.h>
#include <device/battery.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>
#include <vconf.h>

#include <string>

#include "collectors/app_usage_monitor.h"
#include "collectors/row_values.h"
#include "collectors/trusted_sender.h"
#include "include/base_log_provider.h"
#include "include/db_connection.h"
#include "include/provider_registry.h"
#include "storage/pref_store.h"
#include "storage/status_snapshot_store.h"

namespace _CorvaneLogManager {

namespace {

const char* const kFeatureTable = "use_app_feature_survey";
const char* const kPeriodColumns = "app_id,feature,extra,value";
const char* const kEventColumns = "app_id,feature,extra";
const char* const kStatusMatch =
    "type='signal',interface='org.tizen.system.notification.status_message'";
const char* const kStatusIface = "org.tizen.system.notification.status_message";
const char* const kMovementIface = "org.tizen.sensor.context.movement";
const char* const kCaptureText = "Screen captured.";

// Seven days: one millisecond wider than the application-usage bound, on purpose.
const int64_t kMaxPeriodMs = 604800000LL;

// Survey tables whose newest row tells when the previous run was last active.
const char* const kActivityTables[] = {"use_app_survey", "manage_app_survey",
                                       "report_app_error_survey", "report_app_status_survey",
                                       "use_app_feature_survey"};
// Periods a previous run may have left open, closed in this order.
const char* const kRecoveredFeatures[] = {"SCRN", "CHAR", "HEAD", "WIFI", "BLUE"};

bool g_screenOff = false;
const char* g_chargeKind = nullptr;  // "U" or "A" while charging; null when no start was seen
DBusConnection* g_bus = nullptr;

// --- vconf ---------------------------------------------------------------------------------

void OnScreenKey(DeviceStatusMonitor* monitor, int value) {
  if (value == 1 && g_screenOff) {
    g_screenOff = false;
    (void)monitor->SetScreenState(1);
  } else if (value == 3) {
    g_screenOff = true;
    (void)monitor->SetScreenState(0);
  }
  // 2 (dimmed) keeps the screen on; a repeated 1 is not a new period.
}

void OnChargerKey(DeviceStatusMonitor* monitor, int value) {
  if (value == 0 || value == 1) (void)monitor->RecordChargeState(value);
}

void OnLockKey(DeviceStatusMonitor* monitor, int value) {
  if (value == 0) (void)monitor->RecordUnlock();
}

void OnEarjackKey(DeviceStatusMonitor* monitor, int value) {
  if (value != 0) {
    (void)monitor->StartFeature("HEAD", "");
  } else {
    (void)monitor->EndFeature("HEAD", monitor->Now());
  }
}

void OnWifiKey(DeviceStatusMonitor* monitor, int value) {
  if (value == 2) {
    (void)monitor->StartFeature("WIFI", "");
  } else if (value == 0 || value == 1) {
    (void)monitor->EndFeature("WIFI", monitor->Now());
  }
}

struct KeyWatch {
  const char* key;
  // Null: watched, but the value is deliberately not acted on.
  void (*onValue)(DeviceStatusMonitor* monitor, int value);
};

// Registered before the bus filter, then the rest after it.
const KeyWatch kEarlyKeys[] = {
    {"memory/pm/state", OnScreenKey},
    {"memory/sysman/charger_status", OnChargerKey},
    {"db/setting/psmode", nullptr},
};
const KeyWatch kLateKeys[] = {
    {"memory/idle_lock/state", OnLockKey},
    {"memory/sysman/earjack", OnEarjackKey},
    {"memory/dnet/wifi", OnWifiKey},
};

const KeyWatch* FindWatch(const char* key) {
  if (key == nullptr) return nullptr;
  for (const KeyWatch& w : kEarlyKeys) {
    if (strcmp(w.key, key) == 0) return &w;
  }
  for (const KeyWatch& w : kLateKeys) {
    if (strcmp(w.key, key) == 0) return &w;
  }
  return nullptr;
}

void OnKeyChanged(keynode_t* node, void* data) {
  const KeyWatch* watch = FindWatch(vconf_keynode_get_name(node));
  if (watch == nullptr || watch->onValue == nullptr || data == nullptr) return;
  // A key rewritten with another type is not an event.
  if (vconf_keynode_get_type(node) != VCONF_TYPE_INT) return;
  watch->onValue(static_cast<DeviceStatusMonitor*>(data), vconf_keynode_get_int(node));
}

// --- D-Bus and Bluetooth -------------------------------------------------------------------

DBusHandlerResult OnBusMessage(DBusConnection* connection, DBusMessage* message, void* data) {
  DeviceStatusMonitor* monitor = static_cast<DeviceStatusMonitor*>(data);
  // Signals carrying other arguments than announced are not the platform's: skip them.
  if (dbus_message_is_signal(message, kMovementIface, "wakeup")) {
    // A movement wake-up is deliberately counted as an unlock. Anyone may send it: it is
    // addressed to us and only marks the device as picked up.
    if (dbus_message_has_signature(message, "")) (void)monitor->RecordUnlock();
  } else if (dbus_message_is_signal(message, kStatusIface, "status_message") &&
             dbus_message_has_signature(message, "s")) {
    const char* text = nullptr;
    DBusError error;
    dbus_error_init(&error);
    if (dbus_message_get_args(message, &error, DBUS_TYPE_STRING, &text, DBUS_TYPE_INVALID)) {
      // Only the platform's notification service reports captures.
      if (text != nullptr && strcmp(text, kCaptureText) == 0 &&
          IsTrustedSender(connection, message))
        (void)monitor->RecordCapture();
    } else {
      dbus_error_free(&error);
    }
  }
  return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;  // other filters see every message too
}

void OnBondCreated(int result, bt_device_info_s* info, void* data) {
  if (result != BT_ERROR_NONE || info == nullptr || data == nullptr) return;
  char extra[20] = {0};
  (void)snprintf(extra, sizeof(extra), "%d",
                 static_cast<int>(info->bt_class.major_device_class) * 256 +
                     static_cast<int>(info->bt_class.minor_device_class));
  (void)static_cast<DeviceStatusMonitor*>(data)->StartFeature("BLUE", extra);
}

void OnBondDestroyed(int result, char*, void* data) {
  if (result != BT_ERROR_NONE || data == nullptr) return;
  DeviceStatusMonitor* monitor = static_cast<DeviceStatusMonitor*>(data);
  (void)monitor->EndFeature("BLUE", monitor->Now());
}

}  // namespace

// --- periods and events --------------------------------------------------------------------

DeviceStatusMonitor::DeviceStatusMonitor(ProviderRegistry* registry, PrefStore* prefStore,
                                         ClockFn clockFn)
    : providers(registry), prefs(prefStore), clock(clockFn) {}

// One feature row; |value| is null for the events that carry none. Texts are stored verbatim.
int DeviceStatusMonitor::InsertRow(const char* code, const char* extra, const long long* value) {
  BaseLogProvider* provider = providers != nullptr ? providers->Lookup(kFeatureTable) : nullptr;
  if (provider == nullptr) return -1;
  char buffer[512];
  RowValues row(buffer, sizeof(buffer));
  row.Text(appId.c_str()).Text(code).Text(extra);
  if (value != nullptr) row.Number(*value);
  if (row.Get() == nullptr) return -1;
  return provider->InsertRow(value != nullptr ? kPeriodColumns : kEventColumns, row.Get());
}

int DeviceStatusMonitor::StartFeature(const char* code, const char* extra) {
  if (snapshots == nullptr) return -1;
  std::string openExtra;
  int64_t started = 0;
  if (snapshots->Get(code, &openExtra, &started) != 0) return -1;
  if (started > 0) return 0;  // already open: the first start wins
  return snapshots->Put(code, extra, clock()) == 0 ? 0 : -1;
}

int DeviceStatusMonitor::EndFeature(const char* code, int64_t endTime) {
  BaseLogProvider* provider = providers != nullptr ? providers->Lookup(kFeatureTable) : nullptr;
  if (provider == nullptr || snapshots == nullptr) return -1;
  std::string extra;
  int64_t started = 0;
  if (snapshots->Get(code, &extra, &started) != 0) return -1;
  if (started <= 0) return 0;
  int64_t duration = endTime - started;
  if (duration >= 1 && duration <= kMaxPeriodMs) {
    long long value = duration;
    (void)InsertRow(code, extra.c_str(), &value);
  }
  // Written or discarded as implausible, the period is over.
  return snapshots->Put(code, "", 0) == 0 ? 0 : -1;
}

int DeviceStatusMonitor::RecordChargeState(int connected) {
  if (connected == 1) {
    int percent = 0;
    if (device_battery_get_percent(&percent) != DEVICE_ERROR_NONE) return -1;
    int usb = 0;
    if (vconf_get_int("memory/sysman/usb_status", &usb) != 0) return -1;
    g_chargeKind = usb == 2 ? "U" : "A";
    (void)StartFeature("CHAR", g_chargeKind);
    long long level = percent * 1000LL;
    (void)InsertRow("BAT1", g_chargeKind, &level);
    return 0;
  }
  (void)EndFeature("CHAR", clock());
  int percent = 0;
  if (device_battery_get_percent(&percent) != DEVICE_ERROR_NONE) return -1;
  if (g_chargeKind == nullptr) return -1;  // no BAT2 without a seen start
  long long level = percent * 1000LL;
  (void)InsertRow("BAT2", g_chargeKind, &level);
  g_chargeKind = nullptr;
  return 0;
}

int DeviceStatusMonitor::WriteEvent(const char* code) {
  return InsertRow(code, "", nullptr) == 0 ? 0 : -1;
}

int DeviceStatusMonitor::RecordUnlock() { return WriteEvent("UNLO"); }

int DeviceStatusMonitor::RecordCapture() { return WriteEvent("CAPT"); }

int DeviceStatusMonitor::SetScreenState(int on) {
  if (appUsage != nullptr) appUsage->OnScreenState(on);
  if (on == 0) return EndFeature("SCRN", clock());
  return StartFeature("SCRN", "");
}

// --- lifecycle -----------------------------------------------------------------------------

int DeviceStatusMonitor::Start() {
  // A retried start resumes: nothing already registered is registered again.
  if (started) return 0;
  if (!earlyKeysWatched) {
    for (const KeyWatch& w : kEarlyKeys) (void)vconf_notify_key_changed(w.key, OnKeyChanged, this);
    earlyKeysWatched = true;
  }

  if (g_bus == nullptr) {
    DBusError error;
    dbus_error_init(&error);
    DBusConnection* bus = dbus_bus_get(DBUS_BUS_SYSTEM, &error);
    if (bus == nullptr || dbus_error_is_set(&error)) {
      dbus_error_free(&error);
      return -1;
    }
    dbus_connection_setup_with_g_main(bus, nullptr);
    // No rule for the movement interface: its wake-up is sent straight to us.
    dbus_bus_add_match(bus, kStatusMatch, &error);
    if (dbus_error_is_set(&error)) {
      dbus_error_free(&error);
      dbus_connection_unref(bus);
      return -1;
    }
    if (!dbus_connection_add_filter(bus, OnBusMessage, this, nullptr)) {
      dbus_bus_remove_match(bus, kStatusMatch, nullptr);
      dbus_connection_unref(bus);
      return -1;
    }
    g_bus = bus;
  }

  for (const KeyWatch& w : kLateKeys) (void)vconf_notify_key_changed(w.key, OnKeyChanged, this);
  started = true;

  // Without Bluetooth the other features still count: not a start failure.
  if (bt_initialize() < 0) return 0;
  if (bt_device_set_bond_created_cb(OnBondCreated, this) < 0) return 0;
  (void)bt_device_set_bond_destroyed_cb(OnBondDestroyed, this);
  return 0;
}

int DeviceStatusMonitor::Stop() {
  started = false;
  earlyKeysWatched = false;
  for (const KeyWatch& w : kEarlyKeys) (void)vconf_ignore_key_changed(w.key, OnKeyChanged);
  for (const KeyWatch& w : kLateKeys) (void)vconf_ignore_key_changed(w.key, OnKeyChanged);
  if (g_bus != nullptr) {
    dbus_bus_remove_match(g_bus, kStatusMatch, nullptr);
    dbus_connection_remove_filter(g_bus, OnBusMessage, this);
    dbus_connection_unref(g_bus);
    g_bus = nullptr;
  }
  (void)bt_device_unset_bond_created_cb();
  (void)bt_device_unset_bond_destroyed_cb();
  (void)bt_deinitialize();
  return 0;
}

int DeviceStatusMonitor::Recover(StatusSnapshotStore* snapshotStore, DbConnection* survey,
                                 const std::string& rowAppId) {
  // Once per run: a second pass would close the periods the first one opened.
  if (recovered) return 0;
  snapshots = snapshotStore;
  appId = rowAppId;
  if (RecoverAndSample(survey) != 0) return -1;
  recovered = true;
  return 0;
}

int DeviceStatusMonitor::RecoverAndSample(DbConnection* survey) {
  if (snapshots == nullptr || prefs == nullptr) return -1;

  int64_t endTime = 0;
  uint32_t shutdownSeconds = prefs->GetLastShutdownTime();
  if (shutdownSeconds >= 1) {
    // A clean stop recorded its time; used once.
    endTime = static_cast<int64_t>(shutdownSeconds) * 1000;
    (void)prefs->SetLastShutdownTime(0);
  } else {
    // After a crash: the last moment anything was written.
    if (survey == nullptr) return -1;
    for (const char* table : kActivityTables) {
      int64_t latest = survey->MaxTimestamp(table);
      if (latest > endTime) endTime = latest;
    }
    int64_t latest = snapshots->LatestTimestamp();
    if (latest > endTime) endTime = latest;
  }
  if (endTime >= 1) {
    for (const char* code : kRecoveredFeatures) (void)EndFeature(code, endTime);
  }

  // Initial snapshot; it stops at its first failing step, which does not fail the start.
  int pmState = 0;
  if (vconf_get_int("memory/pm/state", &pmState) != 0) return 0;
  if (pmState == 1 || pmState == 2) {
    g_screenOff = false;
    if (SetScreenState(1) != 0) return 0;
  } else {
    g_screenOff = true;
  }
  int charger = 0;
  if (vconf_get_int("memory/sysman/charger_status", &charger) != 0) return 0;
  if (charger == 1) {
    // The start is held up two seconds before the charge is sampled, deliberately.
    sleep(2);
    if (RecordChargeState(1) != 0) return 0;
  }
  int earjack = 0;
  if (vconf_get_int("memory/sysman/earjack", &earjack) != 0) return 0;
  if (earjack == 1 || earjack == 3 || earjack == 16) (void)StartFeature("HEAD", "");
  return 0;
}

}  // namespace _CorvaneLogManager
