// What the two shared tables do for other processes, without the bus: a request's checks, its
// statements under a bus request scope, the upsert of the status table, and a select written
// into the caller's segment. The bus objects only unpack arguments and turn the results into
// the bus answers.
#ifndef LOGMGR_PROVIDERS_SHARED_TABLE_SERVICE_H_
#define LOGMGR_PROVIDERS_SHARED_TABLE_SERVICE_H_

#include <stdint.h>
#include <sys/types.h>

#include <string>
#include <utility>
#include <vector>

namespace _CorvaneLogManager {

class BaseLogProvider;
struct BusRowLists;

class SharedTableService {
 public:
  enum class Result {
    kOk,
    kProviderMissing,  // the table's provider is gone
    kImproperValues,   // refused before anything ran
    kInsertFailed,
    kUpdateFailed,
    kDeleteFailed,
    kApiFailed,     // an upsert step failed
    kSelectFailed,  // nothing selected: too long a statement, no scope, a failed statement
    kNotWritten,    // selected, but the caller's segment did not take the result
  };
  // A caller's row_data: key and value pairs in the order they arrived.
  using RowData = std::vector<std::pair<std::string, std::string>>;

  // |tableName| is one of the two shared tables, which decides the insert's and the delete's
  // rules; null for another name.
  static const SharedTableService* ForTable(const char* tableName);

  // An insert needs app_id and feature. The status table keeps one row per (app_id, feature):
  // an existing pair is updated and its _id answered, more than one leaves the table as it is.
  Result Insert(const RowData& rowData, int32_t* lastRowId) const;
  // An empty |where| is none at all, which the provider refuses.
  Result Update(const RowData& rowData, const char* where, int32_t* count) const;
  // Every row of the table (no where, no order, deliberately) into segment |shmId|, which must
  // be |caller|'s; |callerKnown| false when the caller's user could not be had.
  Result Select(const char* columns, int shmId, bool callerKnown, uid_t caller) const;
  // The feature table refuses an empty |where| and reports a failed delete; the status table
  // answers a failed one with a count of 0.
  Result Delete(const char* where, int32_t* count) const;

 private:
  enum class InsertMode { kPlain, kUpsertOnAppFeature };
  constexpr SharedTableService(const char* tableName, InsertMode insert, bool deleteNeedsWhere,
                               bool deleteFailureIsError)
      : tableName(tableName),
        insert(insert),
        deleteNeedsWhere(deleteNeedsWhere),
        deleteFailureIsError(deleteFailureIsError) {}
  static const SharedTableService kTables[];

  BaseLogProvider* Provider() const;
  Result PlainInsert(BaseLogProvider* provider, const BusRowLists& lists, int32_t* lastRowId) const;
  Result UpsertInsert(BaseLogProvider* provider, const RowData& rowData, const BusRowLists& lists,
                      int32_t* lastRowId) const;

  const char* tableName;  // also the provider's registry key
  InsertMode insert;
  bool deleteNeedsWhere;
  bool deleteFailureIsError;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_PROVIDERS_SHARED_TABLE_SERVICE_H_
