// Seam: filled in by the app usage collector.
#include "collectors/app_usage_monitor.h"

namespace _CorvaneLogManager {

int AppUsageMonitor::Start() { return 0; }
void AppUsageMonitor::OnScreenState(int) {}

}  // namespace _CorvaneLogManager
