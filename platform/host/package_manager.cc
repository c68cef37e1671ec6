// Host pkgmgr client. Status events are the package manager's broadcast signals on the system
// bus, received by a filter on the process's shared connection (dispatched from the GLib
// default main context) and taken only from a trusted sender.
#include <dbus/dbus-glib-lowlevel.h>
#include <dbus/dbus.h>
#include <limits.h>
#include <package-manager.h>
#include <string.h>

#include <deque>
#include <map>
#include <new>
#include <string>
#include <vector>

#include "platform/host/sender_trust.h"

namespace {

const char kPath[] = "/org/tizen/pkgmgr_status";
const char kInterface[] = "org.tizen.pkgmgr_status";
const char kMember[] = "status";
const char kRule[] =
    "type='signal',path='/org/tizen/pkgmgr_status',interface='org.tizen.pkgmgr_status',"
    "member='status'";
// Requests whose "end" never comes must not grow the table without bound.
const size_t kMaxOpenRequests = 64;

struct Listener {
  int id;
  pkgmgr_handler callback;
  void* data;
};

struct Client {
  client_type type = PC_REQUEST;
  DBusConnection* bus = nullptr;
  int mask = PKGMGR_CLIENT_STATUS_ALL;
  std::vector<Listener> listeners;
  std::map<std::string, int> kindOfRequest;  // by the installer's request id
  std::deque<std::string> openOrder;
};

int g_nextListenerId = 0;

int KindBit(const char* value) {
  if (strcmp(value, "install") == 0) return PKGMGR_CLIENT_STATUS_INSTALL;
  if (strcmp(value, "uninstall") == 0) return PKGMGR_CLIENT_STATUS_UNINSTALL;
  if (strcmp(value, "update") == 0) return PKGMGR_CLIENT_STATUS_UPGRADE;
  if (strcmp(value, "move") == 0) return PKGMGR_CLIENT_STATUS_MOVE;
  return 0;
}

void Remember(Client* client, const std::string& request, int kind) {
  if (client->kindOfRequest.count(request) == 0) {
    if (client->openOrder.size() >= kMaxOpenRequests) {
      client->kindOfRequest.erase(client->openOrder.front());
      client->openOrder.pop_front();
    }
    client->openOrder.push_back(request);
  }
  client->kindOfRequest[request] = kind;
}

void Forget(Client* client, const std::string& request) {
  if (client->kindOfRequest.erase(request) == 0) return;
  for (auto it = client->openOrder.begin(); it != client->openOrder.end(); ++it) {
    if (*it == request) {
      client->openOrder.erase(it);
      break;
    }
  }
}

// Whether the mask lets an event of |request| through. A request whose "start" was not seen
// (or named no known kind) cannot be classified and passes.
bool Wanted(Client* client, const std::string& request) {
  if (client->mask == PKGMGR_CLIENT_STATUS_ALL) return true;
  auto it = client->kindOfRequest.find(request);
  if (it == client->kindOfRequest.end() || it->second == 0) return true;
  return (it->second & client->mask) != 0;
}

void Deliver(Client* client, const char* request, const char* pkgType, const char* pkgid,
             const char* key, const char* val) {
  if (strcmp(key, "start") == 0) Remember(client, request, KindBit(val));
  bool wanted = Wanted(client, request);
  if (strcmp(key, "end") == 0) Forget(client, request);
  if (!wanted) return;
  // A handler may register others; deliver to the ones present when the event came.
  std::vector<Listener> listeners = client->listeners;
  for (const Listener& listener : listeners) {
    if (listener.callback(listener.id, pkgType, pkgid, key, val, nullptr, listener.data) != 0)
      break;
  }
}

// Never claims a message: the connection is shared with the rest of the process.
DBusHandlerResult OnMessage(DBusConnection* conn, DBusMessage* msg, void* userData) {
  // Anything other than five strings is not a status event.
  if (!dbus_message_is_signal(msg, kInterface, kMember) || !dbus_message_has_path(msg, kPath) ||
      !dbus_message_has_signature(msg, "sssss"))
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
  // Only the package manager, never any local user, may announce an install.
  if (!logmgr_host::SignalSenderTrusted(conn, msg)) return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
  const char* s[5] = {};
  DBusError err;
  dbus_error_init(&err);
  if (!dbus_message_get_args(msg, &err, DBUS_TYPE_STRING, &s[0], DBUS_TYPE_STRING, &s[1],
                             DBUS_TYPE_STRING, &s[2], DBUS_TYPE_STRING, &s[3], DBUS_TYPE_STRING,
                             &s[4], DBUS_TYPE_INVALID)) {
    dbus_error_free(&err);
    return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
  }
  Deliver(static_cast<Client*>(userData), s[0], s[1], s[2], s[3], s[4]);
  return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

}  // namespace

extern "C" {

pkgmgr_client* pkgmgr_client_new(client_type ctype) {
  Client* client = new (std::nothrow) Client();
  if (client == nullptr) return nullptr;
  client->type = ctype;
  if (ctype != PC_LISTENING) return client;
  // The shared connection: a lost bus ends the process through it with a failure status, and
  // a sender that pings the process's bus name afterwards knows its events have been handled.
  DBusError err;
  dbus_error_init(&err);
  DBusConnection* bus = dbus_bus_get(DBUS_BUS_SYSTEM, &err);
  if (bus != nullptr) {
    dbus_connection_setup_with_g_main(bus, nullptr);
    dbus_bus_add_match(bus, kRule, &err);
  }
  if (bus == nullptr || dbus_error_is_set(&err)) {
    dbus_error_free(&err);
    if (bus != nullptr) dbus_connection_unref(bus);
    delete client;
    return nullptr;
  }
  if (!dbus_connection_add_filter(bus, OnMessage, client, nullptr)) {
    dbus_bus_remove_match(bus, kRule, nullptr);
    dbus_connection_unref(bus);
    delete client;
    return nullptr;
  }
  client->bus = bus;
  return client;
}

int pkgmgr_client_free(pkgmgr_client* pc) {
  Client* client = static_cast<Client*>(pc);
  if (client == nullptr) return PKGMGR_R_EINVAL;
  if (client->bus != nullptr) {
    // Removed on the dispatching thread, so no callback can follow the delete.
    dbus_connection_remove_filter(client->bus, OnMessage, client);
    dbus_bus_remove_match(client->bus, kRule, nullptr);
    dbus_connection_unref(client->bus);  // shared: never closed here
  }
  delete client;
  return PKGMGR_R_OK;
}

int pkgmgr_client_set_status_type(pkgmgr_client* pc, int status_type) {
  Client* client = static_cast<Client*>(pc);
  if (client == nullptr || status_type < 0) return PKGMGR_R_EINVAL;
  if (status_type == PKGMGR_CLIENT_STATUS_ALL) return PKGMGR_R_OK;
  client->listeners.clear();
  client->mask = status_type;
  return PKGMGR_R_OK;
}

int pkgmgr_client_listen_status(pkgmgr_client* pc, pkgmgr_handler event_cb, void* data) {
  Client* client = static_cast<Client*>(pc);
  if (client == nullptr || event_cb == nullptr || client->type != PC_LISTENING)
    return PKGMGR_R_EINVAL;
  if (g_nextListenerId == INT_MAX) g_nextListenerId = 0;
  Listener listener{++g_nextListenerId, event_cb, data};
  client->listeners.push_back(listener);
  return listener.id;
}

}  // extern "C"
