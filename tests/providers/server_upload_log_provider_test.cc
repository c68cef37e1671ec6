#include "provider_test_env.h"
#include "providers/server_upload_log_provider.h"

namespace _CorvaneLogManager {
namespace {

class ServerUploadLogProviderTest : public ProviderTest {
 protected:
  void SetUp() override {
    ProviderTest::SetUp();
    StartProviders();
    queue = static_cast<ServerUploadLogProvider*>(Provider("server_upload"));
    ASSERT_NE(queue, nullptr);
  }
  ServerUploadLogProvider* queue = nullptr;
};

TEST_F(ServerUploadLogProviderTest, InsertsIntoSurveyLogWithoutZoneOrHousekeeping) {
  EXPECT_STREQ(queue->GetTableName(), "server_upload");
  EXPECT_EQ(queue->Config().tableName, "survey_log");
  // The blanks in the declared list separate too.
  EXPECT_EQ(queue->Config().columns,
            (std::vector<std::string>{"_id", "timestamp", "svc_code", "category_code",
                                      "activity", "log_type", "app_version", "body",
                                      "rly_result"}));

  int32_t rowId = 0;
  ASSERT_EQ(queue->InsertRow("svc_code,body", "'s','b'", &rowId), 0);
  EXPECT_EQ(rowId, 1);
  std::vector<std::string> run = uploadTrace.Take();
  ASSERT_EQ(run.size(), 1u);
  EXPECT_TRUE(
      MatchesWithNumbers(run[0], "INSERT INTO survey_log(svc_code,body,timestamp) VALUES ('s','b',#);"))
      << run[0];
  EXPECT_TRUE(surveyTrace.Take().empty());

  // Far past the survey tables' limits: no insert counts rows and nothing expires.
  upload->Exec("BEGIN;");
  for (int i = 0; i < 5100; ++i) ASSERT_EQ(queue->InsertRow("svc_code", "'x'"), 0);
  upload->Exec("COMMIT;");
  for (const std::string& s : uploadTrace.Take()) ASSERT_EQ(s.find("COUNT"), std::string::npos);
  ASSERT_EQ(upload->Exec("UPDATE survey_log SET timestamp = 1;"), 0);
  EXPECT_EQ(queue->DeleteExpiredRows(), 0);
  EXPECT_EQ(queue->GetRowCount(), 5101);

  ASSERT_EQ(queue->DeleteOldestRows(), 0);
  EXPECT_EQ(queue->GetRowCount(), 4601);
  int32_t deleted = 0;
  ASSERT_EQ(queue->DeleteRows("svc_code = 'x'", &deleted), 0);
  EXPECT_EQ(deleted, 4601);
}

TEST_F(ServerUploadLogProviderTest, UpdateSplitsAtBlanksAndKeepsTimestamp) {
  ASSERT_EQ(queue->InsertRow("svc_code,rly_result", "'s',0"), 0);
  long long stamp = Scalar(upload, "SELECT timestamp FROM survey_log");
  (void)uploadTrace.Take();
  int32_t changed = 0;
  // Values split at the blank too; the surplus column gets no assignment.
  ASSERT_EQ(queue->UpdateRows("rly_result,svc_code,body", "1 'new'", "_id = 1", &changed), 0);
  EXPECT_EQ(changed, 1);
  std::vector<std::string> run = uploadTrace.Take();
  ASSERT_EQ(run.size(), 1u);
  EXPECT_EQ(run[0], "UPDATE survey_log SET rly_result = '1',svc_code = 'new' WHERE _id = 1;");
  EXPECT_EQ(Scalar(upload, "SELECT timestamp FROM survey_log"), stamp);
}

TEST_F(ServerUploadLogProviderTest, LimitedSelectAppendsLimitWithoutBlank) {
  for (const char* activity : {"'x'", "'y'", "'x'"})
    ASSERT_EQ(queue->InsertRow("activity", activity), 0);
  (void)uploadTrace.Take();

  const char* order = "CASE activity WHEN 'x' THEN 0 END ";
  struct Case {
    const char* where;
    uint32_t limit;
    const char* statement;
    int rows;
  } cases[] = {
      {nullptr, 10, "SELECT * FROM survey_log ORDER BY CASE activity WHEN 'x' THEN 0 END LIMIT 10;",
       3},
      {"activity = 'x'", 1,
       "SELECT * FROM survey_log WHERE activity = 'x' ORDER BY CASE activity WHEN 'x' THEN 0 END "
       "LIMIT 1;",
       1},
      {nullptr, ServerUploadLogProvider::kNoLimit,
       "SELECT * FROM survey_log ORDER BY CASE activity WHEN 'x' THEN 0 END ;", 3},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.statement);
    int rowCount = -1;
    char** rows = nullptr;
    ASSERT_EQ(queue->SelectLimitedRows(nullptr, c.where, order, c.limit, &rowCount, &rows), 0);
    EXPECT_EQ(rowCount, c.rows);
    for (int i = 0; i < rowCount; ++i) delete[] rows[i];
    if (rowCount > 0) delete[] rows;
    std::vector<std::string> run = uploadTrace.Take();
    ASSERT_FALSE(run.empty());
    EXPECT_EQ(run.back(), c.statement);
  }

  // Kept as designed: a limit without a blank-terminated ORDER BY is invalid SQL.
  int rowCount = -1;
  char** rows = nullptr;
  EXPECT_EQ(queue->SelectLimitedRows("_id", "1=1", nullptr, 5, &rowCount, &rows), -1);
  // The inherited select runs on the survey database, which has no survey_log.
  EXPECT_EQ(queue->SelectRows(nullptr, nullptr, nullptr, &rowCount, &rows), 0);
  EXPECT_EQ(rowCount, 0);
}

}  // namespace
}  // namespace _CorvaneLogManager
