#include "platform/host/vconf_store.h"

#include <errno.h>
#include <fcntl.h>
#include <float.h>
#include <limits.h>
#include <math.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>
#include <vconf.h>

#include "platform/fixed_path.h"

namespace vconf_store {

namespace {

bool ParseInt(const std::string& s, int* out) {
  if (s.empty() || isspace(static_cast<unsigned char>(s[0]))) return false;
  errno = 0;
  char* end = nullptr;
  long v = strtol(s.c_str(), &end, 10);
  if (errno != 0 || *end != '\0' || v < INT_MIN || v > INT_MAX) return false;
  *out = static_cast<int>(v);
  return true;
}

bool ParseDouble(const std::string& s, double* out) {
  if (s.empty() || isspace(static_cast<unsigned char>(s[0]))) return false;
  errno = 0;
  char* end = nullptr;
  double v = strtod(s.c_str(), &end);
  // A subnormal result sets ERANGE yet is the nearest double, and Render writes such values.
  bool subnormal = errno == ERANGE && v != 0 && fabs(v) < DBL_MIN;
  if ((errno != 0 && !subnormal) || *end != '\0') return false;
  *out = v;
  return true;
}

}  // namespace

int MakeParentDirs(const std::string& file_path) {
  std::string dir = file_path.substr(0, file_path.rfind('/'));
  for (size_t pos = 0; pos != std::string::npos;) {
    pos = dir.find('/', pos + 1);
    std::string partial = dir.substr(0, pos);
    if (partial.empty()) continue;
    if (mkdir(partial.c_str(), 0755) != 0 && errno != EEXIST) return -1;
  }
  return 0;
}

int TypeFromName(const char* name) {
  if (name == nullptr) return 0;
  if (strcmp(name, "bool") == 0) return VCONF_TYPE_BOOL;
  if (strcmp(name, "int") == 0) return VCONF_TYPE_INT;
  if (strcmp(name, "double") == 0) return VCONF_TYPE_DOUBLE;
  if (strcmp(name, "string") == 0) return VCONF_TYPE_STRING;
  return 0;
}

const char* TypeName(int type) {
  switch (type) {
    case VCONF_TYPE_BOOL:
      return "bool";
    case VCONF_TYPE_INT:
      return "int";
    case VCONF_TYPE_DOUBLE:
      return "double";
    case VCONF_TYPE_STRING:
      return "string";
    default:
      return nullptr;
  }
}

bool Parse(const char* text, size_t len, Value* out) {
  if (text == nullptr || out == nullptr) return false;
  std::string line(text, len);
  if (!line.empty() && line.back() == '\n') line.pop_back();
  if (line.find('\n') != std::string::npos || line.find('\0') != std::string::npos) return false;
  size_t space = line.find(' ');
  if (space == std::string::npos) return false;
  int type = TypeFromName(line.substr(0, space).c_str());
  std::string value = line.substr(space + 1);
  Value v;
  v.type = type;
  switch (type) {
    case VCONF_TYPE_BOOL:
      if (value != "0" && value != "1") return false;
      v.i = value == "1";
      break;
    case VCONF_TYPE_INT:
      if (!ParseInt(value, &v.i)) return false;
      break;
    case VCONF_TYPE_DOUBLE:
      if (!ParseDouble(value, &v.d)) return false;
      break;
    case VCONF_TYPE_STRING:
      v.s = value;
      break;
    default:
      return false;
  }
  *out = std::move(v);
  return true;
}

bool Render(const Value& v, std::string* out) {
  char num[64];
  switch (v.type) {
    case VCONF_TYPE_BOOL:
      *out = v.i ? "bool 1\n" : "bool 0\n";
      return true;
    case VCONF_TYPE_INT:
      (void)snprintf(num, sizeof num, "int %d\n", v.i);
      *out = num;
      return true;
    case VCONF_TYPE_DOUBLE:
      (void)snprintf(num, sizeof num, "double %.17g\n", v.d);
      *out = num;
      return true;
    case VCONF_TYPE_STRING:
      if (v.s.find('\n') != std::string::npos || v.s.find('\0') != std::string::npos) return false;
      *out = "string " + v.s + "\n";
      return true;
    default:
      return false;
  }
}

bool KeyPath(const char* key, std::string* path) {
  if (key == nullptr) return false;
  std::string k(key);
  const char* base;
  if (k.rfind("db/", 0) == 0 || k.rfind("file/", 0) == 0) {
    base = "/opt/var/kdb/";
  } else if (k.rfind("memory/", 0) == 0) {
    base = "/var/run/";
  } else {
    return false;
  }
  // Every part must be a plain name: no empty, "." or ".." parts that could leave the store.
  size_t start = 0;
  while (true) {
    size_t slash = k.find('/', start);
    std::string part =
        k.substr(start, slash == std::string::npos ? std::string::npos : slash - start);
    if (part.empty() || part == "." || part == "..") return false;
    if (slash == std::string::npos) break;
    start = slash + 1;
  }
  std::string fixed = std::string(base) + k;
  char buf[PATH_MAX];
  *path = logmgr_fixed_path(fixed.c_str(), buf, sizeof buf);
  return true;
}

int Read(const char* key, Value* out) {
  std::string path;
  if (!KeyPath(key, &path)) return VCONF_ERROR_WRONG_PREFIX;
  // The store only ever renames regular files into place. Whatever else sits at a key's path
  // (a FIFO, a device, a link) was put there by someone else and is refused: opening never
  // waits for a writer, and a link is not followed.
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOFOLLOW | O_NOCTTY);
  if (fd < 0) return errno == ENOENT ? VCONF_ERROR_FILE_NO_ENT : VCONF_ERROR_FILE_OPEN;
  struct stat st;
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    close(fd);
    return VCONF_ERROR_FILE_OPEN;
  }
  // A key file is one short line; anything longer than this is not ours.
  char buf[8192];
  size_t len = 0;
  while (len < sizeof buf) {
    ssize_t n = read(fd, buf + len, sizeof buf - len);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    len += static_cast<size_t>(n);
  }
  close(fd);
  if (len == sizeof buf) return VCONF_ERROR_WRONG_VALUE;
  if (!Parse(buf, len, out)) return VCONF_ERROR_WRONG_VALUE;
  return VCONF_OK;
}

int Write(const char* key, const Value& v) {
  std::string path;
  if (!KeyPath(key, &path)) return VCONF_ERROR_WRONG_PREFIX;
  std::string text;
  if (!Render(v, &text)) return VCONF_ERROR_WRONG_VALUE;
  size_t slash = path.rfind('/');
  if (MakeParentDirs(path) != 0) return VCONF_ERROR_FILE_PERM;
  std::string tmp = path.substr(0, slash + 1) + ".vconf-XXXXXX";
  int fd = mkostemp(&tmp[0], O_CLOEXEC);
  if (fd < 0) return VCONF_ERROR_FILE_OPEN;
  bool ok = fchmod(fd, 0644) == 0 &&
            write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
  ok = close(fd) == 0 && ok;
  if (!ok || rename(tmp.c_str(), path.c_str()) != 0) {
    (void)unlink(tmp.c_str());
    return VCONF_ERROR_FILE_WRITE;
  }
  return VCONF_OK;
}

}  // namespace vconf_store
