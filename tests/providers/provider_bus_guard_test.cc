// The checks in front of the shared tables: they must agree byte for byte with the statements
// the providers build, confine SQL to the object's table, and never write a segment that is
// not the caller's or too small.
#include "providers/provider_bus_guard.h"

#include <sqlite3.h>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <unistd.h>

#include <gtest/gtest.h>
#include <stdlib.h>

#include "base_log_provider.h"
#include "db_connection.h"
#include "provider_registry.h"
#include "storage/db_manager.h"

namespace _CorvaneLogManager {
namespace {

const std::vector<std::string> kColumns = {"_id",    "timestamp", "time_zone", "app_id",
                                           "feature", "extra",    "value"};

TEST(ProviderBusGuardTest, RowEntriesAcceptOnlyWritableColumnsAndQuotelessValues) {
  struct Case {
    const char* key;
    const char* value;
    int result;
  } cases[] = {{"app_id", "a", 0},           {"_id", "4", 0},        {"extra", "x, y", 0},
               {"timestamp", "1", -1},       {"time_zone", "Z", -1}, {"bogus", "1", -1},
               {"app_id ", "a", -1},         {"extra", "it's", -1},  {"(SELECT 1)", "1", -1}};
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.key) + "=" + c.value);
    BusRowLists lists{"feature", "'F'"};
    EXPECT_EQ(AppendRowEntry(kColumns, c.key, c.value, &lists), c.result);
    if (c.result == 0) {
      EXPECT_EQ(lists.columns, std::string("feature,") + c.key);
      EXPECT_EQ(lists.values, std::string("'F','") + c.value + "'");
    } else {
      EXPECT_EQ(lists.columns, "feature");
      EXPECT_EQ(lists.values, "'F'");
    }
  }
}

// The real registry and survey database in a temp sysroot, with a trace of the statements.
class ProviderBusFitTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char tmpl[] = "/tmp/logmgr-busguard-XXXXXX";
    ASSERT_NE(mkdtemp(tmpl), nullptr);
    sysroot = tmpl;
    ASSERT_EQ(system(("mkdir -p " + sysroot + "/opt/usr/dbspace " + sysroot + "/opt/etc").c_str()),
              0);
    ASSERT_EQ(symlink("/usr/share/zoneinfo/Europe/Berlin", (sysroot + "/opt/etc/localtime").c_str()),
              0);
    setenv("LOGMGR_SYSROOT", sysroot.c_str(), 1);
    ASSERT_NE(DbManager::GetInstance(), nullptr);
    ASSERT_NE(UploadDbManager::GetInstance(), nullptr);
    ASSERT_EQ(ProviderRegistry::GetInstance()->CreateProviders(), 0);
    ASSERT_EQ(DbManager::GetInstance()->Init(), 0);
    survey = DbManager::GetInstance()->GetConnection()->Handle();
    sqlite3_trace_v2(survey, SQLITE_TRACE_STMT, &ProviderBusFitTest::OnStatement, this);
  }
  void TearDown() override {
    if (survey != nullptr) sqlite3_trace_v2(survey, 0, nullptr, nullptr);
    ProviderRegistry::Release();
    DbManager::CloseInstance();
    UploadDbManager::CloseInstance();
    unsetenv("LOGMGR_SYSROOT");
    (void)system(("rm -rf " + sysroot).c_str());
  }
  static int OnStatement(unsigned, void* self, void*, void* text) {
    static_cast<ProviderBusFitTest*>(self)->statements.push_back(static_cast<const char*>(text));
    return 0;
  }

  BaseLogProvider* Feature() {
    return ProviderRegistry::GetInstance()->Lookup("use_app_feature_survey");
  }
  // The last traced statement beginning with |verb| (an insert may be followed by a count).
  std::string LastStatement(const std::string& verb) {
    std::string last;
    for (const std::string& sql : statements)
      if (sql.compare(0, verb.size(), verb) == 0) last = sql;
    statements.clear();
    return last;
  }
  long long StoredExtraLength() {
    sqlite3_stmt* stmt = nullptr;
    long long length = -1;
    if (sqlite3_prepare_v2(survey, "SELECT length(extra) FROM use_app_feature_survey;", -1, &stmt,
                           nullptr) == SQLITE_OK &&
        sqlite3_step(stmt) == SQLITE_ROW)
      length = sqlite3_column_int64(stmt, 0);
    sqlite3_finalize(stmt);
    return length;
  }
  BusRowLists Lists(size_t extraLength) {
    BusRowLists lists;
    EXPECT_EQ(AppendRowEntry(kColumns, "app_id", "a", &lists), 0);
    EXPECT_EQ(AppendRowEntry(kColumns, "extra", std::string(extraLength, 'e').c_str(), &lists),
              0);
    return lists;
  }

  std::string sysroot;
  sqlite3* survey = nullptr;
  std::vector<std::string> statements;
};

