#!/usr/bin/python3
"""Footprint of logmgrd on the simulated device (with Xvfb): idle RSS, wakeups while idle, and
the daemon's CPU time per 10,000 Inserts over the bus against its floor: the daemon's CPU for
as many Peer.Ping round trips (a call its connection answers with no handler) plus the CPU of
as many bare prepared SQLite inserts of the same row (WAL, synchronous NORMAL, autocommit).

  bench/footprint.py [IDLE_SECONDS] [INSERTS]    (defaults 60 and 10000; scripts/build first)

Wakeups are the growth of each thread's run count (/proc/<pid>/task/*/schedstat, third field);
the daemon's CPU is the sum of its threads' run time (first field, in ns). The three kinds of
work run in chunks, taking turns, so that machine load falls on all of them alike; the bare
inserts run in this process (sqlite3's executemany, one statement prepared once) and count this
thread's CPU.
"""
import glob
import importlib.machinery
import os
import sqlite3
import sys
import tempfile
import time

import dbus

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, "..", "tests", "system"))
from bus_client import FEATURE, table_proxy  # noqa: E402
from harness import Device, wait_for  # noqa: E402

footprint = importlib.machinery.SourceFileLoader(
    "footprint", os.path.join(HERE, "..", "scripts", "footprint")).load_module()
TICK = os.sysconf("SC_CLK_TCK")


def thread_runs(pid):
    out = {}
    for path in glob.glob(f"/proc/{pid}/task/*/schedstat"):
        task = path.split("/")[4]
        try:
            with open(path) as f:
                runs = int(f.read().split()[2])
            with open(f"/proc/{pid}/task/{task}/comm") as f:
                out[f"{task} {f.read().strip()}"] = runs
        except (OSError, IndexError):
            pass  # a thread that ended meanwhile
    return out


def cpu_seconds(pid):
    """Run time of the daemon's live threads, in seconds."""
    total = 0
    for path in glob.glob(f"/proc/{pid}/task/*/schedstat"):
        try:
            with open(path) as f:
                total += int(f.read().split()[0])
        except (OSError, IndexError):
            pass  # a thread that ended meanwhile
    return total / 1e9


class BareInserts:
    """Autocommitted inserts of the provider's row into a table of the same shape, WAL + NORMAL,
    through one statement prepared once."""

    def __init__(self, directory):
        self.con = sqlite3.connect(os.path.join(directory, "bare.db"), isolation_level=None)
        self.con.execute("PRAGMA journal_mode=WAL")
        self.con.execute("PRAGMA synchronous=NORMAL")
        self.con.execute("CREATE TABLE t(_id INTEGER PRIMARY KEY AUTOINCREMENT, timestamp "
                         "INTEGER, time_zone TEXT, app_id TEXT, feature TEXT, extra TEXT, "
                         "value INTEGER)")
        self.done = 0

    def run(self, count):
        """This thread's CPU seconds for |count| inserts."""
        now = int(time.time() * 1000)
        rows = [(now, "Etc/UTC", "bench", "F", str(self.done + i)) for i in range(count)]
        start = time.thread_time()
        self.con.executemany("INSERT INTO t(timestamp,time_zone,app_id,feature,value) "
                             "VALUES(?,?,?,?,?)", rows)
        used = time.thread_time() - start
        self.done += count
        return used

    def close(self):
        self.con.close()


def main():
    window = float(sys.argv[1]) if len(sys.argv) > 1 else 60.0
    inserts = int(sys.argv[2]) if len(sys.argv) > 2 else 10000
    dev = Device(with_x=True)
    try:
        dev.set_consent(True)
        proc = dev.start_daemon()
        dev.wait_started()
        wait_for(lambda: dev.query(".SurveyLog.db", "SELECT COUNT(*) FROM sqlite_master WHERE "
                                   "name LIKE '%_survey'") == [(5,)], message="the tables")
        time.sleep(3)  # the start settles before the idle window opens
        before = thread_runs(proc.pid)
        time.sleep(window)
        after = thread_runs(proc.pid)
        woke = {t: after[t] - before.get(t, 0) for t in after if after[t] != before.get(t, 0)}
        total = sum(woke.values())
        rss_kb = int(footprint.status(proc.pid, "VmRSS"))
        print(f"idle RSS: {rss_kb / 1024:.1f} MB "
              f"(private dirty {footprint.private_dirty_kb(proc.pid) / 1024:.1f} MB), "
              f"threads: {footprint.status(proc.pid, 'Threads')}")
        print(f"idle wakeups: {total} in {window:.0f} s ({total * 60 / window:.1f} per minute)"
              + "".join(f"\n  thread {t}: {n}" for t, n in sorted(woke.items())))

        proxy = table_proxy(dev, FEATURE)
        bus = dbus.bus.BusConnection(dev.env["DBUS_SYSTEM_BUS_ADDRESS"])
        chunk = 500
        rounds = max(1, inserts // chunk)
        used = {"insert": 0.0, "ping": 0.0, "bare": 0.0}
        done = {"insert": 0, "ping": 0}

        def bus_chunk(kind):
            cpu0 = cpu_seconds(proc.pid)
            for _ in range(chunk):
                if kind == "insert":
                    proxy.Insert({"app_id": "bench", "feature": "F", "value": str(done[kind])})
                else:
                    bus.call_blocking("com.corvane.logmgr", "/", "org.freedesktop.DBus.Peer",
                                      "Ping", "", ())
                done[kind] += 1
            used[kind] += cpu_seconds(proc.pid) - cpu0

        with tempfile.TemporaryDirectory() as d:
            bare = BareInserts(d)

            def bare_chunk():
                used["bare"] += bare.run(chunk)

            steps = [lambda: bus_chunk("insert"), lambda: bus_chunk("ping"), bare_chunk]
            bus_chunk("insert")  # warm-up, not counted
            bus_chunk("ping")
            for kind in used:
                used[kind] = 0.0
            wall0 = time.monotonic()
            for r in range(rounds):
                for k in range(3):
                    steps[(r + k) % 3]()
            wall = time.monotonic() - wall0
            bare.close()
        calls = rounds * chunk
        floor = used["ping"] + used["bare"]
        per = 10000 / calls
        print(f"{calls} calls of each kind, in chunks of {chunk} taking turns ({wall:.1f} s); "
              f"CPU per 10,000:")
        print(f"  daemon, bus Inserts:                 {used['insert'] * per * 1000:8.0f} ms "
              f"({used['insert'] * 1e6 / calls:.1f} us each)")
        print(f"  daemon, Peer.Ping round trips:       {used['ping'] * per * 1000:8.0f} ms")
        print(f"  bare prepared SQLite inserts:        {used['bare'] * per * 1000:8.0f} ms")
        print(f"  floor (Ping + bare insert):          {floor * per * 1000:8.0f} ms")
        print(f"  ratio bus Insert / floor:            {used['insert'] / floor:8.2f}")
        rss_after = int(footprint.status(proc.pid, "VmRSS"))
        print(f"RSS after the inserts: {rss_after / 1024:.1f} MB")
    finally:
        dev.close()


if __name__ == "__main__":
    main()
