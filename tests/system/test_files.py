"""Trust at the edges the daemon does not own: who may send the platform signals it acts on (the
bus policy, and the host libraries' own sender check behind it), what may sit at a settings
key or the relay outbox, and whether the service unit fits the daemon."""
import configparser
import os
import re
import signal
import stat
import subprocess
import time
import unittest
from unittest import mock

from harness import BIN_DIR, CONSENT_KEY, NOBODY, SOURCE_DIR, TIMEOUT_SCALE, VALGRIND, \
    DeviceTestCase, wait_for
from test_app_usage import root_watched

FEATURE = "use_app_feature_survey"
UNIT = os.path.join(SOURCE_DIR, "packaging", "logmgrd.service")
TMPFILES = os.path.join(SOURCE_DIR, "packaging", "logmgrd.tmpfiles")
OUTBOX = "/opt/usr/data/log-relay/outbox.jsonl"

# One of each platform signal only root may send: path, interface, member, arguments.
ROOT_ONLY = [
    ("/Org/Tizen/System/DeviceD/PowerOff", "org.tizen.system.deviced.PowerOff", "ChangeState",
     ["int32:1"]),
    ("/Org/Tizen/System/Crash/Crash", "org.tizen.system.crash.Crash", "ProcessCrashed",
     ["string:x", "string:/usr/bin/x"]),
    ("/Org/Tizen/System/Notification/Status_message",
     "org.tizen.system.notification.status_message", "status_message",
     ["string:Screen captured."]),
    ("/org/tizen/pkgmgr_status", "org.tizen.pkgmgr_status", "status",
     ["string:r", "string:tpk", "string:p", "string:start", "string:install"]),
    ("/aul/dbus_handler", "org.tizen.aul.signal", "app_dead", ["uint32:1"]),
]
STATUS = ("/org/tizen/pkgmgr_status", "org.tizen.pkgmgr_status.status")
AUL = ("/aul/dbus_handler", "org.tizen.aul.signal")

# Prints "PATH INTERFACE.MEMBER" for every signal of the given interfaces it receives, and ends
# once |count| of them came on path /root.
LISTENER = r"""
import sys, dbus, dbus.mainloop.glib
from gi.repository import GLib
dbus.mainloop.glib.DBusGMainLoop(set_as_default=True)
bus, loop, left = dbus.SystemBus(), GLib.MainLoop(), [int(sys.argv[1])]
def on(*args, path, interface, member):
    print(path, interface + "." + member, flush=True)
    if path == "/root":
        left[0] -= 1
        if left[0] == 0:
            loop.quit()
for iface in sys.argv[2:]:
    bus.add_signal_receiver(on, dbus_interface=iface, path_keyword="path",
                            interface_keyword="interface", member_keyword="member")
print("ready", flush=True)
loop.run()
"""

class FilesCase(DeviceTestCase):

    def send(self, path, name, *args, as_nobody=False):
        """Sends one signal (dbus-send's notation) and returns once the daemon has handled it."""
        r = self.dev.send_signal(path, name, *args, as_nobody=as_nobody)
        self.assertEqual(r.returncode, 0, r.stderr)

    def dbus_send_as_nobody(self, path, iface, member, *args, dest=None):
        r = subprocess.run(NOBODY + ["dbus-send", "--system", "--type=signal"] +
                           ([f"--dest={dest}"] if dest else []) + [path, f"{iface}.{member}"] +
                           list(args), env=self.dev.env, capture_output=True, text=True,
                           timeout=30)
        self.assertEqual(r.returncode, 0, r.stderr)  # a broadcast is refused silently

    def features(self, code):
        return self.dev.query(".SurveyLog.db",
                              f"SELECT feature FROM {FEATURE} WHERE feature=?", (code,))

    def start(self, consent=True, **kwargs):
        if consent:
            self.dev.set_consent(True)
        proc = self.dev.start_daemon(**kwargs)
        self.dev.wait_tables()
        return proc

    def listen(self, count, interfaces):
        proc = subprocess.Popen(["/usr/bin/python3", "-c", LISTENER, str(count)] + interfaces,
                                env=self.dev.env, stdout=subprocess.PIPE, text=True)
        self.addCleanup(lambda: proc.poll() is None and proc.kill())
        self.assertEqual(proc.stdout.readline().strip(), "ready")
        return proc


