#include "storage/db_manager.h"

#include <limits.h>

#include <algorithm>
#include <new>

#include "include/db_connection.h"
#include "platform/fixed_path.h"
#include "storage/db_response_listener.h"

namespace _CorvaneLogManager {

namespace {

const char* const kSurveyDbPath = "/opt/usr/dbspace/.SurveyLog.db";
const char* const kUploadDbPath = "/opt/usr/dbspace/.ServerUploaderDB.db";

DbManager* g_dbManager = nullptr;
UploadDbManager* g_uploadDbManager = nullptr;

// The paths stay as on the device; the host maps them beneath its sysroot.
int OpenFixed(DbConnection* connection, const char* path) {
  char buf[PATH_MAX];
  return connection->Open(logmgr_fixed_path(path, buf, sizeof(buf)));
}

void InitializeAll(const std::vector<IDbResponseListener*>& listeners) {
  for (IDbResponseListener* listener : listeners) (void)listener->Initialize();
}

}  // namespace

DatabaseOwner::DatabaseOwner() = default;

DatabaseOwner::~DatabaseOwner() = default;

void DatabaseOwner::AddListener(IDbResponseListener* listener) { listeners.push_back(listener); }

void DatabaseOwner::RemoveListener(IDbResponseListener* listener) {
  auto it = std::find(listeners.begin(), listeners.end(), listener);
  if (it != listeners.end()) listeners.erase(it);
}

int DatabaseOwner::NotifyInitialize() {
  InitializeAll(listeners);
  return 0;
}

DbManager* DbManager::GetInstance() {
  if (g_dbManager != nullptr) return g_dbManager;
  DbManager* manager = new (std::nothrow) DbManager();
  if (manager == nullptr) return nullptr;
  manager->connection.reset(new (std::nothrow) DbConnection());
  // The manager is abandoned, not freed, on this out-of-memory path (deliberate).
  if (manager->connection == nullptr) return nullptr;
  g_dbManager = manager;
  return manager;
}

void DbManager::CloseInstance() {
  delete g_dbManager;
  g_dbManager = nullptr;
}

DbManager::~DbManager() {
  listeners.clear();
  if (connection != nullptr) (void)connection->Close();
}

int DbManager::Init() {
  // The connection exists whenever GetInstance handed out the manager.
  if (OpenFixed(connection.get(), kSurveyDbPath) != 0) return -1;
  InitializeAll(listeners);
  return 0;
}

int DbManager::NotifyDeleteExpired() {
  for (IDbResponseListener* listener : listeners) (void)listener->DeleteExpiredRows();
  return 0;
}

UploadDbManager* UploadDbManager::GetInstance() {
  if (g_uploadDbManager != nullptr) return g_uploadDbManager;
  UploadDbManager* manager = new (std::nothrow) UploadDbManager();
  if (manager == nullptr) return nullptr;
  manager->connection.reset(new (std::nothrow) DbConnection());
  if (manager->connection == nullptr) return nullptr;  // abandoned, as above
  g_uploadDbManager = manager;
  return manager;
}

void UploadDbManager::CloseInstance() {
  delete g_uploadDbManager;
  g_uploadDbManager = nullptr;
}

UploadDbManager::~UploadDbManager() {
  listeners.clear();
  (void)CloseConnection();
}

int UploadDbManager::CloseConnection() {
  if (connection == nullptr) return -1;
  return connection->Close();
}

int UploadDbManager::Init() {
  if (connection == nullptr) return -1;
  if (OpenFixed(connection.get(), kUploadDbPath) != 0) return -1;
  InitializeAll(listeners);
  return 0;
}

}  // namespace _CorvaneLogManager
