// Reporting cost: a full daily run at the table limits against its floor, plain SQLite doing
// the same work (the same selects, the same records inserted with one prepared insert and one
// transaction per table, the same purges), with the bytes each writes to storage
// (/proc/self/io write_bytes); and the hand-over of one batch of 1000 queued records.
// Prints the ratios at the end.
#include <benchmark/benchmark.h>
#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "bench/ratio_reporter.h"
#include "include/db_connection.h"
#include "include/provider_registry.h"
#include "reporting/report_builder.h"
#include "reporting/report_context.h"
#include "reporting/uploader.h"
#include "storage/db_manager.h"
#include "storage/pref_store.h"
#include "tests/temp_sysroot.h"

namespace _CorvaneLogManager {
namespace {

constexpr int kRowsPerTable = 5000;  // the survey tables' row limit
int64_t g_nowMs = 0;
int64_t BenchClock() { return g_nowMs; }
bool ReportOn() { return true; }

// This process's bytes sent to storage so far (write_bytes of /proc/self/io); 0 if unreadable.
long long WrittenBytes() {
  FILE* io = fopen("/proc/self/io", "r");
  if (io == nullptr) return 0;
  char line[128];
  long long bytes = 0;
  while (fgets(line, sizeof(line), io) != nullptr) {
    if (strncmp(line, "write_bytes:", 12) == 0) bytes = atoll(line + 12);
  }
  fclose(io);
  return bytes;
}

constexpr double kMiB = 1024.0 * 1024.0;

time_t LocalMidnight(int year, int month, int day) {
  struct tm tm = {};
  tm.tm_year = year - 1900;
  tm.tm_mon = month - 1;
  tm.tm_mday = day;
  tm.tm_isdst = -1;
  return mktime(&tm);
}

class Device {
 public:
  Device() {
    setenv("TZ", "Europe/Berlin", 1);
    tzset();
    setenv("DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nonexistent/bus", 1);
    (void)ProviderRegistry::GetInstance()->CreateProviders();
    (void)DbManager::GetInstance()->Init();
    (void)UploadDbManager::GetInstance()->Init();
    (void)prefs.Create();
    survey = DbManager::GetInstance()->GetConnection();
    upload = UploadDbManager::GetInstance()->GetConnection();
    day = LocalMidnight(2024, 6, 11);
    g_nowMs = (static_cast<int64_t>(day) + 34 * 3600) * 1000;  // next day, 10:00
  }
  // What the daemon hands the report run, with the bench clock.
  ReportContext Context() {
    ReportContext context;
    context.prefs = &prefs;
    context.providers = ProviderRegistry::GetInstance();
    context.survey = DbManager::GetInstance();
    context.queue = UploadDbManager::GetInstance();
    context.clock = BenchClock;
    context.appId = &appId;
    context.reportEnabled = ReportOn;
    return context;
  }
  ~Device() {
    (void)prefs.Close();
    ProviderRegistry::Release();
    DbManager::CloseInstance();
    UploadDbManager::CloseInstance();
  }

  // 5000 rows in each aggregated table, evenly over the day, 40 apps and 10 features.
  void SeedDay() {
    (void)survey->Exec("BEGIN;");
    char sql[256];
    for (int i = 0; i < kRowsPerTable; ++i) {
      long long stamp = (static_cast<long long>(day) * 1000) + i * (86400000LL / kRowsPerTable);
      snprintf(sql, sizeof(sql),
               "INSERT INTO use_app_survey(timestamp,app_id,duration) VALUES (%lld,'app.%d',%d);",
               stamp, i % 40, i);
      (void)survey->Exec(sql);
      snprintf(sql, sizeof(sql),
               "INSERT INTO manage_app_survey(timestamp,installed_app_id,type) "
               "VALUES (%lld,'app.%d',%d);",
               stamp, i % 40, i % 3);
      (void)survey->Exec(sql);
      snprintf(sql, sizeof(sql),
               "INSERT INTO report_app_error_survey(timestamp,app_id,type) "
               "VALUES (%lld,'app.%d',%d);",
               stamp, i % 40, i % 2);
      (void)survey->Exec(sql);
      snprintf(sql, sizeof(sql),
               "INSERT INTO use_app_feature_survey(timestamp,app_id,feature,extra,value) "
               "VALUES (%lld,'lm','F%03d','',%d);",
               stamp, i % 10, i);
      (void)survey->Exec(sql);
    }
    (void)survey->Exec("COMMIT;");
    (void)prefs.SetSentDate(static_cast<int32_t>(day - 86400));
    (void)upload->Exec("DELETE FROM survey_log;");
  }

