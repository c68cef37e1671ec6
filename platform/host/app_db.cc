// One read-only connection with both lookups prepared, and the answers already given, are kept
// for as long as nothing in the database's directory says the file changed: an inotify watch on
// the directory reports a file renamed over it or created, and every write to the file, its
// rollback journal or its WAL log. Any such event drops the answers and the connection (an open
// connection would go on reading a replaced file's old inode); the next lookup reopens. Without
// a watch (no directory yet) every lookup opens and closes the file, as it must then.
#include "platform/host/app_db.h"

#include <errno.h>
#include <sqlite3.h>
#include <string.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <mutex>
#include <unordered_map>

#include "platform/fixed_path.h"

namespace logmgr_host {

namespace {

const char kAppDb[] = "/opt/dbspace/.pkgmgr_parser.db";

// Indexed by AppColumn. Rows with the same executable come in rowid order from the app_exec
// index as well as from a scan, so a file written without the index gives the same answers.
const char* const kSql[] = {
    "SELECT app_id, package, app_exec FROM package_app_info WHERE app_id = ?1 ORDER BY rowid",
    "SELECT app_id, package, app_exec FROM package_app_info WHERE app_exec = ?1 ORDER BY rowid",
};

// Changes of the content only: our own reads (open, access, close without writing) are not
// reported, or every lookup would undo the last one.
const uint32_t kWatchMask = IN_MODIFY | IN_ATTRIB | IN_CLOSE_WRITE | IN_MOVED_FROM | IN_MOVED_TO |
                            IN_CREATE | IN_DELETE | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

// Distinct values remembered per column; past it the memory starts over. Executables of
// windows that are no application are remembered too (with no rows), hence a bound.
const size_t kMemoLimit = 64;

const char* Text(sqlite3_stmt* stmt, int col) {
  const unsigned char* text = sqlite3_column_text(stmt, col);
  return text != nullptr ? reinterpret_cast<const char*>(text) : "";
}

class AppDb {
 public:
  // The rows for |value|, under the lock; -1 when the database cannot be read.
  int Find(AppColumn column, const char* value, std::vector<AppRecord>* out) {
    std::lock_guard<std::mutex> lock(mutex);
    char buf[4096];
    const char* current = logmgr_fixed_path(kAppDb, buf, sizeof(buf));
    if (path != current) {  // another sysroot: nothing known applies
      Unwatch();
      path = current;
    }
    const bool keep = Watch();
    const int col = static_cast<int>(column);
    if (keep) {
      auto hit = memo[col].find(value);
      if (hit != memo[col].end()) {
        out->insert(out->end(), hit->second.begin(), hit->second.end());
        return 0;
      }
    }
    std::vector<AppRecord> rows;
    int rc = Open() ? Query(column, value, &rows) : -1;
    if (rc != 0 || !keep) {
      Drop();
      return rc;
    }
    if (memo[col].size() >= kMemoLimit) memo[col].clear();
    out->insert(out->end(), rows.begin(), rows.end());
    memo[col].emplace(value, std::move(rows));
    return 0;
  }

 private:
  // Reads what the directory reported since the last lookup. False when there is no watch,
  // so nothing may be kept past this lookup.
  bool Watch() {
    if (fd < 0) fd = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    if (fd < 0) return false;
    if (wd < 0) {
      size_t slash = path.rfind('/');
      std::string dir = slash == std::string::npos ? "." : path.substr(0, slash + 1);
      wd = inotify_add_watch(fd, dir.c_str(), kWatchMask);
      if (wd < 0) return false;
      Drop();  // anything read before the watch began is unconfirmed
    }
    const std::string base = path.substr(path.rfind('/') + 1);
    alignas(struct inotify_event) char events[4096];
    for (;;) {
      ssize_t n = read(fd, events, sizeof(events));
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) break;  // EAGAIN: all read
      for (ssize_t at = 0; at < n;) {
        const struct inotify_event* ev = reinterpret_cast<const struct inotify_event*>(events + at);
        at += static_cast<ssize_t>(sizeof(struct inotify_event) + ev->len);
        if (ev->mask & IN_Q_OVERFLOW) {
          Drop();  // events were lost: any of them may have been ours
        } else if (ev->wd != wd) {
          continue;  // an earlier watch's last words
        } else if (ev->mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) {
          Unwatch();  // the directory itself went; watch whatever is there next time
        } else if (ev->len > 0 && Concerns(ev->name, base)) {
          Drop();
        }
      }
    }
    return wd >= 0;
  }

