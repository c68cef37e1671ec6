// Fixture of the provider tests: a temp sysroot with the dbspace directory and a localtime
// link, the real registry and managers, and a trace of the statements each connection runs.
#ifndef LOGMGR_TESTS_PROVIDERS_PROVIDER_TEST_ENV_H_
#define LOGMGR_TESTS_PROVIDERS_PROVIDER_TEST_ENV_H_

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "base_log_provider.h"
#include "db_connection.h"
#include "provider_registry.h"
#include "storage/db_manager.h"

namespace _CorvaneLogManager {

inline long long TestNowMs() {
  struct timeval tv;
  gettimeofday(&tv, nullptr);
  return static_cast<long long>(tv.tv_sec) * 1000 + tv.tv_usec / 1000;
}

// True if |text| is |pattern| with each '#' standing for a run of digits, collected in
// |numbers| (a light stand-in for std::regex, which warns under the sanitizer build).
inline bool MatchesWithNumbers(const std::string& text, const std::string& pattern,
                               std::vector<long long>* numbers = nullptr) {
  size_t t = 0;
  for (char p : pattern) {
    if (p != '#') {
      if (t >= text.size() || text[t] != p) return false;
      ++t;
      continue;
    }
    size_t start = t;
    while (t < text.size() && text[t] >= '0' && text[t] <= '9') ++t;
    if (t == start) return false;
    if (numbers != nullptr) numbers->push_back(std::stoll(text.substr(start, t - start)));
  }
  return t == text.size();
}

class StatementTrace {
 public:
  void Attach(DbConnection* conn) {
    sqlite3_trace_v2(conn->Handle(), SQLITE_TRACE_STMT, &StatementTrace::OnStatement, this);
  }
  void Detach(DbConnection* conn) { sqlite3_trace_v2(conn->Handle(), 0, nullptr, nullptr); }
  std::vector<std::string> Take() {
    std::vector<std::string> out;
    out.swap(statements);
    return out;
  }

 private:
  static int OnStatement(unsigned, void* self, void*, void* text) {
    const char* sql = static_cast<const char*>(text);
    // Statements run by sqlite3_exec are reported once; trigger sub-statements start with "--".
    StatementTrace* trace = static_cast<StatementTrace*>(self);
    if (!trace->paused && sql != nullptr && strncmp(sql, "--", 2) != 0)
      trace->statements.push_back(sql);
    return 0;
  }
  std::vector<std::string> statements;

 public:
  bool paused = false;  // the test's own queries
};

class ProviderTest : public ::testing::Test {
 protected:
  static constexpr const char* kZone = "Europe/Berlin";

  void SetUp() override {
    char tmpl[] = "/tmp/logmgr-providers-XXXXXX";
    ASSERT_NE(mkdtemp(tmpl), nullptr);
    sysroot = tmpl;
    ASSERT_EQ(system(("mkdir -p " + sysroot + "/opt/usr/dbspace " + sysroot + "/opt/etc").c_str()),
              0);
    SetLocaltimeLink(std::string("/usr/share/zoneinfo/") + kZone);
    setenv("LOGMGR_SYSROOT", sysroot.c_str(), 1);
  }

  void TearDown() override {
    ProviderRegistry::Release();
    DbManager::CloseInstance();
    UploadDbManager::CloseInstance();
    unsetenv("LOGMGR_SYSROOT");
    (void)system(("rm -rf " + sysroot).c_str());
  }

  // Empty target: no link at all.
  void SetLocaltimeLink(const std::string& target) {
    std::string link = sysroot + "/opt/etc/localtime";
    unlink(link.c_str());
    if (!target.empty()) {
      ASSERT_EQ(symlink(target.c_str(), link.c_str()), 0);
    }
  }

  // The daemon's start order: registry first, then both files opened.
  void StartProviders() {
    ASSERT_NE(DbManager::GetInstance(), nullptr);
    ASSERT_NE(UploadDbManager::GetInstance(), nullptr);
    ASSERT_EQ(ProviderRegistry::GetInstance()->CreateProviders(), 0);
    ASSERT_EQ(DbManager::GetInstance()->Init(), 0);
    ASSERT_EQ(UploadDbManager::GetInstance()->Init(), 0);
    survey = DbManager::GetInstance()->GetConnection();
    upload = UploadDbManager::GetInstance()->GetConnection();
    // Speed only: the trimming tests write thousands of rows.
    ASSERT_EQ(survey->Exec("PRAGMA synchronous=OFF;"), 0);
    surveyTrace.Attach(survey);
    uploadTrace.Attach(upload);
  }

  BaseLogProvider* Provider(const char* name) {
    return ProviderRegistry::GetInstance()->Lookup(name);
  }

  // The test's own queries, kept out of the trace.
  long long Scalar(DbConnection* conn, const std::string& sql) {
    Untraced untraced(this);
    sqlite3_stmt* stmt = nullptr;
    long long value = -1;
    if (sqlite3_prepare_v2(conn->Handle(), sql.c_str(), -1, &stmt, nullptr) == SQLITE_OK &&
        sqlite3_step(stmt) == SQLITE_ROW)
      value = sqlite3_column_int64(stmt, 0);
    sqlite3_finalize(stmt);
    return value;
  }
  std::string Text(DbConnection* conn, const std::string& sql) {
    Untraced untraced(this);
    sqlite3_stmt* stmt = nullptr;
    std::string value = "<none>";
    if (sqlite3_prepare_v2(conn->Handle(), sql.c_str(), -1, &stmt, nullptr) == SQLITE_OK &&
        sqlite3_step(stmt) == SQLITE_ROW) {
      const unsigned char* text = sqlite3_column_text(stmt, 0);
      value = text == nullptr ? "<null>" : reinterpret_cast<const char*>(text);
    }
    sqlite3_finalize(stmt);
    return value;
  }
  // Fills |table| with |rows| rows directly (one transaction), untraced.
  void Fill(const std::string& table, const std::string& columns, const std::string& values,
            int rows) {
    surveyTrace.Detach(survey);
    ASSERT_EQ(survey->Exec("BEGIN;"), 0);
    std::string sql = "INSERT INTO " + table + "(" + columns + ") VALUES (" + values + ");";
    for (int i = 0; i < rows; ++i) ASSERT_EQ(survey->Exec(sql.c_str()), 0);
    ASSERT_EQ(survey->Exec("COMMIT;"), 0);
    surveyTrace.Attach(survey);
  }

  struct Untraced {
    explicit Untraced(ProviderTest* t) : test(t) {
      test->surveyTrace.paused = test->uploadTrace.paused = true;
    }
    ~Untraced() { test->surveyTrace.paused = test->uploadTrace.paused = false; }
    ProviderTest* test;
  };

  std::string sysroot;
  DbConnection* survey = nullptr;
  DbConnection* upload = nullptr;
  StatementTrace surveyTrace;
  StatementTrace uploadTrace;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_TESTS_PROVIDERS_PROVIDER_TEST_ENV_H_
