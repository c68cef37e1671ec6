// BaseLogProvider: what every log table's owner shares (table description, statement builders,
// automatic timestamp and time_zone columns, age and row-count limits).
#ifndef LOGMGR_INCLUDE_BASE_LOG_PROVIDER_H_
#define LOGMGR_INCLUDE_BASE_LOG_PROVIDER_H_

#include <stdint.h>

#include <string>
#include <vector>

namespace _CorvaneLogManager {

class IDbResponseListener {
 public:
  virtual ~IDbResponseListener() {}
};

struct TableConfig {
  std::string tableName;
  std::vector<std::string> columns;
  int32_t retention_days = 0;
  int32_t check_interval = 0;
  int32_t max_rows = 0;
  int32_t insert_counter = 0;
};

class BaseLogProvider : public IDbResponseListener {
 public:
  BaseLogProvider() = default;
  ~BaseLogProvider() override = default;

  // The order of these virtual operations is part of the design.
  virtual int Initialize();
  virtual void EmptyHook() {}
  virtual int DeleteExpiredRows();
  virtual int InsertRow(const char* columns, const char* values, int32_t* rowId = nullptr);
  virtual int UpdateRows(const char* columns, const char* values, const char* where,
                         int32_t* count = nullptr);
  virtual int SelectRows(const char* columns, const char* where, const char* orderBy,
                         int* rowCount, char*** rows);
  virtual int SelectGroupedRows(const char* columns, const char* where, const char* orderBy,
                                const char* groupBy, int* rowCount, char*** rows);
  virtual int DeleteRows(const char* where, int32_t* count = nullptr);
  virtual const char* GetCreateTableSql() = 0;
  virtual const char* GetTableName() = 0;
  virtual int GetRowCount();
  virtual int DeleteOldestRows();

  const TableConfig& Config() const { return config; }

 protected:
  int InitTableConfig(const char* tableName, const char* columnList, int32_t retentionDays,
                      int32_t checkInterval, int32_t maxRows, int32_t initialCounter);
  int ValidateColumns(const char* columnList);
  void AppendAutoColumns(std::string* columns, std::string* values);
  int32_t AdvanceInsertCounter();
  int32_t TickInsertCounter();

  TableConfig config;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_INCLUDE_BASE_LOG_PROVIDER_H_
