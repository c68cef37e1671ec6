// CrashMonitor: application crashes as report_app_error_survey rows, one per application that
// shares the crashed executable.
#ifndef LOGMGR_COLLECTORS_CRASH_MONITOR_H_
#define LOGMGR_COLLECTORS_CRASH_MONITOR_H_

#include <dbus/dbus.h>

namespace _CorvaneLogManager {

class ProviderRegistry;

class CrashMonitor {
 public:
  // Rows are written through |providers|' report_app_error_survey provider.
  explicit CrashMonitor(ProviderRegistry* providers) : providers(providers) {}

  int Start();
  int Stop();

  static DBusHandlerResult CrashFilter(DBusConnection* connection, DBusMessage* message,
                                       void* monitor);

 private:
  ProviderRegistry* const providers;
  // The system bus while the filter is installed; null otherwise.
  DBusConnection* bus = nullptr;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_CRASH_MONITOR_H_
