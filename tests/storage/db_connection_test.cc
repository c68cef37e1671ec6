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
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "storage/key_derivation.h"
#include "tests/temp_sysroot.h"

namespace _CorvaneLogManager {
namespace {

using Rows = std::vector<std::string>;
using Value = DbConnection::BoundValue;

// |f|'s answer, run on another thread, as the report worker runs while the main loop serves.
int OnOtherThread(const std::function<int()>& f) {
  int result = 2;
  std::thread([&] { result = f(); }).join();
  return result;
}

class DbConnectionTest : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(conn.Open(path.c_str()), 0); }
  void TearDown() override { (void)conn.Close(); }
  // The open phase, the only time tables may be made.
  void Setup(std::initializer_list<const char*> statements) {
    DbConnection::SetupScope setup(&conn);
    for (const char* sql : statements) ASSERT_EQ(conn.Exec(sql), 0) << sql;
  }
  // A Select's rows as strings; |rc| gets its result.
  Rows Select(const std::string& sql, const char* table, int* rc = nullptr) {
    QueryRows rows;
    int result = conn.Select(sql.c_str(), table, &rows.count, &rows.rows);
    if (rc != nullptr) *rc = result;
    if (result != 0) return {};
    EXPECT_TRUE(rows.count > 0 || rows.rows == nullptr) << "nothing may be left to free";
    return Rows(rows.rows, rows.rows + rows.count);
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
    int type = sqlite3_column_type(stmt, c);
    const void* blob = sqlite3_column_blob(stmt, c);
    if (type == SQLITE_INTEGER)
      snprintf(cell, 20, "%lld,", static_cast<long long>(sqlite3_column_int64(stmt, c)));
    else if (type == SQLITE_FLOAT)
      snprintf(cell, 20, "%f,", sqlite3_column_double(stmt, c));
    else if (type == SQLITE_TEXT)
      snprintf(cell, sizeof(cell), "%s,", sqlite3_column_text(stmt, c));
    else if (type == SQLITE_BLOB)
      snprintf(cell, sizeof(cell), "%.*s,", blob ? sqlite3_column_bytes(stmt, c) : 0,
               blob ? static_cast<const char*>(blob) : "");
    row += cell;
  }
  return row;
}

TEST_F(DbConnectionTest, RendersEveryCellAsTheFormattedRenderingDid) {
  // Extreme integers and reals, texts with NULs and commas, blobs and NULL, at and past both cuts.
  std::string values =
      "0;-1;9;10;-10;99999999999999999;999999999999999999;1000000000000000000;-99999999999999999;"
      "-999999999999999999;9223372036854775807;-9223372036854775808;0.0;-1.5;1e15;-1e300;1e-300;"
      "123456.7890125;'';',';'a,b,';CAST(x'610062' AS TEXT);CAST(x'00' AS TEXT);"
      "printf('%.297c', 'a');printf('%.298c', 'b');printf('%.299c', 'c');printf('%.300c', 'd');"
      "printf('%.1000c', 'e');printf('%.297c', 'f') || 'éé';x'';x'00';x'6100';x'616263';"
      "zeroblob(3);CAST(printf('%.299c', 'g') AS BLOB);CAST(printf('%.300c', 'h') AS BLOB);NULL;";
  Setup({"CREATE TABLE v(id INTEGER PRIMARY KEY, x);"});
  size_t count = 0;
  for (size_t at = 0, end; (end = values.find(';', at)) != std::string::npos; at = end + 1, ++count)
    ASSERT_EQ(conn.Exec(("INSERT INTO v(x) VALUES(" + values.substr(at, end - at) + ");").c_str()),
              0);
  // Each value next to its neighbours; then the widest row a bus request may ask.
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
    ASSERT_EQ(want.size(), count);
    EXPECT_EQ(Select(sql, "v"), want);
    // A bus request's limit falls on the rendered bytes exactly.
    for (size_t limit : {bytes, bytes - 1}) {
      DbConnection::BusRequestScope request(&conn, "v");
      request.LimitResult(limit);
      EXPECT_EQ(Select(sql, "v").size(), limit == bytes ? want.size() : 0u);
      EXPECT_EQ(request.ResultTooLarge(), limit != bytes);
    }
  }
}

