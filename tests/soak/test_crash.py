"""Crash consistency: LOGMGR_CRASH_ROUNDS times (default 100) SIGKILL at a random moment while
a caller inserts over the bus and a report run works (three finished days seeded every other
round, else a run asked for through the dump key). The files as the kill left them pass
integrity_check and tell what recovery must write: each open period closed at the latest stored
timestamp. After the restart a day record is handed over at most as often as the queue held it
unmarked, plus once if its table still held rows of its day (a day cut short is rebuilt).
"""
import datetime
import os
import random
import shutil
import signal
import sqlite3
import threading
import time
import logging
import unittest
from collections import Counter

import soak_support as ss
from harness import DeviceTestCase, wait_for

logging.getLogger("dbus.proxies").setLevel(logging.CRITICAL)  # introspection of a killed daemon
ROUNDS = int(os.environ.get("LOGMGR_CRASH_ROUNDS", "100"))
PERIODS = ("SCRN", "CHAR", "HEAD", "WIFI", "BLUE")
SEVEN_DAYS_MS = 604800000
TABLES = {"001": "use_app_survey", "002": "use_app_feature_survey", "003": "manage_app_survey",
          "004": "report_app_error_survey"}


def record_day(activity, body):
    """The day (UTC midnight) a day record was built from: a slice record is dated by its
    window's end, so by the next midnight for the day's last slice; an install by its row."""
    stamp = datetime.datetime.strptime(ss.body_pairs(body)["date"], "%Y-%m-%dT%H:%M:%S%z")
    seconds = int(stamp.timestamp()) - (0 if activity == "003" else 1)
    return ss.utc_midnight(seconds)


