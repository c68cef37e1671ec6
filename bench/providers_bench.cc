// InsertRow of a typical collector row against a bare prepared insert of the same row on the
// same connection (same journal mode), on an empty table and at the 5,000-row limit where the
// provider trims. Prints the ratios at the end.
#include <benchmark/benchmark.h>
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <map>
#include <string>

#include "base/clock.h"
#include "bench/ratio_reporter.h"
#include "include/base_log_provider.h"
#include "include/db_connection.h"
#include "include/provider_registry.h"
#include "storage/db_manager.h"
#include "tests/temp_sysroot.h"

using namespace _CorvaneLogManager;

namespace {

constexpr int kLimit = 5000;
constexpr int kBatch = 500;

TempSysroot* g_sysroot = nullptr;
BaseLogProvider* g_provider = nullptr;
DbConnection* g_conn = nullptr;

void Setup() {
  g_sysroot = new TempSysroot("bench", {"/opt/usr/dbspace"});
  if (!g_sysroot->SetLocaltime("/usr/share/zoneinfo/Europe/Berlin")) abort();
  if (DbManager::GetInstance() == nullptr || UploadDbManager::GetInstance() == nullptr ||
      ProviderRegistry::GetInstance()->CreateProviders() != 0 ||
      DbManager::GetInstance()->Init() != 0 || UploadDbManager::GetInstance()->Init() != 0)
    abort();
  g_provider = ProviderRegistry::GetInstance()->Lookup("use_app_survey");
  g_conn = DbManager::GetInstance()->GetConnection();
}

void Teardown() {
  ProviderRegistry::Release();
  DbManager::CloseInstance();
  UploadDbManager::CloseInstance();
  delete g_sysroot;
}

// Brings the table to |rows| rows and the provider's counter to what a restart would seed.
void Prefill(int rows) {
  g_conn->Exec("DELETE FROM use_app_survey;");
  g_conn->Exec("BEGIN;");
  for (int i = 0; i < rows; ++i)
    g_conn->Exec("INSERT INTO use_app_survey(app_id,duration,timestamp) VALUES ('p',1,1);");
  g_conn->Exec("COMMIT;");
  (void)g_provider->Initialize();
}

// The bare prepared insert of the row InsertRow writes, with the columns it fills itself.
class BareInsert {
 public:
  BareInsert() {
    if (sqlite3_prepare_v2(g_conn->Handle(),
                           "INSERT INTO use_app_survey(app_id,duration,timestamp,time_zone) "
                           "VALUES (?,?,?,?);",
                           -1, &stmt_, nullptr) != SQLITE_OK)
      abort();
  }
  ~BareInsert() { sqlite3_finalize(stmt_); }
  bool Run() {
    sqlite3_bind_text(stmt_, 1, "com.example.clock", -1, SQLITE_STATIC);
    sqlite3_bind_int64(stmt_, 2, 184230);
    sqlite3_bind_int64(stmt_, 3, WallClockMs());
    sqlite3_bind_text(stmt_, 4, "Europe/Berlin", -1, SQLITE_STATIC);
    bool done = sqlite3_step(stmt_) == SQLITE_DONE;
    sqlite3_reset(stmt_);
    return done;
  }

 private:
  sqlite3_stmt* stmt_ = nullptr;
};

// Drops the oldest batch the bare inserts added at the limit, untimed, where InsertRow trims.
void TrimBare() {
  g_conn->Exec(
      "DELETE FROM use_app_survey WHERE _id < (SELECT MIN(_id) FROM use_app_survey) + 500;");
}

// Keeps an "empty" table near empty between batches (untimed).
void MaybeEmpty(benchmark::State& state, int start, int64_t done) {
  if (start == 0 && done % kBatch == 0) {
    state.PauseTiming();
    Prefill(0);
    state.ResumeTiming();
  }
}

void BM_InsertRow(benchmark::State& state) {
  int start = static_cast<int>(state.range(0));
  Prefill(start);
  int64_t done = 0;
  for (auto _ : state) {
    if (g_provider->InsertRow("app_id,duration", "'com.example.clock',184230") != 0)
      state.SkipWithError("insert failed");
    MaybeEmpty(state, start, ++done);
  }
  state.counters["rows_at_end"] = g_conn->Count("use_app_survey");
}

void BM_BarePreparedInsert(benchmark::State& state) {
  int start = static_cast<int>(state.range(0));
  Prefill(start);
  BareInsert bare;
  int64_t done = 0;
  for (auto _ : state) {
    if (!bare.Run()) state.SkipWithError("insert failed");
    MaybeEmpty(state, start, ++done);
    // At the limit the bare table is held there too, untimed, so both see the same size.
    if (start == kLimit && done % kBatch == 0) {
      state.PauseTiming();
      TrimBare();
      state.ResumeTiming();
    }
  }
  state.counters["rows_at_end"] = g_conn->Count("use_app_survey");
}

BENCHMARK(BM_InsertRow)->Arg(0)->Arg(kLimit)->Iterations(2000)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_BarePreparedInsert)
    ->Arg(0)
    ->Arg(kLimit)
    ->Iterations(2000)
    ->Unit(benchmark::kMicrosecond);

