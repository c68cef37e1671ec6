#include "reporting/report_builder.h"

#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <initializer_list>
#include <memory>

#include "base/clock.h"
#include "include/base_log_provider.h"
#include "include/db_connection.h"
#include "include/provider_registry.h"
#include "include/sql_literal.h"
#include "reporting/row_splitter.h"
#include "storage/db_manager.h"
#include "storage/pref_store.h"

namespace _CorvaneLogManager {

// How a grouped table is selected in one mode.
struct Grouping {
  const char* aggregate;  // appended to the columns: COUNT, in slice mode maybe SUM
  const char* groupBy;
  const char* sumText;  // the records' "sum=" value
};

// How a table is cut into windows in slice mode.
struct Slicing {
  int windows;  // 0: never sliced, one whole-day window in either mode
  int windowHours;
  bool sumReplacesLastKey;  // a SUM column ends the row and stands for the last key's value
  Grouping grouping;
};

// How one collection table becomes records. Columns after timestamp give the pair keys; a
// grouped table adds COUNT (and in slice mode maybe SUM).
struct Aggregation {
  const char* table;
  const char* activity;
  const char* columns;
  const char* keys[5];  // pair keys of the columns after timestamp, null-terminated
  bool grouped;         // false: one record per row, no sum/count pairs, always a whole day
  Slicing slice;
  Grouping plain;
};

namespace {

constexpr char kDateFormat[] = "%Y-%m-%dT%H:%M:%S%z";
constexpr char kSeparator[] = "\xC2\xB6";  // "¶"
constexpr char kRecordColumns[] = "svc_code,category_code,activity,log_type,app_version,body";
constexpr char kDefaultVersion[] = "99.02.00";
// The record's fixed codes, as the relay's receiver expects them.
constexpr char kServiceCode[] = "701";
constexpr char kCategoryCode[] = "999";
constexpr char kLogType[] = "BIZ";
// The queue provider's insert statement is 1024 bytes; the values text gets what its fixed
// parts leave, the timestamp counted at its widest, so the statement is never cut.
constexpr size_t kInsertStatementSize = 1024;
constexpr size_t kValuesSize = kInsertStatementSize - (sizeof("INSERT INTO survey_log(") - 1) -
                               (sizeof(kRecordColumns) - 1) - (sizeof(",timestamp) VALUES (") - 1) -
                               (sizeof(",-9223372036854775808);") - 1);
constexpr int kTallyExtra = 30;  // per record, on top of its body's length
constexpr char kQueueTable[] = "server_upload";

// The slice sums. SUM fails the whole select once two values overflow 64 bits, which would
// cost the window's other records and block the day; TOTAL never fails. An all-integer group
// gets its total back as an integer, CAST saturating at the 64-bit limits (exact while the
// sum stays within 2^53, which any real duration or count does); a group holding other values
// gets TOTAL's float, as SUM would give it, and an all-NULL group stays NULL.
// clang-format off
#define LOGMGR_CLAMPED_SUM(col)                                                              \
  "CASE WHEN COUNT(" col ")=0 THEN NULL WHEN MAX(typeof(" col ") NOT IN ('integer','null')) " \
  "THEN TOTAL(" col ") ELSE CAST(TOTAL(" col ") AS INTEGER) END"

constexpr char kCount[] = " , COUNT(1)";
// Outside slice mode a grouped table counts the rows of each timestamp.
constexpr Grouping kPerTimestamp = {kCount, "timestamp", "0"};
constexpr Grouping kUngrouped = {"", nullptr, ""};
constexpr Slicing kNeverSliced = {0, 0, false, kUngrouped};
constexpr bool kGrouped = true;
constexpr bool kRecordPerRow = false;

// Eight 3-hour windows whose SUM column (the last) stands for the last key's value.
constexpr Slicing ThreeHourSums(Grouping grouping) { return {8, 3, true, grouping}; }
// The whole day as one 24-hour window, counted only.
constexpr Slicing OneDayCount(Grouping grouping) { return {1, 24, false, grouping}; }

// In the order the day is processed.
const Aggregation kAggregations[] = {
    {"use_app_survey", kActivityUseApp, "timestamp,app_id,duration",
     {"app_id", "duration", nullptr}, kGrouped,
     ThreeHourSums({" , COUNT(1), " LOGMGR_CLAMPED_SUM("duration"), "app_id", "3"}),
     kPerTimestamp},
    {"manage_app_survey", kActivityManage, "timestamp,installed_app_id,type",
     {"app_id", "type", nullptr}, kRecordPerRow, kNeverSliced, kUngrouped},
    {"report_app_error_survey", kActivityError, "timestamp,app_id,type",
     {"app_id", "type", nullptr}, kGrouped,
     OneDayCount({kCount, "app_id,type", "24"}),
     kPerTimestamp},
    {"use_app_feature_survey", kActivityFeature, "timestamp,app_id,feature,extra,value",
     {"app_id", "feature", "extra", "value", nullptr}, kGrouped,
     ThreeHourSums({" , COUNT(1), " LOGMGR_CLAMPED_SUM("value"), "app_id,feature,extra", "3"}),
     kPerTimestamp},
};
// clang-format on

#undef LOGMGR_CLAMPED_SUM

// Slice mode, on as shipped: the usage tables in eight 3-hour windows with COUNT and SUM.
constexpr bool kSliceMode = true;

// 0 when the time cannot be rendered.
size_t RenderDate(time_t seconds, char* out, size_t size) {
  struct tm tm;
  if (localtime_r(&seconds, &tm) == nullptr) return 0;
  return strftime(out, size, kDateFormat, &tm);
}

// Device texts go into records unchanged except for ",", which would split the queue row.
std::string DeviceText(const char* text) {
  std::string out = text != nullptr ? text : "";
  for (char& c : out) {
    if (c == ',') c = ';';
  }
  return out;
}

// Formats at the end of |buf|; a text that does not fit is cut, |*len| stays below |size|.
__attribute__((format(printf, 4, 5))) void AppendF(char* buf, size_t size, size_t* len,
                                                   const char* format, ...) {
  if (*len + 1 >= size) return;
  va_list args;
  va_start(args, format);
  int n = vsnprintf(buf + *len, size - *len, format, args);
  va_end(args);
  if (n > 0) *len = (*len + n < size) ? *len + n : size - 1;
}

// AppendF of "%s" pieces without the format: the same bytes, cut at the same place.
void AppendTexts(char* buf, size_t size, size_t* len, std::initializer_list<const char*> texts) {
  for (const char* text : texts) {
    if (*len + 1 >= size) return;
    size_t take = strlen(text);
    if (take > size - 1 - *len) take = size - 1 - *len;
    memcpy(buf + *len, text, take);
    *len += take;
    buf[*len] = '\0';
  }
}

}  // namespace

BaseLogProvider* ReportBuilder::Provider(const char* table) const {
  return context.providers != nullptr ? context.providers->Lookup(table) : nullptr;
}

DbConnection* ReportBuilder::QueueConnection() const {
  return context.queue != nullptr ? context.queue->GetConnection() : nullptr;
}

const char* ReportBuilder::AppVersion() const {
  return identity.Firmware() != nullptr ? identity.Firmware() : kDefaultVersion;
}

int ReportBuilder::RunDaily() {
  if (!context.ReportEnabled()) return -1;
  // A worker stopped inside a table's transaction leaves it open; its records were never
  // committed and that table's rows are still there, so dropping them loses nothing.
  DbConnection* queueConn = QueueConnection();
  if (queueConn != nullptr && queueConn->RollBackOpenTransaction() != 0) return -1;
  (void)identity.Refresh();
  headReady = false;  // the identity may have changed
  PrefStore* prefs = context.prefs;
  if (prefs == nullptr) return -1;
  time_t now = context.NowSeconds();
  time_t limit = LocalMidnightDaysBefore(now, 1);
  time_t day = static_cast<time_t>(prefs->NormaliseSentDate());
  if (day == 0) return -1;

  while (day < limit) {
    struct tm tm;
    if (localtime_r(&day, &tm) == nullptr) return -1;
    tm.tm_mday += 1;
    tm.tm_isdst = -1;
    day = mktime(&tm);
    char dayText[kDateSize] = "";
    (void)RenderDate(day, dayText, sizeof(dayText));

    sizeTally.clear();
    for (const char* activity :
         {kActivityUseApp, kActivityFeature, kActivityManage, kActivityError}) {
      sizeTally[activity] = 0;
    }
    for (const Aggregation& agg : kAggregations) {
      if (Aggregate(agg, day) != 0) return -1;
    }
    if (WriteSummary(dayText) != 0) return -1;
    (void)prefs->SetSentDate(static_cast<int32_t>(day));
  }
  return 0;
}

void ReportBuilder::ComputeWindow(time_t day, int mode, int offsetHours, int lengthHours) {
  struct tm tm;
  long long start = 0;
  long long end = 0;
  if (localtime_r(&day, &tm) != nullptr) {
    tm.tm_isdst = -1;
    if (mode == kWholeDay) {
      start = static_cast<long long>(day) * 1000;
      tm.tm_hour += 23;
      tm.tm_min += 59;
      tm.tm_sec += 59;
      end = static_cast<long long>(mktime(&tm)) * 1000;
    } else {
      tm.tm_hour += offsetHours;
      start = static_cast<long long>(mktime(&tm)) * 1000;
      tm.tm_hour += lengthHours;
      tm.tm_isdst = -1;
      end = static_cast<long long>(mktime(&tm)) * 1000;
    }
  }
  snprintf(windowStart, sizeof(windowStart), "%lld", start);
  snprintf(windowEnd, sizeof(windowEnd), "%lld", end);
}

int ReportBuilder::Aggregate(const Aggregation& agg, time_t day) {
  // The table's records go into the queue in one transaction, committed before its rows are
  // purged: a kill or a failure before the commit leaves neither records nor a purge.
  // Without a queue a record fails at its insert, as it always did.
  DbConnection* queueConn = QueueConnection();
  if (queueConn != nullptr && queueConn->BeginTransaction() != 0) return -1;
  if (AggregateWindows(agg, day) != 0) {
    if (queueConn != nullptr) (void)queueConn->RollBackOpenTransaction();
    return -1;
  }
  if (queueConn != nullptr && queueConn->CommitTransaction() != 0) return -1;
  return PurgeTable(agg.table, windowEnd);
}

int ReportBuilder::AggregateWindows(const Aggregation& agg, time_t day) {
  bool slice = kSliceMode && agg.slice.windows > 0;
  const Grouping& grouping = slice ? agg.slice.grouping : agg.plain;
  char columns[320];
  snprintf(columns, sizeof(columns), "%s%s", agg.columns, grouping.aggregate);
  int windows = slice ? agg.slice.windows : 1;

  for (int w = 0; w < windows; ++w) {
    if (slice) {
      ComputeWindow(day, kHourWindow, w * agg.slice.windowHours, agg.slice.windowHours);
    } else {
      ComputeWindow(day, kWholeDay, 0, 0);
    }
    char where[256];
    snprintf(where, sizeof(where), "timestamp >= %s and timestamp < %s", windowStart, windowEnd);
    BaseLogProvider* provider = Provider(agg.table);
    if (provider == nullptr) return -1;
    // Freed also when a stop ends the worker inside one of their records' inserts.
    QueryRows selected;
    int rc = agg.grouped
                 ? provider->SelectGroupedRows(columns, where, nullptr, grouping.groupBy,
                                               &selected.count, &selected.rows)
                 : provider->SelectRows(columns, where, nullptr, &selected.count, &selected.rows);
    if (rc != 0) return -1;
    int result = 0;
    for (int i = 0; i < selected.count && result == 0 && selected.rows != nullptr; ++i) {
      result = WriteRow(agg, slice, grouping.sumText, selected.rows[i]);
    }
    if (result != 0) return -1;
  }
  return 0;
}

int ReportBuilder::WriteRow(const Aggregation& agg, bool slice, const char* sumText,
                            char* rowText) {
  int keyCount = 0;
  while (agg.keys[keyCount] != nullptr) ++keyCount;
  bool hasSum = slice && agg.slice.sumReplacesLastKey;
  int fieldCount = 1 + keyCount + (agg.grouped ? 1 : 0) + (hasSum ? 1 : 0);
  std::unique_ptr<char*[]> fields(RowSplitter::SplitRows(&rowText, 1, fieldCount));
  if (fields == nullptr) return -1;

  // An aggregated group has no single time of its own: slice records carry the window end.
  long long stamp = slice ? strtoll(windowEnd, nullptr, 10) : strtoll(fields[0], nullptr, 10);
  char date[kDateSize];
  if (RenderDate(static_cast<time_t>(stamp / 1000), date, sizeof(date)) == 0) {
    return 0;  // skipped silently
  }

  char body[kBodySize];
  size_t len = BeginBody(body, sizeof(body), date);
  if (agg.grouped) {
    AppendTexts(body, sizeof(body), &len,
                {"sum=", sumText, kSeparator, "count=", fields[1 + keyCount]});
  }
  for (int k = 0; k < keyCount; ++k) {
    const char* value = (hasSum && k == keyCount - 1) ? fields[fieldCount - 1] : fields[1 + k];
    bool first = !agg.grouped && k == 0;
    AppendTexts(body, sizeof(body), &len, {first ? "" : kSeparator, agg.keys[k], "=", value});
  }
  return WriteRecord(agg.activity, body);
}

void ReportBuilder::PrepareHead() {
  if (headReady) return;
  char head[kBodySize];
  size_t len = 0;
  head[0] = '\0';
  AppendF(head, sizeof(head), &len,
          "mcc=%s%smnc=%s%sdid=%smodel=%s%sfw_ver=%s%sdate=", DeviceText(identity.Mcc()).c_str(),
          kSeparator, DeviceText(identity.Mnc()).c_str(), kSeparator, kSeparator,
          DeviceText(identity.Model()).c_str(), kSeparator, DeviceText(AppVersion()).c_str(),
          kSeparator);
  bodyHead = head;
  recordVersion = DeviceText(AppVersion());
  headReady = true;
}

size_t ReportBuilder::BeginBody(char* body, size_t size, const char* date) {
  PrepareHead();
  size_t len = 0;
  body[0] = '\0';
  // Appended as one text, so a cut falls where it always did.
  AppendTexts(body, size, &len, {bodyHead.c_str(), date, kSeparator});
  return len;
}

int ReportBuilder::WriteSummary(const char* renderedDay) {
  char body[kBodySize];
  size_t len = BeginBody(body, sizeof(body), renderedDay);
  AppendF(body, sizeof(body), &len, "size_%s=%d%ssize_%s=%d%ssize_%s=%d%ssize_%s=%d",
          kActivityUseApp, sizeTally[kActivityUseApp], kSeparator, kActivityFeature,
          sizeTally[kActivityFeature], kSeparator, kActivityManage, sizeTally[kActivityManage],
          kSeparator, kActivityError, sizeTally[kActivityError]);
  return WriteRecord(kActivitySummary, body);
}

int ReportBuilder::WriteRecord(const char* activity, const char* body) {
  char values[kValuesSize];
  snprintf(values, sizeof(values), "'%s','%s','%s','%s','", kServiceCode, kCategoryCode, activity,
           kLogType);
  PrepareHead();
  (void)AppendQuoted(values, sizeof(values), recordVersion.c_str());
  size_t used = strlen(values);
  snprintf(values + used, sizeof(values) - used, "','");
  // The body is stored whole when the statement holds it, else up to the last whole UTF-8
  // character that fits (one byte kept back for the closing quote).
  used = strlen(values);
  size_t fits = AppendQuoted(values, sizeof(values) - 1, body);
  size_t cut = fits;
  while (cut > 0 && body[cut] != '\0' && (static_cast<unsigned char>(body[cut]) & 0xC0) == 0x80) {
    --cut;
  }
  if (cut != fits) {
    values[used] = '\0';
    std::string head(body, cut);
    (void)AppendQuoted(values, sizeof(values) - 1, head.c_str());
  }
  used = strlen(values);
  snprintf(values + used, sizeof(values) - used, "'");
  // The summary counts what the day produced, stored or not.
  sizeTally[activity] += static_cast<int32_t>(strlen(body)) + kTallyExtra;

  BaseLogProvider* queue = Provider(kQueueTable);
  if (queue == nullptr) return -1;
  return queue->InsertRow(kRecordColumns, values);
}

int ReportBuilder::PurgeTable(const char* table, const char* bound) {
  BaseLogProvider* provider = Provider(table);
  if (provider == nullptr) return -1;
  char where[256];
  snprintf(where, sizeof(where), "timestamp < %s", bound);
  return provider->DeleteRows(where) == 0 ? 0 : -1;
}

}  // namespace _CorvaneLogManager
