// PrefStore on a real .pref.db in a temp sysroot.
#include "storage/pref_store.h"

#include <gtest/gtest.h>
#include <stdio.h>
#include <stdlib.h>
#include <time.h>

#include <fstream>
#include <sstream>
#include <string>

namespace _CorvaneLogManager {
namespace {

class PrefStoreTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char tmpl[] = "/tmp/logmgr-pref-XXXXXX";
    ASSERT_NE(mkdtemp(tmpl), nullptr);
    sysroot = tmpl;
    setenv("LOGMGR_SYSROOT", sysroot.c_str(), 1);
  }
  void TearDown() override {
    (void)store.Close();
    unsetenv("LOGMGR_SYSROOT");
    unsetenv("TZ");
    tzset();
    (void)system(("rm -rf '" + sysroot + "'").c_str());
  }
  void MakeDbDir() { ASSERT_EQ(system(("mkdir -p '" + DbDir() + "'").c_str()), 0); }
  std::string DbDir() const { return sysroot + "/opt/usr/dbspace"; }
  std::string sysroot;
  PrefStore store;
};

TEST_F(PrefStoreTest, MakesDeviceIdOnceAndReadsItBackWithComma) {
  MakeDbDir();
  time_t before = time(nullptr);
  ASSERT_EQ(store.Create(), 0);
  time_t after = time(nullptr);
  std::string id = CachedDeviceId();
  ASSERT_EQ(id.size(), 32u) << id;
  EXPECT_TRUE(VerifyDeviceId(id)) << id;
  EXPECT_EQ(id[0], 'T');
  long long stamp = atoll(id.substr(13, 13).c_str());
  EXPECT_GE(stamp, before);
  EXPECT_LE(stamp, after);
  ASSERT_EQ(store.Close(), 0);

  PrefStore again;
  ASSERT_EQ(again.Create(), 0);
  EXPECT_EQ(CachedDeviceId(), id + ",");
  EXPECT_TRUE(VerifyDeviceId(CachedDeviceId()));
  std::string stored;
  EXPECT_EQ(again.GetString("key_deviceid", &stored), 0);
  EXPECT_EQ(stored, id + ",");
  EXPECT_EQ(again.Close(), 0);
}

TEST_F(PrefStoreTest, DeviceIdCheckSuffixCatchesEdits) {
  const char* randoms[] = {"abcdefghijkl", "ZZZZZZZZZZZZ", "0123456789Aa", "qX3eR5tY7uI9"};
  const time_t times[] = {0, 1, 1717977600, 9999999999999LL};
  for (const char* random : randoms) {
    for (time_t t : times) {
      std::string id = MakeDeviceId(random, t);
      SCOPED_TRACE(id);
      ASSERT_TRUE(VerifyDeviceId(id));
      ASSERT_TRUE(VerifyDeviceId(id + ","));
      EXPECT_FALSE(VerifyDeviceId(id + ",,"));
      EXPECT_FALSE(VerifyDeviceId(id.substr(0, 31)));
      for (size_t pos = 13; pos < 26; ++pos) {  // any changed time digit
        std::string bad = id;
        bad[pos] = static_cast<char>('0' + (bad[pos] - '0' + 1) % 10);
        EXPECT_FALSE(VerifyDeviceId(bad)) << "digit " << pos;
      }
      for (size_t pos = 26; pos < 32; ++pos) {  // any changed suffix character
        std::string bad = id;
        char base = pos == 28 || pos == 29 ? '0' : (pos == 27 || pos == 31 ? 'a' : 'A');
        int span = base == '0' ? 10 : 26;
        bad[pos] = static_cast<char>(base + (bad[pos] - base + 1) % span);
        EXPECT_FALSE(VerifyDeviceId(bad)) << "suffix " << pos;
      }
      std::string swapped = id;  // two unlike random characters swapped
      std::swap(swapped[1], swapped[2]);
      if (swapped != id) {
        EXPECT_FALSE(VerifyDeviceId(swapped));
      }
    }
  }
  EXPECT_EQ(MakeDeviceId("abcdefghijkl", 42).substr(13, 13), "0000000000042");
}

