// DbManager and UploadDbManager: the survey database and the upload-queue database, each one
// connection and the list of providers whose tables live in it.
#ifndef LOGMGR_STORAGE_DB_MANAGER_H_
#define LOGMGR_STORAGE_DB_MANAGER_H_

#include <vector>

namespace _CorvaneLogManager {

class DbConnection;
class IDbResponseListener;

class DbManager {
 public:
  static DbManager* GetInstance();
  static void CloseInstance();
  // Opens ".SurveyLog.db", then lets every listener create its table.
  int Init();
  DbConnection* GetConnection() { return connection; }
  // Duplicates are kept; removal drops the first equal entry.
  void AddListener(IDbResponseListener* listener);
  void RemoveListener(IDbResponseListener* listener);
  int NotifyInitialize();
  int NotifyDeleteExpired();
  const std::vector<IDbResponseListener*>& Listeners() const { return listeners; }

 private:
  DbManager() = default;
  ~DbManager();

  DbConnection* connection = nullptr;
  std::vector<IDbResponseListener*> listeners;
};

class UploadDbManager {
 public:
  static UploadDbManager* GetInstance();
  static void CloseInstance();
  // Opens ".ServerUploaderDB.db", then lets every listener create its table.
  int Init();
  DbConnection* GetConnection() { return connection; }
  void AddListener(IDbResponseListener* listener);
  void RemoveListener(IDbResponseListener* listener);
  int NotifyInitialize();
  const std::vector<IDbResponseListener*>& Listeners() const { return listeners; }

 private:
  UploadDbManager() = default;
  ~UploadDbManager();
  int CloseConnection();

  DbConnection* connection = nullptr;
  std::vector<IDbResponseListener*> listeners;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_STORAGE_DB_MANAGER_H_
