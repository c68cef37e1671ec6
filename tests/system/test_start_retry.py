"""A start that keeps failing (the survey database cannot be opened) is retried cheaply, without
growing, ends on SIGTERM, and becomes a normal start once the obstacle is gone."""
import os
import signal
import time
import unittest

from harness import DeviceTestCase, wait_for


def cpu_ticks(pid):
    with open(f"/proc/{pid}/stat") as f:
        fields = f.read().rpartition(")")[2].split()
    return int(fields[11]) + int(fields[12])  # utime + stime


def rss_kb(pid):
    with open(f"/proc/{pid}/status") as f:
        return next(int(l.split()[1]) for l in f if l.startswith("VmRSS:"))


class StartRetryTest(DeviceTestCase):

    def start_blocked(self, database=".SurveyLog.db", content=None):
        # A directory (or a file that is no database) where a database belongs.
        if content is None:
            os.makedirs(self.dev.db_path(database))
        else:
            with open(self.dev.db_path(database), "wb") as f:
                f.write(content)
        self.dev.set_consent(True)
        proc = self.dev.start_daemon()
        self.dev.wait_started()
        return proc

    def insert(self, app_id):
        return self.dev.run_tool("logmgrctl", "insert", "use_app_feature_survey",
                                 f"app_id={app_id}", "feature=TEST", check=False).returncode == 0

    def assert_recording(self):
        wait_for(lambda: self.insert("after.obstacle"), message="a bus Insert to succeed")
        self.dev.devsim("app", "install", "com.ex.retry")
        self.dev.devsim("crash", "com.ex.retry")  # returns once the daemon has handled it
        crashes = lambda: self.dev.query(".SurveyLog.db",
                                         "SELECT app_id FROM report_app_error_survey")
        wait_for(crashes, message="the crash row")
        self.assertEqual(crashes(), [("com.ex.retry",)])  # the monitor started once

    def test_retries_stay_cheap_and_flat_then_start_once_the_file_is_usable(self):
        proc = self.start_blocked()
        # After a first second (first attempts, memcheck's warm-up), the CPU used stays a small
        # share of the time that passed, and memory does not grow with the retries.
        samples = []  # (seconds since start, CPU ticks, RSS kB)
        t0 = time.monotonic()

        def window_over():
            samples.append((time.monotonic() - t0, cpu_ticks(proc.pid), rss_kb(proc.pid)))
            return samples[-1][0] >= 4
        wait_for(window_over, interval=0.2, message="the measuring window")
        settled = [s for s in samples if s[0] >= 1]
        elapsed_ticks = (settled[-1][0] - settled[0][0]) * os.sysconf("SC_CLK_TCK")
        used = settled[-1][1] - settled[0][1]
        self.assertLess(used, 0.2 * elapsed_ticks, f"{used} ticks in {elapsed_ticks:.0f}")
        rss = [s[2] for s in settled]
        self.assertLess(max(rss) - rss[0], 4096, f"RSS samples (kB): {rss}")
        self.assertIsNone(proc.poll())
        os.rmdir(self.dev.db_path(".SurveyLog.db"))
        self.assert_recording()
        self.assertEqual(self.dev.query(".SurveyLog.db", "SELECT app_id FROM "
                                        "use_app_feature_survey WHERE feature = 'TEST'"),
                         [("after.obstacle",)])

    def test_a_file_that_is_not_a_database_is_left_alone_and_retried_until_replaced(self):
        garbage = b"not a database\n" * 64
        proc = self.start_blocked(content=garbage)
        self.assertFalse(self.insert("blocked"))
        with open(self.dev.db_path(".SurveyLog.db"), "rb") as f:
            self.assertEqual(f.read(), garbage)
        os.unlink(self.dev.db_path(".SurveyLog.db"))
        self.assert_recording()
        self.assertIsNone(proc.poll())

    def test_a_start_failing_after_the_monitors_began_starts_each_once(self):
        # The snapshot store fails the first attempt after the crash monitor has started; the
        # retry gets past it (the store stays, failing its operations).
        self.start_blocked(".StatusMonitor.db")
        self.assert_recording()

    def test_sigterm_during_the_retries_ends_with_status_zero(self):
        proc = self.start_blocked()
        proc.send_signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(proc), 0)


if __name__ == "__main__":
    unittest.main()