class CrashTest(DeviceTestCase):

    def setUp(self):
        os.environ["TZ"] = "UTC"
        time.tzset()
        super().setUp()
        self.dev.env["TZ"] = "UTC"
        self.dev.set_consent(True)
        self.dev.vconf_set("memory/pm/state", "int", "1")
        self.dev.vconf_set("memory/sysman/earjack", "int", "1")
        self.snap = os.path.join(self.dev.sysroot, "crashed")
        self.stop = threading.Event()
        self.inserted = 0
        self.seeded = 0

    def inserter(self):
        caller = None
        while not self.stop.is_set():
            try:
                caller = caller or ss.Caller(self.dev, "use_app_feature_survey")
                if caller.insert({"app_id": "crash.caller", "feature": "LOAD",
                                  "value": "1"}) is not None:
                    self.inserted += 1
                else:
                    caller.close()  # the daemon went away: bind to the next one
                    caller = None
            except Exception:
                if caller is not None:
                    caller.close()
                caller = None
                self.stop.wait(0.02)  # the name has no owner between a kill and a restart

    def seed(self, now):
        """Rows of the three finished days and a sent date that makes them due."""
        con = sqlite3.connect(self.dev.db_path(".SurveyLog.db"), timeout=10)
        rnd = random.Random(now)
        with con:
            for day in (3, 2, 1):
                base = ss.utc_midnight(now, day) * 1000
                for i in range(60):
                    # A second of its own per row (7919 is prime to 86400): two equal
                    # install records would look like one handed over twice.
                    self.seeded += 1
                    ts = base + (self.seeded * 7919 % 86400) * 1000 + rnd.randrange(1000)
                    con.execute("INSERT INTO use_app_survey(timestamp,app_id,duration) "
                                "VALUES (?,?,?)", (ts, f"com.app{i % 7}", rnd.randrange(9999)))
                    con.execute("INSERT INTO use_app_feature_survey(timestamp,app_id,feature,"
                                "extra,value) VALUES (?,?,?,?,?)",
                                (ts, "crash.seed", f"F{i % 5}", "", 1))
                    con.execute("INSERT INTO manage_app_survey(timestamp,installed_app_id,type)"
                                " VALUES (?,?,?)", (ts, f"pkg{i % 4}", i % 3))
                    con.execute("INSERT INTO report_app_error_survey(timestamp,app_id,type) "
                                "VALUES (?,?,?)", (ts, f"com.app{i % 3}", 1))
        con.close()
        con = sqlite3.connect(self.dev.db_path(".pref.db"), timeout=10)
        with con:
            con.execute("INSERT OR REPLACE INTO pref VALUES('key_sent_date', ?)",
                        (str(ss.utc_midnight(now, 4)),))
        con.close()

    def crashed_state(self):
        """Copies the files as the kill left them; what the recovery must write, from the copy."""
        shutil.rmtree(self.snap, ignore_errors=True)
        shutil.copytree(self.dev.path("/opt/usr/dbspace"), self.snap)
        self.assertEqual(ss.integrity(self.dev, self.snap),
                         {db: "ok" for db in ss.DATABASES}, "files after the kill")
        ends = [(ss.query(self.dev, ".SurveyLog.db", f"SELECT MAX(timestamp) FROM {t}",
                          self.snap) or [(0,)])[0][0] or 0 for t in ("use_app_survey", "manage_app_survey",
                                      "report_app_error_survey", "report_app_status_survey",
                                      "use_app_feature_survey")]
        opened = dict(ss.query(self.dev, ".StatusMonitor.db", "SELECT feature, timestamp FROM "
                               "survey_status_monitor", self.snap))
        shutdown = ss.pref(self.dev, "key_last_shutdown_time", self.snap) or 0
        end = shutdown * 1000 if shutdown >= 1 else max(ends + list(opened.values()) + [0])
        expected = {f: end - opened[f] for f in PERIODS
                    if (opened.get(f) or 0) > 0 and 1 <= end - opened[f] <= SEVEN_DAYS_MS}
        last_id = (ss.query(self.dev, ".SurveyLog.db", "SELECT MAX(_id) FROM "
                            "use_app_feature_survey", self.snap) or [(0,)])[0][0] or 0
        unmarked = Counter((a, b) for a, b, mark in ss.queue(self.dev, self.snap)
                           if a != "007" and mark != "success")
        days = {(table, day * 86400) for table in TABLES.values() for (day,) in ss.query(
            self.dev, ".SurveyLog.db", f"SELECT DISTINCT timestamp / 86400000 FROM {table}",
            self.snap)}
        return expected, last_id, unmarked, days

    def start(self):
        proc = self.dev.start_daemon()
        self.dev.daemon = proc
        self.assertIsNone(proc.poll(), "logmgrd did not start")
        return proc

    def test_kill_at_random_points(self):
        rnd = random.Random(12)
        feeder = threading.Thread(target=self.inserter)
        self.addCleanup(feeder.join)
        self.addCleanup(self.stop.set)
        proc = self.start()
        wait_for(lambda: len(ss.integrity(self.dev)) == len(ss.DATABASES), timeout=30,
                 message="the four databases")
        feeder.start()
        closed = sends = 0
        for rnd_no in range(ROUNDS + 1):
            last = rnd_no == ROUNDS
            proc.send_signal(signal.SIGKILL)
            self.dev.wait_exit(proc)
            expected, last_id, unmarked, days = self.crashed_state()
            if (rnd_no % 2 == 0 or last) and last_id:  # the tables exist
                now = time.time()
                self.seed(now)
                days |= {(t, ss.utc_midnight(now, d)) for t in TABLES.values() for d in (3, 2, 1)}
            before = len(ss.outbox(self.dev))
            proc = self.start()

            def recovered():
                rows = ss.query(self.dev, ".SurveyLog.db", "SELECT feature, value FROM "
                                "use_app_feature_survey WHERE _id > ?", args=(last_id,))
                return all((f, v) in rows for f, v in expected.items())
            wait_for(recovered, timeout=30, message=f"periods closed at the crash: {expected}")
            closed += len(expected)
            self.assertEqual(ss.integrity(self.dev), {db: "ok" for db in ss.DATABASES})
            if rnd_no % 2 == 1 and not last:
                self.dev.vconf_set("db/corvane-log-manager/dumpcontext", "int", "3")
            if not last:
                self.stop.wait(rnd.uniform(0, 0.6))  # the random kill point
            else:
                wait_for(lambda: any(a == "001" for a, _ in ss.outbox(self.dev)[before:]),
                         timeout=60, message="the last run's hand-over")
            handed = Counter(x for x in ss.outbox(self.dev)[before:] if x[0] != "007")
            sends += bool(handed)
            for (activity, body), count in handed.items():
                rebuilt = (TABLES[activity], record_day(activity, body)) in days
                self.assertLessEqual(count, unmarked[activity, body] + rebuilt,
                                     f"handed over too often: {(activity, body)}")
        self.stop.set()
        feeder.join()
        print(f"\ncrash: {ROUNDS} kills, {closed} periods closed by recovery, {sends} rounds "
              f"with hand-overs, {self.inserted} bus inserts committed", flush=True)
        self.assertGreater(sends, 0)


if __name__ == "__main__":
    unittest.main()
