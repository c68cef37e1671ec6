"""Platform faults under the real daemon: the daemon keeps what it committed, fails only what the
fault takes away, and records again once it clears (after a restart where the fault ends the
process: a lost bus or display)."""
import hashlib
import os
import signal
import subprocess
import unittest

import dbus

from bus_client import FEATURE, table_proxy
from harness import DBSPACE, wait_for
from test_app_usage import AppCase
from test_device_status import DeviceStatusCase

DATABASES = (".pref.db", ".SurveyLog.db", ".ServerUploaderDB.db", ".StatusMonitor.db")
INSERT_FAILED = "Insert API Failed"


class Checks:
    def insert(self, value):
        """A row through the bus: its id, or None when the daemon refuses it."""
        try:
            return int(table_proxy(self.dev, FEATURE).Insert(
                {"app_id": "fault", "feature": "F", "value": str(value)}))
        except dbus.DBusException as e:
            self.assertEqual(e.get_dbus_message(), INSERT_FAILED)
            return None

    def bus_values(self):
        rows = self.dev.query(".SurveyLog.db", "SELECT value FROM use_app_feature_survey "
                              "WHERE app_id = 'fault' ORDER BY _id")
        return [r[0] for r in rows]

    def assert_intact(self):
        for name in DATABASES:
            with self.subTest(database=name):
                self.assertEqual(self.dev.query(name, "PRAGMA integrity_check"), [("ok",)])

    def assert_failure_exit(self, proc):
        # Non-zero, and not a signal: the service manager restarts it (Restart=on-failure).
        status = self.dev.wait_exit(proc, timeout=20)
        self.assertGreater(status, 0)
        return status


class FaultCase(Checks, DeviceStatusCase):
    pass


class DbspaceMount(FaultCase):
    """dbspace as its own small tmpfs, so it can fill up or turn read-only."""

    def setUp(self):
        super().setUp()
        self.dbspace = self.dev.path(DBSPACE)
        os.makedirs(self.dbspace, exist_ok=True)
        r = subprocess.run(["mount", "-t", "tmpfs", "-o", "size=4m,mode=0755", "tmpfs",
                            self.dbspace], capture_output=True, text=True)
        if r.returncode != 0:
            self.skipTest(f"cannot mount a tmpfs here: {r.stderr.strip()}")
        self.addCleanup(subprocess.run, ["umount", "-l", self.dbspace])
        self.addCleanup(self.kill_daemons)

    def kill_daemons(self):
        for proc in self.dev.procs:
            if proc.poll() is None:
                proc.kill()
                proc.wait()

    def remount(self, mode):
        subprocess.run(["mount", "-o", f"remount,{mode}", self.dbspace], check=True)

    def fill(self):
        path = os.path.join(self.dbspace, "filler")
        with open(path, "wb") as f:
            try:
                while True:
                    f.write(b"\0" * 65536)
                    f.flush()
            except OSError:
                pass
        return path

    def snapshot_files(self):
        def digest(name):
            with open(os.path.join(self.dbspace, name), "rb") as f:
                return hashlib.sha256(f.read()).hexdigest()
        return {name: digest(name) for name in os.listdir(self.dbspace)}


class FullDiskTest(DbspaceMount):
    def test_writes_fail_while_full_and_succeed_once_space_is_freed(self):
        proc = self.start()
        self.assertIsNotNone(self.insert("before"))
        filler = self.fill()

        results = {i: self.insert(i) for i in range(20)}
        self.dev.devsim("unlock")
        self.dev.devsim("capture")
        self.assertIn(None, results.values(), "a full disk refused nothing")
        # Only what it acknowledged was stored; it still answers and runs.
        self.assertEqual(self.bus_values(),
                         ["before"] + [str(i) for i, rid in results.items() if rid is not None])
        self.assertIsNone(proc.poll())

        os.unlink(filler)
        self.assertIsNotNone(self.insert("after"))
        self.wait_monitoring()
        self.assertEqual(self.bus_values()[-1], "after")
        proc.send_signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(proc), 0)
        self.assert_intact()