TEST_F(DbConnectionTest, SizesSelectByTheNamedTableAndAnswersFailureValues) {
  Setup({"CREATE TABLE small(x);", "INSERT INTO small VALUES(1),(2);",
         "CREATE TABLE big(id INTEGER PRIMARY KEY, timestamp INTEGER);", "CREATE TABLE empty(x);"});
  EXPECT_EQ(conn.MaxTimestamp("big"), 0) << "empty table";
  ASSERT_EQ(conn.Exec("INSERT INTO big VALUES(1, 5000000000), (2, 1), (3, 1), (4, 1), "
                      "(8589934597, 17);"),
            0);
  EXPECT_EQ(conn.MaxTimestamp("big"), 5000000000LL);
  EXPECT_EQ(conn.Changes(), 5);
  EXPECT_EQ(conn.LastInsertRowId(), 5) << "low 32 bits of 2^33 + 5";
  // More rows than the named table holds are cut, never written past the array.
  EXPECT_EQ(Select("SELECT id FROM big ORDER BY id;", "small"), (Rows{"1,", "2,"}));
  EXPECT_EQ(Select("SELECT id FROM big;", "big").size(), 5u);
  // An empty or missing named table: nothing is prepared, so even bad SQL yields 0 rows.
  for (const char* table : {"empty", "missing", "big"}) {
    SCOPED_TRACE(table);
    int rc = 1;
    EXPECT_TRUE(Select("SELECT nonsense FROM nowhere;", table, &rc).empty());
    EXPECT_EQ(rc, std::string(table) == "big" ? -1 : 0);
  }
  EXPECT_EQ(conn.TableExists("big"), 1);
  EXPECT_EQ(conn.TableExists("nolog") + conn.Count("nolog") + conn.MaxTimestamp("nolog"), 0);
  EXPECT_EQ(conn.Exec("INSERT INTO nolog VALUES(1);"), -1);

  sqlite3* first = conn.Handle();
  EXPECT_EQ(conn.Open((dir + "/other.db").c_str()), 0);
  EXPECT_EQ(conn.Handle(), first) << "a second Open keeps the first handle";
  ASSERT_EQ(conn.Close(), 0);
  conn.Interrupt();  // closed: nothing to do
  int rc = 0;
  (void)Select("SELECT 1;", "big", &rc);
  for (int closed :
       {rc, conn.Close(), conn.LastInsertRowId(), conn.Changes(), conn.Exec("SELECT 1;")})
    EXPECT_EQ(closed, -1);
  EXPECT_EQ(DbConnection().Open((dir + "/no/such/dir/x.db").c_str()), -1);
}

std::atomic<int> g_marks{0};

// SQL function mark(): shows the test that a statement is running inside SQLite.
void Mark(sqlite3_context* ctx, int, sqlite3_value**) {
  ++g_marks;
  sqlite3_result_int(ctx, 0);
}

const char kEndless[] =
    "WITH RECURSIVE c(x) AS (SELECT mark() UNION ALL SELECT x + 1 FROM c) SELECT count(*) FROM c;";

// |body| on a thread of its own, as the report job runs.
struct Worker {
  explicit Worker(std::function<void()> f) : body(std::move(f)) {
    EXPECT_EQ(pthread_create(&thread, nullptr, &Worker::Run, this), 0);
  }
  static void* Run(void* self) {
    static_cast<Worker*>(self)->body();
    static_cast<Worker*>(self)->returned = true;
    return nullptr;
  }
  // False when the thread was ended inside |body|.
  bool Join() {
    struct timespec deadline;  // a guard against a hang, not a timing check
    clock_gettime(CLOCK_REALTIME, &deadline);
    deadline.tv_sec += 60;
    EXPECT_EQ(pthread_timedjoin_np(thread, nullptr, &deadline), 0) << "worker still running";
    return returned;
  }
  std::function<void()> body;
  std::atomic<bool> returned{false};
  pthread_t thread;
};

