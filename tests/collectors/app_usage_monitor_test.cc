// AppUsageMonitor's period rules on real processes and the real app and survey databases, with
// the clock in the test's hand. Window activations enter behind the X reads.
#include "collectors/app_usage_monitor.h"

#include "app_db_test_env.h"

namespace _CorvaneLogManager {
namespace {

int64_t g_now = 0;
int64_t FakeNow() { return g_now; }
int64_t TickingNow() { return g_now++; }  // time passes with every reading

const int64_t kT0 = 1700000000000;  // any plausible epoch time

class AppUsageMonitorTest : public AppDbTest {
 protected:
  void SetUp() override {
    AppDbTest::SetUp();
    AppUsageMonitor::SetClock(FakeNow);
    Install("com.ex.alpha", "pkg.alpha", "/opt/usr/apps/alpha/bin/alpha");
    Install("com.ex.beta", "pkg.beta", "/opt/usr/apps/beta/bin/beta");
    Install("com.corvane.lockscreen", "com.corvane.lockscreen", "/opt/usr/apps/lock/bin/lock");
    alpha = Run("/opt/usr/apps/alpha/bin/alpha");
    beta = Run("/opt/usr/apps/beta/bin/beta");
    lock = Run("/opt/usr/apps/lock/bin/lock");
    ASSERT_GT(alpha, 0);
    ASSERT_GT(beta, 0);
    ASSERT_GT(lock, 0);
    monitor = new AppUsageMonitor();
  }
  void TearDown() override {
    delete monitor;
    AppUsageMonitor::SetClock(nullptr);
    AppDbTest::TearDown();
  }
  void ActivateAt(int64_t at, pid_t pid) {
    g_now = at;
    monitor->OnActiveWindow(pid, "window");
  }
  std::string Periods() { return Rows("SELECT app_id, duration FROM use_app_survey ORDER BY _id"); }

