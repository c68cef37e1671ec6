// PrefStore: the daemon's few persistent values (device id, report dates, last shutdown).
#ifndef LOGMGR_STORAGE_PREF_STORE_H_
#define LOGMGR_STORAGE_PREF_STORE_H_

#include <stdint.h>

#include <string>

namespace _CorvaneLogManager {

class DbConnection;

// The device id as loaded or made by the last successful Create; empty before.
const std::string& CachedDeviceId();

class PrefStore {
 public:
  PrefStore() = default;
  ~PrefStore() = default;

  // Allocates the connection and opens the store. 0 / -1.
  int Create();
  // Closes the connection and frees it. 0 / -1.
  int Close();

  int SetLastShutdownTime(int32_t seconds);
  uint32_t GetLastShutdownTime();

 private:
  DbConnection* connection = nullptr;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_STORAGE_PREF_STORE_H_