  // The file itself or one of the files SQLite commits through.
  static bool Concerns(const char* name, const std::string& base) {
    size_t len = base.size();
    if (strncmp(name, base.c_str(), len) != 0) return false;
    return name[len] == '\0' || strcmp(name + len, "-journal") == 0 ||
           strcmp(name + len, "-wal") == 0;
  }

  bool Open() {
    if (db != nullptr) return true;
    // Read-only and never created: a missing database is a failure, not an empty one.
    if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) != SQLITE_OK) {
      Drop();
      return false;
    }
    // The package tools may be writing at the same moment; wait briefly rather than fail.
    sqlite3_busy_timeout(db, 200);
    // Repeated lookups are answered from memory, so the connection needs few pages of its own
    // (a lookup reads the index and table paths: about four).
    (void)sqlite3_exec(db, "PRAGMA cache_size = 16", nullptr, nullptr, nullptr);
    for (int i = 0; i < 2; ++i) {
      if (sqlite3_prepare_v3(db, kSql[i], -1, SQLITE_PREPARE_PERSISTENT, &stmts[i], nullptr) !=
          SQLITE_OK) {
        Drop();
        return false;
      }
    }
    return true;
  }

  int Query(AppColumn column, const char* value, std::vector<AppRecord>* rows) {
    sqlite3_stmt* stmt = stmts[static_cast<int>(column)];
    int rc = sqlite3_bind_text(stmt, 1, value, -1, SQLITE_STATIC);
    if (rc == SQLITE_OK) {
      while ((rc = sqlite3_step(stmt)) == SQLITE_ROW)
        rows->push_back(AppRecord{Text(stmt, 0), Text(stmt, 1), Text(stmt, 2)});
    }
    // Reset at once: a statement left open would hold its read lock and keep the tools out.
    (void)sqlite3_reset(stmt);
    (void)sqlite3_clear_bindings(stmt);
    return rc == SQLITE_DONE ? 0 : -1;
  }

  void Drop() {
    for (sqlite3_stmt*& stmt : stmts) {
      sqlite3_finalize(stmt);
      stmt = nullptr;
    }
    sqlite3_close(db);
    db = nullptr;
    for (auto& m : memo) m.clear();
  }

  void Unwatch() {
    Drop();
    if (wd >= 0) (void)inotify_rm_watch(fd, wd);
    wd = -1;
  }

  std::mutex mutex;
  std::string path;
  int fd = -1;
  int wd = -1;
  sqlite3* db = nullptr;
  sqlite3_stmt* stmts[2] = {nullptr, nullptr};
  std::unordered_map<std::string, std::vector<AppRecord>> memo[2];
};

AppDb g_appDb;

}  // namespace

int AppDbFind(AppColumn column, const char* value, std::vector<AppRecord>* out) {
  if (value == nullptr || out == nullptr) return -1;
  return g_appDb.Find(column, value, out);
}

int AppDbFindFirst(AppColumn column, const char* value, AppRecord* out) {
  if (value == nullptr || out == nullptr) return -1;
  std::vector<AppRecord> rows;
  if (g_appDb.Find(column, value, &rows) != 0) return -1;
  if (rows.empty()) return 0;
  *out = std::move(rows.front());
  return 1;
}

}  // namespace logmgr_host
