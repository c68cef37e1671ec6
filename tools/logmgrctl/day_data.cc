#include "tools/logmgrctl/day_data.h"

#include <sqlite3.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/time.h>
#include <system_info.h>
#include <telephony.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <functional>
#include <map>

#include "platform/fixed_path.h"
#include "tools/logmgrctl/outbox_view.h"
#include "tools/logmgrctl/table_view.h"

namespace daypage {

const DeviceLane kDeviceLanes[6] = {
    {"SCRN", "screen on"}, {"CHAR", "charging"},  {"HEAD", "headset"},
    {"WIFI", "Wi-Fi"},     {"BLUE", "Bluetooth"}, {"CONN", "connection"},
};

const char* MarkName(Mark::Kind kind) {
  static const char* const kNames[] = {"install", "uninstall", "update", "package", "crash",
                                       "unlock",  "capture",   "plug",   "unplug",  "row"};
  return kNames[kind];
}

const char* ActivityName(const std::string& activity) {
  static const std::map<std::string, const char*> kNames = {{"001", "app use"},
                                                            {"002", "device feature"},
                                                            {"003", "package"},
                                                            {"004", "crash"},
                                                            {"007", "day summary"}};
  auto it = kNames.find(activity);
  return it != kNames.end() ? it->second : "other";
}

namespace {

constexpr char kSurveyDb[] = "/opt/usr/dbspace/.SurveyLog.db";
constexpr char kStatusDb[] = "/opt/usr/dbspace/.StatusMonitor.db";
constexpr char kUploadDb[] = "/opt/usr/dbspace/.ServerUploaderDB.db";
constexpr char kOutbox[] = "/opt/usr/data/log-relay/outbox.jsonl";
constexpr char kOwnAppId[] = "com.corvane.logmanager";
constexpr char kSeparator[] = "\xC2\xB6";
// Wall clocks are at most this far from UTC; periods last at most a week.
constexpr int64_t kZoneSlackMs = 15 * kHourMs;
constexpr int64_t kLongestPeriodMs = 7 * kDayMs;

int64_t NowMs() {
  struct timeval tv;
  gettimeofday(&tv, nullptr);
  return static_cast<int64_t>(tv.tv_sec) * 1000 + tv.tv_usec / 1000;
}

std::string Text(sqlite3_stmt* stmt, int column) {
  const unsigned char* text = sqlite3_column_text(stmt, column);
  return text != nullptr ? reinterpret_cast<const char*>(text) : "";
}

// Runs |sql| with the optional bounds bound to ?1 and ?2; a missing table is no rows.
void ForEachRow(sqlite3* db, const char* sql, int64_t lo, int64_t hi,
                const std::function<void(sqlite3_stmt*)>& row) {
  sqlite3_stmt* stmt = nullptr;
  if (db == nullptr || sqlite3_prepare_v2(db, sql, -1, &stmt, nullptr) != SQLITE_OK) {
    sqlite3_finalize(stmt);
    return;
  }
  if (sqlite3_bind_parameter_count(stmt) == 2) {
    sqlite3_bind_int64(stmt, 1, lo);
    sqlite3_bind_int64(stmt, 2, hi);
  }
  while (sqlite3_step(stmt) == SQLITE_ROW) row(stmt);
  sqlite3_finalize(stmt);
}

int Rank(const std::string& activity) {
  static const std::map<std::string, int> kRanks = {
      {"007", 0}, {"001", 1}, {"003", 2}, {"004", 3}, {"002", 4}};
  auto it = kRanks.find(activity);
  return it != kRanks.end() ? it->second : 9;
}

bool IsHeaderKey(const std::string& key) {
  return key == "mcc" || key == "mnc" || key == "did" || key == "model" || key == "fw_ver";
}

std::vector<std::pair<std::string, std::string>> SplitBody(const std::string& body) {
  std::vector<std::pair<std::string, std::string>> pairs;
  for (size_t start = 0; start < body.size();) {
    size_t end = body.find(kSeparator, start);
    if (end == std::string::npos) end = body.size();
    std::string pair = body.substr(start, end - start);
    size_t eq = pair.find('=');
    if (eq == std::string::npos) {
      pairs.emplace_back(pair, "");
    } else {
      pairs.emplace_back(pair.substr(0, eq), pair.substr(eq + 1));
    }
    start = end + strlen(kSeparator);
  }
  return pairs;
}

void FillIdentity(const std::vector<std::pair<std::string, std::string>>& pairs, Identity* id) {
  for (const auto& [key, value] : pairs) {
    std::string* slot = key == "mcc"      ? &id->mcc
                        : key == "mnc"    ? &id->mnc
                        : key == "model"  ? &id->model
                        : key == "fw_ver" ? &id->firmware
                                          : nullptr;
    if (slot != nullptr && slot->empty() && value != "(null)") *slot = value;
  }
}

// Report records of every day, from the outbox or the queue, before the day filter.
struct RawRecord {
  Record record;
  std::vector<std::pair<std::string, std::string>> pairs;
};

void AddRecord(int64_t dayStart, RawRecord raw, std::vector<Record>* out, Identity* dayIdentity,
               Identity* anyIdentity) {
  FillIdentity(raw.pairs, anyIdentity);
  std::string date;
  for (const auto& [key, value] : raw.pairs) {
    if (key == "date") date = value;
    if (!IsHeaderKey(key)) raw.record.fields.emplace_back(key, value);
  }
  int64_t recordDay;
  if (!RecordDay(raw.record.activity, date, &recordDay) || recordDay != dayStart) return;
  FillIdentity(raw.pairs, dayIdentity);
  out->push_back(std::move(raw.record));
}

// The SIM operator as the daemon's next report will read it: MCC, then a 2- or 3-digit MNC.
void SimFromModem(Identity* id) {
  telephony_handle_list_s list{0, nullptr};
  if (telephony_init(&list) != TELEPHONY_ERROR_NONE) return;
  char* text = nullptr;
  if (list.count > 0 && telephony_sim_get_operator(list.handle[0], &text) == TELEPHONY_ERROR_NONE) {
    std::string op = text != nullptr ? text : "";
    if (op.size() == 5 || op.size() == 6) {
      id->mcc = op.substr(0, 3);
      id->mnc = op.substr(3);
    }
  }
  free(text);
  (void)telephony_deinit(&list);
}

std::string StampText(int64_t utcMs, const std::string& zone) {
  int64_t wall = WallClockMs(utcMs, zone);
  return FormatDate(wall) + " " + FormatClock(wall).substr(0, 8);
}

class DayLoader {
 public:
  explicit DayLoader(DayData* day) : day_(day) {}

