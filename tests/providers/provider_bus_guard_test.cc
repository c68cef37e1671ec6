// The checks in front of the shared tables: they must agree byte for byte with the statements
// the providers build, confine SQL to the object's table, and never write a segment that is
// not the caller's or too small.
#include "providers/provider_bus_guard.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <unistd.h>

#include "providers/local_zone.h"
#include "tests/providers/provider_test_env.h"

namespace _CorvaneLogManager {
namespace {

const std::vector<std::string> kColumns = {"_id",     "timestamp", "time_zone", "app_id",
                                           "feature", "extra",     "value"};

TEST(ProviderBusGuardTest, RowEntriesAcceptOnlyWritableColumnsAndQuotelessValues) {
  struct Case {
    const char* key;
    const char* value;
    int result;
  } cases[] = {{"app_id", "a", 0},
               {"_id", "4", 0},
               {"_id", "9007199254740992", 0},  // 2^53, the largest id a caller may give
               {"_id", "009", 0},
               {"extra", "x, y", 0},
               {"_id", "9007199254740993", -1},
               {"_id", "9223372036854775807", -1},
               {"_id", "99999999999999999999999999", -1},
               {"_id", "0", -1},
               {"_id", "-1", -1},
               {"_id", "1e3", -1},
               {"_id", " 7", -1},
               {"_id", "7 ", -1},
               {"_id", "", -1},
               {"timestamp", "1", -1},
               {"time_zone", "Z", -1},
               {"bogus", "1", -1},
               {"app_id ", "a", -1},
               {"extra", "it's", -1},
               {"(SELECT 1)", "1", -1}};
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.key) + "=" + c.value);
    BusRowLists lists{"feature", "'F'"};
    EXPECT_EQ(AppendRowEntry(kColumns, c.key, c.value, &lists), c.result);
    if (c.result == 0) {
      EXPECT_EQ(lists.columns, std::string("feature,") + c.key);
      EXPECT_EQ(lists.values, std::string("'F','") + c.value + "'");
      EXPECT_EQ(lists.valueHasComma, strchr(c.value, ',') != nullptr);
    } else {
      EXPECT_EQ(lists.columns, "feature");
      EXPECT_EQ(lists.values, "'F'");
    }
  }
}

// The real registry and survey database, asked by the guard's own row lists.
class ProviderBusFitTest : public ProviderTest {
 protected:
  void SetUp() override {
    ProviderTest::SetUp();
    StartProviders();
  }
  BaseLogProvider* Feature() { return Provider("use_app_feature_survey"); }
  // The last traced statement beginning with |verb| (an insert may be followed by a count).
  std::string LastStatement(const std::string& verb) {
    std::string last;
    for (const std::string& sql : surveyTrace.Take())
      if (sql.compare(0, verb.size(), verb) == 0) last = sql;
    return last;
  }
  long long StoredExtraLength() {
    return Number(survey, "SELECT length(extra) FROM use_app_feature_survey;");
  }
  BusRowLists Lists(size_t extraLength) {
    BusRowLists lists;
    EXPECT_EQ(AppendRowEntry(kColumns, "app_id", "a", &lists), 0);
    EXPECT_EQ(AppendRowEntry(kColumns, "extra", std::string(extraLength, 'e').c_str(), &lists), 0);
    return lists;
  }
};

// At the largest accepted size each statement is exactly 1023 bytes and runs whole; one byte
// more is refused.
TEST_F(ProviderBusFitTest, LargestAcceptedStatementsRunWholeAndOneMoreIsRefused) {
  BaseLogProvider* feature = Feature();
  auto insertFits = [&](const BusRowLists& lists) {
    return feature->InsertFits(lists.columns.c_str(), lists.values.c_str());
  };
  auto updateFits = [&](const BusRowLists& lists, const std::string& where) {
    return feature->UpdateFits(lists.columns.c_str(), lists.values.c_str(), where.c_str());
  };
  // ",<13-digit ms>,<zone literal>", as the provider appends them.
  std::string zone;
  ASSERT_TRUE(LocalZoneLiteral(&zone));
  const size_t autoValues = 1 + 13 + 1 + zone.size();

  size_t extra = 0;
  while (insertFits(Lists(extra + 1))) ++extra;
  ASSERT_GT(extra, 900u);
  ASSERT_EQ(Feature()->InsertRow(Lists(extra).columns.c_str(), Lists(extra).values.c_str()), 0);
  EXPECT_EQ(LastStatement("INSERT").size(), 1023u);
  EXPECT_EQ(StoredExtraLength(), static_cast<long long>(extra));

  // Update: the lists (with timestamp and time_zone) stay below 200 bytes.
  size_t value = 0;
  while (updateFits(Lists(value + 1), "1")) ++value;
  EXPECT_EQ(Lists(value).values.size() + autoValues, 199u);
  ASSERT_EQ(Feature()->UpdateRows(Lists(value).columns.c_str(), Lists(value).values.c_str(), "1"),
            0);
  EXPECT_EQ(StoredExtraLength(), static_cast<long long>(value));
  // ... and the where fills the statement up to its last byte.
  std::string where = "1";
  while (updateFits(Lists(10), where + " ")) where += " ";
  ASSERT_EQ(
      Feature()->UpdateRows(Lists(10).columns.c_str(), Lists(10).values.c_str(), where.c_str()), 0);
  EXPECT_EQ(LastStatement("UPDATE").size(), 1023u);

  std::string columns = "app_id";
  while (feature->SelectFits((columns + " ").c_str(), nullptr)) columns += " ";
  QueryRows rows;
  ASSERT_EQ(Feature()->SelectRows(columns.c_str(), nullptr, nullptr, &rows.count, &rows.rows), 0);
  EXPECT_EQ(LastStatement("SELECT").size(), 1023u);

  where = "0";
  while (feature->DeleteFits((where + " ").c_str())) where += " ";
  ASSERT_EQ(Feature()->DeleteRows(where.c_str()), 0);
  EXPECT_EQ(LastStatement("DELETE").size(), 1023u);
}