class ReadOnlyStoreTest(DbspaceMount):
    def test_a_start_on_a_read_only_store_ends_untouched_and_a_later_start_records(self):
        proc = self.start()
        self.assertIsNotNone(self.insert("kept"))
        proc.send_signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(proc), 0)

        # A running daemon holds its files open for writing, so the kernel refuses the remount
        # then; the fault a device meets is a store found read-only at boot.
        self.remount("ro")
        files = self.snapshot_files()
        self.assert_failure_exit(self.dev.start_daemon(wait_for_name=False))
        self.assertEqual(self.snapshot_files(), files)

        self.remount("rw")
        self.start()
        self.assertIsNotNone(self.insert("again"))
        self.assertEqual(self.bus_values(), ["kept", "again"])
        self.assert_intact()


class BusRestartTest(FaultCase):
    def test_a_lost_bus_ends_the_daemon_with_a_failure_and_a_restart_records(self):
        proc = self.start()
        self.assertIsNotNone(self.insert("before"))
        # The bus connection cannot be rebuilt under the name, the objects and the match rules
        # registered on it: libdbus ends the process, the service manager starts it again.
        self.dev.stop_bus()
        self.assertEqual(self.assert_failure_exit(proc), 1)  # libdbus's status for a lost bus
        self.assert_intact()

        self.dev.start_bus()
        self.start()
        self.assertIsNotNone(self.insert("after"))
        self.assertEqual(self.bus_values(), ["before", "after"])


class BluetoothComesAndGoesTest(FaultCase):
    def start_bluez(self):
        log = open(os.path.join(self.dev.sysroot, "bluez-mock.log"), "a")
        mock = subprocess.Popen(["/usr/bin/python3", "-m", "dbusmock", "--system", "--template",
                                 "bluez5"], env=self.dev.env, stdout=log, stderr=log)
        log.close()
        self.addCleanup(mock.wait)
        self.addCleanup(mock.kill)
        wait_for(lambda: self.dev.name_owner("org.bluez"), message="the BlueZ mock")
        return mock

    def bond_cycle(self, address):
        before = len(self.rows("BLUE"))
        self.dev.devsim("bt", "pair", address, "0x240404")
        wait_for(lambda: self.snapshot("BLUE")[1] > 0, message="BLUE open")
        self.dev.devsim("bt", "unpair", address)
        wait_for(lambda: len(self.rows("BLUE")) == before + 1, message="the BLUE row")

    def test_bonds_count_whenever_bluez_is_there_and_nothing_else_depends_on_it(self):
        proc = self.start()  # no BlueZ on the bus: the monitor still starts
        mock = self.start_bluez()
        self.bond_cycle("00:11:22:33:44:55")

        mock.kill()
        mock.wait()
        wait_for(lambda: self.dev.name_owner("org.bluez") is None, message="BlueZ gone")
        self.wait_monitoring()
        self.assertIsNotNone(self.insert("without bluez"))

        self.start_bluez()
        self.bond_cycle("00:11:22:33:44:66")
        self.assertIsNone(proc.poll())


class XGoneTest(Checks, AppCase):
    def test_a_lost_display_ends_the_daemon_with_a_failure_and_a_restart_records(self):
        proc = self.dev.daemon
        self.assertTrue(self.root_watched())
        # Ecore_X ends the process when its display goes; Xlib cannot reconnect a dead display.
        self.dev.kill_x()
        self.assert_failure_exit(proc)
        self.assert_intact()

        # Without a display only window tracking is missing.
        self.dev.start_daemon()
        wait_for(lambda: self.insert(1), message="a bus insert")
        unlocks = lambda: len(self.dev.query(".SurveyLog.db", "SELECT 1 FROM "
                                             "use_app_feature_survey WHERE feature = 'UNLO'"))
        before = unlocks()
        wait_for(lambda: self.dev.devsim("unlock") and unlocks() > before, timeout=30,
                 interval=0.5, message="an unlock row")


if __name__ == "__main__":
    unittest.main()
