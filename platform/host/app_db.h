// The installed-application database that host aul and pkgmgr-info read.
#ifndef LOGMGR_HOST_APP_DB_H_
#define LOGMGR_HOST_APP_DB_H_

#include <string>
#include <vector>

namespace logmgr_host {

struct AppRecord {
  std::string appId;
  std::string package;
  std::string exec;
};

enum class AppColumn { kAppId, kExec };

// Appends the applications whose |column| equals |value|, in installation order. Returns 0, or
// -1 when the database is missing or unreadable (a missing table counts as unreadable).
int AppDbFind(AppColumn column, const char* value, std::vector<AppRecord>* out);

// The first of those applications: 1 when there is one, 0 when none, -1 as above.
int AppDbFindFirst(AppColumn column, const char* value, AppRecord* out);

}  // namespace logmgr_host

#endif  // LOGMGR_HOST_APP_DB_H_
