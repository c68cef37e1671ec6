#include "tools/logmgrctl/day_view.h"

#include <errno.h>
#include <stdio.h>
#include <string.h>

#include <string>
#include <vector>

#include "tools/logmgrctl/day_data.h"
#include "tools/logmgrctl/day_html.h"

namespace daypage {
namespace {

using Table = std::vector<std::vector<std::string>>;

// Columns padded to their widest cell, two blanks apart; the last one is not padded.
void PrintTable(const Table& rows) {
  std::vector<size_t> widths;
  for (const auto& row : rows) {
    if (widths.size() < row.size()) widths.resize(row.size(), 0);
    for (size_t c = 0; c + 1 < row.size(); ++c) widths[c] = std::max(widths[c], row[c].size());
  }
  for (const auto& row : rows) {
    std::string line = " ";
    for (size_t c = 0; c < row.size(); ++c) {
      line += " " + row[c];
      if (c + 1 < row.size()) line += std::string(widths[c] - row[c].size() + 1, ' ');
    }
    while (!line.empty() && line.back() == ' ') line.pop_back();
    printf("%s\n", line.c_str());
  }
}

std::string Clock(int64_t wall, int64_t dayStart) {
  return DayOf(wall) == dayStart ? FormatClock(wall) : FormatDate(wall) + " " + FormatClock(wall);
}

void PrintPeriods(const char* title, const std::vector<Period>& periods, int64_t dayStart) {
  printf("\n%s\n", title);
  if (periods.empty()) printf("  none\n");
  Table rows;
  for (const Period& p : periods) {
    std::string note = p.extra.empty() ? "" : "extra " + p.extra;
    if (p.open) note += note.empty() ? "still open" : ", still open";
    rows.push_back({p.lane, Clock(p.full.start, dayStart), Clock(p.full.end, dayStart),
                    FormatDuration(p.recordedMs), note});
  }
  PrintTable(rows);
}

void PrintRecords(const char* title, const std::vector<Record>& records) {
  printf("\n%s (%zu)\n", title, records.size());
  Table rows = {{"#", "rank", "activity", "time", "fields"}};
  for (const Record& r : records) {
    std::string fields;
    for (const auto& [key, value] : r.fields)
      fields += (fields.empty() ? "" : "  ") + key + "=" + value;
    rows.push_back({std::to_string(r.number), std::to_string(r.rank),
                    r.activity + " " + ActivityName(r.activity), r.when, fields});
  }
  if (!records.empty()) PrintTable(rows);
}

void PrintText(const DayData& day) {
  const Identity& id = day.identity;
  auto known = [](const std::string& v) { return v.empty() ? std::string("unknown") : v; };
  printf("Device day %s, times in %s\n", FormatDate(day.dayStart).c_str(),
         day.zone.empty() ? "local time" : day.zone.c_str());
  printf("Model %s, firmware %s, SIM MCC %s MNC %s\n", known(id.model).c_str(),
         known(id.firmware).c_str(), known(id.mcc).c_str(), known(id.mnc).c_str());
  if (day.Empty()) {
    printf("No data for %s: nothing was recorded, handed to the relay or queued for this day.\n",
           FormatDate(day.dayStart).c_str());
    return;
  }
  printf(
      "\nForeground time per app%s\n",
      day.foregroundFromRecords ? " (from the relay records: the day's rows were condensed)" : "");
  if (day.foreground.empty()) printf("  none\n");
  Table rows;
  for (const auto& [app, ms] : day.foreground) rows.push_back({app, FormatDuration(ms)});
  PrintTable(rows);
  PrintPeriods("Apps in front", day.apps, day.dayStart);
  PrintPeriods("Device", day.device, day.dayStart);
  printf("\nEvents\n");
  if (day.marks.empty()) printf("  none\n");
  rows.clear();
  for (const Mark& m : day.marks) {
    rows.push_back(
        {FormatClock(m.at), MarkName(m.kind), m.lane.empty() ? m.text : m.lane + " " + m.text});
  }
  PrintTable(rows);
  PrintRecords("Handed to the relay", day.relayed);
  PrintRecords("Queue still waiting", day.queued);
  printf("  %d record(s) in the queue in all\n", day.queuedTotal);
}

int Usage(const std::string& problem) {
  fprintf(stderr, "logmgrctl: %s (see logmgrctl --help)\n", problem.c_str());
  return 2;
}

}  // namespace
}  // namespace daypage

int RunDayCommand(int argc, char** argv) {
  using namespace daypage;
  std::string date;
  const char* html = nullptr;
  for (int i = 1; i < argc; ++i) {
    if (strcmp(argv[i], "--html") == 0) {
      if (i + 1 >= argc) return Usage("--html needs a FILE");
      html = argv[++i];
    } else if (strncmp(argv[i], "--", 2) == 0) {
      return Usage(std::string("unknown option ") + argv[i]);
    } else if (date.empty()) {
      date = argv[i];
    } else {
      return Usage("day takes one DATE");
    }
  }
  DayData day;
  std::string problem;
  int code = LoadDay(date, &day, &problem);
  if (code != 0) {
    fprintf(stderr, "logmgrctl: %s\n", problem.c_str());
    return code;
  }
  if (html == nullptr) {
    PrintText(day);
    return 0;
  }
  std::string page = RenderHtml(day);
  FILE* f = fopen(html, "we");
  bool written = f != nullptr && fwrite(page.data(), 1, page.size(), f) == page.size();
  if (f != nullptr && fclose(f) != 0) written = false;
  if (!written) {
    fprintf(stderr, "logmgrctl: cannot write %s: %s\n", html, strerror(errno));
    return 1;
  }
  return 0;
}
