// Host capi-system-device, battery part: the charge level of the device's battery.
#ifndef LOGMGR_HOST_DEVICE_BATTERY_H_
#define LOGMGR_HOST_DEVICE_BATTERY_H_

#ifdef __cplusplus
extern "C" {
#endif

typedef enum {
  DEVICE_ERROR_NONE = 0,
  DEVICE_ERROR_OPERATION_FAILED = -1,
  DEVICE_ERROR_PERMISSION_DENIED = -13,
  DEVICE_ERROR_INVALID_PARAMETER = -22,
  DEVICE_ERROR_ALREADY_IN_PROGRESS = -114,
  DEVICE_ERROR_NOT_SUPPORTED = -1073741822,
  DEVICE_ERROR_NOT_INITIALIZED = -0x02400000 | 0x13,
} device_error_e;

// Percent (0..100) of the first power supply of type "Battery".
int device_battery_get_percent(int* percent);

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_HOST_DEVICE_BATTERY_H_