class SignalPolicyTest(FilesCase):

    def test_bus_lets_only_root_send_the_platform_signals(self):
        interfaces = [s[1] for s in ROOT_ONLY]
        listener = self.listen(len(ROOT_ONLY), interfaces)
        proc = self.start()
        for path, iface, member, args in ROOT_ONLY:
            self.dbus_send_as_nobody("/forged", iface, member, *args)
            # Addressed straight to the daemon, the bus refuses it just the same.
            self.dbus_send_as_nobody(path, iface, member, *args, dest="com.corvane.logmgr")
        # Control: root's copies, on another path, reach a listener that saw none of nobody's
        # (root's power-off has another member, so that the daemon keeps running).
        controls = [("/root",) + s[1:] for s in ROOT_ONLY[1:]]
        controls.append(("/root", ROOT_ONLY[0][1], "Other", []))
        for _, iface, member, args in controls:
            self.send("/root", f"{iface}.{member}", *args)
        out, _ = listener.communicate(timeout=30 * TIMEOUT_SCALE)
        self.assertEqual(sorted(out.split("\n")[:-1]),
                         sorted(f"/root {c[1]}.{c[2]}" for c in controls))

        # Nobody's power-off, addressed to the daemon itself, never reached it either.
        self.assertIsNone(proc.poll())


class OpenBusCase(FilesCase):
    """A bus without our signal denials: forged platform signals reach every listener."""

    def setUp(self):
        with mock.patch.dict(os.environ, {"LOGMGR_OPEN_SIGNALS": "1"}):
            super().setUp()


class ForgedPlatformEventsTest(OpenBusCase):
    WITH_X = True
    APPS = {"com.ex.front": "pkg.front", "com.ex.back": "pkg.back"}

    def rows(self, sql):
        return self.dev.query(".SurveyLog.db", sql)

    def test_package_and_launch_events_count_only_from_root(self):
        pids = {}
        for app, package in self.APPS.items():
            self.dev.devsim("app", "install", app, "--package", package)
        self.start()
        for app in self.APPS:
            pids[app] = int(self.dev.devsim("app", "launch", app).stdout)
            self.addCleanup(self.dev.devsim, "app", "kill", app, check=False)
        # The open bus does carry nobody's signals to listeners.
        listener = self.listen(1, [STATUS[1].rpartition(".")[0]])
        self.dbus_send_as_nobody(STATUS[0], *STATUS[1].rsplit(".", 1), "string:r",
                                 "string:tpk", "string:pkg.x", "string:end", "string:fail")
        self.send("/root", STATUS[1], "string:r", "string:tpk", "string:pkg.x", "string:end",
                  "string:fail")
        self.assertIn(STATUS[0], listener.communicate(timeout=30 * TIMEOUT_SCALE)[0])

        with self.subTest("package events"):
            for req, pkg, nobody in (("f", "pkg.forged", True), ("g", "pkg.real", False)):
                for key, val in (("start", "install"), ("end", "ok")):
                    self.send(*STATUS, f"string:{req}", "string:tpk", f"string:{pkg}",
                              f"string:{key}", f"string:{val}", as_nobody=nobody)
            wait_for(lambda: self.rows("SELECT installed_app_id FROM manage_app_survey"),
                     message="the package row")
            self.assertEqual(self.rows("SELECT installed_app_id, type FROM manage_app_survey"),
                             [("pkg.real", 0)])

        with self.subTest("launch and death"):
            front, back = list(self.APPS)
            for nobody in (True, False):
                for app in self.APPS:
                    self.send(AUL[0], f"{AUL[1]}.app_launch", f"uint32:{pids[app]}",
                              as_nobody=nobody)
            wait_for(lambda: root_watched(self.dev.env["DISPLAY"]),
                     message="the daemon to watch the root window")
            # back in front, then front: back's period is written, front's has begun.
            self.dev.devsim("app", "focus", back)
            self.dev.devsim("app", "focus", front)
            wait_for(lambda: self.rows("SELECT app_id FROM use_app_survey"),
                     message="back's period")
            # A forged death would end front's period (or drop front unrecorded).
            self.send(AUL[0], f"{AUL[1]}.app_dead", f"uint32:{pids[front]}", as_nobody=True)
            self.assertEqual(self.rows("SELECT app_id FROM use_app_survey"), [("pkg.back",)])
            self.dev.devsim("app", "focus", back)
            wait_for(lambda: len(self.rows("SELECT app_id FROM use_app_survey")) == 2,
                     message="front's period")
            self.assertEqual(self.rows("SELECT app_id FROM use_app_survey ORDER BY _id"),
                             [("pkg.back",), ("pkg.front",)])


