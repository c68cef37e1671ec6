#include "app_db.h"

#include <sqlite3.h>

#include "fixed_path.h"

namespace logmgr_host {

namespace {

const char kAppDb[] = "/opt/dbspace/.pkgmgr_parser.db";

const char* Text(sqlite3_stmt* stmt, int col) {
  const unsigned char* text = sqlite3_column_text(stmt, col);
  return text != nullptr ? reinterpret_cast<const char*>(text) : "";
}

}  // namespace

int AppDbFind(AppColumn column, const char* value, std::vector<AppRecord>* out) {
  if (value == nullptr || out == nullptr) return -1;
  char buf[4096];
  const char* path = logmgr_fixed_path(kAppDb, buf, sizeof(buf));
  sqlite3* db = nullptr;
  // Read-only and never created: a missing database is a failure, not an empty one.
  if (sqlite3_open_v2(path, &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
    sqlite3_close(db);
    return -1;
  }
  // The package tools may be writing at the same moment; wait briefly rather than fail.
  sqlite3_busy_timeout(db, 200);
  const char* sql = column == AppColumn::kAppId
                        ? "SELECT app_id, package, app_exec FROM package_app_info "
                          "WHERE app_id = ?1 ORDER BY rowid"
                        : "SELECT app_id, package, app_exec FROM package_app_info "
                          "WHERE app_exec = ?1 ORDER BY rowid";
  sqlite3_stmt* stmt = nullptr;
  int result = -1;
  if (sqlite3_prepare_v2(db, sql, -1, &stmt, nullptr) == SQLITE_OK &&
      sqlite3_bind_text(stmt, 1, value, -1, SQLITE_STATIC) == SQLITE_OK) {
    int rc;
    while ((rc = sqlite3_step(stmt)) == SQLITE_ROW)
      out->push_back(AppRecord{Text(stmt, 0), Text(stmt, 1), Text(stmt, 2)});
    result = rc == SQLITE_DONE ? 0 : -1;
  }
  sqlite3_finalize(stmt);
  sqlite3_close(db);
  return result;
}

}  // namespace logmgr_host
