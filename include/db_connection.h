// DbConnection: one SQLite database and the few statement operations the daemon uses.
// Statements run with thread cancellation disabled; a statement interrupted by Interrupt()
// ends the calling thread, which is how a running report job is stopped from outside.
#ifndef LOGMGR_INCLUDE_DB_CONNECTION_H_
#define LOGMGR_INCLUDE_DB_CONNECTION_H_

#include <pthread.h>
#include <stdint.h>

#include <atomic>

struct sqlite3;
struct sqlite3_stmt;

namespace _CorvaneLogManager {

class DbConnection {
 public:
  DbConnection() = default;
  ~DbConnection() = default;  // closing is explicit

  // 0 if opened or already open; -1 on failure. |path| is a real file path: callers map the
  // device path with logmgr_fixed_path first.
  int Open(const char* path);
  int Exec(const char* sql);
  // 1 if exactly one schema object of that name exists, else 0.
  int TableExists(const char* name);
  // Row count of |table|; 0 on any failure.
  int Count(const char* table);
  // Largest timestamp of |table|; 0 on failure or an empty table.
  int64_t MaxTimestamp(const char* table);
  // Runs |sql| and renders each row as its columns, each followed by a comma. The row array
  // has room for Count(table) rows; with a row count above 0 the caller frees each row and
  // the array (delete[]); with 0 nothing is left to free.
  int Select(const char* sql, const char* table, int* rowCount, char*** rows);
  // Low 32 bits of the last insert row id; -1 when closed.
  int LastInsertRowId();
  // Rows changed by the last statement; -1 when closed.
  int Changes();
  // Called from another thread: the statement running on this connection, or the next one to
  // start, fails as interrupted and ends the thread that runs it.
  void Interrupt();
  int Close();
  void ReportError();

  sqlite3* Handle() const { return db; }

 private:
  static int OnProgress(void* self);
  // True when a statement on the calling thread must stop: an interrupt is pending and was
  // requested by another thread.
  bool StopRequestedForThisThread() const;
  // Statement-helper prologue: disables cancellation and ends the thread when an interrupt is
  // already pending (sqlite3_interrupt alone would lose it).
  void BeginStatement();
  [[noreturn]] void EndInterruptedThread();
  // First column of the last row of |sql|; 0 on failure.
  int64_t ScalarQuery(const char* sql);
  // Statement start shared by the queries: begins the statement and prepares |sql|. An
  // interrupted prepare ends the thread; another failure finalises, reports, re-enables
  // cancellation and returns false.
  bool PrepareOrFail(const char* sql, sqlite3_stmt** stmt);

  sqlite3* db = nullptr;
  // Pending interrupt; consumed by the statement it ends, dropped by Close.
  std::atomic<bool> stopRequested{false};
  std::atomic<pthread_t> stopRequester{};
};

// Process-wide encryption switch: off at start and never turned on by the daemon.
bool GetDbEncryption();
void SetDbEncryption(bool on);

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_INCLUDE_DB_CONNECTION_H_
