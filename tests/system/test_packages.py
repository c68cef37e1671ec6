"""Package requests and application crashes through the real daemon on its private bus."""
import os
import unittest

from harness import DBSPACE, DeviceTestCase, wait_for

STATUS = ("/org/tizen/pkgmgr_status", "org.tizen.pkgmgr_status.status")
CRASH = ("/Org/Tizen/System/Crash/Crash", "org.tizen.system.crash.Crash.ProcessCrashed")


class PackageCase(DeviceTestCase):
    def setUp(self):
        super().setUp()
        os.makedirs(self.dev.path(DBSPACE), exist_ok=True)
        self.dev.set_consent(True)
        self.dev.start_daemon()
        self.marks = 0
        wait_for(lambda: self.mark(timeout=2), timeout=30, interval=0,
                 message="the package monitor")

    def rows(self, sql):
        return self.dev.query(".SurveyLog.db", sql)

    def packages(self):
        return self.rows("SELECT installed_app_id, type FROM manage_app_survey ORDER BY _id")

    def mark(self, timeout=10):
        """Installs a new package; True once its row shows all earlier signals are handled."""
        self.marks += 1
        name = f"mark{self.marks}"
        self.dev.devsim("pkg", "install", name)
        try:
            return wait_for(lambda: (name, 0) in self.packages(), timeout=timeout)
        except AssertionError:
            return False

    def status(self, req, pkgid, key, val):
        self.dev.dbus_send("--type=signal", STATUS[0], STATUS[1], f"string:{req}", "string:tpk",
                           f"string:{pkgid}", f"string:{key}", f"string:{val}")


class PackageMonitorTest(PackageCase):
    def settle(self, expected):
        self.assertTrue(self.mark(), "the marker package's row")
        self.assertEqual([r for r in self.packages() if not r[0].startswith("mark")], expected)

    def test_request_sequences(self):
        expected = []
        with self.subTest("install, then an update that fails and ends well without a new start"):
            self.dev.devsim("pkg", "install", "pkg.u")
            expected.append(("pkg.u", 0))
            self.dev.devsim("pkg", "update", "pkg.u", "--fail")
            self.status("late", "pkg.u", "end", "ok")
            expected.append(("pkg.u", 2))
            self.settle(expected)

        with self.subTest("end without start; malformed signals"):
            self.status("lone", "pkg.lone", "end", "ok")
            self.dev.dbus_send("--type=signal", STATUS[0], STATUS[1], "string:r", "string:tpk",
                               "string:pkg.bad", "string:start")
            self.dev.dbus_send("--type=signal", STATUS[0], STATUS[1], "string:r", "string:tpk",
                               "string:pkg.bad", "string:end", "int32:0")
            self.settle(expected)

        with self.subTest("an unknown start keeps the pending kind"):
            self.dev.devsim("pkg", "uninstall", "pkg.x", "--fail")
            self.status("odd", "pkg.odd", "start", "reinstall")
            self.status("odd", "pkg.odd", "end", "ok")
            expected.append(("pkg.odd", 1))
            self.settle(expected)

        with self.subTest("interleaved requests share the pending kind; the last start wins"):
            self.status("a", "pkg.a", "start", "install")
            self.status("b", "pkg.b", "start", "update")
            self.status("a", "pkg.a", "end", "ok")
            self.status("b", "pkg.b", "end", "ok")
            expected.append(("pkg.a", 2))
            self.settle(expected)

        with self.subTest("a package id is stored as sent"):
            forged = "pkg.o'x',0); DROP TABLE manage_app_survey; --"
            self.status("q", forged, "start", "install")
            self.status("q", forged, "end", "ok")
            expected.append((forged, 0))
            self.settle(expected)
        self.assertIsNone(self.dev.daemon.poll())


class CrashMonitorTest(PackageCase):
    def test_a_crash_writes_a_row_per_app_of_the_executable(self):
        shared = "/opt/usr/apps/shared/bin/shared"
        for app in ("com.ex.one", "com.ex.two"):
            self.dev.devsim("app", "install", app, "--package", "pkg.shared", "--exec", shared)
        self.dev.devsim("app", "install", "com.ex.alone")
        self.dev.dbus_send("--type=signal", CRASH[0], CRASH[1], "string:shared")
        self.dev.dbus_send("--type=signal", CRASH[0], CRASH[1], "string:x", "string:/bin/none")
        self.dev.dbus_send("--type=signal", "/Unknown/Path", CRASH[1], "int32:1", "int32:2")
        self.dev.devsim("crash", "com.ex.one")
        self.dev.devsim("crash", "com.ex.alone")
        errors = lambda: self.rows("SELECT app_id, type FROM report_app_error_survey ORDER BY _id")
        wait_for(lambda: len(errors()) >= 3, message="three crash rows")
        self.assertEqual(errors(), [("com.ex.one", 1), ("com.ex.two", 1), ("com.ex.alone", 1)])
        self.assertIsNone(self.dev.daemon.poll())


if __name__ == "__main__":
    unittest.main()
