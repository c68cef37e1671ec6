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
  // key_sent_date (seconds): get gives 0 on failure; normalise rounds it to the nearest local
  // midnight, stores it back and returns it (0 when unreadable).
  int SetSentDate(int32_t seconds);
  uint32_t GetSentDate();
  uint32_t NormaliseSentDate();

 private:
  DbConnection* connection = nullptr;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_STORAGE_PREF_STORE_H_
