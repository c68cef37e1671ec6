// DbConnection on real database files in a temp directory.
#include "db_connection.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <string>
#include <vector>

#include "storage/key_derivation.h"

namespace _CorvaneLogManager {
namespace {

using Rows = std::vector<std::string>;

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
  // A Select's rows as strings, freeing what it handed over; |rc| gets its result.
  Rows Select(const char* sql, const char* table, int* rc = nullptr) {
    int count = -1;
    char** rows = nullptr;
    int result = conn.Select(sql, table, &count, &rows);
    if (rc != nullptr) *rc = result;
    Rows out;
    if (result != 0) return out;
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
  const std::string t298(298, 'y'), t400(400, 'z');
  struct Case {
    const char* name;
    std::string values;
    std::string want;
  } cases[] = {
      {"the example row", "42, 'abc', NULL, 1.5", "42,abc,1.500000,"},
      {"NULL between", "7, NULL, 'x', NULL", "7,x,"},
      {"all NULL", "NULL, NULL, NULL, NULL", ""},
      {"blob read to its NUL", "x'61620063', x'', NULL, NULL", "ab,,"},
      {"text of 298 keeps its comma", "'" + t298 + "', NULL, NULL, NULL", t298 + ","},
      {"text of 400 cut at 299", "'" + t400 + "', 7, NULL, NULL", t400.substr(0, 299) + "7,"},
      {"widest integer cut at 19", "-9223372036854775808, NULL, NULL, NULL", "-922337203685477580"},
  };
  ASSERT_EQ(conn.Exec("CREATE TABLE t(id INTEGER PRIMARY KEY, a, b, c, d);"), 0);
  for (const Case& c : cases) {
    ASSERT_EQ(conn.Exec(("INSERT INTO t(a, b, c, d) VALUES(" + c.values + ");").c_str()), 0);
  }
  Rows rows = Select("SELECT a, b, c, d FROM t ORDER BY id;", "t");
  ASSERT_EQ(rows.size(), sizeof(cases) / sizeof(cases[0]));
  for (size_t i = 0; i < rows.size(); ++i) {
    SCOPED_TRACE(cases[i].name);
    EXPECT_EQ(rows[i], cases[i].want);
  }
}

TEST_F(DbConnectionTest, SizesSelectByTheNamedTable) {
  ASSERT_EQ(conn.Exec("CREATE TABLE small(x); INSERT INTO small VALUES(1),(2);"
                      "CREATE TABLE big(x); INSERT INTO big VALUES(1),(2),(3),(4),(5);"
                      "CREATE TABLE empty(x);"),
            0);
  // More rows than the named table holds are cut, never written past the array.
  EXPECT_EQ(Select("SELECT x FROM big ORDER BY x;", "small"), (Rows{"1,", "2,"}));
  EXPECT_EQ(Select("SELECT x FROM big;", "big").size(), 5u);
  EXPECT_TRUE(Select("SELECT x FROM big WHERE x > 10;", "big").empty());
  // An empty or missing named table: nothing is prepared, so even bad SQL yields 0 rows.
  for (const char* table : {"empty", "missing", "big"}) {
    SCOPED_TRACE(table);
    int rc = 1;
    EXPECT_TRUE(Select("SELECT nonsense FROM nowhere;", table, &rc).empty());
    EXPECT_EQ(rc, std::string(table) == "big" ? -1 : 0);
  }
}

TEST_F(DbConnectionTest, CountsAndFailureValues) {
  ASSERT_EQ(conn.Exec("CREATE TABLE log(id INTEGER PRIMARY KEY, timestamp INTEGER);"), 0);
  EXPECT_EQ(conn.MaxTimestamp("log"), 0) << "empty table";
  ASSERT_EQ(conn.Exec("INSERT INTO log VALUES(1, 5000000000), (8589934597, 17);"), 0);
  EXPECT_EQ(conn.TableExists("log"), 1);
  EXPECT_EQ(conn.TableExists("nolog"), 0);
  EXPECT_EQ(conn.Count("log"), 2);
  EXPECT_EQ(conn.MaxTimestamp("log"), 5000000000LL);
  EXPECT_EQ(conn.Changes(), 2);
  EXPECT_EQ(conn.LastInsertRowId(), 5) << "low 32 bits of 2^33 + 5";
  EXPECT_EQ(conn.Count("nolog"), 0);
  EXPECT_EQ(conn.MaxTimestamp("nolog"), 0);
  EXPECT_EQ(conn.Exec("INSERT INTO nolog VALUES(1);"), -1);

  sqlite3* first = conn.Handle();
  EXPECT_EQ(conn.Open((dir + "/other.db").c_str()), 0);
  EXPECT_EQ(conn.Handle(), first) << "a second Open keeps the first handle";
  ASSERT_EQ(conn.Close(), 0);
  conn.Interrupt();  // closed: nothing to do
  int rc = 0;
  (void)Select("SELECT 1;", "log", &rc);
  EXPECT_EQ(rc, -1);
  for (int closed :
       {conn.Close(), conn.LastInsertRowId(), conn.Changes(), conn.Exec("SELECT 1;")}) {
    EXPECT_EQ(closed, -1);
  }
}

TEST_F(DbConnectionTest, BadFilesAndDirectoriesFailWithoutDamage) {
  std::string junk = dir + "/junk.db";
  ASSERT_EQ(system(("head -c 4096 /dev/urandom > '" + junk + "'").c_str()), 0);
  DbConnection bad;
  ASSERT_EQ(bad.Open(junk.c_str()), 0) << "SQLite reads the header lazily";
  EXPECT_EQ(bad.Exec("CREATE TABLE IF NOT EXISTS t(x);"), -1);
  EXPECT_EQ(bad.Count("t"), 0);
  EXPECT_EQ(bad.TableExists("t"), 0);
  EXPECT_EQ(bad.Close(), 0);
  DbConnection missing;
  EXPECT_EQ(missing.Open((dir + "/no/such/dir/x.db").c_str()), -1);

  // A read-only directory holding a database with a row: no new file, no write (a WAL file
  // cannot read there either). Root ignores modes, so a child drops to an unprivileged user.
  ASSERT_EQ(conn.Exec("CREATE TABLE t(x); INSERT INTO t VALUES('kept');"), 0);
  ASSERT_EQ(conn.Close(), 0);
  ASSERT_EQ(chmod(dir.c_str(), 0555), 0);
  ::testing::FLAGS_gtest_death_test_style = "fast";  // a re-executed child would make its own sysroot
  EXPECT_EXIT(
      {
        if (geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0)) _exit(10);
        DbConnection ro;
        if (ro.Open((dir + "/fresh.db").c_str()) != -1) _exit(11);
        if (ro.Open(path.c_str()) != 0) _exit(12);
        if (ro.Exec("INSERT INTO t VALUES('lost');") != -1) _exit(13);
        if (ro.Exec("DELETE FROM t;") != -1) _exit(14);
        _exit(ro.Close() == 0 ? 0 : 15);
      },
      ::testing::ExitedWithCode(0), "");
  ASSERT_EQ(chmod(dir.c_str(), 0700), 0);
  ASSERT_EQ(conn.Open(path.c_str()), 0);
  EXPECT_EQ(Select("SELECT x FROM t;", "t"), Rows{"kept,"});
}

std::atomic<int> g_marks{0};

// SQL function mark(): shows the test that a statement is running inside SQLite.
void Mark(sqlite3_context* ctx, int, sqlite3_value**) {
  ++g_marks;
  sqlite3_result_int(ctx, 0);
}

// One statement on a shared connection in a thread of its own, as the report job runs.
struct Worker {
  DbConnection* conn;
  bool useSelect;
  const char* sql;
  std::atomic<bool> returned{false};

