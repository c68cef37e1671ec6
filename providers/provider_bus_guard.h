// Checks applied to what other processes send to the two shared tables: the row_data lists,
// the size of every statement a request builds, the tables a request's SQL may touch, and the
// caller's shared-memory segment.
#ifndef LOGMGR_PROVIDERS_PROVIDER_BUS_GUARD_H_
#define LOGMGR_PROVIDERS_PROVIDER_BUS_GUARD_H_

#include <stddef.h>
#include <sys/types.h>

#include <string>
#include <vector>

namespace _CorvaneLogManager {

struct QueryRows;

// Column and value lists built from a caller's row_data, plus the texts the provider will
// append for timestamp and time_zone (measured so the statement sizes can be checked first).
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

// The column and value texts the provider appends on insert and update, as it would now.
BusRowLists AutoColumnTexts(const std::vector<std::string>& declared);

// Whether each statement the provider builds from these arguments fits its buffers whole: no
// list reaching 200 bytes, no statement reaching 1024 (which would be cut or end the process).
bool InsertFits(const std::string& table, const BusRowLists& lists, const BusRowLists& autoTexts);
bool UpdateFits(const std::string& table, const BusRowLists& lists, const BusRowLists& autoTexts,
                const char* where);
bool SelectFits(const std::string& table, const char* columns, const char* where);
bool DeleteFits(const std::string& table, const char* where);

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
