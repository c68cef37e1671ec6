#include "tests/providers/provider_test_env.h"

namespace _CorvaneLogManager {
namespace {

// Records which listener heard what, in order.
class RecordingProvider : public BaseLogProvider {
 public:
  RecordingProvider(std::string name, std::vector<std::string>* log) : name(name), log(log) {}
  int Initialize() override { return Note("init "); }
  int DeleteExpiredRows() override { return Note("expire "); }
  const char* GetCreateTableSql() override { return ""; }
  const char* GetTableName() override { return name.c_str(); }

 private:
  int Note(const char* what) {
    log->push_back(what + name);
    return 0;
  }
  std::string name;
  std::vector<std::string>* log;
};

using DbManagerTest = ProviderTest;

TEST_F(DbManagerTest, ListenersHearInRegistrationOrderWithDuplicates) {
  std::vector<std::string> log;
  RecordingProvider a("a", &log), b("b", &log), never("never", &log), queue("queue", &log);
  DbManager* manager = DbManager::GetInstance();
  EXPECT_EQ(manager->NotifyDeleteExpired(), 0);  // empty list
  for (RecordingProvider* p : {&a, &b, &a}) manager->AddListener(p);
  UploadDbManager::GetInstance()->AddListener(&queue);
  ASSERT_EQ(manager->Init(), 0);
  ASSERT_EQ(UploadDbManager::GetInstance()->Init(), 0);
  manager->RemoveListener(&never);
  manager->RemoveListener(&a);  // only the first entry goes
  EXPECT_EQ(manager->NotifyDeleteExpired(), 0);
  EXPECT_EQ(manager->NotifyInitialize(), 0);
  EXPECT_EQ(log, (std::vector<std::string>{"init a", "init b", "init a", "init queue", "expire b",
                                           "expire a", "init b", "init a"}));

  // Closing forgets the listeners; a manager whose file cannot open keeps them for a retry.
  DbManager::CloseInstance();
  DbManager::CloseInstance();
  EXPECT_TRUE(DbManager::GetInstance()->Listeners().empty());
  ASSERT_EQ(system(("rm -rf " + sysroot + "/opt/usr/dbspace").c_str()), 0);
  DbManager::GetInstance()->AddListener(&b);
  log.clear();
  EXPECT_EQ(DbManager::GetInstance()->Init(), -1);
  EXPECT_TRUE(log.empty());
  EXPECT_EQ(DbManager::GetInstance()->Listeners().size(), 1u);
}

}  // namespace
}  // namespace _CorvaneLogManager
