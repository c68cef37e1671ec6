// Reporting fixture: the provider fixture's database files, registry and managers, a fixed time
// zone, the files the record header reads and an injectable clock.
#ifndef LOGMGR_TESTS_REPORTING_REPORTING_TEST_ENV_H_
#define LOGMGR_TESTS_REPORTING_REPORTING_TEST_ENV_H_

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <time.h>

#include <fstream>
#include <string>
#include <vector>

#include "reporting/report_context.h"
#include "storage/pref_store.h"
#include "tests/providers/provider_test_env.h"

namespace _CorvaneLogManager {

inline int64_t g_testNowMs = 0;
inline int64_t TestClock() { return g_testNowMs; }
inline bool TestReportEnabled() { return true; }

class ReportingTest : public ProviderTest {
 protected:
  void SetUp() override {
    setenv("TZ", "Europe/Berlin", 1);
    tzset();
    // No telephony service: the operator codes stay unknown.
    setenv("DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nonexistent/bus", 1);
    ProviderTest::SetUp();
    WriteFile("/etc/os-release", "NAME=\"Test OS\"\nVERSION_ID=\"12\"\nBUILD_ID=W2.3-K9\n");
    WriteFile("/sys/class/dmi/id/product_name", "Gear-X1\n");
    StartProviders();
    ASSERT_EQ(prefs.Create(), 0);
  }
  void TearDown() override {
    (void)prefs.Close();
    ProviderTest::TearDown();
  }

  ReportContext Context() {
    ReportContext context;
    context.prefs = &prefs;
    context.providers = ProviderRegistry::GetInstance();
    context.survey = DbManager::GetInstance();
    context.queue = UploadDbManager::GetInstance();
    context.clock = TestClock;
    context.appId = &appId;
    context.reportEnabled = TestReportEnabled;
    return context;
  }

  void WriteFile(const std::string& fixedPath, const std::string& text) {
    ASSERT_TRUE(root->Write(fixedPath, text)) << fixedPath;
  }
  std::vector<std::string> OutboxLines() {
    std::vector<std::string> lines;
    std::ifstream in(sysroot + "/opt/usr/data/log-relay/outbox.jsonl");
    for (std::string line; std::getline(in, line);) lines.push_back(line);
    return lines;
  }
  // Local time of a calendar date in the fixed zone, in ms.
  static int64_t LocalMs(int year, int month, int day, int hour = 0, int minute = 0, int second = 0,
                         int ms = 0) {
    struct tm tm = {};
    tm.tm_year = year - 1900;
    tm.tm_mon = month - 1;
    tm.tm_mday = day;
    tm.tm_hour = hour;
    tm.tm_min = minute;
    tm.tm_sec = second;
    tm.tm_isdst = -1;
    return static_cast<int64_t>(mktime(&tm)) * 1000 + ms;
  }
  void Exec(DbConnection* conn, const std::string& sql) {
    char* error = nullptr;
    ASSERT_EQ(sqlite3_exec(conn->Handle(), sql.c_str(), nullptr, nullptr, &error), SQLITE_OK)
        << sql << ": " << (error ? error : "");
    sqlite3_free(error);
  }
  // Column 0 of every row, as text.
  std::vector<std::string> Column(DbConnection* conn, const std::string& sql) {
    std::vector<std::string> out;
    sqlite3_stmt* stmt = nullptr;
    EXPECT_EQ(sqlite3_prepare_v2(conn->Handle(), sql.c_str(), -1, &stmt, nullptr), SQLITE_OK)
        << sql;
    while (stmt != nullptr && sqlite3_step(stmt) == SQLITE_ROW) {
      const unsigned char* text = sqlite3_column_text(stmt, 0);
      out.push_back(text ? reinterpret_cast<const char*>(text) : "<null>");
    }
    sqlite3_finalize(stmt);
    return out;
  }

  PrefStore prefs;
  const std::string appId = "com.corvane.logmanager";
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_TESTS_REPORTING_REPORTING_TEST_ENV_H_
