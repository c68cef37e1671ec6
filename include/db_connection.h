// DbConnection: one SQLite database and the few statement operations the daemon uses.
// Statements run with thread cancellation disabled; a statement interrupted by Interrupt()
// ends the calling thread, which is how a running report job is stopped from outside.
// Every operation runs exactly one statement: a text holding a second one is refused whole.
// One authorizer, installed at Open, judges each statement by the scope of the thread that
// prepares it (see storage/statement_policy.h); a scope belongs to one thread, so the report
// worker's statements stay the daemon's own while the main loop serves a bus request.
#ifndef LOGMGR_INCLUDE_DB_CONNECTION_H_
#define LOGMGR_INCLUDE_DB_CONNECTION_H_

#include <pthread.h>
#include <stddef.h>
#include <stdint.h>

#include <atomic>
#include <mutex>
#include <string>

#include "storage/statement_policy.h"

struct sqlite3;
struct sqlite3_stmt;

namespace _CorvaneLogManager {

class DbConnection {
 public:
  DbConnection() = default;
  ~DbConnection() = default;  // closing is explicit

  // CPU time one bus request's statements may use. A Select of the full 5,000-row table or a
  // Delete scanning it takes about 10 ms here (docs/SECURITY.md has the measurement).
  static constexpr int kBusCpuBudgetMs = 1000;
  // Result columns a bus request's Select may name.
  static constexpr int kBusMaxColumns = 32;

  // While alive, the calling thread's statements on |conn| are the open phase's: they may set
  // pragmas and create tables, and wait for a lock another process holds.
  class SetupScope {
   public:
    explicit SetupScope(DbConnection* conn);
    ~SetupScope();
    SetupScope(const SetupScope&) = delete;
    SetupScope& operator=(const SetupScope&) = delete;

   private:
    DbConnection* conn;
  };

  // While alive, the calling thread's statements on |conn| serve one bus request: they may
  // only touch |table|, fail once the thread has used the CPU budget since the scope began,
  // and a Select fails as soon as its rendered rows (each with a NUL, plus an end byte) would
  // pass LimitResult's bytes.
  class BusRequestScope {
   public:
    BusRequestScope(DbConnection* conn, const char* table);
    ~BusRequestScope();
    BusRequestScope(const BusRequestScope&) = delete;
    BusRequestScope& operator=(const BusRequestScope&) = delete;
    // False when the scope could not be entered (no connection, or a scope already held):
    // the request must then run nothing.
    bool Held() const { return conn != nullptr; }
    void LimitResult(size_t bytes);
    // Whether a Select failed because its result passed the limit.
    bool ResultTooLarge() const;

   private:
    DbConnection* conn;
  };

  // 0 if opened or already open; -1 on failure. |path| is a real file path: callers map the
  // device path with logmgr_fixed_path first. A new file is made owner-only (0600), whatever
  // the umask; SQLite gives its -wal and -shm files the same mode.
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
  // Low 32 bits of the last insert row id; -1 when closed. Both are those of the calling
  // thread's last Exec on this connection, whatever another thread ran since.
  int LastInsertRowId();
  // Rows changed by the last statement; -1 when closed.
  int Changes();
  // Called from another thread: the statement running on this connection, or the next one to
  // start, fails as interrupted and ends the thread that runs it.
  void Interrupt();
  int Close();
  void ReportError();

  sqlite3* Handle() const { return db; }
  // Shortens the bus budget (tests and benchmarks); the default fits the daemon.
  void SetBusCpuBudgetMs(int ms) { busBudgetMs = ms; }

  // ---- Kept statements and transactions -------------------------------------------------
  // One value bound to a kept statement, standing for the literal its text would carry.
  struct BoundValue {
    enum Kind { kNull, kInteger, kText } kind;
    int64_t integer;
    const char* text;  // |length| bytes, no terminator needed
    int length;
  };
  // ExecKept's answer when it ran nothing: the caller runs the statement's literal text.
  static constexpr int kNotRun = 1;
  // Runs |sql|, one statement whose "?"s take |values| in order, from a statement kept per
  // text and per scope. SQLite asks the authorizer at prepare time only, so a kept statement
  // serves only the scope it was judged for: the daemon's own, or a bus request's of the same
  // table. Answers (0 / -1, row id, changes, an interrupt or a spent budget) as Exec does for
  // the text with the values written as literals; kNotRun, with nothing run, in the open
  // phase or when |sql| does not prepare.
  int ExecKept(const char* sql, const BoundValue* values, int count);
  // The calling thread's transaction: BEGIN and COMMIT through Exec (0 / -1). A commit that
  // fails is rolled back, so nothing stays open after either answer.
  int BeginTransaction();
  int CommitTransaction();
  // Rolls back a transaction left open: by a failed step, or by a thread ended inside it
  // (Interrupt). For a normal caller only, never an unwinding one. 0 also when none was open.
  int RollBackOpenTransaction();
  bool InTransaction() const;
  // ---- end of kept statements and transactions -------------------------------------------