  void Load(sqlite3* survey) {
    latestMs_ = NowMs();
    lo_ = day_->dayStart - kZoneSlackMs;
    hi_ = day_->dayStart + kDayMs + kZoneSlackMs + kLongestPeriodMs;
    LoadSurvey(survey);
    LoadQueue();
    LoadOutbox();
    LoadOpenPeriods();  // last: they run until the latest time seen anywhere
    Finish();
  }

 private:
  std::string ZoneOf(const std::string& rowZone) const {
    return IsZoneName(rowZone) ? rowZone : day_->zone;
  }

  void AddPeriod(std::vector<Period>* to, const std::string& lane, const std::string& extra,
                 const std::string& zone, int64_t startUtc, int64_t endUtc, bool open) {
    Period p{lane,
             extra,
             zone,
             {0, 0},
             {WallClockMs(startUtc, zone), WallClockMs(endUtc, zone)},
             endUtc - startUtc,
             open};
    if (ClipToDay(p.full, day_->dayStart, &p.shown)) to->push_back(std::move(p));
  }

  void AddMark(Mark::Kind kind, const std::string& lane, const std::string& text,
               const std::string& zone, int64_t utcMs) {
    int64_t at = WallClockMs(utcMs, zone);
    if (DayOf(at) == day_->dayStart) day_->marks.push_back({kind, lane, text, zone, at});
  }

