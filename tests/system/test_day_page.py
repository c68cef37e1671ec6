"""The day page (logmgrctl day) of a day driven through the real daemon on a frozen clock in
Seoul: its lanes, bars and records read back from the HTML."""
import html.parser
import os
import shutil
import sqlite3
import subprocess
import tempfile
import time
import unittest
from unittest import mock

from harness import DBSPACE, Device, wait_for
from test_app_usage import MsClock, front_at_known_time, root_watched

ZONE = "Asia/Seoul"
DAY = "2026-03-10"  # the clock starts at 19:00 there
APPS = {"com.ex.alpha": "pkg.alpha", "com.ex.beta": "pkg.beta", "com.ex.gamma": "pkg.gamma",
        "com.corvane.lockscreen": "com.corvane.lockscreen"}
HOSTILE = ('"><script>document.documentElement.setAttribute("data-owned","1")</script>'
           "<img src=x onerror=\"document.documentElement.setAttribute('data-owned','2')\">&amp;")
CHROMIUM = "/usr/bin/chromium"


class Page(html.parser.HTMLParser):
    """Lanes with their bars and marks, foreground rows, record rows, scripts, texts."""

    def __init__(self, text):
        super().__init__()
        self.lanes, self.fg, self.rows, self.texts = {}, {}, {}, []
        self.scripts = 0  # script and img elements: the page's one script, nothing injected
        self.lane = self.section = self.row = self.key = None
        self.feed(text)

    def handle_starttag(self, tag, attrs):
        a = dict(attrs)
        if tag in ("script", "img"):
            self.scripts += 1
        if tag == "section":
            self.section = a.get("id")
            self.rows.setdefault(self.section, [])
        if "data-lane" in a:
            self.lane = self.lanes.setdefault(a["data-lane"], {"items": []})
        if tag == "rect" and ("bar" in a.get("class", "") or "mark" in a.get("class", "")):
            self.lane["items"].append(a)
        if "data-app" in a:
            self.fg[a["data-app"]] = int(a["data-ms"])
        if tag == "tr" and "data-activity" in a:
            self.row = {"activity": a["data-activity"]}
            self.rows[self.section].append(self.row)
        if tag == "span" and "data-key" in a and self.row is not None:
            self.key = a["data-key"]

    def handle_data(self, data):
        self.texts.append(data)
        if self.lasttag == "b" and self.row is not None and self.key:
            self.row[self.key] = data
            self.key = None

    def bars(self, lane):
        return [b for b in self.lanes[lane]["items"] if "bar" in b["class"]]


