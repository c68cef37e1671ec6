"""Shared fixture of the system tests: a simulated device in a fresh temporary sysroot.

A Device has its own private system bus (and Xvfb when asked), runs the real logmgrd and the
real tools from the build directory, and offers polling waits. Nothing reaches into the daemon:
tests drive it with vconftool, devsim, logmgrctl, D-Bus and files.
"""
import json
import os
import re
import shutil
import signal
import sqlite3
import subprocess
import tempfile
import time
import unittest

SOURCE_DIR = os.environ.get("LOGMGR_SOURCE_DIR",
                            os.path.dirname(os.path.dirname(os.path.dirname(
                                os.path.abspath(__file__)))))
BUILD_DIR = os.environ.get("LOGMGR_BUILD_DIR", os.path.join(SOURCE_DIR, "build"))
BIN_DIR = os.path.join(BUILD_DIR, "bin")
HOST_ENV = os.path.join(SOURCE_DIR, "scripts", "host-env")
CONSENT_KEY = "db/setting/report_diagnostic_info"
BUS_NAME = "com.corvane.logmgr"
DBSPACE = "/opt/usr/dbspace"
# LOGMGR_VALGRIND=1 runs logmgrd under memcheck; every wait then allows this many times longer.
VALGRIND = os.environ.get("LOGMGR_VALGRIND", "0") == "1"
TIMEOUT_SCALE = float(os.environ.get("LOGMGR_TIMEOUT_SCALE", "8" if VALGRIND else "1"))
VALGRIND_SUPP = os.path.join(SOURCE_DIR, "tests", "valgrind.supp")
VALGRIND_STATUS = 99


def wait_for(condition, timeout=10.0, interval=0.02, message="condition"):
    """Polls |condition| until it returns a true value, which is returned."""
    timeout *= TIMEOUT_SCALE
    deadline = time.monotonic() + timeout
    while True:
        value = condition()
        if value:
            return value
        if time.monotonic() > deadline:
            raise AssertionError(f"timed out after {timeout}s waiting for {message}")
        time.sleep(interval)


# Emits one signal and stays connected until the daemon has answered a ping, which it does
# only after handling the signal: the daemon asks the bus for a signal sender's uid, and a
# sender already gone is nobody. Arguments in dbus-send's notation (string:x, uint32:7, ...).
SIGNAL_SENDER = r"""
import json, sys
import dbus, dbus.lowlevel
address, dest, path, interface, member, args = json.loads(sys.argv[1])
types = {"string": dbus.String, "int32": dbus.Int32, "uint32": dbus.UInt32,
         "int64": dbus.Int64, "byte": dbus.Byte, "boolean": lambda v: dbus.Boolean(v == "true")}
bus = dbus.bus.BusConnection(address)
msg = dbus.lowlevel.SignalMessage(path, interface, member)
if dest:
    msg.set_destination(dest)
values = [types[a.partition(":")[0]](a.partition(":")[2]) for a in args]
if values:
    msg.append(*values)
bus.send_message(msg)
bus.flush()
try:
    bus.call_blocking("com.corvane.logmgr", "/", "org.freedesktop.DBus.Peer", "Ping", "", (),
                      timeout=120)
except dbus.exceptions.DBusException:
    pass
"""
NOBODY = ["setpriv", "--reuid=65534", "--regid=65534", "--clear-groups"]


def valgrind_prefix(log_dir):
    """memcheck around logmgrd when LOGMGR_VALGRIND=1: a memory error ends it with status 99
    and is written to |log_dir|/valgrind.<pid>.log, which Device.close turns into a failure."""
    if not VALGRIND:
        return []
    return ["valgrind", "--quiet", f"--error-exitcode={VALGRIND_STATUS}", "--leak-check=no",
            "--track-origins=no", "--vgdb=no", f"--suppressions={VALGRIND_SUPP}",
            f"--log-file={os.path.join(log_dir, 'valgrind.%p.log')}"]


# Valgrind 3.19 (Debian 12) does not know pidfd_open; the call fails there with ENOSYS, which the
# daemon handles by looking the process up again, so the notice (five lines) is no error of ours.
UNKNOWN_SYSCALL = re.compile(r"^--\d+-- WARNING: unhandled amd64-linux syscall: 434$")


def valgrind_reports(log_dir):
    reports = []
    for name in sorted(os.listdir(log_dir)):
        if name.startswith("valgrind.") and name.endswith(".log"):
            with open(os.path.join(log_dir, name)) as f:
                lines, kept, skip = f.read().splitlines(), [], 0
            for line in lines:
                if UNKNOWN_SYSCALL.match(line):
                    skip = 5
                if skip:
                    skip -= 1
                else:
                    kept.append(line)
            text = "\n".join(kept).strip()
            if text:
                reports.append(text)
    return reports


# A sanitizer build's options gain a log path in the sysroot, so a report from the daemon (or a
# tool) is found by Device.close and fails the test even when the process it ended goes unseen.
SANITIZER_LOGS = (("TSAN_OPTIONS", "tsan"),)


