#include "include/db_connection.h"

#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <sqlite3.h>
#include <stdio.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <mutex>
#include <new>
#include <string>

#include "platform/fixed_path.h"
#include "storage/key_derivation.h"

namespace _CorvaneLogManager {

namespace {

// What the calling thread's last Exec changed, on which connection.
struct LastExec {
  const void* conn;
  int changes;
  int64_t rowId;
};
thread_local LastExec t_lastExec = {nullptr, 0, 0};

bool g_encryption = false;

// VM steps between stop-flag checks: small enough that a long scan stops within microseconds.
const int kProgressSteps = 1000;
const char kKeyLibrary[] = "/usr/lib/libsqlite3.so.0";
// Only the open phase waits for a lock another process holds (a second daemon creating the
// same tables at its start); the main loop's statements never wait.
const int kSetupBusyWaitMs = 10000;  // a start may wait; a slow or loaded device needs it
const int kBusyPollMs = 10;
const int64_t kUsPerS = 1000000;
const int64_t kUsPerMs = 1000;
const int64_t kNsPerUs = 1000;
const int64_t kNsPerMs = 1000000;
// A database file only the daemon's user may read or write.
const mode_t kOwnerOnly = 0600;
const char* const kJournalPragmas[] = {"PRAGMA journal_mode=WAL;", "PRAGMA synchronous=NORMAL;"};
// No value a daemon statement makes comes near this; a bus request cannot build more.
const int kMaxValueLength = 1 << 20;
// Rendered cells are cut at these sizes, terminator included.
const size_t kNumberBuffer = 20;
const size_t kTextBuffer = 300;

void EnableCancel() {
  int old = 0;
  (void)pthread_setcancelstate(PTHREAD_CANCEL_ENABLE, &old);
}

// From getrusage rather than the thread's CPU clock: a clock interposer that speeds up time
// (libfaketime scales CLOCK_THREAD_CPUTIME_ID too) would otherwise shrink the budget with it.
int64_t ThreadCpuNs() {
  struct rusage usage;
  if (getrusage(RUSAGE_THREAD, &usage) != 0) return 0;
  int64_t us = (static_cast<int64_t>(usage.ru_utime.tv_sec) + usage.ru_stime.tv_sec) * kUsPerS +
               usage.ru_utime.tv_usec + usage.ru_stime.tv_usec;
  return us * kNsPerUs;
}

// Creates |path| owner-only when it does not exist yet. Not following a link, and exclusive,
// so an existing file (or anything else at the path) is left to SQLite as it is.
void CreateOwnerOnly(const char* path) {
  // SQLite's own names (":memory:", "", URIs) are no files to make.
  if (path[0] == '\0' || path[0] == ':' || strncmp(path, "file:", 5) == 0) return;
  int fd = open(path, O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, kOwnerOnly);
  if (fd < 0) return;
  (void)fchmod(fd, kOwnerOnly);  // the umask may have taken bits off, never added any
  (void)close(fd);
}

void FreeRows(char** rows, int count) {
  for (int i = 0; i < count; ++i) delete[] rows[i];
  delete[] rows;
}

// Renders one column as a row text carries it at |out| (room for kTextBuffer bytes): numbers
// are cut at kNumberBuffer, texts and blobs at kTextBuffer (a longer text loses its tail and
// its comma), NULL renders as nothing. Returns the rendered length.
size_t RenderColumn(sqlite3_stmt* stmt, int col, char* out) {
  switch (sqlite3_column_type(stmt, col)) {
    case SQLITE_INTEGER:
      (void)snprintf(out, kNumberBuffer, "%lld,",
                     static_cast<long long>(sqlite3_column_int64(stmt, col)));
      break;
    case SQLITE_FLOAT:
      (void)snprintf(out, kNumberBuffer, "%f,", sqlite3_column_double(stmt, col));
      break;
    case SQLITE_TEXT: {
      const unsigned char* text = sqlite3_column_text(stmt, col);
      if (text == nullptr) return 0;
      (void)snprintf(out, kTextBuffer, "%s,", reinterpret_cast<const char*>(text));
      break;
    }
    case SQLITE_BLOB: {
      const void* blob = sqlite3_column_blob(stmt, col);
      int bytes = blob != nullptr ? sqlite3_column_bytes(stmt, col) : 0;
      // The bytes up to the first NUL, as a text; never read past the blob's end.
      (void)snprintf(out, kTextBuffer, "%.*s,", bytes,
                     blob != nullptr ? static_cast<const char*>(blob) : "");
      break;
    }
    default:
      return 0;
  }
  return strlen(out);
}

}  // namespace

bool GetDbEncryption() { return g_encryption; }
void SetDbEncryption(bool on) { g_encryption = on; }

bool DbConnection::StopRequestedForThisThread() const {
  if (!stopRequested.load(std::memory_order_acquire)) return false;
  // The thread that asked for the stop is never the one to be stopped.
  return !pthread_equal(stopRequester.load(std::memory_order_acquire), pthread_self());
}

// A SQLite callback: it only answers; the thread ends later in the helper's own frame, after
// the statement is finalised (ending it here would leave the connection mutex held).
int DbConnection::OnProgress(void* self) {
  DbConnection* conn = static_cast<DbConnection*>(self);
  if (conn->StopRequestedForThisThread()) return 1;
  return conn->ScopeOfThisThread() == StatementScope::kBusRequest && conn->BusBudgetSpent() ? 1 : 0;
}

int DbConnection::OnAuthorize(void* self, int action, const char* arg1, const char* arg2,
                              const char* dbName, const char*) {
  DbConnection* conn = static_cast<DbConnection*>(self);
  StatementScope current = conn->ScopeOfThisThread();
  return AuthorizeAction(current,
                         current == StatementScope::kBusRequest ? conn->scopeTable : nullptr,
                         action, arg1, arg2, dbName);
}

int DbConnection::OnBusy(void* self, int attempts) {
  DbConnection* conn = static_cast<DbConnection*>(self);
  if (conn->ScopeOfThisThread() != StatementScope::kSetup) return 0;
  if (attempts * kBusyPollMs >= kSetupBusyWaitMs) return 0;
  (void)usleep(kBusyPollMs * kUsPerMs);
  return 1;
}

StatementScope DbConnection::ScopeOfThisThread() const {
  StatementScope current = scope.load(std::memory_order_acquire);
  if (current == StatementScope::kDaemon) return current;
  return pthread_equal(scopeThread.load(std::memory_order_acquire), pthread_self())
             ? current
             : StatementScope::kDaemon;
}

bool DbConnection::EnterScope(StatementScope wanted, const char* table) {
  if (scope.load(std::memory_order_acquire) != StatementScope::kDaemon) return false;
  scopeTable = table;
  busCpuDeadlineNs = ThreadCpuNs() + static_cast<int64_t>(busBudgetMs) * kNsPerMs;
  busBudgetSpent = false;
  resultLimit = SIZE_MAX;
  resultTooLarge = false;
  scopeThread.store(pthread_self(), std::memory_order_release);
  scope.store(wanted, std::memory_order_release);
  return true;
}

void DbConnection::LeaveScope() {
  scope.store(StatementScope::kDaemon, std::memory_order_release);
  scopeTable = nullptr;
}

bool DbConnection::BusBudgetSpent() {
  if (!busBudgetSpent && ThreadCpuNs() > busCpuDeadlineNs) busBudgetSpent = true;
  return busBudgetSpent;
}

void DbConnection::EndThreadUnlessBudgetSpent(sqlite3_stmt* stmt) {
  sqlite3_finalize(stmt);
  if (ScopeOfThisThread() == StatementScope::kBusRequest && busBudgetSpent &&
      !StopRequestedForThisThread())
    return;
  EndInterruptedThread();
}

DbConnection::SetupScope::SetupScope(DbConnection* conn) : conn(conn) {
  if (this->conn != nullptr && !this->conn->EnterScope(StatementScope::kSetup, nullptr))
    this->conn = nullptr;
}

DbConnection::SetupScope::~SetupScope() {
  if (conn != nullptr) conn->LeaveScope();
}

DbConnection::BusRequestScope::BusRequestScope(DbConnection* conn, const char* table) : conn(conn) {
  if (this->conn != nullptr && !this->conn->EnterScope(StatementScope::kBusRequest, table))
    this->conn = nullptr;
}

DbConnection::BusRequestScope::~BusRequestScope() {
  if (conn != nullptr) conn->LeaveScope();
}

void DbConnection::BusRequestScope::LimitResult(size_t bytes) {
  if (conn != nullptr) conn->resultLimit = bytes;
}

bool DbConnection::BusRequestScope::ResultTooLarge() const {
  return conn != nullptr && conn->resultTooLarge;
}

void DbConnection::BeginStatement() {
  int old = 0;
  (void)pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &old);
  if (StopRequestedForThisThread()) EndInterruptedThread();
}

