// Uploader: empties the survey_log queue into the log-relay library, highest rank first, at
// most 1000 records per send; drops records stamped before midnight three days ago or in the
// future. A record leaves the queue only once the relay has taken it and it was marked.
#ifndef LOGMGR_REPORTING_UPLOADER_H_
#define LOGMGR_REPORTING_UPLOADER_H_

#include <stdint.h>

#include <memory>
#include <string>

#include "reporting/report_builder.h"
#include "reporting/report_context.h"

namespace _CorvaneLogManager {

class ServerUploadLogProvider;

class Uploader {
 public:
  static constexpr uint32_t kBatchLimit = 1000;
  // Fields of a queued record as read back: _id, timestamp, svc_code, category_code,
  // activity, log_type, app_version, body, rly_result.
  static constexpr int kRecordFields = 9;

  explicit Uploader(const ReportContext& context);
  ~Uploader();
  Uploader(const Uploader&) = delete;
  Uploader& operator=(const Uploader&) = delete;

  // Takes the report pair's builder (-1 when null) and makes the own queue provider
  // (-1 when that allocation fails). 0 on success.
  int Init(ReportBuilder* reportBuilder);
  // Purge out-of-window records and those a cut-short send marked, hand over one batch,
  // delete what was handed over. Runs only with a builder and runtime switch 1 on.
  void SendAll();

  // "CASE activity WHEN '007' THEN 0 ... END " (ends in a blank: LIMIT follows directly).
  static std::string RankOrder();

 private:
  void PurgeOutOfWindow();
  void SendBatch(uint32_t limit);
  void DeleteSent();

  std::unique_ptr<ServerUploadLogProvider> queue;
  ReportBuilder* builder = nullptr;
  const ReportContext context;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_REPORTING_UPLOADER_H_
