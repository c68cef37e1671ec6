// DeviceStatusMonitor periods on the real store, registry and survey database in a temp sysroot.
#include "collectors/device_status_monitor.h"

#include <gtest/gtest.h>

#include <string>

#include "include/provider_registry.h"
#include "storage/db_manager.h"
#include "storage/pref_store.h"
#include "storage/status_snapshot_store.h"
#include "tests/sqlite_rows.h"
#include "tests/temp_sysroot.h"

namespace _CorvaneLogManager {
namespace {

class DeviceStatusMonitorTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(prefs.Create(), 0);
    ASSERT_EQ(ProviderRegistry::GetInstance()->CreateProviders(), 0);
    ASSERT_EQ(DbManager::GetInstance()->Init(), 0);
    store = StatusSnapshotStore::GetInstance();
    ASSERT_NE(store, nullptr);
    ASSERT_EQ(monitor.Recover(store, DbManager::GetInstance()->GetConnection(), kAppId), 0);
  }
  void TearDown() override {
    ProviderRegistry::Release();
    DbManager::CloseInstance();
    StatusSnapshotStore::DestroyInstance();
    (void)prefs.Close();
  }
  std::string Rows() {
    return FileRows(sysroot + "/opt/usr/dbspace/.SurveyLog.db",
                    "SELECT app_id, feature, extra, value FROM use_app_feature_survey ORDER BY _id",
                    "|", "NULL");
  }
  int64_t OpenedAt(const char* code) {
    std::string extra;
    int64_t ts = -1;
    EXPECT_EQ(store->Get(code, &extra, &ts), 0);
    return ts;
  }

  static constexpr const char* kAppId = "com.ex.logger";
  TempSysroot tmp{"device", {"/opt/usr/dbspace"}};
  const std::string sysroot = tmp.path();
  PrefStore prefs;
  DeviceStatusMonitor monitor{ProviderRegistry::GetInstance(), &prefs, WallClockMs};
  StatusSnapshotStore* store = nullptr;
};

TEST_F(DeviceStatusMonitorTest, WritesOnlyPeriodsOfPlausibleLength) {
  std::string expected;
  for (int64_t duration : {-5LL, 0LL, 1LL, 604800000LL, 604800001LL}) {
    SCOPED_TRACE(duration);
    ASSERT_EQ(monitor.StartFeature("WIFI", ""), 0);
    int64_t start = OpenedAt("WIFI");
    ASSERT_GT(start, 0);
    ASSERT_EQ(monitor.EndFeature("WIFI", start + duration), 0);
    if (duration > 0 && duration <= 604800000LL)
      expected += std::string(kAppId) + "|WIFI||" + std::to_string(duration) + ";";
    EXPECT_EQ(Rows(), expected);
    EXPECT_EQ(OpenedAt("WIFI"), 0);  // closed either way
  }
}

TEST_F(DeviceStatusMonitorTest, FirstStartWinsAndClosingTwiceWritesOnce) {
  ASSERT_EQ(monitor.StartFeature("BLUE", "1025"), 0);
  int64_t start = OpenedAt("BLUE");
  ASSERT_EQ(monitor.StartFeature("BLUE", "515"), 0);
  ASSERT_EQ(monitor.EndFeature("BLUE", start + 2500), 0);
  ASSERT_EQ(monitor.EndFeature("BLUE", start + 5000), 0);
  ASSERT_EQ(monitor.RecordCapture(), 0);
  EXPECT_EQ(Rows(), "com.ex.logger|BLUE|1025|2500;com.ex.logger|CAPT||NULL;");
  // Without the store taken by recovery a monitor refuses periods.
  DeviceStatusMonitor fresh(ProviderRegistry::GetInstance(), &prefs, WallClockMs);
  EXPECT_EQ(fresh.StartFeature("HEAD", ""), -1);
}

TEST_F(DeviceStatusMonitorTest, ARetriedStartDoesNotRecoverAgain) {
  // A retried daemon start runs recovery again; the periods opened since must stay open.
  ASSERT_EQ(monitor.StartFeature("WIFI", ""), 0);
  int64_t opened = OpenedAt("WIFI");
  ASSERT_EQ(monitor.Recover(store, DbManager::GetInstance()->GetConnection(), kAppId), 0);
  EXPECT_EQ(OpenedAt("WIFI"), opened);
  EXPECT_EQ(Rows(), "");
}

}  // namespace
}  // namespace _CorvaneLogManager
