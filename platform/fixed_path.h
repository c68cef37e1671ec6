// Where a fixed absolute path of the device lives on this machine.
#ifndef LOGMGR_PLATFORM_FIXED_PATH_H_
#define LOGMGR_PLATFORM_FIXED_PATH_H_

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

// Returns |path| itself on the device. On the host, when LOGMGR_SYSROOT is set, writes the
// sysroot-prefixed path into |buf| and returns |buf|; a prefixed path that does not fit is cut
// (the open then fails, which callers already handle). "/proc" is never remapped.
const char* logmgr_fixed_path(const char* path, char* buf, size_t size);

#ifdef __cplusplus
}
#endif

#endif  // LOGMGR_PLATFORM_FIXED_PATH_H_
