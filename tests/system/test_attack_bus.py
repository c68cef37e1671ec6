"""The shared tables attacked the way a hostile local process would: as an unprivileged user
in the group the bus policy admits. Every attack is refused or bounded, no other row, table or
file changes, and a legitimate caller is served right after."""
import ctypes
import grp
import os
import signal
import sqlite3
import unittest

import dbus

from bus_client import (FEATURE, STATUS, Segment, call_as, parse_segment,
                        prepare_for_other_users, raw_call, table_proxy)
from harness import DeviceTestCase, wait_for

IMPROPER = "Improper Values Provided"
# Rows of the attacked table: near its 5,000-row limit, so that the controls' inserts trim
# nothing.
ROWS = 4900
# A Delete of every row, through six joins of the table with itself: 5000^6 rows to visit.
STALL = ("app_id IN (SELECT a.app_id FROM use_app_feature_survey a, use_app_feature_survey b, "
         "use_app_feature_survey c, use_app_feature_survey d, use_app_feature_survey e, "
         "use_app_feature_survey f WHERE a.value + b.value + c.value + d.value + e.value "
         "+ f.value < 0)")
BIG = "v" * 100 * 1024
SHM_HUGETLB, SHM_NORESERVE, IPC_STAT, IPC_SET = 0o4000, 0o10000, 2, 1


def proc_value(pid, field):
    with open(f"/proc/{pid}/status") as f:
        for line in f:
            if line.startswith(field + ":"):
                return int(line.split()[1])
    raise AssertionError(f"no {field} for {pid}")


def cpu_seconds(pid):
    with open(f"/proc/{pid}/stat") as f:
        fields = f.read().rsplit(")", 1)[1].split()
    return (int(fields[11]) + int(fields[12])) / os.sysconf("SC_CLK_TCK")


