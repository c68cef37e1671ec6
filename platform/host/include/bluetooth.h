// Host capi-network-bluetooth, bonding part: bond created and destroyed callbacks, delivered on
// the GLib default main context.
#ifndef LOGMGR_HOST_BLUETOOTH_H_
#define LOGMGR_HOST_BLUETOOTH_H_

#include <stdbool.h>

#ifdef __cplusplus
extern "C" {
#endif

#define LOGMGR_BT_ERROR_BASE (-0x01C00000)

typedef enum {
  BT_ERROR_NONE = 0,
  BT_ERROR_CANCELLED = -125,
  BT_ERROR_INVALID_PARAMETER = -22,
  BT_ERROR_OUT_OF_MEMORY = -12,
  BT_ERROR_RESOURCE_BUSY = -16,
  BT_ERROR_TIMED_OUT = -1073741823,
  BT_ERROR_NOW_IN_PROGRESS = -115,
  BT_ERROR_NOT_SUPPORTED = -1073741822,
  BT_ERROR_PERMISSION_DENIED = -13,
  BT_ERROR_QUOTA_EXCEEDED = -122,
  BT_ERROR_NOT_INITIALIZED = LOGMGR_BT_ERROR_BASE | 0x0101,
  BT_ERROR_NOT_ENABLED = LOGMGR_BT_ERROR_BASE | 0x0102,
  BT_ERROR_ALREADY_DONE = LOGMGR_BT_ERROR_BASE | 0x0103,
  BT_ERROR_OPERATION_FAILED = LOGMGR_BT_ERROR_BASE | 0x0104,
  BT_ERROR_NOT_IN_PROGRESS = LOGMGR_BT_ERROR_BASE | 0x0105,
  BT_ERROR_REMOTE_DEVICE_NOT_BONDED = LOGMGR_BT_ERROR_BASE | 0x0106,
  BT_ERROR_AUTH_REJECTED = LOGMGR_BT_ERROR_BASE | 0x0107,
  BT_ERROR_AUTH_FAILED = LOGMGR_BT_ERROR_BASE | 0x0108,
  BT_ERROR_REMOTE_DEVICE_NOT_FOUND = LOGMGR_BT_ERROR_BASE | 0x0109,
  BT_ERROR_SERVICE_SEARCH_FAILED = LOGMGR_BT_ERROR_BASE | 0x010A,
  BT_ERROR_REMOTE_DEVICE_NOT_CONNECTED = LOGMGR_BT_ERROR_BASE | 0x010B,
  BT_ERROR_AGAIN = LOGMGR_BT_ERROR_BASE | 0x010C,
  BT_ERROR_SERVICE_NOT_FOUND = LOGMGR_BT_ERROR_BASE | 0x010D,
} bt_error_e;

typedef enum {
  BT_MAJOR_DEVICE_CLASS_MISC = 0x00,
  BT_MAJOR_DEVICE_CLASS_COMPUTER = 0x01,
  BT_MAJOR_DEVICE_CLASS_PHONE = 0x02,
  BT_MAJOR_DEVICE_CLASS_LAN_NETWORK_ACCESS_POINT = 0x03,
  BT_MAJOR_DEVICE_CLASS_AUDIO_VIDEO = 0x04,
  BT_MAJOR_DEVICE_CLASS_PERIPHERAL = 0x05,
  BT_MAJOR_DEVICE_CLASS_IMAGING = 0x06,
  BT_MAJOR_DEVICE_CLASS_WEARABLE = 0x07,
  BT_MAJOR_DEVICE_CLASS_TOY = 0x08,
  BT_MAJOR_DEVICE_CLASS_HEALTH = 0x09,
  BT_MAJOR_DEVICE_CLASS_UNCATEGORIZED = 0x1F,
} bt_major_device_class_e;

// The minor class is a plain 6-bit number here; its named values depend on the major class.
typedef int bt_minor_device_class_e;

typedef struct {
  bt_major_device_class_e major_device_class;
  bt_minor_device_class_e minor_device_class;
  int major_service_class_mask;
} bt_class_s;

typedef struct {
  char* remote_address;  // "AA:BB:CC:DD:EE:FF"
  char* remote_name;
  bt_class_s bt_class;
  char** service_uuid;
  int service_count;
  bool is_bonded;
  bool is_connected;
  bool is_authorized;
  int manufacturer_data_len;
  char* manufacturer_data;
} bt_device_info_s;

// |device_info| and |remote_address| are valid only during the callback.
typedef void (*bt_device_bond_created_cb)(int result, bt_device_info_s* device_info,
                                          void* user_data);
typedef void (*bt_device_bond_destroyed_cb)(int result, char* remote_address, void* user_data);

int bt_initialize(void);
int bt_deinitialize(void);
int bt_device_set_bond_created_cb(bt_device_bond_created_cb callback, void* user_data);
int bt_device_unset_bond_created_cb(void);
int bt_device_set_bond_destroyed_cb(bt_device_bond_destroyed_cb callback, void* user_data);
int bt_device_unset_bond_destroyed_cb(void);

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_HOST_BLUETOOTH_H_
