#include "reporting/report_scheduler.h"

#include <Ecore.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/sysinfo.h>
#include <vconf.h>

#include <new>

#include "base/clock.h"
#include "include/base_log_provider.h"
#include "include/db_connection.h"
#include "include/provider_registry.h"
#include "reporting/report_builder.h"
#include "reporting/row_splitter.h"
#include "reporting/uploader.h"
#include "storage/db_manager.h"
#include "storage/pref_store.h"

namespace _CorvaneLogManager {

namespace {

const char kTimeChangedKey[] = "memory/system/timechanged";
const char kDumpKey[] = "db/corvane-log-manager/dumpcontext";
const char kMmcKey[] = "memory/appservice/mmc";
const char kStatusTable[] = "report_app_status_survey";
const char kFeatureTable[] = "use_app_feature_survey";
const char kSdCardFeature[] = "SDCA";
const int kSdCardPresent = 1000;
const int kAlarmInterval = 7200;   // seconds between due checks
const int kFirstAlarmDelay = 180;  // seconds from start to the first alarm
// The one-shot timer's delay: a random second within this span after the minimum.
const int kRandomDelayMin = 3600;
const int kRandomDelaySpan = 7200;
const long long kPurgeIntervalMs = 604799999LL;  // a week less a millisecond
const long kStatusCopyIntervalSeconds = 604800;  // a week
// After a time change a sent date more than three days behind yesterday gives up the days
// before the oldest one caught up.
const long kCatchUpSeconds = 259199;
const int kOldestDayCaughtUp = 4;         // midnight this many days ago
const long kSurveyUpdateSeconds = 43199;  // uptime before a survey update is due

// Not an owning static: a pair left at exit must not be torn down after the databases.
ReportPair* g_reportPair = nullptr;

// The dates are rendered as the device's log would show them; nothing is logged, so the
// texts go nowhere.
void RenderDate(time_t when) {
  char text[80];
  struct tm tm;
  if (localtime_r(&when, &tm) != nullptr)
    (void)strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%S%z", &tm);
}

int OnAlarm(alarm_id_t id, void* data) {
  auto* scheduler = static_cast<ReportScheduler*>(data);
  if (scheduler == nullptr || id != scheduler->AlarmId()) return 0;
  scheduler->HandleEvent(ReportScheduler::kAlarm);
  return 0;
}

void OnDumpRequest(keynode_t*, void* data) {
  auto* scheduler = static_cast<ReportScheduler*>(data);
  if (scheduler != nullptr) scheduler->HandleEvent(ReportScheduler::kDumpContext);
}

void OnTimeChanged(keynode_t*, void* data) {
  auto* scheduler = static_cast<ReportScheduler*>(data);
  if (scheduler != nullptr) scheduler->HandleEvent(ReportScheduler::kTimeChanged);
}

Eina_Bool OnRandomTimer(void* data) {
  static_cast<ReportScheduler*>(data)->HandleEvent(ReportScheduler::kAlarm);
  return ECORE_CALLBACK_CANCEL;
}

void* WorkerEntry(void* data) {
  static_cast<ReportScheduler*>(data)->RunAndEnd();
  return nullptr;
}

}  // namespace

ReportPair::ReportPair() = default;
ReportPair::~ReportPair() = default;

ReportPair* ReportPair::Get(const ReportContext& context) {
  if (g_reportPair != nullptr) return g_reportPair;
  ReportPair* pair = new (std::nothrow) ReportPair();
  if (pair == nullptr) return nullptr;
  g_reportPair = pair;
  pair->builder.reset(new (std::nothrow) ReportBuilder(context));
  if (pair->builder != nullptr && pair->uploader == nullptr) {
    pair->uploader.reset(new (std::nothrow) Uploader(context));
  }
  if (pair->builder == nullptr || pair->uploader == nullptr) {
    pair->builder.reset();
    pair->uploader.reset();
    return nullptr;
  }
  // A failed init keeps both objects in the holder; the request still fails.
  if (pair->uploader->Init(pair->builder.get()) != 0) return nullptr;
  return pair;
}

void ReportPair::Destroy() {
  delete g_reportPair;
  g_reportPair = nullptr;
}

time_t ReportScheduler::MidnightDaysAgo(int days) const {
  return LocalMidnightDaysBefore(context.NowSeconds(), days);
}

int ReportScheduler::Create(const ReportContext& reportContext) {
  context = reportContext;
  alarmEntry = nullptr;
  alarmId = 0;
  running = false;
  worker = 0;
  workerStarted = false;
  reportPair = ReportPair::Get(context);
  return reportPair != nullptr ? 0 : -1;
}

int ReportScheduler::Init() {
  if (alarmmgr_init("com.corvane.logmanager") == 0) CreateAlarm(kAlarmInterval);
  (void)ClampSentDate(false);
  CheckReportDue();
  RegisterWatches();
  return 0;
}

void ReportScheduler::CreateAlarm(int interval) {
  alarmEntry = alarmmgr_create_alarm();
  bool ok = alarmEntry != nullptr && alarmmgr_set_cb(OnAlarm, this) == 0;
  if (ok) {
    time_t start = context.NowSeconds() + kFirstAlarmDelay;
    struct tm tm;
    ok = localtime_r(&start, &tm) != nullptr;
    alarm_date_t date = {tm.tm_year + 1900, tm.tm_mon + 1, tm.tm_mday,
                         tm.tm_hour,        tm.tm_min,     tm.tm_sec};
    ok = ok && alarmmgr_set_time(alarmEntry, date) == 0 &&
         alarmmgr_set_repeat_mode(alarmEntry, ALARM_REPEAT_MODE_REPEAT, interval) == 0 &&
         alarmmgr_set_type(alarmEntry, ALARM_TYPE_VOLATILE) == 0;
  }
  if (ok) {
    if (alarmmgr_add_alarm_with_localtime(alarmEntry, nullptr, &alarmId) == 0) return;
    (void)alarmmgr_remove_alarm(alarmId);
    alarmId = 0;
  }
  if (alarmEntry != nullptr) {
    (void)alarmmgr_free_alarm(alarmEntry);
    alarmEntry = nullptr;
  }
}

void ReportScheduler::RegisterWatches() {
  (void)vconf_notify_key_changed(kTimeChangedKey, OnTimeChanged, this);
  int dump = 0;
  if (vconf_get_bool(kDumpKey, &dump) == -1) (void)vconf_set_bool(kDumpKey, 0);
  (void)vconf_notify_key_changed(kDumpKey, OnDumpRequest, this);
}

void ReportScheduler::Stop() {
  if (alarmEntry != nullptr) {
    if (alarmId != 0) (void)alarmmgr_remove_alarm(alarmId);
    (void)alarmmgr_free_alarm(alarmEntry);
    alarmEntry = nullptr;
    alarmId = 0;
  }
  alarmmgr_fini();
  if (running.load() && workerStarted && pthread_cancel(worker) == 0) {
    // The worker may sit inside a statement with cancellation off: interrupting both
    // connections makes that statement fail, and the worker ends itself there.
    for (DatabaseOwner* owner : {static_cast<DatabaseOwner*>(context.queue),
                                 static_cast<DatabaseOwner*>(context.survey)}) {
      if (owner != nullptr && owner->GetConnection() != nullptr)
        owner->GetConnection()->Interrupt();
    }
  }
  // Also a finished worker: it may still be re-checking consent, and the pair, the
  // connections and LogManager go away right after this.
  if (workerStarted) {
    int err = pthread_join(worker, nullptr);
    if (err != 0) (void)strerror(err);  // nothing is logged
    workerStarted = false;
  }
  ReportPair::Destroy();
  reportPair = nullptr;
  (void)vconf_ignore_key_changed(kTimeChangedKey, OnTimeChanged);
  (void)vconf_ignore_key_changed(kDumpKey, OnDumpRequest);
}

void ReportScheduler::HandleEvent(int kind) {
  if (running.load() || kind < 0 || kind > kAlarm) return;
  switch (kind) {
    case kDumpContext:
      DumpContext();
      break;
    case kTimeChanged:
      ResetAfterTimeChange();
      break;
    default:
      break;
  }
  CheckReportDue();
}

int ReportScheduler::ClampSentDate(bool forced) {
  PrefStore* prefs = context.prefs;
  if (prefs == nullptr) return -1;
  long long sent = prefs->GetSentDate();
  time_t now = context.NowSeconds();
  struct tm tm;
  if (localtime_r(&now, &tm) == nullptr) return -1;
  if (sent == 0) return prefs->SetSentDate(static_cast<int32_t>(MidnightDaysAgo(1)));
  time_t oldest = MidnightDaysAgo(kOldestDayCaughtUp);
  if (!forced) {
    if (sent < oldest) return prefs->SetSentDate(static_cast<int32_t>(oldest));
    return 0;
  }
  time_t yesterday = MidnightDaysAgo(1);
  if (sent > yesterday) return prefs->SetSentDate(static_cast<int32_t>(yesterday));
  if (yesterday - sent > kCatchUpSeconds) return prefs->SetSentDate(static_cast<int32_t>(oldest));
  return 0;
}

void ReportScheduler::CheckReportDue() {
  PrefStore* prefs = context.prefs;
  if (prefs == nullptr) return;
  long long sent = prefs->GetSentDate();
  RenderDate(static_cast<time_t>(sent));
  long long yesterday = 0;
  if (reportPair != nullptr && reportPair->builder != nullptr) yesterday = MidnightDaysAgo(1);
  if (yesterday == sent) return;

  JoinFinishedWorker();
  running = true;
  CheckWeeklyStatusCopy();
  int err = pthread_create(&worker, nullptr, WorkerEntry, this);
  workerStarted = err == 0;
  // Running deliberately stays set on failure: no further run until a restart.
  if (err != 0) (void)strerror(err);
}

void ReportScheduler::JoinFinishedWorker() {
  // Only called with running false: the worker is past its run and ends within moments.
  if (!workerStarted) return;
  (void)pthread_join(worker, nullptr);
  workerStarted = false;
}

void ReportScheduler::RunAndEnd() {
  if (RunJob() == 0 && runEndHook != nullptr) runEndHook(runEndData);
}

int ReportScheduler::RunJob() {
  if (reportPair == nullptr) return -1;
  if (context.ReportEnabled() && reportPair->builder != nullptr &&
      reportPair->builder->RunDaily() == 0 && reportPair->uploader != nullptr) {
    reportPair->uploader->SendAll();
  }
  CheckWeeklyPurge();
  running = false;
  return 0;
}

void ReportScheduler::CheckWeeklyPurge() {
  PrefStore* prefs = context.prefs;
  long long now = context.NowMs();
  long long stored = prefs != nullptr ? prefs->GetDeleteDate() : -1;
  if (stored != -1 && now - stored <= kPurgeIntervalMs) return;
  if (context.survey == nullptr) return;
  (void)context.survey->NotifyDeleteExpired();
  if (prefs != nullptr) (void)prefs->SetDeleteDate(now);
}

void ReportScheduler::ResetAfterTimeChange() {
  PrefStore* prefs = context.prefs;
  if (prefs != nullptr) (void)prefs->SetDeleteDate(0);  // the next run purges
  (void)ClampSentDate(true);
}

void ReportScheduler::DumpContext() {
  PrefStore* prefs = context.prefs;
  if (prefs == nullptr) return;
  (void)prefs->SetDeleteDate(0);
  int days = 0;
  // The key is made as a boolean; reading it as an integer is deliberate.
  if (vconf_get_int(kDumpKey, &days) != 0) return;
  RenderDate(static_cast<time_t>(prefs->GetSentDate()));
  time_t target = MidnightDaysAgo(days);
  (void)prefs->SetSentDate(static_cast<int32_t>(target));
  RenderDate(target);
}

void ReportScheduler::CheckWeeklyStatusCopy() {
  PrefStore* prefs = context.prefs;
  if (prefs == nullptr) return;
  time_t now = context.NowSeconds();
  struct tm tm;
  if (localtime_r(&now, &tm) == nullptr) return;
  long t = static_cast<long>(mktime(&tm));
  long r = prefs->GetReportDate();
  if (r != 0 && r > t) {
    (void)prefs->SetReportDate(static_cast<int32_t>(t));
    return;
  }
  if (r != 0 && t - r < kStatusCopyIntervalSeconds) return;
  CopyStatusSnapshot(r);
  AddSdCardRow();
  (void)prefs->SetReportDate(static_cast<int32_t>(t));
}

void ReportScheduler::CopyStatusSnapshot(long lowerBound) {
  ProviderRegistry* registry = context.providers;
  if (registry == nullptr) return;
  BaseLogProvider* status = registry->Lookup(kStatusTable);
  BaseLogProvider* feature = registry->Lookup(kFeatureTable);
  if (status == nullptr || feature == nullptr) return;

  // Seconds compared with millisecond timestamps: every row qualifies. Kept as it is.
  char where[512];
  (void)snprintf(where, sizeof where, "timestamp>%ld", lowerBound);
  QueryRows rows;
  if (status->SelectGroupedRows("app_id,feature,extra,value", where, nullptr, nullptr, &rows.count,
                                &rows.rows) != 0) {
    return;
  }
  for (int i = 0; i < rows.count; ++i) {
    char* cursor = nullptr;
    char* appId = RowSplitter::Next(rows.rows[i], ",", &cursor);
    char* code = RowSplitter::Next(nullptr, ",", &cursor);
    char* extra = RowSplitter::Next(nullptr, ",", &cursor);
    char* value = RowSplitter::Next(nullptr, ",", &cursor);
    char values[512];
    (void)snprintf(values, sizeof values, "'%s','%s','%s',%d", appId, code, extra,
                   static_cast<int>(strtol(value, nullptr, 10)));
    (void)feature->InsertRow("app_id,feature,extra,value", values);
  }

  if (context.survey != nullptr && context.survey->GetConnection() != nullptr) {
    (void)context.survey->GetConnection()->Exec("delete from report_app_status_survey;");
  }
}

void ReportScheduler::AddSdCardRow() {
  ProviderRegistry* registry = context.providers;
  BaseLogProvider* feature = registry != nullptr ? registry->Lookup(kFeatureTable) : nullptr;
  if (feature == nullptr) return;
  int mmc = 0;
  if (vconf_get_int(kMmcKey, &mmc) != 0) return;
  char values[512];
  (void)snprintf(values, sizeof values, "'%s','%s',%d", context.AppId(), kSdCardFeature,
                 mmc >= 1 ? kSdCardPresent : 0);
  (void)feature->InsertRow("app_id,feature,value", values);
}

void ReportScheduler::AddRandomTimer() {
  (void)ecore_timer_add(static_cast<double>(rand() % kRandomDelaySpan + kRandomDelayMin),
                        OnRandomTimer, this);
}

int ReportScheduler::StampSurveyUpdate() {
  struct sysinfo info;
  int err = sysinfo(&info);
  if (err != 0) return err;
  PrefStore* prefs = context.prefs;
  return prefs != nullptr ? prefs->SetSurveyUpdateDate(static_cast<int32_t>(info.uptime)) : -1;
}

bool ReportScheduler::IsSurveyUpdateDue() {
  PrefStore* prefs = context.prefs;
  struct sysinfo info;
  if (prefs == nullptr || sysinfo(&info) != 0) return false;
  long stamp = prefs->GetSurveyUpdateDate();
  return stamp == 0 || info.uptime - stamp > kSurveyUpdateSeconds;
}

bool ReportScheduler::IsSentDateStale() {
  PrefStore* prefs = context.prefs;
  return prefs != nullptr && static_cast<long long>(prefs->GetSentDate()) != MidnightDaysAgo(1);
}

}  // namespace _CorvaneLogManager
