// Host pkgmgr client. Status events are the package manager's broadcast signals on the system
// bus, received through a GDBus subscription made on (and so dispatched from) the GLib default
// main context.
#include <gio/gio.h>
#include <string.h>

#include <deque>
#include <map>
#include <new>
#include <string>
#include <vector>

#include "package-manager.h"

namespace {

const char kPath[] = "/org/tizen/pkgmgr_status";
const char kInterface[] = "org.tizen.pkgmgr_status";
const char kMember[] = "status";
// Requests whose "end" never comes must not grow the table without bound.
const size_t kMaxOpenRequests = 64;

struct Listener {
  int id;
  pkgmgr_handler callback;
  void* data;
};

struct Client {
  client_type type = PC_REQUEST;
  GDBusConnection* bus = nullptr;
  guint subscription = 0;
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

void OnStatus(GDBusConnection*, const gchar*, const gchar*, const gchar*, const gchar*,
              GVariant* params, gpointer userData) {
  Client* client = static_cast<Client*>(userData);
  // Anything other than five strings is not a status event.
  if (!g_variant_is_of_type(params, G_VARIANT_TYPE("(sssss)"))) return;
  const gchar* request = nullptr;
  const gchar* pkgType = nullptr;
  const gchar* pkgid = nullptr;
  const gchar* key = nullptr;
  const gchar* val = nullptr;
  g_variant_get(params, "(&s&s&s&s&s)", &request, &pkgType, &pkgid, &key, &val);
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

}  // namespace

extern "C" {

pkgmgr_client* pkgmgr_client_new(client_type ctype) {
  Client* client = new (std::nothrow) Client();
  if (client == nullptr) return nullptr;
  client->type = ctype;
  if (ctype != PC_LISTENING) return client;
  client->bus = g_bus_get_sync(G_BUS_TYPE_SYSTEM, nullptr, nullptr);
  if (client->bus == nullptr) {
    delete client;
    return nullptr;
  }
  // GDBus would answer a lost bus with SIGTERM, a clean stop with status 0 that no service
  // manager restarts; the daemon's own connection ends it with a failure instead.
  g_dbus_connection_set_exit_on_close(client->bus, FALSE);
  client->subscription =
      g_dbus_connection_signal_subscribe(client->bus, nullptr, kInterface, kMember, kPath, nullptr,
                                         G_DBUS_SIGNAL_FLAGS_NONE, OnStatus, client, nullptr);
  return client;
}

int pkgmgr_client_free(pkgmgr_client* pc) {
  Client* client = static_cast<Client*>(pc);
  if (client == nullptr) return PKGMGR_R_EINVAL;
  if (client->bus != nullptr) {
    // Unsubscribed on the dispatching thread, so no callback can follow the delete.
    if (client->subscription != 0)
      g_dbus_connection_signal_unsubscribe(client->bus, client->subscription);
    g_object_unref(client->bus);
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
  if (g_nextListenerId == G_MAXINT) g_nextListenerId = 0;
  Listener listener{++g_nextListenerId, event_cb, data};
  client->listeners.push_back(listener);
  return listener.id;
}

}  // extern "C"
