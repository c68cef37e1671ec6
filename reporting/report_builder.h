// ReportBuilder: turns each complete local day of the collection tables into upload records of
// the survey_log queue, with one size summary per day, then advances key_sent_date.
//
// Texts from outside callers: every record field comes from a row text split at ",", so a ","
// inside a collection value splits that value and shifts the later fields of that one record
// (its surplus tail is dropped); no queued text ever holds a ",", which keeps the uploader's
// split of the queue row aligned. A "'" is carried verbatim (doubled inside the insert
// statement), so it can neither break the day's inserts nor leak into another record. Device
// texts (model, firmware) have any "," replaced by ";".
//
// Bodies: built whole (up to kBodySize - 1 bytes) and stored whole when the queue's 1024-byte
// insert statement holds them; a longer one is stored up to its last whole UTF-8 character that
// fits, so the insert never fails for size. The day's summary adds each body's full length
// plus 30, stored or not.
//
// Sums: the slice records' sum of duration or value is TOTAL, given back as an integer when all
// of the group's values are integers, saturating at the 64-bit limits instead of failing (SUM's
// integer overflow would end the window's select in an error, lose the day's other records
// and block the day for good). Below 2^53 it equals SUM exactly; a group with a non-integer
// value gets the float SUM gives, and an all-NULL group stays empty.
#ifndef LOGMGR_REPORTING_REPORT_BUILDER_H_
#define LOGMGR_REPORTING_REPORT_BUILDER_H_

#include <stdint.h>
#include <time.h>

#include <map>
#include <string>

#include "reporting/device_identity.h"
#include "reporting/report_context.h"

namespace _CorvaneLogManager {

// Record activity codes: one per collection table, and the day's size summary.
inline constexpr char kActivityUseApp[] = "001";
inline constexpr char kActivityFeature[] = "002";
inline constexpr char kActivityManage[] = "003";
inline constexpr char kActivityError[] = "004";
inline constexpr char kActivitySummary[] = "007";

class BaseLogProvider;
class DbConnection;
class PrefStore;
struct Aggregation;

class ReportBuilder {
 public:
  static constexpr size_t kBodySize = 4096;
  static constexpr size_t kDateSize = 80;
  // ComputeWindow's modes.
  static constexpr int kWholeDay = 0;
  static constexpr int kHourWindow = 2;

  explicit ReportBuilder(const ReportContext& context) : context(context) {}
  ~ReportBuilder() = default;
  ReportBuilder(const ReportBuilder&) = delete;
  ReportBuilder& operator=(const ReportBuilder&) = delete;

  // Aggregates every day after key_sent_date up to yesterday, oldest first, advancing the
  // sent date after each. 0 when all due days were done; -1 otherwise (the failed day is
  // repeated by the next run; its records already queued stay, so it may queue them twice).
  int RunDaily();

  // Window of day start |day| (local midnight, seconds): kWholeDay is the day up to 23:59:59
  // (the last second deliberately outside); kHourWindow is |lengthHours| from |offsetHours|.
  // Sets the window texts (ms).
  void ComputeWindow(time_t day, int mode, int offsetHours, int lengthHours);
  const char* WindowStart() const { return windowStart; }
  const char* WindowEnd() const { return windowEnd; }

 private:
  // Deletes rows of the provider |table| with timestamp < |bound|. 0 / -1.
  int PurgeTable(const char* table, const char* bound);
  // Queues one record of |activity| and counts its size in the day's tally. The insert's result.
  int WriteRecord(const char* activity, const char* body);
  // "99.02.00" until the firmware is known.
  const char* AppVersion() const;
  // The registry's provider of |table|; null when missing.
  BaseLogProvider* Provider(const char* table) const;
  // Null without a queue: a record then fails at its insert.
  DbConnection* QueueConnection() const;
  // One table's day: its records in one queue transaction, then the purge of its rows.
  int Aggregate(const Aggregation& agg, time_t day);
  int AggregateWindows(const Aggregation& agg, time_t day);
  int WriteRow(const Aggregation& agg, bool slice, const char* sumText, char* rowText);
  int WriteSummary(const char* renderedDay);
  // Header pairs and the date pair, each followed by the separator.
  size_t BeginBody(char* body, size_t size, const char* date);
  // The header pairs before the date and the record's version text, built once per identity
  // rather than per record.
  void PrepareHead();

  char windowStart[24] = "";
  char windowEnd[24] = "";
  std::map<std::string, int32_t> sizeTally;
  DeviceIdentity identity;
  const ReportContext context;
  std::string bodyHead;
  std::string recordVersion;
  bool headReady = false;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_REPORTING_REPORT_BUILDER_H_
