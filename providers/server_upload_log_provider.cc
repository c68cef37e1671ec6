#include "providers/server_upload_log_provider.h"

#include <stdio.h>

#include "include/db_connection.h"
#include "providers/statement_buffer.h"
#include "storage/db_manager.h"

namespace _CorvaneLogManager {

namespace {

// The queue's table description; records never expire by age (see DeleteExpiredRows).
constexpr int32_t kRetentionDays = 3;
constexpr int32_t kCheckInterval = 500;
constexpr int32_t kMaxRows = 5000;

DbConnection* UploadConnection() {
  UploadDbManager* manager = UploadDbManager::GetInstance();
  return manager == nullptr ? nullptr : manager->GetConnection();
}

}  // namespace

ServerUploadLogProvider::ServerUploadLogProvider() {
  UploadDbManager* manager = UploadDbManager::GetInstance();
  if (manager == nullptr || manager->GetConnection() == nullptr) return;
  // The blanks after two commas are harmless: the list is split at comma and blank.
  (void)InitTableConfig("survey_log",
                        "_id,timestamp,svc_code,category_code,activity,log_type,app_version, "
                        "body, rly_result",
                        kRetentionDays, kCheckInterval, kMaxRows, 0);
}

int ServerUploadLogProvider::Initialize() {
  DbConnection* conn = UploadConnection();
  if (conn == nullptr) return 0;
  DbConnection::SetupScope setup(conn);  // the one schema change allowed, and only here
  return conn->Exec(GetCreateTableSql()) == 0 ? 0 : -1;
}

// Queued records never expire by age; only the uploader removes them.
int ServerUploadLogProvider::DeleteExpiredRows() { return 0; }

int ServerUploadLogProvider::InsertRow(const char* columns, const char* values, int32_t* rowId) {
  return InsertOn(UploadConnection(), columns, values, rowId, false);
}

// Deliberately unlike the survey tables: timestamp is left alone and both lists are split at
// blanks too.
int ServerUploadLogProvider::UpdateRows(const char* columns, const char* values, const char* where,
                                        int32_t* count) {
  return UpdateOn(UploadConnection(), columns, values, where, count, false, ", ");
}

int ServerUploadLogProvider::DeleteRows(const char* where, int32_t* count) {
  return DeleteOn(UploadConnection(), where, count);
}

const char* ServerUploadLogProvider::GetCreateTableSql() {
  return "CREATE TABLE IF NOT EXISTS survey_log(_id INTEGER PRIMARY KEY AUTOINCREMENT NOT NULL, "
         "timestamp INTEGER, svc_code TEXT, category_code TEXT, activity TEXT, log_type TEXT, "
         "app_version TEXT, body TEXT, rly_result INTEGER);";
}

const char* ServerUploadLogProvider::GetTableName() { return "server_upload"; }

int ServerUploadLogProvider::GetRowCount() {
  DbConnection* conn = UploadConnection();
  if (conn == nullptr) return -1;
  return conn->Count(config.tableName.c_str());
}

int ServerUploadLogProvider::DeleteOldestRows() { return DeleteOldestOn(UploadConnection()); }

int ServerUploadLogProvider::SelectLimitedRows(const char* columns, const char* where,
                                               const char* orderBy, uint32_t limit, int* rowCount,
                                               char*** rows) {
  DbConnection* conn = UploadConnection();
  if (conn == nullptr) return -1;
  char sql[kStatementSize];
  char piece[kStatementSize];
  snprintf(sql, sizeof(sql), "SELECT %s FROM %s", columns == nullptr ? "*" : columns,
           config.tableName.c_str());
  AppendClauseOrDie(sql, sizeof(sql), " WHERE %s", where);
  AppendClauseOrDie(sql, sizeof(sql), " ORDER BY %s", orderBy);
  if (limit != kNoLimit) {
    // No leading blank, on purpose: the uploader's ORDER BY text ends with one.
    snprintf(piece, sizeof(piece), "LIMIT %ld", static_cast<long>(limit));
    AppendOrDie(sql, sizeof(sql), piece);
  }
  AppendOrDie(sql, sizeof(sql), ";");
  return conn->Select(sql, config.tableName.c_str(), rowCount, rows);
}

}  // namespace _CorvaneLogManager
