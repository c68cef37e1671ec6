// Host capi-telephony over oFono on the system bus: one handle per modem, the operator text
// from the modem's SimManager (MobileCountryCode followed by MobileNetworkCode).
#include <dbus/dbus.h>
#include <stdlib.h>
#include <string.h>
#include <telephony.h>

#include <new>
#include <string>
#include <vector>

struct telephony_data {
  DBusConnection* bus;
  std::string modemPath;
};

namespace {

constexpr int kCallTimeoutMs = 5000;

DBusMessage* Call(DBusConnection* bus, const char* path, const char* iface, const char* method) {
  DBusMessage* msg = dbus_message_new_method_call("org.ofono", path, iface, method);
  if (msg == nullptr) return nullptr;
  DBusError err;
  dbus_error_init(&err);
  DBusMessage* reply = dbus_connection_send_with_reply_and_block(bus, msg, kCallTimeoutMs, &err);
  dbus_message_unref(msg);
  dbus_error_free(&err);
  return reply;
}

std::vector<std::string> ModemPaths(DBusConnection* bus) {
  std::vector<std::string> paths;
  DBusMessage* reply = Call(bus, "/", "org.ofono.Manager", "GetModems");
  if (reply == nullptr) return paths;
  DBusMessageIter it, array;
  if (dbus_message_iter_init(reply, &it) &&
      dbus_message_iter_get_arg_type(&it) == DBUS_TYPE_ARRAY) {
    dbus_message_iter_recurse(&it, &array);
    while (dbus_message_iter_get_arg_type(&array) == DBUS_TYPE_STRUCT) {
      DBusMessageIter entry;
      dbus_message_iter_recurse(&array, &entry);
      if (dbus_message_iter_get_arg_type(&entry) == DBUS_TYPE_OBJECT_PATH) {
        const char* path = nullptr;
        dbus_message_iter_get_basic(&entry, &path);
        if (path != nullptr) paths.emplace_back(path);
      }
      dbus_message_iter_next(&array);
    }
  }
  dbus_message_unref(reply);
  return paths;
}

struct SimProperties {
  bool present = false;
  std::string mcc;
  std::string mnc;
};

bool ReadSim(telephony_h handle, SimProperties* sim) {
  DBusMessage* reply =
      Call(handle->bus, handle->modemPath.c_str(), "org.ofono.SimManager", "GetProperties");
  if (reply == nullptr) return false;
  DBusMessageIter it, dict;
  bool ok =
      dbus_message_iter_init(reply, &it) && dbus_message_iter_get_arg_type(&it) == DBUS_TYPE_ARRAY;
  if (ok) {
    dbus_message_iter_recurse(&it, &dict);
    while (dbus_message_iter_get_arg_type(&dict) == DBUS_TYPE_DICT_ENTRY) {
      DBusMessageIter entry, variant;
      dbus_message_iter_recurse(&dict, &entry);
      const char* name = nullptr;
      dbus_message_iter_get_basic(&entry, &name);
      dbus_message_iter_next(&entry);
      dbus_message_iter_recurse(&entry, &variant);
      int type = dbus_message_iter_get_arg_type(&variant);
      if (strcmp(name, "Present") == 0 && type == DBUS_TYPE_BOOLEAN) {
        dbus_bool_t present = FALSE;
        dbus_message_iter_get_basic(&variant, &present);
        sim->present = present;
      } else if (type == DBUS_TYPE_STRING && (strcmp(name, "MobileCountryCode") == 0 ||
                                              strcmp(name, "MobileNetworkCode") == 0)) {
        const char* text = nullptr;
        dbus_message_iter_get_basic(&variant, &text);
        (name[6] == 'C' ? sim->mcc : sim->mnc) = text != nullptr ? text : "";
      }
      dbus_message_iter_next(&dict);
    }
  }
  dbus_message_unref(reply);
  return ok;
}

void FreeHandles(telephony_handle_list_s* list) {
  for (unsigned int i = 0; i < list->count; ++i) delete list->handle[i];
  delete[] list->handle;
  list->handle = nullptr;
  list->count = 0;
}

}  // namespace

extern "C" int telephony_init(telephony_handle_list_s* list) {
  if (list == nullptr) return TELEPHONY_ERROR_INVALID_PARAMETER;
  list->count = 0;
  list->handle = nullptr;
  DBusError err;
  dbus_error_init(&err);
  // A private connection: the caller may be a worker thread, and closing it must not
  // disturb the daemon's shared one.
  DBusConnection* bus = dbus_bus_get_private(DBUS_BUS_SYSTEM, &err);
  dbus_error_free(&err);
  if (bus == nullptr) return TELEPHONY_ERROR_OPERATION_FAILED;
  dbus_connection_set_exit_on_disconnect(bus, FALSE);

  std::vector<std::string> paths = ModemPaths(bus);
  if (!paths.empty()) {
    list->handle = new (std::nothrow) telephony_h[paths.size()];
    if (list->handle != nullptr) {
      for (const std::string& path : paths) {
        telephony_h h = new (std::nothrow) telephony_data{bus, path};
        if (h == nullptr) break;
        list->handle[list->count++] = h;
      }
    }
  }
  if (list->count == 0) {
    FreeHandles(list);
    dbus_connection_close(bus);
    dbus_connection_unref(bus);
    return paths.empty() ? TELEPHONY_ERROR_OPERATION_FAILED : TELEPHONY_ERROR_OUT_OF_MEMORY;
  }
  return TELEPHONY_ERROR_NONE;
}

extern "C" int telephony_deinit(telephony_handle_list_s* list) {
  if (list == nullptr) return TELEPHONY_ERROR_INVALID_PARAMETER;
  DBusConnection* bus = list->count > 0 ? list->handle[0]->bus : nullptr;
  FreeHandles(list);
  if (bus != nullptr) {
    dbus_connection_close(bus);
    dbus_connection_unref(bus);
  }
  return TELEPHONY_ERROR_NONE;
}

extern "C" int telephony_sim_get_state(telephony_h handle, telephony_sim_state_e* state) {
  if (handle == nullptr || state == nullptr) return TELEPHONY_ERROR_INVALID_PARAMETER;
  SimProperties sim;
  if (!ReadSim(handle, &sim)) return TELEPHONY_ERROR_OPERATION_FAILED;
  *state = sim.present ? TELEPHONY_SIM_STATE_AVAILABLE : TELEPHONY_SIM_STATE_UNAVAILABLE;
  return TELEPHONY_ERROR_NONE;
}

extern "C" int telephony_sim_get_operator(telephony_h handle, char** sim_operator) {
  if (handle == nullptr || sim_operator == nullptr) return TELEPHONY_ERROR_INVALID_PARAMETER;
  SimProperties sim;
  if (!ReadSim(handle, &sim)) return TELEPHONY_ERROR_OPERATION_FAILED;
  if (!sim.present || sim.mcc.empty() || sim.mnc.empty()) return TELEPHONY_ERROR_SIM_NOT_AVAILABLE;
  *sim_operator = strdup((sim.mcc + sim.mnc).c_str());
  return *sim_operator == nullptr ? TELEPHONY_ERROR_OUT_OF_MEMORY : TELEPHONY_ERROR_NONE;
}
