// Properties of a bus request's statement on a real connection: the where or column text a
// caller sends, second statements and aggregates included, never reaches past its table, runs
// only when it is one statement, and succeeds only when SQLite itself ran it to its end.
// Shared by the bus_statement fuzz target and the corpus replay test.
#ifndef LOGMGR_TESTS_FUZZ_BUS_STATEMENT_CHECKS_H_
#define LOGMGR_TESTS_FUZZ_BUS_STATEMENT_CHECKS_H_

#include <sqlite3.h>
#include <stdint.h>
#include <stdlib.h>
#include <unistd.h>

#include <string>

#include "include/db_connection.h"
#include "tests/temp_sysroot.h"

namespace fuzz_checks {

// One database with the caller's table and a table it must never reach, and a plain second
// connection without the daemon's hooks that tells what SQLite makes of a text.
class BusStatementBench {
 public:
  static BusStatementBench& Get() {
    static BusStatementBench bench;
    return bench;
  }

  std::string Check(const uint8_t* data, size_t size) {
    if (size < 1) return "";
    std::string text(reinterpret_cast<const char*>(data) + 1, size - 1);
    text = text.substr(0, text.find('\0'));
    std::string sql;
    switch (data[0] % 3) {
      case 0:
        sql = "DELETE FROM own WHERE " + text + ";";
        break;
      case 1:
        sql = "UPDATE own SET extra = 'f' WHERE " + text + ";";
        break;
      default:
        sql = "SELECT " + text + " FROM own;";
        break;
    }
    if (sql.size() >= 1024) return "";  // the bus checks refuse longer statements first
    Reset();
    int result;
    int rows = 0;
    {
      _CorvaneLogManager::DbConnection::BusRequestScope request(&conn, "own");
      if (!request.Held()) return "bus scope not entered";
      if (data[0] % 3 == 2) {
        char** out = nullptr;
        result = conn.Select(sql.c_str(), "own", &rows, &out);
        for (int i = 0; result == 0 && i < rows; ++i) delete[] out[i];
        if (result == 0 && rows > 0) delete[] out;
      } else {
        result = conn.Exec(sql.c_str());
      }
    }
    if (Fingerprint("other") != otherPrint) return "another table changed: " + sql;
    if (Fingerprint("sqlite_master") != schemaPrint) return "the schema changed: " + sql;
    if (result != 0) return "";
    // Accepted: SQLite must see exactly one statement, and run it to its end without error.
    sqlite3_stmt* stmt = nullptr;
    const char* tail = nullptr;
    if (sqlite3_prepare_v2(plain, sql.c_str(), -1, &stmt, &tail) != SQLITE_OK || stmt == nullptr)
      return "accepted what SQLite cannot prepare: " + sql;
    sqlite3_stmt* second = nullptr;
    int tailRc = sqlite3_prepare_v2(plain, tail, -1, &second, nullptr);
    sqlite3_finalize(second);
    if (tailRc != SQLITE_OK || second != nullptr) {
      sqlite3_finalize(stmt);
      return "accepted a second statement: " + sql;
    }
    if (data[0] % 3 != 2) {
      sqlite3_finalize(stmt);
      return "";
    }
    // Selects only read, so the plain connection can run the same one and compare.
    steps = 0;
    int rc;
    int plainRows = 0;
    while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) ++plainRows;
    sqlite3_finalize(stmt);
    if (rc == SQLITE_INTERRUPT) return "";  // too long for a comparison
    if (rc != SQLITE_DONE) return "a select whose step fails was a success: " + sql;
    if (plainRows < kRows && rows != plainRows) return "rows lost: " + sql;
    return "";
  }

 private:
  static constexpr int kRows = 6;

  BusStatementBench() {
    std::string path = dir.Path("/bus.db");
    if (conn.Open(path.c_str()) != 0) abort();
    conn.SetBusCpuBudgetMs(20);
    {
      _CorvaneLogManager::DbConnection::SetupScope setup(&conn);
      if (conn.Exec("CREATE TABLE own(_id INTEGER PRIMARY KEY AUTOINCREMENT, timestamp "
                    "INTEGER, app_id TEXT, feature TEXT, extra TEXT, value INTEGER);") != 0 ||
          conn.Exec("CREATE TABLE other(secret TEXT);") != 0 ||
          conn.Exec("INSERT INTO other VALUES ('kept');") != 0)
        abort();
    }
    if (sqlite3_open_v2(path.c_str(), &plain, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) abort();
    sqlite3_progress_handler(plain, 1000, &BusStatementBench::Bound, this);
    Reset();
    otherPrint = Fingerprint("other");
    schemaPrint = Fingerprint("sqlite_master");
  }
  ~BusStatementBench() {
    sqlite3_close(plain);
    (void)conn.Close();
  }

  // Values near the integer limit, so that SUM and arithmetic overflow.
  void Reset() {
    if (conn.Exec("DELETE FROM own;") != 0 ||
        conn.Exec("INSERT INTO own(timestamp, app_id, feature, extra, value) VALUES "
                  "(1, 'a', 'F', 'x', 9223372036854775807), (2, 'a', 'F', 'y', 1), "
                  "(3, 'b', 'G', NULL, -9223372036854775807), (4, 'b', 'G', 'z', -2), "
                  "(5, 'c', 'H', 'w', 0), (6, 'c', 'H', '', 4611686018427387904);") != 0)
      abort();
  }

  std::string Fingerprint(const char* table) {
    std::string sql = std::string("SELECT * FROM ") + table + ";";
    sqlite3_stmt* stmt = nullptr;
    std::string print;
    if (sqlite3_prepare_v2(conn.Handle(), sql.c_str(), -1, &stmt, nullptr) != SQLITE_OK)
      return "<unreadable>";
    while (sqlite3_step(stmt) == SQLITE_ROW) {
      for (int c = 0; c < sqlite3_column_count(stmt); ++c) {
        const unsigned char* v = sqlite3_column_text(stmt, c);
        print += v != nullptr ? reinterpret_cast<const char*>(v) : "<null>";
        print += '|';
      }
      print += '\n';
    }
    sqlite3_finalize(stmt);
    return print;
  }

  // The plain connection's run stops after a bounded number of steps: the fuzzer may well
  // find a statement that never ends.
  static int Bound(void* self) { return ++static_cast<BusStatementBench*>(self)->steps > 20000; }

  TempSysroot dir{"fuzz-bus"};
  _CorvaneLogManager::DbConnection conn;
  sqlite3* plain = nullptr;
  int steps = 0;
  std::string otherPrint;
  std::string schemaPrint;
};

// Input: one byte for the method (Delete, Update, Select), then the caller's where (or the
// Select's columns).
inline std::string CheckBusStatement(const uint8_t* data, size_t size) {
  return BusStatementBench::Get().Check(data, size);
}

}  // namespace fuzz_checks

#endif  // LOGMGR_TESTS_FUZZ_BUS_STATEMENT_CHECKS_H_
