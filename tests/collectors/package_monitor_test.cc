// PackageMonitor's request states, fed as pkgmgr would, into the real survey database.
#include "collectors/package_monitor.h"

#include <memory>

#include "tests/collectors/app_db_test_env.h"

namespace _CorvaneLogManager {
namespace {

class PackageMonitorTest : public AppDbTest {
 protected:
  void SetUp() override {
    // The monitor's listening client is never used here; keep it off any real bus.
    setenv("DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nonexistent", 1);
    AppDbTest::SetUp();
    monitor.reset(new PackageMonitor(ProviderRegistry::GetInstance()));
  }
  void TearDown() override {
    monitor.reset();
    unsetenv("DBUS_SYSTEM_BUS_ADDRESS");
    AppDbTest::TearDown();
  }
  void Status(const char* packageId, const char* key, const char* value) {
    EXPECT_EQ(
        PackageMonitor::StatusHandler(1, "tpk", packageId, key, value, nullptr, monitor.get()), 0);
  }
  std::string Managed() {
    return Rows("SELECT installed_app_id, type FROM manage_app_survey ORDER BY _id");
  }

  std::unique_ptr<PackageMonitor> monitor;
};

TEST_F(PackageMonitorTest, OnlyAnAnnouncedRequestIsWrittenAndOnlyOnce) {
  Status("pkg.a", "end", "ok");      // no start seen
  Status("pkg.a", "start", "move");  // not a kind written here
  Status("pkg.a", "end", "ok");
  Status("pkg.b", nullptr, "ok");
  Status("pkg.b", "start", nullptr);
  EXPECT_EQ(Managed(), "");
  // A failed end keeps the kind for the next good one; a kind not written leaves it too.
  Status("pkg.b", "start", "uninstall");
  Status("pkg.b", "end", "fail");
  Status("pkg.b", "start", "move");
  Status("pkg.b", "end", "ok");
  Status("pkg.b", "end", "ok");
  EXPECT_EQ(Managed(), "pkg.b:1;");
  EXPECT_EQ(PackageMonitor::StatusHandler(1, "tpk", "pkg.c", "end", "ok", nullptr, nullptr), -1);
}

TEST_F(PackageMonitorTest, StoresPackageIdsVerbatimAndRefusesOnesThatDoNotFit) {
  // "'id',N" fits the 132-byte text up to a 127-character id; a quote takes two bytes.
  const std::string quoted = "pkg.o'x',9); DROP TABLE manage_app_survey; --";
  const std::string fits(127, 'a'), tooLong(128, 'b'), quotedTooLong = std::string(126, 'c') + "'";
  for (const std::string& id : {quoted, fits, tooLong, quotedTooLong}) {
    SCOPED_TRACE(id.size());
    Status(id.c_str(), "start", "install");
    Status(id.c_str(), "end", "ok");
  }
  Status("pkg.refused", "end", "ok");  // the refused request is over all the same
  Status(nullptr, "start", "install");
  Status(nullptr, "end", "ok");
  EXPECT_EQ(Managed(), quoted + ":0;" + fits + ":0;:0;");
}

}  // namespace
}  // namespace _CorvaneLogManager
