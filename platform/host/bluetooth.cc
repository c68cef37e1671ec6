// Host Bluetooth bonding over BlueZ on the system bus. A device object's Paired turning true is
// a bond created, turning false or the object's removal a bond destroyed. Callbacks run on the
// GLib default main context, where the signal subscriptions are made.
#include <bluetooth.h>
#include <gio/gio.h>
#include <stdint.h>

#include <map>
#include <string>
#include <vector>

namespace {

const char kBluez[] = "org.bluez";
const char kDeviceIface[] = "org.bluez.Device1";
const char kPropsIface[] = "org.freedesktop.DBus.Properties";
const char kObjectManagerIface[] = "org.freedesktop.DBus.ObjectManager";

struct Device {
  std::string address;
  std::string name;
  bool hasAddress = false;
  bool hasClass = false;
  uint32_t cls = 0;
  bool paired = false;
};

struct State {
  GDBusConnection* bus = nullptr;
  GCancellable* cancel = nullptr;
  std::vector<guint> subscriptions;
  std::map<std::string, Device> devices;  // by object path
  bt_device_bond_created_cb created = nullptr;
  void* createdData = nullptr;
  bt_device_bond_destroyed_cb destroyed = nullptr;
  void* destroyedData = nullptr;
};

State* g_state = nullptr;

// Takes what a property dictionary (a{sv}) tells about a device; values of the wrong type are
// ignored as if absent.
void MergeProperties(GVariant* props, Device* dev, bool* pairedSeen, bool* paired) {
  GVariant* v = g_variant_lookup_value(props, "Address", G_VARIANT_TYPE_STRING);
  if (v != nullptr) {
    dev->address = g_variant_get_string(v, nullptr);
    dev->hasAddress = true;
    g_variant_unref(v);
  }
  v = g_variant_lookup_value(props, "Name", G_VARIANT_TYPE_STRING);
  if (v != nullptr) {
    dev->name = g_variant_get_string(v, nullptr);
    g_variant_unref(v);
  }
  v = g_variant_lookup_value(props, "Class", G_VARIANT_TYPE_UINT32);
  if (v != nullptr) {
    dev->cls = g_variant_get_uint32(v);
    dev->hasClass = true;
    g_variant_unref(v);
  }
  v = g_variant_lookup_value(props, "Paired", G_VARIANT_TYPE_BOOLEAN);
  if (pairedSeen != nullptr) *pairedSeen = v != nullptr;
  if (v != nullptr) {
    if (paired != nullptr) *paired = g_variant_get_boolean(v);
    g_variant_unref(v);
  }
}

void EmitCreated(const Device& dev) {
  if (g_state->created == nullptr) return;
  std::string address = dev.address;
  std::string name = dev.name;
  bt_device_info_s info = {};
  info.remote_address = &address[0];
  info.remote_name = &name[0];
  info.bt_class.major_device_class = static_cast<bt_major_device_class_e>((dev.cls >> 8) & 0x1F);
  info.bt_class.minor_device_class = static_cast<int>((dev.cls >> 2) & 0x3F);
  info.bt_class.major_service_class_mask = static_cast<int>(dev.cls & 0xFFE000);
  info.is_bonded = true;
  g_state->created(BT_ERROR_NONE, &info, g_state->createdData);
}

void EmitDestroyed(const Device& dev) {
  if (g_state->destroyed == nullptr) return;
  std::string address = dev.address;
  g_state->destroyed(BT_ERROR_NONE, &address[0], g_state->destroyedData);
}

// A bond is reported only with both address and class known; otherwise it is skipped and the
// device stays unpaired here, so its later removal reports nothing either.
void CompletePairing(const std::string& path) {
  auto it = g_state->devices.find(path);
  if (it == g_state->devices.end() || it->second.paired) return;
  if (!it->second.hasAddress || !it->second.hasClass) return;
  it->second.paired = true;
  EmitCreated(it->second);
}

void OnGetAll(GObject* source, GAsyncResult* res, gpointer data) {
  std::string* path = static_cast<std::string*>(data);
  GError* error = nullptr;
  GVariant* reply = g_dbus_connection_call_finish(G_DBUS_CONNECTION(source), res, &error);
  if (reply == nullptr) {
    g_error_free(error);
    delete path;
    return;
  }
  if (g_state != nullptr) {
    auto it = g_state->devices.find(*path);
    if (it != g_state->devices.end() && !it->second.paired) {
      // Values carried by the signal are newer than the stored ones: only fill the gaps.
      Device fresh;
      GVariant* props = g_variant_get_child_value(reply, 0);
      MergeProperties(props, &fresh, nullptr, nullptr);
      g_variant_unref(props);
      Device& dev = it->second;
      if (!dev.hasAddress && fresh.hasAddress) {
        dev.address = fresh.address;
        dev.hasAddress = true;
      }
      if (!dev.hasClass && fresh.hasClass) {
        dev.cls = fresh.cls;
        dev.hasClass = true;
      }
      if (dev.name.empty()) dev.name = fresh.name;
      CompletePairing(*path);
    }
  }
  g_variant_unref(reply);
  delete path;
}

void OnPropertiesChanged(GDBusConnection*, const gchar*, const gchar* path, const gchar*,
                         const gchar*, GVariant* params, gpointer) {
  if (g_state == nullptr || !g_variant_is_of_type(params, G_VARIANT_TYPE("(sa{sv}as)"))) return;
  const gchar* iface = nullptr;
  GVariant* changed = nullptr;
  g_variant_get(params, "(&s@a{sv}as)", &iface, &changed, nullptr);
  if (g_strcmp0(iface, kDeviceIface) != 0) {
    g_variant_unref(changed);
    return;
  }
  Device& dev = g_state->devices[path];
  bool pairedSeen = false;
  bool paired = false;
  MergeProperties(changed, &dev, &pairedSeen, &paired);
  g_variant_unref(changed);
  if (!pairedSeen) return;
  if (paired && !dev.paired) {
    if (dev.hasAddress && dev.hasClass) {
      CompletePairing(path);
      return;
    }
    g_dbus_connection_call(g_state->bus, kBluez, path, kPropsIface, "GetAll",
                           g_variant_new("(s)", kDeviceIface), G_VARIANT_TYPE("(a{sv})"),
                           G_DBUS_CALL_FLAGS_NONE, -1, g_state->cancel, OnGetAll,
                           new std::string(path));
  } else if (!paired && dev.paired) {
    dev.paired = false;
    EmitDestroyed(dev);
  }
}

void OnInterfacesAdded(GDBusConnection*, const gchar*, const gchar*, const gchar*, const gchar*,
                       GVariant* params, gpointer) {
  if (g_state == nullptr || !g_variant_is_of_type(params, G_VARIANT_TYPE("(oa{sa{sv}})"))) return;
  const gchar* path = nullptr;
  GVariant* ifaces = nullptr;
  g_variant_get(params, "(&o@a{sa{sv}})", &path, &ifaces);
  GVariant* props = g_variant_lookup_value(ifaces, kDeviceIface, G_VARIANT_TYPE("a{sv}"));
  if (props != nullptr) {
    // A device that appears already paired was bonded before we looked: not a new bond.
    Device dev;
    bool paired = false;
    MergeProperties(props, &dev, nullptr, &paired);
    dev.paired = paired && dev.hasAddress;
    g_state->devices[path] = dev;
    g_variant_unref(props);
  }
  g_variant_unref(ifaces);
}

void OnInterfacesRemoved(GDBusConnection*, const gchar*, const gchar*, const gchar*, const gchar*,
                         GVariant* params, gpointer) {
  if (g_state == nullptr || !g_variant_is_of_type(params, G_VARIANT_TYPE("(oas)"))) return;
  const gchar* path = nullptr;
  GVariant* ifaces = nullptr;
  g_variant_get(params, "(&o@as)", &path, &ifaces);
  bool device = false;
  GVariantIter iter;
  const gchar* name = nullptr;
  g_variant_iter_init(&iter, ifaces);
  while (g_variant_iter_next(&iter, "&s", &name)) {
    if (g_strcmp0(name, kDeviceIface) == 0) device = true;
  }
  g_variant_unref(ifaces);
  if (!device) return;
  auto it = g_state->devices.find(path);
  if (it == g_state->devices.end()) return;
  Device dev = it->second;
  g_state->devices.erase(it);
  if (dev.paired) EmitDestroyed(dev);
}

// The devices BlueZ already knows; entries made by signals meanwhile are newer and kept.
void OnManagedObjects(GObject* source, GAsyncResult* res, gpointer) {
  GError* error = nullptr;
  GVariant* reply = g_dbus_connection_call_finish(G_DBUS_CONNECTION(source), res, &error);
  if (reply == nullptr) {
    g_error_free(error);
    return;
  }
  if (g_state != nullptr) {
    GVariantIter* objects = nullptr;
    const gchar* path = nullptr;
    GVariant* ifaces = nullptr;
    g_variant_get(reply, "(a{oa{sa{sv}}})", &objects);
    while (g_variant_iter_next(objects, "{&o@a{sa{sv}}}", &path, &ifaces)) {
      GVariant* props = g_variant_lookup_value(ifaces, kDeviceIface, G_VARIANT_TYPE("a{sv}"));
      if (props != nullptr && g_state->devices.count(path) == 0) {
        Device dev;
        bool paired = false;
        MergeProperties(props, &dev, nullptr, &paired);
        dev.paired = paired && dev.hasAddress;
        g_state->devices[path] = dev;
      }
      if (props != nullptr) g_variant_unref(props);
      g_variant_unref(ifaces);
    }
    g_variant_iter_free(objects);
  }
  g_variant_unref(reply);
}

guint Subscribe(const char* iface, const char* member, const char* arg0, GDBusSignalCallback cb) {
  return g_dbus_connection_signal_subscribe(g_state->bus, kBluez, iface, member, nullptr, arg0,
                                            G_DBUS_SIGNAL_FLAGS_NONE, cb, nullptr, nullptr);
}

}  // namespace

