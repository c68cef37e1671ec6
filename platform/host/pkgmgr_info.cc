// Host pkgmgr-info over the app database. Handles are heap records owned by the caller until
// their destroy call; the ones passed to a foreach callback live only for that call.
#include <pkgmgr-info.h>
#include <string.h>

#include <new>
#include <string>
#include <utility>
#include <vector>

#include "platform/host/app_db.h"

using logmgr_host::AppColumn;
using logmgr_host::AppRecord;

namespace {

struct AppFilter {
  std::vector<std::pair<AppColumn, std::string>> conditions;
};

bool Matches(const AppRecord& app, const std::pair<AppColumn, std::string>& condition) {
  const std::string& field = condition.first == AppColumn::kAppId ? app.appId : app.exec;
  return field == condition.second;
}

int Field(pkgmgrinfo_appinfo_h handle, char** out, std::string AppRecord::*member) {
  if (handle == nullptr || out == nullptr) return PMINFO_R_EINVAL;
  *out = const_cast<char*>((static_cast<AppRecord*>(handle)->*member).c_str());
  return PMINFO_R_OK;
}

// Runs the filter; |visit| sees each match and returns false to stop.
template <typename Visit>
int RunFilter(pkgmgrinfo_appinfo_filter_h handle, Visit visit) {
  AppFilter* filter = static_cast<AppFilter*>(handle);
  if (filter == nullptr || filter->conditions.empty()) return PMINFO_R_EINVAL;
  std::vector<AppRecord> apps;
  const auto& first = filter->conditions.front();
  if (logmgr_host::AppDbFind(first.first, first.second.c_str(), &apps) != 0) return PMINFO_R_ERROR;
  for (AppRecord& app : apps) {
    bool all = true;
    for (const auto& condition : filter->conditions) all = all && Matches(app, condition);
    if (all && !visit(&app)) break;
  }
  return PMINFO_R_OK;
}

}  // namespace

extern "C" {

int pkgmgrinfo_appinfo_get_appinfo(const char* appid, pkgmgrinfo_appinfo_h* handle) {
  if (appid == nullptr || handle == nullptr) return PMINFO_R_EINVAL;
  AppRecord app;
  if (logmgr_host::AppDbFindFirst(AppColumn::kAppId, appid, &app) != 1) return PMINFO_R_ERROR;
  AppRecord* record = new (std::nothrow) AppRecord(std::move(app));
  if (record == nullptr) return PMINFO_R_ERROR;
  *handle = record;
  return PMINFO_R_OK;
}

int pkgmgrinfo_appinfo_get_appid(pkgmgrinfo_appinfo_h handle, char** appid) {
  return Field(handle, appid, &AppRecord::appId);
}

int pkgmgrinfo_appinfo_get_pkgid(pkgmgrinfo_appinfo_h handle, char** pkgid) {
  return Field(handle, pkgid, &AppRecord::package);
}

int pkgmgrinfo_appinfo_get_pkgname(pkgmgrinfo_appinfo_h handle, char** pkg_name) {
  return Field(handle, pkg_name, &AppRecord::package);
}

int pkgmgrinfo_appinfo_get_exec(pkgmgrinfo_appinfo_h handle, char** exec) {
  return Field(handle, exec, &AppRecord::exec);
}

int pkgmgrinfo_appinfo_destroy_appinfo(pkgmgrinfo_appinfo_h handle) {
  if (handle == nullptr) return PMINFO_R_EINVAL;
  delete static_cast<AppRecord*>(handle);
  return PMINFO_R_OK;
}

int pkgmgrinfo_appinfo_filter_create(pkgmgrinfo_appinfo_filter_h* handle) {
  if (handle == nullptr) return PMINFO_R_EINVAL;
  AppFilter* filter = new (std::nothrow) AppFilter();
  if (filter == nullptr) return PMINFO_R_ERROR;
  *handle = filter;
  return PMINFO_R_OK;
}

int pkgmgrinfo_appinfo_filter_destroy(pkgmgrinfo_appinfo_filter_h handle) {
  if (handle == nullptr) return PMINFO_R_EINVAL;
  delete static_cast<AppFilter*>(handle);
  return PMINFO_R_OK;
}

int pkgmgrinfo_appinfo_filter_add_string(pkgmgrinfo_appinfo_filter_h handle, const char* property,
                                         const char* value) {
  if (handle == nullptr || property == nullptr || value == nullptr) return PMINFO_R_EINVAL;
  AppColumn column;
  if (strcmp(property, PMINFO_APPINFO_PROP_APP_EXEC) == 0) {
    column = AppColumn::kExec;
  } else if (strcmp(property, PMINFO_APPINFO_PROP_APP_ID) == 0) {
    column = AppColumn::kAppId;
  } else {
    return PMINFO_R_EINVAL;
  }
  static_cast<AppFilter*>(handle)->conditions.emplace_back(column, value);
  return PMINFO_R_OK;
}

int pkgmgrinfo_appinfo_filter_foreach_appinfo(pkgmgrinfo_appinfo_filter_h handle,
                                              pkgmgrinfo_app_list_cb app_cb, void* user_data) {
  if (app_cb == nullptr) return PMINFO_R_EINVAL;
  return RunFilter(handle, [&](AppRecord* app) { return app_cb(app, user_data) >= 0; });
}

int pkgmgrinfo_appinfo_filter_count(pkgmgrinfo_appinfo_filter_h handle, int* count) {
  if (count == nullptr) return PMINFO_R_EINVAL;
  int n = 0;
  int rc = RunFilter(handle, [&](AppRecord*) {
    ++n;
    return true;
  });
  if (rc == PMINFO_R_OK) *count = n;
  return rc;
}

}  // extern "C"
