// PrefStore on a real .pref.db in a temp sysroot.
#include "storage/pref_store.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <time.h>

#include <string>

#include "tests/temp_sysroot.h"

namespace _CorvaneLogManager {
namespace {

class PrefStoreTest : public ::testing::Test {
 protected:
  void TearDown() override {
    (void)store.Close();
    unsetenv("TZ");
    tzset();
  }
  TempSysroot tmp{"pref"};
  PrefStore store;
};

TEST_F(PrefStoreTest, DeviceIdCheckSuffixCatchesEdits) {
  for (time_t t : {time_t{0}, time_t{1717977600}, time_t{9999999999999LL}}) {
    std::string id = MakeDeviceId("qX3eR5tY7uI9", t);
    SCOPED_TRACE(id);
    ASSERT_TRUE(VerifyDeviceId(id));
    std::string swapped = id;
    std::swap(swapped[1], swapped[2]);
    for (const std::string& bad : {id + ",,", id.substr(1), swapped})
      EXPECT_FALSE(VerifyDeviceId(bad));
    // Any changed time digit, or any other suffix character of its class.
    for (size_t pos = 13; pos < 32; ++pos) {
      char base = pos < 26 || pos == 28 || pos == 29 ? '0' : (pos == 27 || pos == 31) ? 'a' : 'A';
      std::string bad = id;
      bad[pos] = static_cast<char>(base + (bad[pos] - base + 1) % (base == '0' ? 10 : 26));
      EXPECT_FALSE(VerifyDeviceId(bad)) << pos;
    }
  }
  EXPECT_EQ(MakeDeviceId("abcdefghijkl", 42).substr(13, 13), "0000000000042");
}

TEST_F(PrefStoreTest, DeviceIdAndValuesKeptAndFailedReadsGiveTheirFailureValue) {
  EXPECT_EQ(store.Create(), -1) << "no database directory";
  ASSERT_TRUE(tmp.MakeDir("/opt/usr/dbspace"));
  ASSERT_EQ(store.Create(), 0);
  // The device id is made once; a later open reads it back as a row text.
  std::string id = CachedDeviceId();
  EXPECT_TRUE(VerifyDeviceId(id)) << id;
  ASSERT_EQ(store.Close(), 0);
  ASSERT_EQ(store.Create(), 0);
  EXPECT_EQ(CachedDeviceId(), id + ",");
  std::string text = "untouched";
  EXPECT_EQ(store.GetString("key_never_written", &text), 0);
  EXPECT_EQ(text, "");
  EXPECT_EQ(store.GetDeleteDate(), 0) << "absent keys read as 0";
  ASSERT_EQ(store.SetDeleteDate(1717977600123LL), 0);
  ASSERT_EQ(store.SetSurveyUpdateDate(-5), 0);  // widened with its sign
  ASSERT_EQ(store.SetSentDate(-1), 0);
  EXPECT_EQ(store.GetDeleteDate(), 1717977600123LL);
  EXPECT_EQ(store.GetSurveyUpdateDate(), -5);
  EXPECT_EQ(store.GetSentDate(), 0xFFFFFFFFu);
  ASSERT_EQ(store.SetString("key_note", "a b"), 0);
  EXPECT_EQ(store.GetString("key_note", &text), 0);
  EXPECT_EQ(text, "a b,");
  EXPECT_EQ(store.SetString("", "x"), -1);
  ASSERT_EQ(store.Close(), 0);
  EXPECT_EQ(store.GetDeleteDate() + store.GetSurveyUpdateDate() + store.GetReportDate(), -3);
  EXPECT_EQ(store.GetSentDate() + store.GetLastShutdownTime(), 0u);
}

TEST_F(PrefStoreTest, NormaliseSentDateRoundsToNearestLocalMidnight) {
  ASSERT_TRUE(tmp.MakeDir("/opt/usr/dbspace"));
  ASSERT_EQ(store.Create(), 0);
  const int64_t kUtcMidnight = 1717977600;  // 2024-06-10 00:00 UTC
  const int64_t kSeoul = kUtcMidnight - 9 * 3600;
  const struct {
    const char* tz;
    int64_t sent, want;
  } cases[] = {
      {"KST-9", kSeoul + 13 * 3600, kSeoul + 86400},
      {"KST-9", kSeoul + 12 * 3600 + 59 * 60, kSeoul},
      {"KST-9", kSeoul + 30 * 60, kSeoul + 30 * 60},  // hour 0: kept as it is
      {"UTC0", kUtcMidnight + 23 * 3600, kUtcMidnight + 86400},
      // 2024-03-31 05:00 CEST, the day clocks went forward: that midnight was still CET.
      {"CET-1CEST,M3.5.0,M10.5.0/3", 1711854000, 1711839600},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(std::string(c.tz) + " " + std::to_string(c.sent));
    setenv("TZ", c.tz, 1);
    tzset();
    ASSERT_EQ(store.SetSentDate(static_cast<int32_t>(c.sent)), 0);
    EXPECT_EQ(store.NormaliseSentDate(), static_cast<uint32_t>(c.want));
    EXPECT_EQ(store.GetSentDate(), static_cast<uint32_t>(c.want)) << "stored back";
  }
}

}  // namespace
}  // namespace _CorvaneLogManager
