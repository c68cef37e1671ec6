// Seam: filled in by the device status collector.
#include "collectors/device_status_monitor.h"

namespace _CorvaneLogManager {

int DeviceStatusMonitor::Recover() { return 0; }
int DeviceStatusMonitor::Start() { return 0; }
int DeviceStatusMonitor::Stop() { return 0; }

}  // namespace _CorvaneLogManager
