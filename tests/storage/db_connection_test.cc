// DbConnection on real database files in a temp directory.
#include "db_connection.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <string>
#include <vector>

#include "storage/key_derivation.h"

namespace _CorvaneLogManager {
namespace {

class DbConnectionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char tmpl[] = "/tmp/logmgr-dbconn-XXXXXX";
    ASSERT_NE(mkdtemp(tmpl), nullptr);
    dir = tmpl;
    path = dir + "/test.db";
    ASSERT_EQ(conn.Open(path.c_str()), 0);
  }
  void TearDown() override {
    (void)conn.Close();
    (void)chmod(dir.c_str(), 0700);
    (void)system(("rm -rf '" + dir + "'").c_str());
  }
  // The rows of a Select as strings, freeing what it handed over.
  std::vector<std::string> SelectRows(const char* sql, const char* table, int* result = nullptr) {
    int count = -1;
    char** rows = nullptr;
    int rc = conn.Select(sql, table, &count, &rows);
    if (result != nullptr) *result = rc;
    std::vector<std::string> out;
    if (rc != 0) return out;
    EXPECT_GE(count, 0);
    if (count == 0) {
      EXPECT_EQ(rows, nullptr) << "nothing may be left to free";
    }
    for (int i = 0; i < count; ++i) {
      out.push_back(rows[i]);
      delete[] rows[i];
    }
    if (count > 0) delete[] rows;
    return out;
  }
  std::string dir;
  std::string path;
  DbConnection conn;
};

TEST_F(DbConnectionTest, RendersColumnsAsCommaTerminatedTexts) {
  ASSERT_EQ(conn.Exec("CREATE TABLE t(id INTEGER, a, b, c);"), 0);
  const std::string t298(298, 'y');
  const std::string t400(400, 'z');
  struct Case {
    const char* name;
    std::string values;
    std::string want;
  } cases[] = {
      {"mixed with NULL", "'abc', NULL, 1.5", "abc,1.500000,"},
      {"NULL between", "NULL, 'x', NULL", "x,"},
      {"all NULL", "NULL, NULL, NULL", ""},
      {"blob read to its NUL", "x'61620063', x'', NULL", "ab,,"},
      {"text of 298 keeps its comma", "'" + t298 + "', NULL, NULL", t298 + ","},
      {"text of 400 cut at 299", "'" + t400 + "', 7, NULL", t400.substr(0, 299) + "7,"},
      {"widest integer cut at 19", "-9223372036854775808, NULL, NULL", "-922337203685477580"},
      {"empty text", "'', 0, -2.25", ",0,-2.250000,"},
  };
  int id = 0;
  for (const Case& c : cases) {
    ++id;
    std::string insert =
        "INSERT INTO t VALUES(" + std::to_string(id) + ", " + c.values + ");";
    ASSERT_EQ(conn.Exec(insert.c_str()), 0) << insert;
  }
  std::vector<std::string> rows = SelectRows("SELECT a, b, c FROM t ORDER BY id;", "t");
  ASSERT_EQ(rows.size(), sizeof(cases) / sizeof(cases[0]));
  for (size_t i = 0; i < rows.size(); ++i) {
    SCOPED_TRACE(cases[i].name);
    EXPECT_EQ(rows[i], cases[i].want);
  }
  // The leading integer column and the example row of the design.
  ASSERT_EQ(conn.Exec("CREATE TABLE e(a, b, c, d); INSERT INTO e VALUES(42, 'abc', NULL, 1.5);"),
            0);
  EXPECT_EQ(SelectRows("SELECT * FROM e;", "e"), std::vector<std::string>{"42,abc,1.500000,"});
}

