// Package information: installed applications by id and by executable.
#ifndef LOGMGR_HOST_PKGMGR_INFO_H_
#define LOGMGR_HOST_PKGMGR_INFO_H_

#ifdef __cplusplus
extern "C" {
#endif

#define PMINFO_R_OK 0
#define PMINFO_R_ERROR -1
#define PMINFO_R_EINVAL -2

// Filter properties are their own names.
#define PMINFO_APPINFO_PROP_APP_ID "PMINFO_APPINFO_PROP_APP_ID"
#define PMINFO_APPINFO_PROP_APP_EXEC "PMINFO_APPINFO_PROP_APP_EXEC"

typedef void* pkgmgrinfo_appinfo_h;
typedef void* pkgmgrinfo_appinfo_filter_h;
// A negative result stops the iteration.
typedef int (*pkgmgrinfo_app_list_cb)(const pkgmgrinfo_appinfo_h handle, void* user_data);

int pkgmgrinfo_appinfo_get_appinfo(const char* appid, pkgmgrinfo_appinfo_h* handle);
// The texts belong to the handle: valid until it is destroyed (or the foreach callback ends).
int pkgmgrinfo_appinfo_get_appid(pkgmgrinfo_appinfo_h handle, char** appid);
int pkgmgrinfo_appinfo_get_pkgid(pkgmgrinfo_appinfo_h handle, char** pkgid);
int pkgmgrinfo_appinfo_get_pkgname(pkgmgrinfo_appinfo_h handle, char** pkg_name);
int pkgmgrinfo_appinfo_get_exec(pkgmgrinfo_appinfo_h handle, char** exec);
int pkgmgrinfo_appinfo_destroy_appinfo(pkgmgrinfo_appinfo_h handle);

int pkgmgrinfo_appinfo_filter_create(pkgmgrinfo_appinfo_filter_h* handle);
int pkgmgrinfo_appinfo_filter_destroy(pkgmgrinfo_appinfo_filter_h handle);
int pkgmgrinfo_appinfo_filter_add_string(pkgmgrinfo_appinfo_filter_h handle, const char* property,
                                         const char* value);
int pkgmgrinfo_appinfo_filter_foreach_appinfo(pkgmgrinfo_appinfo_filter_h handle,
                                              pkgmgrinfo_app_list_cb app_cb, void* user_data);
int pkgmgrinfo_appinfo_filter_count(pkgmgrinfo_appinfo_filter_h handle, int* count);

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_HOST_PKGMGR_INFO_H_
