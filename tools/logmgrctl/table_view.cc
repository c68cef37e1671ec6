#include "tools/logmgrctl/table_view.h"

#include <sqlite3.h>
#include <stdio.h>
#include <string.h>

#include <string>

#include "platform/fixed_path.h"

namespace {

constexpr char kSurveyDb[] = "/opt/usr/dbspace/.SurveyLog.db";
constexpr char kUploadDb[] = "/opt/usr/dbspace/.ServerUploaderDB.db";

struct KnownTable {
  const char* name;
  const char* database;
};

const KnownTable kTables[] = {
    {"use_app_survey", kSurveyDb},           {"manage_app_survey", kSurveyDb},
    {"report_app_error_survey", kSurveyDb},  {"use_app_feature_survey", kSurveyDb},
    {"report_app_status_survey", kSurveyDb}, {"survey_log", kUploadDb},
};

const KnownTable* FindTable(const char* name) {
  for (const KnownTable& table : kTables)
    if (strcmp(table.name, name) == 0) return &table;
  return nullptr;
}

int PrintRows(sqlite3* db, const char* table, long limit) {
  std::string sql = std::string("SELECT * FROM (SELECT * FROM ") + table +
                    " ORDER BY _id DESC LIMIT " + std::to_string(limit) + ") ORDER BY _id;";
  sqlite3_stmt* stmt = nullptr;
  if (sqlite3_prepare_v2(db, sql.c_str(), -1, &stmt, nullptr) != SQLITE_OK) {
    fprintf(stderr, "logmgrctl: cannot read %s: %s\n", table, sqlite3_errmsg(db));
    return 3;
  }
  int columns = sqlite3_column_count(stmt);
  for (int c = 0; c < columns; ++c) printf("%s%s", c > 0 ? "\t" : "", sqlite3_column_name(stmt, c));
  printf("\n");
  int rc;
  while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
    for (int c = 0; c < columns; ++c) {
      const unsigned char* text = sqlite3_column_text(stmt, c);
      printf("%s%s", c > 0 ? "\t" : "",
             text != nullptr ? reinterpret_cast<const char*>(text) : "NULL");
    }
    printf("\n");
  }
  sqlite3_finalize(stmt);
  if (rc != SQLITE_DONE) {
    fprintf(stderr, "logmgrctl: cannot read %s: %s\n", table, sqlite3_errmsg(db));
    return 3;
  }
  return 0;
}

// Prints the reason a database could not be opened; null passes through.
sqlite3* OpenOrSay(const char* devicePath) {
  std::string problem;
  sqlite3* db = OpenReadOnly(devicePath, &problem);
  if (db == nullptr) fprintf(stderr, "logmgrctl: %s\n", problem.c_str());
  return db;
}

}  // namespace

sqlite3* OpenReadOnly(const char* devicePath, std::string* problem) {
  char buf[4096];
  const char* path = logmgr_fixed_path(devicePath, buf, sizeof(buf));
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(path, &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
    *problem = std::string("cannot open ") + path + ": " +
               (db != nullptr ? sqlite3_errmsg(db) : "out of memory");
    sqlite3_close(db);
    return nullptr;
  }
  sqlite3_busy_timeout(db, 2000);  // the daemon may be writing
  return db;
}

int ShowTable(const char* table, long limit) {
  const KnownTable* known = FindTable(table);
  if (known == nullptr) {
    fprintf(stderr, "logmgrctl: unknown table '%s' (see logmgrctl --help)\n", table);
    return 2;
  }
  sqlite3* db = OpenOrSay(known->database);
  if (db == nullptr) return 3;
  int result = PrintRows(db, known->name, limit);
  sqlite3_close(db);
  return result;
}

int ShowQueue(long limit) {
  sqlite3* db = OpenOrSay(kUploadDb);
  if (db == nullptr) return 3;
  sqlite3_stmt* stmt = nullptr;
  int result = 3;
  if (sqlite3_prepare_v2(db, "SELECT COUNT(*) FROM survey_log;", -1, &stmt, nullptr) == SQLITE_OK &&
      sqlite3_step(stmt) == SQLITE_ROW) {
    printf("survey_log: %lld queued record(s)\n",
           static_cast<long long>(sqlite3_column_int64(stmt, 0)));
    result = 0;
  } else {
    fprintf(stderr, "logmgrctl: cannot read survey_log: %s\n", sqlite3_errmsg(db));
  }
  sqlite3_finalize(stmt);
  if (result == 0) result = PrintRows(db, "survey_log", limit);
  sqlite3_close(db);
  return result;
}
