// Checks applied to what other processes send to the two shared tables: the row_data lists,
// the size of every statement a request builds, the tables a request's SQL may touch, and the
// caller's shared-memory segment.
#ifndef LOGMGR_PROVIDERS_PROVIDER_BUS_GUARD_H_
#define LOGMGR_PROVIDERS_PROVIDER_BUS_GUARD_H_

#include <stddef.h>
#include <sys/types.h>

#include <string>
#include <vector>

struct sqlite3;

namespace _CorvaneLogManager {

// Column and value lists built from a caller's row_data, plus the texts the provider will
// append for timestamp and time_zone (measured so the statement sizes can be checked first).
struct BusRowLists {
  std::string columns;
  std::string values;
};

// Appends one row_data entry: "," between entries, the key, the value in single quotes.
// -1 (lists unchanged) when the key is not a declared column, is timestamp or time_zone, or the
// value holds a single quote.
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

// While alive, statements prepared on |db| may only read and write |table|: no other table, no
// ATTACH/DETACH, DDL, PRAGMA, transactions, recursive queries or blob-making functions, and no
// value longer than kRequestMaxLength. A denied statement fails to prepare.
class TableOnlyAuthorizer {
 public:
  static constexpr int kRequestMaxLength = 1 << 20;
  TableOnlyAuthorizer(sqlite3* db, const char* table);
  ~TableOnlyAuthorizer();
  TableOnlyAuthorizer(const TableOnlyAuthorizer&) = delete;
  TableOnlyAuthorizer& operator=(const TableOnlyAuthorizer&) = delete;

 private:
  static int Decide(void* self, int action, const char* arg1, const char* arg2, const char* db,
                    const char* trigger);
  sqlite3* db;
  const char* table;
  int savedLength = 0;
};

// Bytes a select result takes in the segment: each row text and its NUL, then the "&" mark.
size_t SegmentBytes(char** rows, int rowCount);

// Writes the rows into System V segment |shmId| and detaches it. 0 on success; -1 without
// writing anything when the segment is unknown, not owned by |callerUid|, too small for the
// whole result, or cannot be attached.
int WriteRowsToSegment(int shmId, uid_t callerUid, char** rows, int rowCount);

// Frees a select result (each row text, then the array).
void FreeRows(char** rows, int rowCount);

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_PROVIDERS_PROVIDER_BUS_GUARD_H_
