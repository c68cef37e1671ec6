#include <unistd.h>

#include "provider_test_env.h"

namespace _CorvaneLogManager {
namespace {

// Records which listener heard what, in order.
class RecordingProvider : public BaseLogProvider {
 public:
  RecordingProvider(std::string name, std::vector<std::string>* log)
      : name(std::move(name)), log(log) {}
  int Initialize() override {
    log->push_back("init " + name);
    return 0;
  }
  int DeleteExpiredRows() override {
    log->push_back("expire " + name);
    return 0;
  }
  const char* GetCreateTableSql() override { return ""; }
  const char* GetTableName() override { return name.c_str(); }

 private:
  std::string name;
  std::vector<std::string>* log;
};

using DbManagerTest = ProviderTest;

TEST_F(DbManagerTest, ListenersHearInRegistrationOrderWithDuplicates) {
  std::vector<std::string> log;
  RecordingProvider a("a", &log), b("b", &log), never("never", &log);
  DbManager* manager = DbManager::GetInstance();
  ASSERT_NE(manager, nullptr);
  EXPECT_EQ(manager->NotifyDeleteExpired(), 0);  // empty list

  manager->AddListener(&a);
  manager->AddListener(&b);
  manager->AddListener(&a);
  ASSERT_EQ(manager->Init(), 0);
  EXPECT_EQ(log, (std::vector<std::string>{"init a", "init b", "init a"}));
  EXPECT_EQ(access((sysroot + "/opt/usr/dbspace/.SurveyLog.db").c_str(), F_OK), 0);

  log.clear();
  manager->RemoveListener(&never);
  manager->RemoveListener(&a);  // only the first entry goes
  EXPECT_EQ(manager->NotifyDeleteExpired(), 0);
  EXPECT_EQ(manager->NotifyInitialize(), 0);
  EXPECT_EQ(log, (std::vector<std::string>{"expire b", "expire a", "init b", "init a"}));
}

TEST_F(DbManagerTest, InitOpensEachFileAndCloseAllowsAFreshManager) {
  std::vector<std::string> log;
  RecordingProvider queue("queue", &log);
  UploadDbManager::GetInstance()->AddListener(&queue);
  ASSERT_EQ(DbManager::GetInstance()->Init(), 0);  // no listeners
  ASSERT_EQ(UploadDbManager::GetInstance()->Init(), 0);
  EXPECT_EQ(log, std::vector<std::string>{"init queue"});
  EXPECT_EQ(access((sysroot + "/opt/usr/dbspace/.ServerUploaderDB.db").c_str(), F_OK), 0);

  DbManager::CloseInstance();
  DbManager::CloseInstance();  // no instance: harmless
  UploadDbManager::CloseInstance();
  DbManager* fresh = DbManager::GetInstance();
  ASSERT_NE(fresh, nullptr);
  EXPECT_TRUE(fresh->Listeners().empty());
  EXPECT_TRUE(UploadDbManager::GetInstance()->Listeners().empty());

  // A file that cannot be opened fails Init but keeps the listeners for the retry.
  DbManager::CloseInstance();
  UploadDbManager::CloseInstance();
  ASSERT_EQ(system(("rm -rf " + sysroot + "/opt/usr/dbspace").c_str()), 0);
  UploadDbManager::GetInstance()->AddListener(&queue);
  log.clear();
  EXPECT_EQ(UploadDbManager::GetInstance()->Init(), -1);
  EXPECT_TRUE(log.empty());
  EXPECT_EQ(UploadDbManager::GetInstance()->Listeners().size(), 1u);
}

}  // namespace
}  // namespace _CorvaneLogManager
