#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "platform/fixed_path.h"

const char* logmgr_fixed_path(const char* path, char* buf, size_t size) {
  const char* root = getenv("LOGMGR_SYSROOT");
  if (path == NULL || root == NULL || root[0] == '\0' || path[0] != '/') return path;
  if (strncmp(path, "/proc/", 6) == 0 || strcmp(path, "/proc") == 0) return path;
  if (buf == NULL || size == 0) return path;
  size_t len = strlen(root);
  while (len > 1 && root[len - 1] == '/') --len;  // "/tmp/x/" and "/tmp/x" are the same root
  (void)snprintf(buf, size, "%.*s%s", (int)len, root, path);
  return buf;
}
