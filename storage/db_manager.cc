// Seam: filled in by the storage layer.
#include "storage/db_manager.h"

#include <new>

namespace _CorvaneLogManager {

namespace {
DbManager* g_dbManager = nullptr;
UploadDbManager* g_uploadDbManager = nullptr;
}  // namespace

DbManager* DbManager::GetInstance() {
  if (g_dbManager == nullptr) g_dbManager = new (std::nothrow) DbManager();
  return g_dbManager;
}

void DbManager::CloseInstance() {
  delete g_dbManager;
  g_dbManager = nullptr;
}

int DbManager::Init() { return 0; }
DbManager::~DbManager() {}
void DbManager::AddListener(IDbResponseListener* l) { listeners.push_back(l); }
void DbManager::RemoveListener(IDbResponseListener*) {}
int DbManager::NotifyInitialize() { return 0; }
int DbManager::NotifyDeleteExpired() { return 0; }

UploadDbManager* UploadDbManager::GetInstance() {
  if (g_uploadDbManager == nullptr) g_uploadDbManager = new (std::nothrow) UploadDbManager();
  return g_uploadDbManager;
}

void UploadDbManager::CloseInstance() {
  delete g_uploadDbManager;
  g_uploadDbManager = nullptr;
}

int UploadDbManager::Init() { return 0; }
UploadDbManager::~UploadDbManager() {}
void UploadDbManager::AddListener(IDbResponseListener* l) { listeners.push_back(l); }
void UploadDbManager::RemoveListener(IDbResponseListener*) {}
int UploadDbManager::NotifyInitialize() { return 0; }

}  // namespace _CorvaneLogManager
