// The floor the daemon's idle footprint is measured against (scripts/footprint --floor): the
// stack the daemon stands on doing nothing of its own. Ecore with the GLib bridge, a dbus-glib
// system-bus connection that queues for the daemon's name and exports one object, Ecore_X on
// DISPLAY, and the given SQLite databases open in WAL mode with every table read once.
//
//   idle_floor [--sqlite-defaults] DB...    runs until killed; prints "ready" once settled
//
// SQLite's page cache is set up as the daemon sets it up, unless --sqlite-defaults.
#include <Ecore.h>
#include <Ecore_X.h>
#include <dbus/dbus-glib.h>
#include <glib-object.h>
#include <sqlite3.h>
#include <stdio.h>
#include <string.h>

#include <string>
#include <vector>

#include "platform/main_loop_glib.h"

namespace {

struct FloorObject {
  GObject parent;
};
struct FloorObjectClass {
  GObjectClass parent;
};
G_DEFINE_TYPE(FloorObject, floor_object, G_TYPE_OBJECT)
void floor_object_init(FloorObject*) {}
void floor_object_class_init(FloorObjectClass*) {}

int CountRows(void* counted, int, char**, char**) {
  ++*static_cast<int*>(counted);
  return 0;
}

int Names(void* names, int columns, char** values, char**) {
  if (columns > 0 && values[0] != nullptr)
    static_cast<std::vector<std::string>*>(names)->push_back(values[0]);
  return 0;
}

// Opens |path| as the daemon does (WAL, synchronous NORMAL) and reads each table once.
sqlite3* OpenAndRead(const char* path) {
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(path, &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr) != SQLITE_OK)
    return nullptr;
  std::vector<std::string> tables;
  int rows = 0;
  if (sqlite3_exec(db, "PRAGMA journal_mode=WAL; PRAGMA synchronous=NORMAL;", nullptr, nullptr,
                   nullptr) != SQLITE_OK ||
      sqlite3_exec(db, "SELECT name FROM sqlite_master WHERE type = 'table'", Names, &tables,
                   nullptr) != SQLITE_OK)
    return nullptr;
  for (const std::string& table : tables) {
    char sql[512];
    (void)snprintf(sql, sizeof(sql), "SELECT count(*) FROM \"%s\"", table.c_str());
    (void)sqlite3_exec(db, sql, CountRows, &rows, nullptr);
  }
  return db;
}

}  // namespace

int main(int argc, char** argv) {
  int first = 1;
  if (argc > 1 && strcmp(argv[1], "--sqlite-defaults") == 0) {
    first = 2;
  } else {
    (void)sqlite3_config(SQLITE_CONFIG_PAGECACHE, nullptr, 0, 0);
  }
  if (ecore_init() == 0 || logmgr_main_loop_glib_integrate() == 0) return 1;
  GError* error = nullptr;
  DBusGConnection* connection = dbus_g_bus_get(DBUS_BUS_SYSTEM, &error);
  if (connection == nullptr) return 1;
  DBusGProxy* proxy = dbus_g_proxy_new_for_name(connection, "org.freedesktop.DBus",
                                                "/org/freedesktop/DBus", "org.freedesktop.DBus");
  guint reply = 0;
  if (!dbus_g_proxy_call(proxy, "RequestName", &error, G_TYPE_STRING, "com.corvane.logmgr",
                         G_TYPE_UINT, 0, G_TYPE_INVALID, G_TYPE_UINT, &reply, G_TYPE_INVALID))
    return 1;
  dbus_g_connection_register_g_object(connection, "/floor",
                                      G_OBJECT(g_object_new(floor_object_get_type(), nullptr)));
  if (ecore_x_init(nullptr) == 0) return 1;
  std::vector<sqlite3*> dbs;
  for (int i = first; i < argc; ++i) {
    sqlite3* db = OpenAndRead(argv[i]);
    if (db == nullptr) return 1;
    dbs.push_back(db);
  }
  printf("ready\n");
  fflush(stdout);
  ecore_main_loop_begin();
  return 0;
}
