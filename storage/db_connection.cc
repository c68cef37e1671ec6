#include "db_connection.h"

#include <dlfcn.h>
#include <pthread.h>
#include <sqlite3.h>
#include <stdio.h>
#include <string.h>

#include <new>
#include <string>

#include "platform/fixed_path.h"
#include "storage/key_derivation.h"

namespace _CorvaneLogManager {

namespace {

bool g_encryption = false;

// VM steps between stop-flag checks: small enough that a long scan stops within microseconds.
const int kProgressSteps = 1000;
const char kKeyLibrary[] = "/usr/lib/libsqlite3.so.0";
const int kBusyTimeoutMs = 2000;
const char kJournalPragmas[] = "PRAGMA journal_mode=WAL; PRAGMA synchronous=NORMAL;";
// Rendered cells are cut at these sizes, terminator included.
const size_t kNumberBuffer = 20;
const size_t kTextBuffer = 300;

void EnableCancel() {
  int old = 0;
  (void)pthread_setcancelstate(PTHREAD_CANCEL_ENABLE, &old);
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
  return static_cast<DbConnection*>(self)->StopRequestedForThisThread() ? 1 : 0;
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
  // WAL with synchronous NORMAL: an event's insert costs no fsync; a power cut may drop the
  // last commits but never corrupts the file. A file that refuses it keeps its journal mode.
  // Another process (a second daemon, logmgrctl) may hold the file for a moment: wait for it
  // rather than fail the statement.
  (void)sqlite3_busy_timeout(handle, kBusyTimeoutMs);
  (void)sqlite3_exec(handle, kJournalPragmas, nullptr, nullptr, nullptr);
  sqlite3_progress_handler(handle, kProgressSteps, OnProgress, this);
  db = handle;
  return 0;
}

int DbConnection::Exec(const char* sql) {
  if (sql == nullptr || db == nullptr) return -1;
  BeginStatement();
  char* errmsg = nullptr;
  int rc = sqlite3_exec(db, sql, nullptr, nullptr, &errmsg);
  if (rc == SQLITE_INTERRUPT) {
    sqlite3_free(errmsg);
    EndInterruptedThread();
  }
  if (rc == SQLITE_OK) {
    EnableCancel();
    return 0;
  }
  (void)sqlite3_extended_errcode(db);
  sqlite3_free(errmsg);
  // Deliberately left non-cancellable after a failed statement.
  return -1;
}

int DbConnection::TableExists(const char* name) {
  if (db == nullptr || name == nullptr) return 0;
  char sql[1024];
  (void)snprintf(sql, sizeof(sql), "select count(*) from sqlite_master where name in ('%s')", name);
  BeginStatement();
  sqlite3_stmt* stmt = nullptr;
  (void)sqlite3_prepare_v2(db, sql, -1, &stmt, nullptr);
  int rc = sqlite3_step(stmt);
  if (rc == SQLITE_INTERRUPT) {
    sqlite3_finalize(stmt);
    EndInterruptedThread();
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

bool DbConnection::PrepareOrFail(const char* sql, sqlite3_stmt** stmt) {
  BeginStatement();
  *stmt = nullptr;
  int rc = sqlite3_prepare_v2(db, sql, -1, stmt, nullptr);
  if (rc == SQLITE_INTERRUPT) {
    sqlite3_finalize(*stmt);
    EndInterruptedThread();
  }
  if (rc != SQLITE_OK) {
    sqlite3_finalize(*stmt);
    ReportError();
    EnableCancel();
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
    sqlite3_finalize(stmt);
    EndInterruptedThread();
  }
  if (rc != SQLITE_DONE) value = 0;
  sqlite3_finalize(stmt);
  EnableCancel();
  return value;
}

int DbConnection::Select(const char* sql, const char* table, int* rowCount, char*** rows) {
  if (sql == nullptr || db == nullptr || rowCount == nullptr || rows == nullptr) return -1;
  int capacity = Count(table);
  if (capacity <= 0) {
    *rowCount = 0;
    return 0;
  }
  sqlite3_stmt* stmt = nullptr;
  if (!PrepareOrFail(sql, &stmt)) return -1;
  int rc = SQLITE_ROW;
  int columns = sqlite3_column_count(stmt);
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
  // The array is sized by the whole table; a query yielding more rows than the table holds
  // is cut there rather than written past the array.
  while (index < capacity && (rc = sqlite3_step(stmt)) == SQLITE_ROW) {
    size_t length = 0;
    for (int c = 0; c < columns; ++c) length += RenderColumn(stmt, c, scratch + length);
    // A row whose columns are all NULL becomes an empty text, so every counted slot is valid.
    char* row = new (std::nothrow) char[length + 1]();
    if (row == nullptr) {
      delete[] scratch;
      FreeRows(out, index);
      sqlite3_finalize(stmt);
      EnableCancel();
      return -1;
    }
    memcpy(row, scratch, length);
    out[index++] = row;
  }
  delete[] scratch;
  if (rc == SQLITE_INTERRUPT) {
    FreeRows(out, index);
    sqlite3_finalize(stmt);
    EndInterruptedThread();
  }
  if (index == 0) {
    delete[] out;
    *rows = nullptr;
  }
  sqlite3_finalize(stmt);
  EnableCancel();
  *rowCount = index;
  return 0;
}

int DbConnection::LastInsertRowId() {
  if (db == nullptr) return -1;
  return static_cast<int>(static_cast<uint32_t>(sqlite3_last_insert_rowid(db)));
}

int DbConnection::Changes() { return db == nullptr ? -1 : sqlite3_changes(db); }

void DbConnection::Interrupt() {
  if (db == nullptr) return;
  stopRequester.store(pthread_self(), std::memory_order_release);
  stopRequested.store(true, std::memory_order_release);
  sqlite3_interrupt(db);
}

int DbConnection::Close() {
  if (db == nullptr) return -1;
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

}  // namespace _CorvaneLogManager
