// The checks in front of the shared tables: they must agree byte for byte with the statements
// the providers build.
#include "providers/provider_bus_guard.h"

#include <gtest/gtest.h>

#include "providers/local_zone.h"
#include "tests/providers/provider_test_env.h"

namespace _CorvaneLogManager {
namespace {

const std::vector<std::string> kColumns = {"_id",     "timestamp", "time_zone", "app_id",
                                           "feature", "extra",     "value"};

TEST(ProviderBusGuardTest, RowEntriesAcceptOnlyWritableColumnsAndQuotelessValues) {
  // "key=value"; an _id is decimal digits only, 1 to 2^53.
  // clang-format off
  const std::vector<std::string> accepted = {
      "app_id=a", "_id=4", "_id=9007199254740992", "_id=009", "extra=x, y"};
  const std::vector<std::string> refused = {
      "_id=9007199254740993", "_id=9223372036854775807", "_id=99999999999999999999999999",
      "_id=0", "_id=-1", "_id=1e3", "_id= 7", "_id=7 ", "_id=", "timestamp=1", "time_zone=Z",
      "bogus=1", "app_id =a", "extra=it's", "(SELECT 1)=1"};
  // clang-format on
  for (const auto* cases : {&accepted, &refused}) {
    for (const std::string& entry : *cases) {
      SCOPED_TRACE(entry);
      const std::string key = entry.substr(0, entry.find('='));
      const std::string value = entry.substr(entry.find('=') + 1);
      BusRowLists lists{"feature", "'F'"};
      bool ok = cases == &accepted;
      EXPECT_EQ(AppendRowEntry(kColumns, key.c_str(), value.c_str(), &lists), ok ? 0 : -1);
      EXPECT_EQ(lists.columns, ok ? "feature," + key : "feature");
      EXPECT_EQ(lists.values, ok ? "'F','" + value + "'" : "'F'");
      EXPECT_EQ(lists.valueHasComma, ok && value.find(',') != std::string::npos);
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

}  // namespace
}  // namespace _CorvaneLogManager
