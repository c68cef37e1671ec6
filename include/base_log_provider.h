// BaseLogProvider: what every log table's owner shares (table description, statement builders,
// automatic timestamp and time_zone columns, age and row-count limits).
#ifndef LOGMGR_INCLUDE_BASE_LOG_PROVIDER_H_
#define LOGMGR_INCLUDE_BASE_LOG_PROVIDER_H_

#include <stddef.h>
#include <stdint.h>

#include <string>
#include <vector>

#include "include/db_connection.h"
#include "storage/db_response_listener.h"

namespace _CorvaneLogManager {

// Reads a value list made only of plain literals, each standing for exactly what SQLite stores
// from it: a quoted string ('' for '), an integer of up to 18 digits with an optional leading
// "-", or NULL, separated by commas and SQL blanks. Fills |out| (room for |room| values), texts
// decoded into |decoded|; the count, or -1 for anything else (the text path serves it).
int ParsePlainLiterals(const char* text, DbConnection::BoundValue* out, int room, char* decoded,
                       size_t decodedSize);

struct TableConfig {
  std::string tableName;
  std::vector<std::string> columns;
  int32_t retention_days = 0;
  int32_t check_interval = 0;
  int32_t max_rows = 0;
  int32_t insert_counter = 0;
};

// Column and value lists are comma-separated texts; values are SQL literals as the caller
// wants them (strings already quoted). timestamp and time_zone are appended here, never by
// the caller. Row texts of selects are QueryResult rows (see DbConnection::Select).
class BaseLogProvider : public IDbResponseListener {
 public:
  BaseLogProvider() = default;
  ~BaseLogProvider() override = default;

  // Keep these virtual operations in this order: the vtable layout is part of the interface
  // (Initialize, EmptyHook and DeleteExpiredRows come first, from IDbResponseListener).
  // Creates the table; returns the reseeded insert counter (0..499) or -1.
  int Initialize() override;
  int DeleteExpiredRows() override;
  virtual int InsertRow(const char* columns, const char* values, int32_t* rowId = nullptr);
  virtual int UpdateRows(const char* columns, const char* values, const char* where,
                         int32_t* count = nullptr);
  virtual int SelectRows(const char* columns, const char* where, const char* orderBy, int* rowCount,
                         char*** rows);
  // Note the argument order: ORDER BY before GROUP BY (the statement places GROUP BY first).
  virtual int SelectGroupedRows(const char* columns, const char* where, const char* orderBy,
                                const char* groupBy, int* rowCount, char*** rows);
  virtual int DeleteRows(const char* where, int32_t* count = nullptr);
  virtual const char* GetCreateTableSql() = 0;
  // The registry name; equals the table name except for the upload queue.
  virtual const char* GetTableName() = 0;
  virtual int GetRowCount();
  virtual int DeleteOldestRows();

  // Whether each statement these arguments make (with timestamp and time_zone as they would be
  // now) comes out of its fixed buffer whole. A cut statement would run as cut and a list past
  // its buffer ends the process, so requests from other processes are asked about first.
  bool InsertFits(const char* columns, const char* values);
  bool UpdateFits(const char* columns, const char* values, const char* where);
  bool SelectFits(const char* columns, const char* where);
  bool DeleteFits(const char* where);

  const TableConfig& Config() const { return config; }

 protected:
  // List texts of 200 bytes or more end the process.
  int InitTableConfig(const char* tableName, const char* columnList, int32_t retentionDays,
                      int32_t checkInterval, int32_t maxRows, int32_t initialCounter);
  int ValidateColumns(const char* columnList);
  void AppendAutoColumns(std::string* columns, std::string* values);
  int32_t AdvanceInsertCounter();
  int32_t TickInsertCounter();

  // The statements themselves, on a given connection (null: no connection), so that a
  // provider living in another database file reuses them.
  int InsertOn(DbConnection* conn, const char* columns, const char* values, int32_t* rowId,
               bool countRows);
  // The insert from the connection's kept statement when every value is a plain literal (see
  // ParsePlainLiterals); DbConnection::kNotRun when it cannot serve, nothing run.
  int InsertKept(DbConnection* conn, const char* columns, const char* values);
  // |splitDelims| is where the two lists are cut into tokens before pairing.
  int UpdateOn(DbConnection* conn, const char* columns, const char* values, const char* where,
               int32_t* count, bool autoColumns, const char* splitDelims);
  int DeleteOn(DbConnection* conn, const char* where, int32_t* count);
  int DeleteOldestOn(DbConnection* conn);

  TableConfig config;

 private:
  static uint64_t NewInstanceId();
  // Names this provider in per-thread caches; an address may be reused, this never is.
  uint64_t instanceId = NewInstanceId();
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_INCLUDE_BASE_LOG_PROVIDER_H_