// At the largest accepted size each statement is exactly 1023 bytes and runs whole; one byte
// more is refused.
TEST_F(ProviderBusFitTest, LargestAcceptedStatementsRunWholeAndOneMoreIsRefused) {
  const std::string table = "use_app_feature_survey";
  BusRowLists autoTexts = AutoColumnTexts(Feature()->Config().columns);

  size_t extra = 0;
  while (InsertFits(table, Lists(extra + 1), autoTexts)) ++extra;
  ASSERT_GT(extra, 900u);
  ASSERT_EQ(Feature()->InsertRow(Lists(extra).columns.c_str(), Lists(extra).values.c_str()), 0);
  EXPECT_EQ(LastStatement("INSERT").size(), 1023u);
  EXPECT_EQ(StoredExtraLength(), static_cast<long long>(extra));

  // Update: the lists (with timestamp and time_zone) stay below 200 bytes.
  size_t value = 0;
  while (UpdateFits(table, Lists(value + 1), autoTexts, "1")) ++value;
  EXPECT_EQ(Lists(value).values.size() + autoTexts.values.size(), 199u);
  ASSERT_EQ(Feature()->UpdateRows(Lists(value).columns.c_str(), Lists(value).values.c_str(), "1"),
            0);
  EXPECT_EQ(StoredExtraLength(), static_cast<long long>(value));
  // ... and the where fills the statement up to its last byte.
  std::string where = "1";
  while (UpdateFits(table, Lists(10), autoTexts, (where + " ").c_str())) where += " ";
  ASSERT_EQ(Feature()->UpdateRows(Lists(10).columns.c_str(), Lists(10).values.c_str(),
                                  where.c_str()),
            0);
  EXPECT_EQ(LastStatement("UPDATE").size(), 1023u);

  std::string columns = "app_id";
  while (SelectFits(table, (columns + " ").c_str(), nullptr)) columns += " ";
  int rowCount = 0;
  char** rows = nullptr;
  ASSERT_EQ(Feature()->SelectRows(columns.c_str(), nullptr, nullptr, &rowCount, &rows), 0);
  FreeRows(rows, rowCount);
  EXPECT_EQ(LastStatement("SELECT").size(), 1023u);

  where = "0";
  while (DeleteFits(table, (where + " ").c_str())) where += " ";
  ASSERT_EQ(Feature()->DeleteRows(where.c_str()), 0);
  EXPECT_EQ(LastStatement("DELETE").size(), 1023u);
}

