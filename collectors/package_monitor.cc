// Seam: filled in by its collector.
#include "collectors/package_monitor.h"

namespace _CorvaneLogManager {

int PackageMonitor::Start() { return 0; }
int PackageMonitor::Stop() { return 0; }

}  // namespace _CorvaneLogManager
