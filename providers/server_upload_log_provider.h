// ServerUploadLogProvider: the upload queue (table survey_log in the upload database). Runs on
// the upload connection and skips the survey tables' housekeeping (no time_zone, no expiry,
// no row-count check on insert).
#ifndef LOGMGR_PROVIDERS_SERVER_UPLOAD_LOG_PROVIDER_H_
#define LOGMGR_PROVIDERS_SERVER_UPLOAD_LOG_PROVIDER_H_

#include <stdint.h>

#include "include/base_log_provider.h"

namespace _CorvaneLogManager {

class ServerUploadLogProvider : public BaseLogProvider {
 public:
  static constexpr uint32_t kNoLimit = 4294967295u;

  ServerUploadLogProvider();
  ~ServerUploadLogProvider() override = default;

  int Initialize() override;
  void EmptyHook() override {}
  int DeleteExpiredRows() override;
  int InsertRow(const char* columns, const char* values, int32_t* rowId = nullptr) override;
  int UpdateRows(const char* columns, const char* values, const char* where,
                 int32_t* count = nullptr) override;
  int DeleteRows(const char* where, int32_t* count = nullptr) override;
  const char* GetCreateTableSql() override;
  const char* GetTableName() override;  // "server_upload", while statements name survey_log
  int GetRowCount() override;
  int DeleteOldestRows() override;

  // The only read of the queue (SelectRows would run on the survey database). "LIMIT %ld"
  // follows the ORDER BY text without a blank: that text must end with one. kNoLimit: no LIMIT.
  int SelectLimitedRows(const char* columns, const char* where, const char* orderBy, uint32_t limit,
                        int* rowCount, char*** rows);
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_PROVIDERS_SERVER_UPLOAD_LOG_PROVIDER_H_
