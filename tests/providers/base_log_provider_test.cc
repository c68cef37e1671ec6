#include "tests/providers/provider_test_env.h"
#include "tests/sqlite_rows.h"

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
  std::vector<std::string> Taken(const char* prefix) {
    std::vector<std::string> out;
    for (const std::string& s : surveyTrace.Take())
      if (s.rfind(prefix, 0) == 0) out.push_back(s);
    return out;
  }
  BaseLogProvider* useApp = nullptr;
};

TEST_F(BaseLogProviderTest, InsertAppendsTimestampAndZoneOrLeavesZoneNull) {
  // The link's name after /usr/share/zoneinfo/ (nullptr: no link); "X" leaves one character after
  // the prefix, a quote is stored as it stands, and an empty name gives no zone.
  for (const char* name :
       {"Europe/Berlin", "X", "", static_cast<const char*>(nullptr), "O'Hare", "Europe/Berlin"}) {
    SCOPED_TRACE(name ? name : "(no link)");
    SetLocaltimeLink(name ? std::string("/usr/share/zoneinfo/") + name : "");
    const char* zone = name && *name ? name : nullptr;
    long long before = WallClockMs();
    int32_t rowId = 0;
    ASSERT_EQ(useApp->InsertRow("app_id,duration", "'com.example',12", &rowId), 0);
    long long after = WallClockMs();
    std::vector<std::string> run = Taken("INSERT");
    ASSERT_EQ(run.size(), 1u);
    std::vector<long long> stamp;
    ASSERT_TRUE(MatchesWithNumbers(
        run[0],
        std::string("INSERT INTO use_app_survey(app_id,duration,timestamp") +
            (zone ? ",time_zone) VALUES ('com.example',12,#," + SqlQuoted(zone) + ");"
                  : ") VALUES ('com.example',12,#);"),
        &stamp))
        << run[0];
    EXPECT_GE(stamp[0], before);
    EXPECT_LE(stamp[0], after);
    std::string where = " FROM use_app_survey WHERE _id=" + std::to_string(rowId);
    EXPECT_EQ(Number(survey, "SELECT timestamp" + where), stamp[0]);
    EXPECT_EQ(Query(survey, "SELECT time_zone" + where), zone ? zone : "<null>");
  }
}

TEST_F(BaseLogProviderTest, RejectedListsRunNoStatement) {
  const char* cases[][2] = {{"app_id,size", "'a',1"},       // undeclared
                            {"app_id, duration", "'a',1"},  // the blank belongs to the name
                            {"APP_ID", "'a'"},              // case-sensitive
                            {"", "'a'"},
                            {"app_id", ""},
                            {",,,", "'a'"},  // no token at all
                            {nullptr, "'a'"}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c[0] ? c[0] : "(null)");
    int32_t out = 77;
    EXPECT_EQ(useApp->InsertRow(c[0], c[1], &out), -1);
    EXPECT_EQ(useApp->UpdateRows(c[0], c[1], "1=1", &out), -1);
    EXPECT_EQ(out, 77);
  }
  EXPECT_EQ(useApp->UpdateRows("app_id", "'a'", nullptr), -1);
  EXPECT_EQ(useApp->DeleteRows(nullptr), -1);
  EXPECT_TRUE(surveyTrace.Take().empty());
}

TEST_F(BaseLogProviderTest, UpdateQuotesBareValuesAndSelectGroupsBeforeOrdering) {
  Fill(survey, "use_app_survey", "app_id,duration", "'a',1", 1);
  int32_t changed = 0;
  ASSERT_EQ(useApp->UpdateRows("duration,app_id", "5,'c'", "app_id = 'a'", &changed), 0);
  EXPECT_EQ(changed, 1);
  std::vector<std::string> run = surveyTrace.Take();
  ASSERT_EQ(run.size(), 1u);
  EXPECT_TRUE(MatchesWithNumbers(run[0],
                                 "UPDATE use_app_survey SET duration = '5',app_id = 'c',"
                                 "timestamp = '#',time_zone = 'Europe/Berlin' WHERE app_id = 'a';"))
      << run[0];
  changed = 9;  // a failing statement reports no changed rows
  EXPECT_EQ(useApp->UpdateRows("duration", "1", "no_such_column = 1", &changed), -1);
  EXPECT_EQ(changed, 0);

  Fill(survey, "use_app_survey", "app_id,duration", "'b',4", 2);
  QueryRows rows;
  ASSERT_EQ(useApp->SelectGroupedRows("app_id,SUM(duration)", "duration > 0", "app_id DESC",
                                      "app_id", &rows.count, &rows.rows),
            0);
  ASSERT_EQ(rows.count, 2);
  EXPECT_EQ(std::string(rows[0]) + rows[1], "c,5,b,8,");
  rows.Reset();
  ASSERT_EQ(useApp->SelectRows(nullptr, nullptr, nullptr, &rows.count, &rows.rows), 0);
  EXPECT_EQ(rows.count, 3);
  EXPECT_EQ(Taken("SELECT"),
            (std::vector<std::string>{"SELECT app_id,SUM(duration) FROM use_app_survey WHERE "
                                      "duration > 0 GROUP BY app_id ORDER BY app_id DESC;",
                                      "SELECT * FROM use_app_survey;"}));
}