  static void* Run(void* arg) {
    Worker* self = static_cast<Worker*>(arg);
    int count = 0;
    char** rows = nullptr;
    if (!self->useSelect) {
      (void)self->conn->Exec(self->sql);
    } else if (self->conn->Select(self->sql, "t", &count, &rows) == 0 && count > 0) {
      for (int i = 0; i < count; ++i) delete[] rows[i];
      delete[] rows;
    }
    self->returned = true;
    return nullptr;
  }
};

TEST_F(DbConnectionTest, InterruptEndsTheThreadRunningTheStatement) {
  ASSERT_EQ(conn.Exec("CREATE TABLE t(x); INSERT INTO t VALUES(1);"), 0);
  ASSERT_EQ(sqlite3_create_function(conn.Handle(), "mark", 0, SQLITE_UTF8, nullptr, Mark, nullptr,
                                    nullptr),
            SQLITE_OK);
  const char* endless =  // runs until interrupted
      "WITH RECURSIVE c(x) AS (SELECT mark() UNION ALL SELECT x + 1 FROM c) "
      "SELECT count(*) FROM c;";
  struct Case {
    const char* name;
    bool useSelect;
    bool interruptFirst;  // the interrupt comes before the statement starts
  } cases[] = {{"Exec blocked", false, false},
               {"Select blocked", true, false},
               {"interrupt before the statement", false, true}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    g_marks = 0;
    if (c.interruptFirst) {
      conn.Interrupt();
      // The requesting thread's own statements are not stopped.
      EXPECT_EQ(conn.Exec("INSERT INTO t VALUES(2); DELETE FROM t WHERE x = 2;"), 0);
    }
    Worker worker{&conn, c.useSelect, endless};
    pthread_t thread;
    ASSERT_EQ(pthread_create(&thread, nullptr, Worker::Run, &worker), 0);
    if (!c.interruptFirst) {
      for (int i = 0; i < 20000 && g_marks == 0; ++i) usleep(500);
      ASSERT_GT(g_marks.load(), 0) << "the worker never entered its statement";
      conn.Interrupt();
    }
    struct timespec deadline;  // a guard against a hang, not a timing check
    clock_gettime(CLOCK_REALTIME, &deadline);
    deadline.tv_sec += 60;
    ASSERT_EQ(pthread_timedjoin_np(thread, nullptr, &deadline), 0) << "worker still running";
    EXPECT_FALSE(worker.returned) << "the interrupted statement must end its thread";
    EXPECT_EQ(conn.Count("t"), 1) << "the interrupt is spent; the connection serves on";
  }
}

TEST(KeyedOpenTest, OutcomesOfTheKeyedBranch) {
  char tmpl[] = "/tmp/logmgr-keyed-XXXXXX";
  ASSERT_NE(mkdtemp(tmpl), nullptr);
  std::string root = tmpl;
  std::string db = root + "/opt/usr/dbspace/keyed.db";
  std::string lib = root + "/usr/lib/libsqlite3.so.0";
  ASSERT_EQ(system(("mkdir -p '" + root + "/opt/usr/dbspace' '" + root + "/usr/lib'").c_str()), 0);
  setenv("LOGMGR_SYSROOT", root.c_str(), 1);
  SetDbEncryption(true);
  DbConnection conn;
  // No key library under the sysroot: the password file is made and the open goes on unkeyed.
  EXPECT_EQ(conn.Open(db.c_str()), 0);
  EXPECT_EQ(conn.Exec("CREATE TABLE t(x);"), 0);
  EXPECT_EQ(conn.Close(), 0);
  std::string key = ReadKey();
  EXPECT_FALSE(key.empty());
  // Debian's library at that path has no sqlite3_key: the open fails.
  ASSERT_EQ(system(("cp -L /usr/lib/x86_64-linux-gnu/libsqlite3.so.0 '" + lib + "'").c_str()), 0);
  EXPECT_EQ(conn.Open(db.c_str()), -1);
  EXPECT_EQ(conn.Handle(), nullptr);
  // An empty key: the open fails, and the file stays as it was.
  ASSERT_EQ(unlink(lib.c_str()), 0);
  ASSERT_EQ(truncate((root + "/opt/usr/dbspace/.SecurePassword.txt").c_str(), 0), 0);
  EXPECT_EQ(conn.Open(db.c_str()), -1);
  EXPECT_EQ(ReadKey(), "");
  SetDbEncryption(false);
  ReleaseKeyParams();
  unsetenv("LOGMGR_SYSROOT");
  (void)system(("rm -rf '" + root + "'").c_str());
}

}  // namespace
}  // namespace _CorvaneLogManager