// Only ever called from the statement helpers' own frames, never from a noexcept frame, a
// destructor or a SQLite callback: pthread_exit unwinds the C++ stack.
void DbConnection::EndInterruptedThread() {
  stopRequested.store(false, std::memory_order_release);
  pthread_exit(nullptr);
}

int DbConnection::Open(const char* path) {
  if (db != nullptr) return 0;
  if (path == nullptr) return -1;
  CreateOwnerOnly(path);
  sqlite3* handle = nullptr;
  if (sqlite3_open_v2(path, &handle, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr) !=
      SQLITE_OK) {
    sqlite3_close(handle);
    return -1;
  }
  if (g_encryption) {
    // Deliberately neither kept nor closed: a store that cannot key ends the start anyway.
    if (GetKeyParams() == nullptr) return -1;
    std::string key = ReadKey();
    if (key.empty()) {
      sqlite3_close(handle);
      return -1;
    }
    char lib[4096];
    void* dl = dlopen(logmgr_fixed_path(kKeyLibrary, lib, sizeof(lib)), RTLD_LAZY);
    if (dl != nullptr) {  // no library at that path: the database stays unkeyed
      typedef int (*KeyFn)(sqlite3*, const void*, int);
      KeyFn keyFn = reinterpret_cast<KeyFn>(dlsym(dl, "sqlite3_key"));
      if (keyFn == nullptr) {
        (void)dlerror();
        (void)dlclose(dl);
        sqlite3_close(handle);
        return -1;
      }
      (void)keyFn(handle, key.data(), static_cast<int>(key.size()));
      (void)dlclose(dl);
    }
  }
  db = handle;
  // Installed once for the life of the handle: each hook reads the calling thread's scope,
  // so nothing is set per statement (setting an authorizer expires prepared statements).
  (void)sqlite3_set_authorizer(handle, OnAuthorize, this);
  (void)sqlite3_busy_handler(handle, OnBusy, this);
  sqlite3_progress_handler(handle, kProgressSteps, OnProgress, this);
  (void)sqlite3_limit(handle, SQLITE_LIMIT_LENGTH, kMaxValueLength);
  // WAL with synchronous NORMAL: an event's insert costs no fsync; a power cut may drop the
  // last commits but never corrupts the file. A file that refuses it keeps its journal mode.
  bool readable;
  {
    SetupScope setup(this);
    for (const char* pragma : kJournalPragmas) (void)Exec(pragma);
    // SQLite opens lazily: a file that is not a database would fail every later statement.
    // Failing the open instead leaves the connection closed, so the start is retried until
    // the file is usable.
    readable = Exec("SELECT count(*) FROM sqlite_master;") == 0;
  }
  EnableCancel();  // a refused pragma leaves the thread as it found it
  if (!readable) {
    (void)Close();
    return -1;
  }
  return 0;
}

