// DbConnection on real database files in a temp directory.
#include "include/db_connection.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "storage/key_derivation.h"
#include "tests/temp_sysroot.h"

namespace _CorvaneLogManager {
namespace {

using Rows = std::vector<std::string>;

class DbConnectionTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(conn.Open(path.c_str()), 0); }
  void TearDown() override { (void)conn.Close(); }
  // Runs each statement in the open phase, the only time tables may be made.
  void Setup(std::initializer_list<const char*> statements) {
    DbConnection::SetupScope setup(&conn);
    for (const char* sql : statements) ASSERT_EQ(conn.Exec(sql), 0) << sql;
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
  TempSysroot tmp{"dbconn"};
  const std::string dir = tmp.path();
  const std::string path = dir + "/test.db";
  DbConnection conn;
};

// The cells as the formatted rendering made them, cell by cell into buffers of the cell's size.
std::string FormattedRow(sqlite3_stmt* stmt) {
  std::string row;
  for (int c = 0; c < sqlite3_column_count(stmt); ++c) {
    char cell[300] = "";
    switch (sqlite3_column_type(stmt, c)) {
      case SQLITE_INTEGER:
        snprintf(cell, 20, "%lld,", static_cast<long long>(sqlite3_column_int64(stmt, c)));
        break;
      case SQLITE_FLOAT:
        snprintf(cell, 20, "%f,", sqlite3_column_double(stmt, c));
        break;
      case SQLITE_TEXT:
        snprintf(cell, sizeof(cell), "%s,", sqlite3_column_text(stmt, c));
        break;
      case SQLITE_BLOB: {
        const void* blob = sqlite3_column_blob(stmt, c);
        snprintf(cell, sizeof(cell), "%.*s,", blob ? sqlite3_column_bytes(stmt, c) : 0,
                 blob ? static_cast<const char*>(blob) : "");
        break;
      }
    }
    row += cell;
  }
  return row;
}

TEST_F(DbConnectionTest, RendersEveryCellAsTheFormattedRenderingDid) {
  // clang-format off
  const char* values[] = {
      "0", "-1", "9", "10", "-10", "99999999999999999", "999999999999999999", "1000000000000000000",
      "-99999999999999999", "-999999999999999999", "9223372036854775807", "-9223372036854775808",
      "0.0", "-1.5", "1e15", "-1e300", "1e-300", "123456.7890125", "''", "','", "'a,b,'",
      "CAST(x'610062' AS TEXT)", "CAST(x'00' AS TEXT)", "printf('%.297c', 'a')",
      "printf('%.298c', 'b')", "printf('%.299c', 'c')", "printf('%.300c', 'd')",
      "printf('%.1000c', 'e')", "printf('%.297c', 'f') || 'éé'", "x''", "x'00'", "x'6100'",
      "x'616263'", "zeroblob(3)", "CAST(printf('%.299c', 'g') AS BLOB)",
      "CAST(printf('%.300c', 'h') AS BLOB)", "NULL"};
  // clang-format on
  Setup({"CREATE TABLE v(id INTEGER PRIMARY KEY, x);"});
  for (const char* value : values) {
    ASSERT_EQ(conn.Exec((std::string("INSERT INTO v(x) VALUES(") + value + ");").c_str()), 0);
  }
  // A row holding each value next to its neighbours; then the widest row a bus request may ask,
  // with every cell at or past its cut.
  std::string wide = "x";
  for (int i = 1; i < DbConnection::kBusMaxColumns; ++i) wide += i % 2 ? ", -x" : ", x";
  for (std::string columns : {std::string("x, x || '', id, x"), wide}) {
    SCOPED_TRACE(columns);
    std::string sql = "SELECT " + columns + " FROM v ORDER BY id;";
    Rows want;
    size_t bytes = 1;
    sqlite3_stmt* stmt = nullptr;
    ASSERT_EQ(sqlite3_prepare_v2(conn.Handle(), sql.c_str(), -1, &stmt, nullptr), SQLITE_OK);
    while (sqlite3_step(stmt) == SQLITE_ROW) {
      want.push_back(FormattedRow(stmt));
      bytes += want.back().size() + 1;
    }
    sqlite3_finalize(stmt);
    ASSERT_EQ(want.size(), sizeof(values) / sizeof(values[0]));
    Rows got = Select(sql.c_str(), "v");
    ASSERT_EQ(got.size(), want.size());
    for (size_t i = 0; i < got.size(); ++i) EXPECT_EQ(got[i], want[i]) << values[i];
    // A bus request's limit falls on the rendered bytes exactly.
    for (size_t limit : {bytes, bytes - 1}) {
      DbConnection::BusRequestScope request(&conn, "v");
      request.LimitResult(limit);
      int rc = 1;
      EXPECT_EQ(Select(sql.c_str(), "v", &rc).size(), limit == bytes ? want.size() : 0u);
      EXPECT_EQ(request.ResultTooLarge(), limit != bytes);
    }
  }
}

TEST_F(DbConnectionTest, SizesSelectByTheNamedTable) {
  Setup({"CREATE TABLE small(x);", "INSERT INTO small VALUES(1),(2);", "CREATE TABLE big(x);",
         "INSERT INTO big VALUES(1),(2),(3),(4),(5);", "CREATE TABLE empty(x);"});
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
  Setup({"CREATE TABLE log(id INTEGER PRIMARY KEY, timestamp INTEGER);"});
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
  ASSERT_EQ(
      system(("head -c 4096 /dev/urandom > '" + junk + "' && cp '" + junk + "' '" + junk + ".orig'")
                 .c_str()),
      0);
  DbConnection bad;
  // SQLite reads the header lazily; the open reads it at once, so the file stays closed.
  EXPECT_EQ(bad.Open(junk.c_str()), -1);
  EXPECT_EQ(bad.Exec("CREATE TABLE IF NOT EXISTS t(x);"), -1);
  EXPECT_EQ(bad.Count("t"), 0);
  EXPECT_EQ(bad.Close(), -1);
  EXPECT_EQ(system(("cmp -s '" + junk + "' '" + junk + ".orig'").c_str()), 0);
  DbConnection missing;
  EXPECT_EQ(missing.Open((dir + "/no/such/dir/x.db").c_str()), -1);

  // A read-only directory holding a database with a row: no new file, and the WAL database
  // cannot even be read there, so the open fails. Root ignores modes, so a child drops to an
  // unprivileged user.
  Setup({"CREATE TABLE t(x);", "INSERT INTO t VALUES('kept');"});
  ASSERT_EQ(conn.Close(), 0);
  ASSERT_EQ(chmod(path.c_str(), 0644), 0);  // made owner-only; the reader below is another user
  ASSERT_EQ(chmod(dir.c_str(), 0555), 0);
  ::testing::FLAGS_gtest_death_test_style =
      "fast";  // a re-executed child would make its own sysroot
  EXPECT_EXIT(
      {
        if (geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0)) _exit(10);
        DbConnection ro;
        if (ro.Open((dir + "/fresh.db").c_str()) != -1) _exit(11);
        if (ro.Open(path.c_str()) != -1) _exit(12);
        if (ro.Exec("INSERT INTO t VALUES('lost');") != -1) _exit(13);
        if (ro.Exec("DELETE FROM t;") != -1) _exit(14);
        _exit(ro.Close() == -1 ? 0 : 15);
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
    QueryRows rows;
    if (!self->useSelect) {
      (void)self->conn->Exec(self->sql);
    } else {
      (void)self->conn->Select(self->sql, "t", &rows.count, &rows.rows);
    }
    self->returned = true;
    return nullptr;
  }
};

TEST_F(DbConnectionTest, InterruptEndsTheThreadRunningTheStatement) {
  Setup({"CREATE TABLE t(x);", "INSERT INTO t VALUES(1);"});
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
      EXPECT_EQ(conn.Exec("INSERT INTO t VALUES(2);"), 0);
      EXPECT_EQ(conn.Exec("DELETE FROM t WHERE x = 2;"), 0);
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

TEST_F(DbConnectionTest, RunsExactlyOneStatementOrNothing) {
  Setup({"CREATE TABLE t(x);", "CREATE TABLE other(y);", "INSERT INTO other VALUES('kept');"});
  const struct {
    const char* sql;
    int result;
  } cases[] = {
      {"INSERT INTO t VALUES(1);", 0},
      {"INSERT INTO t VALUES(2); -- a note\n /* and another */ ", 0},
      {"INSERT INTO t VALUES(3); /* left open", 0},
      {"INSERT INTO t VALUES(4); DELETE FROM other;", -1},
      {"INSERT INTO t VALUES(5); INSERT INTO t VALUES(6);", -1},
      {"DELETE FROM other WHERE 0;; ", -1},
      {"DELETE FROM other WHERE 0; -- x\n DROP TABLE other", -1},
      {"", -1},
      {"-- nothing to run", -1},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.sql);
    EXPECT_EQ(conn.Exec(c.sql), c.result);
  }
  // Refused texts ran no part of themselves.
  EXPECT_EQ(Select("SELECT x FROM t ORDER BY x;", "t"), (Rows{"1,", "2,", "3,"}));
  int rc = 0;
  EXPECT_TRUE(Select("SELECT x FROM t; DELETE FROM other;", "t", &rc).empty());
  EXPECT_EQ(rc, -1);
  EXPECT_EQ(Select("SELECT y FROM other;", "other"), Rows{"kept,"});
}

TEST_F(DbConnectionTest, AfterTheOpenPhaseOnlyRowsChange) {
  std::string attached = dir + "/attached.db";
  const char* kNames =
      "SELECT group_concat(name, ' ') FROM (SELECT name FROM sqlite_master ORDER BY name);";
  Setup({"CREATE TABLE t(x);", "CREATE TABLE u(y);", "PRAGMA user_version = 1;"});
  const struct {
    const char* sql;
    bool daemon;  // allowed for the daemon's own statements
    bool setup;   // allowed in the open phase
  } cases[] = {
      {"INSERT INTO t VALUES(1);", true, true},
      {"UPDATE t SET x = x + 1;", true, true},
      {"PRAGMA user_version;", true, true},
      {"SELECT count(*) FROM sqlite_master;", true, true},
      {"BEGIN;", true, true},
      {"COMMIT;", true, true},
      {"PRAGMA user_version = 7;", false, true},
      {"PRAGMA writable_schema = 1;", false, false},
      {"CREATE TABLE IF NOT EXISTS w(y);", false, true},
      {"CREATE INDEX IF NOT EXISTS tx ON t(x);", false, true},
      {"DROP TABLE u;", false, false},
      {"DROP INDEX tx;", false, false},
      {"ALTER TABLE t ADD COLUMN z;", false, false},
      {"CREATE TRIGGER tr AFTER INSERT ON t BEGIN DELETE FROM t; END;", false, false},
      {"CREATE VIEW v AS SELECT x FROM t;", false, false},
      {"CREATE TEMP TABLE tt(z);", false, true},
      {"DELETE FROM sqlite_master;", false, false},
      {"UPDATE sqlite_master SET sql = 'x';", false, false},
  };
  for (bool inSetup : {false, true}) {
    for (const auto& c : cases) {
      SCOPED_TRACE(std::string(inSetup ? "setup: " : "daemon: ") + c.sql);
      if (inSetup) {
        DbConnection::SetupScope setup(&conn);
        EXPECT_EQ(conn.Exec(c.sql), c.setup ? 0 : -1);
      } else {
        EXPECT_EQ(conn.Exec(c.sql), c.daemon ? 0 : -1);
      }
    }
    if (!inSetup) {
      EXPECT_EQ(Select("PRAGMA user_version;", "t"), Rows{"1,"});
      EXPECT_EQ(Select(kNames, "t"), Rows{"t u,"});
    }
    // ATTACH is never allowed, and no file appears for it.
    DbConnection::SetupScope setup(inSetup ? &conn : nullptr);
    EXPECT_EQ(conn.Exec(("ATTACH DATABASE '" + attached + "' AS a;").c_str()), -1);
    EXPECT_NE(access(attached.c_str(), F_OK), 0);
  }
  EXPECT_EQ(Select(kNames, "t"), Rows{"t tx u w,"});
}

TEST_F(DbConnectionTest, AStepThatEndsInAnErrorIsAFailure) {
  Setup({"CREATE TABLE t(id INTEGER PRIMARY KEY, v INTEGER, timestamp INTEGER);",
         "INSERT INTO t(v, timestamp) VALUES (9223372036854775807, 1), (1, 2), (3, 3);"});
  int rc = 0;
  // SUM overflows only when it reaches the second row: the error comes after stepping began.
  EXPECT_TRUE(Select("SELECT SUM(v) FROM t;", "t", &rc).empty());
  EXPECT_EQ(rc, -1);
  // An error on the third row of a plain select loses the first two too: the result fails.
  EXPECT_TRUE(Select("SELECT CASE WHEN id = 3 THEN abs(-9223372036854775807 - 1) ELSE v END FROM t "
                     "ORDER BY id;",
                     "t", &rc)
                  .empty());
  EXPECT_EQ(rc, -1);
  EXPECT_EQ(conn.Exec("UPDATE t SET v = (SELECT SUM(v) FROM t) WHERE id = 2;"), -1);
  EXPECT_EQ(conn.Exec("INSERT INTO t(v) SELECT abs(-9223372036854775807 - 1);"), -1);
  EXPECT_EQ(conn.Count("t"), 3);
  EXPECT_EQ(Select("SELECT v FROM t WHERE id = 2;", "t"), Rows{"1,"}) << "nothing changed";
}

TEST_F(DbConnectionTest, ABusRequestTouchesOneTableWithinItsBudgetAndResultLimit) {
  Setup({"CREATE TABLE own(a);", "CREATE TABLE other(b);"});
  ASSERT_EQ(conn.Exec("BEGIN;"), 0);
  for (int i = 0; i < 200; ++i) ASSERT_EQ(conn.Exec("INSERT INTO own VALUES('row');"), 0);
  ASSERT_EQ(conn.Exec("COMMIT;"), 0);
  conn.SetBusCpuBudgetMs(50);
  {
    DbConnection::BusRequestScope request(&conn, "own");
    ASSERT_TRUE(request.Held());
    const struct {
      const char* sql;
      bool allowed;
    } cases[] = {
        {"INSERT INTO own(a) VALUES ('x');", true},
        {"UPDATE own SET a = upper(a) WHERE a IN (SELECT a FROM own);", true},
        {"SELECT count(*), max(a) FROM own;", true},
        {"DELETE FROM own WHERE a = 'X';", true},  // the row inserted above, upper-cased
        {"SELECT a, (SELECT b FROM other) FROM own;", false},
        {"DELETE FROM own WHERE a IN (SELECT b FROM other);", false},
        {"INSERT INTO other(b) VALUES (1);", false},
        {"SELECT name FROM sqlite_master;", false},
        {"ATTACH DATABASE ':memory:' AS x;", false},
        {"PRAGMA user_version = 3;", false},
        {"PRAGMA user_version;", false},
        {"DROP TABLE other;", false},
        {"CREATE TABLE x(c);", false},
        {"BEGIN;", false},
        {"VACUUM;", false},
        {"WITH RECURSIVE r(n) AS (SELECT 1 UNION ALL SELECT n + 1 FROM r) SELECT n FROM r;", false},
        {"SELECT randomblob(10) FROM own;", false},
        {"SELECT replace(printf('%.1000000c', 'x'), 'x', 'xx') FROM own;", false},
        {"DELETE FROM own WHERE 1; DELETE FROM other;", false},
    };
    for (const auto& c : cases) {
      SCOPED_TRACE(c.sql);
      EXPECT_EQ(conn.Exec(c.sql), c.allowed ? 0 : -1);
    }
    // The scope is this thread's: the worker's statements meanwhile stay the daemon's own.
    int other = 1;
    std::thread([&] { other = conn.Exec("INSERT INTO other VALUES(2);"); }).join();
    EXPECT_EQ(other, 0);
    DbConnection::SetupScope nested(&conn);  // a second scope is never entered
    EXPECT_EQ(conn.Exec("CREATE TABLE x(c);"), -1);
  }
  {
    // 200^4 rows to count: far past the budget, so it fails instead of holding the thread.
    DbConnection::BusRequestScope request(&conn, "own");
    int rc = 0;
    EXPECT_TRUE(Select("SELECT count(*) FROM own a, own b, own c, own d;", "own", &rc).empty());
    EXPECT_EQ(rc, -1);
    EXPECT_FALSE(request.ResultTooLarge());
    EXPECT_EQ(conn.Exec("DELETE FROM own WHERE a IN (SELECT a.a FROM own a, own b, own c);"), -1);
  }
  EXPECT_EQ(conn.Count("own"), 200) << "the stopped delete changed nothing";
  // Afterwards the daemon's own statements reach every table again.
  EXPECT_EQ(conn.Exec("INSERT INTO other(b) SELECT a FROM own LIMIT 1;"), 0);
  EXPECT_EQ(conn.Count("other"), 2);
  // Every row renders as "row," plus a NUL, and one byte ends the result.
  for (size_t limit : {size_t{6}, size_t{5}, size_t{200 * 5 + 1}, size_t{200 * 5}}) {
    SCOPED_TRACE(limit);
    DbConnection::BusRequestScope request(&conn, "own");
    request.LimitResult(limit);
    int rc = 0;
    const char* sql = limit < 10 ? "SELECT a FROM own LIMIT 1;" : "SELECT a FROM own;";
    bool fits = limit == 6 || limit == 200 * 5 + 1;
    EXPECT_EQ(Select(sql, "own", &rc).size(), fits ? (limit == 6 ? 1u : 200u) : 0u);
    EXPECT_EQ(rc, fits ? 0 : -1);
    EXPECT_EQ(request.ResultTooLarge(), !fits);
  }
  std::string columns = "a";
  for (int i = 1; i <= DbConnection::kBusMaxColumns; ++i) columns += ",a";
  DbConnection::BusRequestScope request(&conn, "own");
  int rc = 0;
  (void)Select(("SELECT " + columns + " FROM own;").c_str(), "own", &rc);
  EXPECT_EQ(rc, -1) << "one column more than a bus request may name";
}

// A kept statement was judged by the authorizer once, at its prepare: it may serve only the
// scope (and for a bus request the table) it was judged for, never another.
TEST_F(DbConnectionTest, KeptStatementsServeOnlyTheScopeTheyWereJudgedFor) {
  Setup({"CREATE TABLE own(a);", "CREATE TABLE other(b);"});
  using Value = DbConnection::BoundValue;
  const Value row[] = {{Value::kText, 0, "v", 1}};
  const char* intoOther = "INSERT INTO other(b) VALUES (?);";
  const char* intoOwn = "INSERT INTO own(a) VALUES (?);";
  EXPECT_EQ(conn.ExecKept(intoOther, row, 1), 0);
  EXPECT_EQ(conn.ExecKept(intoOther, row, 1), 0);  // the kept one, again
  {
    DbConnection::BusRequestScope request(&conn, "own");
    ASSERT_TRUE(request.Held());
    EXPECT_EQ(conn.ExecKept(intoOther, row, 1), DbConnection::kNotRun);
    EXPECT_EQ(conn.ExecKept(intoOwn, row, 1), 0);
    // Meanwhile another thread's statements stay the daemon's own, kept statement included.
    int daemon = 2;
    std::thread([&] { daemon = conn.ExecKept(intoOther, row, 1); }).join();
    EXPECT_EQ(daemon, 0);
  }
  {
    DbConnection::BusRequestScope request(&conn, "other");
    EXPECT_EQ(conn.ExecKept(intoOwn, row, 1), DbConnection::kNotRun) << "judged for own only";
    EXPECT_EQ(conn.Exec("INSERT INTO own(a) VALUES ('v');"), -1) << "as the text is refused";
  }
  {
    DbConnection::SetupScope setup(&conn);
    EXPECT_EQ(conn.ExecKept(intoOther, row, 1), DbConnection::kNotRun);
  }
  EXPECT_EQ(conn.Count("other"), 3);
  EXPECT_EQ(conn.Count("own"), 1);
  // A statement that does not prepare, or whose ?s do not match the values, runs nothing.
  EXPECT_EQ(conn.ExecKept("INSERT INTO gone(a) VALUES (?);", row, 1), DbConnection::kNotRun);
  EXPECT_EQ(conn.ExecKept("INSERT INTO own(a) VALUES (?, ?);", row, 1), DbConnection::kNotRun);
  EXPECT_EQ(conn.Count("own"), 1);
  // Closing finalises the kept statements; the reopened connection prepares afresh.
  ASSERT_EQ(conn.Close(), 0);
  ASSERT_EQ(conn.Open(path.c_str()), 0);
  EXPECT_EQ(conn.ExecKept(intoOther, row, 1), 0);
  EXPECT_EQ(conn.Count("other"), 4);
}

// A kept statement answers as Exec does: row id and changes of the calling thread, the
// failure of a constraint, and a stop that ends its thread inside a transaction, which a
// later caller rolls back.
TEST_F(DbConnectionTest, KeptStatementsAnswerAsExecAndAnEndedThreadsTransactionRollsBack) {
  Setup({"CREATE TABLE t(id INTEGER PRIMARY KEY, x TEXT NOT NULL);"});
  using Value = DbConnection::BoundValue;
  const char* sql = "INSERT INTO t(id,x) VALUES (?,?);";
  const Value first[] = {{Value::kInteger, 41, nullptr, 0}, {Value::kText, 0, "a", 1}};
  const Value same[] = {{Value::kInteger, 41, nullptr, 0}, {Value::kText, 0, "b", 1}};
  const Value null[] = {{Value::kInteger, 50, nullptr, 0}, {Value::kNull, 0, nullptr, 0}};
  ASSERT_EQ(conn.ExecKept(sql, first, 2), 0);
  EXPECT_EQ(conn.LastInsertRowId(), 41);
  EXPECT_EQ(conn.Changes(), 1);
  EXPECT_EQ(conn.ExecKept(sql, same, 2), -1);
  EXPECT_EQ(conn.ExecKept(sql, null, 2), -1);
  EXPECT_EQ(Select("SELECT id, x FROM t;", "t"), Rows{"41,a,"});

  ASSERT_EQ(sqlite3_create_function(conn.Handle(), "mark", 0, SQLITE_UTF8, nullptr, Mark, nullptr,
                                    nullptr),
            SQLITE_OK);
  // The worker opens a transaction, inserts, then blocks in an endless statement.
  struct InTransaction {
    DbConnection* conn;
    const Value* row;
    std::atomic<bool> returned{false};
    static void* Run(void* arg) {
      InTransaction* self = static_cast<InTransaction*>(arg);
      if (self->conn->BeginTransaction() == 0 &&
          self->conn->ExecKept("INSERT INTO t(id,x) VALUES (?,?);", self->row, 2) == 0) {
        (void)self->conn->Exec(
            "WITH RECURSIVE c(x) AS (SELECT mark() UNION ALL SELECT x + 1 FROM c) "
            "SELECT count(*) FROM c;");
      }
      self->returned = true;
      return nullptr;
    }
  };
  const Value second[] = {{Value::kInteger, 42, nullptr, 0}, {Value::kText, 0, "c", 1}};
  g_marks = 0;
  InTransaction worker{&conn, second};
  pthread_t thread;
  ASSERT_EQ(pthread_create(&thread, nullptr, InTransaction::Run, &worker), 0);
  for (int i = 0; i < 20000 && g_marks == 0; ++i) usleep(500);
  ASSERT_GT(g_marks.load(), 0) << "the worker never entered its statement";
  conn.Interrupt();
  ASSERT_EQ(pthread_join(thread, nullptr), 0);
  EXPECT_FALSE(worker.returned);
  EXPECT_TRUE(conn.InTransaction()) << "an ended thread cannot close its transaction";
  EXPECT_EQ(conn.RollBackOpenTransaction(), 0);
  EXPECT_FALSE(conn.InTransaction());
  EXPECT_EQ(Select("SELECT id FROM t;", "t"), Rows{"41,"});
  EXPECT_EQ(conn.RollBackOpenTransaction(), 0) << "none open: nothing to do";
  // The kept statement the worker held was finalised with it; the next caller prepares anew.
  EXPECT_EQ(conn.ExecKept(sql, second, 2), 0);
  EXPECT_EQ(conn.Count("t"), 2);
  // A failed commit leaves no transaction open either.
  ASSERT_EQ(conn.BeginTransaction(), 0);
  EXPECT_EQ(conn.BeginTransaction(), -1) << "no nesting";
  EXPECT_EQ(conn.CommitTransaction(), 0);
  EXPECT_EQ(conn.CommitTransaction(), -1);
  EXPECT_FALSE(conn.InTransaction());
}

TEST(KeyedOpenTest, OutcomesOfTheKeyedBranch) {
  TempSysroot root("keyed", {"/opt/usr/dbspace", "/usr/lib"});
  std::string db = root.Path("/opt/usr/dbspace/keyed.db");
  std::string lib = root.Path("/usr/lib/libsqlite3.so.0");
  const char kPassword[] = "/opt/usr/dbspace/.SecurePassword.txt";
  SetDbEncryption(true);
  DbConnection conn;
  // A fresh device: the first keyed open makes the password file. The key is the text of
  // derived bytes, so a key whose first byte is zero (one in 256) leaves an empty file, and
  // that open fails; whichever key came out, the outcome must match it.
  int first = conn.Open(db.c_str());
  struct stat st;
  ASSERT_EQ(stat(root.Path(kPassword).c_str(), &st), 0);
  EXPECT_EQ(first, ReadKey().empty() ? -1 : 0);
  if (first == 0) {
    EXPECT_EQ(conn.Close(), 0);
  }
  // A key with text and no key library under the sysroot: the open goes on unkeyed. A new
  // process finds the key on file and derives none.
  ReleaseKeyParams();
  ASSERT_TRUE(root.Write(kPassword, "k3y"));
  EXPECT_EQ(conn.Open(db.c_str()), 0);
  {
    DbConnection::SetupScope setup(&conn);
    EXPECT_EQ(conn.Exec("CREATE TABLE t(x);"), 0);
  }
  EXPECT_EQ(conn.Close(), 0);
  EXPECT_EQ(ReadKey(), "k3y");
  // Debian's library at that path has no sqlite3_key: the open fails.
  ASSERT_EQ(system(("cp -L /usr/lib/x86_64-linux-gnu/libsqlite3.so.0 '" + lib + "'").c_str()), 0);
  EXPECT_EQ(conn.Open(db.c_str()), -1);
  EXPECT_EQ(conn.Handle(), nullptr);
  // An empty key: the open fails, and the file stays as it was.
  ASSERT_EQ(unlink(lib.c_str()), 0);
  ASSERT_EQ(truncate(root.Path(kPassword).c_str(), 0), 0);
  EXPECT_EQ(conn.Open(db.c_str()), -1);
  EXPECT_EQ(ReadKey(), "");
  SetDbEncryption(false);
  ReleaseKeyParams();
}

// The report worker purges batches on the connection the main loop's bus requests use: a
// request's count is its own statement's, whatever the other thread ran in between.
TEST_F(DbConnectionTest, CountsAreThoseOfTheCallingThreadsOwnStatement) {
  Setup({"CREATE TABLE mine(v);", "CREATE TABLE batch(v);"});
  std::atomic<bool> stop{false};
  std::thread other([&] {
    while (!stop.load()) {
      (void)conn.Exec("INSERT INTO batch VALUES (1),(2),(3),(4),(5);");
      (void)conn.Exec("DELETE FROM batch;");
    }
  });
  int wrong = 0;
  for (int i = 0; i < 3000; ++i) {
    if (conn.Exec("INSERT INTO mine VALUES (1);") != 0) ++wrong;
    int id = conn.LastInsertRowId();
    std::string del = "DELETE FROM mine WHERE rowid = " + std::to_string(id) + ";";
    if (conn.Exec(del.c_str()) != 0 || conn.Changes() != 1) ++wrong;
  }
  stop = true;
  other.join();
  EXPECT_EQ(wrong, 0);
  EXPECT_EQ(Select("SELECT count(*) FROM mine;", "mine"), Rows{});  // an empty table yields no row
}

}  // namespace
}  // namespace _CorvaneLogManager