TEST_F(DbConnectionTest, SizesSelectByTheNamedTable) {
  ASSERT_EQ(conn.Exec("CREATE TABLE small(x); INSERT INTO small VALUES(1),(2);"
                      "CREATE TABLE big(x); INSERT INTO big VALUES(1),(2),(3),(4),(5);"
                      "CREATE TABLE empty(x);"),
            0);
  // Capacity is COUNT(*) of the named table: more rows than it holds are cut, never overrun.
  EXPECT_EQ(SelectRows("SELECT x FROM big ORDER BY x;", "small"),
            (std::vector<std::string>{"1,", "2,"}));
  EXPECT_EQ(SelectRows("SELECT x FROM big ORDER BY x;", "big").size(), 5u);
  EXPECT_TRUE(SelectRows("SELECT x FROM big WHERE x > 10;", "big").empty());
  // An empty or missing named table: nothing prepared, so even bad SQL "succeeds" empty.
  int rc = -1;
  EXPECT_TRUE(SelectRows("SELECT nonsense FROM nowhere;", "empty", &rc).empty());
  EXPECT_EQ(rc, 0);
  EXPECT_TRUE(SelectRows("SELECT nonsense FROM nowhere;", "missing", &rc).empty());
  EXPECT_EQ(rc, 0);
  (void)SelectRows("SELECT nonsense FROM nowhere;", "big", &rc);
  EXPECT_EQ(rc, -1);
}

TEST_F(DbConnectionTest, SchemaAndCountQueries) {
  ASSERT_EQ(conn.Exec("CREATE TABLE log(timestamp INTEGER);"), 0);
  EXPECT_EQ(conn.TableExists("log"), 1);
  EXPECT_EQ(conn.TableExists("nolog"), 0);
  EXPECT_EQ(conn.Count("log"), 0);
  EXPECT_EQ(conn.MaxTimestamp("log"), 0);
  ASSERT_EQ(conn.Exec("INSERT INTO log VALUES(5000000000),(17),(4999999999);"), 0);
  EXPECT_EQ(conn.Count("log"), 3);
  EXPECT_EQ(conn.MaxTimestamp("log"), 5000000000LL);
  EXPECT_EQ(conn.Changes(), 3);
  EXPECT_EQ(conn.Count("nolog"), 0);
  EXPECT_EQ(conn.MaxTimestamp("nolog"), 0);
  ASSERT_EQ(conn.Exec("CREATE TABLE r(id INTEGER PRIMARY KEY); INSERT INTO r VALUES(4294967298);"),
            0);
  EXPECT_EQ(conn.LastInsertRowId(), 2) << "low 32 bits of the row id";
  EXPECT_EQ(conn.Exec("INSERT INTO nowhere VALUES(1);"), -1);
  EXPECT_EQ(conn.Exec(nullptr), -1);
}

TEST_F(DbConnectionTest, OpenIsIdempotentAndClosedConnectionFails) {
  sqlite3* first = conn.Handle();
  EXPECT_EQ(conn.Open((dir + "/other.db").c_str()), 0);
  EXPECT_EQ(conn.Handle(), first);
  ASSERT_EQ(conn.Close(), 0);
  EXPECT_EQ(conn.Close(), -1);
  EXPECT_EQ(conn.LastInsertRowId(), -1);
  EXPECT_EQ(conn.Changes(), -1);
  EXPECT_EQ(conn.Exec("SELECT 1;"), -1);
  EXPECT_EQ(conn.Count("t"), 0);
  EXPECT_EQ(conn.TableExists("t"), 0);
  int count = 0;
  char** rows = nullptr;
  EXPECT_EQ(conn.Select("SELECT 1;", "t", &count, &rows), -1);
  conn.Interrupt();  // nothing to interrupt; must not crash
}