int DbConnection::StepToEnd(sqlite3_stmt* stmt) {
  int rc;
  // The report worker and the main loop share the connection: the counts a caller reads
  // after its statement are taken under the connection's mutex, before the other thread's
  // next statement can change them.
  sqlite3_mutex* mutex = sqlite3_db_mutex(db);
  sqlite3_mutex_enter(mutex);
  while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
  }
  t_lastExec = {this, sqlite3_changes(db), sqlite3_last_insert_rowid(db)};
  sqlite3_mutex_leave(mutex);
  return rc;
}

int DbConnection::Exec(const char* sql) {
  if (sql == nullptr || db == nullptr) return -1;
  sqlite3_stmt* stmt = nullptr;
  // Deliberately left non-cancellable after a failed statement, a refused text included.
  if (!PrepareOrFail(sql, &stmt, false)) return -1;
  int rc = StepToEnd(stmt);
  if (rc == SQLITE_INTERRUPT) {
    EndThreadUnlessBudgetSpent(stmt);
    return -1;
  }
  sqlite3_finalize(stmt);
  if (rc == SQLITE_DONE) {
    EnableCancel();
    return 0;
  }
  (void)sqlite3_extended_errcode(db);
  return -1;
}

int DbConnection::TableExists(const char* name) {
  if (db == nullptr || name == nullptr) return 0;
  char sql[1024];
  (void)snprintf(sql, sizeof(sql), "select count(*) from sqlite_master where name in ('%s')", name);
  sqlite3_stmt* stmt = nullptr;
  if (!PrepareOrFail(sql, &stmt)) return 0;
  int rc = sqlite3_step(stmt);
  if (rc == SQLITE_INTERRUPT) {
    EndThreadUnlessBudgetSpent(stmt);
    EnableCancel();
    return 0;
  }
  int exists = (rc == SQLITE_ROW && sqlite3_column_int64(stmt, 0) == 1) ? 1 : 0;
  sqlite3_finalize(stmt);
  EnableCancel();
  return exists;
}

