#include "reporting/uploader.h"

#include <corvane_log_relay.h>
#include <stdio.h>
#include <time.h>

#include <new>

#include "base/clock.h"
#include "include/db_connection.h"
#include "providers/server_upload_log_provider.h"
#include "reporting/row_splitter.h"

namespace _CorvaneLogManager {

namespace {

constexpr char kQueueColumns[] =
    "_id,timestamp,svc_code,category_code,activity,log_type,app_version, body, rly_result";

// Hand-over order: the daily summary first, the feature records last.
struct Rank {
  const char* activity;
  const char* then;
};
const Rank kRanks[] = {{kActivitySummary, "' THEN 0 "},
                       {kActivityUseApp, "' THEN 1 "},
                       {kActivityManage, "' THEN 2 "},
                       {kActivityError, "' THEN 3 "},
                       {kActivityFeature, "' THEN 4 "}};
// Records stamped before midnight this many days ago are dropped unsent.
constexpr int kKeptDays = 3;
constexpr char kSentMark[] = "success";

enum Field { kId, kTimestamp, kSvcCode, kCategory, kActivity, kLogType, kAppVersion, kBody };

}  // namespace

Uploader::Uploader(const ReportContext& context) : context(context) {}

Uploader::~Uploader() = default;

int Uploader::Init(ReportBuilder* reportBuilder) {
  if (reportBuilder == nullptr) return -1;
  builder = reportBuilder;
  queue.reset(new (std::nothrow) ServerUploadLogProvider());
  return queue == nullptr ? -1 : 0;
}

std::string Uploader::RankOrder() {
  std::string text = "CASE activity ";
  for (const Rank& rank : kRanks) {
    text += "WHEN '";
    text += rank.activity;
    text += rank.then;
  }
  return text + "END ";
}

void Uploader::SendAll() {
  if (builder == nullptr || queue == nullptr || !context.ReportEnabled()) return;
  PurgeOutOfWindow();
  // A record marked by a send that was cut short (a kill between mark and delete) was handed
  // over already: it goes now instead of being handed over again.
  DeleteSent();
  SendBatch(kBatchLimit);
  DeleteSent();
}

void Uploader::PurgeOutOfWindow() {
  int64_t now = context.NowMs();
  time_t oldest = LocalMidnightDaysBefore(static_cast<time_t>(now / 1000), kKeptDays);
  if (oldest == 0) return;  // no local time
  long long lower = static_cast<long long>(oldest) * 1000;
  char where[100];
  snprintf(where, sizeof(where), " timestamp < %lld or timestamp > %lld", lower,
           static_cast<long long>(now));
  (void)queue->DeleteRows(where);
}

void Uploader::SendBatch(uint32_t limit) {
  QueryRows rows;
  std::string order = RankOrder();
  if (queue->SelectLimitedRows(kQueueColumns, nullptr, order.c_str(), limit, &rows.count,
                               &rows.rows) != 0 ||
      rows.rows == nullptr) {
    return;
  }
  std::unique_ptr<char*[]> fields(RowSplitter::SplitRows(rows.rows, rows.count, kRecordFields));
  if (fields == nullptr) return;
  const char* appId = context.AppId();

  for (int i = 0; i < rows.count; ++i) {
    char** record = fields.get() + static_cast<size_t>(i) * kRecordFields;
    int64_t nowMs = context.NowMs();
    time_t seconds = static_cast<time_t>(nowMs / 1000);

    corvane_log_item_h handle = nullptr;
    if (corvane_log_relay_mobile_create_log_item_handle(&handle) != 0 && handle == nullptr) break;
    const struct {
      int item;
      const void* value;
    } items[] = {{CORVANE_LOG_ITEM_APP_ID, appId},
                 {CORVANE_LOG_ITEM_LOG_TYPE, record[kLogType]},
                 {CORVANE_LOG_ITEM_SVC_CODE, record[kSvcCode]},
                 {CORVANE_LOG_ITEM_TIME, &nowMs},
                 {CORVANE_LOG_ITEM_ACTIVITY, record[kActivity]},
                 {CORVANE_LOG_ITEM_APP_VERSION, record[kAppVersion]},
                 {CORVANE_LOG_ITEM_BODY, record[kBody]}};
    bool setFailed = false;
    for (const auto& entry : items) {
      if (corvane_log_relay_mobile_set_log_item(handle, entry.item, entry.value) != 0) {
        setFailed = true;
        break;
      }
    }
    // Deliberately not freed after a failed set: kept as it stands.
    if (setFailed) break;
    if (corvane_log_relay_mobile_register_log_item(handle) != 0) {
      (void)corvane_log_relay_mobile_free_log_item(handle);
      break;
    }
    (void)corvane_log_relay_mobile_free_log_item(handle);
    handle = nullptr;

    char where[100];
    snprintf(where, sizeof(where), "_id = %s", record[kId]);
    if (queue->UpdateRows("rly_result", kSentMark, where) != 0) break;

    // Rendered as the hand-over log line would be; nothing is logged.
    char stamp[100];
    struct tm tm;
    if (localtime_r(&seconds, &tm) != nullptr) {
      (void)strftime(stamp, sizeof(stamp), "%d/%b/%Y:%H:%M:%S", &tm);
    }
  }
}

void Uploader::DeleteSent() {
  char where[100];
  snprintf(where, sizeof(where), "rly_result = '%s'", kSentMark);
  (void)queue->DeleteRows(where);
}

}  // namespace _CorvaneLogManager
