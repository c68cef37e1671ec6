// Fixture of the provider tests: a temp sysroot with the dbspace directory and a localtime
// link, the real registry and managers, and a trace of the statements each connection runs.
#ifndef LOGMGR_TESTS_PROVIDERS_PROVIDER_TEST_ENV_H_
#define LOGMGR_TESTS_PROVIDERS_PROVIDER_TEST_ENV_H_

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <unistd.h>

#include <memory>
#include <string>
#include <vector>

#include "base/clock.h"
#include "include/base_log_provider.h"
#include "include/db_connection.h"
#include "include/provider_registry.h"
#include "storage/db_manager.h"
#include "tests/temp_sysroot.h"

namespace _CorvaneLogManager {

// True if |text| is |pattern| with each '#' standing for a run of digits, collected in
// |numbers| (std::regex warns in the sanitizer build).
inline bool MatchesWithNumbers(const std::string& text, const std::string& pattern,
                               std::vector<long long>* numbers = nullptr) {
  size_t t = 0;
  for (char p : pattern) {
    size_t start = t;
    if (p != '#') {
      if (t >= text.size() || text[t++] != p) return false;
      continue;
    }
    while (t < text.size() && isdigit(static_cast<unsigned char>(text[t]))) ++t;
    if (t == start) return false;
    if (numbers != nullptr) numbers->push_back(std::stoll(text.substr(start, t - start)));
  }
  return t == text.size();
}

// Statements as SQLite starts them, bound values written in as literals (a kept statement reads
// as the text it stands for), minus the test's own queries.
struct StatementTrace {
  void Attach(DbConnection* conn) {
    sqlite3_trace_v2(conn->Handle(), SQLITE_TRACE_STMT, &StatementTrace::OnStatement, this);
  }
  std::vector<std::string> Take() { return std::move(statements); }
  static int OnStatement(unsigned, void* self, void* stmt, void*) {
    StatementTrace* trace = static_cast<StatementTrace*>(self);
    if (trace->paused) return 0;
    char* text = sqlite3_expanded_sql(static_cast<sqlite3_stmt*>(stmt));
    trace->statements.push_back(text != nullptr ? text : "");
    sqlite3_free(text);
    return 0;
  }
  std::vector<std::string> statements;
  bool paused = false;
};

class ProviderTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root.reset(new TempSysroot("providers", {"/opt/usr/dbspace"}));
    sysroot = root->path();
    SetLocaltimeLink("/usr/share/zoneinfo/Europe/Berlin");
  }
  void TearDown() override {
    ProviderRegistry::Release();
    DbManager::CloseInstance();
    UploadDbManager::CloseInstance();
    root.reset();
  }
  // Empty target: no link at all.
  void SetLocaltimeLink(const std::string& target) { EXPECT_TRUE(root->SetLocaltime(target)); }
  // The daemon's start order: registry first, then both files opened.
  void StartProviders() {
    ASSERT_NE(DbManager::GetInstance(), nullptr);
    ASSERT_NE(UploadDbManager::GetInstance(), nullptr);
    ASSERT_EQ(ProviderRegistry::GetInstance()->CreateProviders(), 0);
    ASSERT_EQ(DbManager::GetInstance()->Init(), 0);
    ASSERT_EQ(UploadDbManager::GetInstance()->Init(), 0);
    survey = DbManager::GetInstance()->GetConnection();
    upload = UploadDbManager::GetInstance()->GetConnection();
    surveyTrace.Attach(survey);
    uploadTrace.Attach(upload);
  }
  BaseLogProvider* Provider(const char* name) {
    return ProviderRegistry::GetInstance()->Lookup(name);
  }
  // First column of the first row as text ("<none>" without a row, "<null>" for NULL).
  std::string Query(DbConnection* conn, const std::string& sql) {
    surveyTrace.paused = uploadTrace.paused = true;
    sqlite3_stmt* stmt = nullptr;
    std::string value = "<none>";
    if (sqlite3_prepare_v2(conn->Handle(), sql.c_str(), -1, &stmt, nullptr) == SQLITE_OK &&
        sqlite3_step(stmt) == SQLITE_ROW) {
      const unsigned char* text = sqlite3_column_text(stmt, 0);
      value = text == nullptr ? "<null>" : reinterpret_cast<const char*>(text);
    }
    sqlite3_finalize(stmt);
    surveyTrace.paused = uploadTrace.paused = false;
    return value;
  }
  long long Number(DbConnection* conn, const std::string& sql) {
    return std::stoll(Query(conn, sql));
  }
  // Adds |rows| copies of a row in one transaction, untraced.
  void Fill(DbConnection* conn, const std::string& table, const std::string& columns,
            const std::string& values, int rows) {
    surveyTrace.paused = uploadTrace.paused = true;
    std::string sql = "INSERT INTO " + table + "(" + columns + ") VALUES (" + values + ");";
    ASSERT_EQ(conn->Exec("BEGIN;"), 0);
    for (int i = 0; i < rows; ++i) ASSERT_EQ(conn->Exec(sql.c_str()), 0);
    ASSERT_EQ(conn->Exec("COMMIT;"), 0);
    surveyTrace.paused = uploadTrace.paused = false;
  }

  std::unique_ptr<TempSysroot> root;
  std::string sysroot;
  DbConnection* survey = nullptr;
  DbConnection* upload = nullptr;
  StatementTrace surveyTrace;
  StatementTrace uploadTrace;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_TESTS_PROVIDERS_PROVIDER_TEST_ENV_H_
