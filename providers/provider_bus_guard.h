// Checks applied to what other processes send to the two shared tables: the row_data lists and
// the caller's shared-memory segment. Whether a request's statements fit, the provider that
// builds them answers (BaseLogProvider::InsertFits and its siblings).
#ifndef LOGMGR_PROVIDERS_PROVIDER_BUS_GUARD_H_
#define LOGMGR_PROVIDERS_PROVIDER_BUS_GUARD_H_

#include <stddef.h>
#include <sys/types.h>

#include <string>
#include <vector>

namespace _CorvaneLogManager {

struct QueryRows;

// Column and value lists built from a caller's row_data.
struct BusRowLists {
  std::string columns;
  std::string values;
  // An update cuts both lists at commas, so such a value would turn into SQL there.
  bool valueHasComma = false;
};

// Largest _id a caller may give: every later automatic id still fits a double exactly and
// stays far below the rowid limit, so the table never runs out of ids.
constexpr long long kMaxCallerRowId = 1LL << 53;

// Appends one row_data entry: "," between entries, the key, the value in single quotes.
// -1 (lists unchanged) when the key is not a declared column, is timestamp or time_zone, the
// value holds a single quote, or an _id is not a decimal integer from 1 to kMaxCallerRowId.
int AppendRowEntry(const std::vector<std::string>& declared, const char* key, const char* value,
                   BusRowLists* lists);

// Bytes a select result takes in the segment: each row text and its NUL, then the "&" mark.
size_t SegmentBytes(const QueryRows& rows);

// Bytes segment |shmId| may take: its size when it exists, belongs to |callerUid| and lets its
// owner write; 0 otherwise.
size_t SegmentRoom(int shmId, uid_t callerUid);

// Writes the rows into System V segment |shmId| and detaches it. 0 on success; -1 without
// writing anything when the segment is unknown, not owned by |callerUid|, not writable by its
// owner, too small for the whole result, or cannot be attached; -1 too when a page of it
// cannot be had (the copy stops there, and the daemon carries on). The segment gets a copy:
// the rows stay the caller's.
int WriteRowsToSegment(int shmId, uid_t callerUid, const QueryRows& rows);

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_PROVIDERS_PROVIDER_BUS_GUARD_H_
