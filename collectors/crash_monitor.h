// CrashMonitor: application crashes as report_app_error_survey rows, one per application that
// shares the crashed executable.
#ifndef LOGMGR_COLLECTORS_CRASH_MONITOR_H_
#define LOGMGR_COLLECTORS_CRASH_MONITOR_H_

#include <dbus/dbus.h>

namespace _CorvaneLogManager {

class CrashMonitor {
 public:
  int Start();
  int Stop();

  static DBusHandlerResult CrashFilter(DBusConnection* connection, DBusMessage* message,
                                       void* userData);

 private:
  // The system bus while the filter is installed; null otherwise.
  DBusConnection* bus = nullptr;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_COLLECTORS_CRASH_MONITOR_H_