 private:
  static int OnProgress(void* self);
  static int OnAuthorize(void* self, int action, const char* arg1, const char* arg2,
                         const char* dbName, const char* trigger);
  static int OnBusy(void* self, int attempts);
  // The scope of the calling thread's statements: the entered scope for the thread that
  // entered it, the daemon's own for every other thread.
  StatementScope ScopeOfThisThread() const;
  // False (nothing changed) when another scope is already held.
  bool EnterScope(StatementScope scope, const char* table);
  void LeaveScope();
  bool BusBudgetSpent();
  // After SQLITE_INTERRUPT: returns when the bus budget ended the statement (an ordinary
  // failure); otherwise ends the thread, as a stop asked.
  void EndThreadUnlessBudgetSpent(sqlite3_stmt* stmt);
  // True when a statement on the calling thread must stop: an interrupt is pending and was
  // requested by another thread.
  bool StopRequestedForThisThread() const;
  // Statement-helper prologue: disables cancellation and ends the thread when an interrupt is
  // already pending (sqlite3_interrupt alone would lose it).
  void BeginStatement();
  [[noreturn]] void EndInterruptedThread();
  // Steps |stmt| to its end and records its changes and row id as the calling thread's last
  // Exec; returns the last step's code.
  int StepToEnd(sqlite3_stmt* stmt);
  // First column of the last row of |sql|; 0 on failure.
  int64_t ScalarQuery(const char* sql);
  // Statement start shared by the queries: begins the statement and prepares |sql|. An
  // interrupted prepare ends the thread; another failure finalises, reports, re-enables
  // cancellation and returns false.
  // A text with more than one statement (or none) fails like a bad one.
  bool PrepareOrFail(const char* sql, sqlite3_stmt** stmt, bool enableCancelOnFailure = true);

  sqlite3* db = nullptr;
  std::atomic<StatementScope> scope{StatementScope::kDaemon};
  std::atomic<pthread_t> scopeThread{};
  // The rest of the scope is read only by the thread that entered it.
  const char* scopeTable = nullptr;
  int busBudgetMs = kBusCpuBudgetMs;
  int64_t busCpuDeadlineNs = 0;
  bool busBudgetSpent = false;
  size_t resultLimit = 0;
  bool resultTooLarge = false;
  // Pending interrupt; consumed by the statement it ends, dropped by Close.
  std::atomic<bool> stopRequested{false};
  std::atomic<pthread_t> stopRequester{};

  // ---- Kept statements -------------------------------------------------------------------
  struct KeptStatement {
    std::string sql;
    StatementScope scope = StatementScope::kDaemon;
    std::string table;  // the bus request's table; empty for the daemon's own
    sqlite3_stmt* stmt = nullptr;
  };
  static constexpr int kKeptStatements = 16;
  // A statement is taken out while it runs, so two threads never share one, and a thread
  // ended inside it (which finalises it) leaves nothing dangling here.
  sqlite3_stmt* TakeKept(const char* sql, StatementScope scope, const char* table);
  void ReturnKept(const char* sql, StatementScope scope, const char* table, sqlite3_stmt* stmt);
  void DropKept();
  std::mutex keptMutex;
  KeptStatement kept[kKeptStatements];
  int keptNext = 0;  // the slot a new statement replaces when all are used
  // ---- end of kept statements ------------------------------------------------------------
};

// Process-wide encryption switch: off at start and never turned on by the daemon.
bool GetDbEncryption();
void SetDbEncryption(bool on);

// The rows a Select (or a provider's SelectRows) hands out, owned here and freed together when
// this goes, also when a stopped worker unwinds through it (memory only, no statement). Pass
// &count and &rows as the select's out-parameters on an empty one.
struct QueryRows {
  QueryRows() = default;
  ~QueryRows() { Reset(); }
  QueryRows(const QueryRows&) = delete;
  QueryRows& operator=(const QueryRows&) = delete;

  const char* operator[](int i) const { return rows[i]; }
  // Frees what is held and leaves the rows empty, ready for another select.
  void Reset();

  char** rows = nullptr;
  int count = 0;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_INCLUDE_DB_CONNECTION_H_
