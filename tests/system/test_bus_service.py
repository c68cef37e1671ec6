"""The two shared tables through the real daemon: results and errors of each method, and the
difference between the two tables. Hostile callers: test_attack_bus."""
import sqlite3
import subprocess
import unittest

import dbus
from dbus.mainloop.glib import DBusGMainLoop
from gi.repository import GLib

from bus_client import (FEATURE, IFACE_PREFIX, PATH_PREFIX, STATUS, Segment,
                        table_proxy)
from harness import NOBODY, DeviceTestCase, wait_for
from test_lifecycle import has_consent_watch

IMPROPER = "Improper Values Provided"
class BusServiceTest(DeviceTestCase):

    def setUp(self):
        super().setUp()
        self.dev.set_consent(True)
        self.dev.start_daemon()
        self.dev.wait_started()
        self.dev.wait_tables()
        self.feature = table_proxy(self.dev, FEATURE)
        self.status = table_proxy(self.dev, STATUS)

    def table_rows(self, table, columns="app_id, feature, extra, value"):
        try:
            return self.dev.query(".SurveyLog.db", f"SELECT {columns} FROM {table} ORDER BY _id")
        except sqlite3.OperationalError:
            return None

    def segment(self, size):
        seg = Segment(size)
        self.addCleanup(seg.close)
        return seg

    def assert_bus_error(self, call, message):
        with self.assertRaises(dbus.DBusException) as caught:
            call()
        self.assertEqual(caught.exception.get_dbus_message(), message)

    def test_insert_update_delete_results_and_the_two_tables_differences(self):
        first = self.feature.Insert({"app_id": "x", "feature": "F", "value": "1"})
        second = self.feature.Insert({"app_id": "y", "feature": "F", "value": "2"})
        self.assertEqual(second, first + 1)
        self.assertEqual(self.table_rows(FEATURE), [("x", "F", None, 1), ("y", "F", None, 2)])
        for proxy in (self.feature, self.status):
            with self.subTest(table=proxy.dbus_interface):
                self.assert_bus_error(lambda: proxy.Insert({"app_id": "x"}), IMPROPER)
                self.assert_bus_error(lambda: proxy.Insert({"feature": "F"}), IMPROPER)

        # The status table keeps one row per (app_id, feature): a second insert updates it.
        row_id = self.status.Insert({"app_id": "x", "feature": "F", "value": "1"})
        stamp = self.table_rows(STATUS, "timestamp")[0][0]
        self.assertEqual(self.status.Insert({"app_id": "x", "feature": "F", "value": "7"}), row_id)
        self.assertEqual(self.table_rows(STATUS), [("x", "F", None, 7)])
        self.assertGreaterEqual(self.table_rows(STATUS, "timestamp")[0][0], stamp)
        # Two rows of the same pair (made by Update) make the upsert write nothing.
        self.status.Insert({"app_id": "x", "feature": "G", "value": "2"})
        self.assertEqual(self.status.Update({"feature": "F"}, "feature='G'"), 1)
        self.status.Insert({"app_id": "x", "feature": "F", "value": "9"})
        self.assertEqual(self.table_rows(STATUS, "value"), [(7,), (2,)])

        self.assertEqual(self.feature.Update({"extra": "e"}, "app_id='x'"), 1)
        self.assertEqual(self.table_rows(FEATURE)[0], ("x", "F", "e", 1))
        self.assert_bus_error(lambda: self.feature.Update({"extra": "e"}, ""), "Update API Failed")
        self.assert_bus_error(lambda: self.status.Update({"extra": "e"}, ""), IMPROPER)

        self.assert_bus_error(lambda: self.feature.Delete(""), IMPROPER)
        self.assert_bus_error(lambda: self.feature.Delete("no such ((("), "Delete API Failed")
        self.assertEqual(self.status.Delete("app_id='nobody'"), 0)
        self.assertEqual(self.status.Delete(""), 0)
        self.assertEqual(self.status.Delete("no such((("), 0)
        self.assertEqual(self.feature.Delete("app_id='y'"), 1)
        self.assertEqual(self.status.Delete("app_id='x'"), 2)
        self.assertEqual(self.table_rows(FEATURE), [("x", "F", "e", 1)])

    def test_the_main_loop_never_waits_for_another_process_lock(self):
        self.feature.Insert({"app_id": "x", "feature": "F"})
        holder = sqlite3.connect(self.dev.db_path(".SurveyLog.db"), timeout=5,
                                 isolation_level=None)
        self.addCleanup(holder.close)
        holder.execute("BEGIN IMMEDIATE")  # the write lock, held until the answer is in
        replies = []
        bus = dbus.bus.BusConnection(self.dev.env["DBUS_SYSTEM_BUS_ADDRESS"],
                                     mainloop=DBusGMainLoop())
        self.addCleanup(bus.close)
        proxy = dbus.Interface(bus.get_object("com.corvane.logmgr", PATH_PREFIX + FEATURE),
                               IFACE_PREFIX + FEATURE)
        proxy.Insert({"app_id": "y", "feature": "F"}, timeout=120,
                     reply_handler=lambda *r: replies.append(("ok", r)),
                     error_handler=lambda e: replies.append(("error", e.get_dbus_message())))
        context = GLib.MainContext.default()
        # A wait for the lock (2 s with the old busy timeout) would not answer in time.
        wait_for(lambda: (context.iteration(False), replies)[1], timeout=1.5, interval=0.005,
                 message="an answer while the lock is held")
        self.assertEqual(replies, [("error", "Insert API Failed")])
        holder.execute("ROLLBACK")
        self.assertGreater(self.feature.Insert({"app_id": "z", "feature": "F"}), 0)
        self.assertEqual(self.table_rows(FEATURE, "app_id"), [("x",), ("z",)])

    def test_select_writes_every_row_into_an_owned_segment_large_enough(self):
        self.feature.Insert({"app_id": "x", "feature": "F", "value": "1"})
        self.feature.Insert({"app_id": "y", "feature": "F", "value": "2"})
        seg = self.segment(64)
        # where and order are ignored: both rows come back in table order.
        self.feature.Select("app_id,value", "app_id='y'", "value DESC", dbus.UInt32(seg.id))
        self.assertEqual(seg.read()[:11], b"x,1,\0y,2,\0&")

        # A one-byte segment holds the end mark of an empty result, nothing more.
        one = self.segment(1)
        with self.assertRaises(dbus.DBusException):
            self.feature.Select("app_id", "", "", dbus.UInt32(one.id))
        self.assertEqual(one.read(), b"\0")
        self.status.Select("app_id", "", "", dbus.UInt32(one.id))
        self.assertEqual(one.read(), b"&")

        # An unknown segment: false, and no error of the table's domain.
        with self.assertRaises(dbus.DBusException) as caught:
            self.feature.Select("app_id", "", "", dbus.UInt32(0x7ffffff0))
        self.assertNotIn("Improper", caught.exception.get_dbus_message())

        # Another user's segment is never written, whatever its size.
        made = subprocess.run(NOBODY + ["/usr/bin/python3", "-c",
                                        "import ctypes; print(ctypes.CDLL(None).shmget"
                                        "(0, 4096, 0o1666))"],
                              capture_output=True, text=True, check=True)
        foreign = Segment(4096, int(made.stdout))
        self.addCleanup(foreign.close)
        with self.assertRaises(dbus.DBusException):
            self.feature.Select("app_id", "", "", dbus.UInt32(foreign.id))
        self.assertEqual(foreign.read(), bytes(4096))


class StartTogetherTest(DeviceTestCase):

    def test_two_daemons_starting_on_fresh_files_both_start(self):
        # The one place a statement waits for another process: the open phase, where a second
        # daemon's table creation meets the first's (without the wait one of them ended at
        # start in nearly every round).
        self.dev.set_consent(True)
        first = self.dev.start_daemon(wait_for_name=False)
        second = self.dev.start_daemon(wait_for_name=False)
        wait_for(lambda: len(self.dev.name_queue()) == 2 or None not in (first.poll(),
                                                                        second.poll()),
                 message="both daemons on the bus")
        wait_for(lambda: self.dev.survey_tables() and self.dev.query(".ServerUploaderDB.db", "SELECT COUNT(*) FROM "
                                    "sqlite_master") == [(2,)],
                 message="the tables")
        # Each has opened its stores once it watches the consent key (or it has ended).
        for proc in (first, second):
            wait_for(lambda: has_consent_watch(proc.pid) or proc.poll() is not None,
                     message="the deferred start")
        self.assertGreater(table_proxy(self.dev, FEATURE).Insert({"app_id": "x",
                                                                   "feature": "F"}), 0)
        self.assertEqual((first.poll(), second.poll()), (None, None))


if __name__ == "__main__":
    unittest.main()