  void Feature(int64_t ts, const std::string& zone, const std::string& app,
               const std::string& feature, const std::string& extra, sqlite3_stmt* row) {
    int64_t value = sqlite3_column_int64(row, 5);
    bool own = app == kOwnAppId;
    if (own) {
      for (const DeviceLane& lane : kDeviceLanes) {
        if (feature == lane.code)
          return AddPeriod(&day_->device, feature, extra, zone, ts - value, ts, false);
      }
      if (feature == "BAT1" || feature == "BAT2") {
        char level[64];
        snprintf(level, sizeof(level), "%g %%%s", static_cast<double>(value) / 1000,
                 extra == "U"   ? " (USB)"
                 : extra == "A" ? " (AC)"
                                : "");
        return AddMark(feature == "BAT1" ? Mark::kPlug : Mark::kUnplug, "", level, zone, ts);
      }
      if (feature == "UNLO") return AddMark(Mark::kUnlock, "", "", zone, ts);
      if (feature == "CAPT") return AddMark(Mark::kCapture, "", "", zone, ts);
    }
    std::string text = feature + " extra=" + extra + " value=" + Text(row, 5);
    AddMark(Mark::kRow, app, text, zone, ts);
  }

  void LoadSurvey(sqlite3* db) {
    ForEachRow(db,
               "SELECT MAX(timestamp) FROM (SELECT timestamp FROM use_app_survey UNION ALL "
               "SELECT timestamp FROM use_app_feature_survey UNION ALL "
               "SELECT timestamp FROM manage_app_survey UNION ALL "
               "SELECT timestamp FROM report_app_error_survey UNION ALL "
               "SELECT timestamp FROM report_app_status_survey);",
               0, 0, [&](sqlite3_stmt* r) { Seen(sqlite3_column_int64(r, 0)); });
    ForEachRow(db,
               "SELECT timestamp, time_zone, app_id, duration FROM use_app_survey "
               "WHERE timestamp >= ?1 AND timestamp < ?2 ORDER BY timestamp, _id;",
               lo_, hi_, [&](sqlite3_stmt* r) {
                 int64_t ts = sqlite3_column_int64(r, 0);
                 AddPeriod(&day_->apps, Text(r, 2), "", ZoneOf(Text(r, 1)),
                           ts - sqlite3_column_int64(r, 3), ts, false);
               });
    ForEachRow(db,
               "SELECT timestamp, time_zone, app_id, feature, extra, value "
               "FROM use_app_feature_survey WHERE timestamp >= ?1 AND timestamp < ?2;",
               lo_, hi_, [&](sqlite3_stmt* r) {
                 Feature(sqlite3_column_int64(r, 0), ZoneOf(Text(r, 1)), Text(r, 2), Text(r, 3),
                         Text(r, 4), r);
               });
    ForEachRow(db,
               "SELECT timestamp, time_zone, app_id, feature, extra, value "
               "FROM report_app_status_survey WHERE timestamp >= ?1 AND timestamp < ?2;",
               lo_, hi_, [&](sqlite3_stmt* r) {
                 std::string text =
                     "status " + Text(r, 3) + " extra=" + Text(r, 4) + " value=" + Text(r, 5);
                 AddMark(Mark::kRow, Text(r, 2), text, ZoneOf(Text(r, 1)),
                         sqlite3_column_int64(r, 0));
               });
    ForEachRow(
        db,
        "SELECT timestamp, time_zone, installed_app_id, type FROM manage_app_survey "
        "WHERE timestamp >= ?1 AND timestamp < ?2;",
        lo_, hi_, [&](sqlite3_stmt* r) {
          static const Mark::Kind kKinds[] = {Mark::kInstall, Mark::kUninstall, Mark::kUpdate};
          int64_t type = sqlite3_column_int64(r, 3);
          AddMark(type >= 0 && type <= 2 ? kKinds[type] : Mark::kPackage, "", Text(r, 2),
                  ZoneOf(Text(r, 1)), sqlite3_column_int64(r, 0));
        });
    ForEachRow(db,
               "SELECT timestamp, time_zone, app_id, type FROM report_app_error_survey "
               "WHERE timestamp >= ?1 AND timestamp < ?2;",
               lo_, hi_, [&](sqlite3_stmt* r) {
                 std::string text = Text(r, 2);
                 if (sqlite3_column_int64(r, 3) != 1) text += " (error type " + Text(r, 3) + ")";
                 AddMark(Mark::kCrash, "", text, ZoneOf(Text(r, 1)), sqlite3_column_int64(r, 0));
               });
  }