class AttackBusTest(DeviceTestCase):

    def setUp(self):
        super().setUp()
        self.dev.set_consent(True)
        self.dev.start_daemon()
        self.dev.wait_tables()
        # The scheduler starts last (sent date, then the dump key): the snapshot comes after it.
        wait_for(lambda: self.dev.vconf_get("db/corvane-log-manager/dumpcontext") is not None,
                 message="the daemon's whole start")
        prepare_for_other_users(self.dev)
        gid = grp.getgrnam("logmgr").gr_gid
        self.attacker = ["setpriv", "--reuid=65534", "--regid=65534", f"--groups={gid}"]
        self.feature = table_proxy(self.dev, FEATURE)
        self.status = table_proxy(self.dev, STATUS)
        # A full table of long rows, and a row in the other shared table.
        con = sqlite3.connect(self.dev.db_path(".SurveyLog.db"), timeout=30)
        con.executemany(f"INSERT INTO {FEATURE}(timestamp, app_id, feature, extra, value) "
                        "VALUES (?, ?, 'F', ?, ?)",
                        [(1700000000000 + i, f"app{i}", "e" * 280, i) for i in range(ROWS)])
        con.execute(f"INSERT INTO {STATUS}(app_id, feature, value) VALUES ('victim', 'S', 1)")
        con.commit()
        con.close()
        self.before = self.state()

    def state(self):
        """Every table's rows and the schema of every database, and the files beside them."""
        # Journals come and go with the daemon's own writes; any other new file is the attack's.
        snapshot = {"files": sorted(f for f in os.listdir(self.dev.path("/opt/usr/dbspace"))
                                    if not f.endswith(("-journal", "-wal", "-shm")))}
        for db in (".SurveyLog.db", ".ServerUploaderDB.db", ".pref.db"):
            for name, sql in self.dev.query(db, "SELECT name, sql FROM sqlite_master "
                                            "ORDER BY name"):
                # The id counters move with every control insert; what they allow is shown by
                # the inserts that follow each attack.
                rows = sql and sql.startswith("CREATE TABLE") and name != "sqlite_sequence"
                snapshot[(db, name)] = (sql, self.dev.query(db, f"SELECT * FROM {name}")
                                        if rows else None)
            snapshot[(db, "user_version")] = self.dev.query(db, "PRAGMA user_version")
        return snapshot

    def attack(self, table, method, *params, **segment):
        return call_as(self.dev, self.attacker, table, method, *params, **segment)

    def assert_untouched_and_serving(self):
        self.assertEqual(self.state(), self.before)
        self.assertIsNone(self.dev.daemon.poll())
        # A legitimate caller (the attacker's own user too) is served; its row is taken out again.
        row = self.attack(STATUS, "Insert", {"app_id": "legit", "feature": "L"})
        self.assertGreater(row.get("result", 0), 0, row)
        self.assertEqual(self.attack(STATUS, "Delete", "app_id='legit'"), {"result": 1})
        self.assertEqual(self.state(), self.before)

    def test_second_statements_row_ids_and_commas_are_refused(self):
        attacks = [
            (FEATURE, "Delete", ["1=1; DELETE FROM report_app_status_survey"],
             {"error": "Delete API Failed"}),
            (FEATURE, "Delete", ["0; INSERT INTO use_app_feature_survey(app_id) VALUES ('x')"],
             {"error": "Delete API Failed"}),
            (STATUS, "Delete", ["0; DROP TABLE use_app_survey"], {"result": 0}),
            (FEATURE, "Update", [{"extra": "e"}, "0; DELETE FROM use_app_feature_survey"],
             {"error": "Update API Failed"}),
            (STATUS, "Update", [{"extra": "e"}, "1 /* */ ; -- \n INSERT INTO "
                                "report_app_status_survey(app_id) VALUES ('x')"],
             {"error": IMPROPER}),
            (FEATURE, "Insert", [{"app_id": "x", "feature": "F", "_id": "9223372036854775807"}],
             {"error": IMPROPER}),
            (STATUS, "Insert", [{"app_id": "x", "feature": "F", "_id": "9007199254740993"}],
             {"error": IMPROPER}),
            (FEATURE, "Insert", [{"app_id": "x", "feature": "F", "_id": "0"}], {"error": IMPROPER}),
            (FEATURE, "Insert", [{"app_id": "x", "feature": "F", "_id": "-4"}], {"error": IMPROPER}),
            (FEATURE, "Insert", [{"app_id": "x", "feature": "F", "_id": "0x10"}],
             {"error": IMPROPER}),
            (FEATURE, "Update", [{"_id": "9223372036854775807"}, "app_id='app1'"],
             {"error": "Update API Failed"}),
            (FEATURE, "Update", [{"extra": "x,value=(SELECT max(value) FROM "
                                           "use_app_feature_survey)"}, "app_id='app1'"],
             {"error": "Update API Failed"}),
            (STATUS, "Update", [{"extra": "a,b"}, "app_id='victim'"], {"error": IMPROPER}),
            (STATUS, "Insert", [{"app_id": "victim", "feature": "S", "extra": "a,b"}],
             {"error": "API Failed"}),
            (FEATURE, "Delete", ["0; ATTACH DATABASE '" + self.dev.path("/opt/usr/dbspace/x.db")
                                 + "' AS x"], {"error": "Delete API Failed"}),
            (FEATURE, "Delete", ["0; PRAGMA user_version=7"], {"error": "Delete API Failed"}),
            (FEATURE, "Update", [{"extra": "e"}, "app_id IN (SELECT app_id FROM use_app_survey)"],
             {"error": "Update API Failed"}),
            (FEATURE, "Insert", [{"app_id": "x', 'y'); DROP TABLE use_app_survey; --",
                                  "feature": "F"}], {"error": IMPROPER}),
            (STATUS, "Update", [{"extra": "'||(SELECT app_id FROM use_app_survey)||'"}, "1"],
             {"error": IMPROPER}),
            (FEATURE, "Insert", [{"app_id": "x", "feature": "F", "(SELECT 1)": "1"}],
             {"error": IMPROPER}),
            (FEATURE, "Insert", [{"app_id": "x", "feature": "F", "timestamp": "1"}],
             {"error": IMPROPER}),
            (FEATURE, "Insert", [{"app_id": BIG, "feature": "F"}], {"error": IMPROPER}),
            (STATUS, "Insert", [{"app_id": BIG, "feature": "F"}], {"error": IMPROPER}),
            (FEATURE, "Update", [{"extra": BIG}, "1"], {"error": "Update API Failed"}),
            (FEATURE, "Delete", ["1 OR " + BIG], {"error": "Delete API Failed"}),
        ]
        for table, method, params, expected in attacks:
            with self.subTest(table=table, method=method, params=params):
                self.assertEqual(self.attack(table, method, *params), expected)
                self.assert_untouched_and_serving()

        # Arguments of the wrong types or number never reach a table.
        for signature, method, table, args in (("a{si}", "Insert", FEATURE, [{"app_id": 1}]),
                                               ("ssss", "Select", FEATURE, ["_id", "", "", "1"]),
                                               ("i", "Delete", STATUS, [1]),
                                               ("a{ss}", "Update", FEATURE, [{"extra": "e"}])):
            with self.subTest(signature=signature, method=method):
                with self.assertRaises(dbus.DBusException):
                    raw_call(self.dev, table, method, signature, *args)
                self.assert_untouched_and_serving()
        # Select's columns reach no other table, and nothing is written.
        for columns in ("(SELECT pref_data FROM pref)", "(SELECT app_id FROM use_app_survey)",
                        "(SELECT sql FROM sqlite_master)", "randomblob(1000000)", BIG):
            with self.subTest(columns=columns[:40]):
                answer = self.attack(FEATURE, "Select", columns, "", "", segment=4096)
                self.assertEqual(answer["segment"], "00" * 4096)

        # Controls: the same requests without the second statement, the comma or the large id.
        self.assertEqual(self.attack(STATUS, "Update", {"extra": "a b"}, "app_id='victim'"),
                         {"result": 1})
        big = self.attack(FEATURE, "Insert", {"app_id": "x", "feature": "F",
                                              "_id": str(2 ** 53)})
        self.assertNotIn("error", big)
        self.assertNotIn("error", self.attack(FEATURE, "Insert", {"app_id": "y", "feature": "F"}))
        self.assertEqual(self.dev.query(".SurveyLog.db", f"SELECT _id, app_id FROM {FEATURE} "
                                        "WHERE _id >= ? ORDER BY _id", (2 ** 53,)),
                         [(2 ** 53, "x"), (2 ** 53 + 1, "y")])
        # A value made to look like a statement is stored as the text it is.
        text = "1);DELETE FROM use_app_feature_survey;--"
        self.assertNotIn("error", self.attack(FEATURE, "Insert", {"app_id": text, "feature": "F"}))
        self.assertEqual(self.dev.query(".SurveyLog.db", f"SELECT COUNT(*) FROM {FEATURE} WHERE "
                                        "app_id = ?", (text,)), [(1,)])
        self.assertEqual(self.dev.query(".SurveyLog.db", f"SELECT COUNT(*) FROM {FEATURE}"),
                         [(ROWS + 3,)])

    def test_a_stalling_request_fails_within_its_budget_and_sigterm_is_acted_on(self):
        pid = self.dev.daemon.pid
        spent = cpu_seconds(pid)
        self.assertEqual(self.attack(FEATURE, "Delete", STALL), {"error": "Delete API Failed"})
        # Select ignores its where, so the joins go into a column; a failed select is answered
        # without an error and writes nothing.
        column = "(SELECT count(*) " + STALL.split("(SELECT a.app_id ", 1)[1].split(" WHERE")[0] + ")"
        stalled = self.attack(FEATURE, "Select", column, "", "", segment=1 << 20)
        self.assertNotIn("error", stalled)
        self.assertEqual(stalled["segment"], "00" * 4096)
        # About one second of CPU each (the budget), not the hours the statements would need.
        self.assertLess(cpu_seconds(pid) - spent, 6.0)
        self.assert_untouched_and_serving()

        # SIGTERM while a stall runs: the request ends at its budget, then the daemon stops.
        import subprocess
        stall = subprocess.Popen(self.attacker + ["dbus-send", "--system", "--print-reply",
                                                  "--reply-timeout=600000",
                                                  "--dest=com.corvane.logmgr",
                                                  "/com/corvane/logmgr/log/provider/" + FEATURE,
                                                  f"com.corvane.logmgr.log.provider.{FEATURE}"
                                                  ".Delete", "string:" + STALL],
                                 env=self.dev.env, stdout=subprocess.DEVNULL,
                                 stderr=subprocess.PIPE, text=True)
        self.addCleanup(stall.wait)
        spent = cpu_seconds(pid)
        wait_for(lambda: cpu_seconds(pid) > spent + 0.05 or stall.poll() is not None,
                 message="the stall to start")
        self.dev.signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(), 0)
        self.assertEqual(self.state()[(".SurveyLog.db", FEATURE)],
                         self.before[(".SurveyLog.db", FEATURE)])

    def test_select_results_stop_at_the_callers_segment(self):
        pid = self.dev.daemon.pid
        # Control: the whole table into a segment that holds it.
        whole = self.attack(FEATURE, "Select", "_id", "", "", segment=64 * 1024)
        self.assertNotIn("error", whole)
        self.assertRegex(bytes.fromhex(whole["segment"]).decode(), r"^1,\0002,\0003,\000")
        baseline = proc_value(pid, "VmHWM")
        # The widest column list allowed, of 300-byte cells, 5,000 times, into one byte: the
        # first row already passes the segment, so nothing more is built.
        wide = ",".join(["extra"] * 32)
        one = self.attack(FEATURE, "Select", wide, "", "", segment=1)
        self.assertIn("error", one)
        self.assertEqual(one["segment"], "00")
        # Past the column bound the select itself fails (answered without an error).
        widest = ",".join(["extra"] * 140)
        self.assertEqual(self.attack(FEATURE, "Select", widest, "", "", segment=1)["segment"],
                         "00")
        self.assertLess(proc_value(pid, "VmHWM") - baseline, 16 * 1024,
                        "a refused Select grew the daemon by more than 16 MB")
        # A segment the caller may not write (mode 0400), and one already marked removed.
        ro = self.attack(FEATURE, "Select", "_id", "", "", segment=4096, mode=0o400)
        self.assertIn("error", ro)
        self.assertEqual(ro["segment"], "00" * 4096)
        removed = self.attack(FEATURE, "Select", "_id", "", "", segment=64 * 1024, removed=True)
        self.assertNotIn("error", removed)
        self.assertRegex(bytes.fromhex(removed["segment"]).decode(), r"^[0-9]+,\0[0-9]+,\0")
        self.assert_untouched_and_serving()

    def test_a_segment_with_no_memory_behind_it_does_not_end_the_daemon(self):
        libc = ctypes.CDLL(None, use_errno=True)
        libc.shmget.argtypes = [ctypes.c_int, ctypes.c_size_t, ctypes.c_int]
        libc.shmctl.argtypes = [ctypes.c_int, ctypes.c_int, ctypes.c_void_p]
        # Made by root (users need the hugetlb group for that), then handed to the attacker's
        # user, as a segment of its own.
        seg = libc.shmget(0, 2 << 20, 0o1000 | 0o600 | SHM_HUGETLB | SHM_NORESERVE)
        if seg < 0:
            self.skipTest(f"no hugetlb segments on this machine: errno {ctypes.get_errno()}")
        self.addCleanup(libc.shmctl, seg, 0, None)
        info = ctypes.create_string_buffer(256)
        self.assertEqual(libc.shmctl(seg, IPC_STAT, info), 0)
        ctypes.c_uint32.from_buffer(info, 4).value = 65534  # shm_perm.uid
        self.assertEqual(libc.shmctl(seg, IPC_SET, info), 0)
        with open("/proc/sys/vm/nr_hugepages") as f:
            pool = int(f.read())
        answer = self.attack(FEATURE, "Select", "_id", "", "", shm_id=seg)
        if pool == 0:
            self.assertIn("error", answer)
        self.assertIsNone(self.dev.daemon.poll(), "the daemon ended writing the segment")
        self.assert_untouched_and_serving()
        # Root's own Select into its own segment still works.
        own = Segment(64 * 1024)
        self.addCleanup(own.close)
        self.feature.Select("_id", "", "", dbus.UInt32(own.id))
        self.assertEqual(len(parse_segment(own.read())), ROWS)


if __name__ == "__main__":
    unittest.main()