class KeyFilesTest(FilesCase):

    def test_a_fifo_at_a_key_never_stalls_the_daemon(self):
        proc = self.start()
        for n, key in enumerate((CONSENT_KEY, "memory/pm/state")):
            with self.subTest(key):
                path = self.dev.path(("/opt/var/kdb/" if key.startswith("db/") else "/var/run/")
                                     + key)
                os.makedirs(os.path.dirname(path), exist_ok=True)
                # Renamed into place, as a key is set: the daemon is told about it at once.
                os.mkfifo(path + ".fifo")
                os.rename(path + ".fifo", path)
                r = subprocess.run([os.path.join(BIN_DIR, "logmgrctl"), "insert", FEATURE,
                                    "app_id=probe", f"feature=P{n}"], env=self.dev.env,
                                   capture_output=True, text=True, timeout=20 * TIMEOUT_SCALE)
                self.assertEqual(r.returncode, 0, r.stderr)
                # A key still set the ordinary way keeps working.
                # The daemon reads a key when told of its change: the plug must be seen (its
                # open period stored) before the unplug replaces the value.
                self.dev.vconf_set("memory/sysman/earjack", "int", "1")
                wait_for(lambda: self.dev.query(
                    ".StatusMonitor.db", "SELECT 1 FROM survey_status_monitor "
                    "WHERE feature = 'HEAD' AND timestamp > 0"), message="the headset plugged")
                self.dev.vconf_set("memory/sysman/earjack", "int", "0")
                wait_for(lambda: len(self.features("HEAD")) == n + 1, message="a headset row")
                self.assertIsNone(proc.poll())
        self.assertEqual(len(self.features("P0")) + len(self.features("P1")), 2)


class OutboxAndDatabasesTest(FilesCase):

    def set_prefs(self, sent):
        self.dev.set_pref("key_sent_date", sent)
        self.dev.set_pref("key_delete_date", None)

    def test_outbox_never_follows_a_link_and_files_are_owner_only_under_umask_0(self):
        umask0 = ["sh", "-c", 'umask 000; exec "$0" "$@"']  # memcheck's arguments follow
        tm = time.localtime()
        two_days_ago = int(time.mktime((tm.tm_year, tm.tm_mon, tm.tm_mday - 2, 0, 0, 0, 0, 0,
                                        -1)))
        proc = self.start(prefix=umask0)
        wait_for(lambda: self.dev.pref("key_sent_date"), message="the first start")
        proc.send_signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(proc), 0)

        target = os.path.join(self.dev.sysroot, "target")
        with open(target, "w") as f:
            f.write("keep\n")
        outbox = self.dev.path(OUTBOX)
        os.makedirs(os.path.dirname(outbox), exist_ok=True)
        os.symlink(target, outbox)
        self.set_prefs(two_days_ago)
        proc = self.dev.start_daemon(prefix=umask0)
        # The run ends with the weekly purge date: by then the hand-over was tried.
        wait_for(lambda: self.dev.pref("key_delete_date"), timeout=30, message="the report run")
        with open(target) as f:
            self.assertEqual(f.read(), "keep\n")
        self.assertTrue(os.path.islink(outbox))
        proc.send_signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(proc), 0)

        # Without the link the records left queued are handed over into a file of our own.
        os.unlink(outbox)
        self.set_prefs(two_days_ago)
        self.dev.start_daemon(prefix=umask0)
        wait_for(lambda: os.path.exists(outbox) and os.path.getsize(outbox) > 0, timeout=30,
                 message="records in the outbox")
        dbspace = os.path.dirname(self.dev.db_path(".pref.db"))
        paths = [outbox] + [os.path.join(dbspace, n) for n in sorted(os.listdir(dbspace))]
        self.assertGreaterEqual(len(paths), 5)  # the outbox and the four databases at least
        for path in paths:
            with self.subTest(path):
                self.assertEqual(stat.S_IMODE(os.lstat(path).st_mode), 0o600)