int DbConnection::Count(const char* table) {
  if (db == nullptr || table == nullptr) return 0;
  char sql[1024];
  (void)snprintf(sql, sizeof(sql), "select COUNT(*) from %s", table);
  return static_cast<int>(ScalarQuery(sql));
}

int64_t DbConnection::MaxTimestamp(const char* table) {
  if (db == nullptr || table == nullptr) return 0;
  char sql[100];
  (void)snprintf(sql, sizeof(sql), "select MAX(timestamp) from %s", table);
  return ScalarQuery(sql);
}

bool DbConnection::PrepareOrFail(const char* sql, sqlite3_stmt** stmt, bool enableCancelOnFailure) {
  BeginStatement();
  *stmt = nullptr;
  const char* tail = nullptr;
  int rc = sqlite3_prepare_v2(db, sql, -1, stmt, &tail);
  if (rc == SQLITE_INTERRUPT) {
    sqlite3_finalize(*stmt);
    EndInterruptedThread();
  }
  // Exactly one statement: nothing to run is as wrong as a second one to run.
  if (rc != SQLITE_OK || *stmt == nullptr || !IsOnlyBlanksAndComments(tail)) {
    sqlite3_finalize(*stmt);
    *stmt = nullptr;
    ReportError();
    if (enableCancelOnFailure) EnableCancel();
    return false;
  }
  return true;
}

int64_t DbConnection::ScalarQuery(const char* sql) {
  sqlite3_stmt* stmt = nullptr;
  if (!PrepareOrFail(sql, &stmt)) return 0;
  int rc;
  int64_t value = 0;
  while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) value = sqlite3_column_int64(stmt, 0);
  if (rc == SQLITE_INTERRUPT) {
    EndThreadUnlessBudgetSpent(stmt);
    EnableCancel();
    return 0;
  }
  if (rc != SQLITE_DONE) value = 0;
  sqlite3_finalize(stmt);
  EnableCancel();
  return value;
}

// Cell rendering for Select. Each writes one column as a row text carries it at |out| (room for
// kTextBuffer bytes) and returns the length, with the cuts snprintf into a buffer of the cell's
// size made: numbers are cut at kNumberBuffer, texts and blobs at kTextBuffer (a longer one loses
// its tail and its comma), NULL renders as nothing. No terminator is written.

