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

// The platform keys read here, each with the values that matter to it.
const char* const kPmStateKey = "memory/pm/state";
const int kPmNormal = 1;
const int kPmDim = 2;  // dimmed, still on
const int kPmOff = 3;
const char* const kChargerKey = "memory/sysman/charger_status";
const int kChargerDisconnected = 0;
const int kChargerConnected = 1;
// Connected to a host and usable: the charge comes over USB.
const char* const kUsbKey = "memory/sysman/usb_status";
const int kUsbAvailable = 2;
const char* const kLockKey = "memory/idle_lock/state";
const int kUnlocked = 0;
const char* const kEarjackKey = "memory/sysman/earjack";
const int kEarjackRemoved = 0;
const int kEarjackThreeWire = 1;
const int kEarjackFourWire = 3;
const int kEarjackTvOut = 16;
const char* const kWifiKey = "memory/dnet/wifi";
const int kWifiOff = 0;
const int kWifiUnconnected = 1;
const int kWifiConnected = 2;

// Charge kinds in the CHAR, BAT1 and BAT2 rows' extra.
const char* const kChargeUsb = "U";
const char* const kChargeAc = "A";

// BAT1 and BAT2 rows carry the battery level in thousandths of a percent.
const long long kLevelPerPercent = 1000;
// The start is held up this long before a connected charger's state is sampled, deliberately.
const unsigned kChargeSampleDelaySeconds = 2;

// A bonded device's extra: its major class over its minor class, as one number.
const int kMajorClassShift = 256;

bool g_screenOff = false;
const char* g_chargeKind = nullptr;  // a charge kind while charging; null when no start was seen
DBusConnection* g_bus = nullptr;

// --- vconf ---------------------------------------------------------------------------------

void OnScreenKey(DeviceStatusMonitor* monitor, int value) {
  if (value == kPmNormal && g_screenOff) {
    g_screenOff = false;
    (void)monitor->SetScreenState(true);
  } else if (value == kPmOff) {
    g_screenOff = true;
    (void)monitor->SetScreenState(false);
  }
  // Dimmed keeps the screen on; a repeated normal is not a new period.
}

void OnChargerKey(DeviceStatusMonitor* monitor, int value) {
  if (value == kChargerDisconnected || value == kChargerConnected)
    (void)monitor->RecordChargeState(value == kChargerConnected);
}

void OnLockKey(DeviceStatusMonitor* monitor, int value) {
  if (value == kUnlocked) (void)monitor->RecordUnlock();
}

void OnEarjackKey(DeviceStatusMonitor* monitor, int value) {
  if (value != kEarjackRemoved) {
    (void)monitor->StartFeature("HEAD", "");
  } else {
    (void)monitor->EndFeature("HEAD", monitor->Now());
  }
}

void OnWifiKey(DeviceStatusMonitor* monitor, int value) {
  if (value == kWifiConnected) {
    (void)monitor->StartFeature("WIFI", "");
  } else if (value == kWifiOff || value == kWifiUnconnected) {
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
    {kPmStateKey, OnScreenKey},
    {kChargerKey, OnChargerKey},
    {"db/setting/psmode", nullptr},
};
const KeyWatch kLateKeys[] = {
    {kLockKey, OnLockKey},
    {kEarjackKey, OnEarjackKey},
    {kWifiKey, OnWifiKey},
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
                 static_cast<int>(info->bt_class.major_device_class) * kMajorClassShift +
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

int DeviceStatusMonitor::RecordChargeState(bool connected) {
  if (connected) {
    int percent = 0;
    if (device_battery_get_percent(&percent) != DEVICE_ERROR_NONE) return -1;
    int usb = 0;
    if (vconf_get_int(kUsbKey, &usb) != 0) return -1;
    g_chargeKind = usb == kUsbAvailable ? kChargeUsb : kChargeAc;
    (void)StartFeature("CHAR", g_chargeKind);
    long long level = percent * kLevelPerPercent;
    (void)InsertRow("BAT1", g_chargeKind, &level);
    return 0;
  }
  (void)EndFeature("CHAR", clock());
  int percent = 0;
  if (device_battery_get_percent(&percent) != DEVICE_ERROR_NONE) return -1;
  if (g_chargeKind == nullptr) return -1;  // no BAT2 without a seen start
  long long level = percent * kLevelPerPercent;
  (void)InsertRow("BAT2", g_chargeKind, &level);
  g_chargeKind = nullptr;
  return 0;
}

int DeviceStatusMonitor::WriteEvent(const char* code) {
  return InsertRow(code, "", nullptr) == 0 ? 0 : -1;
}

int DeviceStatusMonitor::RecordUnlock() { return WriteEvent("UNLO"); }

int DeviceStatusMonitor::RecordCapture() { return WriteEvent("CAPT"); }

int DeviceStatusMonitor::SetScreenState(bool on) {
  if (appUsage != nullptr) appUsage->OnScreenState(on);
  if (!on) return EndFeature("SCRN", clock());
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
  if (vconf_get_int(kPmStateKey, &pmState) != 0) return 0;
  if (pmState == kPmNormal || pmState == kPmDim) {
    g_screenOff = false;
    if (SetScreenState(true) != 0) return 0;
  } else {
    g_screenOff = true;
  }
  int charger = 0;
  if (vconf_get_int(kChargerKey, &charger) != 0) return 0;
  if (charger == kChargerConnected) {
    sleep(kChargeSampleDelaySeconds);
    if (RecordChargeState(true) != 0) return 0;
  }
  int earjack = 0;
  if (vconf_get_int(kEarjackKey, &earjack) != 0) return 0;
  if (earjack == kEarjackThreeWire || earjack == kEarjackFourWire || earjack == kEarjackTvOut)
    (void)StartFeature("HEAD", "");
  return 0;
}

}  // namespace _CorvaneLogManager
