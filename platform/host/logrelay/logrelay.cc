// Host log relay: register appends the record as one JSON line to the outbox
// ($SYSROOT/opt/usr/data/log-relay/outbox.jsonl), keys the item numbers as text.
// LOGRELAY_FAIL="register:N[,create:N][,set:N]" makes the N-th such call of the process fail,
// so tests can break a hand-over at any position.
#include <corvane_log_relay.h>
#include <errno.h>
#include <fcntl.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <map>
#include <new>
#include <string>

#include "platform/fixed_path.h"

#define RELAY_API extern "C" __attribute__((visibility("default")))

struct corvane_log_item {
  std::map<int, std::string> texts;  // item number -> text
  bool hasTime = false;
  int64_t timeMs = 0;
};

namespace {

constexpr char kOutboxDir[] = "/opt/usr/data/log-relay";
constexpr char kOutboxName[] = "outbox.jsonl";

std::atomic<long> g_creates{0};
std::atomic<long> g_sets{0};
std::atomic<long> g_registers{0};

// True when this call (its 1-based number |call|) is the one LOGRELAY_FAIL names for |kind|.
bool InjectedFailure(const char* kind, long call) {
  const char* faults = getenv("LOGRELAY_FAIL");
  if (faults == nullptr) return false;
  size_t kindLen = strlen(kind);
  for (const char* p = faults; *p != '\0';) {
    const char* end = strchr(p, ',');
    size_t len = end ? static_cast<size_t>(end - p) : strlen(p);
    if (len > kindLen + 1 && strncmp(p, kind, kindLen) == 0 && p[kindLen] == ':' &&
        strtol(p + kindLen + 1, nullptr, 10) == call) {
      return true;
    }
    p += len + (end ? 1 : 0);
  }
  return false;
}

void AppendJsonString(std::string* out, const std::string& text) {
  out->push_back('"');
  for (unsigned char c : text) {
    switch (c) {
      case '"':
        *out += "\\\"";
        break;
      case '\\':
        *out += "\\\\";
        break;
      case '\n':
        *out += "\\n";
        break;
      case '\r':
        *out += "\\r";
        break;
      case '\t':
        *out += "\\t";
        break;
      default:
        if (c < 0x20) {
          char esc[8];
          snprintf(esc, sizeof(esc), "\\u%04x", c);
          *out += esc;
        } else {
          out->push_back(static_cast<char>(c));
        }
    }
  }
  out->push_back('"');
}

// Makes |path|'s directories; the last one, if made here, is the relay's own (owner only).
int MakeDirs(const std::string& path) {
  for (size_t i = 1; i <= path.size(); ++i) {
    if (i == path.size() || path[i] == '/') {
      std::string part = path.substr(0, i);
      if (mkdir(part.c_str(), i == path.size() ? 0700 : 0755) != 0 && errno != EEXIST) return -1;
    }
  }
  return 0;
}

// The outbox holds every record on its way off the device, so only its owner may read it,
// whatever the umask. Neither it nor its directory is reached through a link, and anything but
// a plain file of ours with no other name (a FIFO, another user's file, a hard link) is refused.
int OpenOutbox() {
  char buf[4096];
  std::string dirPath = logmgr_fixed_path(kOutboxDir, buf, sizeof(buf));
  if (MakeDirs(dirPath) != 0) return -1;
  int dir = open(dirPath.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (dir < 0) return -1;
  int fd =
      openat(dir, kOutboxName,
             O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY, 0600);
  close(dir);
  if (fd < 0) return -1;
  struct stat st;
  bool ours =
      fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_uid == geteuid() && st.st_nlink == 1;
  // An outbox left readable by an older build is narrowed rather than refused.
  if (!ours || ((st.st_mode & 077) != 0 && fchmod(fd, 0600) != 0)) {
    close(fd);
    return -1;
  }
  return fd;
}

}  // namespace

RELAY_API int corvane_log_relay_mobile_create_log_item_handle(corvane_log_item_h* handle) {
  if (handle == nullptr) return CORVANE_LOG_RELAY_ERROR_INVALID_PARAMETER;
  if (InjectedFailure("create", ++g_creates)) {
    *handle = nullptr;
    return CORVANE_LOG_RELAY_ERROR_IO;
  }
  *handle = new (std::nothrow) corvane_log_item();
  return *handle == nullptr ? CORVANE_LOG_RELAY_ERROR_OUT_OF_MEMORY : CORVANE_LOG_RELAY_ERROR_NONE;
}

RELAY_API int corvane_log_relay_mobile_set_log_item(corvane_log_item_h handle, int item,
                                                    const void* value) {
  if (InjectedFailure("set", ++g_sets)) return CORVANE_LOG_RELAY_ERROR_IO;
  if (handle == nullptr || value == nullptr || item < CORVANE_LOG_ITEM_LOG_TYPE ||
      item > CORVANE_LOG_ITEM_APP_ID) {
    return CORVANE_LOG_RELAY_ERROR_INVALID_PARAMETER;
  }
  if (item == CORVANE_LOG_ITEM_TIME) {
    handle->hasTime = true;
    memcpy(&handle->timeMs, value, sizeof(handle->timeMs));
  } else {
    handle->texts[item] = static_cast<const char*>(value);
  }
  return CORVANE_LOG_RELAY_ERROR_NONE;
}

RELAY_API int corvane_log_relay_mobile_register_log_item(corvane_log_item_h handle) {
  if (InjectedFailure("register", ++g_registers)) return CORVANE_LOG_RELAY_ERROR_IO;
  if (handle == nullptr) return CORVANE_LOG_RELAY_ERROR_INVALID_PARAMETER;

  std::string line = "{";
  for (int item = CORVANE_LOG_ITEM_LOG_TYPE; item <= CORVANE_LOG_ITEM_APP_ID; ++item) {
    std::string value;
    if (item == CORVANE_LOG_ITEM_TIME) {
      if (!handle->hasTime) continue;
      value = std::to_string(static_cast<long long>(handle->timeMs));
    } else {
      auto it = handle->texts.find(item);
      if (it == handle->texts.end()) continue;
      AppendJsonString(&value, it->second);
    }
    if (line.size() > 1) line += ", ";
    line += "\"" + std::to_string(item) + "\": " + value;
  }
  line += "}\n";

  int fd = OpenOutbox();
  if (fd < 0) return CORVANE_LOG_RELAY_ERROR_IO;
  // One write under O_APPEND keeps concurrent writers' lines whole.
  ssize_t written = write(fd, line.data(), line.size());
  int synced = fsync(fd);
  close(fd);
  if (written != static_cast<ssize_t>(line.size()) || synced != 0)
    return CORVANE_LOG_RELAY_ERROR_IO;
  return CORVANE_LOG_RELAY_ERROR_NONE;
}

RELAY_API int corvane_log_relay_mobile_free_log_item(corvane_log_item_h handle) {
  if (handle == nullptr) return CORVANE_LOG_RELAY_ERROR_INVALID_PARAMETER;
  delete handle;
  return CORVANE_LOG_RELAY_ERROR_NONE;
}
