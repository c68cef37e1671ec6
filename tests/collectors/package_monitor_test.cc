// PackageMonitor's row text, fed status events directly; the event sequences themselves run
// through the daemon in the system tests.
#include "collectors/package_monitor.h"

#include "app_db_test_env.h"

namespace _CorvaneLogManager {
namespace {

class PackageMonitorTest : public AppDbTest {
 protected:
  void SetUp() override {
    // No bus here: the monitor is fed by hand.
    setenv("DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nonexistent/bus", 1);
    AppDbTest::SetUp();
  }
  void Request(const std::string& pkgid, const char* kind, const char* result) {
    EXPECT_EQ(
        PackageMonitor::StatusHandler(1, "tpk", pkgid.c_str(), "start", kind, nullptr, &monitor),
        0);
    EXPECT_EQ(
        PackageMonitor::StatusHandler(1, "tpk", pkgid.c_str(), "end", result, nullptr, &monitor),
        0);
  }
  PackageMonitor monitor;
};

TEST_F(PackageMonitorTest, CutsTheRowTextAt131Characters) {
  // "'id',2" fills the 132-byte text with a 127-character id; one more and the type is cut
  // off, a statement the database refuses.
  Request(std::string(127, 'p'), "update", "ok");
  Request(std::string(128, 'q'), "update", "ok");
  Request("after", "uninstall", "ok");  // later requests are still recorded
  EXPECT_EQ(Rows("SELECT installed_app_id, type FROM manage_app_survey ORDER BY _id"),
            std::string(127, 'p') + ":2;after:1;");
}

}  // namespace
}  // namespace _CorvaneLogManager
