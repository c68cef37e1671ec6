// ReportContext: what the report run works with, handed in by the daemon that owns all of it,
// so reporting never looks its owner up.
#ifndef LOGMGR_REPORTING_REPORT_CONTEXT_H_
#define LOGMGR_REPORTING_REPORT_CONTEXT_H_

#include <time.h>

#include <string>

#include "base/clock.h"

namespace _CorvaneLogManager {

class DbManager;
class PrefStore;
class ProviderRegistry;
class UploadDbManager;

struct ReportContext {
  PrefStore* prefs = nullptr;
  ProviderRegistry* providers = nullptr;
  DbManager* survey = nullptr;       // the collection tables
  UploadDbManager* queue = nullptr;  // the upload queue
  ClockFn clock = WallClockMs;
  // The daemon's own application id; read when used, as the owner sets it after construction.
  const std::string* appId = nullptr;
  // The switch that gates the report run; no switch means the run is off.
  bool (*reportEnabled)() = nullptr;

  bool ReportEnabled() const { return reportEnabled != nullptr && reportEnabled(); }
  const char* AppId() const { return appId != nullptr ? appId->c_str() : ""; }
  int64_t NowMs() const { return clock != nullptr ? clock() : WallClockMs(); }
  time_t NowSeconds() const { return static_cast<time_t>(NowMs() / 1000); }
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_REPORTING_REPORT_CONTEXT_H_
