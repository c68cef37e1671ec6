// StatusSnapshotStore on a real database file in a temp sysroot.
#include "storage/status_snapshot_store.h"

#include <gtest/gtest.h>

#include <string>

#include "tests/sqlite_rows.h"
#include "tests/temp_sysroot.h"

namespace _CorvaneLogManager {
namespace {

class StatusSnapshotStoreTest : public ::testing::Test {
 protected:
  void TearDown() override { StatusSnapshotStore::DestroyInstance(); }
  // Get's answer as "result:extra:timestamp".
  std::string Got(StatusSnapshotStore* store, const char* feature) {
    std::string extra = "kept";
    int64_t ts = 7;
    int result = store->Get(feature, &extra, &ts);
    return std::to_string(result) + ":" + extra + ":" + std::to_string(ts);
  }
  // Rows as stored, read past the store.
  std::string Dump() {
    return FileRows(tmp.Path("/opt/usr/dbspace/.StatusMonitor.db"),
                    "SELECT feature, extra, timestamp FROM survey_status_monitor ORDER BY feature",
                    "|");
  }
  TempSysroot tmp{"snapshot"};
};

TEST_F(StatusSnapshotStoreTest, KeepsOneRowPerFeatureAndStoresTextsAsTheyCame) {
  ASSERT_TRUE(tmp.MakeDir("/opt/usr/dbspace"));
  StatusSnapshotStore* store = StatusSnapshotStore::GetInstance();
  ASSERT_NE(store, nullptr);
  EXPECT_EQ(Got(store, "SCRN"), "0::0");
  ASSERT_EQ(store->Put("BLUE", "1025", 1700000000123LL), 0);
  ASSERT_EQ(store->Put("BLUE", "515", 1700000000999LL), 0);
  ASSERT_EQ(store->Put("SCRN", "", 1700000000500LL), 0);
  EXPECT_EQ(Dump(), "BLUE|515|1700000000999;SCRN||1700000000500;");
  EXPECT_EQ(Got(store, "BLUE"), "0:515:1700000000999");
  EXPECT_EQ(store->LatestTimestamp(), 1700000000999LL);
  // Closing a period is a write of "" and 0.
  ASSERT_EQ(store->Put("BLUE", "", 0), 0);
  EXPECT_EQ(Got(store, "BLUE"), "0::0");
  EXPECT_EQ(store->LatestTimestamp(), 1700000000500LL);

  EXPECT_EQ(store->Put("", "x", 1), -1);
  EXPECT_EQ(Got(store, ""), "-1:kept:7");
  // A quote is stored as it came; an extra too long for its literal is refused.
  EXPECT_EQ(store->Put("HEAD", "it's'); DROP TABLE survey_status_monitor; --", 99), 0);
  EXPECT_EQ(store->Put("HEAD", std::string(600, 'x').c_str(), 1), -1);
  EXPECT_EQ(Dump(),
            "BLUE||0;HEAD|it's'); DROP TABLE survey_status_monitor; --|99;SCRN||1700000000500;");
  // No escaping: an extra with a comma reads back cut, the next field as the timestamp.
  ASSERT_EQ(store->Put("CHAR", "U,12,x", 500), 0);
  EXPECT_EQ(Got(store, "CHAR"), "0:U:12");
}

TEST_F(StatusSnapshotStoreTest, StaysRegisteredWhenTheFileCannotBeOpened) {
  // No dbspace directory: the open fails, yet the instance remains for later calls.
  EXPECT_EQ(StatusSnapshotStore::GetInstance(), nullptr);
  StatusSnapshotStore* again = StatusSnapshotStore::GetInstance();
  ASSERT_NE(again, nullptr);
  EXPECT_EQ(again->Put("SCRN", "", 1), -1);
  EXPECT_EQ(Got(again, "SCRN"), "-1:kept:7");
  EXPECT_EQ(again->LatestTimestamp(), 0);
}

}  // namespace
}  // namespace _CorvaneLogManager
