#include "reporting/report_builder.h"

#include <pthread.h>
#include <unistd.h>

#include <atomic>
#include <memory>

#include "tests/reporting/reporting_test_env.h"
#include "tests/sqlite_rows.h"

namespace _CorvaneLogManager {
namespace {

// Header of every record: no SIM on the test bus, model and build from the sysroot's files.
const std::string kHead = "mcc=¶mnc=¶did=¶model=Gear-X1¶fw_ver=W2.3-K9¶";

class ReportBuilderTest : public ReportingTest {
 protected:
  // Most tests run on June 12th with the 10th reported: the 11th is due.
  void SetUp() override {
    ReportingTest::SetUp();
    builder = std::make_unique<ReportBuilder>(Context());
    g_testNowMs = Jun(12, 10);
    SentDate(10);
  }
  static int64_t Jun(int day, int hour = 0, int minute = 0, int second = 0, int ms = 0) {
    return LocalMs(2024, 6, day, hour, minute, second, ms);
  }
  void SentDate(int day) { ASSERT_EQ(prefs.SetSentDate(static_cast<int32_t>(Jun(day) / 1000)), 0); }
  int64_t Sent() { return static_cast<int64_t>(prefs.GetSentDate()) * 1000; }
  void Row(const std::string& table, const std::string& columns, int64_t stamp,
           const std::string& values) {
    Exec(survey, "INSERT INTO " + table + "(timestamp," + columns + ") VALUES (" +
                     std::to_string(stamp) + "," + values + ");");
  }
  void Use(int64_t stamp, const std::string& values) {
    Row("use_app_survey", "app_id,duration", stamp, values);
  }
  void Feature(int64_t stamp, const std::string& values) {
    Row("use_app_feature_survey", "app_id,feature,extra,value", stamp, values);
  }
  void Manage(int64_t stamp, const std::string& values) {
    Row("manage_app_survey", "installed_app_id,type", stamp, values);
  }
  std::string Count(DbConnection* conn, const std::string& table) {
    return Query(conn, "SELECT count(*) FROM " + table);
  }
  std::vector<std::string> Bodies(const std::string& activity) {
    return Column(upload,
                  "SELECT body FROM survey_log WHERE activity='" + activity + "' ORDER BY _id");
  }

