// DbManager and UploadDbManager: the survey database and the upload-queue database, each one
// connection and the list of providers whose tables live in it.
#ifndef LOGMGR_STORAGE_DB_MANAGER_H_
#define LOGMGR_STORAGE_DB_MANAGER_H_

#include <memory>
#include <vector>

namespace _CorvaneLogManager {

class DbConnection;
class IDbResponseListener;

// What both managers share: one owned connection and the providers whose tables live in its
// file. Duplicates are kept; removal drops the first equal entry.
class DatabaseOwner {
 public:
  DbConnection* GetConnection() { return connection.get(); }
  void AddListener(IDbResponseListener* listener);
  void RemoveListener(IDbResponseListener* listener);
  // Lets every listener create its table; kept in the interface, called by nobody.
  int NotifyInitialize();
  const std::vector<IDbResponseListener*>& Listeners() const { return listeners; }

 protected:
  DatabaseOwner();
  ~DatabaseOwner();

  std::unique_ptr<DbConnection> connection;
  std::vector<IDbResponseListener*> listeners;
};

class DbManager : public DatabaseOwner {
 public:
  static DbManager* GetInstance();
  static void CloseInstance();
  // Opens ".SurveyLog.db", then lets every listener create its table.
  int Init();
  int NotifyDeleteExpired();

 private:
  DbManager() = default;
  ~DbManager();
};

class UploadDbManager : public DatabaseOwner {
 public:
  static UploadDbManager* GetInstance();
  static void CloseInstance();
  // Opens ".ServerUploaderDB.db", then lets every listener create its table.
  int Init();

 private:
  UploadDbManager() = default;
  ~UploadDbManager();
  int CloseConnection();
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_STORAGE_DB_MANAGER_H_