// An interrupted worker ends inside its statement; one ended inside a transaction leaves it
// open for a later caller to roll back, and its kept statement is finalised with it.
TEST_F(DbConnectionTest, InterruptEndsTheThreadRunningTheStatement) {
  Setup({"CREATE TABLE t(id INTEGER PRIMARY KEY);", "INSERT INTO t VALUES(1);"});
  ASSERT_EQ(sqlite3_create_function(conn.Handle(), "mark", 0, SQLITE_UTF8, nullptr, Mark, nullptr,
                                    nullptr),
            SQLITE_OK);
  const char* insert = "INSERT INTO t(id) VALUES (?);";
  const Value second[] = {{Value::kInteger, 2, nullptr, 0}};
  enum { kExec, kSelect, kInTransaction, kInterruptFirst };
  for (int c : {kExec, kSelect, kInTransaction, kInterruptFirst}) {
    SCOPED_TRACE(c);
    g_marks = 0;
    if (c == kInterruptFirst) {  // before the statement starts
      conn.Interrupt();
      EXPECT_EQ(conn.Exec("UPDATE t SET id = id;"), 0) << "the requester's own run on";
    }
    Worker worker([&] {
      QueryRows rows;
      if (c == kSelect)
        (void)conn.Select(kEndless, "t", &rows.count, &rows.rows);
      else if (c != kInTransaction ||
               (conn.BeginTransaction() == 0 && conn.ExecKept(insert, second, 1) == 0))
        (void)conn.Exec(kEndless);
    });
    if (c != kInterruptFirst) {
      for (int i = 0; i < 20000 && g_marks == 0; ++i) usleep(500);
      ASSERT_GT(g_marks.load(), 0) << "the worker never entered its statement";
      conn.Interrupt();
    }
    EXPECT_FALSE(worker.Join()) << "the interrupted statement must end its thread";
    EXPECT_EQ(conn.InTransaction(), c == kInTransaction);
    EXPECT_EQ(conn.RollBackOpenTransaction(), 0);
    EXPECT_FALSE(conn.InTransaction());
    EXPECT_EQ(Select("SELECT id FROM t;", "t"), Rows{"1,"}) << "the interrupt is spent";
  }
  EXPECT_EQ(conn.ExecKept(insert, second, 1), 0) << "prepared anew";
  ASSERT_EQ(conn.BeginTransaction(), 0);
  EXPECT_EQ(conn.BeginTransaction(), -1) << "no nesting";
  EXPECT_EQ(conn.CommitTransaction(), 0);
  EXPECT_EQ(conn.CommitTransaction(), -1);
  EXPECT_FALSE(conn.InTransaction());
}

TEST_F(DbConnectionTest, RunsExactlyOneStatementOrNothing) {
  Setup({"CREATE TABLE t(x);", "CREATE TABLE other(y);", "INSERT INTO other VALUES('kept');"});
  for (const char* sql :
       {"INSERT INTO t VALUES(1);", "INSERT INTO t VALUES(2); -- a note\n /* and another */ ",
        "INSERT INTO t VALUES(3); /* left open"})
    EXPECT_EQ(conn.Exec(sql), 0) << sql;
  for (const char* sql :
       {"INSERT INTO t VALUES(4); DELETE FROM other;",
        "INSERT INTO t VALUES(5); INSERT INTO t VALUES(6);", "DELETE FROM other WHERE 0;; ",
        "DELETE FROM other WHERE 0; -- x\n DROP TABLE other", "", "-- nothing to run"})
    EXPECT_EQ(conn.Exec(sql), -1) << sql;
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
  const std::vector<std::string> everywhere = {"INSERT INTO t VALUES(1);",
                                               "UPDATE t SET x = x + 1;",
                                               "PRAGMA user_version;",
                                               "SELECT count(*) FROM sqlite_master;",
                                               "BEGIN;",
                                               "COMMIT;"};
  const std::vector<std::string> openPhaseOnly = {
      "PRAGMA user_version = 7;", "CREATE TABLE IF NOT EXISTS w(y);",
      "CREATE INDEX IF NOT EXISTS tx ON t(x);", "CREATE TEMP TABLE tt(z);"};
  const std::vector<std::string> never = {
      "PRAGMA writable_schema = 1;",
      "DROP TABLE u;",
      "DROP INDEX tx;",
      "ALTER TABLE t ADD COLUMN z;",
      "CREATE TRIGGER tr AFTER INSERT ON t BEGIN DELETE FROM t; END;",
      "CREATE VIEW v AS SELECT x FROM t;",
      "DELETE FROM sqlite_master;",
      "UPDATE sqlite_master SET sql = 'x';"};
  for (bool inSetup : {false, true}) {
    DbConnection::SetupScope setup(inSetup ? &conn : nullptr);
    for (const auto* list : {&everywhere, &openPhaseOnly, &never}) {
      for (const std::string& sql : *list) {
        bool allowed = list == &everywhere || (inSetup && list == &openPhaseOnly);
        EXPECT_EQ(conn.Exec(sql.c_str()), allowed ? 0 : -1) << (inSetup ? "setup: " : "") << sql;
      }
    }
    if (!inSetup) {
      EXPECT_EQ(Select("PRAGMA user_version;", "t"), Rows{"1,"});
      EXPECT_EQ(Select(kNames, "t"), Rows{"t u,"});
    }
    // ATTACH is never allowed, and no file appears for it.
    EXPECT_EQ(conn.Exec(("ATTACH DATABASE '" + attached + "' AS a;").c_str()), -1);
    EXPECT_NE(access(attached.c_str(), F_OK), 0);
  }
  EXPECT_EQ(Select(kNames, "t"), Rows{"t tx u w,"});
}