TEST_F(BaseLogProviderTest, OnlyTheInsertThatWrapsTheCounterTrimsTheOldest) {
  Fill(survey, "use_app_survey", "app_id,duration,timestamp", "'old',1,1", 5000);
  ASSERT_EQ(useApp->Initialize(), 0);  // seeded as at a restart: 5000 % 500
  long long firstId = Number(survey, "SELECT MIN(_id) FROM use_app_survey");
  (void)surveyTrace.Take();
  for (int round = 1; round <= 2; ++round) {
    SCOPED_TRACE(round);
    ASSERT_EQ(useApp->InsertRow("app_id,duration", "'new',1"), 0);
    std::vector<std::string> run = surveyTrace.Take();
    ASSERT_EQ(run.size(), 3u);
    EXPECT_EQ(run[1], "select COUNT(*) from use_app_survey");
    EXPECT_EQ(run[2],
              "DELETE FROM use_app_survey WHERE _id < (SELECT MIN(_id) FROM "
              "use_app_survey) + 500;");
    EXPECT_EQ(Number(survey, "SELECT MIN(_id) FROM use_app_survey"), firstId + 500 * round);
    EXPECT_EQ(Number(survey, "SELECT COUNT(*) FROM use_app_survey"), 4501);
    // The next 499 inserts never count rows; the one after wraps the counter again.
    for (int i = 0; i < 499; ++i) ASSERT_EQ(useApp->InsertRow("app_id,duration", "'n',1"), 0);
    EXPECT_EQ(Taken("INSERT").size(), 499u);
    EXPECT_TRUE(surveyTrace.Take().empty());
  }
}

TEST_F(BaseLogProviderTest, ExpiryKeepsStatusTenDaysAndTheRestThree) {
  const long long day = 86400000LL, hour = 3600000LL;
  const char* tables[] = {"use_app_survey", "manage_app_survey", "report_app_error_survey",
                          "use_app_feature_survey", "report_app_status_survey"};
  long long now = WallClockMs();
  for (const char* table : tables)
    for (long long age : {3 * day - hour, 3 * day + hour, 10 * day - hour, 10 * day + hour})
      Fill(survey, table, "timestamp", std::to_string(now - age), 1);
  ASSERT_EQ(DbManager::GetInstance()->NotifyDeleteExpired(), 0);
  for (const char* table : tables) {
    SCOPED_TRACE(table);
    long long keptDays = std::string(table) == "report_app_status_survey" ? 10 : 3;
    std::string from = std::string(" FROM ") + table;
    EXPECT_EQ(Number(survey, "SELECT COUNT(*)" + from), keptDays == 10 ? 3 : 1);
    EXPECT_GE(Number(survey, "SELECT MIN(timestamp)" + from), now - keptDays * day);
  }
}

