// Application utility library: launch and death notices, application id of a process.
#ifndef LOGMGR_HOST_AUL_H_
#define LOGMGR_HOST_AUL_H_

#ifdef __cplusplus
extern "C" {
#endif

typedef enum _aul_return_val {
  AUL_R_EREJECTED = -14,
  AUL_R_ENOAPP = -13,
  AUL_R_UG_LOCAL = -12,
  AUL_R_EHIDDENFORGUEST = -11,
  AUL_R_ENOLAUNCHPAD = -10,
  AUL_R_ETERMINATING = -9,
  AUL_R_EILLACC = -8,
  AUL_R_LOCAL = -7,
  AUL_R_ETIMEOUT = -6,
  AUL_R_ECANCELED = -5,
  AUL_R_EINVAL = -4,
  AUL_R_ECOMM = -3,
  AUL_R_ENOINIT = -2,
  AUL_R_ERROR = -1,
  AUL_R_OK = 0
} aul_return_val;

// One handler per kind; a second call replaces the first, a null |func| removes it. Handlers
// run on the GLib default main context; their result is ignored.
int aul_listen_app_launch_signal(int (*func)(int pid, void* data), void* data);
int aul_listen_app_dead_signal(int (*func)(int pid, void* data), void* data);

// Write the NUL-terminated id (cut to |len|) of the application |pid| runs.
int aul_app_get_appid_bypid(int pid, char* appid, int len);
int aul_app_get_pkgname_bypid(int pid, char* pkgname, int len);
int aul_app_get_pkgid_bypid(int pid, char* pkgid, int len);

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_HOST_AUL_H_