TEST_F(DbConnectionTest, AStepThatEndsInAnErrorIsAFailure) {
  Setup({"CREATE TABLE t(id INTEGER PRIMARY KEY, v INTEGER, timestamp INTEGER);",
         "INSERT INTO t(v, timestamp) VALUES (9223372036854775807, 1), (1, 2), (3, 3);"});
  // SUM overflows only at the second row, after stepping began; an error on the third row of a
  // plain select loses the first two too.
  for (const char* sql : {"SELECT SUM(v) FROM t;",
                          "SELECT CASE WHEN id = 3 THEN abs(-9223372036854775807 - 1) ELSE v END "
                          "FROM t ORDER BY id;"}) {
    int rc = 0;
    EXPECT_TRUE(Select(sql, "t", &rc).empty());
    EXPECT_EQ(rc, -1) << sql;
  }
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
    for (const char* sql : {"INSERT INTO own(a) VALUES ('x');",
                            "UPDATE own SET a = upper(a) WHERE a IN (SELECT a FROM own);",
                            "SELECT count(*), max(a) FROM own;", "DELETE FROM own WHERE a = 'X';"})
      EXPECT_EQ(conn.Exec(sql), 0) << sql;
    for (const char* sql :
         {"SELECT a, (SELECT b FROM other) FROM own;",
          "DELETE FROM own WHERE a IN (SELECT b FROM other);", "INSERT INTO other(b) VALUES (1);",
          "SELECT name FROM sqlite_master;", "ATTACH DATABASE ':memory:' AS x;",
          "PRAGMA user_version = 3;", "PRAGMA user_version;", "DROP TABLE other;",
          "CREATE TABLE x(c);", "BEGIN;", "VACUUM;",
          "WITH RECURSIVE r(n) AS (SELECT 1 UNION ALL SELECT n + 1 FROM r) SELECT n FROM r;",
          "SELECT randomblob(10) FROM own;",
          "SELECT replace(printf('%.1000000c', 'x'), 'x', 'xx') FROM own;",
          "DELETE FROM own WHERE 1; DELETE FROM other;"})
      EXPECT_EQ(conn.Exec(sql), -1) << sql;
    // The scope is this thread's: the worker's statements meanwhile stay the daemon's own.
    EXPECT_EQ(OnOtherThread([&] { return conn.Exec("INSERT INTO other VALUES(2);"); }), 0);
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
  EXPECT_EQ(conn.Exec("INSERT INTO other(b) SELECT a FROM own LIMIT 1;"), 0) << "daemon's again";
  // Every row renders as "row," plus a NUL, and one byte ends the result.
  for (size_t limit : {size_t{6}, size_t{5}, size_t{200 * 5 + 1}, size_t{200 * 5}}) {
    DbConnection::BusRequestScope request(&conn, "own");
    request.LimitResult(limit);
    int rc = 0;
    bool fits = limit == 6 || limit == 200 * 5 + 1;
    EXPECT_EQ(
        Select(limit < 10 ? "SELECT a FROM own LIMIT 1;" : "SELECT a FROM own;", "own", &rc).size(),
        fits ? (limit == 6 ? 1u : 200u) : 0u)
        << limit;
    EXPECT_EQ(rc, fits ? 0 : -1);
    EXPECT_EQ(request.ResultTooLarge(), !fits);
  }
  std::string columns = "a";
  for (int i = 1; i <= DbConnection::kBusMaxColumns; ++i) columns += ",a";
  DbConnection::BusRequestScope request(&conn, "own");
  int rc = 0;
  (void)Select("SELECT " + columns + " FROM own;", "own", &rc);
  EXPECT_EQ(rc, -1) << "one column more than a bus request may name";
}