// A plain-literal insert runs from a kept statement with its values bound; what it stores and
// answers must be what the text statement stores and answers: each value with the same type
// after the column's affinity, the same row id, the same failures.
TEST_F(BaseLogProviderTest, KeptInsertsStoreAndAnswerAsTheTextWould) {
  sqlite3* raw = nullptr;  // the text statement, on a connection of its own
  ASSERT_EQ(sqlite3_open((sysroot + "/opt/usr/dbspace/.SurveyLog.db").c_str(), &raw), SQLITE_OK);
  auto stored = [&](long long id) {
    return Query(survey,
                 "SELECT typeof(app_id)||':'||quote(app_id)||'|'||typeof(duration)||':'"
                 "||quote(duration) FROM use_app_survey WHERE _id=" +
                     std::to_string(id));
  };
  const char* values[] = {
      "'com.example',12", "'12',' 34'", "'x''y''', -0", " NULL , '7' ", "'a',123456789012345678",
      "'a',-987654321", "'a','3.0'", "'\xC3\xA9\xFF',null", "'',''", "007,8", "-0,-0",
      "NULL,NULL",  // into the text column: numbers as SQLite writes them
      // Not plain literals: the text path stores them.
      "'a',1234567890123456789", "'a',99999999999999999999", "'a',1.5", "'a',0x10", "'a',1e3",
      "'a',-'3'", "'a',+4", "'a'||'b',1", "'a' 'b',1", "\"a\",1", "'a',X'41'", "'a',1_000"};
  for (const char* v : values) {
    SCOPED_TRACE(v);
    int32_t rowId = 0;
    int result = useApp->InsertRow("app_id,duration", v, &rowId);
    std::string text =
        std::string("INSERT INTO use_app_survey(app_id,duration) VALUES (") + v + ");";
    int rawResult = sqlite3_exec(raw, text.c_str(), nullptr, nullptr, nullptr);
    ASSERT_EQ(result, rawResult == SQLITE_OK ? 0 : -1);
    if (result != 0) continue;
    EXPECT_EQ(rowId, survey->LastInsertRowId());
    EXPECT_EQ(survey->Changes(), 1);
    EXPECT_EQ(stored(rowId), stored(sqlite3_last_insert_rowid(raw)));
  }
  bool kept = false;
  for (sqlite3_stmt* s = sqlite3_next_stmt(survey->Handle(), nullptr); s != nullptr;
       s = sqlite3_next_stmt(survey->Handle(), s)) {
    kept = kept || std::string(sqlite3_sql(s)) ==
                       "INSERT INTO use_app_survey(app_id,duration,timestamp,time_zone) "
                       "VALUES (?,?,?,?);";
  }
  EXPECT_TRUE(kept) << "the plain inserts must have run from a kept statement";

  // Failures answer as the text's do: no row id, nothing stored. "columns|values" each.
  long long rows = Number(survey, "SELECT count(*) FROM use_app_survey");
  for (std::string f : {"_id,app_id|'x','a'", "_id,app_id|1,'a'", "app_id,duration|'a'",
                        "app_id|'a',1", "app_id|'a"}) {
    int32_t rowId = 0;
    size_t bar = f.find('|');
    EXPECT_EQ(useApp->InsertRow(f.substr(0, bar).c_str(), f.substr(bar + 1).c_str(), &rowId), -1)
        << f;
    EXPECT_EQ(rowId, -1);
  }
  EXPECT_EQ(Number(survey, "SELECT count(*) FROM use_app_survey"), rows);

  // Around the 1024-byte buffer: a whole text, one cut at its ";" (still a statement), and one
  // cut inside its literal (none).
  std::string fixed =
      "INSERT INTO use_app_survey(app_id,timestamp,time_zone) VALUES ('',"
      "1234567890123,'Europe/Berlin');";
  for (size_t length : {size_t{1023}, size_t{1024}, size_t{1025}}) {
    SCOPED_TRACE(length);
    std::string app(length - fixed.size(), 'v');
    int32_t rowId = 0;
    int result = useApp->InsertRow("app_id", ("'" + app + "'").c_str(), &rowId);
    EXPECT_EQ(result, length < 1025 ? 0 : -1);
    if (result == 0) {
      EXPECT_EQ(
          Query(survey, "SELECT app_id FROM use_app_survey WHERE _id=" + std::to_string(rowId)),
          app);
    }
  }
  sqlite3_close(raw);
}

// One-step statements are cut by the buffer; lists and appended clauses that would not fit
// end the process before anything is written past a buffer.
using BaseLogProviderDeathTest = BaseLogProviderTest;

TEST_F(BaseLogProviderDeathTest, BuffersAtAndPastTheirBounds) {
  int32_t rowId = 0;
  EXPECT_EQ(useApp->InsertRow("app_id", ("'" + std::string(2000, 'v') + "'").c_str(), &rowId), -1);
  EXPECT_EQ(rowId, -1);
  EXPECT_EQ(useApp->DeleteRows((std::string(2000, ' ') + "1=1").c_str()), -1);
  EXPECT_EQ(Number(survey, "SELECT COUNT(*) FROM use_app_survey"), 0);

  // "SELECT * FROM use_app_survey WHERE " is 35 characters and ";" one more: 987 fit.
  std::string where = std::string(984, ' ') + "1=1";
  int rowCount = -1;
  char** rows = nullptr;
  EXPECT_EQ(useApp->SelectRows(nullptr, where.c_str(), nullptr, &rowCount, &rows), 0);
  EXPECT_DEATH(useApp->SelectRows(nullptr, (" " + where).c_str(), nullptr, &rowCount, &rows), "");

  // Column lists: 199 characters are copied (and rejected), 200 are fatal.
  std::string columns = "app_id" + std::string(193, 'x');
  EXPECT_EQ(useApp->InsertRow(columns.c_str(), "1"), -1);
  EXPECT_DEATH(useApp->InsertRow((columns + "x").c_str(), "1"), "");

  // An update copies the lists after ",timestamp,time_zone" (20 characters) is appended.
  std::string fits = "_id";
  for (int i = 1; i < 45; ++i) fits += ",_id";
  ASSERT_EQ(fits.size(), 179u);
  EXPECT_EQ(useApp->UpdateRows(fits.c_str(), "1", "0"), 0);
  std::string over = fits.substr(0, 171) + ",duration";
  ASSERT_EQ(over.size(), 180u);
  EXPECT_DEATH(useApp->UpdateRows(over.c_str(), "1", "0"), "");
}

}  // namespace
}  // namespace _CorvaneLogManager
