// Seam: filled in by the reporting layer.
#include "reporting/report_scheduler.h"

namespace _CorvaneLogManager {

int ReportScheduler::Create() { return 0; }
int ReportScheduler::Init() { return 0; }
void ReportScheduler::Stop() {}
int ReportScheduler::RunJob() { return 0; }

}  // namespace _CorvaneLogManager
