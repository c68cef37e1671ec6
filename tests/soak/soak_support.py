"""What the soak and crash runs share: the sped-up device clock, the records handed to the relay,
database checks and a caller of the shared tables that remembers what the daemon answered."""
import datetime
import json
import os
import sqlite3
import sys

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), "..", "system"))

import bus_client  # noqa: E402
from harness import DBSPACE  # noqa: E402

FAKETIME_LIB = "/usr/lib/x86_64-linux-gnu/faketime/libfaketime.so.1"
DATABASES = (".pref.db", ".SurveyLog.db", ".ServerUploaderDB.db", ".StatusMonitor.db")
OUTBOX = "/opt/usr/data/log-relay/outbox.jsonl"
SEP = "\u00b6"


def clock_env(dev, start, speed):
    """The daemon's environment for a clock that starts at |start| (seconds) running |speed|
    times faster, monotonic clock included so that its timers keep pace with the wall clock."""
    stamp = datetime.datetime.fromtimestamp(start, datetime.timezone.utc)
    asan = dev.env.get("ASAN_OPTIONS", "")
    return {"LD_PRELOAD": FAKETIME_LIB, "FAKETIME": stamp.strftime(f"@%Y-%m-%d %H:%M:%S x{speed}"),
            "FAKETIME_NO_CACHE": "1", "TZ": "UTC",
            # A sanitizer build would refuse a preload ahead of its runtime.
            "ASAN_OPTIONS": (asan + ":" if asan else "") + "verify_asan_link_order=0"}


def body_pairs(body):
    return dict(p.split("=", 1) for p in body.split(SEP) if "=" in p)


def outbox(dev):
    """Items handed to the relay, in order, as (activity, body)."""
    path = dev.path(OUTBOX)
    if not os.path.exists(path):
        return []
    with open(path, encoding="utf-8") as f:
        return [(item["4"], item["7"]) for item in map(json.loads, filter(str.strip, f))]


def queue(dev, db_dir=None):
    """Records of the upload queue as (activity, body, rly_result)."""
    return query(dev, ".ServerUploaderDB.db",
                 "SELECT activity, body, rly_result FROM survey_log ORDER BY _id", db_dir)


def query(dev, name, sql, db_dir=None, args=()):
    path = os.path.join(db_dir or dev.path(DBSPACE), name)
    if not os.path.exists(path):
        return []
    con = sqlite3.connect(path, timeout=10)
    try:
        return con.execute(sql, args).fetchall()
    except sqlite3.OperationalError as e:
        if "no such table" in str(e):  # killed before the daemon created it
            return []
        raise
    finally:
        con.close()


def integrity(dev, db_dir=None):
    """integrity_check of each database that exists, by name; 'ok' when intact."""
    out = {}
    for name in DATABASES:
        path = os.path.join(db_dir or dev.path(DBSPACE), name)
        if os.path.exists(path):
            rows = query(dev, name, "PRAGMA integrity_check", db_dir)
            out[name] = ";".join(r[0] for r in rows)
    return out


def pref(dev, key, db_dir=None):
    rows = query(dev, ".pref.db", "SELECT pref_data FROM pref WHERE pref_key=?", db_dir, (key,))
    return int(rows[0][0]) if rows and rows[0][0] not in (None, "") else None


def utc_midnight(seconds, days_back=0):
    day = datetime.datetime.fromtimestamp(seconds, datetime.timezone.utc).date()
    day -= datetime.timedelta(days=days_back)
    return int(datetime.datetime(day.year, day.month, day.day,
                                 tzinfo=datetime.timezone.utc).timestamp())


def sysv_mappings(pid):
    with open(f"/proc/{pid}/maps") as f:
        return [line.strip() for line in f if "SYSV" in line]


def vm_rss_kb(pid):
    with open(f"/proc/{pid}/status") as f:
        for line in f:
            if line.startswith("VmRSS:"):
                return int(line.split()[1])
    return None


class Caller:
    """One outside process's view of a shared table: its own bus connection, and every answer
    the daemon gave it."""

    def __init__(self, dev, table):
        self.dev = dev
        self.proxy = bus_client.table_proxy(dev, table)
        self.ids = []          # ids the daemon returned for committed inserts
        self.deleted = set()   # ids a Delete of ours removed (the daemon counted 1)
        self.failures = []

    def close(self):
        self.proxy.proxy_object._bus.close()

    def insert(self, row):
        try:
            row_id = int(self.proxy.Insert(row))
        except Exception as e:  # a failed call is a finding, not a crash of the test
            self.failures.append(f"Insert: {e}")
            return None
        self.ids.append(row_id)
        return row_id

    def delete_id(self, row_id):
        try:
            count = int(self.proxy.Delete(f"_id = {row_id}"))
        except Exception as e:
            self.failures.append(f"Delete: {e}")
            return None
        if count == 1:
            self.deleted.add(row_id)
        return count

    def select(self, columns, size=4 << 20):
        """Rows of the whole table through a segment of ours, removed afterwards."""
        seg = bus_client.Segment(size)
        try:
            self.proxy.Select(columns, "", "", dbus_uint(seg.id))
            rows = bus_client.parse_segment(seg.read())
            if rows is None:
                self.failures.append("Select wrote no end mark")
            return rows
        except Exception as e:
            self.failures.append(f"Select: {e}")
            return None
        finally:
            seg.close()


def dbus_uint(value):
    import dbus
    return dbus.UInt32(value)
