// StatusSnapshotStore: the one open period of each device feature, kept on disk so that a
// period survives a restart of the daemon.
#ifndef LOGMGR_STORAGE_STATUS_SNAPSHOT_STORE_H_
#define LOGMGR_STORAGE_STATUS_SNAPSHOT_STORE_H_

#include <stdint.h>

#include <memory>
#include <string>

namespace _CorvaneLogManager {

class DbConnection;

class StatusSnapshotStore {
 public:
  // The single store. Null when it could not be opened this time; the half-opened instance
  // is still kept and returned by later calls (its operations then fail).
  static StatusSnapshotStore* GetInstance();
  // Closes the connection and forgets the instance.
  static void DestroyInstance();

  // Replaces the feature's row. A timestamp of 0 means "no open period".
  int Put(const char* feature, const char* extra, int64_t timestamp);
  // A feature never written reads as "" and 0.
  int Get(const char* feature, std::string* extraOut, int64_t* timestampOut);
  int64_t LatestTimestamp();

 private:
  StatusSnapshotStore() = default;
  ~StatusSnapshotStore();

  std::unique_ptr<DbConnection> connection;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_STORAGE_STATUS_SNAPSHOT_STORE_H_
