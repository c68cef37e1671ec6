#include "provider_test_env.h"
#include "providers/survey_log_providers.h"

namespace _CorvaneLogManager {
namespace {

class BaseLogProviderTest : public ProviderTest {
 protected:
  void SetUp() override {
    ProviderTest::SetUp();
    StartProviders();
    useApp = Provider("use_app_survey");
    ASSERT_NE(useApp, nullptr);
  }
  BaseLogProvider* useApp = nullptr;
};

TEST_F(BaseLogProviderTest, InsertAppendsTimestampAndZoneOrLeavesZoneNull) {
  struct Case {
    const char* link;  // "" = no link
    const char* zone;  // nullptr = no time_zone column expected
  } cases[] = {
      {"/usr/share/zoneinfo/Europe/Berlin", "Europe/Berlin"},
      {"/usr/share/zoneinfo/X", "X"},            // 21 characters: one left after the prefix
      {"/usr/share/zoneinfo/", nullptr},         // exactly the prefix
      {"", nullptr},                             // link missing
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.link);
    SetLocaltimeLink(c.link);
    long long before = TestNowMs();
    int32_t rowId = 0;
    ASSERT_EQ(useApp->InsertRow("app_id,duration", "'com.example',12", &rowId), 0);
    long long after = TestNowMs();

    std::vector<std::string> run;
    for (const std::string& s : surveyTrace.Take())
      if (s.rfind("INSERT", 0) == 0) run.push_back(s);
    ASSERT_EQ(run.size(), 1u);
    std::string zonePart = c.zone ? std::string(",'") + c.zone + "'" : "";
    std::vector<long long> numbers;
    ASSERT_TRUE(MatchesWithNumbers(
        run[0],
        std::string("INSERT INTO use_app_survey(app_id,duration,timestamp") +
            (c.zone ? ",time_zone" : "") + ") VALUES ('com.example',12,#" + zonePart + ");",
        &numbers))
        << run[0];
    long long stamp = numbers[0];
    EXPECT_GE(stamp, before);
    EXPECT_LE(stamp, after);

    std::string where = " FROM use_app_survey WHERE _id=" + std::to_string(rowId);
    EXPECT_EQ(Scalar(survey, "SELECT timestamp" + where), stamp);
    EXPECT_EQ(Text(survey, "SELECT time_zone" + where), c.zone ? c.zone : "<null>");
  }
}

TEST_F(BaseLogProviderTest, RejectedListsRunNoStatement) {
  struct Case {
    const char* columns;
    const char* values;
  } cases[] = {
      {"app_id,size", "'a',1"},       // undeclared column
      {"app_id, duration", "'a',1"},  // blank after the comma is part of the name
      {"APP_ID", "'a'"},              // case-sensitive
      {"", "'a'"},
      {"app_id", ""},
      {",,,", "'a'"},  // no token at all
      {nullptr, "'a'"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.columns ? c.columns : "(null)");
    int32_t rowId = 77;
    EXPECT_EQ(useApp->InsertRow(c.columns, c.values, &rowId), -1);
    EXPECT_EQ(rowId, 77);
    int32_t changed = 77;
    EXPECT_EQ(useApp->UpdateRows(c.columns, c.values, "1=1", &changed), -1);
    EXPECT_EQ(changed, 77);
    EXPECT_TRUE(surveyTrace.Take().empty());
  }
  EXPECT_EQ(useApp->UpdateRows("app_id", "'a'", nullptr), -1);
  EXPECT_EQ(useApp->DeleteRows(nullptr), -1);
  EXPECT_TRUE(surveyTrace.Take().empty());
}

TEST_F(BaseLogProviderTest, UpdateQuotesBareValuesAndRefreshesAutoColumns) {
  ASSERT_EQ(useApp->InsertRow("app_id,duration", "'a',1"), 0);
  ASSERT_EQ(useApp->InsertRow("app_id,duration", "'b',2"), 0);
  (void)surveyTrace.Take();
  int32_t changed = 0;
  ASSERT_EQ(useApp->UpdateRows("duration,app_id", "5,'c'", "app_id = 'a'", &changed), 0);
  EXPECT_EQ(changed, 1);
  std::vector<std::string> run = surveyTrace.Take();
  ASSERT_EQ(run.size(), 1u);
  EXPECT_TRUE(MatchesWithNumbers(run[0],
                                 "UPDATE use_app_survey SET duration = '5',app_id = 'c',"
                                 "timestamp = '#',time_zone = 'Europe/Berlin' WHERE app_id = 'a';"))
      << run[0];
  EXPECT_EQ(Scalar(survey, "SELECT COUNT(*) FROM use_app_survey WHERE app_id='c' AND duration=5"),
            1);

  // A failing statement reports no changed rows.
  changed = 9;
  EXPECT_EQ(useApp->UpdateRows("duration", "1", "no_such_column = 1", &changed), -1);
  EXPECT_EQ(changed, 0);
}

TEST_F(BaseLogProviderTest, SelectPlacesGroupByBeforeOrderBy) {
  ASSERT_EQ(useApp->InsertRow("app_id,duration", "'a',1"), 0);
  ASSERT_EQ(useApp->InsertRow("app_id,duration", "'a',2"), 0);
  ASSERT_EQ(useApp->InsertRow("app_id,duration", "'b',4"), 0);
  (void)surveyTrace.Take();

  int rowCount = -1;
  char** rows = nullptr;
  ASSERT_EQ(useApp->SelectGroupedRows("app_id,SUM(duration)", "duration > 0", "app_id DESC",
                                      "app_id", &rowCount, &rows),
            0);
  ASSERT_EQ(rowCount, 2);
  EXPECT_STREQ(rows[0], "b,4,");
  EXPECT_STREQ(rows[1], "a,3,");
  for (int i = 0; i < rowCount; ++i) delete[] rows[i];
  delete[] rows;

  ASSERT_EQ(useApp->SelectRows(nullptr, nullptr, nullptr, &rowCount, &rows), 0);
  EXPECT_EQ(rowCount, 3);
  for (int i = 0; i < rowCount; ++i) delete[] rows[i];
  delete[] rows;

  std::vector<std::string> run = surveyTrace.Take();
  std::vector<std::string> selects;
  for (const std::string& s : run)
    if (s.rfind("SELECT", 0) == 0) selects.push_back(s);
  ASSERT_EQ(selects.size(), 2u);
  EXPECT_EQ(selects[0],
            "SELECT app_id,SUM(duration) FROM use_app_survey WHERE duration > 0 GROUP BY app_id "
            "ORDER BY app_id DESC;");
  EXPECT_EQ(selects[1], "SELECT * FROM use_app_survey;");
}

TEST_F(BaseLogProviderTest, OnlyTheInsertThatWrapsTheCounterTrimsTheOldest) {
  Fill("use_app_survey", "app_id,duration,timestamp", "'old',1,1", 5000);
  // The counter is seeded from the row count, as at a restart: 5000 % 500 = 0.
  ASSERT_EQ(useApp->Initialize(), 0);
  long long firstId = Scalar(survey, "SELECT MIN(_id) FROM use_app_survey");
  (void)surveyTrace.Take();

  ASSERT_EQ(useApp->InsertRow("app_id,duration", "'new',1"), 0);
  std::vector<std::string> run = surveyTrace.Take();
  ASSERT_EQ(run.size(), 3u);
  EXPECT_EQ(run[1], "select COUNT(*) from use_app_survey");
  EXPECT_EQ(run[2],
            "DELETE FROM use_app_survey WHERE _id < (SELECT MIN(_id) FROM use_app_survey) + 500;");
  EXPECT_EQ(Scalar(survey, "SELECT MIN(_id) FROM use_app_survey"), firstId + 500);
  EXPECT_EQ(Scalar(survey, "SELECT COUNT(*) FROM use_app_survey"), 4501);

  // The next 499 inserts never count rows; the 500th counts again and, at 5001 rows, trims.
  for (int i = 0; i < 499; ++i) ASSERT_EQ(useApp->InsertRow("app_id,duration", "'n',1"), 0);
  run = surveyTrace.Take();
  for (const std::string& s : run) EXPECT_EQ(s.rfind("INSERT", 0), 0u) << s;
  ASSERT_EQ(run.size(), 499u);
  ASSERT_EQ(useApp->InsertRow("app_id,duration", "'n',1"), 0);
  run = surveyTrace.Take();
  ASSERT_EQ(run.size(), 3u);
  EXPECT_EQ(run[1], "select COUNT(*) from use_app_survey");
  EXPECT_EQ(Scalar(survey, "SELECT MIN(_id) FROM use_app_survey"), firstId + 1000);
  EXPECT_EQ(Scalar(survey, "SELECT COUNT(*) FROM use_app_survey"), 4501);
}

TEST_F(BaseLogProviderTest, ExpiryKeepsStatusTenDaysAndTheRestThree) {
  const long long day = 86400000LL;
  const long long hour = 3600000LL;
  const char* tables[] = {"use_app_survey", "manage_app_survey", "report_app_error_survey",
                          "use_app_feature_survey", "report_app_status_survey"};
  long long now = TestNowMs();
  for (const char* table : tables) {
    for (long long age : {3 * day - hour, 3 * day + hour, 10 * day - hour, 10 * day + hour})
      Fill(table, "timestamp", std::to_string(now - age), 1);
  }
  ASSERT_EQ(DbManager::GetInstance()->NotifyDeleteExpired(), 0);
  for (const char* table : tables) {
    SCOPED_TRACE(table);
    long long keptDays = std::string(table) == "report_app_status_survey" ? 10 : 3;
    std::string from = std::string(" FROM ") + table;
    EXPECT_EQ(Scalar(survey, "SELECT COUNT(*)" + from), keptDays == 10 ? 3 : 1);
    EXPECT_GE(Scalar(survey, "SELECT MIN(timestamp)" + from), now - keptDays * day);
  }
}

TEST_F(BaseLogProviderTest, OneStepStatementsAreCutAtTheBuffer) {
  std::string longValue = "'" + std::string(2000, 'v') + "'";
  int32_t rowId = 0;
  EXPECT_EQ(useApp->InsertRow("app_id", longValue.c_str(), &rowId), -1);
  EXPECT_EQ(rowId, -1);
  EXPECT_EQ(useApp->DeleteRows(std::string(2000, ' ').append("1=1").c_str()), -1);
  // Cut statements are incomplete SQL and never reach SQLite's trace; nothing was written.
  EXPECT_EQ(Scalar(survey, "SELECT COUNT(*) FROM use_app_survey"), 0);
}

// Select clauses and list copies that would not fit end the process instead of overflowing.
using BaseLogProviderDeathTest = BaseLogProviderTest;

TEST_F(BaseLogProviderDeathTest, ListsAndAppendedClausesAtTheirBounds) {
  // "SELECT * FROM use_app_survey WHERE " is 35 characters, ";" one more: 987 fits in 1024.
  std::string where = std::string(984, ' ') + "1=1";
  int rowCount = -1;
  char** rows = nullptr;
  EXPECT_EQ(useApp->SelectRows(nullptr, where.c_str(), nullptr, &rowCount, &rows), 0);
  EXPECT_EQ(rowCount, 0);
  where.insert(0, " ");
  EXPECT_DEATH(useApp->SelectRows(nullptr, where.c_str(), nullptr, &rowCount, &rows), "");

  // Column lists: 199 characters are copied (and rejected), 200 are fatal.
  std::string columns = "app_id" + std::string(193, 'x');
  EXPECT_EQ(useApp->InsertRow(columns.c_str(), "1"), -1);
  columns += "x";
  EXPECT_DEATH(useApp->InsertRow(columns.c_str(), "1"), "");

  // The update copies the lists after ",timestamp,time_zone" (20 characters) is appended:
  // a 179-character list still fits, 180 does not.
  std::string fits;
  for (int i = 0; i < 45; ++i) fits += (i ? ",_id" : "_id");
  ASSERT_EQ(fits.size(), 179u);
  EXPECT_EQ(useApp->UpdateRows(fits.c_str(), "1", "0"), 0);
  std::string over = fits.substr(0, 171) + ",duration";
  ASSERT_EQ(over.size(), 180u);
  EXPECT_DEATH(useApp->UpdateRows(over.c_str(), "1", "0"), "");
}

}  // namespace
}  // namespace _CorvaneLogManager
