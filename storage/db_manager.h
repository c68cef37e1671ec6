// DbManager and UploadDbManager: the survey database and the upload-queue database, each one
// connection and the list of providers whose tables live in it.
#ifndef LOGMGR_STORAGE_DB_MANAGER_H_
#define LOGMGR_STORAGE_DB_MANAGER_H_

namespace _CorvaneLogManager {

class DbConnection;

class DbManager {
 public:
  static DbManager* GetInstance();
  static void CloseInstance();
  int Init();
  DbConnection* GetConnection() { return connection; }

 private:
  DbConnection* connection = nullptr;
};

class UploadDbManager {
 public:
  static UploadDbManager* GetInstance();
  static void CloseInstance();
  int Init();
  DbConnection* GetConnection() { return connection; }

 private:
  DbConnection* connection = nullptr;
};

}  // namespace _CorvaneLogManager

#endif  // LOGMGR_STORAGE_DB_MANAGER_H_