TEST(ProviderBusGuardTest, AuthorizerConfinesStatementsToTheOwnTableWhileAlive) {
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open(":memory:", &db), SQLITE_OK);
  ASSERT_EQ(sqlite3_exec(db, "CREATE TABLE own(a); CREATE TABLE other(b);", nullptr, nullptr,
                         nullptr),
            SQLITE_OK);
  int lengthBefore = sqlite3_limit(db, SQLITE_LIMIT_LENGTH, -1);
  const struct {
    const char* sql;
    bool allowed;
  } cases[] = {
      {"INSERT INTO own(a) VALUES ('x');", true},
      {"UPDATE own SET a = upper(a) WHERE a IN (SELECT a FROM own);", true},
      {"SELECT count(*), max(a) FROM own;", true},
      {"DELETE FROM own WHERE a = 'y';", true},
      {"SELECT a, (SELECT b FROM other) FROM own;", false},
      {"DELETE FROM own WHERE a IN (SELECT b FROM other);", false},
      {"INSERT INTO other(b) VALUES (1);", false},
      {"SELECT name FROM sqlite_master;", false},
      {"ATTACH DATABASE ':memory:' AS x;", false},
      {"PRAGMA user_version = 3;", false},
      {"DROP TABLE other;", false},
      {"CREATE TABLE x(c);", false},
      {"BEGIN;", false},
      {"VACUUM;", false},
      {"WITH RECURSIVE r(n) AS (SELECT 1 UNION ALL SELECT n + 1 FROM r) SELECT n FROM r;", false},
      {"SELECT randomblob(10) FROM own;", false},
      {"SELECT replace(printf('%.1000000c', 'x'), 'x', 'xx') FROM own;", false},
  };
  {
    TableOnlyAuthorizer guard(db, "own");
    for (const auto& c : cases) {
      SCOPED_TRACE(c.sql);
      sqlite3_stmt* stmt = nullptr;
      int rc = sqlite3_prepare_v2(db, c.sql, -1, &stmt, nullptr);
      if (rc == SQLITE_OK) {
        while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
        }
      }
      sqlite3_finalize(stmt);
      EXPECT_EQ(rc == SQLITE_DONE, c.allowed) << sqlite3_errmsg(db);
    }
  }
  // Afterwards the daemon's own statements are free again.
  EXPECT_EQ(sqlite3_limit(db, SQLITE_LIMIT_LENGTH, -1), lengthBefore);
  EXPECT_EQ(sqlite3_exec(db, "INSERT INTO other(b) SELECT a FROM own; PRAGMA user_version = 3;",
                         nullptr, nullptr, nullptr),
            SQLITE_OK);
  sqlite3_close(db);
}

TEST(ProviderBusGuardTest, SegmentIsWrittenOnlyWhenOwnedAndLargeEnoughThenDetached) {
  char first[] = "x,1,";
  char second[] = "y,2,";
  char* rows[] = {first, second};
  const char kResult[] = "x,1,\0y,2,\0&";
  ASSERT_EQ(SegmentBytes(rows, 2), sizeof(kResult) - 1);
  struct Case {
    size_t size;
    uid_t owner;
    int rowCount;
    int result;
  } cases[] = {{11, getuid(), 2, 0},      {10, getuid(), 2, -1}, {1, getuid(), 0, 0},
               {1, getuid(), 1, -1},      {4096, getuid() + 1, 2, -1}};
  for (const Case& c : cases) {
    SCOPED_TRACE("size " + std::to_string(c.size) + " rows " + std::to_string(c.rowCount));
    int id = shmget(IPC_PRIVATE, c.size, IPC_CREAT | 0600);
    ASSERT_NE(id, -1);
    EXPECT_EQ(WriteRowsToSegment(id, c.owner, rows, c.rowCount), c.result);
    struct shmid_ds info;
    ASSERT_EQ(shmctl(id, IPC_STAT, &info), 0);
    EXPECT_EQ(info.shm_nattch, 0u);
    const char* base = static_cast<const char*>(shmat(id, nullptr, SHM_RDONLY));
    std::string content(base, c.size);
    std::string expected = c.result != 0      ? std::string(c.size, '\0')
                           : c.rowCount == 2 ? std::string(kResult, 11)
                                             : std::string("&");
    EXPECT_EQ(content, expected);
    shmdt(base);
    shmctl(id, IPC_RMID, nullptr);
  }
  EXPECT_EQ(WriteRowsToSegment(-1, getuid(), rows, 2), -1);
}

}  // namespace
}  // namespace _CorvaneLogManager
