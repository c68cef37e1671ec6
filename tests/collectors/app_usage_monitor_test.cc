// AppUsageMonitor on real processes and the real app and survey databases, the clock in the
// test's hand. Window activations enter behind the X reads.
#include "collectors/app_usage_monitor.h"

#include <algorithm>
#include <memory>

#include "tests/collectors/app_db_test_env.h"

namespace _CorvaneLogManager {
namespace {

int64_t g_now = 0;
int64_t FakeNow() { return g_now; }
int64_t TickingNow() { return g_now++; }  // time passes with every reading

const int64_t kT0 = 1700000000000;

class AppUsageMonitorTest : public AppDbTest {
 protected:
  void SetUp() override {
    AppDbTest::SetUp();
    Install("com.ex.alpha", "pkg.alpha", "/opt/usr/apps/alpha/bin/alpha");
    Install("com.ex.beta", "pkg.beta", "/opt/usr/apps/beta/bin/beta");
    Install("com.corvane.lockscreen", "com.corvane.lockscreen", "/opt/usr/apps/lock/bin/lock");
    alpha = Run("/opt/usr/apps/alpha/bin/alpha");
    beta = Run("/opt/usr/apps/beta/bin/beta");
    lock = Run("/opt/usr/apps/lock/bin/lock");
    ASSERT_TRUE(alpha > 0 && beta > 0 && lock > 0);
    monitor.reset(new AppUsageMonitor(ProviderRegistry::GetInstance(), FakeNow));
  }
  void TearDown() override {
    monitor.reset();
    AppDbTest::TearDown();
  }
  void ActivateAt(int64_t at, pid_t pid) {
    g_now = at;
    monitor->OnActiveWindow(pid);
  }
  std::string Periods() { return Rows("SELECT app_id, duration FROM use_app_survey ORDER BY _id"); }
  // Ends the child |pid| and collects it, so the number is free again.
  void Reap(pid_t pid) {
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
    children.erase(std::remove(children.begin(), children.end(), pid), children.end());
  }

  std::unique_ptr<AppUsageMonitor> monitor;
  pid_t alpha = -1, beta = -1, lock = -1;
};

TEST_F(AppUsageMonitorTest, APeriodStartsWhereTheLastOneEndedAndIdsAreStoredVerbatim) {
  monitor.reset(new AppUsageMonitor(ProviderRegistry::GetInstance(), TickingNow));
  const std::string forged = "pkg.o'q',1); DELETE FROM use_app_survey; --";
  Install("com.ex.quote", forged, "/opt/usr/apps/quote/bin/quote");
  pid_t quote = Run("/opt/usr/apps/quote/bin/quote");
  ActivateAt(kT0, alpha);
  ActivateAt(kT0 + 5000, quote);
  ActivateAt(kT0 + 8000, alpha);
  EXPECT_EQ(Periods(), "pkg.alpha:5000;" + forged + ":3000;");
}

TEST_F(AppUsageMonitorTest, ExcludedPackagesAndPeriodsOutOfBoundsAreNeverWritten) {
  int64_t t = kT0;
  for (const char* package : {"com.corvane.lockscreen", "com.corvane.w-home", "Homescreen",
                              "com.corvane.homescreen", ""}) {
    SCOPED_TRACE(package);
    ASSERT_EQ(AppDb(std::string("UPDATE package_app_info SET package = '") + package +
                    "' WHERE app_id = 'com.corvane.lockscreen'"),
              SQLITE_OK);
    pid_t excludedApp = Run("/opt/usr/apps/lock/bin/lock");  // a process keeps its first package
    ActivateAt(t, alpha);
    ActivateAt(t + 1000, excludedApp);
    ActivateAt(t + 3000, beta);  // nothing for the excluded window's 2 s
    t += 10000;
  }
  EXPECT_EQ(Rows("SELECT count(*) FROM use_app_survey WHERE duration = 2000"), "0;");
  EXPECT_EQ(Rows("SELECT count(*), sum(duration) FROM use_app_survey WHERE app_id = 'pkg.alpha'"),
            "5:5000;");

  for (int64_t length : {1LL, 604799999LL, 0LL, 604800000LL, -5000LL}) {
    ActivateAt(t, alpha);
    ActivateAt(t + length, beta);
    t += 2 * 604800000LL;
  }
  EXPECT_EQ(Rows("SELECT group_concat(duration) FROM use_app_survey WHERE app_id = 'pkg.alpha' "
                 "AND duration <> 1000"),
            "1,604799999;");
}

TEST_F(AppUsageMonitorTest, KeepsTheFirstPackageOfAProcessAndSkipsBadLookups) {
  ActivateAt(kT0, alpha);
  // Reinstalled under another package while running: the process keeps the package it had.
  ASSERT_EQ(
      AppDb("UPDATE package_app_info SET package = 'pkg.renamed' WHERE app_id = 'com.ex.alpha'"),
      SQLITE_OK);
  ActivateAt(kT0 + 100, beta);
  ActivateAt(kT0 + 200, alpha);
  ActivateAt(kT0 + 300, beta);
  // Unknown pid, then the app database missing, then corrupt: each activation of a process not
  // looked up before is skipped; one already known is not looked up again.
  pid_t fresh = Run("/opt/usr/apps/alpha/bin/alpha");
  ActivateAt(kT0 + 400, 0x3ffffff0);
  ASSERT_EQ(Sh("mv '" + sysroot + "/opt/dbspace/.pkgmgr_parser.db' '" + sysroot + "/saved.db'"), 0);
  ActivateAt(kT0 + 500, fresh);
  ASSERT_EQ(Sh("echo garbage > '" + sysroot + "/opt/dbspace/.pkgmgr_parser.db'"), 0);
  ActivateAt(kT0 + 600, fresh);
  EXPECT_EQ(AppUsageMonitor::LaunchHandler(fresh, monitor.get()), -1);
  ActivateAt(kT0 + 650, alpha);
  ASSERT_EQ(Sh("mv '" + sysroot + "/saved.db' '" + sysroot + "/opt/dbspace/.pkgmgr_parser.db'"), 0);
  ActivateAt(kT0 + 1000, fresh);
  ActivateAt(kT0 + 1500, beta);
  EXPECT_EQ(Periods(),
            "pkg.alpha:100;pkg.beta:100;pkg.alpha:100;pkg.beta:350;pkg.alpha:350;"
            "pkg.renamed:500;");
}

// A pid that comes back as another app's process, after a death announced or one that was not,
// is that other app's: nothing of the earlier process sticks to the number.
TEST_F(AppUsageMonitorTest, APidReusedByAnotherAppIsTheNewApp) {
  const pid_t pid = alpha;
  ActivateAt(kT0, pid);
  ActivateAt(kT0 + 1000, lock);
  Reap(pid);
  g_now = kT0 + 1500;
  EXPECT_EQ(AppUsageMonitor::DeadHandler(pid, monitor.get()), 0);
  if (Run("/opt/usr/apps/beta/bin/beta", pid) != pid)
    GTEST_SKIP() << "cannot start a process under a chosen pid here (clone3 set_tid)";
  ActivateAt(kT0 + 2000, pid);
  ActivateAt(kT0 + 2500, lock);
  Reap(pid);  // unannounced this time
  ASSERT_EQ(Run("/opt/usr/apps/alpha/bin/alpha", pid), pid);
  ActivateAt(kT0 + 3000, pid);
  ActivateAt(kT0 + 3700, lock);
  EXPECT_EQ(Periods(), "pkg.alpha:1000;pkg.beta:500;pkg.alpha:700;");
}

}  // namespace
}  // namespace _CorvaneLogManager
