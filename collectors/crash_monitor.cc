// Seam: filled in by its collector.
#include "collectors/crash_monitor.h"

namespace _CorvaneLogManager {

int CrashMonitor::Start() { return 0; }
int CrashMonitor::Stop() { return 0; }

}  // namespace _CorvaneLogManager