def sanitizer_reports(log_dir):
    reports = []
    for name in sorted(os.listdir(log_dir)):
        if any(name.startswith(prefix + ".") for _, prefix in SANITIZER_LOGS):
            with open(os.path.join(log_dir, name), errors="replace") as f:
                reports.append(f.read().strip())
    return [r for r in reports if r]


def kill_programs_under(root):
    """SIGKILLs every process whose program lives under |root| (apps a test launched and left)."""
    prefix = root.rstrip("/") + "/"
    for pid in os.listdir("/proc"):
        if not pid.isdigit():
            continue
        try:
            if os.readlink(f"/proc/{pid}/exe").startswith(prefix):
                os.kill(int(pid), signal.SIGKILL)
        except OSError:
            pass  # gone already, or not ours to read


class Device:
    """A simulated device: temp sysroot, private bus, optional Xvfb, the daemon process."""

    def __init__(self, with_x=False):
        self.sysroot = tempfile.mkdtemp(prefix="logmgr-dev-")
        args = [HOST_ENV, "start", self.sysroot] + ([] if with_x else ["--no-x"])
        out = subprocess.run(args, check=True, capture_output=True, text=True).stdout
        self.env = dict(os.environ)
        for line in out.splitlines():
            if line.startswith("export "):
                key, _, value = line[len("export "):].partition("=")
                self.env[key] = value
        if not with_x:
            self.env.pop("DISPLAY", None)
        for var, prefix in SANITIZER_LOGS:
            if self.env.get(var):
                self.env[var] += ":log_path=" + os.path.join(self.sysroot, prefix)
        self.daemon = None
        self.procs = []

    # --- paths and files -------------------------------------------------------------------
    def path(self, fixed_path):
        return os.path.join(self.sysroot, fixed_path.lstrip("/"))

    def db_path(self, name):
        return self.path(os.path.join(DBSPACE, name))

    def query(self, db_name, sql, args=()):
        """Rows of |sql| on a database of the device, read-only; [] while the file or the table
        does not exist yet (the daemon creates the file before its tables)."""
        path = self.db_path(db_name)
        if not os.path.exists(path):
            return []
        con = sqlite3.connect(f"file:{path}?mode=ro", uri=True, timeout=5)
        try:
            return con.execute(sql, args).fetchall()
        except sqlite3.OperationalError as e:
            if str(e).startswith("no such table"):
                return []
            raise
        finally:
            con.close()

    def pref(self, key):
        rows = self.query(".pref.db", "SELECT pref_data FROM pref WHERE pref_key = ?", (key,))
        return rows[0][0] if rows else None

    def set_pref(self, key, value):
        """Writes a preference (None removes it) beside the daemon, as another process would."""
        con = sqlite3.connect(self.db_path(".pref.db"), timeout=10)
        with con:
            con.execute("DELETE FROM pref WHERE pref_key = ?", (key,))
            if value is not None:
                con.execute("INSERT INTO pref VALUES(?, ?)", (key, str(value)))
        con.close()

    # --- tools -----------------------------------------------------------------------------
    def run_tool(self, name, *args, check=True, env=None):
        return subprocess.run([os.path.join(BIN_DIR, name)] + [str(a) for a in args],
                              env=env or self.env, capture_output=True, text=True,
                              check=check, timeout=60)

    def vconf_set(self, key, vtype, value):
        self.run_tool("vconftool", "set", "-t", vtype, key, value)

    def vconf_get(self, key):
        r = self.run_tool("vconftool", "get", key, check=False)
        return r.stdout.strip() if r.returncode == 0 else None

    def set_consent(self, on):
        self.vconf_set(CONSENT_KEY, "bool", "1" if on else "0")

    def devsim(self, *args, check=True):
        return self.run_tool("devsim", *args, check=check)

    def dbus_send(self, *args):
        if args and args[0] == "--type=signal":
            return self.send_signal(*args[1:])
        return subprocess.run(["dbus-send", "--system"] + list(args), env=self.env,
                              capture_output=True, text=True, timeout=30)

    def send_signal(self, *args, as_nobody=False):
        """A signal as dbus-send takes it ([--dest=NAME] PATH INTERFACE.MEMBER ARG...), sent by
        root or by nobody; returns once the daemon has handled it."""
        args = list(args)
        dest = args.pop(0)[len("--dest="):] if args[0].startswith("--dest=") else ""
        path, name = args[0], args[1]
        interface, _, member = name.rpartition(".")
        request = json.dumps([self.env["DBUS_SYSTEM_BUS_ADDRESS"], dest, path, interface, member,
                              args[2:]])
        return subprocess.run((NOBODY if as_nobody else []) +
                              ["/usr/bin/python3", "-c", SIGNAL_SENDER, request], env=self.env,
                              capture_output=True, text=True, timeout=150)

    def name_owner(self, name=BUS_NAME):
        r = self.dbus_send("--print-reply", "--dest=org.freedesktop.DBus", "/",
                           "org.freedesktop.DBus.GetNameOwner", f"string:{name}")
        if r.returncode != 0:
            return None
        return r.stdout.strip().splitlines()[-1].split('"')[1]

    def name_queue(self, name=BUS_NAME):
        r = self.dbus_send("--print-reply", "--dest=org.freedesktop.DBus", "/",
                           "org.freedesktop.DBus.ListQueuedOwners", f"string:{name}")
        if r.returncode != 0:
            return []
        return [l.split('"')[1] for l in r.stdout.splitlines() if '"' in l]

    # --- the daemon ------------------------------------------------------------------------
    def start_daemon(self, wait_for_name=True, prefix=(), extra_env=None):
        env = dict(self.env)
        env.update(extra_env or {})
        log = open(os.path.join(self.sysroot, "logmgrd.out"), "ab")
        proc = subprocess.Popen(list(prefix) + valgrind_prefix(self.sysroot) +
                                [os.path.join(BIN_DIR, "logmgrd")], env=env,
                                stdout=log, stderr=log, stdin=subprocess.DEVNULL)
        log.close()
        self.procs.append(proc)
        if self.daemon is None:
            self.daemon = proc
        if wait_for_name:
            wait_for(lambda: self.name_owner() is not None or proc.poll() is not None,
                     message="logmgrd to own its name")
        return proc

    def wait_exit(self, proc=None, timeout=10.0):
        proc = proc or self.daemon
        try:
            return proc.wait(timeout * TIMEOUT_SCALE)
        except subprocess.TimeoutExpired:
            raise AssertionError(f"logmgrd did not exit within {timeout}s")

    def survey_tables(self):
        return self.query(".SurveyLog.db", "SELECT COUNT(*) FROM sqlite_master WHERE name LIKE "
                          "'%_survey'") == [(5,)]

    def wait_tables(self):
        wait_for(self.survey_tables, message="the survey tables")

    def wait_started(self, timeout=10.0):
        """Waits until the deferred start has created the databases."""
        wait_for(lambda: os.path.exists(self.db_path(".pref.db")), timeout,
                 message="the daemon's start")

    # --- platform faults -------------------------------------------------------------------
    def host_state(self):
        path = os.path.join(self.sysroot, "run", "host-env", "state")
        with open(path) as f:
            return dict(line.rstrip("\n").split("=", 1) for line in f if "=" in line)

    def _write_host_state(self, state):
        path = os.path.join(self.sysroot, "run", "host-env", "state")
        with open(path, "w") as f:
            f.writelines(f"{k}={v}\n" for k, v in state.items())

    def stop_bus(self):
        """Ends the private system bus under whatever is connected to it."""
        state = self.host_state()
        pid = int(state.pop("bus_pid"))
        os.kill(pid, signal.SIGTERM)
        wait_for(lambda: not os.path.exists(f"/proc/{pid}"), message="the bus to end")
        self._write_host_state(state)

    def start_bus(self):
        """A new bus daemon on the same socket; its address (new guid) replaces the old one."""
        config = os.path.join(self.sysroot, "run", "host-env", "system-bus.conf")
        socket_path = os.path.join(self.sysroot, "run", "dbus", "system_bus_socket")
        if os.path.exists(socket_path):
            os.unlink(socket_path)
        out = subprocess.run(["dbus-daemon", f"--config-file={config}", "--fork",
                              "--print-address=1", "--print-pid=1"], check=True,
                             capture_output=True, text=True).stdout.split("\n")
        state = self.host_state()
        state["bus_address"], state["bus_pid"] = out[0].strip(), out[1].strip()
        self._write_host_state(state)
        self.env["DBUS_SYSTEM_BUS_ADDRESS"] = state["bus_address"]

    def kill_x(self):
        """Ends Xvfb at once, as a crashed X server would go."""
        state = self.host_state()
        pid = int(state.pop("xvfb_pid"))
        os.kill(pid, signal.SIGKILL)
        wait_for(lambda: not os.path.exists(f"/proc/{pid}"), message="Xvfb to end")
        self._write_host_state(state)

    def signal(self, signum, proc=None):
        (proc or self.daemon).send_signal(signum)

    def close(self):
        for proc in self.procs + [self.daemon]:
            if proc is not None and proc.poll() is None:
                proc.send_signal(signal.SIGKILL)
            if proc is not None:
                proc.wait()
        kill_programs_under(self.sysroot)
        reports = valgrind_reports(self.sysroot) if VALGRIND else []
        races = sanitizer_reports(self.sysroot)
        subprocess.run([HOST_ENV, "stop", self.sysroot], capture_output=True)
        shutil.rmtree(self.sysroot, ignore_errors=True)
        if reports:
            raise AssertionError("memcheck found errors in logmgrd:\n" + "\n".join(reports))
        if races:
            raise AssertionError("sanitizer reports:\n" + "\n".join(races))


class DeviceTestCase(unittest.TestCase):
    """Gives every test a fresh device in self.dev; set WITH_X for tests that need X."""
    WITH_X = False

    def setUp(self):
        self.dev = Device(with_x=self.WITH_X)
        self.addCleanup(self.dev.close)
