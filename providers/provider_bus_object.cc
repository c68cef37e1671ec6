// The bus objects of the two shared tables. Both GObject types share one set of handlers; the
// object's type picks its row in the table of differences below.
#include "providers/provider_bus_object.h"

#include <dbus/dbus-glib-lowlevel.h>
#include <dbus/dbus-glib.h>
#include <dbus/dbus.h>
#include <glib-object.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <string>

#include "include/base_log_provider.h"
#include "include/db_connection.h"
#include "include/provider_registry.h"
#include "providers/provider_bus_guard.h"
#include "providers/sender_uid_cache.h"
#include "storage/db_manager.h"

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
constexpr gint kErrorCode = 1;
// Result of every handler when the table's provider is gone: non-zero, so the binding reports
// success with empty outputs. Deliberate.
constexpr gboolean kProviderMissing = -1;

// The key path callers historically derived their segment key from; kept beside each object,
// never read by the daemon.
const std::string kUseAppFeatureShmPath = "/home/developer/.shm_log_mgr";
const std::string kReportAppStatusShmPath = "/home/developer/.shm_log_mgr";

enum class InsertMode { kPlain, kUpsertOnAppFeature };

struct BusTable {
  const char* tableName;  // also the provider's registry key
  const char* typeName;
  const char* objectPath;
  const char* errorDomain;
  const DBusGObjectInfo* info;
  InsertMode insert;
  const char* updateFailure;
  bool deleteNeedsWhere;      // an empty where is refused with kImproperValues
  bool deleteFailureIsError;  // otherwise a failed delete succeeds with count 0
  const std::string* shmPath;
};

