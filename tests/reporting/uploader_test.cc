#include "reporting/uploader.h"

#include <string.h>
#include <unistd.h>

#include <memory>

#include "tests/reporting/reporting_test_env.h"

namespace _CorvaneLogManager {
namespace {

class UploaderTest : public ReportingTest {
 protected:
  void SetUp() override {
    ReportingTest::SetUp();
    g_testNowMs = LocalMs(2024, 6, 12, 10);
    builder = std::make_unique<ReportBuilder>(Context());
    uploader = std::make_unique<Uploader>(Context());
    ASSERT_EQ(uploader->Init(builder.get()), 0);
  }

  void Queue(const std::string& activity, int64_t stamp, const std::string& body = "b") {
    Exec(upload,
         "INSERT INTO survey_log(timestamp,svc_code,category_code,activity,log_type,"
         "app_version,body) VALUES (" +
             std::to_string(stamp) + ",'701','999','" + activity + "','BIZ','W2','" + body + "');");
  }
  // The "4" item of every outbox line, in order.
  std::vector<std::string> SentActivities() {
    std::vector<std::string> out;
    for (const std::string& line : OutboxLines()) {
      size_t at = line.find("\"4\": \"");
      out.push_back(at == std::string::npos ? "?" : line.substr(at + 6, 3));
    }
    return out;
  }

  std::unique_ptr<ReportBuilder> builder;
  std::unique_ptr<Uploader> uploader;
};

TEST_F(UploaderTest, HandsOverAtMostOneBatchInRankOrderWithAllItems) {
  int64_t stamp = g_testNowMs - 3600 * 1000;
  Exec(upload, "BEGIN;");
  for (const char* activity : {"002", "004", "003", "001", "007"}) {
    for (int i = 0; i < 300; ++i) Queue(activity, stamp);
  }
  Exec(upload, "COMMIT;");

  uploader->SendAll();

  std::vector<std::string> expected(300, "007");
  expected.insert(expected.end(), 300, "001");
  expected.insert(expected.end(), 300, "003");
  expected.insert(expected.end(), 100, "004");
  EXPECT_EQ(SentActivities(), expected);
  EXPECT_EQ(Column(upload,
                   "SELECT activity||':'||count(*) FROM survey_log GROUP BY activity "
                   "ORDER BY activity"),
            (std::vector<std::string>{"002:300", "004:200"}));
  EXPECT_EQ(OutboxLines()[0],
            "{\"1\": \"BIZ\", \"2\": \"701\", \"3\": " + std::to_string(g_testNowMs) +
                ", \"4\": \"007\", \"6\": \"W2\", \"7\": \"b\", \"8\": "
                "\"com.corvane.logmanager\"}");
}

// A record marked by a send cut short goes too, without being handed over again.
TEST_F(UploaderTest, OutOfWindowAndMarkedRecordsArePurgedUnsent) {
  int64_t lower = LocalMs(2024, 6, 9);  // midnight three days ago
  Queue("001", lower - 1, "stale");
  Queue("001", lower, "oldest kept");
  Queue("001", g_testNowMs + 24 * 3600 * 1000, "tomorrow");
  Queue("001", g_testNowMs, "taken before the kill");
  Queue("001", g_testNowMs, "now");
  Queue("002", g_testNowMs, "quote \" and ¶");
  Exec(upload, "UPDATE survey_log SET rly_result='success' WHERE body='taken before the kill';");

  uploader->SendAll();

  std::vector<std::string> bodies;
  for (const std::string& line : OutboxLines()) {
    size_t at = line.find("\"7\": \"");
    bodies.push_back(line.substr(at + 6, line.find("\", \"8\"") - at - 6));
  }
  EXPECT_EQ(bodies, (std::vector<std::string>{"oldest kept", "now", "quote \\\" and ¶"}));
  EXPECT_EQ(Column(upload, "SELECT count(*) FROM survey_log"), std::vector<std::string>{"0"});
  uploader->SendAll();  // an empty queue makes no relay call at all
  EXPECT_EQ(OutboxLines().size(), 3u);
}

// The relay's fault counters are per process, so each case runs in a fresh child process.
TEST_F(UploaderTest, RelayFailureOnTheThirdRecordKeepsTheRestQueued) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  // Seven items are set per record: set:15 is the first and set:21 the last of record 3.
  for (const char* fault : {"create:3", "set:15", "set:21", "register:3"}) {
    SCOPED_TRACE(fault);
    EXPECT_EXIT(
        {
          int64_t stamp = g_testNowMs - 1000;
          for (const char* activity : {"002", "004", "003", "001", "007"}) Queue(activity, stamp);
          setenv("LOGRELAY_FAIL", fault, 1);
          uploader->SendAll();
          std::string problems;
          if (SentActivities() != std::vector<std::string>{"007", "001"}) problems += "sent; ";
          if (Column(upload,
                     "SELECT group_concat(activity) FROM survey_log WHERE "
                     "rly_result IS NULL") != std::vector<std::string>{"002,004,003"})
            problems += "queue; ";
          unsetenv("LOGRELAY_FAIL");
          uploader->SendAll();  // the next send takes the rest, once
          if (SentActivities() != std::vector<std::string>{"007", "001", "003", "004", "002"})
            problems += "resend; ";
          fprintf(stderr, "%s", problems.c_str());
          TearDown();
          _exit(problems.empty() ? 0 : 1);
        },
        ::testing::ExitedWithCode(0), "");
  }
}

}  // namespace
}  // namespace _CorvaneLogManager
