#include <sqlite3.h>

#include "include/daemon_lifecycle.h"

int main() {
  // Before any SQLite use: with no preallocated page cache each connection allocates its pages
  // as it reads them, instead of about 80 kB up front at its first read.
  (void)sqlite3_config(SQLITE_CONFIG_PAGECACHE, nullptr, 0, 0);
  return _CorvaneLogManager::RunDaemon();
}
