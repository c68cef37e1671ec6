// Host aul and pkgmgr-info over the app database they keep open. This test process itself is
// the app being looked up.
#include <aul.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <pkgmgr-info.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <unistd.h>

#include <string>

#include "tests/sqlite_rows.h"
#include "tests/temp_sysroot.h"

namespace {

class AppDbTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(system(("mkdir -p '" + sysroot + "/opt/dbspace'").c_str()), 0);
    db = sysroot + "/opt/dbspace/.pkgmgr_parser.db";
    char exe[PATH_MAX];
    ssize_t n = readlink("/proc/self/exe", exe, sizeof(exe) - 1);
    ASSERT_GT(n, 0);
    self.assign(exe, static_cast<size_t>(n));
  }
  static int Exec(sqlite3* conn, const std::string& sql) {
    return sqlite3_exec(conn, sql.c_str(), nullptr, nullptr, nullptr);
  }

  // A new database at |path|, holding this process as |app| of |package|.
  void Create(const std::string& path, const std::string& app, const std::string& package,
              bool index = false) {
    sqlite3* conn = nullptr;
    ASSERT_EQ(sqlite3_open(path.c_str(), &conn), SQLITE_OK);
    ASSERT_EQ(Exec(conn, std::string("CREATE TABLE package_app_info(app_id TEXT PRIMARY KEY, "
                                     "package TEXT NOT NULL, app_exec TEXT NOT NULL);") +
                             (index ? "CREATE INDEX package_app_info_exec ON "
                                      "package_app_info(app_exec);"
                                    : "") +
                             "INSERT INTO package_app_info VALUES ('" + app + "','" + package +
                             "','" + self + "')"),
              SQLITE_OK);
    sqlite3_close(conn);
  }

  // "app/package" of this process as aul sees it, or "error".
  static std::string Self() {
    char app[256], package[256];
    if (aul_app_get_appid_bypid(getpid(), app, sizeof(app)) != AUL_R_OK ||
        aul_app_get_pkgid_bypid(getpid(), package, sizeof(package)) != AUL_R_OK)
      return "error";
    return std::string(app) + "/" + package;
  }

  // The package pkgmgr-info gives for |app|, or "error".
  static std::string PackageOf(const char* app) {
    pkgmgrinfo_appinfo_h info = nullptr;
    char* package = nullptr;
    std::string out = "error";
    if (pkgmgrinfo_appinfo_get_appinfo(app, &info) == PMINFO_R_OK &&
        pkgmgrinfo_appinfo_get_pkgid(info, &package) == PMINFO_R_OK)
      out = package;
    if (info != nullptr) (void)pkgmgrinfo_appinfo_destroy_appinfo(info);
    return out;
  }

  // App ids filtered by executable, in the order given, or "error".
  static std::string AppsOf(const std::string& exec) {
    pkgmgrinfo_appinfo_filter_h filter = nullptr;
    std::string out;
    int count = -1;
    if (pkgmgrinfo_appinfo_filter_create(&filter) != PMINFO_R_OK) return "error";
    bool ok = pkgmgrinfo_appinfo_filter_add_string(filter, PMINFO_APPINFO_PROP_APP_EXEC,
                                                   exec.c_str()) == PMINFO_R_OK &&
              pkgmgrinfo_appinfo_filter_count(filter, &count) == PMINFO_R_OK &&
              pkgmgrinfo_appinfo_filter_foreach_appinfo(
                  filter,
                  [](const pkgmgrinfo_appinfo_h app, void* data) {
                    char* id = nullptr;
                    (void)pkgmgrinfo_appinfo_get_appid(app, &id);
                    *static_cast<std::string*>(data) += std::string(id) + ";";
                    return 0;
                  },
                  &out) == PMINFO_R_OK;
    (void)pkgmgrinfo_appinfo_filter_destroy(filter);
    return ok ? std::to_string(count) + ":" + out : "error";
  }

  TempSysroot tmp{"appdb"};
  const std::string sysroot = tmp.path();
  std::string db, self;
};