  TempSysroot root{"bench", {"/opt/usr/dbspace"}};
  const std::string sysroot = root.path();
  PrefStore prefs;
  const std::string appId = "com.corvane.logmanager";
  DbConnection* survey = nullptr;
  DbConnection* upload = nullptr;
  time_t day = 0;
};

double CpuMs() {
  struct timespec ts;
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &ts);
  return ts.tv_sec * 1e3 + ts.tv_nsec / 1e6;
}

double WallMs() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec * 1e3 + ts.tv_nsec / 1e6;
}

// One record as the run queued it.
struct Record {
  std::string activity, version, body;
};

// The floor of the daily run: what it must do at the least, in plain SQLite on the same files.
// The records are those a real run queued, in its order, each table's in one transaction
// through one prepared insert, and each table's rows purged after its commit.
class Floor {
 public:
  explicit Floor(Device* device) : device(device) {
    device->SeedDay();
    ReportBuilder builder(device->Context());
    if (builder.RunDaily() != 0) abort();
    sqlite3_stmt* stmt = nullptr;
    (void)sqlite3_prepare_v2(device->upload->Handle(),
                             "SELECT activity,app_version,body FROM survey_log ORDER BY _id;", -1,
                             &stmt, nullptr);
    while (sqlite3_step(stmt) == SQLITE_ROW) {
      records.push_back({reinterpret_cast<const char*>(sqlite3_column_text(stmt, 0)),
                         reinterpret_cast<const char*>(sqlite3_column_text(stmt, 1)),
                         reinterpret_cast<const char*>(sqlite3_column_text(stmt, 2))});
    }
    sqlite3_finalize(stmt);
  }

  // One run over a freshly seeded day; false on a failed statement.
  bool Run() {
    long long dayMs = static_cast<long long>(device->day) * 1000;
    sqlite3* survey = device->survey->Handle();
    sqlite3* upload = device->upload->Handle();
    bool ok = true;
    sqlite3_stmt* insert = nullptr;
    (void)sqlite3_prepare_v2(upload,
                             "INSERT INTO survey_log(svc_code,category_code,activity,log_type,"
                             "app_version,body,timestamp) VALUES ('701','999',?,'BIZ',?,?,?);",
                             -1, &insert, nullptr);
    auto queue = [&](const Record& r) {
      sqlite3_bind_text(insert, 1, r.activity.c_str(), -1, SQLITE_STATIC);
      sqlite3_bind_text(insert, 2, r.version.c_str(), -1, SQLITE_STATIC);
      sqlite3_bind_text(insert, 3, r.body.c_str(), -1, SQLITE_STATIC);
      sqlite3_bind_int64(insert, 4, g_nowMs);
      ok = sqlite3_step(insert) == SQLITE_DONE && ok;
      sqlite3_reset(insert);
    };
    for (const Table& t : kTables) {
      ok = sqlite3_exec(upload, "BEGIN;", nullptr, nullptr, nullptr) == SQLITE_OK && ok;
      for (int w = 0; w < t.windows; ++w) {
        sqlite3_stmt* stmt = nullptr;
        ok = sqlite3_prepare_v2(survey, t.sql, -1, &stmt, nullptr) == SQLITE_OK && ok;
        sqlite3_bind_int64(stmt, 1, dayMs + w * t.length);
        sqlite3_bind_int64(stmt, 2, dayMs + (w + 1) * t.length);
        while (sqlite3_step(stmt) == SQLITE_ROW) {
          for (int c = 0; c < sqlite3_column_count(stmt); ++c) {
            cells += sqlite3_column_bytes(stmt, c) + (sqlite3_column_text(stmt, c) != nullptr);
          }
        }
        sqlite3_finalize(stmt);
      }
      for (const Record& r : records) {
        if (r.activity == t.activity) queue(r);
      }
      ok = sqlite3_exec(upload, "COMMIT;", nullptr, nullptr, nullptr) == SQLITE_OK && ok;
      char purge[160];
      snprintf(purge, sizeof(purge), "DELETE FROM %s WHERE timestamp < %lld;", t.table,
               dayMs + t.windows * t.length);
      ok = sqlite3_exec(survey, purge, nullptr, nullptr, nullptr) == SQLITE_OK && ok;
    }
    for (const Record& r : records) {
      if (r.activity == "007") queue(r);
    }
    sqlite3_finalize(insert);
    return ok;
  }

