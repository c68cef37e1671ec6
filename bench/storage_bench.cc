// Select of 5,000 rows through DbConnection against a bare sqlite3_step loop over the same rows,
// and single-row Exec inserts in the journal modes worth considering (rollback or WAL, each with
// synchronous FULL or NORMAL). Prints the ratios at the end.
#include <benchmark/benchmark.h>
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>

#include <map>
#include <string>

#include "bench/ratio_reporter.h"
#include "db_connection.h"

using namespace _CorvaneLogManager;

namespace {

constexpr int kRows = 5000;
const char kSelect[] = "SELECT app_id, duration, ratio, timestamp FROM t;";

std::string g_dir;

std::string DbFile(const char* name) { return g_dir + "/" + name; }

void Setup() {
  char tmpl[] = "/tmp/logmgr-storage-bench-XXXXXX";
  if (mkdtemp(tmpl) == nullptr) abort();
  g_dir = tmpl;
}

void Teardown() { (void)system(("rm -rf '" + g_dir + "'").c_str()); }

// A survey-like table of |rows| rows: a text, two numbers and a timestamp per row.
void Fill(DbConnection* conn, int rows) {
  {
    DbConnection::SetupScope setup(conn);  // a daemon connection creates tables only here
    if (conn->Exec("CREATE TABLE IF NOT EXISTS t(app_id TEXT, duration INTEGER, ratio REAL, "
                   "timestamp INTEGER);") != 0)
      abort();
  }
  if (conn->Exec("DELETE FROM t;") != 0 || conn->Exec("BEGIN;") != 0) abort();
  char sql[256];
  for (int i = 0; i < rows; ++i) {
    (void)snprintf(sql, sizeof(sql), "INSERT INTO t VALUES('com.example.app%d', %d, %f, %lld);",
                   i % 40, i * 37, i / 7.0, 1717977600000LL + i);
    if (conn->Exec(sql) != 0) abort();
  }
  if (conn->Exec("COMMIT;") != 0) abort();
}

void BM_SelectThroughDbConnection(benchmark::State& state) {
  DbConnection conn;
  if (conn.Open(DbFile("select.db").c_str()) != 0) abort();
  Fill(&conn, kRows);
  for (auto _ : state) {
    int count = 0;
    char** rows = nullptr;
    if (conn.Select(kSelect, "t", &count, &rows) != 0 || count != kRows) {
      state.SkipWithError("select failed");
      break;
    }
    for (int i = 0; i < count; ++i) delete[] rows[i];
    delete[] rows;
  }
  (void)conn.Close();
}

// The floor: step and touch every column, no rendering and no allocation.
void BM_BareStepLoop(benchmark::State& state) {
  DbConnection conn;
  if (conn.Open(DbFile("select.db").c_str()) != 0) abort();
  sqlite3_stmt* stmt = nullptr;
  if (sqlite3_prepare_v2(conn.Handle(), kSelect, -1, &stmt, nullptr) != SQLITE_OK) abort();
  for (auto _ : state) {
    int count = 0;
    size_t bytes = 0;
    while (sqlite3_step(stmt) == SQLITE_ROW) {
      bytes += static_cast<size_t>(sqlite3_column_bytes(stmt, 0));
      benchmark::DoNotOptimize(sqlite3_column_text(stmt, 0));
      benchmark::DoNotOptimize(sqlite3_column_int64(stmt, 1));
      benchmark::DoNotOptimize(sqlite3_column_double(stmt, 2));
      benchmark::DoNotOptimize(sqlite3_column_int64(stmt, 3));
      ++count;
    }
    sqlite3_reset(stmt);
    benchmark::DoNotOptimize(bytes);
    if (count != kRows) {
      state.SkipWithError("step loop failed");
      break;
    }
  }
  sqlite3_finalize(stmt);
  (void)conn.Close();
}

struct Mode {
  const char* name;
  const char* journal;
  const char* sync;
};
const Mode kModes[] = {
    {"rollback_full", "PRAGMA journal_mode=DELETE;", "PRAGMA synchronous=FULL;"},
    {"rollback_normal", "PRAGMA journal_mode=DELETE;", "PRAGMA synchronous=NORMAL;"},
    {"wal_full", "PRAGMA journal_mode=WAL;", "PRAGMA synchronous=FULL;"},
    {"wal_normal", "PRAGMA journal_mode=WAL;", "PRAGMA synchronous=NORMAL;"},
};

// One autocommitted single-row insert per iteration, as a collector event produces.
void BM_ExecInsert(benchmark::State& state) {
  const Mode& mode = kModes[state.range(0)];
  state.SetLabel(mode.name);
  std::string path = DbFile((std::string(mode.name) + ".db").c_str());
  DbConnection conn;
  if (conn.Open(path.c_str()) != 0) abort();
  {
    // One statement per Exec, pragmas and tables only in the open phase.
    DbConnection::SetupScope setup(&conn);
    if (conn.Exec(mode.journal) != 0 || conn.Exec(mode.sync) != 0 ||
        conn.Exec("CREATE TABLE IF NOT EXISTS t(app_id TEXT, duration INTEGER, timestamp "
                  "INTEGER);") != 0)
      abort();
  }
  int64_t i = 0;
  char sql[256];
  for (auto _ : state) {
    (void)snprintf(sql, sizeof(sql), "INSERT INTO t VALUES('com.example.clock', 184230, %lld);",
                   static_cast<long long>(1717977600000LL + ++i));
    if (conn.Exec(sql) != 0) {
      state.SkipWithError("insert failed");
      break;
    }
  }
  (void)conn.Close();
}

BENCHMARK(BM_SelectThroughDbConnection)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_BareStepLoop)->Unit(benchmark::kMillisecond);
BENCHMARK(BM_ExecInsert)->DenseRange(0, 3)->Iterations(1000)->Unit(benchmark::kMicrosecond);

}  // namespace

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  Setup();
  RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  Teardown();
  for (const auto* times : {&reporter.wall, &reporter.cpu}) {
    const char* kind = times == &reporter.wall ? "wall" : "cpu ";
    double select = RatioReporter::Find(*times, "BM_SelectThroughDbConnection");
    double bare = RatioReporter::Find(*times, "BM_BareStepLoop");
    if (select > 0 && bare > 0) {
      printf("%s Select of %d rows / bare step loop:      %.2f\n", kind, kRows, select / bare);
    }
    double base = RatioReporter::Find(*times, "BM_ExecInsert/0");
    if (base <= 0) continue;
    for (int m = 1; m < 4; ++m) {
      double t = RatioReporter::Find(*times, "BM_ExecInsert/" + std::to_string(m));
      if (t > 0) {
        printf("%s insert %-16s / rollback_full:        %.3f\n", kind, kModes[m].name, t / base);
      }
    }
  }
  benchmark::Shutdown();
  return 0;
}