TEST_F(DbConnectionTest, BadFilesAndDirectoriesFailWithoutDamage) {
  // A file that is not a database: opening is lazy, every statement fails.
  std::string junk = dir + "/junk.db";
  FILE* f = fopen(junk.c_str(), "w");
  ASSERT_NE(f, nullptr);
  fputs("this is not an SQLite database, just some text that is long enough to matter\n", f);
  fclose(f);
  DbConnection bad;
  ASSERT_EQ(bad.Open(junk.c_str()), 0);
  EXPECT_EQ(bad.Exec("CREATE TABLE IF NOT EXISTS t(x);"), -1);
  EXPECT_EQ(bad.Count("t"), 0);
  EXPECT_EQ(bad.TableExists("t"), 0);
  int count = 0;
  char** rows = nullptr;
  EXPECT_EQ(bad.Select("SELECT x FROM t;", "sqlite_master", &count, &rows), 0);
  EXPECT_EQ(count, 0);
  EXPECT_EQ(bad.Close(), 0);
  // A missing directory.
  DbConnection missing;
  EXPECT_EQ(missing.Open((dir + "/no/such/dir/x.db").c_str()), -1);
  EXPECT_EQ(missing.Handle(), nullptr);

  // A read-only directory holding a database with a row: no new file, no write (a WAL file
  // cannot read there either). Root ignores modes, so a child drops to an unprivileged user.
  ASSERT_EQ(conn.Exec("CREATE TABLE t(x); INSERT INTO t VALUES('kept');"), 0);
  ASSERT_EQ(conn.Close(), 0);
  ASSERT_EQ(chmod(dir.c_str(), 0555), 0);
  ::testing::FLAGS_gtest_death_test_style = "threadsafe";
  EXPECT_EXIT(
      {
        if (geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0)) _exit(10);
        DbConnection ro;
        if (ro.Open((dir + "/fresh.db").c_str()) != -1) _exit(11);
        if (ro.Open(path.c_str()) != 0) _exit(12);
        if (ro.Exec("INSERT INTO t VALUES('lost');") != -1) _exit(13);
        if (ro.Exec("DELETE FROM t;") != -1) _exit(14);
        _exit(ro.Close() == 0 ? 0 : 16);
      },
      ::testing::ExitedWithCode(0), "");
  ASSERT_EQ(chmod(dir.c_str(), 0700), 0);
  ASSERT_EQ(conn.Open(path.c_str()), 0);
  EXPECT_EQ(SelectRows("SELECT x FROM t;", "t"), std::vector<std::string>{"kept,"});
}

// A worker that runs one statement on a shared connection, as the report job does.
struct Worker {
  DbConnection* conn = nullptr;
  bool useSelect = false;
  const char* sql = nullptr;
  std::atomic<bool> returned{false};
  pthread_t thread{};

  static void* Run(void* arg) {
    Worker* self = static_cast<Worker*>(arg);
    if (self->useSelect) {
      int count = 0;
      char** rows = nullptr;
      if (self->conn->Select(self->sql, "t", &count, &rows) == 0) {
        for (int i = 0; i < count; ++i) delete[] rows[i];
        if (count > 0) delete[] rows;
      }
    } else {
      (void)self->conn->Exec(self->sql);
    }
    self->returned = true;
    return nullptr;
  }
  int Start() { return pthread_create(&thread, nullptr, Run, this); }
  // Joins within |seconds| (a safety net against a hang, not a timing check).
  int Join(int seconds) {
    struct timespec deadline;
    clock_gettime(CLOCK_REALTIME, &deadline);
    deadline.tv_sec += seconds;
    return pthread_timedjoin_np(thread, nullptr, &deadline);
  }
};

std::atomic<int> g_marks{0};

// SQL function mark(): tells the test the statement is running inside SQLite.
void Mark(sqlite3_context* ctx, int, sqlite3_value**) {
  ++g_marks;
  sqlite3_result_int(ctx, 0);
}

TEST_F(DbConnectionTest, InterruptEndsWorkerBlockedInStatement) {
  ASSERT_EQ(conn.Exec("CREATE TABLE t(x); INSERT INTO t VALUES(1);"), 0);
  ASSERT_EQ(sqlite3_create_function(conn.Handle(), "mark", 0, SQLITE_UTF8, nullptr, Mark, nullptr,
                                    nullptr),
            SQLITE_OK);
  // Endless unless interrupted.
  const char* endless =
      "WITH RECURSIVE c(x) AS (SELECT mark() UNION ALL SELECT x + 1 FROM c) "
      "SELECT count(*) FROM c;";
  for (bool useSelect : {false, true}) {
    SCOPED_TRACE(useSelect ? "Select" : "Exec");
    g_marks = 0;
    Worker worker;
    worker.conn = &conn;
    worker.useSelect = useSelect;
    worker.sql = endless;
    ASSERT_EQ(worker.Start(), 0);
    for (int i = 0; i < 10000 && g_marks == 0; ++i) usleep(1000);
    ASSERT_GT(g_marks.load(), 0) << "worker never entered its statement";
    conn.Interrupt();
    ASSERT_EQ(worker.Join(30), 0) << "worker still running after Interrupt";
    EXPECT_FALSE(worker.returned) << "the interrupted statement must end its thread";
    // The interrupt is spent: the connection serves the next caller.
    EXPECT_EQ(conn.Count("t"), 1);
  }
}