// The decimal digits and comma of |value|.
static size_t RenderIntegerCell(int64_t value, char* out) {
  char digits[24];
  char* end = digits + sizeof(digits);
  char* first = end;
  *--first = ',';
  // Unsigned, so that the smallest integer has a magnitude too.
  uint64_t magnitude = value < 0 ? 0 - static_cast<uint64_t>(value) : static_cast<uint64_t>(value);
  // Two digits a step: a timestamp has thirteen.
  static const char kPairs[] =
      "00010203040506070809101112131415161718192021222324252627282930313233343536373839"
      "40414243444546474849505152535455565758596061626364656667686970717273747576777879"
      "8081828384858687888990919293949596979899";
  while (magnitude >= 10) {
    const char* pair = kPairs + 2 * (magnitude % 100);
    magnitude /= 100;
    *--first = pair[1];
    *--first = pair[0];
  }
  if (magnitude != 0 || first == end - 1) *--first = static_cast<char>('0' + magnitude);
  if (value < 0) *--first = '-';
  size_t length = static_cast<size_t>(end - first);
  if (length > kNumberBuffer - 1) length = kNumberBuffer - 1;
  memcpy(out, first, length);
  return length;
}

// The bytes of |text| up to its first NUL or its |bytes|, whichever comes first, and a comma.
static size_t RenderTextCell(const char* text, size_t bytes, char* out) {
  const size_t room = kTextBuffer - 1;
  size_t length = bytes < room ? bytes : room;
  const void* nul = memchr(text, '\0', length);
  if (nul != nullptr) length = static_cast<size_t>(static_cast<const char*>(nul) - text);
  memcpy(out, text, length);
  if (length < room) out[length++] = ',';
  return length;
}

// One column of the current row of |stmt|. The caller holds the connection's mutex, so the value
// sqlite3_column_value hands out may be read directly, as sqlite3_column_text does inside: one
// lock per cell instead of one per call.
static size_t RenderCell(sqlite3_stmt* stmt, int col, char* out) {
  sqlite3_value* value = sqlite3_column_value(stmt, col);
  switch (sqlite3_value_type(value)) {
    case SQLITE_INTEGER:
      return RenderIntegerCell(sqlite3_value_int64(value), out);
    case SQLITE_FLOAT:
      // Rare in the daemon's tables, and %f's rounding is glibc's: left to snprintf.
      return RenderColumn(stmt, col, out);
    case SQLITE_TEXT: {
      const unsigned char* text = sqlite3_value_text(value);
      if (text == nullptr) return 0;
      return RenderTextCell(reinterpret_cast<const char*>(text),
                            static_cast<size_t>(sqlite3_value_bytes(value)), out);
    }
    case SQLITE_BLOB: {
      const void* blob = sqlite3_value_blob(value);
      // An empty blob has no pointer and renders as its comma alone.
      if (blob == nullptr) return RenderTextCell("", 0, out);
      return RenderTextCell(static_cast<const char*>(blob),
                            static_cast<size_t>(sqlite3_value_bytes(value)), out);
    }
    default:
      return 0;
  }
}

