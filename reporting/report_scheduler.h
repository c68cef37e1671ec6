// ReportScheduler: decides when the daily report run happens and runs it on one worker thread.
#ifndef LOGMGR_REPORTING_REPORT_SCHEDULER_H_
#define LOGMGR_REPORTING_REPORT_SCHEDULER_H_

namespace _CorvaneLogManager {

class ReportScheduler {
 public:
  // Zero the fields and obtain the report pair. 0 / -1.
  int Create();
  // Alarm, sent-date clamp, first due check, watches. Always 0.
  int Init();
  // Alarm removed, worker cancelled and joined, pair destroyed, watches removed.
  void Stop();
  // The job body run when a worker ends: report and upload, weekly trim, busy flag cleared.
  // -1 when there is no report pair.
  int RunJob();
  // True from the moment a run is decided until the worker has finished it.
  bool IsRunning() const { return running; }

 private:
  bool running = false;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_REPORTING_REPORT_SCHEDULER_H_
