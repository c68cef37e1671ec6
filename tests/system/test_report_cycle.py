"""The day cycle through the real daemon: what a report run aggregates, and how it ends when the
daemon is stopped or consent is withdrawn in the middle of it."""
import json
import os
import signal
import sqlite3
import threading
import time

import bus_client
from harness import DeviceTestCase, wait_for

SURVEY_DB = ".SurveyLog.db"
UPLOAD_DB = ".ServerUploaderDB.db"
PREF_DB = ".pref.db"
OUTBOX = "/opt/usr/data/log-relay/outbox.jsonl"


def midnight(days_ago):
    tm = time.localtime()
    return int(time.mktime((tm.tm_year, tm.tm_mon, tm.tm_mday - days_ago, 0, 0, 0, 0, 0, -1)))


class ReportCycleTest(DeviceTestCase):

    def setUp(self):
        os.environ["TZ"] = "UTC"
        time.tzset()
        super().setUp()
        self.dev.env["TZ"] = "UTC"
        self.dev.set_consent(True)

    def connect(self, name):
        con = sqlite3.connect(self.dev.db_path(name), timeout=10)
        con.isolation_level = None
        return con

    def pref(self, key):
        value = self.dev.pref(key)
        return int(value) if value is not None else None

    def outbox(self):
        path = self.dev.path(OUTBOX)
        if not os.path.exists(path):
            return []
        with open(path) as f:
            return [json.loads(line) for line in f if line.strip()]

    def summaries(self):
        """Dates of the daily size summaries handed to the relay, in order."""
        return [dict(p.split("=", 1) for p in i["7"].split("¶") if "=" in p)["date"][:10]
                for i in self.outbox() if i["4"] == "007"]

    def handed_over(self, days):
        wait_for(lambda: self.summaries() == days and self.dev.query(
            UPLOAD_DB, "SELECT count(*) FROM survey_log") == [(0,)], timeout=30,
                 message=f"{days} handed over")

    def prepared_device(self):
        """Runs the daemon once so its databases exist, then stops it."""
        proc = self.dev.start_daemon()
        wait_for(lambda: self.pref("key_sent_date") is not None, message="the first start")
        proc.send_signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(proc), 0)

    def seed_use_app(self, day_start, rows, apps=3):
        con = self.connect(SURVEY_DB)
        con.execute("BEGIN")
        for i in range(rows):
            ts = (day_start + 60 + (i * 10) % 86000) * 1000
            con.execute("INSERT INTO use_app_survey(timestamp,time_zone,app_id,duration) "
                        "VALUES(?,?,?,?)", (ts, "Etc/UTC", f"com.example.app{i % apps}", 1000 + i))
        con.execute("COMMIT")
        con.close()

    @staticmethod
    def day_text(seconds):
        return time.strftime("%Y-%m-%d", time.localtime(seconds))

    LONG_DAY = 12000  # rows of each day, each its own record

    def long_run(self):
        """Three due days of thousands of records each, with the run under way. A table's
        records become visible at its commit, so the first day's first table shows the run
        started while two days are still to go."""
        self.prepared_device()
        self.dev.set_pref("key_sent_date", midnight(4))
        for days_ago in (3, 2, 1):
            self.seed_use_app(midnight(days_ago), self.LONG_DAY, apps=self.LONG_DAY)
        proc = self.dev.start_daemon()
        wait_for(lambda: self.dev.query(UPLOAD_DB, "SELECT count(*) FROM survey_log")[0][0] > 20,
                 timeout=30, message="the run to be under way")
        return proc

    def test_sigterm_during_a_run_exits_quickly_and_keeps_every_row(self):
        proc = self.long_run()
        proc.send_signal(signal.SIGTERM)
        # Quickly means without finishing the run: a stop that waited for it would have purged
        # the last day and advanced the sent date to it.
        self.assertEqual(self.dev.wait_exit(proc), 0)
        for db in (SURVEY_DB, UPLOAD_DB, PREF_DB):
            self.assertEqual(self.dev.query(db, "PRAGMA integrity_check"), [("ok",)], db)
        self.assertIn(self.pref("key_sent_date"), (midnight(4), midnight(3), midnight(2)))
        # The last day was not reached: nothing of it was purged.
        day = self.LONG_DAY
        self.assertEqual(self.dev.query(SURVEY_DB, "SELECT count(*) FROM use_app_survey "
                                        "WHERE timestamp >= ?", (midnight(1) * 1000,)), [(day,)])
        # A day's records are queued whole or not at all, and a day's rows go only once its
        # records are queued: every row is either still there or a queued record.
        rows = self.dev.query(SURVEY_DB, "SELECT count(*) FROM use_app_survey")[0][0]
        queued = self.dev.query(UPLOAD_DB, "SELECT count(*) FROM survey_log "
                                "WHERE activity='001'")[0][0]
        self.assertGreater(queued, 0)
        self.assertLess(queued, 3 * day)
        self.assertEqual((rows % day, queued % day), (0, 0))
        self.assertGreaterEqual(rows + queued, 3 * day)

    def test_a_caller_busy_on_the_bus_during_a_run_costs_no_record_and_no_repeat(self):
        # Statements of the worker and of bus requests share one connection; a request's checks
        # once judged the worker's statements too, failing its purge mid-day.
        self.prepared_device()
        self.dev.set_pref("key_sent_date", midnight(4))
        for days_ago in (3, 2, 1):
            self.seed_use_app(midnight(days_ago), 8600, apps=20)  # all eight slices
        self.dev.start_daemon()
        stop = threading.Event()

        def caller():
            proxy = None
            while not stop.is_set():
                try:
                    proxy = proxy or bus_client.table_proxy(self.dev, bus_client.FEATURE)
                    proxy.Insert({"app_id": "busy", "feature": "LOAD", "value": "1"})
                except Exception:  # before the daemon serves the table
                    proxy = None
                    stop.wait(0.01)
        threads = [threading.Thread(target=caller) for _ in range(4)]
        for thread in threads:
            thread.start()
        try:
            self.handed_over([self.day_text(midnight(d)) for d in (3, 2, 1)])
        finally:
            stop.set()
            for thread in threads:
                thread.join()
        uses = [i["7"] for i in self.outbox() if i["4"] == "001"]
        self.assertEqual(len(uses), 3 * 8 * 20)
        self.assertEqual(len(set(uses)), len(uses))
        self.assertEqual(self.dev.query(SURVEY_DB, "SELECT count(*) FROM use_app_survey"), [(0,)])

    def test_sums_past_the_integer_limit_cost_no_other_record_of_the_day(self):
        self.prepared_device()
        proc = self.dev.start_daemon()
        wait_for(lambda: self.dev.query(SURVEY_DB, "SELECT count(*) FROM sqlite_master WHERE "
                                        "name='use_app_feature_survey'") == [(1,)],
                 message="the feature table")
        near_limit = str(2 ** 63 - 1000)
        rows = [("evil", "BIG", near_limit), ("evil", "BIG", near_limit), ("good", "SCRN", "100"),
                ("good", "SCRN", "250"), ("good", "WIFI", "7")]
        for app, feature, value in rows:
            self.dev.run_tool("logmgrctl", "insert", "use_app_feature_survey", f"app_id={app}",
                              f"feature={feature}", "extra=-", f"value={value}")
        proc.send_signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(proc), 0)
        # The callers' rows belong to yesterday's 06:00-09:00 slice, beside a day of app use.
        con = self.connect(SURVEY_DB)
        con.execute("UPDATE use_app_feature_survey SET timestamp=? WHERE app_id IN "
                    "('evil','good')", ((midnight(1) + 7 * 3600) * 1000,))
        con.close()
        self.seed_use_app(midnight(1), 6)
        self.dev.set_pref("key_sent_date", midnight(2))
        self.dev.start_daemon()
        self.handed_over([self.day_text(midnight(1))])

        def records(activity):
            return sorted((p["app_id"], p.get("feature", ""), p["count"], p.get("value", p.get(
                "duration"))) for p in (dict(x.split("=", 1) for x in i["7"].split("¶"))
                                        for i in self.outbox() if i["4"] == activity))
        # The callers' own record is there too, though its fields shift: a 19-digit value
        # renders without its comma (numbers are read back in 20 bytes).
        self.assertEqual(records("002")[1:], [("good", "SCRN", "2", "350"),
                                              ("good", "WIFI", "1", "7")])
        self.assertEqual(records("002")[0][:2], ("evil", "BIG"))
        self.assertEqual(records("001"), [(f"com.example.app{i}", "", "2", str(2003 + 2 * i))
                                          for i in range(3)])
        # Every row of the day went out in a record before it was purged.
        for table in ("use_app_survey", "use_app_feature_survey"):
            self.assertEqual(self.dev.query(SURVEY_DB, f"SELECT count(*) FROM {table} WHERE "
                                            "timestamp < ?", (midnight(0) * 1000,)), [(0,)])
        self.assertEqual(self.pref("key_sent_date"), midnight(1))

    def test_consent_withdrawn_during_a_run_lets_it_finish_then_exits(self):
        proc = self.long_run()
        self.dev.set_consent(False)
        self.assertEqual(self.dev.wait_exit(proc, timeout=120), 0)
        self.assertEqual(self.pref("key_sent_date"), midnight(1))
        self.assertEqual(self.summaries(), [self.day_text(midnight(d)) for d in (3, 2, 1)])


if __name__ == "__main__":
    import unittest
    unittest.main()
