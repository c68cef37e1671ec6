"""Outside callers of the shared tables: logmgrctl's commands and exit codes, and the bus
policy that keeps unprivileged users away from the tables."""
import os
import sqlite3
import subprocess
import unittest

from bus_client import FEATURE, STATUS, prepare_for_other_users
from harness import BIN_DIR, NOBODY, DeviceTestCase

class BusClientsTest(DeviceTestCase):

    def start(self):
        self.dev.set_consent(True)
        self.dev.start_daemon()
        self.dev.wait_tables()

    def ctl(self, *args, prefix=()):
        r = subprocess.run(list(prefix) + [os.path.join(BIN_DIR, "logmgrctl")] +
                           [str(a) for a in args], env=self.dev.env, capture_output=True,
                           text=True, timeout=60)
        return r.returncode, r.stdout, r.stderr

    def test_logmgrctl_commands_outputs_and_exit_codes(self):
        # Without a daemon the bus has nobody to answer.
        code, _, err = self.ctl("insert", FEATURE, "app_id=x", "feature=F")
        self.assertEqual(code, 3, err)
        self.start()

        self.assertEqual(self.ctl("insert", FEATURE, "app_id=a.b", "feature=F", "value=3")[:2],
                         (0, "1\n"))
        self.assertEqual(self.ctl("insert", FEATURE, "app_id=c", "feature=G", "extra=x y")[:2],
                         (0, "2\n"))
        self.assertEqual(self.ctl("insert", STATUS, "app_id=a", "feature=F")[:2], (0, "1\n"))
        self.assertEqual(self.ctl("insert", STATUS, "app_id=a", "feature=F", "value=2")[:2],
                         (0, "1\n"))
        self.assertEqual(self.ctl("update", FEATURE, "--where", "app_id='c'", "value=9")[:2],
                         (0, "1\n"))
        self.assertEqual(self.ctl("select", FEATURE, "app_id,extra,value")[:2],
                         (0, "a.b,3\nc,x y,9\n"))  # a NULL column adds nothing
        self.assertEqual(self.ctl("select", STATUS, "value")[:2], (0, "2\n"))
        self.assertEqual(self.ctl("delete", FEATURE, "--where", "app_id='a.b'")[:2], (0, "1\n"))

        code, out, _ = self.ctl("show", FEATURE, "--limit", "5")
        self.assertEqual(code, 0)
        lines = out.splitlines()
        self.assertEqual(lines[0].split("\t"), ["_id", "timestamp", "time_zone", "app_id",
                                                "feature", "extra", "value"])
        self.assertEqual([l.split("\t")[3:] for l in lines[1:]], [["c", "G", "x y", "9"]])
        con = sqlite3.connect(self.dev.db_path(".ServerUploaderDB.db"), timeout=5)
        con.executemany("INSERT INTO survey_log(svc_code, body) VALUES (?, ?)",
                        [("svc", "b%d" % i) for i in range(3)])
        con.commit()
        con.close()
        code, out, _ = self.ctl("queue", "--limit", "2")
        self.assertEqual(code, 0)
        self.assertEqual(out.splitlines()[0], "survey_log: 3 queued record(s)")
        self.assertEqual([l.split("\t")[7] for l in out.splitlines()[2:]], ["b1", "b2"])

        failures = [
            (("insert", FEATURE, "app_id=x"), 1, "Improper Values Provided"),
            (("update", STATUS, "--where", "app_id='a'", "extra=it's"), 1,
             "Improper Values Provided"),
            (("delete", FEATURE, "--where", ""), 1, "Improper Values Provided"),
            (("select", FEATURE, "app_id", "--size", "2"), 1, "select failed"),
            (("insert", "use_app_survey", "app_id=x"), 2, "unknown shared table"),
            (("update", FEATURE, "value=1"), 2, "needs --where"),
            (("select", FEATURE), 2, "needs COLUMNS"),
            (("show", "pref"), 2, "unknown table"),
            (("frobnicate", FEATURE), 2, "unknown command"),
            (("show", FEATURE, "--limit", "-1"), 2, "non-negative"),
        ]
        for args, expected_code, message in failures:
            with self.subTest(args=args):
                code, out, err = self.ctl(*args)
                self.assertEqual(code, expected_code)
                self.assertIn(message, err)
                self.assertEqual(len(err.splitlines()), 1)
        self.assertIn("usage: logmgrctl", self.ctl("--help")[1])

    def test_users_outside_the_allowed_group_are_refused_by_the_bus(self):
        self.start()
        prepare_for_other_users(self.dev)
        as_nobody = NOBODY + ["dbus-send", "--system", "--print-reply",
                              "--dest=com.corvane.logmgr"]
        path = "/com/corvane/logmgr/log/provider/" + FEATURE

        def send(prefix, *args):
            return subprocess.run(prefix + list(args), env=self.dev.env, capture_output=True,
                                  text=True, timeout=30)

        # The socket is reachable for that user: introspection is allowed to everyone.
        intro = send(as_nobody, path, "org.freedesktop.DBus.Introspectable.Introspect")
        self.assertEqual(intro.returncode, 0, intro.stderr)
        self.assertIn("com.corvane.logmgr.log.provider." + FEATURE, intro.stdout)
        for method, args in (("Insert", ["dict:string:string:app_id,x,feature,F"]),
                             ("Delete", ["string:1=1"]),
                             ("Select", ["string:*", "string:", "string:", "uint32:1"])):
            with self.subTest(method=method):
                r = send(as_nobody, path, f"com.corvane.logmgr.log.provider.{FEATURE}.{method}",
                         *args)
                self.assertNotEqual(r.returncode, 0)
                self.assertIn("AccessDenied", r.stderr)
        code, _, err = self.ctl("insert", STATUS, "app_id=x", "feature=F", prefix=NOBODY)
        self.assertEqual(code, 1)
        self.assertIn("Rejected send message", err)
        self.assertEqual(self.dev.query(".SurveyLog.db", f"SELECT COUNT(*) FROM {FEATURE}"),
                         [(0,)])
        # Root, the daemon's own user, is let through.
        self.assertEqual(self.ctl("insert", FEATURE, "app_id=x", "feature=F")[:2], (0, "1\n"))


if __name__ == "__main__":
    unittest.main()