  std::unique_ptr<ReportBuilder> builder;
};

TEST_F(ReportBuilderTest, OneDayInSlicesGivesExactRecordsAndPurgesTheDay) {
  Use(Jun(11, 1), "'a.calc',1000");
  Use(Jun(11, 2, 30), "'a.calc',500");
  Use(Jun(11, 2), "'b.mail',200");
  Use(Jun(11, 22), "'a.calc',300");
  Use(Jun(10, 22), "'old.day',1");        // purged unsent
  Use(Jun(12, 0, 0, 0, 1), "'today',1");  // kept
  Manage(Jun(11, 10, 15, 30), "'c.game',1");
  for (int hour : {8, 9})
    Row("report_app_error_survey", "app_id,type", Jun(11, hour), "'a.calc',2");
  Row("report_app_error_survey", "app_id,type", Jun(11, 12), "'b.mail',1");
  Feature(Jun(11, 13), "'lm','SCRN','',4000");
  Feature(Jun(11, 14, 59, 59), "'lm','SCRN','',1000");
  Feature(Jun(11, 15), "'lm','WIFI','',10");

  ASSERT_EQ(builder->RunDaily(), 0);

  const std::string at3 = "date=2024-06-11T03:00:00+0200¶sum=3¶",
                    at24 = "date=2024-06-12T00:00:00+0200¶";
  const std::vector<std::string> use = {kHead + at3 + "count=2¶app_id=a.calc¶duration=1500",
                                        kHead + at3 + "count=1¶app_id=b.mail¶duration=200",
                                        kHead + at24 + "sum=3¶count=1¶app_id=a.calc¶duration=300"};
  const std::vector<std::string> manage = {kHead +
                                           "date=2024-06-11T10:15:30+0200¶app_id=c.game¶type=1"};
  const std::vector<std::string> errors = {kHead + at24 + "sum=24¶count=2¶app_id=a.calc¶type=2",
                                           kHead + at24 + "sum=24¶count=1¶app_id=b.mail¶type=1"};
  const std::vector<std::string> features = {
      kHead +
          "date=2024-06-11T15:00:00+0200¶sum=3¶count=2¶app_id=lm¶feature=SCRN¶extra=¶value=5000",
      kHead + "date=2024-06-11T18:00:00+0200¶sum=3¶count=1¶app_id=lm¶feature=WIFI¶extra=¶value=10"};
  EXPECT_EQ(Bodies("001"), use);
  EXPECT_EQ(Bodies("003"), manage);
  EXPECT_EQ(Bodies("004"), errors);
  EXPECT_EQ(Bodies("002"), features);
  auto tally = [](const std::vector<std::string>& bodies) {
    size_t size = 0;
    for (const std::string& body : bodies) size += body.size() + 30;
    return std::to_string(size);
  };
  EXPECT_EQ(Bodies("007"),
            std::vector<std::string>{kHead + "date=2024-06-11T00:00:00+0200¶size_001=" +
                                     tally(use) + "¶size_002=" + tally(features) +
                                     "¶size_003=" + tally(manage) + "¶size_004=" + tally(errors)});
  // Insertion order is the day's processing order; the fixed columns of every record.
  EXPECT_EQ(Column(upload, "SELECT group_concat(activity, ' ') FROM survey_log"),
            std::vector<std::string>{"001 001 001 003 004 004 002 002 007"});
  EXPECT_EQ(Column(upload,
                   "SELECT DISTINCT svc_code||category_code||log_type||app_version "
                   "FROM survey_log"),
            std::vector<std::string>{"701999BIZW2.3-K9"});
  // The day and everything before it is gone; today's row waits.
  for (const char* table : {"use_app_survey", "manage_app_survey", "report_app_error_survey",
                            "use_app_feature_survey"}) {
    EXPECT_EQ(Count(survey, table), std::string(table) == "use_app_survey" ? "1" : "0") << table;
  }
  EXPECT_EQ(Sent(), Jun(11));
  ASSERT_EQ(builder->RunDaily(), 0);  // nothing is due any more
  EXPECT_EQ(Count(upload, "survey_log"), "9");
}

TEST_F(ReportBuilderTest, ManageRowInTheLastSecondIsDroppedUnreportedByTheNextDay) {
  Manage(Jun(11, 23, 59, 59, 500), "'m.late',0");
  Use(Jun(11, 23, 59, 59, 500), "'u.late',7");
  ASSERT_EQ(builder->RunDaily(), 0);
  EXPECT_TRUE(Bodies("003").empty());
  EXPECT_EQ(Count(survey, "manage_app_survey"), "1");
  // The slices reach midnight, so the usage row of the same instant is reported.
  ASSERT_EQ(Bodies("001").size(), 1u);
  EXPECT_NE(Bodies("001")[0].find("¶app_id=u.late¶duration=7"), std::string::npos);

  g_testNowMs = Jun(13, 10);
  ASSERT_EQ(builder->RunDaily(), 0);
  EXPECT_TRUE(Bodies("003").empty());
  EXPECT_EQ(Count(survey, "manage_app_survey"), "0");
}

TEST_F(ReportBuilderTest, QuotesAndCommasFromOutsideCallersStayInTheirOwnRecord) {
  WriteFile("/sys/class/dmi/id/product_name", "Gear, Rev 'B'\n");
  Use(Jun(11, 1), "'it''s',5");
  Use(Jun(11, 1), "'x,y',700");
  Use(Jun(11, 1), "'z.ok',9");
  Feature(Jun(11, 5), "'lm','CAPT','a''b',1");

  ASSERT_EQ(builder->RunDaily(), 0);

  const std::string head = "mcc=¶mnc=¶did=¶model=Gear; Rev 'B'¶fw_ver=W2.3-K9¶";
  const std::string date = "date=2024-06-11T03:00:00+0200¶";
  // The comma splits "x,y": that record's later fields shift and its surplus tail is dropped.
  EXPECT_EQ(Bodies("001"),
            (std::vector<std::string>{head + date + "sum=3¶count=1¶app_id=it's¶duration=5",
                                      head + date + "sum=3¶count=700¶app_id=x¶duration=1",
                                      head + date + "sum=3¶count=1¶app_id=z.ok¶duration=9"}));
  EXPECT_EQ(Bodies("002"),
            std::vector<std::string>{head + "date=2024-06-11T06:00:00+0200¶sum=3¶count=1¶"
                                            "app_id=lm¶feature=CAPT¶extra=a'b¶value=1"});
  EXPECT_EQ(Column(upload, "SELECT count(*) FROM survey_log WHERE body LIKE '%,%'"),
            std::vector<std::string>{"0"});
}

TEST_F(ReportBuilderTest, SumsPastTheIntegerLimitSaturateAndCostNoOtherRecord) {
  // Eighteen digits: each value still renders whole; ten of them pass 2^63.
  for (int i = 0; i < 10; ++i) Use(Jun(11, 1), "'big',999999999999999999");
  for (const char* values :
       {"'x','HALF','',1.5", "'x','HALF','',1", "'x','NONE','',NULL", "'x','NEG','',-7"})
    Feature(Jun(11, 1), values);

  ASSERT_EQ(builder->RunDaily(), 0);

  const std::string date = "date=2024-06-11T03:00:00+0200¶sum=3¶";
  EXPECT_EQ(Bodies("001"), std::vector<std::string>{
                               kHead + date + "count=10¶app_id=big¶duration=9223372036854775807"});
  // Below the limit every sum reads as SUM gives it: integers exact, a float as a float, an
  // all-NULL group as nothing (so the NULL value shifts that record's count).
  EXPECT_EQ(Bodies("002"), (std::vector<std::string>{
                               kHead + date + "count=2¶app_id=x¶feature=HALF¶extra=¶value=2.500000",
                               kHead + date + "count=1¶app_id=x¶feature=NEG¶extra=¶value=-7",
                               kHead + date + "count=¶app_id=x¶feature=NONE¶extra=¶value="}));
  EXPECT_EQ(Sent(), Jun(11));
}

TEST_F(ReportBuilderTest, ATableWhoseSelectFailsKeepsItsRowsAndTheDayStaysDue) {
  Use(Jun(11, 1), "'a.calc',1000");
  Feature(Jun(11, 1), "'lm','SCRN','',4000");
  // Another connection changes the schema under the daemon's, so the feature select fails.
  auto alter = [&](const char* sql) {
    sqlite3* other = nullptr;
    ASSERT_EQ(sqlite3_open((sysroot + "/opt/usr/dbspace/.SurveyLog.db").c_str(), &other),
              SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(other, sql, nullptr, nullptr, nullptr), SQLITE_OK) << sql;
    sqlite3_close(other);
  };
  alter("ALTER TABLE use_app_feature_survey RENAME COLUMN extra TO gone");
  EXPECT_EQ(builder->RunDaily(), -1);
  EXPECT_EQ(Count(survey, "use_app_feature_survey"), "1");
  EXPECT_EQ(Count(survey, "use_app_survey"), "0");
  EXPECT_EQ(Sent(), Jun(10));

  // The repeat completes the day; the purged table's record is not queued again.
  alter("ALTER TABLE use_app_feature_survey RENAME COLUMN gone TO extra");
  ASSERT_EQ(builder->RunDaily(), 0);
  EXPECT_EQ(Bodies("001").size(), 1u);
  EXPECT_EQ(Bodies("002").size(), 1u);
  EXPECT_EQ(Count(survey, "use_app_feature_survey"), "0");
}

// A table's records are queued in one transaction, committed before its rows are purged. A
// worker stopped inside it leaves it open, none of the table's records visible and its rows
// still there; the next run rolls it back and queues every record once.
TEST_F(ReportBuilderTest, AWorkerStoppedInsideATablesRecordsLeavesThemToTheNextRunOnce) {
  Use(Jun(11, 1), "'a.calc',1000");
  Use(Jun(11, 13), "'b.mail',20");
  for (int i = 0; i < 5; ++i) Manage(Jun(11, 10 + i), "'pkg" + std::to_string(i) + "',1");
  // Holds the worker inside the queue's fourth insert (manage's second) until the stop is asked.
  struct Stopped {
    ReportBuilder* builder;
    std::atomic<int> inserts{0};
    std::atomic<bool> held{false}, release{false}, returned{false};
    static void OnChange(void* arg, int op, const char*, const char*, sqlite3_int64) {
      Stopped* self = static_cast<Stopped*>(arg);
      if (op != SQLITE_INSERT || ++self->inserts != 4) return;
      self->held = true;
      while (!self->release) usleep(200);
    }
    static void* Run(void* arg) {
      Stopped* self = static_cast<Stopped*>(arg);
      (void)self->builder->RunDaily();
      self->returned = true;
      return nullptr;
    }
  } stopped{builder.get()};
  sqlite3_update_hook(upload->Handle(), &Stopped::OnChange, &stopped);
  pthread_t worker;
  ASSERT_EQ(pthread_create(&worker, nullptr, &Stopped::Run, &stopped), 0);
  for (int i = 0; i < 60000 && !stopped.held; ++i) usleep(500);
  ASSERT_TRUE(stopped.held) << "the run never reached manage's records";
  upload->Interrupt();
  stopped.release = true;
  ASSERT_EQ(pthread_join(worker, nullptr), 0);
  sqlite3_update_hook(upload->Handle(), nullptr, nullptr);
  EXPECT_FALSE(stopped.returned) << "the stop ends the worker";

  EXPECT_TRUE(upload->InTransaction());
  // What another connection (and a crash) sees: the commits only.
  EXPECT_EQ(FileRows(sysroot + "/opt/usr/dbspace/.ServerUploaderDB.db",
                     "SELECT group_concat(activity) FROM survey_log"),
            "001,001;");
  EXPECT_EQ(Count(survey, "manage_app_survey"), "5");
  EXPECT_EQ(Sent(), Jun(10));

  ASSERT_EQ(builder->RunDaily(), 0);
  EXPECT_FALSE(upload->InTransaction());
  EXPECT_EQ(Column(upload, "SELECT group_concat(activity) FROM survey_log"),
            std::vector<std::string>{"001,001,003,003,003,003,003,007"});
  std::vector<std::string> manage = Bodies("003");
  for (size_t i = 0; i < manage.size(); ++i)
    EXPECT_NE(manage[i].find("app_id=pkg" + std::to_string(i) + "¶"), std::string::npos);
  EXPECT_EQ(Count(survey, "manage_app_survey"), "0");
}

TEST_F(ReportBuilderTest, LongBodiesAreStoredWholeOrCutAtACharacterAndTalliedInFull) {
  const std::string longFeature(290, 'f'), longExtra(290, 'e'), marks = [] {
    std::string text;
    for (int i = 0; i < 149; ++i) text += "¶";  // two bytes each
    return text;
  }();
  Feature(Jun(11, 1), "'lm','" + longFeature + "','" + longExtra + "',1");
  Feature(Jun(11, 4), "'" + longExtra + "','" + longFeature + "','" + marks + "',2");

  ASSERT_EQ(builder->RunDaily(), 0);

  const std::string whole =
      kHead + "date=2024-06-11T03:00:00+0200¶sum=3¶count=1¶app_id=lm¶feature=" + longFeature +
      "¶extra=" + longExtra + "¶value=1";
  const std::string tooLong = kHead +
                              "date=2024-06-11T06:00:00+0200¶sum=3¶count=1¶app_id=" + longExtra +
                              "¶feature=" + longFeature + "¶extra=" + marks + "¶value=2";
  std::vector<std::string> stored = Bodies("002");
  ASSERT_EQ(stored.size(), 2u);
  EXPECT_GT(whole.size(), 639u);
  EXPECT_EQ(stored[0], whole);
  // Cut where the 1024-byte insert statement ends, never inside a two-byte character.
  EXPECT_GT(stored[1].size(), 800u);
  EXPECT_LT(stored[1].size(), tooLong.size());
  EXPECT_EQ(tooLong.compare(0, stored[1].size(), stored[1]), 0);
  EXPECT_NE(static_cast<unsigned char>(stored[1].back()), 0xC2);
  const std::string size002 = "size_002=" + std::to_string(whole.size() + tooLong.size() + 60);
  EXPECT_NE(Bodies("007")[0].find(size002), std::string::npos) << Bodies("007")[0];
}

TEST_F(ReportBuilderTest, WindowsTileTheDayAcrossSummerTime) {
  struct Case {
    int month, day, mode, offset, length;
    int64_t start, end;
  } cases[] = {
      {6, 11, 0, 0, 0, Jun(11), Jun(11, 23, 59, 59)},
      {6, 11, 2, 21, 3, Jun(11, 21), Jun(12)},
      {3, 31, 2, 0, 3, LocalMs(2024, 3, 31), LocalMs(2024, 3, 31, 3)},  // 02:00 does not exist
      {3, 31, 2, 21, 3, LocalMs(2024, 3, 31, 21), LocalMs(2024, 4, 1)},
      {10, 27, 2, 0, 24, LocalMs(2024, 10, 27), LocalMs(2024, 10, 28)},  // 25-hour day
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::to_string(c.month) + "/" + std::to_string(c.day) + "+" +
                 std::to_string(c.offset));
    builder->ComputeWindow(static_cast<time_t>(LocalMs(2024, c.month, c.day) / 1000), c.mode,
                           c.offset, c.length);
    EXPECT_EQ(builder->WindowStart(), std::to_string(c.start));
    EXPECT_EQ(builder->WindowEnd(), std::to_string(c.end));
  }
}

}  // namespace
}  // namespace _CorvaneLogManager