int DbConnection::Select(const char* sql, const char* table, int* rowCount, char*** rows) {
  if (sql == nullptr || db == nullptr || rowCount == nullptr || rows == nullptr) return -1;
  int capacity = Count(table);
  // A count cut short by the bus budget reads as 0; that request has failed, not found nothing.
  if (ScopeOfThisThread() == StatementScope::kBusRequest && busBudgetSpent) return -1;
  if (capacity <= 0) {
    *rowCount = 0;
    return 0;
  }
  sqlite3_stmt* stmt = nullptr;
  if (!PrepareOrFail(sql, &stmt)) return -1;
  int rc = SQLITE_ROW;
  int columns = sqlite3_column_count(stmt);
  bool forBus = ScopeOfThisThread() == StatementScope::kBusRequest;
  // A bus request's result goes into a segment of the caller's choosing: stop as soon as it
  // cannot fit, never build it whole first.
  size_t limit = forBus ? resultLimit : SIZE_MAX;
  size_t used = 1;  // the end mark after the last row
  if (forBus && columns > kBusMaxColumns) {
    sqlite3_finalize(stmt);
    EnableCancel();
    return -1;
  }
  char** out = new (std::nothrow) char*[capacity];
  // One scratch row for the whole select: no cell renders longer than kTextBuffer - 1.
  char* scratch = new (std::nothrow) char[static_cast<size_t>(columns) * kTextBuffer + 1];
  if (out == nullptr || scratch == nullptr) {
    delete[] out;
    delete[] scratch;
    sqlite3_finalize(stmt);
    EnableCancel();
    return -1;
  }
  *rows = out;
  int index = 0;
  bool failed = false;
  // The array is sized by the whole table; a query yielding more rows than the table holds
  // is cut there rather than written past the array.
  // Rows are stepped and read under the connection's mutex, a few rows per hold rather than a
  // lock per call: the report worker shares the connection and gets it between holds.
  const int kRowsPerHold = 32;
  sqlite3_mutex* mutex = sqlite3_db_mutex(db);
  sqlite3_mutex_enter(mutex);
  for (int held = 0; index < capacity; ++held) {
    if (held == kRowsPerHold) {
      sqlite3_mutex_leave(mutex);
      sqlite3_mutex_enter(mutex);
      held = 0;
    }
    rc = sqlite3_step(stmt);
    if (rc != SQLITE_ROW) break;
    size_t length = 0;
    for (int c = 0; c < columns; ++c) length += RenderCell(stmt, c, scratch + length);
    used += length + 1;
    if (used > limit) {
      resultTooLarge = true;
      failed = true;
      break;
    }
    // A row whose columns are all NULL becomes an empty text, so every counted slot is valid.
    char* row = new (std::nothrow) char[length + 1];
    if (row == nullptr) {
      failed = true;
      break;
    }
    memcpy(row, scratch, length);
    row[length] = '\0';
    out[index++] = row;
  }
  sqlite3_mutex_leave(mutex);
  delete[] scratch;
  if (rc == SQLITE_INTERRUPT) {
    FreeRows(out, index);
    *rows = nullptr;
    EndThreadUnlessBudgetSpent(stmt);
    EnableCancel();
    return -1;
  }
  // A step that ends in an error (an overflowing SUM, a corrupt page) is a failed select, not
  // a shorter result.
  if (!failed && rc != SQLITE_ROW && rc != SQLITE_DONE) failed = true;
  if (failed || index == 0) {
    FreeRows(out, index);
    *rows = nullptr;
  }
  sqlite3_finalize(stmt);
  EnableCancel();
  if (failed) return -1;
  *rowCount = index;
  return 0;
}

int DbConnection::LastInsertRowId() {
  if (db == nullptr) return -1;
  int64_t id = t_lastExec.conn == this ? t_lastExec.rowId : sqlite3_last_insert_rowid(db);
  return static_cast<int>(static_cast<uint32_t>(id));
}

int DbConnection::Changes() {
  if (db == nullptr) return -1;
  return t_lastExec.conn == this ? t_lastExec.changes : sqlite3_changes(db);
}

void DbConnection::Interrupt() {
  if (db == nullptr) return;
  stopRequester.store(pthread_self(), std::memory_order_release);
  stopRequested.store(true, std::memory_order_release);
  sqlite3_interrupt(db);
}

int DbConnection::Close() {
  if (db == nullptr) return -1;
  DropKept();
  sqlite3_stmt* stmt = nullptr;
  while ((stmt = sqlite3_next_stmt(db, nullptr)) != nullptr) (void)sqlite3_finalize(stmt);
  if (sqlite3_close(db) != SQLITE_OK) {
    ReportError();
    return -1;
  }
  db = nullptr;
  stopRequested.store(false, std::memory_order_release);
  return 0;
}

void DbConnection::ReportError() {
  if (db != nullptr) (void)sqlite3_errmsg(db);  // nothing is logged
}

// ---- Kept statements and transactions ----------------------------------------------------

sqlite3_stmt* DbConnection::TakeKept(const char* sql, StatementScope scope, const char* table) {
  size_t length = strlen(sql);
  std::lock_guard<std::mutex> lock(keptMutex);
  for (KeptStatement& entry : kept) {
    if (entry.stmt != nullptr && entry.scope == scope && entry.sql.size() == length &&
        memcmp(entry.sql.data(), sql, length) == 0 && entry.table == table) {
      sqlite3_stmt* stmt = entry.stmt;
      entry.stmt = nullptr;
      return stmt;
    }
  }
  return nullptr;
}

