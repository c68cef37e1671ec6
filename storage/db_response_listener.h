// IDbResponseListener: what a database manager asks of the owners of the tables in its file.
#ifndef LOGMGR_STORAGE_DB_RESPONSE_LISTENER_H_
#define LOGMGR_STORAGE_DB_RESPONSE_LISTENER_H_

namespace _CorvaneLogManager {

// Keep these virtual operations in this order: BaseLogProvider's vtable starts with them.
class IDbResponseListener {
 public:
  virtual ~IDbResponseListener() {}
  // Creates the listener's table; the listener's own answer (the manager ignores it).
  virtual int Initialize() = 0;
  virtual void EmptyHook() {}
  // Drops the rows past the listener's retention.
  virtual int DeleteExpiredRows() = 0;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_STORAGE_DB_RESPONSE_LISTENER_H_