  size_t Records() const { return records.size(); }
  long long cells = 0;

 private:
  // The builder's selects, in its order (the clamped sum as it writes it).
  struct Table {
    const char* activity;
    const char* table;
    const char* sql;
    int windows;
    long long length;
  };
#define CLAMPED(col)                                          \
  "CASE WHEN COUNT(" col ")=0 THEN NULL WHEN MAX(typeof(" col \
  ") NOT IN ('integer','null')) "                             \
  "THEN TOTAL(" col ") ELSE CAST(TOTAL(" col ") AS INTEGER) END"
  static constexpr Table kTables[] = {
      {"001", "use_app_survey",
       "SELECT timestamp,app_id,duration , COUNT(1), " CLAMPED(
           "duration") " FROM use_app_survey "
                       "WHERE timestamp >= ?1 and timestamp < ?2 GROUP BY app_id;",
       8, 3 * 3600000LL},
      {"003", "manage_app_survey",
       "SELECT timestamp,installed_app_id,type FROM manage_app_survey "
       "WHERE timestamp >= ?1 and timestamp < ?2;",
       1, 86399000LL},
      {"004", "report_app_error_survey",
       "SELECT timestamp,app_id,type , COUNT(1) FROM report_app_error_survey "
       "WHERE timestamp >= ?1 and timestamp < ?2 GROUP BY app_id,type;",
       1, 86400000LL},
      {"002", "use_app_feature_survey",
       "SELECT timestamp,app_id,feature,extra,value , COUNT(1), " CLAMPED(
           "value") " FROM "
                    "use_app_feature_survey WHERE timestamp >= ?1 and timestamp < ?2 "
                    "GROUP BY app_id,feature,extra;",
       8, 3 * 3600000LL},
  };
#undef CLAMPED

  Device* device;
  std::vector<Record> records;
};

// What the daily run and its floor cost, per run, measured alternately on the same freshly
// seeded files so that both meet the same machine load.
struct Costs {
  double runCpu = 0, runWall = 0, floorCpu = 0, floorWall = 0;
  double runMiB = 0, floorMiB = 0;
};
Costs g_costs;

// Each iteration: seed, one daily run; seed, one floor run (seeding untimed). The reported
// time is the two runs together; the counters split them.
void BM_DailyRunAgainstFloor(benchmark::State& state) {
  Device device;
  Floor floor(&device);
  Costs sum;
  long long runBytes = 0, floorBytes = 0;
  for (auto _ : state) {
    state.PauseTiming();
    device.SeedDay();
    ReportBuilder builder(device.Context());
    long long bytes = WrittenBytes();
    double cpu = CpuMs(), wall = WallMs();
    state.ResumeTiming();
    if (builder.RunDaily() != 0) state.SkipWithError("daily run failed");
    state.PauseTiming();
    sum.runCpu += CpuMs() - cpu;
    sum.runWall += WallMs() - wall;
    runBytes += WrittenBytes() - bytes;
    if (device.upload->Count("survey_log") != static_cast<int>(floor.Records()))
      state.SkipWithError("the run queued another number of records than the floor");
    device.SeedDay();
    bytes = WrittenBytes();
    cpu = CpuMs();
    wall = WallMs();
    state.ResumeTiming();
    if (!floor.Run()) state.SkipWithError("floor run failed");
    state.PauseTiming();
    sum.floorCpu += CpuMs() - cpu;
    sum.floorWall += WallMs() - wall;
    floorBytes += WrittenBytes() - bytes;
    state.ResumeTiming();
  }
  double n = static_cast<double>(state.iterations());
  g_costs = {sum.runCpu / n,    sum.runWall / n,     sum.floorCpu / n,
             sum.floorWall / n, runBytes / kMiB / n, floorBytes / kMiB / n};
  state.counters["run_cpu_ms"] = g_costs.runCpu;
  state.counters["floor_cpu_ms"] = g_costs.floorCpu;
  state.counters["run_MiB"] = g_costs.runMiB;
  state.counters["floor_MiB"] = g_costs.floorMiB;
  state.counters["records"] = static_cast<double>(floor.Records());
  benchmark::DoNotOptimize(floor.cells);
}
BENCHMARK(BM_DailyRunAgainstFloor)->Iterations(12)->Unit(benchmark::kMillisecond);

