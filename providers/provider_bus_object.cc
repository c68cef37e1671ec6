// The bus objects of the two shared tables. Both GObject types share one set of handlers; the
// object's type picks its row in the table of differences below.
#include "providers/provider_bus_object.h"

#include <dbus/dbus-glib-lowlevel.h>
#include <dbus/dbus-glib.h>
#include <dbus/dbus.h>
#include <glib-object.h>
#include <stdio.h>
#include <string.h>

#include <string>

#include "providers/sender_uid_cache.h"
#include "providers/shared_table_service.h"

namespace {

gboolean logmgr_provider_bus_insert(GObject* self, GHashTable* rowData, gint* lastRowId,
                                    GError** error);
gboolean logmgr_provider_bus_update(GObject* self, GHashTable* rowData, const char* where,
                                    gint* count, GError** error);
gboolean logmgr_provider_bus_select(GObject* self, const char* columns, const char* where,
                                    const char* order, guint shmId, GError** error);
gboolean logmgr_provider_bus_delete(GObject* self, const char* where, gint* count, GError** error);

}  // namespace

// Generated method tables; both name the handlers above.
#include "report_app_status_survey_glue.h"
#include "use_app_feature_survey_glue.h"

namespace {

using namespace _CorvaneLogManager;

constexpr char kImproperValues[] = "Improper Values Provided";
constexpr char kInsertFailed[] = "Insert API Failed";
constexpr char kApiFailed[] = "API Failed";
constexpr char kDeleteFailed[] = "Delete API Failed";
constexpr gint kErrorCode = 1;
// Result of every handler when the table's provider is gone: non-zero, so the binding reports
// success with empty outputs. Deliberate.
constexpr gboolean kProviderMissing = -1;
// A select that ran nothing answers this, without an error, as the binding reports it.
constexpr gboolean kSelectFailed = -1;

// The key path callers historically derived their segment key from; kept beside each object,
// never read by the daemon.
const std::string kUseAppFeatureShmPath = "/home/developer/.shm_log_mgr";
const std::string kReportAppStatusShmPath = "/home/developer/.shm_log_mgr";

// What the request rules (SharedTableService) leave to the bus: names, paths and error texts.
struct BusTable {
  const char* tableName;  // also the provider's registry key
  const char* typeName;
  const char* objectPath;
  const char* errorDomain;
  const DBusGObjectInfo* info;
  const char* updateFailure;
  const std::string* shmPath;
};

const BusTable kBusTables[] = {
    {"use_app_feature_survey", "LogProviderInterfaceUseAppFeatureSurvey",
     "/com/corvane/logmgr/log/provider/use_app_feature_survey", "g-logmgr-useappfeature-error",
     &dbus_glib_use_app_feature_survey_object_info, "Update API Failed", &kUseAppFeatureShmPath},
    {"report_app_status_survey", "LogProviderInterfaceReportAppStatusSurvey",
     "/com/corvane/logmgr/log/provider/report_app_status_survey", "g-logmgr-reportappstatus-error",
     &dbus_glib_report_app_status_survey_object_info, kImproperValues, &kReportAppStatusShmPath},
};
constexpr size_t kTableCount = sizeof(kBusTables) / sizeof(kBusTables[0]);

gsize gTypeIds[kTableCount];
GObjectClass* gParentClass[kTableCount];

// The sender of the method call being dispatched: a filter sees every message before the
// object handlers do, and Select needs to know whose segment it is about to write.
DBusGConnection* gBus = nullptr;
char gCallerName[256];

size_t IndexOfType(GType type) {
  for (size_t i = 0; i < kTableCount; ++i)
    if (gTypeIds[i] != 0 && static_cast<GType>(gTypeIds[i]) == type) return i;
  return kTableCount;
}

const BusTable* TableOf(GObject* object) {
  size_t index = IndexOfType(G_OBJECT_TYPE(object));
  return index < kTableCount ? &kBusTables[index] : nullptr;
}

GObjectClass* ParentOf(GObject* object) {
  size_t index = IndexOfType(G_OBJECT_TYPE(object));
  return index < kTableCount ? gParentClass[index] : nullptr;
}

DBusHandlerResult RememberCaller(DBusConnection*, DBusMessage* message, void*) {
  if (dbus_message_get_type(message) == DBUS_MESSAGE_TYPE_METHOD_CALL) {
    const char* sender = dbus_message_get_sender(message);
    (void)snprintf(gCallerName, sizeof(gCallerName), "%s", sender != nullptr ? sender : "");
  }
  return DBUS_HANDLER_RESULT_NOT_YET_HANDLED;
}

// Enough for every regular caller at once; a flood of one-shot callers only costs lookups.
constexpr size_t kKnownCallers = 64;

bool BusUidOf(void* connection, const char* uniqueName, uid_t* uid) {
  DBusError error;
  dbus_error_init(&error);
  unsigned long user =
      dbus_bus_get_unix_user(static_cast<DBusConnection*>(connection), uniqueName, &error);
  if (dbus_error_is_set(&error)) {
    dbus_error_free(&error);
    return false;
  }
  if (user == static_cast<unsigned long>(-1)) return false;
  *uid = static_cast<uid_t>(user);
  return true;
}

// The calling user, as the bus daemon knows the sender; asked once per unique name, which the
// bus never hands to another connection. false when it cannot tell.
bool CallerUid(uid_t* uid) {
  static SenderUidCache* known = new SenderUidCache(kKnownCallers);  // for the process's life
  if (gBus == nullptr || gCallerName[0] == '\0') return false;
  return known->UidOf(gCallerName, BusUidOf, dbus_g_connection_get_connection(gBus), uid);
}

void Constructed(GObject* object) {
  GObjectClass* parent = ParentOf(object);
  if (parent != nullptr && parent->constructed != nullptr) parent->constructed(object);
  const BusTable* table = TableOf(object);
  if (table == nullptr) return;
  GError* error = nullptr;
  DBusGConnection* bus = dbus_g_bus_get(DBUS_BUS_SYSTEM, &error);
  if (error != nullptr) g_error_free(error);
  dbus_g_object_type_install_info(G_OBJECT_TYPE(object), table->info);
  // Without a bus there is nothing to register on; the object still exists for its provider.
  if (bus == nullptr) return;
  if (gBus != bus) {
    gBus = bus;
    (void)dbus_connection_add_filter(dbus_g_connection_get_connection(bus), RememberCaller, nullptr,
                                     nullptr);
  }
  // A retried start builds its providers again while the first objects still hold the paths;
  // they keep serving (handlers find the table through the registry), and registering twice
  // would abort the process.
  if (dbus_g_connection_lookup_g_object(bus, table->objectPath) != nullptr) return;
  dbus_g_connection_register_g_object(bus, table->objectPath, object);
}

void Dispose(GObject* object) {
  GObjectClass* parent = ParentOf(object);
  if (parent != nullptr) parent->dispose(object);
}

void Finalize(GObject* object) {
  GObjectClass* parent = ParentOf(object);
  if (parent != nullptr) parent->finalize(object);
}

void ClassInit(gpointer klass, gpointer classData) {
  size_t index = static_cast<const BusTable*>(classData) - kBusTables;
  gParentClass[index] = G_OBJECT_CLASS(g_type_class_peek_parent(klass));
  GObjectClass* objectClass = G_OBJECT_CLASS(klass);
  objectClass->constructed = Constructed;
  objectClass->dispose = Dispose;
  objectClass->finalize = Finalize;
}

void InstanceInit(GTypeInstance*, gpointer) {}

GType TypeOf(size_t index) {
  if (g_once_init_enter(&gTypeIds[index])) {
    GTypeInfo info = {};
    info.class_size = sizeof(GObjectClass);
    info.class_init = ClassInit;
    info.class_data = &kBusTables[index];
    info.instance_size = sizeof(GObject);
    info.instance_init = InstanceInit;
    GType type = g_type_register_static(G_TYPE_OBJECT, kBusTables[index].typeName, &info,
                                        static_cast<GTypeFlags>(0));
    g_once_init_leave(&gTypeIds[index], type);
  }
  return static_cast<GType>(gTypeIds[index]);
}

gboolean Fail(const BusTable* table, GError** error, const char* message) {
  g_set_error_literal(error, g_quark_from_static_string(table->errorDomain), kErrorCode, message);
  return FALSE;
}

// The bus answer to a result: success, or the error each failure gets from this table.
gboolean Answer(const BusTable* table, SharedTableService::Result result, GError** error) {
  switch (result) {
    case SharedTableService::Result::kOk:
      return TRUE;
    case SharedTableService::Result::kProviderMissing:
      return kProviderMissing;
    case SharedTableService::Result::kImproperValues:
      return Fail(table, error, kImproperValues);
    case SharedTableService::Result::kInsertFailed:
      return Fail(table, error, kInsertFailed);
    case SharedTableService::Result::kUpdateFailed:
      return Fail(table, error, table->updateFailure);
    case SharedTableService::Result::kDeleteFailed:
      return Fail(table, error, kDeleteFailed);
    case SharedTableService::Result::kApiFailed:
      return Fail(table, error, kApiFailed);
    case SharedTableService::Result::kSelectFailed:
      // A failed select answers -1 without an error, as the binding reports it.
      return kSelectFailed;
    case SharedTableService::Result::kNotWritten:
      return FALSE;
  }
  return FALSE;
}

const SharedTableService* ServiceOf(GObject* object, const BusTable** table) {
  *table = TableOf(object);
  return *table == nullptr ? nullptr : SharedTableService::ForTable((*table)->tableName);
}

// row_data in the order the hash table hands it out.
SharedTableService::RowData Unpack(GHashTable* rowData) {
  SharedTableService::RowData entries;
  if (rowData == nullptr) return entries;
  GHashTableIter iter;
  gpointer key = nullptr;
  gpointer value = nullptr;
  g_hash_table_iter_init(&iter, rowData);
  while (g_hash_table_iter_next(&iter, &key, &value)) {
    // a{ss} never carries a null; were one there, the entry names no column and is refused.
    if (key == nullptr || value == nullptr) {
      entries.emplace_back();
      continue;
    }
    entries.emplace_back(static_cast<const char*>(key), static_cast<const char*>(value));
  }
  return entries;
}

gboolean logmgr_provider_bus_insert(GObject* self, GHashTable* rowData, gint* lastRowId,
                                    GError** error) {
  const BusTable* table = nullptr;
  const SharedTableService* service = ServiceOf(self, &table);
  if (service == nullptr) return FALSE;
  return Answer(table, service->Insert(Unpack(rowData), lastRowId), error);
}

gboolean logmgr_provider_bus_update(GObject* self, GHashTable* rowData, const char* where,
                                    gint* count, GError** error) {
  const BusTable* table = nullptr;
  const SharedTableService* service = ServiceOf(self, &table);
  if (service == nullptr) return FALSE;
  return Answer(table, service->Update(Unpack(rowData), where, count), error);
}

gboolean logmgr_provider_bus_select(GObject* self, const char* columns, const char*, const char*,
                                    guint shmId, GError** error) {
  const BusTable* table = nullptr;
  const SharedTableService* service = ServiceOf(self, &table);
  if (service == nullptr) return FALSE;
  // where and order are accepted and ignored (see SharedTableService::Select).
  uid_t caller = 0;
  bool known = columns != nullptr && CallerUid(&caller);
  return Answer(table, service->Select(columns, static_cast<int>(shmId), known, caller), error);
}

gboolean logmgr_provider_bus_delete(GObject* self, const char* where, gint* count, GError** error) {
  const BusTable* table = nullptr;
  const SharedTableService* service = ServiceOf(self, &table);
  if (service == nullptr) return FALSE;
  return Answer(table, service->Delete(where, count), error);
}

}  // namespace

namespace _CorvaneLogManager {

void* CreateProviderBusObject(const char* tableName) {
  if (tableName == nullptr) return nullptr;
  for (size_t i = 0; i < kTableCount; ++i) {
    if (strcmp(kBusTables[i].tableName, tableName) == 0) return g_object_new(TypeOf(i), nullptr);
  }
  return nullptr;
}

void ReleaseProviderBusObject(void* object) {
  if (object != nullptr) g_object_unref(object);
}

}  // namespace _CorvaneLogManager