TEST_F(PrefStoreTest, ValuesRoundTripAndAbsentKeysReadZero) {
  MakeDbDir();
  ASSERT_EQ(store.Create(), 0);
  // Absent keys: 0 through every getter, with success.
  EXPECT_EQ(store.GetDeleteDate(), 0);
  EXPECT_EQ(store.GetSurveyUpdateDate(), 0);
  EXPECT_EQ(store.GetReportDate(), 0);
  EXPECT_EQ(store.GetSentDate(), 0u);
  EXPECT_EQ(store.GetLastShutdownTime(), 0u);
  std::string text = "untouched";
  EXPECT_EQ(store.GetString("key_never_written", &text), 0);
  EXPECT_EQ(text, "");

  ASSERT_EQ(store.SetDeleteDate(1717977600123LL), 0);
  ASSERT_EQ(store.SetSurveyUpdateDate(-5), 0);  // widened with its sign
  ASSERT_EQ(store.SetReportDate(1717977600), 0);
  ASSERT_EQ(store.SetSentDate(-1), 0);
  ASSERT_EQ(store.SetLastShutdownTime(2000000000), 0);
  EXPECT_EQ(store.GetDeleteDate(), 1717977600123LL);
  EXPECT_EQ(store.GetSurveyUpdateDate(), -5);
  EXPECT_EQ(store.GetReportDate(), 1717977600);
  EXPECT_EQ(store.GetSentDate(), 0xFFFFFFFFu);
  EXPECT_EQ(store.GetLastShutdownTime(), 2000000000u);
  ASSERT_EQ(store.SetSentDate(1717977600), 0);  // replaced, not added
  EXPECT_EQ(store.GetSentDate(), 1717977600u);
  ASSERT_EQ(store.SetString("key_note", "a b"), 0);
  EXPECT_EQ(store.GetString("key_note", &text), 0);
  EXPECT_EQ(text, "a b,");
  EXPECT_EQ(store.SetString("", "x"), -1);
  EXPECT_EQ(store.SetString(nullptr, "x"), -1);
  EXPECT_EQ(store.GetString("", &text), -1);

  // Failed reads: -1 from the delete, survey-update and report dates, 0 from the other two.
  ASSERT_EQ(store.Close(), 0);
  EXPECT_EQ(store.GetDeleteDate(), -1);
  EXPECT_EQ(store.GetSurveyUpdateDate(), -1);
  EXPECT_EQ(store.GetReportDate(), -1);
  EXPECT_EQ(store.GetSentDate(), 0u);
  EXPECT_EQ(store.GetLastShutdownTime(), 0u);
  EXPECT_EQ(store.SetSentDate(1), -1);
}

TEST_F(PrefStoreTest, NormaliseSentDateRoundsToNearestLocalMidnight) {
  MakeDbDir();
  ASSERT_EQ(store.Create(), 0);
  const int64_t kUtcMidnight = 1717977600;  // 2024-06-10 00:00 UTC
  const int64_t kSeoulMidnight = kUtcMidnight - 9 * 3600;
  struct Case {
    const char* tz;
    int64_t sent;
    int64_t want;
  } cases[] = {
      {"KST-9", kSeoulMidnight + 13 * 3600, kSeoulMidnight + 86400},  // 13:00: next day
      {"KST-9", kSeoulMidnight + 12 * 3600 + 59 * 60, kSeoulMidnight},  // 12:59: same day
      {"KST-9", kSeoulMidnight + 30 * 60, kSeoulMidnight + 30 * 60},  // 00:30: kept
      {"UTC0", kUtcMidnight + 23 * 3600 + 59 * 60, kUtcMidnight + 86400},
      // 2024-03-31 05:00 CEST, the day clocks went forward: midnight was still CET.
      {"CET-1CEST,M3.5.0,M10.5.0/3", 1711854000, 1711839600},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.tz) + " " + std::to_string(c.sent));
    setenv("TZ", c.tz, 1);
    tzset();
    ASSERT_EQ(store.SetSentDate(static_cast<int32_t>(c.sent)), 0);
    EXPECT_EQ(store.NormaliseSentDate(), static_cast<uint32_t>(c.want));
    EXPECT_EQ(store.GetSentDate(), static_cast<uint32_t>(c.want)) << "stored back";
  }
}

TEST_F(PrefStoreTest, OpenFailsOnBadFileOrMissingDirectory) {
  // No database directory under the sysroot.
  EXPECT_EQ(store.Create(), -1);
  EXPECT_EQ(store.Close(), -1);

  // A .pref.db that is not a database: the open fails and the file is left as it was.
  MakeDbDir();
  std::string path = DbDir() + "/.pref.db";
  const std::string junk(4096, 'j');
  {
    std::ofstream out(path);
    out << junk;
  }
  EXPECT_EQ(store.Create(), -1);
  std::ifstream in(path);
  std::stringstream content;
  content << in.rdbuf();
  EXPECT_EQ(content.str(), junk);
}

}  // namespace
}  // namespace _CorvaneLogManager