class DayPageTest(unittest.TestCase):
    """One day is driven once; the tests read the two pages it gave."""

    @classmethod
    def setUpClass(cls):
        env = mock.patch.dict(os.environ, {"TZ": ZONE, "LOGMGR_ZONE": ZONE})
        # Cleanups run last first: the zone is re-read after the environment is restored.
        cls.addClassCleanup(time.tzset)
        env.start()
        cls.addClassCleanup(env.stop)
        time.tzset()
        cls.dev = dev = Device(with_x=True)
        cls.addClassCleanup(dev.close)
        cls.out = tempfile.mkdtemp(prefix="logmgr-day-")
        cls.addClassCleanup(shutil.rmtree, cls.out, True)
        cls.clock = MsClock(dev)
        for app, package in APPS.items():
            dev.devsim("app", "install", app, "--package", package)
        os.makedirs(dev.path(DBSPACE), exist_ok=True)
        dev.set_consent(True)
        dev.vconf_set("memory/pm/state", "int", "3")  # the screen starts off
        dev.start_daemon(extra_env=cls.clock.env)
        cls.drive_day()
        cls.before = cls.render("before.html")
        cls.text_before = dev.run_tool("logmgrctl", "day", DAY).stdout
        cls.sums = dict(cls.rows("SELECT app_id, SUM(duration) FROM use_app_survey "
                                 "WHERE time_zone='Asia/Seoul' GROUP BY app_id"))
        cls.report()
        cls.after = cls.render("after.html")

    @classmethod
    def rows(cls, sql):
        return cls.dev.query(".SurveyLog.db", sql)

    @classmethod
    def drive_day(cls):
        dev, clock = cls.dev, cls.clock
        wait_for(lambda: dev.devsim("unlock") and cls.rows(
            "SELECT 1 FROM use_app_feature_survey WHERE feature='UNLO'"), timeout=30,
            interval=0.2, message="the device status monitor")
        pids = [int(dev.devsim("app", "launch", app).stdout) for app in APPS]
        aul = ("/aul/dbus_handler", "org.tizen.aul.signal.app_launch")
        wait_for(lambda: [dev.dbus_send("--type=signal", *aul, f"uint32:{p}") for p in pids]
                 and root_watched(dev.env["DISPLAY"]), timeout=30, interval=0.2,
                 message="the daemon to watch the root window")

        gamma = "SELECT duration FROM use_app_survey WHERE app_id='pkg.gamma' ORDER BY _id"
        front_at_known_time(dev, clock, lambda: cls.rows(gamma), "com.ex.alpha")
        cls.alpha_from = clock.now_ms
        for app, ms in (("com.ex.beta", 300000), ("com.corvane.lockscreen", 180000)):
            clock.advance_ms(ms)
            dev.devsim("app", "focus", app)
            wait_for(lambda: cls.rows(f"SELECT 1 FROM use_app_survey WHERE duration={ms}"),
                     message=f"the {ms} ms period")

        def feature(code):
            return lambda: cls.rows(f"SELECT 1 FROM use_app_feature_survey WHERE feature='{code}'")

        def opened(code):
            return lambda: dev.query(".StatusMonitor.db", "SELECT 1 FROM survey_status_monitor "
                                     f"WHERE feature='{code}' AND timestamp>0")
        for on, off, code, ms in ((("charger", "plug", "usb", "40"), ("charger", "unplug", "55"),
                                   "CHAR", 600000),
                                  (("earjack", "in"), ("earjack", "out"), "HEAD", 120000),
                                  (("wifi", "on"), ("wifi", "off"), "WIFI", 60000),
                                  (("screen", "on"), ("screen", "off"), "SCRN", 240000)):
            dev.devsim(*on)
            wait_for(opened(code), message=f"{code} open")
            clock.advance_ms(ms)
            dev.devsim(*off)
            wait_for(feature(code), message=f"{code} row")
        clock.advance_ms(60000)
        dev.devsim("screen", "on")  # left open
        cls.screen_open_from = clock.now_ms
        wait_for(opened("SCRN"), message="SCRN open again")
        dev.devsim("unlock")
        dev.devsim("capture")
        dev.devsim("pkg", "install", "com.example.face")
        dev.devsim("crash", "com.ex.beta")
        dev.run_tool("logmgrctl", "insert", "use_app_feature_survey", "app_id=com.ex.bus",
                     "feature=LIKE", "extra=x", "value=3")
        wait_for(lambda: feature("CAPT")() and feature("LIKE")()
                 and cls.rows("SELECT 1 FROM report_app_error_survey")
                 and cls.rows("SELECT 1 FROM manage_app_survey"), message="the events")
        # A row from a traveller in New York, holding markup: 04:30-05:00 there.
        con = sqlite3.connect(dev.db_path(".SurveyLog.db"), timeout=10)
        con.execute("INSERT INTO use_app_survey(timestamp,time_zone,app_id,duration) "
                    "VALUES(?,?,?,?)", (1773133200000, "America/New_York", HOSTILE, 1800000))
        con.commit()
        con.close()

    @classmethod
    def report(cls):
        """Past midnight the finished day goes to the relay."""
        cls.clock.advance_ms(6 * 3600 * 1000)
        outbox = cls.dev.path("/opt/usr/data/log-relay/outbox.jsonl")

        def sent():  # the summary goes first, so the send is over once the queue is empty
            if not os.path.exists(outbox):
                return False
            with open(outbox) as f:
                return '"007"' in f.read() and cls.dev.query(
                    ".ServerUploaderDB.db", "SELECT count(*) FROM survey_log") == [(0,)]

        def summary():
            cls.dev.vconf_set("memory/system/timechanged", "int", str(cls.clock.now_ms // 1000))
            try:
                return wait_for(sent, timeout=3)
            except AssertionError:
                return False
        wait_for(summary, timeout=60, interval=0, message="the day's report run")

    @classmethod
    def render(cls, name):
        path = os.path.join(cls.out, name)
        cls.dev.run_tool("logmgrctl", "day", DAY, "--html", path)
        with open(path) as f:
            return path, Page(f.read())

    @staticmethod
    def clock_text(ms):
        return time.strftime("%H:%M:%S", time.localtime(ms // 1000)) + f".{ms % 1000:03d}"

    def test_lanes_bars_and_marks_follow_the_rows(self):
        page = self.before[1]
        for lane in ("pkg.alpha", "pkg.beta", "pkg.gamma", HOSTILE, "SCRN", "CHAR", "HEAD", "WIFI",
                     "BLUE", "PKG", "CRASH", "UNLO · CAPT", "BAT1 · BAT2", "com.ex.bus"):
            self.assertIn(lane, page.lanes)
        self.assertNotIn("com.corvane.lockscreen", page.lanes)
        alpha = page.bars("pkg.alpha")
        self.assertIn(("300000", self.clock_text(self.alpha_from)),
                      [(b["data-ms"], b["data-start"]) for b in alpha])
        self.assertIn("180000", [b["data-ms"] for b in page.bars("pkg.beta")])
        for code, ms in (("CHAR", 600000), ("HEAD", 120000), ("WIFI", 60000), ("SCRN", 240000)):
            self.assertIn(str(ms), [b["data-ms"] for b in page.bars(code)], code)
        opened = [b for b in page.bars("SCRN") if "open" in b["class"]]
        self.assertEqual([b["data-start"] for b in opened],
                         [self.clock_text(self.screen_open_from)])
        # The traveller's row is placed on New York's clock, and its markup is only text.
        self.assertEqual([(b["data-start"], b["data-end"]) for b in page.bars(HOSTILE)],
                         [("04:30:00.000", "05:00:00.000")])
        self.assertEqual(page.scripts, 1)
        marks = {m["class"].split()[1] for lane in page.lanes.values() for m in lane["items"]
                 if "mark" in m["class"]}
        self.assertLessEqual({"install", "crash", "unlock", "capture", "plug", "unplug", "row"},
                             marks)
        self.assertIn("40%", page.texts)
        self.assertIn("55%", page.texts)
        # Foreground time per app: largest first, the rows' sums.
        self.assertEqual({k: v for k, v in page.fg.items() if k != HOSTILE}, self.sums)
        self.assertEqual(list(page.fg.values()), sorted(page.fg.values(), reverse=True))

    def test_relay_records_and_queue_after_the_report_run(self):
        page = self.after[1]
        relayed = page.rows["relayed"]
        self.assertEqual(relayed[0]["activity"], "007")
        self.assertEqual(relayed[0]["date"][:10], DAY)
        uses = {r["app_id"]: int(r["duration"]) for r in relayed if r["activity"] == "001"}
        # A retried probe may leave alpha an extra short row; the record sums whatever was stored.
        self.assertEqual(uses["pkg.alpha"], self.sums["pkg.alpha"])
        self.assertEqual(uses["pkg.beta"], 180000)
        self.assertLessEqual({"CHAR", "HEAD", "WIFI", "SCRN", "BAT1", "BAT2", "UNLO", "CAPT"},
                             {r["feature"] for r in relayed if r["activity"] == "002"})
        self.assertEqual(page.rows["queued"], [])
        # The rows are gone; the chart falls back to the records' sums.
        self.assertEqual(page.fg["pkg.alpha"], self.sums["pkg.alpha"])
        self.assertIn("From the relay records: the day's rows were condensed.", page.texts)
        self.assertTrue([b for b in page.bars("SCRN") if "open" in b["class"]])

    def test_text_summary_empty_day_and_bad_date(self):
        text = self.text_before
        self.assertRegex(text, r"\n  pkg\.beta +3 min 00 s\n")
        clock = r"\d\d:\d\d:\d\d\.\d{3}"
        self.assertRegex(text, rf"\n  CHAR +{clock} +{clock} +10 min 00 s +extra U\n")
        empty = os.path.join(self.out, "empty.html")
        self.dev.run_tool("logmgrctl", "day", "2026-03-01", "--html", empty)
        with open(empty) as f:
            self.assertIn("No data for 2026-03-01", "".join(Page(f.read()).texts))
        bad = self.dev.run_tool("logmgrctl", "day", "2026-02-30", check=False)
        self.assertEqual((bad.returncode, bad.stderr.count("\n")), (2, 1))


    @unittest.skipUnless(os.path.exists(CHROMIUM), "needs /usr/bin/chromium (scripts/deps --full)")
    def test_page_runs_in_chromium_without_script_errors_or_injected_markup(self):
        profile = tempfile.mkdtemp(prefix="chromium-", dir=self.out)
        dom = subprocess.run([CHROMIUM, "--headless", "--no-sandbox", "--disable-gpu",
                              f"--user-data-dir={profile}", "--enable-logging=stderr", "--v=0",
                              "--dump-dom", f"file://{self.before[0]}"],
                             capture_output=True, text=True, timeout=120)
        self.assertIn('data-ready="1"', dom.stdout.split(">", 2)[1])
        self.assertNotIn("data-owned", dom.stdout.split("<body", 1)[0])
        self.assertNotIn("Uncaught", dom.stderr)


if __name__ == "__main__":
    unittest.main()