void DbConnection::ReturnKept(const char* sql, StatementScope scope, const char* table,
                              sqlite3_stmt* stmt) {
  (void)sqlite3_reset(stmt);
  (void)sqlite3_clear_bindings(stmt);
  std::lock_guard<std::mutex> lock(keptMutex);
  KeptStatement* slot = nullptr;
  for (KeptStatement& entry : kept) {
    if (entry.stmt == nullptr && entry.scope == scope && entry.table == table && entry.sql == sql) {
      slot = &entry;  // its own slot, emptied when it was taken
      break;
    }
  }
  for (int i = 0; slot == nullptr && i < kKeptStatements; ++i) {
    if (kept[i].stmt == nullptr && kept[i].sql.empty()) slot = &kept[i];
  }
  if (slot == nullptr) {
    slot = &kept[keptNext];
    keptNext = (keptNext + 1) % kKeptStatements;
  }
  if (slot->stmt != nullptr) {
    // Another thread kept the same text meanwhile, or an old text gives way.
    if (slot->sql == sql && slot->scope == scope && slot->table == table) {
      sqlite3_finalize(stmt);
      return;
    }
    sqlite3_finalize(slot->stmt);
  }
  slot->sql = sql;
  slot->scope = scope;
  slot->table = table;
  slot->stmt = stmt;
}

void DbConnection::DropKept() {
  std::lock_guard<std::mutex> lock(keptMutex);
  for (KeptStatement& entry : kept) {
    if (entry.stmt != nullptr) sqlite3_finalize(entry.stmt);
    entry = KeptStatement();
  }
  keptNext = 0;
}

int DbConnection::ExecKept(const char* sql, const BoundValue* values, int count) {
  if (sql == nullptr || db == nullptr || (count > 0 && values == nullptr)) return -1;
  StatementScope current = ScopeOfThisThread();
  if (current == StatementScope::kSetup) return kNotRun;
  // The table is part of the key: a statement judged for one bus request's table is never
  // run for another's, nor one judged for the daemon for any bus request.
  const char* table =
      current == StatementScope::kBusRequest && scopeTable != nullptr ? scopeTable : "";
  BeginStatement();
  sqlite3_stmt* stmt = TakeKept(sql, current, table);
  if (stmt == nullptr) {
    // Cancellation stays off as after Exec's prepare; the caller's Exec settles it.
    if (!PrepareOrFail(sql, &stmt, false)) return kNotRun;
    if (sqlite3_bind_parameter_count(stmt) != count) {
      sqlite3_finalize(stmt);
      return kNotRun;
    }
  }
  for (int i = 0; i < count; ++i) {
    const BoundValue& value = values[i];
    int rc = SQLITE_OK;
    switch (value.kind) {
      case BoundValue::kNull:
        rc = sqlite3_bind_null(stmt, i + 1);
        break;
      case BoundValue::kInteger:
        rc = sqlite3_bind_int64(stmt, i + 1, value.integer);
        break;
      case BoundValue::kText:
        rc = sqlite3_bind_text(stmt, i + 1, value.text, value.length, SQLITE_STATIC);
        break;
    }
    if (rc != SQLITE_OK) {
      sqlite3_finalize(stmt);
      return kNotRun;
    }
  }
  int rc = StepToEnd(stmt);
  if (rc == SQLITE_INTERRUPT) {
    EndThreadUnlessBudgetSpent(stmt);
    return -1;
  }
  ReturnKept(sql, current, table, stmt);
  if (rc == SQLITE_DONE) {
    EnableCancel();
    return 0;
  }
  return -1;
}

int DbConnection::BeginTransaction() { return Exec("BEGIN;"); }

int DbConnection::CommitTransaction() {
  if (Exec("COMMIT;") == 0) return 0;
  (void)RollBackOpenTransaction();
  return -1;
}

int DbConnection::RollBackOpenTransaction() {
  if (db == nullptr || !InTransaction()) return 0;
  return Exec("ROLLBACK;");
}

bool DbConnection::InTransaction() const {
  return db != nullptr && sqlite3_get_autocommit(db) == 0;
}

void QueryRows::Reset() {
  if (rows != nullptr) FreeRows(rows, count);
  rows = nullptr;
  count = 0;
}

}  // namespace _CorvaneLogManager
