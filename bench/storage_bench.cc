// Select of 5,000 rows through DbConnection against a bare sqlite3_step loop over the same rows
// that reads each column by its type, and single-row Exec inserts in the journal modes worth
// considering (rollback or WAL, each with synchronous FULL or NORMAL). Prints the ratios at the
// end; the Select ratios come from pairs run alternately in one loop, for two row shapes: a
// text, an integer, a real and a timestamp, and the survey tables' own row (integers and texts).
#include <benchmark/benchmark.h>
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <time.h>

#include <algorithm>
#include <map>
#include <string>
#include <vector>

#include "bench/ratio_reporter.h"
#include "include/db_connection.h"
#include "tests/temp_sysroot.h"

using namespace _CorvaneLogManager;

namespace {

constexpr int kRows = 5000;
const char kSelect[] = "SELECT app_id, duration, ratio, timestamp FROM t;";

TempSysroot* g_dir = nullptr;

std::string DbFile(const char* name) { return g_dir->Path(std::string("/") + name); }

void Setup() { g_dir = new TempSysroot("storage-bench"); }

void Teardown() { delete g_dir; }

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

// The survey tables' row: _id, timestamp, time_zone, app_id, feature, extra, value.
const char kSurveySelect[] =
    "SELECT _id, timestamp, time_zone, app_id, feature, extra, value FROM s;";

void FillSurvey(DbConnection* conn, int rows) {
  {
    DbConnection::SetupScope setup(conn);
    if (conn->Exec("CREATE TABLE IF NOT EXISTS s(_id INTEGER PRIMARY KEY AUTOINCREMENT, "
                   "timestamp INTEGER, time_zone TEXT, app_id TEXT, feature TEXT, extra TEXT, "
                   "value INTEGER);") != 0)
      abort();
  }
  if (conn->Exec("DELETE FROM s;") != 0 || conn->Exec("BEGIN;") != 0) abort();
  char sql[256];
  for (int i = 0; i < rows; ++i) {
    (void)snprintf(sql, sizeof(sql),
                   "INSERT INTO s(timestamp, time_zone, app_id, feature, extra, "
                   "value) VALUES(%lld, 'Europe/Berlin', 'com.example.app%d', 'SCRN', '', %d);",
                   1717977600000LL + i * 1000LL, i % 40, i * 37);
    if (conn->Exec(sql) != 0) abort();
  }
  if (conn->Exec("COMMIT;") != 0) abort();
}

// One pass of the floor: step and read every column by its type, no rendering, no allocation.
int BareStep(sqlite3_stmt* stmt, const std::vector<int>& types) {
  int count = 0;
  size_t bytes = 0;
  while (sqlite3_step(stmt) == SQLITE_ROW) {
    for (size_t c = 0; c < types.size(); ++c) {
      int col = static_cast<int>(c);
      switch (types[c]) {
        case SQLITE_INTEGER:
          benchmark::DoNotOptimize(sqlite3_column_int64(stmt, col));
          break;
        case SQLITE_FLOAT:
          benchmark::DoNotOptimize(sqlite3_column_double(stmt, col));
          break;
        default:
          benchmark::DoNotOptimize(sqlite3_column_text(stmt, col));
          bytes += static_cast<size_t>(sqlite3_column_bytes(stmt, col));
      }
    }
    ++count;
  }
  sqlite3_reset(stmt);
  benchmark::DoNotOptimize(bytes);
  return count;
}

double NowNs(clockid_t clock) {
  struct timespec ts;
  clock_gettime(clock, &ts);
  return ts.tv_sec * 1e9 + ts.tv_nsec;
}

struct PairResult {
  double selectWall, bareWall, selectCpu, bareCpu;  // medians, ms
};

// Select and the bare loop run alternately, |rounds| times each, so that load on a shared
// machine falls on both alike; medians of each.
PairResult SelectPair(DbConnection* conn, const char* sql, const char* table,
                      const std::vector<int>& types, int rounds) {
  sqlite3_stmt* stmt = nullptr;
  if (sqlite3_prepare_v2(conn->Handle(), sql, -1, &stmt, nullptr) != SQLITE_OK) abort();
  std::vector<double> wall[2], cpu[2];
  for (int i = 0; i < rounds * 2; ++i) {
    int which = (i + i / 2) % 2;  // select, bare, bare, select, ...
    double w0 = NowNs(CLOCK_MONOTONIC), c0 = NowNs(CLOCK_THREAD_CPUTIME_ID);
    int count = 0;
    if (which == 0) {
      char** rows = nullptr;
      if (conn->Select(sql, table, &count, &rows) != 0) abort();
      for (int r = 0; r < count; ++r) delete[] rows[r];
      if (count > 0) delete[] rows;
    } else {
      count = BareStep(stmt, types);
    }
    cpu[which].push_back((NowNs(CLOCK_THREAD_CPUTIME_ID) - c0) / 1e6);
    wall[which].push_back((NowNs(CLOCK_MONOTONIC) - w0) / 1e6);
    if (count != kRows) abort();
  }
  sqlite3_finalize(stmt);
  auto median = [](std::vector<double>& v) {
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
  };
  return {median(wall[0]), median(wall[1]), median(cpu[0]), median(cpu[1])};
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

// The floor: step and read every column by its type, no rendering and no allocation.
void BM_BareStepLoop(benchmark::State& state) {
  DbConnection conn;
  if (conn.Open(DbFile("select.db").c_str()) != 0) abort();
  sqlite3_stmt* stmt = nullptr;
  if (sqlite3_prepare_v2(conn.Handle(), kSelect, -1, &stmt, nullptr) != SQLITE_OK) abort();
  const std::vector<int> types = {SQLITE_TEXT, SQLITE_INTEGER, SQLITE_FLOAT, SQLITE_INTEGER};
  for (auto _ : state) {
    if (BareStep(stmt, types) != kRows) {
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
  {
    DbConnection conn;
    if (conn.Open(DbFile("pairs.db").c_str()) != 0) abort();
    Fill(&conn, kRows);
    FillSurvey(&conn, kRows);
    const int kPairRounds = 150;
    struct {
      const char* name;
      const char* sql;
      const char* table;
      std::vector<int> types;
    } shapes[] = {
        {"text, int, real, int",
         kSelect,
         "t",
         {SQLITE_TEXT, SQLITE_INTEGER, SQLITE_FLOAT, SQLITE_INTEGER}},
        {"survey row (3 int, 4 text)",
         kSurveySelect,
         "s",
         {SQLITE_INTEGER, SQLITE_INTEGER, SQLITE_TEXT, SQLITE_TEXT, SQLITE_TEXT, SQLITE_TEXT,
          SQLITE_INTEGER}},
    };
    printf("Select of %d rows against the bare step loop, %d interleaved pairs, medians (ms):\n",
           kRows, kPairRounds);
    for (const auto& shape : shapes) {
      PairResult r = SelectPair(&conn, shape.sql, shape.table, shape.types, kPairRounds);
      printf("  %-28s wall %.2f / %.2f = %.2f   cpu %.2f / %.2f = %.2f\n", shape.name, r.selectWall,
             r.bareWall, r.selectWall / r.bareWall, r.selectCpu, r.bareCpu,
             r.selectCpu / r.bareCpu);
    }
    (void)conn.Close();
  }
  Teardown();
  for (int m = 1; m < 4; ++m) {
    reporter.PrintRatio(std::string("insert ") + kModes[m].name + " / rollback_full",
                        "BM_ExecInsert/" + std::to_string(m), "BM_ExecInsert/0");
  }
  benchmark::Shutdown();
  return 0;
}