// A kept statement was judged by the authorizer once, at its prepare: it may serve only the
// scope (and for a bus request the table) it was judged for, and answers as Exec does.
TEST_F(DbConnectionTest, KeptStatementsServeOnlyTheScopeTheyWereJudgedFor) {
  Setup({"CREATE TABLE own(a);", "CREATE TABLE other(id INTEGER PRIMARY KEY, b NOT NULL);"});
  const Value row[] = {{Value::kText, 0, "v", 1}};
  const char* intoOther = "INSERT INTO other(b) VALUES (?);";
  const char* intoOwn = "INSERT INTO own(a) VALUES (?);";
  const char* withId = "INSERT INTO other(id,b) VALUES (?,?);";
  const Value first[] = {{Value::kInteger, 41, nullptr, 0}, {Value::kText, 0, "a", 1}};
  const Value null[] = {{Value::kInteger, 50, nullptr, 0}, {Value::kNull, 0, nullptr, 0}};
  ASSERT_EQ(conn.ExecKept(withId, first, 2), 0);
  EXPECT_EQ(conn.LastInsertRowId(), 41);
  EXPECT_EQ(conn.Changes(), 1);
  EXPECT_EQ(conn.ExecKept(withId, first, 2), -1) << "the id is taken";
  EXPECT_EQ(conn.ExecKept(withId, null, 2), -1);
  EXPECT_EQ(conn.ExecKept(intoOther, row, 1), 0);
  {
    DbConnection::BusRequestScope request(&conn, "own");
    ASSERT_TRUE(request.Held());
    EXPECT_EQ(conn.ExecKept(intoOther, row, 1), DbConnection::kNotRun);
    EXPECT_EQ(conn.ExecKept(intoOwn, row, 1), 0);
    EXPECT_EQ(OnOtherThread([&] { return conn.ExecKept(intoOther, row, 1); }), 0)
        << "another thread's stay the daemon's own";
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
  // A statement that does not prepare, or whose ?s do not match the values, runs nothing.
  EXPECT_EQ(conn.ExecKept("INSERT INTO gone(a) VALUES (?);", row, 1), DbConnection::kNotRun);
  EXPECT_EQ(conn.ExecKept("INSERT INTO own(a) VALUES (?, ?);", row, 1), DbConnection::kNotRun);
  EXPECT_EQ(Select("SELECT (SELECT count(*) FROM own), count(*) FROM other;", "other"),
            Rows{"1,3,"});
  // Closing finalises the kept statements; the reopened connection prepares afresh.
  ASSERT_EQ(conn.Close(), 0);
  ASSERT_EQ(conn.Open(path.c_str()), 0);
  EXPECT_EQ(conn.ExecKept(intoOther, row, 1), 0);
  EXPECT_EQ(conn.Count("other"), 4);
}

TEST_F(DbConnectionTest, NewFilesAreOwnerOnlyWhateverTheUmask) {
  ASSERT_EQ(conn.Close(), 0);
  ASSERT_EQ(unlink(path.c_str()), 0);
  mode_t old = umask(0);
  ASSERT_EQ(conn.Open(path.c_str()), 0);
  umask(old);
  Setup({"CREATE TABLE t(x);", "INSERT INTO t VALUES(1);"});
  for (const char* suffix : {"", "-wal", "-shm"}) {
    struct stat st;
    ASSERT_EQ(stat((path + suffix).c_str(), &st), 0) << suffix;
    EXPECT_EQ(st.st_mode & 0777, 0600u) << suffix;
  }
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
  ASSERT_EQ(access(root.Path(kPassword).c_str(), F_OK), 0);
  EXPECT_EQ(first, ReadKey().empty() ? -1 : 0);
  EXPECT_EQ(conn.Close(), first);
  // A key with text and no key library under the sysroot: the open goes on unkeyed. A new
  // process finds the key on file and derives none.
  ReleaseKeyParams();
  ASSERT_TRUE(root.Write(kPassword, "k3y"));
  EXPECT_EQ(conn.Open(db.c_str()), 0);
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
    std::string del = "DELETE FROM mine WHERE rowid = " + std::to_string(conn.LastInsertRowId());
    if (conn.Exec(del.c_str()) != 0 || conn.Changes() != 1) ++wrong;
  }
  stop = true;
  other.join();
  EXPECT_EQ(wrong, 0);
  EXPECT_EQ(conn.Count("mine"), 0);
}

}  // namespace
}  // namespace _CorvaneLogManager
