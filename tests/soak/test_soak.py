"""Soak: steady bus load and random device events for LOGMGR_SOAK_SECONDS (default 60) on a
clock LOGMGR_SOAK_SPEED times fast (default 4320: a day every 20 s), so report runs fall inside
the load. For the feature rows the callers write: stored rows are a subset of inserted minus
deleted, no report counts more rows of a 3-hour window than left the table from it (timestamps
learnt from Selects; an unseen row lies between its seen neighbours), and no row leaves the
table neither deleted nor reported (the load stays far below the row limit).
"""
import os
import random
import signal
import threading
import time
import unittest
from collections import Counter, defaultdict
from datetime import datetime

import soak_support as ss
from harness import DeviceTestCase, wait_for

SECONDS = float(os.environ.get("LOGMGR_SOAK_SECONDS", "60"))
SPEED = int(os.environ.get("LOGMGR_SOAK_SPEED", "4320"))
INSERT_RATE = float(os.environ.get("LOGMGR_SOAK_RATE", "60"))  # feature inserts per second
ROW_LIMIT = 5000
APPS = ("com.soak.alpha", "com.soak.beta", "com.soak.gamma")
WINDOW_MS = 3 * 3600 * 1000


class SoakTest(DeviceTestCase):
    WITH_X = True

    def setUp(self):
        os.environ["TZ"] = "UTC"
        time.tzset()
        super().setUp()
        self.dev.env["TZ"] = "UTC"
        for app in APPS:
            self.dev.devsim("app", "install", app, "--exec", f"/opt/usr/apps/{app}/bin/{app}")
        self.dev.vconf_set("memory/pm/state", "int", "1")
        self.dev.set_consent(True)
        self.stop = threading.Event()
        self.seen_ts = {}       # row id -> timestamp, every row any Select returned
        self.max_rows = 0
        self.selects = 0
        self.rss = []
        self.errors = []
        self.events = Counter()

    def feature_caller(self, caller):
        rnd = random.Random(1)
        interval = 1.0 / INSERT_RATE
        next_at = time.monotonic()
        while not self.stop.is_set():
            caller.insert({"app_id": "soak.feature", "feature": "LOAD", "extra": "",
                           "value": "1"})
            if caller.ids and rnd.random() < 0.2:
                caller.delete_id(rnd.choice(caller.ids[-200:]))
            next_at += interval
            delay = next_at - time.monotonic()
            if delay > 0:
                self.stop.wait(delay)  # pacing of the load, not a wait for a condition

    def status_caller(self, caller):
        rnd = random.Random(2)
        while not self.stop.is_set():
            feature = f"S{rnd.randrange(20)}"
            caller.insert({"app_id": "soak.status", "feature": feature,
                           "value": str(rnd.randrange(100))})
            if rnd.random() < 0.1:
                try:
                    caller.proxy.Delete(f"feature = '{feature}'")
                except Exception as e:
                    caller.failures.append(f"Delete: {e}")
            self.stop.wait(0.05)

    def selector(self, feature, status):
        while not self.stop.is_set():
            self.selects += 2
            rows = feature.select("_id,timestamp,app_id")
            if rows is not None:
                self.max_rows = max(self.max_rows, len(rows))
                for row in rows:
                    rid, ts, _app, _ = row.split(",")
                    self.seen_ts[int(rid)] = int(ts)
            keys = status.select("app_id,feature")
            if keys is not None and len(keys) != len(set(keys)):
                self.errors.append(f"status table holds a key twice: {sorted(keys)}")
            self.stop.wait(0.1)

    def device_events(self):
        rnd = random.Random(3)
        running = set()
        simple = [("screen", "off"), ("screen", "on"), ("screen", "dim"), ("earjack", "in"),
                  ("earjack", "out"), ("wifi", "on"), ("wifi", "off"), ("capture",), ("move",),
                  ("unlock",), ("lock",)]
        while not self.stop.is_set():
            kind = rnd.randrange(6)
            if kind < 2:
                args = rnd.choice(simple)
            elif kind == 2:
                args = rnd.choice([("charger", "plug", rnd.choice(["usb", "ac"]),
                                    str(rnd.randrange(100))),
                                   ("charger", "unplug", str(rnd.randrange(100)))])
            elif kind == 3:
                args = ("pkg", rnd.choice(["install", "update", "uninstall"]),
                        f"pkg.soak{rnd.randrange(5)}")
            elif kind == 4:
                args = ("crash", rnd.choice(APPS))
            else:
                app = rnd.choice(APPS)
                action = rnd.choice(["focus", "kill"]) if app in running else "launch"
                args = ("app", action, app)
                running.symmetric_difference_update({app} if action != "focus" else set())
            r = self.dev.devsim(*args, check=False)
            self.events[args[0]] += 1
            if r.returncode != 0:
                self.errors.append(f"devsim {' '.join(args)}: {r.stderr.strip()}")
        for app in running:
            self.dev.devsim("app", "kill", app, check=False)

    def sample_rss(self, pid):
        while not self.stop.is_set():
            if self.dev.daemon.poll() is not None:
                self.errors.append(f"logmgrd ended with {self.dev.daemon.returncode}")
                return
            self.rss.append(ss.vm_rss_kb(pid))
            self.stop.wait(0.5)

    def test_soak(self):
        start = ss.utc_midnight(time.time()) + 20 * 3600
        t0 = time.time()
        daemon = self.dev.start_daemon(extra_env=ss.clock_env(self.dev, start, SPEED))
        device_now = lambda: start + (time.time() - t0) * SPEED
        self.dev.wait_started()
        feature = ss.Caller(self.dev, "use_app_feature_survey")
        status = ss.Caller(self.dev, "report_app_status_survey")
        sel_f = ss.Caller(self.dev, "use_app_feature_survey")
        sel_s = ss.Caller(self.dev, "report_app_status_survey")
        threads = [threading.Thread(target=self.feature_caller, args=(feature,)),
                   threading.Thread(target=self.status_caller, args=(status,)),
                   threading.Thread(target=self.selector, args=(sel_f, sel_s)),
                   threading.Thread(target=self.device_events),
                   threading.Thread(target=self.sample_rss, args=(daemon.pid,))]
        for t in threads:
            t.start()
        self.stop.wait(SECONDS)  # the soak's length, not a wait for a condition
        self.stop.set()
        for t in threads:
            t.join(120)

        # Stop cleanly right after a finished report run (yesterday sent, queue empty), while
        # no midnight is near: no run can then be under way when the stop comes.
        def settled():
            now = device_now()
            hour = (now % 86400) / 3600
            return (2 <= hour <= 20 and ss.pref(self.dev, "key_sent_date") ==
                    ss.utc_midnight(now, 1) and not ss.queue(self.dev))
        wait_for(settled, timeout=120, interval=0.05, message="a finished report run")
        final = sel_f.select("_id,timestamp,app_id")
        for row in final or []:
            rid, ts, _app, _ = row.split(",")
            self.seen_ts[int(rid)] = int(ts)
        leaked = ss.sysv_mappings(daemon.pid)
        self.dev.signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(timeout=30), 0)

        self.assertEqual(self.errors, [])
        self.assertEqual(feature.failures + status.failures, [])
        # Open finding: under load a rare Select answers FALSE without an error (the segment
        # was not written); tolerated at under 1% of the Selects until it is understood.
        failed = sel_f.failures + sel_s.failures
        self.assertLess(len(failed), 0.01 * self.selects + 1, failed)
        self.assertEqual(leaked, [], "shared-memory segments still attached")
        self.assertEqual(ss.integrity(self.dev), {db: "ok" for db in ss.DATABASES})
        midnights = int(device_now() // 86400 - start // 86400)
        self.assertGreaterEqual(midnights, 2, "the clock did not pass several midnights")

        # Every device event source reached the relay through a report.
        sent = ss.outbox(self.dev)
        self.assertEqual(len(sent), len(set(sent)), "a record was handed over twice")
        self.assertLessEqual({"001", "002", "003", "004", "007"}, {a for a, _ in sent})
        features = {ss.body_pairs(b)["feature"] for a, b in sent if a == "002"}
        self.assertLessEqual({"SCRN", "CAPT", "UNLO", "HEAD", "WIFI", "CHAR", "LOAD"}, features)

        stats = self.account(feature, sent)
        self.report_numbers(stats, midnights)

    def account(self, caller, sent):
        stored = {r[0] for r in ss.query(self.dev, ".SurveyLog.db",
                  "SELECT _id FROM use_app_feature_survey WHERE app_id = 'soak.feature'")}
        inserted = set(caller.ids)
        self.assertEqual(len(inserted), len(caller.ids), "an id was returned twice")
        live = inserted - caller.deleted
        self.assertLessEqual(stored, live, "rows stored that no caller committed or kept")
        missing = sorted(live - stored)

        reported = Counter()
        for activity, body in sent + [(a, b) for a, b, _ in ss.queue(self.dev)]:
            pairs = ss.body_pairs(body)
            if activity == "002" and pairs.get("app_id") == "soak.feature":
                end = datetime.strptime(pairs["date"], "%Y-%m-%dT%H:%M:%S%z")
                reported[int(end.timestamp() * 1000)] += int(pairs["count"])

        # Each missing row falls in one window if seen, else somewhere between its neighbours.
        seen = sorted(self.seen_ts.items())
        known, maybe = Counter(), defaultdict(int)
        for rid in missing:
            if rid in self.seen_ts:
                known[self.window_end(self.seen_ts[rid])] += 1
                continue
            lower = max((ts for i, ts in seen if i < rid), default=None)
            upper = min((ts for i, ts in seen if i > rid), default=None)
            # Without a seen neighbour on one side it may belong to any window on that side.
            low = self.window_end(lower) if lower is not None else min(reported, default=0)
            high = self.window_end(upper) if upper is not None else max(reported, default=0)
            for end in range(low, high + 1, WINDOW_MS):
                maybe[end] += 1
        for end, count in reported.items():
            with self.subTest(window_end=end):
                self.assertGreaterEqual(known[end] + maybe[end], count, "reported too many")
                self.assertLessEqual(known[end], count, "rows of the window left unreported")
        total_reported = sum(reported.values())
        trimmed = len(missing) - total_reported
        self.assertLess(self.max_rows, ROW_LIMIT - 500, "the load reached the row limit")
        self.assertEqual(trimmed, 0, "rows left the table neither deleted nor reported")
        self.assertEqual(len(inserted) - len(caller.deleted) - trimmed - total_reported,
                         len(stored))
        return {"inserted": len(inserted), "deleted": len(caller.deleted),
                "reported": total_reported, "trimmed": trimmed, "stored": len(stored)}

    @staticmethod
    def window_end(ts):
        return (ts // WINDOW_MS + 1) * WINDOW_MS

    def report_numbers(self, stats, midnights):
        half = len(self.rss) // 2
        first, second = max(self.rss[:half]), max(self.rss[half:])
        print(f"\nsoak: {SECONDS:.0f}s at x{SPEED}, {midnights} midnights, "
              f"{sum(self.events.values())} device events, {self.selects} selects, rows {stats}, "
              f"max table {self.max_rows}, VmRSS max first half {first} kB, "
              f"second half {second} kB", flush=True)
        # Growth within the second half beyond caches already warm in the first is a leak.
        self.assertLessEqual(second, first * 1.10 + 2048, f"RSS grew: {self.rss}")


if __name__ == "__main__":
    unittest.main()
