#include "providers/provider_bus_guard.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include "include/db_connection.h"
#include "providers/local_zone.h"
#include "providers/statement_buffer.h"

namespace _CorvaneLogManager {

namespace {

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

bool IsCallerRowId(const char* value) {
  if (value[0] == '\0') return false;
  long long id = 0;
  for (const char* p = value; *p != '\0'; ++p) {
    if (*p < '0' || *p > '9') return false;
    id = id * 10 + (*p - '0');
    if (id > kMaxCallerRowId) return false;
  }
  return id >= 1;
}

// Copies |length| bytes to |dst| through the empty pipe |fds|, so that the kernel, not this
// process, touches the caller's pages: a page that cannot be had (a hugetlb segment without
// reserve) is then an EFAULT here instead of a SIGBUS that would end the daemon. The pipe is
// empty again on success.
bool CopyThroughKernel(const int fds[2], char* dst, const char* src, size_t length) {
  bool ok = true;
  size_t done = 0;
  while (ok && done < length) {
    ssize_t in = write(fds[1], src + done, length - done);
    if (in < 0 && errno == EINTR) continue;
    if (in <= 0) {
      ok = false;
      break;
    }
    for (size_t got = 0; got < static_cast<size_t>(in);) {
      ssize_t out = read(fds[0], dst + done + got, static_cast<size_t>(in) - got);
      if (out < 0 && errno == EINTR) continue;
      if (out <= 0) {
        ok = false;
        break;
      }
      got += static_cast<size_t>(out);
    }
    done += static_cast<size_t>(in);
  }
  return ok;
}

}  // namespace

int AppendRowEntry(const std::vector<std::string>& declared, const char* key, const char* value,
                   BusRowLists* lists) {
  if (key == nullptr || value == nullptr || IsAutoColumn(key) || strchr(value, '\'') != nullptr)
    return -1;
  if (strcmp(key, "_id") == 0 && !IsCallerRowId(value)) return -1;
  bool known = false;
  for (const std::string& column : declared) known = known || column == key;
  if (!known) return -1;
  if (!lists->columns.empty() && !lists->values.empty()) {
    lists->columns.append(",");
    lists->values.append(",");
  }
  lists->columns.append(key);
  lists->values.append("'").append(value).append("'");
  if (strchr(value, ',') != nullptr) lists->valueHasComma = true;
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
      std::string zone;
      if (!LocalZoneLiteral(&zone)) continue;
      texts.columns.append(",time_zone");
      texts.values.append(",").append(zone);
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

size_t SegmentBytes(const QueryRows& rows) {
  size_t bytes = 1;
  for (int i = 0; i < rows.count; ++i) bytes += strlen(rows[i]) + 1;
  return bytes;
}

size_t SegmentRoom(int shmId, uid_t callerUid) {
  struct shmid_ds info;
  if (shmctl(shmId, IPC_STAT, &info) != 0) return 0;
  if (info.shm_perm.uid != callerUid || (info.shm_perm.mode & S_IWUSR) == 0) return 0;
  return info.shm_segsz;
}

int WriteRowsToSegment(int shmId, uid_t callerUid, const QueryRows& rows) {
  // Attached first and checked after: an attached segment keeps its id, so what is checked is
  // what is written, even if the caller removes it and makes another meanwhile.
  void* base = shmat(shmId, nullptr, 0);
  if (base == reinterpret_cast<void*>(-1)) return -1;
  size_t bytes = SegmentBytes(rows);
  bool ok = bytes <= SegmentRoom(shmId, callerUid);
  // One pipe for the whole result; chunks of a default pipe's capacity (a smaller pipe takes
  // them in parts).
  int fds[2] = {-1, -1};
  if (ok && pipe2(fds, O_CLOEXEC | O_NONBLOCK) != 0) ok = false;
  char chunk[65536];
  size_t staged = 0;
  size_t written = 0;
  auto stage = [&](const char* data, size_t length) {
    while (ok && length > 0) {
      size_t take = length < sizeof(chunk) - staged ? length : sizeof(chunk) - staged;
      memcpy(chunk + staged, data, take);
      staged += take;
      data += take;
      length -= take;
      if (staged == sizeof(chunk)) {
        ok = CopyThroughKernel(fds, static_cast<char*>(base) + written, chunk, staged);
        written += staged;
        staged = 0;
      }
    }
  };
  for (int i = 0; ok && i < rows.count; ++i) stage(rows[i], strlen(rows[i]) + 1);
  stage("&", 1);
  if (ok && staged > 0)
    ok = CopyThroughKernel(fds, static_cast<char*>(base) + written, chunk, staged);
  if (fds[0] >= 0) {
    (void)close(fds[0]);
    (void)close(fds[1]);
  }
  (void)shmdt(base);
  return ok ? 0 : -1;
}

}  // namespace _CorvaneLogManager
