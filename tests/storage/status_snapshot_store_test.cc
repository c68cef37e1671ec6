// StatusSnapshotStore on a real database file in a temp sysroot.
#include "storage/status_snapshot_store.h"

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <string>

#include "tests/sqlite_rows.h"
#include "tests/temp_sysroot.h"

namespace _CorvaneLogManager {
namespace {

class StatusSnapshotStoreTest : public ::testing::Test {
 protected:
  void TearDown() override { StatusSnapshotStore::DestroyInstance(); }
  StatusSnapshotStore* Open() {
    (void)tmp.MakeDir("/opt/usr/dbspace");
    return StatusSnapshotStore::GetInstance();
  }
  // Rows as stored, read past the store: "feature|extra|timestamp;" each.
  std::string Dump() {
    return FileRows(sysroot + "/opt/usr/dbspace/.StatusMonitor.db",
                    "SELECT feature, extra, timestamp FROM survey_status_monitor ORDER BY feature",
                    "|");
  }
  TempSysroot tmp{"snapshot"};
  const std::string sysroot = tmp.path();
};

TEST_F(StatusSnapshotStoreTest, RejectsWhatTheStatementCannotCarry) {
  StatusSnapshotStore* store = Open();
  ASSERT_NE(store, nullptr);
  ASSERT_EQ(store->Put("HEAD", "", 42), 0);
  std::string extra = "kept";
  int64_t ts = 7;
  EXPECT_EQ(store->Put("", "x", 1), -1);
  EXPECT_EQ(store->Get("", &extra, &ts), -1);
  EXPECT_EQ(extra, "kept");
  EXPECT_EQ(ts, 7);
  // A quote is stored as it came; a feature or extra too long for its literal is refused.
  EXPECT_EQ(store->Put("HEAD", "it's'); DROP TABLE survey_status_monitor; --", 99), 0);
  EXPECT_EQ(Dump(), "HEAD|it's'); DROP TABLE survey_status_monitor; --|99;");
  EXPECT_EQ(store->Put("HEAD", std::string(600, 'x').c_str(), 1), -1);
  ASSERT_EQ(store->Put("HEAD", "", 42), 0);

  // No escaping: an extra with a comma reads back cut, the next field as the timestamp.
  ASSERT_EQ(store->Put("CHAR", "U,12,x", 500), 0);
  ASSERT_EQ(store->Get("CHAR", &extra, &ts), 0);
  EXPECT_EQ(extra, "U");
  EXPECT_EQ(ts, 12);
}

TEST_F(StatusSnapshotStoreTest, StaysRegisteredWhenTheFileCannotBeOpened) {
  // No dbspace directory: the open fails, yet the instance remains for later calls.
  EXPECT_EQ(StatusSnapshotStore::GetInstance(), nullptr);
  StatusSnapshotStore* again = StatusSnapshotStore::GetInstance();
  ASSERT_NE(again, nullptr);
  std::string extra;
  int64_t ts = 0;
  EXPECT_EQ(again->Put("SCRN", "", 1), -1);
  EXPECT_EQ(again->Get("SCRN", &extra, &ts), -1);
  EXPECT_EQ(again->LatestTimestamp(), 0);
}

}  // namespace
}  // namespace _CorvaneLogManager