  void LoadQueue() {
    std::string problem;
    sqlite3* db = OpenReadOnly(kUploadDb, &problem);
    ForEachRow(db, "SELECT _id, timestamp, activity, body FROM survey_log ORDER BY _id;", 0, 0,
               [&](sqlite3_stmt* r) {
                 ++day_->queuedTotal;
                 Seen(sqlite3_column_int64(r, 1));
                 RawRecord raw;
                 raw.record.number = sqlite3_column_int(r, 0);
                 raw.record.activity = Text(r, 2);
                 raw.record.rank = Rank(raw.record.activity);
                 raw.record.when = StampText(sqlite3_column_int64(r, 1), day_->zone);
                 raw.pairs = SplitBody(Text(r, 3));
                 AddRecord(day_->dayStart, std::move(raw), &day_->queued, &dayIdentity_,
                           &anyIdentity_);
               });
    sqlite3_close(db);
  }

  void LoadOutbox() {
    char buf[4096];
    std::ifstream in(logmgr_fixed_path(kOutbox, buf, sizeof(buf)));
    int number = 0;
    for (std::string line; std::getline(in, line);) {
      std::map<int, std::string> items;
      if (line.empty() || !ParseOutboxRecord(line, &items)) continue;
      int64_t handedMs = strtoll(items[3].c_str(), nullptr, 10);
      Seen(handedMs);
      RawRecord raw;
      raw.record.number = ++number;
      raw.record.activity = items[4];
      raw.record.rank = Rank(items[4]);
      raw.record.when = StampText(handedMs, day_->zone);
      raw.pairs = SplitBody(items[7]);
      AddRecord(day_->dayStart, std::move(raw), &day_->relayed, &dayIdentity_, &anyIdentity_);
    }
  }

  // Periods the daemon holds open run, as far as anyone knows, until the latest recorded time.
  void LoadOpenPeriods() {
    std::string problem;
    sqlite3* db = OpenReadOnly(kStatusDb, &problem);
    ForEachRow(db,
               "SELECT feature, extra, timestamp FROM survey_status_monitor "
               "WHERE timestamp > 0 ORDER BY feature;",
               0, 0, [&](sqlite3_stmt* r) {
                 int64_t start = sqlite3_column_int64(r, 2);
                 AddPeriod(&day_->device, Text(r, 0), Text(r, 1), day_->zone, start,
                           std::max(start, latestMs_), true);
               });
    sqlite3_close(db);
  }

