// What one window activation costs the app usage monitor before any row is written: the
// application of a pid (aul: /proc/<pid>/exe, then the app database by executable) and its
// package (pkgmgr-info by app id), with 10 and 1,000 installed apps, with the app_exec index the
// package tools create and without it (a file written before they did), and with the database
// changed before every activation (each one then reads the file afresh). The floor is the
// readlink of /proc/<pid>/exe alone, timed interleaved with the lookups: each round times a
// batch of readlinks, then a batch of activations, so machine load falls on both.
#include <aul.h>
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <limits.h>
#include <pkgmgr-info.h>
#include <sqlite3.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <string>

#include "tests/temp_sysroot.h"

namespace {

const int kBatch = 32;
std::string g_sysroot;

// An app database of |apps| apps, the last of which is this very process.
void WriteAppDb(int apps, bool index) {
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
  if (index) sql += "CREATE INDEX package_app_info_exec ON package_app_info(app_exec);";
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

// What the monitor asks on an activation.
void Activate() {
  char appId[512];
  if (aul_app_get_appid_bypid(getpid(), appId, sizeof(appId)) != AUL_R_OK) abort();
  pkgmgrinfo_appinfo_h info = nullptr;
  char* pkgid = nullptr;
  if (pkgmgrinfo_appinfo_get_appinfo(appId, &info) != PMINFO_R_OK ||
      pkgmgrinfo_appinfo_get_pkgid(info, &pkgid) != PMINFO_R_OK)
    abort();
  benchmark::DoNotOptimize(pkgid);
  (void)pkgmgrinfo_appinfo_destroy_appinfo(info);
}

double Since(std::chrono::steady_clock::time_point start) {
  return std::chrono::duration<double, std::nano>(std::chrono::steady_clock::now() - start).count();
}

// Arguments: installed apps; index (1) or not (0); whether the database changed (its time
// stamp touched, untimed) before each activation, so that each one reads the file afresh.
void BM_ActivationVsReadlink(benchmark::State& state) {
  WriteAppDb(static_cast<int>(state.range(0)), state.range(1) != 0);
  const bool changed = state.range(2) != 0;
  const std::string db = g_sysroot + "/opt/dbspace/.pkgmgr_parser.db";
  char buf[PATH_MAX];
  double floorNs = 0, lookupNs = 0;
  for (auto _ : state) {
    auto start = std::chrono::steady_clock::now();
    for (int i = 0; i < kBatch; ++i)
      benchmark::DoNotOptimize(readlink("/proc/self/exe", buf, sizeof(buf)));
    floorNs += Since(start);
    if (changed) {
      for (int i = 0; i < kBatch; ++i) {
        if (utimensat(AT_FDCWD, db.c_str(), nullptr, 0) != 0) abort();
        start = std::chrono::steady_clock::now();
        Activate();
        lookupNs += Since(start);
      }
    } else {
      start = std::chrono::steady_clock::now();
      for (int i = 0; i < kBatch; ++i) Activate();
      lookupNs += Since(start);
    }
  }
  double n = static_cast<double>(state.iterations()) * kBatch;
  state.counters["readlink_us"] = floorNs / n / 1000;
  state.counters["activation_us"] = lookupNs / n / 1000;
  state.counters["ratio"] = lookupNs / floorNs;
}

BENCHMARK(BM_ActivationVsReadlink)
    ->Args({10, 1, 0})
    ->Args({1000, 1, 0})
    ->Args({1000, 0, 0})
    ->Args({1000, 1, 1})
    ->Args({1000, 0, 1});

}  // namespace

int main(int argc, char** argv) {
  TempSysroot root("bench-apps", {"/opt/dbspace"});
  g_sysroot = root.path();
  benchmark::Initialize(&argc, argv);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
