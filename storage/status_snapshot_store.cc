#include "storage/status_snapshot_store.h"

#include <limits.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <new>

#include "include/db_connection.h"
#include "include/sql_literal.h"
#include "platform/fixed_path.h"

namespace _CorvaneLogManager {

namespace {

const char* const kDbPath = "/opt/usr/dbspace/.StatusMonitor.db";
const char* const kTable = "survey_status_monitor";
const char* const kCreateSql =
    "CREATE TABLE IF NOT EXISTS survey_status_monitor (feature TEXT NOT NULL UNIQUE,extra "
    "TEXT,timestamp INTEGER);";

StatusSnapshotStore* g_store = nullptr;

}  // namespace

StatusSnapshotStore* StatusSnapshotStore::GetInstance() {
  if (g_store != nullptr) return g_store;
  StatusSnapshotStore* store = new (std::nothrow) StatusSnapshotStore();
  if (store == nullptr) return nullptr;
  // Registered before opening: a failed open still leaves this instance for later callers,
  // who tolerate its failing operations. Deliberate.
  g_store = store;
  store->connection.reset(new (std::nothrow) DbConnection());
  if (store->connection == nullptr) return nullptr;
  char buf[PATH_MAX];
  if (store->connection->Open(logmgr_fixed_path(kDbPath, buf, sizeof(buf))) != 0) return nullptr;
  DbConnection::SetupScope setup(store->connection.get());
  if (store->connection->Exec(kCreateSql) != 0) return nullptr;
  return store;
}

void StatusSnapshotStore::DestroyInstance() {
  delete g_store;
  g_store = nullptr;
}

StatusSnapshotStore::~StatusSnapshotStore() {
  if (connection != nullptr) (void)connection->Close();
}

int StatusSnapshotStore::Put(const char* feature, const char* extra, int64_t timestamp) {
  if (feature == nullptr || feature[0] == '\0' || connection == nullptr) return -1;
  // Stored verbatim: an extra may come from outside the process (a device's name or class).
  char featureLiteral[256];
  char extraLiteral[512];
  if (QuoteLiteral(featureLiteral, sizeof(featureLiteral), feature) != 0 ||
      QuoteLiteral(extraLiteral, sizeof(extraLiteral), extra != nullptr ? extra : "") != 0)
    return -1;
  char sql[1024];
  (void)snprintf(sql, sizeof(sql),
                 "INSERT OR REPLACE INTO survey_status_monitor VALUES(%s,%s,%lld);", featureLiteral,
                 extraLiteral, static_cast<long long>(timestamp));
  return connection->Exec(sql) == 0 ? 0 : -1;
}

int StatusSnapshotStore::Get(const char* feature, std::string* extraOut, int64_t* timestampOut) {
  if (feature == nullptr || feature[0] == '\0' || connection == nullptr) return -1;
  char featureLiteral[256];
  if (QuoteLiteral(featureLiteral, sizeof(featureLiteral), feature) != 0) return -1;
  char sql[1024];
  (void)snprintf(sql, sizeof(sql),
                 "SELECT extra,timestamp FROM survey_status_monitor WHERE feature = %s;",
                 featureLiteral);
  QueryRows rows;
  if (connection->Select(sql, kTable, &rows.count, &rows.rows) != 0) return -1;
  if (rows.count <= 0) {
    *extraOut = "";
    *timestampOut = 0;
    return 0;
  }
  // The row reads "extra,timestamp,": no escaping, so an extra holding "," is cut there.
  const char* row = rows[0] != nullptr ? rows[0] : "";
  const char* comma = strchr(row, ',');
  if (comma == nullptr) {
    extraOut->assign(row);
    *timestampOut = 0;
  } else {
    extraOut->assign(row, comma - row);
    *timestampOut = strtoll(comma + 1, nullptr, 10);
  }
  return 0;
}

int64_t StatusSnapshotStore::LatestTimestamp() {
  if (connection == nullptr) return 0;
  return connection->MaxTimestamp(kTable);
}

}  // namespace _CorvaneLogManager
