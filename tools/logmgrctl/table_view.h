// Read-only views of the daemon's databases under the sysroot: `show TABLE` and `queue`.
#ifndef LOGMGR_TOOLS_LOGMGRCTL_TABLE_VIEW_H_
#define LOGMGR_TOOLS_LOGMGRCTL_TABLE_VIEW_H_

#include <sqlite3.h>

#include <string>

// Prints the newest |limit| rows of |table| (oldest first) with a header line, tab-separated.
// Returns the exit code: 0, 2 for an unknown table, 3 when the database cannot be read.
int ShowTable(const char* table, long limit);

// Opens a database of the device (its path on the device) read-only, never creating it; null
// with the reason in |problem| on failure.
sqlite3* OpenReadOnly(const char* devicePath, std::string* problem);

// The upload queue: its record count, then the newest |limit| records.
int ShowQueue(long limit);

#endif  // LOGMGR_TOOLS_LOGMGRCTL_TABLE_VIEW_H_