  AppUsageMonitor* monitor = nullptr;
  pid_t alpha = -1, beta = -1, lock = -1;
};

TEST_F(AppUsageMonitorTest, WritesOnePeriodPerForegroundChange) {
  ActivateAt(kT0, alpha);
  ActivateAt(kT0 + 5000, beta);
  EXPECT_EQ(Periods(), "pkg.alpha:5000;");
  ActivateAt(kT0 + 5500, beta);  // same process again: the period runs on
  ActivateAt(kT0 + 7000, lock);  // ends beta's period and starts none
  ActivateAt(kT0 + 9000, alpha);
  ActivateAt(kT0 + 9400, getpid());  // a window of no application changes nothing
  ActivateAt(kT0 + 9600, beta);
  EXPECT_EQ(Periods(), "pkg.alpha:5000;pkg.beta:2000;pkg.alpha:600;");
}

TEST_F(AppUsageMonitorTest, APeriodStartsWhereTheLastOneEnded) {
  AppUsageMonitor::SetClock(TickingNow);
  ActivateAt(kT0, alpha);
  ActivateAt(kT0 + 5000, beta);
  ActivateAt(kT0 + 8000, alpha);
  EXPECT_EQ(Periods(), "pkg.alpha:5000;pkg.beta:3000;");
}

TEST_F(AppUsageMonitorTest, StoresThePackageIdFromTheAppDatabaseVerbatim) {
  const std::string forged = "pkg.o'q',1); DELETE FROM use_app_survey; --";
  std::string forFixture;  // the fixture's own statement needs the quotes doubled
  for (char c : forged) forFixture += c == '\'' ? "''" : std::string(1, c);
  Install("com.ex.quote", forFixture, "/opt/usr/apps/quote/bin/quote");
  pid_t quote = Run("/opt/usr/apps/quote/bin/quote");
  ActivateAt(kT0, alpha);
  ActivateAt(kT0 + 300, quote);
  ActivateAt(kT0 + 700, alpha);
  EXPECT_EQ(Periods(), "pkg.alpha:300;" + forged + ":400;");
}

TEST_F(AppUsageMonitorTest, ExcludedPackagesAreNeverTracked) {
  const char* const excluded[] = {"com.corvane.lockscreen", "com.corvane.w-home", "Homescreen",
                                  "com.corvane.homescreen", ""};
  int64_t t = kT0;
  for (const char* package : excluded) {
    SCOPED_TRACE(package);
    ASSERT_EQ(AppDb(std::string("UPDATE package_app_info SET package = '") + package +
                    "' WHERE app_id = 'com.corvane.lockscreen'"),
              SQLITE_OK);
    ActivateAt(t, alpha);
    ActivateAt(t + 1000, lock);
    ActivateAt(t + 3000, beta);  // nothing for the excluded window's 2 s
    t += 10000;
  }
  EXPECT_EQ(Rows("SELECT count(*) FROM use_app_survey WHERE duration = 2000"), "0;");
  EXPECT_EQ(Rows("SELECT count(*), sum(duration) FROM use_app_survey WHERE app_id = 'pkg.alpha'"),
            "5:5000;");
}

TEST_F(AppUsageMonitorTest, ScreenOffClosesThePeriodAndScreenOnStartsTheNext) {
  ActivateAt(kT0, alpha);
  g_now = kT0 + 3000;
  monitor->OnScreenState(0);
  ActivateAt(kT0 + 4000, beta);  // while off: takes over the foreground, writes nothing
  g_now = kT0 + 10000;
  monitor->OnScreenState(1);  // no display here: only the period restarts
  ActivateAt(kT0 + 12000, alpha);
  EXPECT_EQ(Periods(), "pkg.alpha:3000;pkg.beta:2000;");
}

TEST_F(AppUsageMonitorTest, DeathWritesOnlyAfterTheShortestPeriod) {
  ActivateAt(kT0, beta);
  ActivateAt(kT0 + 10, alpha);  // beta's 10 ms are written; alpha's period starts
  g_now = kT0 + 110;
  EXPECT_EQ(AppUsageMonitor::DeadHandler(alpha, monitor), 0);  // 100 ms: nothing
  g_now = kT0 + 2010;
  EXPECT_EQ(AppUsageMonitor::DeadHandler(beta, monitor), 0);  // not in front, still recorded
  EXPECT_EQ(AppUsageMonitor::DeadHandler(beta, monitor), 0);  // no longer tracked
  EXPECT_EQ(Periods(), "pkg.beta:10;pkg.beta:2000;");
}

TEST_F(AppUsageMonitorTest, DropsPeriodsOutsideTheBounds) {
  struct Case {
    int64_t length;
    bool written;
  } const cases[] = {{1, true}, {604799999, true}, {0, false}, {604800000, false}, {-5000, false}};
  int64_t t = kT0;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.length);
    std::string before = Rows("SELECT count(*) FROM use_app_survey WHERE app_id = 'pkg.alpha'");
    ActivateAt(t, alpha);
    ActivateAt(t + c.length, beta);
    std::string expected = c.written ? std::to_string(std::stoi(before) + 1) + ";" : before;
    EXPECT_EQ(Rows("SELECT count(*) FROM use_app_survey WHERE app_id = 'pkg.alpha'"), expected);
    t += 2 * 604800000LL;
  }
}

TEST_F(AppUsageMonitorTest, KeepsTheFirstPackageOfAProcessAndSkipsBadLookups) {
  ActivateAt(kT0, alpha);
  // Reinstalled under another package while running: the tracked entry stays as it was.
  ASSERT_EQ(
      AppDb("UPDATE package_app_info SET package = 'pkg.renamed' WHERE app_id = 'com.ex.alpha'"),
      SQLITE_OK);
  ActivateAt(kT0 + 100, beta);
  ActivateAt(kT0 + 200, alpha);
  ActivateAt(kT0 + 300, beta);
  // Unknown pid, then the app database missing, then corrupt: each activation is skipped.
  ActivateAt(kT0 + 400, 0x3ffffff0);
  ASSERT_EQ(Sh("mv '" + sysroot + "/opt/dbspace/.pkgmgr_parser.db' '" + sysroot + "/saved.db'"), 0);
  ActivateAt(kT0 + 500, alpha);
  ASSERT_EQ(Sh("echo garbage > '" + sysroot + "/opt/dbspace/.pkgmgr_parser.db'"), 0);
  ActivateAt(kT0 + 600, alpha);
  EXPECT_EQ(AppUsageMonitor::LaunchHandler(alpha, monitor), -1);
  ASSERT_EQ(Sh("mv '" + sysroot + "/saved.db' '" + sysroot + "/opt/dbspace/.pkgmgr_parser.db'"), 0);
  ActivateAt(kT0 + 1000, alpha);
  EXPECT_EQ(Periods(), "pkg.alpha:100;pkg.beta:100;pkg.alpha:100;pkg.beta:700;");
}

}  // namespace
}  // namespace _CorvaneLogManager