// The first |count| rows of "x,1," and "y,2,", owned as a select hands them out.
void TwoRowResult(int count, QueryRows* rows) {
  rows->Reset();
  if (count == 0) return;
  rows->rows = new char*[count];
  for (int i = 0; i < count; ++i) {
    rows->rows[i] = new char[5];
    memcpy(rows->rows[i], i == 0 ? "x,1," : "y,2,", 5);
  }
  rows->count = count;
}

TEST(ProviderBusGuardTest, SegmentIsWrittenOnlyWhenOwnedAndLargeEnoughThenDetached) {
  QueryRows rows;
  TwoRowResult(2, &rows);
  const char kResult[] = "x,1,\0y,2,\0&";
  ASSERT_EQ(SegmentBytes(rows), sizeof(kResult) - 1);
  struct Case {
    size_t size;
    uid_t owner;
    int rowCount;
    int result;
  } cases[] = {{11, getuid(), 2, 0},
               {10, getuid(), 2, -1},
               {1, getuid(), 0, 0},
               {1, getuid(), 1, -1},
               {4096, getuid() + 1, 2, -1}};
  for (const Case& c : cases) {
    SCOPED_TRACE("size " + std::to_string(c.size) + " rows " + std::to_string(c.rowCount));
    int id = shmget(IPC_PRIVATE, c.size, IPC_CREAT | 0600);
    ASSERT_NE(id, -1);
    QueryRows result;
    TwoRowResult(c.rowCount, &result);
    EXPECT_EQ(WriteRowsToSegment(id, c.owner, result), c.result);
    struct shmid_ds info;
    ASSERT_EQ(shmctl(id, IPC_STAT, &info), 0);
    EXPECT_EQ(info.shm_nattch, 0u);
    const char* base = static_cast<const char*>(shmat(id, nullptr, SHM_RDONLY));
    std::string content(base, c.size);
    std::string expected = c.result != 0     ? std::string(c.size, '\0')
                           : c.rowCount == 2 ? std::string(kResult, 11)
                                             : std::string("&");
    EXPECT_EQ(content, expected);
    shmdt(base);
    shmctl(id, IPC_RMID, nullptr);
  }
  EXPECT_EQ(WriteRowsToSegment(-1, getuid(), rows), -1);

  // A segment whose owner may not write it is refused, whoever could still attach it.
  int readOnly = shmget(IPC_PRIVATE, 64, IPC_CREAT | 0400);
  ASSERT_NE(readOnly, -1);
  EXPECT_EQ(SegmentRoom(readOnly, getuid()), 0u);
  EXPECT_EQ(WriteRowsToSegment(readOnly, getuid(), rows), -1);
  shmctl(readOnly, IPC_RMID, nullptr);

  // A hugetlb segment without reserve has no page to give where the pool is empty: writing it
  // by hand would end the process with SIGBUS; the write fails instead. Where the machine
  // does have free huge pages the write succeeds, which is fine too.
  int huge = shmget(IPC_PRIVATE, 2 << 20, IPC_CREAT | 0600 | SHM_HUGETLB | SHM_NORESERVE);
  if (huge == -1) GTEST_SKIP() << "no hugetlb segments here";
  EXPECT_EQ(SegmentRoom(huge, getuid()), size_t{2} << 20);
  int result = WriteRowsToSegment(huge, getuid(), rows);
  FILE* pool = fopen("/proc/sys/vm/nr_hugepages", "r");
  long pages = -1;
  if (pool != nullptr) {
    if (fscanf(pool, "%ld", &pages) != 1) pages = -1;
    fclose(pool);
  }
  if (pages == 0) {
    EXPECT_EQ(result, -1);
  }
  shmctl(huge, IPC_RMID, nullptr);
}

}  // namespace
}  // namespace _CorvaneLogManager
