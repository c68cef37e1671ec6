#!/usr/bin/python3
"""Footprint of logmgrd on the simulated device (with Xvfb): idle RSS, wakeups while idle, and
CPU time per 10,000 Inserts over the bus against 10,000 bare SQLite inserts of the same row.

  bench/footprint.py [IDLE_SECONDS] [INSERTS]    (defaults 60 and 10000; scripts/build first)

Wakeups are the growth of each thread's run count (/proc/<pid>/task/*/schedstat, third field);
CPU is utime + stime of the daemon from /proc/<pid>/stat.
"""
import glob
import importlib.machinery
import os
import sqlite3
import sys
import tempfile
import time

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
    with open(f"/proc/{pid}/stat") as f:
        fields = f.read().rsplit(")", 1)[1].split()
    return (int(fields[11]) + int(fields[12])) / TICK


def bare_inserts(count):
    """CPU seconds of |count| autocommitted inserts of the provider's row, WAL + NORMAL."""
    with tempfile.TemporaryDirectory() as d:
        con = sqlite3.connect(os.path.join(d, "bare.db"), isolation_level=None)
        con.execute("PRAGMA journal_mode=WAL")
        con.execute("PRAGMA synchronous=NORMAL")
        con.execute("CREATE TABLE t(_id INTEGER PRIMARY KEY AUTOINCREMENT, timestamp INTEGER, "
                    "time_zone TEXT, app_id TEXT, feature TEXT, extra TEXT, value INTEGER)")
        start = time.process_time()
        for i in range(count):
            con.execute("INSERT INTO t(timestamp,time_zone,app_id,feature,value) "
                        "VALUES(?,?,?,?,?)", (int(time.time() * 1000), "Etc/UTC", "bench",
                                              "F", i))
        used = time.process_time() - start
        con.close()
        return used


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
        cpu0 = cpu_seconds(proc.pid)
        wall0 = time.monotonic()
        for i in range(inserts):
            proxy.Insert({"app_id": "bench", "feature": "F", "value": str(i)})
        wall = time.monotonic() - wall0
        daemon_cpu = cpu_seconds(proc.pid) - cpu0
        bare = bare_inserts(inserts)
        rss_after = int(footprint.status(proc.pid, "VmRSS"))
        print(f"{inserts} bus inserts: daemon CPU {daemon_cpu * 1000:.0f} ms "
              f"({daemon_cpu * 1e6 / inserts:.1f} us each), wall {wall:.1f} s; "
              f"bare SQLite inserts of the same row: {bare * 1000:.0f} ms CPU; "
              f"ratio {daemon_cpu / bare:.1f}x")
        print(f"RSS after the inserts: {rss_after / 1024:.1f} MB")
    finally:
        dev.close()


if __name__ == "__main__":
    main()