double CpuUs() {
  struct timespec ts;
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &ts);
  return ts.tv_sec * 1e6 + ts.tv_nsec / 1e3;
}

double WallUs() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec * 1e6 + ts.tv_nsec / 1e3;
}

// Per insert, from the interleaved benchmark: [0] empty table, [1] at the limit.
struct Interleaved {
  double insertCpu = 0, insertWall = 0, bareCpu = 0, bareWall = 0;
};
Interleaved g_interleaved[2];

// InsertRow and the bare insert taking turns on the same table (which goes first alternates),
// so that both meet the same load; the table is held at its start size as above, untimed.
void BM_InsertRowInterleavedWithBare(benchmark::State& state) {
  int start = static_cast<int>(state.range(0));
  Prefill(start);
  BareInsert bareInsert;
  Interleaved sum;
  int64_t done = 0;
  auto insertRow = [&] {
    double cpu = CpuUs(), wall = WallUs();
    if (g_provider->InsertRow("app_id,duration", "'com.example.clock',184230") != 0)
      state.SkipWithError("insert failed");
    sum.insertCpu += CpuUs() - cpu;
    sum.insertWall += WallUs() - wall;
  };
  auto bare = [&] {
    double cpu = CpuUs(), wall = WallUs();
    if (!bareInsert.Run()) state.SkipWithError("insert failed");
    sum.bareCpu += CpuUs() - cpu;
    sum.bareWall += WallUs() - wall;
  };
  for (auto _ : state) {
    if (done % 2 == 0) {
      insertRow();
      bare();
    } else {
      bare();
      insertRow();
    }
    ++done;
    if (done % kBatch == 0) {
      state.PauseTiming();
      if (start == 0) {
        Prefill(0);
      } else {  // the bare inserts' share; InsertRow trims its own
        TrimBare();
      }
      state.ResumeTiming();
    }
  }
  double n = static_cast<double>(state.iterations());
  Interleaved& out = g_interleaved[start == 0 ? 0 : 1];
  out = {sum.insertCpu / n, sum.insertWall / n, sum.bareCpu / n, sum.bareWall / n};
  state.counters["insert_cpu_us"] = out.insertCpu;
  state.counters["bare_cpu_us"] = out.bareCpu;
  state.counters["rows_at_end"] = g_conn->Count("use_app_survey");
}
BENCHMARK(BM_InsertRowInterleavedWithBare)
    ->Arg(0)
    ->Arg(kLimit)
    ->Iterations(4000)
    ->Unit(benchmark::kMicrosecond);

}  // namespace

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  Setup();
  RatioReporter reporter(benchmark::ConsoleReporter::OO_Tabular);
  benchmark::RunSpecifiedBenchmarks(&reporter);
  Teardown();
  // Wall time includes the journal's fsync, which dominates on a real disk; CPU time shows
  // what the provider itself adds.
  reporter.PrintRatio("InsertRow / bare insert, empty table", "BM_InsertRow/0",
                      "BM_BarePreparedInsert/0");
  reporter.PrintRatio("InsertRow / bare insert, at 5,000 rows", "BM_InsertRow/5000",
                      "BM_BarePreparedInsert/5000");
  reporter.PrintRatio("InsertRow at 5,000 rows / empty table", "BM_InsertRow/5000",
                      "BM_InsertRow/0");
  // The same ratios from the interleaved runs, per insert.
  for (int i = 0; i < 2; ++i) {
    const Interleaved& t = g_interleaved[i];
    if (t.bareCpu <= 0 || t.bareWall <= 0) continue;
    const char* where = i == 0 ? "empty table" : "at 5,000 rows";
    printf(
        "interleaved, %-13s InsertRow %.1f us cpu / %.1f us wall, bare %.1f / %.1f: "
        "cpu %.2f, wall %.2f\n",
        where, t.insertCpu, t.insertWall, t.bareCpu, t.bareWall, t.insertCpu / t.bareCpu,
        t.insertWall / t.bareWall);
  }
  benchmark::Shutdown();
  return 0;
}
