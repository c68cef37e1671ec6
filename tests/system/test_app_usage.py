"""Foreground periods through the real daemon: real app processes, real X windows (Xvfb)."""
import os
import time
import unittest

from harness import DBSPACE, DeviceTestCase, wait_for

FAKETIME_LIB = "/usr/lib/x86_64-linux-gnu/faketime/libfaketime.so.1"

ALPHA, BETA, GAMMA, LOCK = "com.ex.alpha", "com.ex.beta", "com.ex.gamma", "com.corvane.lockscreen"
PACKAGES = {ALPHA: "pkg.alpha", BETA: "pkg.beta", LOCK: LOCK}
AUL = ("/aul/dbus_handler", "org.tizen.aul.signal")


class MsClock:
    """The daemon's wall clock, standing still until the test advances it (in milliseconds)."""

    def __init__(self, dev, start_ms=1773136800000):
        self.path = os.path.join(dev.sysroot, "faketime")
        self.now_ms = start_ms
        self._write()
        asan = dev.env.get("ASAN_OPTIONS", "")
        # A sanitizer build would refuse a preload ahead of its runtime.
        self.env = {"LD_PRELOAD": FAKETIME_LIB, "FAKETIME_TIMESTAMP_FILE": self.path,
                    "FAKETIME_NO_CACHE": "1", "FAKETIME_DONT_FAKE_MONOTONIC": "1",
                    "ASAN_OPTIONS": (asan + ":" if asan else "") + "verify_asan_link_order=0"}

    def _write(self):
        stamp = time.strftime("%Y-%m-%d %H:%M:%S", time.localtime(self.now_ms // 1000))
        with open(self.path + ".tmp", "w") as f:
            # Half a microsecond past the millisecond: libfaketime reads the fraction as a
            # double and truncates, so ".015" alone would come back as 14.999999 ms.
            f.write(f"{stamp}.{self.now_ms % 1000:03d}000500\n")
        os.replace(self.path + ".tmp", self.path)

    def advance_ms(self, ms):
        self.now_ms += ms
        self._write()


def root_watched(display_name):
    """Whether someone (the daemon) watches the root window's properties on |display_name|."""
    from Xlib import X, display
    d = display.Display(display_name)
    try:
        return d.screen().root.get_attributes().all_event_masks & X.PropertyChangeMask
    finally:
        d.close()


def front_at_known_time(dev, clock, gamma_rows, app):
    """Brings gamma and then |app| to the front until a gamma row of exactly this probe's
    length shows the daemon took both in step with the frozen clock."""
    attempts = []

    def probe():
        # Each probe has its own length, so a late row of an earlier probe never passes for
        # this one; X events are handled in order, so this row being last means none is pending.
        attempts.append(1000 + len(attempts))
        count = len(gamma_rows())
        dev.devsim("app", "focus", GAMMA)
        clock.advance_ms(attempts[-1])
        dev.devsim("app", "focus", app)
        try:
            rows = wait_for(lambda: gamma_rows()[count:], timeout=10)
        except AssertionError:
            return False
        return rows[-1][-1] == attempts[-1]
    wait_for(probe, timeout=60, interval=0, message="the daemon to follow the windows")


class AppCase(DeviceTestCase):
    WITH_X = True
    FROZEN = False  # the daemon's wall clock stands still until the test advances it

    def setUp(self):
        super().setUp()
        self.pids = {}
        for app, package in PACKAGES.items():
            self.dev.devsim("app", "install", app, "--package", package)
        os.makedirs(self.dev.path(DBSPACE), exist_ok=True)
        self.dev.set_consent(True)
        self.clock = MsClock(self.dev) if self.FROZEN else None
        self.dev.start_daemon(extra_env=self.clock.env if self.clock else None)
        for app in PACKAGES:
            self.pids[app] = int(self.dev.devsim("app", "launch", app).stdout)
            self.addCleanup(self.dev.devsim, "app", "kill", app, check=False)

        # Launches count once the daemon listens, and the first one counted makes it watch the
        # root window: announce them again until it does.
        def launched():
            for pid in self.pids.values():
                self.aul("app_launch", f"uint32:{pid}")
            return self.root_watched()
        wait_for(launched, timeout=30, interval=0.2, message="the daemon to watch the root window")

    def root_watched(self):
        return root_watched(self.dev.env["DISPLAY"])

    def focus(self, app, *extra):
        self.dev.devsim("app", "focus", app, *extra)
        return time.monotonic()

    def periods(self, package=None):
        rows = self.dev.query(".SurveyLog.db",
                              "SELECT app_id, duration FROM use_app_survey ORDER BY _id")
        return [r for r in rows if package is None or r[0] == package]

    def in_front_at_known_time(self, app):
        """Returns the gamma rows written so far; |app|'s period starts now."""
        if GAMMA not in self.pids:
            self.dev.devsim("app", "install", GAMMA)
            self.pids[GAMMA] = int(self.dev.devsim("app", "launch", GAMMA).stdout)
            self.addCleanup(self.dev.devsim, "app", "kill", GAMMA, check=False)
        front_at_known_time(self.dev, self.clock, lambda: self.periods(GAMMA), app)
        return self.periods(GAMMA)

    def aul(self, member, *args):
        self.dev.dbus_send("--type=signal", AUL[0], f"{AUL[1]}.{member}", *args)


class AppUsageTest(AppCase):

    def test_bad_input_lock_screen_and_screen_off(self):
        def step(count, message):
            wait_for(lambda: len(self.periods()) == count, message=message)

        self.focus(BETA)
        self.aul("app_launch", "string:123")
        self.aul("app_dead", "int32:5")
        self.aul("app_launch", "uint32:4000000")  # no such process
        self.aul("app_launch", f"uint32:{os.getpid()}")  # a process of no app
        self.aul("app_dead", f"uint32:{os.getpid()}")
        self.focus(ALPHA, "--no-pid")  # a window of no process: beta's period runs on
        self.focus(ALPHA)
        step(1, "beta's period")
        self.focus(LOCK)  # ends alpha's period and starts none
        step(2, "alpha's period at the lock screen")
        self.focus(BETA)
        self.focus(ALPHA)
        step(3, "beta's period")
        self.dev.devsim("screen", "off")
        step(4, "alpha's period at screen off")
        self.focus(BETA)  # while the screen is off: no period for anyone
        self.dev.devsim("screen", "on")
        self.focus(ALPHA)
        step(5, "beta's period from screen on")
        self.assertEqual([r[0] for r in self.periods()],
                         ["pkg.beta", "pkg.alpha", "pkg.beta", "pkg.alpha", "pkg.beta"])
        self.assertIsNone(self.dev.daemon.poll())


class FrozenClockTest(AppCase):
    """On the daemon's own clock, which moves only when the test moves it, lengths are exact
    however slowly the machine runs."""
    FROZEN = True

    def test_period_lengths_and_deaths_from_150_ms_into_a_period(self):
        self.in_front_at_known_time(ALPHA)
        before = len(self.periods("pkg.alpha"))
        self.clock.advance_ms(5000)
        self.focus(BETA)
        rows = wait_for(lambda: self.periods("pkg.alpha")[before:], message="alpha's period")
        self.assertEqual(rows, [("pkg.alpha", 5000)])

        gammas = self.in_front_at_known_time(ALPHA)
        betas = len(self.periods("pkg.beta"))
        self.clock.advance_ms(149)
        self.dev.devsim("app", "kill", GAMMA)
        self.clock.advance_ms(1851)
        self.dev.devsim("app", "kill", BETA)  # in the background, still counted
        rows = wait_for(lambda: self.periods("pkg.beta")[betas:], message="beta's row")
        self.assertEqual(self.periods(GAMMA), gammas)  # its death came too early to count
        self.assertEqual(rows, [("pkg.beta", 2000)])


if __name__ == "__main__":
    unittest.main()
