#include "providers/provider_bus_guard.h"

#include <sqlite3.h>
#include <stdio.h>
#include <string.h>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/time.h>
#include <unistd.h>

#include "platform/fixed_path.h"
#include "providers/statement_buffer.h"

namespace _CorvaneLogManager {

namespace {

// Length of "/usr/share/zoneinfo/" in front of the zone name of the localtime link.
constexpr size_t kZoneinfoPrefix = 20;

bool IsAutoColumn(const char* name) {
  return strcmp(name, "timestamp") == 0 || strcmp(name, "time_zone") == 0;
}

// Length of the SET text the provider makes of these lists: both cut at commas (empty pieces
// skipped) and paired in step, each pair "c = v," or "c = 'v',".
size_t SetLength(const std::string& columns, const std::string& values) {
  std::vector<std::string> cols;
  std::vector<std::string> vals;
  for (auto [text, out] : {std::make_pair(&columns, &cols), std::make_pair(&values, &vals)}) {
    size_t start = 0;
    while (start <= text->size()) {
      size_t end = text->find(',', start);
      if (end == std::string::npos) end = text->size();
      if (end > start) out->push_back(text->substr(start, end - start));
      start = end + 1;
    }
  }
  size_t length = 0;
  for (size_t i = 0; i < cols.size() && i < vals.size(); ++i)
    length += cols[i].size() + 4 + vals[i].size() + (vals[i][0] == '\'' ? 0 : 2);
  return length;
}

// Functions that make large values out of little input, or reach outside the database.
bool IsDeniedFunction(const char* name) {
  static const char* const kDenied[] = {"randomblob", "zeroblob",  "load_extension",
                                        "readfile",   "writefile", "fts3_tokenizer"};
  if (name == nullptr) return true;
  for (const char* denied : kDenied)
    if (strcasecmp(name, denied) == 0) return true;
  return false;
}

}  // namespace

int AppendRowEntry(const std::vector<std::string>& declared, const char* key, const char* value,
                   BusRowLists* lists) {
  if (key == nullptr || value == nullptr || IsAutoColumn(key) || strchr(value, '\'') != nullptr)
    return -1;
  bool known = false;
  for (const std::string& column : declared) known = known || column == key;
  if (!known) return -1;
  if (!lists->columns.empty() && !lists->values.empty()) {
    lists->columns.append(",");
    lists->values.append(",");
  }
  lists->columns.append(key);
  lists->values.append("'").append(value).append("'");
  return 0;
}

BusRowLists AutoColumnTexts(const std::vector<std::string>& declared) {
  BusRowLists texts;
  for (const std::string& column : declared) {
    if (column == "timestamp") {
      struct timeval tv;
      gettimeofday(&tv, nullptr);
      char now[32];
      snprintf(now, sizeof(now), ",%lld",
               static_cast<long long>(tv.tv_sec) * 1000 + tv.tv_usec / 1000);
      texts.columns.append(",timestamp");
      texts.values.append(now);
    } else if (column == "time_zone") {
      char pathBuf[4096];
      const char* link = logmgr_fixed_path("/opt/etc/localtime", pathBuf, sizeof(pathBuf));
      char target[1024];
      ssize_t len = readlink(link, target, sizeof(target) - 1);
      if (len <= static_cast<ssize_t>(kZoneinfoPrefix)) continue;
      target[len] = '\0';
      texts.columns.append(",time_zone");
      texts.values.append(",'").append(target + kZoneinfoPrefix).append("'");
    }
  }
  return texts;
}

bool InsertFits(const std::string& table, const BusRowLists& lists, const BusRowLists& autoTexts) {
  if (lists.columns.size() >= kListSize) return false;
  size_t statement = strlen("INSERT INTO () VALUES ();") + table.size() + lists.columns.size() +
                     autoTexts.columns.size() + lists.values.size() + autoTexts.values.size();
  return statement < kStatementSize;
}

bool UpdateFits(const std::string& table, const BusRowLists& lists, const BusRowLists& autoTexts,
                const char* where) {
  if (where == nullptr) return true;  // the provider refuses it before building anything
  std::string columns = lists.columns + autoTexts.columns;
  std::string values = lists.values + autoTexts.values;
  if (columns.size() >= kListSize || values.size() >= kListSize) return false;
  // The SET text is built with a trailing comma, which is dropped before the statement.
  size_t set = SetLength(columns, values);
  if (set >= kStatementSize) return false;
  if (set > 0) --set;
  size_t statement = strlen("UPDATE  SET  WHERE ;") + table.size() + set + strlen(where);
  return statement < kStatementSize;
}

bool SelectFits(const std::string& table, const char* columns, const char* where) {
  size_t statement = strlen("SELECT  FROM ;") + table.size() + strlen(columns);
  if (where != nullptr) statement += strlen(" WHERE ") + strlen(where);
  return statement < kStatementSize;
}

bool DeleteFits(const std::string& table, const char* where) {
  return strlen("DELETE FROM  WHERE ;") + table.size() + strlen(where) < kStatementSize;
}

TableOnlyAuthorizer::TableOnlyAuthorizer(sqlite3* db, const char* table) : db(db), table(table) {
  if (db == nullptr) return;
  savedLength = sqlite3_limit(db, SQLITE_LIMIT_LENGTH, kRequestMaxLength);
  (void)sqlite3_set_authorizer(db, &TableOnlyAuthorizer::Decide, this);
}

TableOnlyAuthorizer::~TableOnlyAuthorizer() {
  if (db == nullptr) return;
  (void)sqlite3_set_authorizer(db, nullptr, nullptr);
  (void)sqlite3_limit(db, SQLITE_LIMIT_LENGTH, savedLength);
}

int TableOnlyAuthorizer::Decide(void* self, int action, const char* arg1, const char* arg2,
                                const char* db, const char*) {
  const char* own = static_cast<TableOnlyAuthorizer*>(self)->table;
  bool ownTable = arg1 != nullptr && strcmp(arg1, own) == 0 &&
                  (db == nullptr || strcmp(db, "main") == 0);
  switch (action) {
    case SQLITE_SELECT:
      return SQLITE_OK;
    case SQLITE_READ:
    case SQLITE_INSERT:
    case SQLITE_UPDATE:
    case SQLITE_DELETE:
      return ownTable ? SQLITE_OK : SQLITE_DENY;
    case SQLITE_FUNCTION:
      return IsDeniedFunction(arg2) ? SQLITE_DENY : SQLITE_OK;
    default:
      // Everything else (ATTACH, DDL, PRAGMA, transactions, VACUUM, recursive queries).
      return SQLITE_DENY;
  }
}

size_t SegmentBytes(char** rows, int rowCount) {
  size_t bytes = 1;
  for (int i = 0; i < rowCount; ++i) bytes += strlen(rows[i]) + 1;
  return bytes;
}

int WriteRowsToSegment(int shmId, uid_t callerUid, char** rows, int rowCount) {
  struct shmid_ds info;
  if (shmctl(shmId, IPC_STAT, &info) != 0) return -1;
  if (info.shm_perm.uid != callerUid) return -1;
  if (SegmentBytes(rows, rowCount) > info.shm_segsz) return -1;
  void* base = shmat(shmId, nullptr, 0);
  if (base == reinterpret_cast<void*>(-1)) return -1;
  char* out = static_cast<char*>(base);
  for (int i = 0; i < rowCount; ++i) {
    size_t length = strlen(rows[i]) + 1;
    memcpy(out, rows[i], length);
    out += length;
  }
  *out = '&';
  (void)shmdt(base);
  return 0;
}

void FreeRows(char** rows, int rowCount) {
  if (rows == nullptr) return;
  for (int i = 0; i < rowCount; ++i) delete[] rows[i];
  delete[] rows;
}

}  // namespace _CorvaneLogManager
