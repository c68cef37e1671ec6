"""Platform signals forged by nobody steer nothing; root's still work. The bus policy refuses
them already; the second class runs on a bus without those denials (host-env's open-signals
switch), where only the daemon's own check of the sender's uid stands."""
import os
import unittest

from harness import DeviceTestCase, wait_for

POWER_OFF = ("/Org/Tizen/System/DeviceD/PowerOff", "org.tizen.system.deviced.PowerOff.ChangeState")
CRASH = ("/Org/Tizen/System/Crash/Crash", "org.tizen.system.crash.Crash.ProcessCrashed")
STATUS = ("/Org/Tizen/System/Notification/Status_message",
          "org.tizen.system.notification.status_message.status_message")
MOVEMENT = ("--dest=com.corvane.logmgr", "/org/tizen/sensor/context/movement",
            "org.tizen.sensor.context.movement.wakeup")
EXE = "/opt/usr/apps/victim/bin/victim"


class ForgedSignalsTest(DeviceTestCase):
    OPEN_SIGNALS = False

    def setUp(self):
        saved = os.environ.get("LOGMGR_OPEN_SIGNALS")
        os.environ["LOGMGR_OPEN_SIGNALS"] = "1" if self.OPEN_SIGNALS else "0"
        try:
            super().setUp()
        finally:
            if saved is None:
                del os.environ["LOGMGR_OPEN_SIGNALS"]
            else:
                os.environ["LOGMGR_OPEN_SIGNALS"] = saved

    def features(self, code):
        return self.dev.query(".SurveyLog.db", "SELECT count(*) FROM use_app_feature_survey "
                                               "WHERE feature = ?", (code,))[0][0]

    def crashes(self):
        return self.dev.query(".SurveyLog.db", "SELECT count(*) FROM report_app_error_survey")[0][0]

    def test_forged_power_off_crash_and_capture_change_nothing(self):
        self.dev.devsim("app", "install", "com.ex.victim", "--exec", EXE)
        self.dev.set_consent(True)
        proc = self.dev.start_daemon()
        # Root's capture is the control that the daemon is up and listening.
        wait_for(lambda: self.dev.devsim("capture") and self.features("CAPT"), timeout=20,
                 message="root's capture to be recorded")
        captures = self.features("CAPT")

        # Each returns once the daemon has handled (or never got) the signal.
        for args in ((*CRASH, "string:victim", f"string:{EXE}"),
                     (*STATUS, "string:Screen captured."), (*POWER_OFF, "int32:2"), MOVEMENT):
            r = self.dev.send_signal(*args, as_nobody=True)
            self.assertEqual(r.returncode, 0, r.stderr)
        self.assertEqual((self.crashes(), self.features("CAPT")), (0, captures))
        self.assertIsNone(proc.poll())

        # Anyone may send the movement wake-up, addressed to the daemon; it counts as an unlock.
        wait_for(lambda: self.features("UNLO") == 1, message="the wake-up's unlock row")

        # Root's signals still act, the power-off last.
        self.dev.devsim("crash", "com.ex.victim")
        self.dev.devsim("capture")
        self.assertEqual((self.crashes(), self.features("CAPT")), (1, captures + 1))
        self.assertIsNone(proc.poll())
        self.dev.devsim("poweroff")
        self.assertEqual(self.dev.wait_exit(proc), 0)


class ForgedSignalsOnAnOpenBusTest(ForgedSignalsTest):
    OPEN_SIGNALS = True


if __name__ == "__main__":
    unittest.main()
