#include "tools/logmgrctl/day_html.h"

#include <stdio.h>

#include <map>
#include <set>

namespace daypage {
namespace {

constexpr double kBoxWidth = 1000;  // viewBox units across every lane
constexpr double kMinBar = 3;       // a zero-length period still shows and can be hovered
constexpr double kMarkWidth = 6;
constexpr int kTrackPx = 18;

const char* const kPalette[] = {"#4e79a7", "#f28e2b", "#59a14f", "#e15759", "#76b7b2",
                                "#b07aa1", "#edc948", "#ff9da7", "#9c755f", "#79706e"};

const char kStyle[] = R"(
:root{--fg:#1d2330;--muted:#5d6678;--grid:#e4e7ed}
*{box-sizing:border-box}
body{font:14px/1.45 system-ui,-apple-system,"Segoe UI",Roboto,"Noto Sans",sans-serif;color:var(--fg);
 margin:0 auto;max-width:1100px;padding:12px 14px 48px;background:#fff}
h1{font-size:21px;margin:0 0 2px}h2{font-size:16px;margin:22px 0 6px}
.ident,.note{color:var(--muted);margin:2px 0}.empty{font-size:16px;padding:18px 0}
.lane{display:grid;grid-template-columns:180px 1fr;align-items:center;border-top:1px solid var(--grid)}
.lane .name{font-size:12px;white-space:nowrap;overflow:hidden;text-overflow:ellipsis;padding:2px 8px 2px 0}
.lane .name small{color:var(--muted)}
.track{position:relative}.track svg{display:block;width:100%}
.axis{border-top:0}.axis .track{height:20px}
.tick{position:absolute;top:2px;font-size:11px;color:var(--muted);transform:translateX(-50%)}
.tick.first{transform:none}.tick.last{transform:translateX(-100%)}
.grid{stroke:var(--grid);stroke-width:1}
.bar:hover,.mark:hover{stroke:#111;stroke-width:2}
.open{fill-opacity:.45;stroke-dasharray:4 3;stroke:#333;stroke-width:1}
.lvl{position:absolute;top:0;margin-left:5px;font-size:11px;line-height:16px;font-weight:600;pointer-events:none}
.lvl.low{top:17px}
.group{font-size:12px;font-weight:600;color:var(--muted);padding:8px 0 2px}
.fg{display:grid;grid-template-columns:180px 1fr 9em;align-items:center;gap:0 8px;margin:3px 0}
.fg .name{font-size:13px;overflow:hidden;text-overflow:ellipsis;white-space:nowrap}
.fg .num{font-variant-numeric:tabular-nums;text-align:right;font-size:13px}
.fg svg{display:block;width:100%;height:16px}
#tip{position:sticky;bottom:0;background:#f6f7f9;border:1px solid var(--grid);border-radius:4px;
 padding:6px 8px;margin-top:8px;font-size:13px;white-space:pre-line;min-height:2.2em}
.scroll{overflow-x:auto}
table{border-collapse:collapse;width:100%;font-size:13px}
th,td{text-align:left;vertical-align:top;padding:4px 6px;border-bottom:1px solid var(--grid)}
th{font-weight:600;color:var(--muted)}
.kv{display:inline-block;margin:0 10px 0 0;white-space:nowrap}.kv b{font-weight:600}
@media (max-width:640px){
 body{padding:8px 8px 48px}
 .lane{grid-template-columns:1fr}.lane .name{padding:3px 0 0}
 .axis .name{display:none}
 .fg{grid-template-columns:1fr 7.5em}.fg .name{grid-column:1/3}
 th.when,td.when{display:none}
 .kv{white-space:normal;overflow-wrap:anywhere}
}
)";

// Fills the readout on hover and on tap (phones have no hover); text only, never markup.
const char kScript[] = R"(
(function(){
  var tip=document.getElementById('tip');
  function show(e){
    var el=e.target.closest?e.target.closest('[data-tip]'):null;
    if(el&&tip)tip.textContent=el.getAttribute('data-tip');
  }
  document.addEventListener('mouseover',show);
  document.addEventListener('click',show);
  document.documentElement.setAttribute('data-ready','1');
})();
)";

std::string Fmt(const char* format, double a, double b = 0, double c = 0, double d = 0) {
  char text[128];
  snprintf(text, sizeof(text), format, a, b, c, d);
  return text;
}

// A time of the day as a clock; one outside it (a clipped period's far end) with its date.
std::string When(int64_t wall, int64_t dayStart) {
  if (DayOf(wall) == dayStart) return FormatClock(wall);
  return FormatDate(wall) + " " + FormatClock(wall);
}

const char* DeviceColor(const std::string& code) {
  static const std::map<std::string, const char*> kColors = {
      {"SCRN", "#e0a526"}, {"CHAR", "#59a14f"}, {"HEAD", "#b07aa1"},
      {"WIFI", "#4e79a7"}, {"BLUE", "#2f6fdb"}, {"CONN", "#79706e"}};
  auto it = kColors.find(code);
  return it != kColors.end() ? it->second : "#79706e";
}

const char* MarkColor(Mark::Kind kind) {
  switch (kind) {
    case Mark::kInstall:
      return "#2e8b57";
    case Mark::kUpdate:
      return "#2f6fdb";
    case Mark::kUninstall:
      return "#6b6b6b";
    case Mark::kCrash:
      return "#d62728";
    case Mark::kUnlock:
      return "#8e44ad";
    case Mark::kCapture:
      return "#17becf";
    case Mark::kPlug:
      return "#e07b00";
    case Mark::kUnplug:
      return "#a35a00";
    default:
      return "#555";
  }
}

class Page {
 public:
  explicit Page(const DayData& day) : day_(day) {
    std::vector<Span> drawn;
    for (const Period& p : day.apps) drawn.push_back(p.shown);
    for (const Period& p : day.device) drawn.push_back(p.shown);
    for (const Mark& m : day.marks) drawn.push_back({m.at, m.at});
    window_ = ViewWindow(drawn, day.dayStart);
    for (size_t i = 0; i < day.foreground.size(); ++i)
      colors_[day.foreground[i].first] = kPalette[i % 10];
  }

  std::string Render() {
    std::string date = FormatDate(day_.dayStart);
    out_ +=
        "<!DOCTYPE html>\n<html lang=\"en\"><head><meta charset=\"utf-8\">\n"
        "<meta name=\"viewport\" content=\"width=device-width, initial-scale=1\">\n"
        "<title>Device day " +
        date + "</title>\n<style>" + kStyle + "</style></head>\n<body>\n";
    Header(date);
    if (day_.Empty()) {
      out_ += "<p class=\"empty\" id=\"no-data\">No data for " + date +
              ": nothing was recorded, handed to the relay or queued for this day.</p>\n";
    } else {
      Timeline();
      Foreground();
      Records("relayed", "Handed to the relay", "handed over", day_.relayed);
      Records("queued", "Queue still waiting", "queued at", day_.queued);
    }
    out_ += "<script>" + std::string(kScript) + "</script>\n</body></html>\n";
    return out_;
  }

 private:
  void Header(const std::string& date) {
    const Identity& id = day_.identity;
    auto known = [](const std::string& v) { return v.empty() ? std::string("unknown") : v; };
    out_ += "<header><h1>Device day <time datetime=\"" + date + "\">" + date + "</time></h1>\n";
    out_ += "<p class=\"ident\" id=\"identity\">Model <b>" + EscapeHtml(known(id.model)) +
            "</b> · firmware <b>" + EscapeHtml(known(id.firmware)) + "</b> · SIM MCC <b>" +
            EscapeHtml(known(id.mcc)) + "</b> MNC <b>" + EscapeHtml(known(id.mnc)) +
            "</b> · times in " + EscapeHtml(day_.zone.empty() ? "local time" : day_.zone) +
            "</p></header>\n";
  }

  std::string X(Span span, double minWidth) const {
    Box box = Place(span, window_, kBoxWidth, minWidth);
    return Fmt("x=\"%.2f\" width=\"%.2f\"", box.x, box.width);
  }

  // The lane's row: its name, then an SVG stretched across the track with the hour grid.
  void OpenLane(const std::string& kind, const std::string& name, const std::string& note,
                int tracks) {
    int height = tracks * kTrackPx;
    out_ += "<div class=\"lane\" data-kind=\"" + kind + "\" data-lane=\"" + EscapeHtml(name) +
            "\"><span class=\"name\" title=\"" + EscapeHtml(name) + "\">" + EscapeHtml(name) +
            (note.empty() ? "" : " <small>" + note + "</small>") + "</span><div class=\"track\">" +
            "<svg viewBox=\"0 0 1000 " + std::to_string(height) +
            "\" preserveAspectRatio=\"none\" height=\"" + std::to_string(height) + "\">";
    for (int64_t t : ticks_) {
      double x = Place({t, t}, window_, kBoxWidth, 0).x;
      out_ +=
          Fmt("<line class=\"grid\" x1=\"%.2f\" x2=\"%.2f\" y1=\"0\" y2=\"%.0f\" "
              "vector-effect=\"non-scaling-stroke\"/>",
              x, x, height);
    }
  }

  void Bars(const std::vector<const Period*>& periods, const char* color) {
    std::vector<Span> spans;
    for (const Period* p : periods) spans.push_back(p->shown);
    int tracks;
    std::vector<int> track = AssignTracks(spans, &tracks);
    for (size_t i = 0; i < periods.size(); ++i) {
      const Period& p = *periods[i];
      std::string tip = p.lane + (p.extra.empty() ? "" : " (" + p.extra + ")") + "\n" +
                        When(p.full.start, day_.dayStart) + " – " +
                        When(p.full.end, day_.dayStart) + (p.open ? " (still open)" : "") + "\n" +
                        FormatDuration(p.recordedMs) + " (" + std::to_string(p.recordedMs) + " ms)";
      if (p.shown.start != p.full.start || p.shown.end != p.full.end) tip += ", clipped to the day";
      if (p.zone != day_.zone) tip += "\ntimes in " + p.zone;
      out_ +=
          "<rect class=\"bar" + std::string(p.open ? " open" : "") + "\" " + X(p.shown, kMinBar) +
          Fmt(" y=\"%.0f\" height=\"%.0f\"", track[i] * kTrackPx + 2, kTrackPx - 4) + " fill=\"" +
          color + "\" data-start=\"" + When(p.full.start, day_.dayStart) + "\" data-end=\"" +
          When(p.full.end, day_.dayStart) + "\" data-ms=\"" + std::to_string(p.recordedMs) +
          "\" data-shown-ms=\"" + std::to_string(p.shown.end - p.shown.start) + "\" data-tip=\"" +
          EscapeHtml(tip) + "\"><title>" + EscapeHtml(tip) + "</title></rect>";
    }
  }

  void Marks(const std::string& name, const std::string& note,
             const std::vector<const Mark*>& marks, bool levels) {
    int levelCount = 0;
    OpenLane("marks", name, note, levels ? 2 : 1);
    std::string labels;
    for (const Mark* m : marks) {
      std::string tip = std::string(MarkName(m->kind)) + (m->text.empty() ? "" : " " + m->text) +
                        "\n" + FormatClock(m->at) + (m->zone != day_.zone ? " " + m->zone : "");
      out_ += "<rect class=\"mark " + std::string(MarkName(m->kind)) + "\" " +
              X({m->at, m->at}, kMarkWidth) + " y=\"1\" height=\"" +
              std::to_string((levels ? 2 : 1) * kTrackPx - 2) + "\" fill=\"" + MarkColor(m->kind) +
              "\" data-at=\"" + FormatClock(m->at) + "\" data-tip=\"" + EscapeHtml(tip) +
              "\"><title>" + EscapeHtml(tip) + "</title></rect>";
      if (levels) {
        double x = Place({m->at, m->at}, window_, 100, 0).x;
        // Alternate rows, so that the levels of a short charge do not print over each other.
        labels += std::string("<span class=\"lvl") + ((++levelCount % 2) == 0 ? " low" : "") +
                  Fmt("\" style=\"left:%.2f%%\">", x) +
                  EscapeHtml(m->text.substr(0, m->text.find(' '))) + "%</span>";
      }
    }
    out_ += "</svg>" + labels + "</div></div>\n";
  }

  void Timeline() {
    ticks_ = Ticks(window_, 8);
    out_ += Fmt("<section id=\"timeline\" data-window-start=\"%.0f\" data-window-end=\"%.0f\">",
                window_.start - day_.dayStart, window_.end - day_.dayStart);
    out_ += "<h2>Timeline " + FormatHourMinute(window_.start, day_.dayStart) + "–" +
            FormatHourMinute(window_.end, day_.dayStart) + "</h2>\n";
    out_ += "<div class=\"lane axis\"><span class=\"name\"></span><div class=\"track\">";
    for (size_t i = 0; i < ticks_.size(); ++i) {
      double x = Place({ticks_[i], ticks_[i]}, window_, 100, 0).x;
      const char* edge = x <= 0.5 ? " first" : x >= 99.5 ? " last" : "";
      out_ += std::string("<span class=\"tick") + edge + Fmt("\" style=\"left:%.2f%%\">", x) +
              FormatHourMinute(ticks_[i], day_.dayStart) + "</span>";
    }
    out_ += "</div></div>\n";

    out_ += "<div class=\"group\">Apps in front</div>\n";
    if (day_.apps.empty()) {
      out_ += day_.foregroundFromRecords
                  ? "<p class=\"note\">No foreground rows left: the day was condensed into the "
                    "relay records below.</p>\n"
                  : "<p class=\"note\">No foreground periods recorded.</p>\n";
    }
    std::map<std::string, std::vector<const Period*>> byApp;
    std::vector<std::string> order;
    for (const Period& p : day_.apps) {
      if (byApp[p.lane].empty()) order.push_back(p.lane);
      byApp[p.lane].push_back(&p);
    }
    for (const std::string& app : order) Lane("app", app, "", byApp[app], colors_[app]);

    out_ += "<div class=\"group\">Device</div>\n";
    for (const DeviceLane& lane : kDeviceLanes) {
      std::vector<const Period*> periods;
      for (const Period& p : day_.device)
        if (p.lane == lane.code) periods.push_back(&p);
      if (periods.empty() && std::string(lane.code) == "CONN") continue;
      Lane("device", lane.code, lane.meaning, periods, DeviceColor(lane.code));
    }
    struct MarkLane {
      const char* name;
      const char* note;
      std::set<Mark::Kind> kinds;
    };
    const MarkLane kMarkLanes[] = {
        {"PKG",
         "install · update · uninstall",
         {Mark::kInstall, Mark::kUpdate, Mark::kUninstall, Mark::kPackage}},
        {"CRASH", "app crashes", {Mark::kCrash}},
        {"UNLO · CAPT", "unlock · capture", {Mark::kUnlock, Mark::kCapture}},
        {"BAT1 · BAT2", "battery", {Mark::kPlug, Mark::kUnplug}},
    };
    for (const MarkLane& lane : kMarkLanes) {
      std::vector<const Mark*> marks;
      for (const Mark& m : day_.marks)
        if (lane.kinds.count(m.kind) != 0) marks.push_back(&m);
      Marks(lane.name, lane.note, marks, lane.kinds.count(Mark::kPlug) != 0);
    }
    std::map<std::string, std::vector<const Mark*>> rows;
    for (const Mark& m : day_.marks)
      if (m.kind == Mark::kRow) rows[m.lane].push_back(&m);
    if (!rows.empty()) out_ += "<div class=\"group\">Rows written over the bus</div>\n";
    for (const auto& [app, marks] : rows) Marks(app, "", marks, false);
    out_ += "<div id=\"tip\">Hover or tap a bar or a mark for its exact times.</div></section>\n";
  }

  void Lane(const std::string& kind, const std::string& name, const std::string& note,
            const std::vector<const Period*>& periods, const char* color) {
    std::vector<Span> spans;
    for (const Period* p : periods) spans.push_back(p->shown);
    int tracks;
    AssignTracks(spans, &tracks);
    OpenLane(kind, name, note, tracks);
    Bars(periods, color);
    out_ += "</svg></div></div>\n";
  }

  void Foreground() {
    out_ += "<section id=\"foreground\"><h2>Foreground time per app</h2>\n";
    if (day_.foregroundFromRecords)
      out_ += "<p class=\"note\">From the relay records: the day's rows were condensed.</p>\n";
    if (day_.foreground.empty()) out_ += "<p class=\"note\">No foreground time.</p>\n";
    int64_t most = day_.foreground.empty() ? 1 : std::max<int64_t>(day_.foreground[0].second, 1);
    for (const auto& [app, ms] : day_.foreground) {
      auto it = colors_.find(app);
      out_ += "<div class=\"fg\" data-app=\"" + EscapeHtml(app) + "\" data-ms=\"" +
              std::to_string(ms) + "\"><span class=\"name\" title=\"" + EscapeHtml(app) + "\">" +
              EscapeHtml(app) +
              "</span><svg viewBox=\"0 0 1000 16\" preserveAspectRatio=\"none\">" +
              Fmt("<rect x=\"0\" y=\"1\" height=\"14\" width=\"%.2f\" ",
                  std::max(2.0, kBoxWidth * static_cast<double>(ms) / most)) +
              "fill=\"" + (it != colors_.end() ? it->second : kPalette[0]) + "\"/></svg>" +
              "<span class=\"num\">" + FormatDuration(ms) + "</span></div>\n";
    }
    out_ += "</section>\n";
  }

  void Records(const char* id, const char* title, const char* whenTitle,
               const std::vector<Record>& records) {
    out_ += std::string("<section id=\"") + id + "\"><h2>" + title + " (" +
            std::to_string(records.size()) + ")</h2>\n";
    if (std::string(id) == "queued") {
      out_ += "<p class=\"note\">" + std::to_string(day_.queuedTotal) +
              " record(s) in the queue in all.</p>\n";
    }
    if (records.empty()) {
      out_ += "</section>\n";
      return;
    }
    out_ += std::string(
                "<div class=\"scroll\"><table><thead><tr><th>#</th><th>rank</th>"
                "<th>activity</th><th class=\"when\">") +
            whenTitle + "</th><th>fields</th></tr></thead><tbody>\n";
    for (const Record& r : records) {
      out_ += "<tr data-activity=\"" + EscapeHtml(r.activity) + "\"><td>" +
              std::to_string(r.number) + "</td><td>" + std::to_string(r.rank) + "</td><td>" +
              EscapeHtml(r.activity) + " " + ActivityName(r.activity) + "</td><td class=\"when\">" +
              EscapeHtml(r.when) + "</td><td>";
      for (const auto& [key, value] : r.fields) {
        out_ += "<span class=\"kv\" data-key=\"" + EscapeHtml(key) + "\">" + EscapeHtml(key) +
                "=<b>" + EscapeHtml(value) + "</b></span>";
      }
      out_ += "</td></tr>\n";
    }
    out_ += "</tbody></table></div></section>\n";
  }

  const DayData& day_;
  Span window_;
  std::vector<int64_t> ticks_;
  std::map<std::string, const char*> colors_;
  std::string out_;
};

}  // namespace

std::string EscapeHtml(const std::string& text) {
  std::string out;
  out.reserve(text.size());
  for (char c : text) {
    switch (c) {
      case '&':
        out += "&amp;";
        break;
      case '<':
        out += "&lt;";
        break;
      case '>':
        out += "&gt;";
        break;
      case '"':
        out += "&quot;";
        break;
      case '\'':
        out += "&#39;";
        break;
      default:
        out.push_back(c);
    }
  }
  return out;
}

std::string RenderHtml(const DayData& day) { return Page(day).Render(); }

}  // namespace daypage
