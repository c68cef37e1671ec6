// The shared tables' request rules without the bus: what each table accepts, the status
// table's one row per (app_id, feature), and a select that only reaches the caller's segment.
#include "providers/shared_table_service.h"

#include <gtest/gtest.h>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <unistd.h>

#include "tests/providers/provider_test_env.h"

namespace _CorvaneLogManager {
namespace {

using Result = SharedTableService::Result;

class SharedTableServiceTest : public ProviderTest {
 protected:
  void SetUp() override {
    ProviderTest::SetUp();
    StartProviders();
    feature = SharedTableService::ForTable("use_app_feature_survey");
    status = SharedTableService::ForTable("report_app_status_survey");
    ASSERT_NE(feature, nullptr);
    ASSERT_NE(status, nullptr);
  }
  std::string Rows(const char* table) {
    return Query(survey, std::string("SELECT group_concat(_id || ':' || app_id || ':' || "
                                     "feature || ':' || ifnull(value, '-'), ' ') FROM ") +
                             table);
  }

  const SharedTableService* feature = nullptr;
  const SharedTableService* status = nullptr;
};

TEST_F(SharedTableServiceTest, InsertsKeepOneStatusRowPerPairAndRefuseWhatTheyCannotRun) {
  EXPECT_EQ(SharedTableService::ForTable("use_app_survey"), nullptr);
  int32_t id = 0;
  const SharedTableService::RowData first = {{"app_id", "a"}, {"feature", "f"}, {"value", "1"}};
  const SharedTableService::RowData again = {{"app_id", "a"}, {"feature", "f"}, {"value", "2"}};
  ASSERT_EQ(status->Insert(first, &id), Result::kOk);
  EXPECT_EQ(id, 1);
  id = 0;
  ASSERT_EQ(status->Insert(again, &id), Result::kOk);
  EXPECT_EQ(id, 1);  // the existing row's id, updated in place
  EXPECT_EQ(Rows("report_app_status_survey"), "1:a:f:2");
  // The feature table keeps every insert.
  ASSERT_EQ(feature->Insert(first, &id), Result::kOk);
  ASSERT_EQ(feature->Insert(again, &id), Result::kOk);
  EXPECT_EQ(id, 2);
  EXPECT_EQ(Rows("use_app_feature_survey"), "1:a:f:1 2:a:f:2");

  // An existing pair cannot take a comma: the update would cut its lists there.
  id = 0;
  EXPECT_EQ(status->Insert({{"app_id", "a"}, {"feature", "f"}, {"extra", "x,y"}}, &id),
            Result::kApiFailed);
  EXPECT_EQ(id, 1);
  const struct {
    SharedTableService::RowData rowData;
    Result result;
  } refused[] = {
      {{{"app_id", "a"}}, Result::kImproperValues},
      {{{"app_id", "a"}, {"feature", "f"}, {"timestamp", "1"}}, Result::kImproperValues},
      {{{"app_id", "a"}, {"feature", "f"}, {"bogus", "1"}}, Result::kImproperValues},
      {{{"app_id", "a"}, {"feature", std::string(1000, 'f')}}, Result::kImproperValues},
  };
  for (const auto& c : refused) {
    EXPECT_EQ(status->Insert(c.rowData, &id), c.result);
    EXPECT_EQ(feature->Insert(c.rowData, &id), c.result);
  }
  EXPECT_EQ(Rows("report_app_status_survey"), "1:a:f:2");
  EXPECT_EQ(Number(survey, "SELECT COUNT(*) FROM use_app_feature_survey"), 2);

  // Without the providers every request is answered as such, and nothing runs.
  ProviderRegistry::Release();
  int32_t count = 7;
  EXPECT_EQ(status->Insert(first, &id), Result::kProviderMissing);
  EXPECT_EQ(feature->Update(first, "1", &count), Result::kProviderMissing);
  EXPECT_EQ(feature->Delete("1", &count), Result::kProviderMissing);
  EXPECT_EQ(feature->Select("*", -1, false, 0), Result::kProviderMissing);
  EXPECT_EQ(count, 7);
}

TEST_F(SharedTableServiceTest, UpdatesAndDeletesStayInTheirTableWithEachTablesFailures) {
  int32_t id = 0;
  for (const char* value : {"1", "2"}) {
    ASSERT_EQ(feature->Insert({{"app_id", "a"}, {"feature", "f"}, {"value", value}}, &id),
              Result::kOk);
  }
  int32_t count = -1;
  EXPECT_EQ(feature->Update({{"value", "5"}}, "value = 2", &count), Result::kOk);
  EXPECT_EQ(count, 1);
  EXPECT_EQ(Rows("use_app_feature_survey"), "1:a:f:1 2:a:f:5");
  for (const char* where : {"", "value IN (SELECT duration FROM use_app_survey)"})
    EXPECT_EQ(feature->Update({{"value", "6"}}, where, &count), Result::kUpdateFailed) << where;
  EXPECT_EQ(feature->Update({{"value", "6,7"}}, "1", &count), Result::kUpdateFailed);
  EXPECT_EQ(status->Update({{"bogus", "6"}}, "1", &count), Result::kUpdateFailed);
  EXPECT_EQ(Rows("use_app_feature_survey"), "1:a:f:1 2:a:f:5");

  // The feature table refuses an empty where and reports a failed delete; the status table
  // answers both with nothing deleted.
  count = -1;
  EXPECT_EQ(feature->Delete("", &count), Result::kImproperValues);
  EXPECT_EQ(feature->Delete("_id IN (SELECT _id FROM use_app_survey)", &count),
            Result::kDeleteFailed);
  EXPECT_EQ(count, -1);
  EXPECT_EQ(status->Delete("", &count), Result::kOk);
  EXPECT_EQ(count, 0);
  count = -1;
  EXPECT_EQ(status->Delete(std::string(1100, ' ').append("1").c_str(), &count), Result::kOk);
  EXPECT_EQ(count, 0);
  EXPECT_EQ(feature->Delete("value = 5", &count), Result::kOk);
  EXPECT_EQ(count, 1);
  EXPECT_EQ(Rows("use_app_feature_survey"), "1:a:f:1");
}

TEST_F(SharedTableServiceTest, SelectWritesOnlyTheCallersLargeEnoughSegment) {
  int32_t id = 0;
  ASSERT_EQ(status->Insert({{"app_id", "a"}, {"feature", "f"}, {"value", "3"}}, &id), Result::kOk);
  const std::string kResult("a,3,\0&", 6);
  struct Case {
    size_t size;
    bool known;
    uid_t caller;
    const char* columns;
    Result result;
  } cases[] = {
      {64, true, getuid(), "app_id,value", Result::kOk},
      {6, true, getuid(), "app_id,value", Result::kOk},
      {5, true, getuid(), "app_id,value", Result::kNotWritten},  // stops at the limit
      {64, true, getuid() + 1, "app_id,value", Result::kNotWritten},
      {64, false, getuid(), "app_id,value", Result::kNotWritten},
      {64, true, getuid(), "app_id FROM use_app_survey --", Result::kSelectFailed},
      {64, true, getuid(), nullptr, Result::kSelectFailed},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::to_string(c.size) + (c.columns != nullptr ? c.columns : "(null)"));
    int shm = shmget(IPC_PRIVATE, c.size, IPC_CREAT | 0600);
    ASSERT_NE(shm, -1);
    EXPECT_EQ(status->Select(c.columns, shm, c.known, c.caller), c.result);
    struct shmid_ds info;
    ASSERT_EQ(shmctl(shm, IPC_STAT, &info), 0);
    EXPECT_EQ(info.shm_nattch, 0u) << "left attached";
    const char* base = static_cast<const char*>(shmat(shm, nullptr, SHM_RDONLY));
    std::string content(base, c.size);
    EXPECT_EQ(content, c.result == Result::kOk ? kResult + std::string(c.size - 6, '\0')
                                               : std::string(c.size, '\0'));
    shmdt(base);
    shmctl(shm, IPC_RMID, nullptr);
  }
}

}  // namespace
}  // namespace _CorvaneLogManager
