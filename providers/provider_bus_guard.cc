#include "providers/provider_bus_guard.h"

#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <unistd.h>

#include "include/db_connection.h"

namespace _CorvaneLogManager {

namespace {

// The mark after the last row of a select result in the caller's segment.
constexpr char kSegmentEnd = '&';
// A default pipe's capacity: one chunk passes the pipe in one write.
constexpr size_t kPipeChunk = 65536;

bool IsAutoColumn(const char* name) {
  return strcmp(name, "timestamp") == 0 || strcmp(name, "time_zone") == 0;
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
  char chunk[kPipeChunk];
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
  stage(&kSegmentEnd, 1);
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
