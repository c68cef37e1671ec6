// Package manager client: status events of package installs, removals and updates.
#ifndef LOGMGR_HOST_PACKAGE_MANAGER_H_
#define LOGMGR_HOST_PACKAGE_MANAGER_H_

#ifdef __cplusplus
extern "C" {
#endif

#define PKGMGR_R_OK 0
#define PKGMGR_R_ERROR -1
#define PKGMGR_R_ECOMM -2
#define PKGMGR_R_EINVAL -3
#define PKGMGR_R_ETIMEOUT -4
#define PKGMGR_R_EPRIV -5
#define PKGMGR_R_ENOPKG -6
#define PKGMGR_R_ENOMEM -7
#define PKGMGR_R_EIO -8
#define PKGMGR_R_ESYSTEM -9

#define PKGMGR_CLIENT_STATUS_ALL 0x00
#define PKGMGR_CLIENT_STATUS_INSTALL 0x01
#define PKGMGR_CLIENT_STATUS_UNINSTALL 0x02
#define PKGMGR_CLIENT_STATUS_UPGRADE 0x04
#define PKGMGR_CLIENT_STATUS_MOVE 0x08
#define PKGMGR_CLIENT_STATUS_CLEAR_DATA 0x10
#define PKGMGR_CLIENT_STATUS_INSTALL_PROGRESS 0x20
#define PKGMGR_CLIENT_STATUS_GET_SIZE 0x40
#define PKGMGR_CLIENT_STATUS_GET_JUNK_INFO 0x80

typedef void pkgmgr_client;
typedef enum { PC_REQUEST = 0, PC_LISTENING = 1, PC_BROADCAST = 2 } client_type;
// A non-zero result keeps the event from handlers registered later. |pmsg| is null.
typedef int (*pkgmgr_handler)(int req_id, const char* pkg_type, const char* pkgid, const char* key,
                              const char* val, const void* pmsg, void* data);

pkgmgr_client* pkgmgr_client_new(client_type ctype);
int pkgmgr_client_free(pkgmgr_client* pc);
// Call before listening: a non-zero mask drops the handlers registered so far.
int pkgmgr_client_set_status_type(pkgmgr_client* pc, int status_type);
// Returns a positive listener id, which the handler receives as |req_id|.
int pkgmgr_client_listen_status(pkgmgr_client* pc, pkgmgr_handler event_cb, void* data);

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_HOST_PACKAGE_MANAGER_H_
