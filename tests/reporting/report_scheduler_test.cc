#include "reporting/report_scheduler.h"

#include <semaphore.h>
#include <time.h>
#include <vconf.h>

#include "base/clock.h"
#include "tests/reporting/reporting_test_env.h"

namespace _CorvaneLogManager {
namespace {

const char kDumpKey[] = "db/corvane-log-manager/dumpcontext";

class ReportSchedulerTest : public ReportingTest {
 protected:
  void SetUp() override {
    ReportingTest::SetUp();
    // An hour ahead of the wall clock the queued records are not in the future: they go out.
    g_testNowMs = WallClockMs() + 3600 * 1000;
    ASSERT_EQ(sem_init(&runsEnded, 0, 0), 0);
    ASSERT_EQ(scheduler.Create(Context()), 0);
    scheduler.SetRunEndHook([](void* data) { sem_post(static_cast<sem_t*>(data)); }, &runsEnded);
  }
  void TearDown() override {
    scheduler.Stop();
    sem_destroy(&runsEnded);
    ReportingTest::TearDown();
  }

  static int64_t DaysAgo(int days) { return LocalMidnightDaysBefore(g_testNowMs / 1000, days); }
  void SetSent(int64_t seconds) { ASSERT_EQ(prefs.SetSentDate(static_cast<int32_t>(seconds)), 0); }
  int64_t Sent() { return static_cast<int64_t>(prefs.GetSentDate()); }
  // The end hook is the run's last step. Bounded so that a run never started fails the test.
  void WaitForRunEnd() {
    struct timespec limit;
    clock_gettime(CLOCK_REALTIME, &limit);
    limit.tv_sec += 60;
    ASSERT_EQ(sem_timedwait(&runsEnded, &limit), 0) << "no run ended";
  }
  bool RunStarted() { return scheduler.IsRunning() || sem_trywait(&runsEnded) == 0; }
  void UseApp(int daysAgo) {
    Exec(survey, "INSERT INTO use_app_survey(timestamp,app_id,duration) VALUES (" +
                     std::to_string((DaysAgo(daysAgo) + 9 * 3600) * 1000) + ",'a.calc',60);");
  }
  // Stamped on the wall clock, as the weekly purge judges rows by it.
  void StatusRow() {
    Exec(survey,
         "INSERT INTO report_app_status_survey(timestamp,app_id,feature,extra,value) VALUES (" +
             std::to_string(WallClockMs()) + ",'lm','BATT','',55);");
  }
  size_t Summaries() {
    size_t count = 0;
    for (const std::string& line : OutboxLines()) count += line.find("\"4\": \"007\"") != line.npos;
    return count;
  }