TEST_F(DbConnectionTest, InterruptBeforeStatementStartsIsNotLost) {
  ASSERT_EQ(conn.Exec("CREATE TABLE t(x); INSERT INTO t VALUES(1);"), 0);
  conn.Interrupt();
  // The requesting thread's own statements go on.
  EXPECT_EQ(conn.Count("t"), 1);
  EXPECT_EQ(conn.Exec("INSERT INTO t VALUES(2);"), 0);
  Worker worker;
  worker.conn = &conn;
  worker.sql = "WITH RECURSIVE c(x) AS (SELECT 1 UNION ALL SELECT x + 1 FROM c) "
               "SELECT count(*) FROM c;";
  ASSERT_EQ(worker.Start(), 0);
  ASSERT_EQ(worker.Join(30), 0);
  EXPECT_FALSE(worker.returned);
  // Spent by that worker: a later one runs to completion.
  Worker next;
  next.conn = &conn;
  next.sql = "INSERT INTO t VALUES(3);";
  ASSERT_EQ(next.Start(), 0);
  ASSERT_EQ(next.Join(30), 0);
  EXPECT_TRUE(next.returned);
  EXPECT_EQ(conn.Count("t"), 3);
}

class KeyedOpenTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char tmpl[] = "/tmp/logmgr-keyed-XXXXXX";
    ASSERT_NE(mkdtemp(tmpl), nullptr);
    sysroot = tmpl;
    ASSERT_EQ(system(("mkdir -p '" + sysroot + "/opt/usr/dbspace'").c_str()), 0);
    setenv("LOGMGR_SYSROOT", sysroot.c_str(), 1);
    SetDbEncryption(true);
  }
  void TearDown() override {
    SetDbEncryption(false);
    ReleaseKeyParams();
    unsetenv("LOGMGR_SYSROOT");
    (void)system(("rm -rf '" + sysroot + "'").c_str());
  }
  std::string PasswordFile() const { return sysroot + "/opt/usr/dbspace/.SecurePassword.txt"; }
  std::string Db() const { return sysroot + "/opt/usr/dbspace/keyed.db"; }
  std::string sysroot;
};

TEST_F(KeyedOpenTest, OutcomesOfTheKeyedBranch) {
  {
    SCOPED_TRACE("no key library under the sysroot: opened unkeyed, password file made");
    DbConnection conn;
    ASSERT_EQ(conn.Open(Db().c_str()), 0);
    EXPECT_EQ(conn.Exec("CREATE TABLE t(x); INSERT INTO t VALUES(1);"), 0);
    EXPECT_EQ(conn.Close(), 0);
    EXPECT_FALSE(ReadKey().empty());
  }
  {
    SCOPED_TRACE("a library without sqlite3_key at that path: the open fails");
    ASSERT_EQ(system(("mkdir -p '" + sysroot + "/usr/lib' && cp -L "
                      "/usr/lib/x86_64-linux-gnu/libsqlite3.so.0 '" +
                      sysroot + "/usr/lib/libsqlite3.so.0'")
                         .c_str()),
              0);
    DbConnection conn;
    EXPECT_EQ(conn.Open(Db().c_str()), -1);
    EXPECT_EQ(conn.Handle(), nullptr);
  }
  {
    SCOPED_TRACE("an empty key: the open fails");
    ASSERT_EQ(unlink((sysroot + "/usr/lib/libsqlite3.so.0").c_str()), 0);
    FILE* f = fopen(PasswordFile().c_str(), "w");
    ASSERT_NE(f, nullptr);
    fclose(f);
    DbConnection conn;
    EXPECT_EQ(conn.Open(Db().c_str()), -1);
  }
}

}  // namespace
}  // namespace _CorvaneLogManager