extern "C" {

int bt_initialize(void) {
  if (g_state != nullptr) return BT_ERROR_NONE;
  GError* error = nullptr;
  GDBusConnection* bus = g_bus_get_sync(G_BUS_TYPE_SYSTEM, nullptr, &error);
  if (bus == nullptr) {
    g_error_free(error);
    return BT_ERROR_OPERATION_FAILED;
  }
  // A lost bus must not become SIGTERM (a clean stop): see the host pkgmgr client.
  g_dbus_connection_set_exit_on_close(bus, FALSE);
  g_state = new State();
  g_state->bus = bus;
  g_state->cancel = g_cancellable_new();
  g_state->subscriptions.push_back(
      Subscribe(kPropsIface, "PropertiesChanged", kDeviceIface, OnPropertiesChanged));
  g_state->subscriptions.push_back(
      Subscribe(kObjectManagerIface, "InterfacesAdded", nullptr, OnInterfacesAdded));
  g_state->subscriptions.push_back(
      Subscribe(kObjectManagerIface, "InterfacesRemoved", nullptr, OnInterfacesRemoved));
  // No BlueZ on the bus is not an error: bonds are reported once it appears and pairs.
  g_dbus_connection_call(bus, kBluez, "/", kObjectManagerIface, "GetManagedObjects", nullptr,
                         G_VARIANT_TYPE("(a{oa{sa{sv}}})"), G_DBUS_CALL_FLAGS_NO_AUTO_START, -1,
                         g_state->cancel, OnManagedObjects, nullptr);
  return BT_ERROR_NONE;
}

int bt_deinitialize(void) {
  if (g_state == nullptr) return BT_ERROR_NOT_INITIALIZED;
  for (guint id : g_state->subscriptions) g_dbus_connection_signal_unsubscribe(g_state->bus, id);
  // Pending replies still run their callbacks (cancelled); they find no state and return.
  g_cancellable_cancel(g_state->cancel);
  g_object_unref(g_state->cancel);
  g_object_unref(g_state->bus);
  delete g_state;
  g_state = nullptr;
  return BT_ERROR_NONE;
}

int bt_device_set_bond_created_cb(bt_device_bond_created_cb callback, void* user_data) {
  if (g_state == nullptr) return BT_ERROR_NOT_INITIALIZED;
  if (callback == nullptr) return BT_ERROR_INVALID_PARAMETER;
  g_state->created = callback;
  g_state->createdData = user_data;
  return BT_ERROR_NONE;
}

int bt_device_unset_bond_created_cb(void) {
  if (g_state == nullptr) return BT_ERROR_NOT_INITIALIZED;
  g_state->created = nullptr;
  g_state->createdData = nullptr;
  return BT_ERROR_NONE;
}

int bt_device_set_bond_destroyed_cb(bt_device_bond_destroyed_cb callback, void* user_data) {
  if (g_state == nullptr) return BT_ERROR_NOT_INITIALIZED;
  if (callback == nullptr) return BT_ERROR_INVALID_PARAMETER;
  g_state->destroyed = callback;
  g_state->destroyedData = user_data;
  return BT_ERROR_NONE;
}

int bt_device_unset_bond_destroyed_cb(void) {
  if (g_state == nullptr) return BT_ERROR_NOT_INITIALIZED;
  g_state->destroyed = nullptr;
  g_state->destroyedData = nullptr;
  return BT_ERROR_NONE;
}

}  // extern "C"