  sem_t runsEnded;
  ReportScheduler scheduler;
};

TEST_F(ReportSchedulerTest, ClampKeepsTheSentDateWithinThreeDaysAndNeverInTheFuture) {
  // Now is June 12th: yesterday is the 11th, the oldest day still caught up follows the 8th.
  g_testNowMs = LocalMs(2024, 6, 12, 10);
  auto Midnight = [](int day) { return LocalMs(2024, 6, day) / 1000; };
  const struct {
    int64_t sent;
    bool forced;
    int64_t expected;
  } cases[] = {
      {0, false, Midnight(11)},                  // first start
      {Midnight(2), false, Midnight(8)},         // long off
      {Midnight(9), false, Midnight(9)},         // within reach
      {Midnight(20), false, Midnight(20)},       // only a time change corrects this
      {Midnight(20), true, Midnight(11)},        // the clock went back
      {Midnight(8) + 1, true, Midnight(8) + 1},  // three days less a second behind
      {Midnight(8) - 1, true, Midnight(8)},      // more than three days behind
  };
  for (const auto& c : cases) {
    SetSent(c.sent);
    EXPECT_EQ(scheduler.ClampSentDate(c.forced), 0);
    EXPECT_EQ(Sent(), c.expected) << c.sent << (c.forced ? " forced" : "");
  }
}

TEST_F(ReportSchedulerTest, ADueCheckRunsTheMissedDaysAfterTheWeeklyStatusCopy) {
  SetSent(DaysAgo(1));
  scheduler.CheckReportDue();
  EXPECT_FALSE(RunStarted()) << "nothing is due when yesterday was reported";
  EXPECT_EQ(prefs.GetReportDate(), 0) << "nor is the status copy checked";

  SetSent(DaysAgo(3));
  UseApp(2);
  UseApp(1);
  StatusRow();
  ASSERT_EQ(vconf_set_int("memory/appservice/mmc", 1), 0);
  scheduler.CheckReportDue();
  // The status copy ran on this thread, before the worker started.
  EXPECT_EQ(Column(survey,
                   "SELECT app_id||':'||feature||':'||value FROM use_app_feature_survey "
                   "ORDER BY _id"),
            (std::vector<std::string>{"lm:BATT:55", "com.corvane.logmanager:SDCA:1000"}));
  EXPECT_EQ(Column(survey, "SELECT count(*) FROM report_app_status_survey"),
            std::vector<std::string>{"0"});
  EXPECT_EQ(prefs.GetReportDate(), g_testNowMs / 1000);
  WaitForRunEnd();

  EXPECT_EQ(Sent(), DaysAgo(1));
  EXPECT_EQ(Summaries(), 2u) << "one summary per missed day, handed to the relay";
  EXPECT_EQ(Column(upload, "SELECT count(*) FROM survey_log"), std::vector<std::string>{"0"});
  EXPECT_EQ(prefs.GetDeleteDate(), g_testNowMs) << "never purged: the run purges";
}

TEST_F(ReportSchedulerTest, ATimeChangeClampsForcedAndForcesThePurge) {
  ASSERT_EQ(prefs.SetDeleteDate(g_testNowMs - 1000), 0);
  SetSent(DaysAgo(-8));
  scheduler.HandleEvent(ReportScheduler::kTimeChanged);
  EXPECT_EQ(Sent(), DaysAgo(1));
  EXPECT_FALSE(RunStarted());
  EXPECT_EQ(prefs.GetDeleteDate(), 0);

  // Five days behind: the days before the last three are given up. A report date in the
  // future is only reset, without a status copy.
  SetSent(DaysAgo(6));
  ASSERT_EQ(prefs.SetReportDate(static_cast<int32_t>(DaysAgo(-8))), 0);
  StatusRow();
  scheduler.HandleEvent(ReportScheduler::kTimeChanged);
  EXPECT_EQ(prefs.GetReportDate(), g_testNowMs / 1000);
  WaitForRunEnd();
  EXPECT_EQ(Sent(), DaysAgo(1));
  EXPECT_EQ(Summaries(), 3u);
  EXPECT_EQ(prefs.GetDeleteDate(), g_testNowMs);
  EXPECT_EQ(Column(survey, "SELECT count(*) FROM use_app_feature_survey"),
            std::vector<std::string>{"0"});
}

TEST_F(ReportSchedulerTest, ADumpRequestReAggregatesTheDaysItNamesAndPurges) {
  SetSent(DaysAgo(1));
  ASSERT_EQ(prefs.SetDeleteDate(g_testNowMs - 1000), 0);
  scheduler.HandleEvent(ReportScheduler::kDumpContext);  // unreadable as a number: no run
  EXPECT_EQ(Sent(), DaysAgo(1));
  EXPECT_FALSE(RunStarted());
  EXPECT_EQ(prefs.GetDeleteDate(), 0);

  UseApp(1);
  ASSERT_EQ(vconf_set_int(kDumpKey, 2), 0);
  scheduler.HandleEvent(ReportScheduler::kDumpContext);
  WaitForRunEnd();
  EXPECT_EQ(Sent(), DaysAgo(1));
  EXPECT_EQ(Summaries(), 1u);
  EXPECT_EQ(prefs.GetDeleteDate(), g_testNowMs);
}

}  // namespace
}  // namespace _CorvaneLogManager
