// ReportScheduler: decides when the daily report run happens and runs it on one worker thread;
// once a week it also copies the status snapshot rows into the feature table.
#ifndef LOGMGR_REPORTING_REPORT_SCHEDULER_H_
#define LOGMGR_REPORTING_REPORT_SCHEDULER_H_

#include <alarm.h>
#include <pthread.h>
#include <time.h>

#include <atomic>
#include <memory>

#include "reporting/report_context.h"

namespace _CorvaneLogManager {

class ReportBuilder;
class Uploader;

// The process-wide pair of the report run: one builder, one uploader.
struct ReportPair {
  ReportPair();
  ~ReportPair();

  std::unique_ptr<ReportBuilder> builder;
  std::unique_ptr<Uploader> uploader;

  // Made on first request from |context|; a failed request still leaves the holder registered,
  // so a later request returns it as it stands (deliberately no second attempt). Null on
  // failure.
  static ReportPair* Get(const ReportContext& context);
  static void Destroy();
};

class ReportScheduler {
 public:
  enum Event { kDumpContext = 0, kTimeChanged = 1, kCheck = 2, kAlarm = 3 };
  // Called on the worker at the end of every run, once running is cleared, with the data
  // given along with it.
  using RunEndHook = void (*)(void* data);

  // Zero the fields, keep |reportContext| and obtain the report pair with it. 0 / -1.
  int Create(const ReportContext& reportContext);
  // Alarm, sent-date clamp, first due check, watches. Always 0.
  int Init();
  // Alarm removed, worker cancelled and joined, pair destroyed, watches removed.
  void Stop();
  // The owner's step at the end of a run; install before Init. None by default.
  void SetRunEndHook(RunEndHook hook, void* data) {
    runEndHook = hook;
    runEndData = data;
  }
  // Drops the event while a run is in progress or for an unknown kind.
  void HandleEvent(int kind);
  // The worker's body: the run, then (when there was a report pair) the end hook.
  void RunAndEnd();
  // True from the moment a run is decided until the worker has finished it. Read by the main
  // loop, cleared by the worker: the flag hands the PrefStore dates and the report pair from
  // one thread to the other, so it is sequentially consistent.
  bool IsRunning() const { return running.load(); }
  alarm_id_t AlarmId() const { return alarmId; }

  // Brings key_sent_date into range: on first start midnight yesterday; otherwise never more
  // than four days back, and after a time change (forced) never in the future. 0 / -1.
  int ClampSentDate(bool forced);
  // Starts a run when key_sent_date is not midnight yesterday.
  void CheckReportDue();

  // Deliberately unwired: kept as part of the component's surface.
  void AddRandomTimer();
  int StampSurveyUpdate();
  bool IsSurveyUpdateDue();
  bool IsSentDateStale();

 private:
  // Report and upload, weekly purge, running cleared. -1 when there is no report pair.
  int RunJob();
  // Local midnight |days| days before today, on the handed clock.
  time_t MidnightDaysAgo(int days) const;
  void CreateAlarm(int interval);
  void RegisterWatches();
  void ResetAfterTimeChange();
  void DumpContext();
  void CheckWeeklyStatusCopy();
  void CopyStatusSnapshot(long lowerBound);
  void AddSdCardRow();
  void CheckWeeklyPurge();
  // Joins a worker that has finished its run (running is false), so no thread is left behind.
  void JoinFinishedWorker();

  ReportContext context;
  RunEndHook runEndHook = nullptr;
  void* runEndData = nullptr;
  alarm_entry_t* alarmEntry = nullptr;
  alarm_id_t alarmId = 0;
  ReportPair* reportPair = nullptr;
  std::atomic<bool> running{false};
  pthread_t worker = 0;
  bool workerStarted = false;  // main loop only: a worker exists that nobody joined yet
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_REPORTING_REPORT_SCHEDULER_H_
