#include "providers/server_upload_log_provider.h"

#include "tests/providers/provider_test_env.h"

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

TEST_F(ServerUploadLogProviderTest, QueueSkipsZoneCountingExpiryAndTimestampUpdates) {
  EXPECT_EQ(queue->Config().columns.size(), 9u);  // the blanks in the list separate too
  int32_t rowId = 0;
  ASSERT_EQ(queue->InsertRow("svc_code,body", "'s','b'", &rowId), 0);
  EXPECT_EQ(rowId, 1);
  std::vector<std::string> run = uploadTrace.Take();
  ASSERT_EQ(run.size(), 1u);  // a survey table's first insert would also count rows
  EXPECT_TRUE(MatchesWithNumbers(
      run[0], "INSERT INTO survey_log(svc_code,body,timestamp) VALUES ('s','b',#);"))
      << run[0];
  EXPECT_TRUE(surveyTrace.Take().empty());

  // Values split at blanks too; the surplus column gets no assignment; timestamp stays.
  ASSERT_EQ(upload->Exec("UPDATE survey_log SET timestamp = 1;"), 0);
  int32_t changed = 0;
  ASSERT_EQ(queue->UpdateRows("rly_result,svc_code,body", "1 'new'", "_id = 1", &changed), 0);
  EXPECT_EQ(changed, 1);
  EXPECT_EQ(uploadTrace.Take().back(),
            "UPDATE survey_log SET rly_result = '1',svc_code = 'new' WHERE _id = 1;");
  EXPECT_EQ(queue->DeleteExpiredRows(), 0);
  EXPECT_EQ(Query(upload, "SELECT timestamp||rly_result||svc_code FROM survey_log"), "11new");

  Fill(upload, "survey_log", "svc_code", "'x'", 501);
  ASSERT_EQ(queue->DeleteOldestRows(), 0);
  EXPECT_EQ(queue->GetRowCount(), 2);
  int32_t deleted = 0;
  ASSERT_EQ(queue->DeleteRows("svc_code = 'x'", &deleted), 0);
  EXPECT_EQ(deleted, 2);
}

TEST_F(ServerUploadLogProviderTest, LimitedSelectAppendsLimitWithoutBlank) {
  Fill(upload, "survey_log", "activity", "'x'", 2);
  Fill(upload, "survey_log", "activity", "'y'", 1);
  const std::string order = "CASE activity WHEN 'x' THEN 0 END ";
  const struct {
    const char* where;
    uint32_t limit;
    const char* tail;
    int rows;
  } cases[] = {{nullptr, 10, "LIMIT 10;", 3},
               {"activity = 'x'", 1, "LIMIT 1;", 1},
               {nullptr, ServerUploadLogProvider::kNoLimit, ";", 3}};
  for (const auto& c : cases) {
    QueryRows rows;
    ASSERT_EQ(
        queue->SelectLimitedRows(nullptr, c.where, order.c_str(), c.limit, &rows.count, &rows.rows),
        0);
    EXPECT_EQ(rows.count, c.rows);
    EXPECT_EQ(uploadTrace.Take().back(),
              std::string("SELECT * FROM survey_log ") +
                  (c.where ? std::string("WHERE ") + c.where + " " : "") + "ORDER BY " + order +
                  c.tail);
  }
  // Kept on purpose: a limit without a blank-terminated ORDER BY is invalid SQL, and the
  // inherited select looks in the survey database, which has no survey_log.
  QueryRows rows;
  EXPECT_EQ(queue->SelectLimitedRows("_id", "1=1", nullptr, 5, &rows.count, &rows.rows), -1);
  EXPECT_EQ(queue->SelectRows(nullptr, nullptr, nullptr, &rows.count, &rows.rows), 0);
  EXPECT_EQ(rows.count, 0);
}

}  // namespace
}  // namespace _CorvaneLogManager
