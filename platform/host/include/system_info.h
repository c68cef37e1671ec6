// Host capi-system-info: model and build string from the sysroot's firmware and os-release files.
#ifndef LOGMGR_HOST_SYSTEM_INFO_H_
#define LOGMGR_HOST_SYSTEM_INFO_H_

#ifdef __cplusplus
extern "C" {
#endif

#define SYSTEM_INFO_ERROR_NONE 0
#define SYSTEM_INFO_ERROR_INVALID_PARAMETER (-22)
#define SYSTEM_INFO_ERROR_OUT_OF_MEMORY (-12)
#define SYSTEM_INFO_ERROR_IO_ERROR (-5)
#define SYSTEM_INFO_ERROR_PERMISSION_DENIED (-13)

// The 2.3 numbering; only the two string keys the daemon reads are backed on the host.
typedef enum {
  SYSTEM_INFO_KEY_MODEL = 0,
  SYSTEM_INFO_KEY_TIZEN_VERSION = 1,
  SYSTEM_INFO_KEY_PLATFORM_NAME = 2,
  SYSTEM_INFO_KEY_TIZEN_VERSION_NAME = 3,
  SYSTEM_INFO_KEY_MANUFACTURER = 4,
  SYSTEM_INFO_KEY_CORE_CPU_ARCH = 5,
  SYSTEM_INFO_KEY_CORE_CPU_FREQ = 6,
  SYSTEM_INFO_KEY_BUILD_STRING = 7,
  SYSTEM_INFO_KEY_BUILD_DATE = 8,
  SYSTEM_INFO_KEY_BUILD_TIME = 9,
  SYSTEM_INFO_KEY_SCREEN_HEIGHT = 10,
  SYSTEM_INFO_KEY_SCREEN_WIDTH = 11,
  SYSTEM_INFO_KEY_PHYSICAL_SCREEN_HEIGHT = 12,
  SYSTEM_INFO_KEY_PHYSICAL_SCREEN_WIDTH = 13,
  SYSTEM_INFO_KEY_TETHERING_SUPPORTED = 14
} system_info_key_e;

// The text is malloc'd; the caller frees it. A missing source file is SYSTEM_INFO_ERROR_IO_ERROR.
int system_info_get_value_string(system_info_key_e key, char** value);

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_HOST_SYSTEM_INFO_H_
