"""The daemon's life: the consent gate, the bus name, and every way it ends."""
import os
import signal
import subprocess
import unittest

from harness import DBSPACE, DeviceTestCase, wait_for


def has_consent_watch(pid):
    """True once the daemon watches a key (its inotify descriptor is open)."""
    try:
        fds = os.listdir(f"/proc/{pid}/fd")
    except FileNotFoundError:
        return False
    for fd in fds:
        try:
            if os.readlink(f"/proc/{pid}/fd/{fd}") == "anon_inode:inotify":
                return True
        except OSError:
            pass
    return False


class LifecycleTest(DeviceTestCase):

    def dbspace_files(self):
        d = self.dev.path(DBSPACE)
        return sorted(os.listdir(d)) if os.path.isdir(d) else []

    def started_daemon(self):
        self.dev.set_consent(True)
        proc = self.dev.start_daemon()
        wait_for(lambda: has_consent_watch(proc.pid), message="the deferred start")
        return proc

    def test_consent_missing_or_false_ends_at_once_without_a_database(self):
        for consent in (None, False):
            with self.subTest(consent=consent):
                if consent is not None:
                    self.dev.set_consent(consent)
                proc = self.dev.start_daemon(wait_for_name=False)
                self.assertEqual(self.dev.wait_exit(proc), 0)
                self.assertEqual(self.dbspace_files(), [])

    def test_owns_the_name_and_a_second_daemon_queues_and_runs(self):
        first = self.started_daemon()
        owner = self.dev.name_owner()
        second = self.dev.start_daemon(wait_for_name=False)
        wait_for(lambda: len(self.dev.name_queue()) == 2, message="the second daemon to queue")
        self.assertEqual(self.dev.name_owner(), owner)
        self.assertIsNone(first.poll())
        self.assertIsNone(second.poll())
        second.send_signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(second), 0)

    def test_termination_signals_and_power_off_end_with_status_zero(self):
        for how in ("SIGTERM", "SIGINT", "poweroff", "poweroff twice", "poweroff then SIGTERM"):
            with self.subTest(how=how):
                proc = self.started_daemon()
                if how.startswith("SIG"):
                    proc.send_signal(getattr(signal, how))
                else:
                    self.dev.devsim("poweroff")
                    if how == "poweroff twice":
                        self.dev.devsim("poweroff", "3")
                    elif how == "poweroff then SIGTERM":
                        proc.send_signal(signal.SIGTERM)
                self.assertEqual(self.dev.wait_exit(proc), 0)
                wait_for(lambda: self.dev.name_owner() is None, message="the name to be freed")

    def test_withdrawn_consent_ends_the_daemon_cleanly(self):
        proc = self.started_daemon()

        # A withdrawal before the start has completed is ignored on purpose, so keep
        # withdrawing (every set notifies) until the daemon has gone.
        def withdrawn():
            self.dev.set_consent(False)
            try:
                proc.wait(0.2)
                return True
            except subprocess.TimeoutExpired:
                return False
        wait_for(withdrawn, timeout=15, interval=0, message="exit after withdrawal")
        self.assertEqual(proc.returncode, 0)

    def test_no_reachable_system_bus_is_status_255_and_nothing_on_stderr(self):
        self.dev.set_consent(True)
        self.dev.env["DBUS_SYSTEM_BUS_ADDRESS"] = "unix:path=" + self.dev.path("/nonexistent")
        # With its system modules, EFL itself tries the bus at start and would log about it.
        self.dev.env.pop("ECORE_NO_SYSTEM_MODULES", None)
        proc = self.dev.start_daemon(wait_for_name=False)
        self.assertEqual(self.dev.wait_exit(proc), 255)
        with open(os.path.join(self.dev.sysroot, "logmgrd.out")) as f:
            self.assertEqual(f.read(), "")


class VconftoolTest(DeviceTestCase):

    def test_bad_input_is_a_one_line_error_with_status_1(self):
        cases = [("set", "-t", "float", "db/x", "1"), ("set", "-t", "int", "db/x", "twelve"),
                 ("set", "-t", "bool", "db/x", "2"), ("get", "db/missing/key"),
                 ("set", "-t", "int", "bogus/x", "1"), ("unset", "db/missing/key"),
                 ("frobnicate",)]
        for args in cases:
            with self.subTest(args=args):
                r = self.dev.run_tool("vconftool", *args, check=False)
                self.assertEqual((r.returncode, r.stdout), (1, ""))
                lines = r.stderr.strip().splitlines()
                self.assertEqual(len(lines), 1)
                self.assertTrue(lines[0].startswith("vconftool: "), lines[0])
        self.assertIsNone(self.dev.vconf_get("db/x"))


if __name__ == "__main__":
    unittest.main()