class ServiceUnitTest(FilesCase):

    def test_unit_lets_the_daemon_write_what_it_writes_and_bounds_it(self):
        unit = configparser.ConfigParser(strict=False, interpolation=None)
        unit.optionxform = str
        unit.read(UNIT)
        service = unit["Service"]
        writable = service["ReadWritePaths"].split()
        with open(TMPFILES) as f:
            made = {line.split()[1] for line in f if line.startswith("d ")}
        # A writable path missing at start would keep the unit from starting at all.
        self.assertLessEqual(set(writable), made)

        r = subprocess.run(["systemd-analyze", "security", "--offline=true", UNIT],
                           capture_output=True, text=True, timeout=60)
        score = re.search(r"Overall exposure level for \S+: ([0-9.]+)", r.stdout)
        self.assertIsNotNone(score, r.stdout + r.stderr)
        self.assertLessEqual(float(score.group(1)), 1.5)

        self.dev.set_consent(True)
        started = time.time()  # from here on, every file written is the daemon's
        proc = self.start(consent=False)
        dump_key = self.dev.path("/opt/var/kdb/db/corvane-log-manager/dumpcontext")
        wait_for(lambda: os.path.exists(dump_key), message="the dump key")
        for n in range(20):
            self.dev.run_tool("logmgrctl", "insert", FEATURE, "app_id=a", f"feature=F{n}")
        written = []
        for root, dirs, files in os.walk(self.dev.sysroot):
            rel = os.path.relpath(root, self.dev.sysroot)
            if rel == "run" or rel.startswith("run/"):
                continue  # the bus and host-env's own state
            for name in files:
                path = os.path.join(root, name)
                # The daemon's output and memcheck's or a sanitizer's reports are the test's.
                if rel == "." and (name == "logmgrd.out" or
                                   name.startswith(("valgrind.", "tsan."))):
                    continue
                if os.lstat(path).st_mtime >= started:
                    written.append("/" + os.path.relpath(path, self.dev.sysroot))
        self.assertIn("/opt/var/kdb/db/corvane-log-manager/dumpcontext", written)
        for path in written:
            with self.subTest(path):
                self.assertTrue(any(path.startswith(w.rstrip("/") + "/") for w in writable))

        with open(f"/proc/{proc.pid}/maps") as f:
            sanitized = any(rt in f.read() for rt in ("libasan", "libtsan"))
        # memcheck's or a sanitizer's own footprint says nothing about the daemon's.
        if not VALGRIND and not sanitized:
            with open(f"/proc/{proc.pid}/status") as f:
                status = dict(line.split(":", 1) for line in f)
            peak_kb = int(status["VmHWM"].split()[0])
            max_kb = int(service["MemoryMax"].rstrip("M")) * 1024
            self.assertLess(peak_kb * 2, max_kb)
            self.assertLess(int(status["Threads"]) * 2, int(service["TasksMax"]))


if __name__ == "__main__":
    unittest.main()
