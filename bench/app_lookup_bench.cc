// What one window activation costs the app usage monitor before any row is written: the
// application of a pid (aul: /proc/<pid>/exe, then the app database by executable) and its
// package (pkgmgr-info by app id), with 10 and 1,000 installed apps. The floor it is compared
// with is the readlink of /proc/<pid>/exe alone.
#include <aul.h>
#include <benchmark/benchmark.h>
#include <limits.h>
#include <pkgmgr-info.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <unistd.h>

#include <string>

namespace {

std::string g_sysroot;

// An app database of |apps| apps, the last of which is this very process.
void WriteAppDb(int apps) {
  char self[PATH_MAX];
  ssize_t n = readlink("/proc/self/exe", self, sizeof(self) - 1);
  if (n <= 0) abort();
  self[n] = '\0';
  sqlite3* db = nullptr;
  std::string path = g_sysroot + "/opt/dbspace/.pkgmgr_parser.db";
  unlink(path.c_str());
  if (sqlite3_open(path.c_str(), &db) != SQLITE_OK) abort();
  std::string sql =
      "BEGIN; CREATE TABLE package_app_info(app_id TEXT PRIMARY KEY, package TEXT NOT NULL, "
      "app_exec TEXT NOT NULL);";
  for (int i = 0; i < apps - 1; ++i) {
    std::string id = "com.example.app" + std::to_string(i);
    sql += "INSERT INTO package_app_info VALUES ('" + id + "','" + id + "','/opt/usr/apps/" + id +
           "/bin/app');";
  }
  sql += std::string("INSERT INTO package_app_info VALUES ('com.example.self','pkg.self','") +
         self + "'); COMMIT;";
  if (sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr) != SQLITE_OK) abort();
  sqlite3_close(db);
}

void BM_ReadlinkFloor(benchmark::State& state) {
  char buf[PATH_MAX];
  for (auto _ : state) benchmark::DoNotOptimize(readlink("/proc/self/exe", buf, sizeof(buf)));
}

void BM_ActivationLookups(benchmark::State& state) {
  WriteAppDb(static_cast<int>(state.range(0)));
  char appId[512];
  for (auto _ : state) {
    if (aul_app_get_appid_bypid(getpid(), appId, sizeof(appId)) != AUL_R_OK) abort();
    pkgmgrinfo_appinfo_h info = nullptr;
    char* pkgid = nullptr;
    if (pkgmgrinfo_appinfo_get_appinfo(appId, &info) != PMINFO_R_OK ||
        pkgmgrinfo_appinfo_get_pkgid(info, &pkgid) != PMINFO_R_OK)
      abort();
    benchmark::DoNotOptimize(pkgid);
    (void)pkgmgrinfo_appinfo_destroy_appinfo(info);
  }
}

BENCHMARK(BM_ReadlinkFloor);
BENCHMARK(BM_ActivationLookups)->Arg(10)->Arg(1000);

}  // namespace

int main(int argc, char** argv) {
  char tmpl[] = "/tmp/logmgr-bench-apps-XXXXXX";
  if (mkdtemp(tmpl) == nullptr) return 1;
  g_sysroot = tmpl;
  if (system(("mkdir -p '" + g_sysroot + "/opt/dbspace'").c_str()) != 0) return 1;
  setenv("LOGMGR_SYSROOT", g_sysroot.c_str(), 1);
  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return system(("rm -rf '" + g_sysroot + "'").c_str()) == 0 ? 0 : 1;
}