  void Finish() {
    std::stable_sort(day_->apps.begin(), day_->apps.end(),
                     [](const Period& a, const Period& b) { return a.full.start < b.full.start; });
    auto laneIndex = [](const std::string& code) {
      for (size_t i = 0; i < 6; ++i)
        if (code == kDeviceLanes[i].code) return i;
      return size_t{6};
    };
    std::stable_sort(day_->device.begin(), day_->device.end(),
                     [&](const Period& a, const Period& b) {
                       size_t la = laneIndex(a.lane), lb = laneIndex(b.lane);
                       return la != lb ? la < lb : a.full.start < b.full.start;
                     });
    std::stable_sort(day_->marks.begin(), day_->marks.end(),
                     [](const Mark& a, const Mark& b) { return a.at < b.at; });
    std::stable_sort(day_->queued.begin(), day_->queued.end(),
                     [](const Record& a, const Record& b) {
                       return a.rank != b.rank ? a.rank < b.rank : a.number < b.number;
                     });

    std::map<std::string, std::vector<Span>> perApp;
    for (const Period& p : day_->apps) perApp[p.lane].push_back(p.shown);
    std::map<std::string, int64_t> totals;
    for (const auto& [app, spans] : perApp) totals[app] = UnionLength(spans);
    if (totals.empty()) {
      // The day was condensed already: its app-use records still carry the sums.
      for (const auto* list : {&day_->relayed, &day_->queued}) {
        for (const Record& r : *list) {
          if (r.activity != "001") continue;
          std::string app, duration;
          for (const auto& [key, value] : r.fields) {
            if (key == "app_id") app = value;
            if (key == "duration") duration = value;
          }
          totals[app] += strtoll(duration.c_str(), nullptr, 10);
          day_->foregroundFromRecords = true;
        }
      }
    }
    day_->foreground.assign(totals.begin(), totals.end());
    std::stable_sort(day_->foreground.begin(), day_->foreground.end(),
                     [](const auto& a, const auto& b) { return a.second > b.second; });

    day_->identity = dayIdentity_;
    Identity* id = &day_->identity;
    for (auto [slot, fallback] : {std::pair{&id->model, &anyIdentity_.model},
                                  {&id->firmware, &anyIdentity_.firmware},
                                  {&id->mcc, &anyIdentity_.mcc},
                                  {&id->mnc, &anyIdentity_.mnc}}) {
      if (slot->empty()) *slot = *fallback;
    }
    if (id->mcc.empty() || id->mnc.empty()) SimFromModem(id);
    // Without any record, the device's own files still name the model and the build.
    for (auto [slot, key] : {std::pair{&id->model, SYSTEM_INFO_KEY_MODEL},
                             {&id->firmware, SYSTEM_INFO_KEY_BUILD_STRING}}) {
      char* value = nullptr;
      if (slot->empty() && system_info_get_value_string(key, &value) == SYSTEM_INFO_ERROR_NONE)
        *slot = value;
      free(value);
    }
  }

  void Seen(int64_t utcMs) { latestMs_ = std::max(latestMs_, utcMs); }

  DayData* day_;
  int64_t lo_ = 0, hi_ = 0;
  int64_t latestMs_ = 0;
  Identity dayIdentity_, anyIdentity_;
};

}  // namespace

std::string DeviceZone() {
  char buf[4096], target[4096];
  ssize_t n = readlink(logmgr_fixed_path("/opt/etc/localtime", buf, sizeof(buf)), target,
                       sizeof(target) - 1);
  if (n <= 0) return "";
  target[n] = '\0';
  const char* zone = strstr(target, "zoneinfo/");
  std::string name = zone != nullptr ? zone + strlen("zoneinfo/") : "";
  return IsZoneName(name) ? name : "";
}

int LoadDay(const std::string& date, DayData* day, std::string* problem) {
  day->zone = DeviceZone();
  if (date.empty()) {
    day->dayStart = DayOf(WallClockMs(NowMs(), day->zone));
  } else if (!ParseDate(date, &day->dayStart)) {
    *problem = "bad date '" + date + "': expected YYYY-MM-DD";
    return 2;
  }
  sqlite3* survey = OpenReadOnly(kSurveyDb, problem);
  if (survey == nullptr) return 3;
  DayLoader(day).Load(survey);
  sqlite3_close(survey);
  return 0;
}

}  // namespace daypage