TEST_F(AppDbTest, AnswersFollowTheFileReplacedOrWrittenInPlace) {
  Create(db, "com.ex.first", "pkg.first");
  EXPECT_EQ(Self(), "com.ex.first/pkg.first");
  EXPECT_EQ(PackageOf("com.ex.first"), "pkg.first");

  // A tool writes a new file beside it and renames it over the old one.
  Create(db + ".new", "com.ex.second", "pkg.second");
  ASSERT_EQ(rename((db + ".new").c_str(), db.c_str()), 0);
  EXPECT_EQ(Self(), "com.ex.second/pkg.second");
  EXPECT_EQ(PackageOf("com.ex.first"), "error");
  EXPECT_EQ(PackageOf("com.ex.second"), "pkg.second");

  sqlite3* writer = nullptr;
  ASSERT_EQ(sqlite3_open(db.c_str(), &writer), SQLITE_OK);
  // In place through the rollback journal.
  ASSERT_EQ(Exec(writer, "UPDATE package_app_info SET package = 'pkg.third'"), SQLITE_OK);
  EXPECT_EQ(Self(), "com.ex.second/pkg.third");
  // In place through a WAL log: with the writer still open, the main file stays as it was.
  ASSERT_EQ(Exec(writer, "PRAGMA journal_mode=WAL"), SQLITE_OK);
  ASSERT_EQ(FileRows(db, "PRAGMA journal_mode"), "wal;");
  EXPECT_EQ(Self(), "com.ex.second/pkg.third");
  ASSERT_EQ(Exec(writer, "UPDATE package_app_info SET package = 'pkg.fourth'"), SQLITE_OK);
  EXPECT_EQ(Self(), "com.ex.second/pkg.fourth");
  ASSERT_EQ(Exec(writer, "UPDATE package_app_info SET app_id = 'com.ex.fifth'"), SQLITE_OK);
  EXPECT_EQ(Self(), "com.ex.fifth/pkg.fourth");
  EXPECT_EQ(PackageOf("com.ex.second"), "error");
  sqlite3_close(writer);

  // Gone, then back as something that is no database.
  ASSERT_EQ(system(("rm -f '" + db + "' '" + db + "-wal' '" + db + "-shm'").c_str()), 0);
  EXPECT_EQ(Self(), "error");
  ASSERT_EQ(system(("echo garbage > '" + db + "'").c_str()), 0);
  EXPECT_EQ(Self(), "error");
  EXPECT_EQ(PackageOf("com.ex.fifth"), "error");
}

TEST_F(AppDbTest, ExecutableLookupsAgreeWithAndWithoutTheIndex) {
  for (bool index : {false, true}) {
    SCOPED_TRACE(index ? "with the index" : "without");
    std::string path = sysroot + (index ? "/indexed" : "/plain");
    ASSERT_EQ(system(("mkdir -p '" + path + "/opt/dbspace'").c_str()), 0);
    setenv("LOGMGR_SYSROOT", path.c_str(), 1);
    std::string file = path + "/opt/dbspace/.pkgmgr_parser.db";
    Create(file, "z.self", "pkg.self", index);
    sqlite3* conn = nullptr;
    ASSERT_EQ(sqlite3_open(file.c_str(), &conn), SQLITE_OK);
    std::string sql = "BEGIN;";
    for (int i = 0; i < 300; ++i)
      sql += "INSERT INTO package_app_info VALUES ('com.ex.app" + std::to_string(i) +
             "','pkg.app','/opt/usr/apps/app" + std::to_string(i) + "/bin/app');";
    // A second app of the same executable, installed later: it comes second.
    sql += "INSERT INTO package_app_info VALUES ('a.also', 'pkg.self', '" + self + "'); COMMIT;";
    ASSERT_EQ(Exec(conn, sql), SQLITE_OK);
    sqlite3_close(conn);
    std::string plan = FileRows(file,
                                "EXPLAIN QUERY PLAN SELECT app_id, package, app_exec FROM "
                                "package_app_info WHERE app_exec = 'x' ORDER BY rowid");
    EXPECT_EQ(plan.find("USING INDEX package_app_info_exec") != std::string::npos, index) << plan;

    EXPECT_EQ(Self(), "z.self/pkg.self");
    EXPECT_EQ(AppsOf(self), "2:z.self;a.also;");
    EXPECT_EQ(AppsOf("/opt/usr/apps/app7/bin/app"), "1:com.ex.app7;");
    EXPECT_EQ(AppsOf("/opt/usr/apps/app7/bin"), "0:");
    EXPECT_EQ(PackageOf("com.ex.app299"), "pkg.app");
  }
}

}  // namespace