// The same selects straight on SQLite: no records written, nothing purged.
void BM_BareGroupByQueries(benchmark::State& state) {
  Device device;
  device.SeedDay();
  long long dayMs = static_cast<long long>(device.day) * 1000;
  struct Query {
    const char* sql;
    int windows;
    long long length;
  } queries[] = {
      {"SELECT timestamp,app_id,duration , COUNT(1), SUM(duration) FROM use_app_survey "
       "WHERE timestamp >= ?1 and timestamp < ?2 GROUP BY app_id;",
       8, 3 * 3600000LL},
      {"SELECT timestamp,installed_app_id,type FROM manage_app_survey "
       "WHERE timestamp >= ?1 and timestamp < ?2;",
       1, 86399000LL},
      {"SELECT timestamp,app_id,type , COUNT(1) FROM report_app_error_survey "
       "WHERE timestamp >= ?1 and timestamp < ?2 GROUP BY app_id,type;",
       1, 86400000LL},
      {"SELECT timestamp,app_id,feature,extra,value , COUNT(1), SUM(value) FROM "
       "use_app_feature_survey WHERE timestamp >= ?1 and timestamp < ?2 "
       "GROUP BY app_id,feature,extra;",
       8, 3 * 3600000LL},
  };
  long long cells = 0;
  for (auto _ : state) {
    for (const Query& q : queries) {
      for (int w = 0; w < q.windows; ++w) {
        sqlite3_stmt* stmt = nullptr;
        (void)sqlite3_prepare_v2(device.survey->Handle(), q.sql, -1, &stmt, nullptr);
        sqlite3_bind_int64(stmt, 1, dayMs + w * q.length);
        sqlite3_bind_int64(stmt, 2, dayMs + (w + 1) * q.length);
        while (sqlite3_step(stmt) == SQLITE_ROW) {
          for (int c = 0; c < sqlite3_column_count(stmt); ++c) {
            cells += sqlite3_column_bytes(stmt, c) + (sqlite3_column_text(stmt, c) != nullptr);
          }
        }
        sqlite3_finalize(stmt);
      }
    }
  }
  benchmark::DoNotOptimize(cells);
}
BENCHMARK(BM_BareGroupByQueries)->Unit(benchmark::kMillisecond);

void BM_SendThousandRecords(benchmark::State& state) {
  Device device;
  ReportBuilder builder(device.Context());
  Uploader uploader(device.Context());
  (void)uploader.Init(&builder);
  std::string outbox = device.sysroot + "/opt/usr/data/log-relay/outbox.jsonl";
  for (auto _ : state) {
    state.PauseTiming();
    (void)unlink(outbox.c_str());
    (void)device.upload->Exec("BEGIN;");
    char sql[512];
    for (int i = 0; i < 1000; ++i) {
      snprintf(sql, sizeof(sql),
               "INSERT INTO survey_log(timestamp,svc_code,category_code,activity,log_type,"
               "app_version,body) VALUES (%lld,'701','999','00%d','BIZ','W2','mcc=¶mnc=¶did=¶"
               "model=m¶fw_ver=W2¶date=2024-06-11T03:00:00+0200¶sum=3¶count=%d¶app_id=app.%d¶"
               "duration=%d');",
               static_cast<long long>(g_nowMs - 1000), 1 + i % 4, i, i % 40, i * 7);
      (void)device.upload->Exec(sql);
    }
    (void)device.upload->Exec("COMMIT;");
    state.ResumeTiming();
    uploader.SendAll();
  }
  state.SetItemsProcessed(state.iterations() * 1000);
}
BENCHMARK(BM_SendThousandRecords)->Unit(benchmark::kMillisecond);

}  // namespace
}  // namespace _CorvaneLogManager

using namespace _CorvaneLogManager;

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  const Costs& c = g_costs;
  if (c.floorCpu > 0 && c.floorWall > 0) {
    printf("daily run, per run:   cpu %.1f ms, wall %.1f ms, written %.2f MiB\n", c.runCpu,
           c.runWall, c.runMiB);
    printf("floor, per run:       cpu %.1f ms, wall %.1f ms, written %.2f MiB\n", c.floorCpu,
           c.floorWall, c.floorMiB);
    printf("daily run / floor:    cpu %.2f, wall %.2f\n", c.runCpu / c.floorCpu,
           c.runWall / c.floorWall);
  }
  double bare = RatioReporter::Find(reporter.cpu, "BM_BareGroupByQueries");
  if (bare > 0 && c.runCpu > 0)
    printf("daily run / bare selects only: cpu %.2f\n", c.runCpu / bare);
  benchmark::Shutdown();
  return 0;
}