const BusTable kBusTables[] = {
    {"use_app_feature_survey", "LogProviderInterfaceUseAppFeatureSurvey",
     "/com/corvane/logmgr/log/provider/use_app_feature_survey", "g-logmgr-useappfeature-error",
     &dbus_glib_use_app_feature_survey_object_info, InsertMode::kPlain, "Update API Failed", true,
     true, &kUseAppFeatureShmPath},
    {"report_app_status_survey", "LogProviderInterfaceReportAppStatusSurvey",
     "/com/corvane/logmgr/log/provider/report_app_status_survey", "g-logmgr-reportappstatus-error",
     &dbus_glib_report_app_status_survey_object_info, InsertMode::kUpsertOnAppFeature,
     kImproperValues, false, false, &kReportAppStatusShmPath},
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

BaseLogProvider* LookupProvider(const BusTable* table) {
  ProviderRegistry* registry = ProviderRegistry::GetInstance();
  return registry == nullptr ? nullptr : registry->Lookup(table->tableName);
}

DbConnection* SurveyConnection() {
  DbManager* manager = DbManager::GetInstance();
  return manager == nullptr ? nullptr : manager->GetConnection();
}

// row_data as the provider's column and value lists; -1 when an entry is refused.
int BuildLists(BaseLogProvider* provider, GHashTable* rowData, BusRowLists* lists) {
  if (rowData == nullptr) return 0;
  GHashTableIter iter;
  gpointer key = nullptr;
  gpointer value = nullptr;
  g_hash_table_iter_init(&iter, rowData);
  while (g_hash_table_iter_next(&iter, &key, &value)) {
    if (AppendRowEntry(provider->Config().columns, static_cast<const char*>(key),
                       static_cast<const char*>(value), lists) != 0)
      return -1;
  }
  return 0;
}

bool HasKey(GHashTable* rowData, const char* key) {
  return rowData != nullptr && g_hash_table_lookup(rowData, key) != nullptr;
}

gboolean PlainInsert(const BusTable* table, BaseLogProvider* provider, const BusRowLists& lists,
                     gint* lastRowId, GError** error) {
  if (!provider->InsertFits(lists.columns.c_str(), lists.values.c_str()))
    return Fail(table, error, kImproperValues);
  DbConnection::BusRequestScope scope(SurveyConnection(), table->tableName);
  int32_t rowId = -1;
  if (!scope.Held() ||
      provider->InsertRow(lists.columns.c_str(), lists.values.c_str(), &rowId) == -1)
    return Fail(table, error, kInsertFailed);
  *lastRowId = rowId;
  return TRUE;
}

// One row per (app_id, feature): an existing row is updated, a missing one inserted.
gboolean UpsertInsert(const BusTable* table, BaseLogProvider* provider, GHashTable* rowData,
                      const BusRowLists& lists, gint* lastRowId, GError** error) {
  std::string condition =
      std::string("app_id='") + static_cast<const char*>(g_hash_table_lookup(rowData, "app_id")) +
      "' and feature='" + static_cast<const char*>(g_hash_table_lookup(rowData, "feature")) + "'";
  // The update's 200-byte lists and its comma split only matter when the pair exists.
  if (!provider->SelectFits("_id", condition.c_str()) ||
      !provider->InsertFits(lists.columns.c_str(), lists.values.c_str()))
    return Fail(table, error, kImproperValues);

  DbConnection::BusRequestScope scope(SurveyConnection(), table->tableName);
  if (!scope.Held()) return Fail(table, error, kApiFailed);
  QueryRows rows;
  if (provider->SelectRows("_id", condition.c_str(), nullptr, &rows.count, &rows.rows) == -1)
    return Fail(table, error, kApiFailed);
  if (rows.count == 1) {
    // The row text ends in a comma, which stops the conversion.
    long existingId = strtol(rows[0], nullptr, 10);
    *lastRowId = static_cast<gint>(existingId);
    if (lists.valueHasComma ||
        !provider->UpdateFits(lists.columns.c_str(), lists.values.c_str(), condition.c_str()))
      return Fail(table, error, kApiFailed);
    if (provider->UpdateRows(lists.columns.c_str(), lists.values.c_str(), condition.c_str()) == -1)
      return Fail(table, error, kApiFailed);
    return TRUE;
  }
  if (rows.count > 1) return TRUE;  // ambiguous pair: nothing is written, deliberately
  int32_t rowId = -1;
  if (provider->InsertRow(lists.columns.c_str(), lists.values.c_str(), &rowId) == -1)
    return Fail(table, error, kInsertFailed);
  *lastRowId = rowId;
  return TRUE;
}

gboolean logmgr_provider_bus_insert(GObject* self, GHashTable* rowData, gint* lastRowId,
                                    GError** error) {
  const BusTable* table = TableOf(self);
  if (table == nullptr) return FALSE;
  BaseLogProvider* provider = LookupProvider(table);
  if (provider == nullptr) return kProviderMissing;
  if (!HasKey(rowData, "app_id") || !HasKey(rowData, "feature"))
    return Fail(table, error, kImproperValues);
  BusRowLists lists;
  if (BuildLists(provider, rowData, &lists) != 0) return Fail(table, error, kImproperValues);
  if (table->insert == InsertMode::kUpsertOnAppFeature)
    return UpsertInsert(table, provider, rowData, lists, lastRowId, error);
  return PlainInsert(table, provider, lists, lastRowId, error);
}

gboolean logmgr_provider_bus_update(GObject* self, GHashTable* rowData, const char* where,
                                    gint* count, GError** error) {
  const BusTable* table = TableOf(self);
  if (table == nullptr) return FALSE;
  BaseLogProvider* provider = LookupProvider(table);
  if (provider == nullptr) return kProviderMissing;
  BusRowLists lists;
  if (BuildLists(provider, rowData, &lists) != 0) return Fail(table, error, table->updateFailure);
  // No where at all makes the provider refuse the update.
  const char* condition = where != nullptr && where[0] != '\0' ? where : nullptr;
  if (lists.valueHasComma ||
      !provider->UpdateFits(lists.columns.c_str(), lists.values.c_str(), condition))
    return Fail(table, error, table->updateFailure);
  DbConnection::BusRequestScope scope(SurveyConnection(), table->tableName);
  int32_t changed = 0;
  if (!scope.Held() ||
      provider->UpdateRows(lists.columns.c_str(), lists.values.c_str(), condition, &changed) == -1)
    return Fail(table, error, table->updateFailure);
  *count = changed;
  return TRUE;
}

gboolean logmgr_provider_bus_select(GObject* self, const char* columns, const char*, const char*,
                                    guint shmId, GError**) {
  const BusTable* table = TableOf(self);
  if (table == nullptr) return FALSE;
  BaseLogProvider* provider = LookupProvider(table);
  if (provider == nullptr) return kProviderMissing;
  // where and order are accepted and ignored: every row of the table is returned, deliberately.
  // A failed select answers -1 without an error, as the binding reports it.
  if (columns == nullptr || !provider->SelectFits(columns, nullptr)) return -1;
  uid_t caller = 0;
  bool known = CallerUid(&caller);
  QueryRows rows;
  {
    DbConnection::BusRequestScope scope(SurveyConnection(), table->tableName);
    if (!scope.Held()) return -1;
    // Rendering stops where the result stops fitting the segment; a segment that is not the
    // caller's takes nothing.
    scope.LimitResult(known ? SegmentRoom(static_cast<int>(shmId), caller) : 0);
    if (provider->SelectRows(columns, nullptr, nullptr, &rows.count, &rows.rows) != 0)
      return scope.ResultTooLarge() ? FALSE : -1;
  }
  // The segment gets a copy; the rows stay this handler's and go with it.
  bool written = known && WriteRowsToSegment(static_cast<int>(shmId), caller, rows) == 0;
  return written ? TRUE : FALSE;
}

gboolean logmgr_provider_bus_delete(GObject* self, const char* where, gint* count, GError** error) {
  const BusTable* table = TableOf(self);
  if (table == nullptr) return FALSE;
  BaseLogProvider* provider = LookupProvider(table);
  if (provider == nullptr) return kProviderMissing;
  if (table->deleteNeedsWhere && (where == nullptr || where[0] == '\0'))
    return Fail(table, error, kImproperValues);
  int32_t deleted = 0;
  int result = -1;
  if (where != nullptr && provider->DeleteFits(where)) {
    DbConnection::BusRequestScope scope(SurveyConnection(), table->tableName);
    if (scope.Held()) result = provider->DeleteRows(where, &deleted);
  }
  if (result == -1) {
    if (table->deleteFailureIsError) return Fail(table, error, "Delete API Failed");
    deleted = 0;
  }
  *count = deleted;
  return TRUE;
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
