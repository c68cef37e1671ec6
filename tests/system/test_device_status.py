"""Device status features through the real daemon: periods, battery, events, Bluetooth, restarts.
Wherever a duration is checked the daemon runs on a frozen clock, so durations are exact."""
import os
import signal
import sqlite3
import subprocess

import dbus

from harness import DBSPACE, DeviceTestCase, wait_for
from test_app_usage import MsClock

FEATURE_DB = ".SurveyLog.db"
SNAPSHOT_DB = ".StatusMonitor.db"
APP_ID = "com.corvane.logmanager"


class DeviceStatusCase(DeviceTestCase):
    base = 0

    def start(self, clock=None):
        os.makedirs(self.dev.path(DBSPACE), exist_ok=True)
        self.dev.set_consent(True)
        proc = self.dev.start_daemon(extra_env=clock.env if clock else None)
        self.dev.daemon = proc
        self.wait_monitoring()
        return proc

    def wait_monitoring(self):
        """Unlocks until an UNLO row shows every handler is registered; later rows are new."""
        # Only an UNLO row counts: the restart recovery writes rows of its own before the
        # handlers are registered.
        def probe():
            before = self.max_id("UNLO")
            self.dev.devsim("unlock")
            try:
                return wait_for(lambda: self.max_id("UNLO") > before, timeout=1.0)
            except AssertionError:
                return False
        wait_for(probe, timeout=30, interval=0, message="the device status monitor")
        self.base = self.max_id()

    def max_id(self, feature=None):
        where = " WHERE feature = ?" if feature else ""
        try:
            rows = self.dev.query(FEATURE_DB, "SELECT MAX(_id) FROM use_app_feature_survey" + where,
                                  (feature,) if feature else ())
        except sqlite3.OperationalError:  # the table is not created yet
            return 0
        return (rows[0][0] or 0) if rows else 0

    def rows(self, *features):
        where = f" AND feature IN ({','.join('?' * len(features))})" if features else ""
        return self.dev.query(
            FEATURE_DB, "SELECT feature, extra, value FROM use_app_feature_survey WHERE _id > ?"
            + where + " ORDER BY _id", (self.base,) + features)

    def snapshot(self, feature):
        rows = self.dev.query(SNAPSHOT_DB, "SELECT extra, timestamp FROM survey_status_monitor "
                              "WHERE feature = ?", (feature,))
        return rows[0] if rows else ("", 0)

    def vconf_marker(self):
        """Waits until every vconf change made so far has been handled."""
        count = len(self.rows("UNLO"))
        self.dev.devsim("unlock")
        wait_for(lambda: len(self.rows("UNLO")) > count, message="the unlock marker")

    def periods(self):
        return [r for r in self.rows() if r[0] != "UNLO"]


class ChargerTest(DeviceStatusCase):
    def test_charging_period_with_battery_levels(self):
        clock = MsClock(self.dev)
        self.start(clock)
        self.dev.devsim("charger", "plug", "usb", "40")
        wait_for(lambda: self.rows("BAT1"), message="BAT1")
        self.assertEqual(self.snapshot("CHAR"), ("U", clock.now_ms))
        clock.advance_ms(3600000)
        self.dev.devsim("charger", "unplug", "55")
        wait_for(lambda: self.rows("BAT2"), message="BAT2")
        self.assertEqual(self.periods(), [("BAT1", "U", 40000), ("CHAR", "U", 3600000),
                                          ("BAT2", "U", 55000)])
        self.assertEqual(self.snapshot("CHAR"), ("", 0))
        rows = self.dev.query(FEATURE_DB, "SELECT app_id FROM use_app_feature_survey "
                                          "WHERE _id > ?", (self.base,))
        self.assertEqual({r[0] for r in rows}, {APP_ID})

        # Input that must change nothing: an unplug without a plug, a battery file with text,
        # a status rewritten as a string, a status value outside 0/1.
        bad = [("unplug without plug", lambda: self.dev.devsim("charger", "unplug", "50")),
               ("battery text", self.plug_with_text_capacity),
               ("string status",
                lambda: self.dev.vconf_set("memory/sysman/charger_status", "string", "1")),
               ("status 2", lambda: self.dev.vconf_set("memory/sysman/charger_status", "int", "2"))]
        for name, action in bad:
            with self.subTest(name):
                action()
                self.vconf_marker()
                self.assertEqual(self.periods()[3:], [])
                self.assertEqual(self.snapshot("CHAR"), ("", 0))

        # Mains charging carries "A", and charging still works after the bad input.
        clock.advance_ms(60000)
        self.dev.devsim("charger", "plug", "ac", "20")
        # A vconf callback reads the key as it is then: an unplug written before a slow daemon
        # took the plug would leave it nothing to see.
        wait_for(lambda: len(self.rows("BAT1")) == 2, message="the second plug")
        clock.advance_ms(60000)
        self.dev.devsim("charger", "unplug", "21")
        wait_for(lambda: len(self.periods()) == 6, message="the second charge")
        self.assertEqual(self.periods()[3:], [("BAT1", "A", 20000), ("CHAR", "A", 60000),
                                              ("BAT2", "A", 21000)])

    def plug_with_text_capacity(self):
        supply = self.dev.path("/sys/class/power_supply/battery")
        with open(os.path.join(supply, "capacity"), "w") as f:
            f.write("full\n")
        self.dev.vconf_set("memory/sysman/usb_status", "int", "2")
        self.dev.vconf_set("memory/sysman/charger_status", "int", "1")


class PeriodsTest(DeviceStatusCase):
    def test_screen_headset_and_wifi_periods(self):
        clock = MsClock(self.dev)
        self.dev.vconf_set("memory/pm/state", "int", "1")
        self.start(clock)
        self.assertEqual(self.snapshot("SCRN"), ("", clock.now_ms))

        steps = [  # (seconds later, key, value)
            (60, "memory/pm/state", 3),      # SCRN 60 s
            (5, "memory/pm/state", 2),       # dimmed: ignored
            (5, "memory/pm/state", 1),       # reopens
            (10, "memory/pm/state", 1),      # already on: ignored
            (10, "memory/pm/state", 3),      # SCRN 20 s
            (10, "memory/sysman/earjack", 3),
            (30, "memory/sysman/earjack", 0),  # HEAD 30 s
            (10, "memory/dnet/wifi", 2),
            (10, "memory/dnet/wifi", 1),     # not connected closes: WIFI 10 s
            (10, "memory/dnet/wifi", 2),
            (10, "memory/dnet/wifi", 5),     # unknown state: ignored
            (10, "memory/dnet/wifi", 0),     # WIFI 20 s
        ]
        for seconds, key, value in steps:
            clock.advance_ms(seconds * 1000)
            self.dev.vconf_set(key, "int", str(value))
            self.vconf_marker()
        self.assertEqual(self.periods(), [("SCRN", "", 60000), ("SCRN", "", 20000),
                                          ("HEAD", "", 30000), ("WIFI", "", 10000),
                                          ("WIFI", "", 20000)])

        # Garbage and wrong types in the key files change nothing.
        self.dev.devsim("wifi", "on")
        self.vconf_marker()
        opened = self.snapshot("WIFI")
        with open(self.dev.path("/var/run/memory/dnet/wifi"), "w") as f:
            f.write("int zero\n")
        self.dev.vconf_set("memory/dnet/wifi", "string", "0")
        self.dev.vconf_set("memory/pm/state", "double", "1.0")
        self.vconf_marker()
        self.assertEqual(self.snapshot("WIFI"), opened)
        self.assertEqual(self.snapshot("SCRN"), ("", 0))
        self.assertEqual(len(self.periods()), 5)


class EventsTest(DeviceStatusCase):
    def send(self, *args):
        r = self.dev.dbus_send("--type=signal", *args)
        self.assertEqual(r.returncode, 0, r.stderr)

    def test_capture_movement_and_unlock(self):
        self.start()
        status = ("/Org/Tizen/System/Notification/Status_message",
                  "org.tizen.system.notification.status_message.status_message")
        self.dev.devsim("capture")
        self.dev.devsim("capture", "Screenshot saved.")
        self.send(*status, "int32:5")
        self.send(*status, "string:Screen captured.", "string:again")
        self.dev.devsim("move")
        self.send("--dest=com.corvane.logmgr", "/org/tizen/sensor/context/movement",
                  "org.tizen.sensor.context.movement.wakeup", "int32:1")
        self.dev.devsim("lock")
        self.dev.devsim("unlock")
        self.dev.devsim("capture")
        wait_for(lambda: len(self.rows()) >= 4, message="the event rows")
        self.assertEqual(sorted(self.rows()), [("CAPT", "", None), ("CAPT", "", None),
                                               ("UNLO", "", None), ("UNLO", "", None)])


class BluetoothTest(DeviceStatusCase):
    def setUp(self):
        super().setUp()
        log = open(os.path.join(self.dev.sysroot, "bluez-mock.log"), "w")
        self.mock = subprocess.Popen(["/usr/bin/python3", "-m", "dbusmock", "--system",
                                      "--template", "bluez5"], env=self.dev.env,
                                     stdout=log, stderr=log)
        log.close()
        self.addCleanup(self.mock.wait)
        self.addCleanup(self.mock.terminate)
        self.bus = dbus.bus.BusConnection(self.dev.env["DBUS_SYSTEM_BUS_ADDRESS"])
        wait_for(lambda: self.bus.name_has_owner("org.bluez"), message="the BlueZ mock")

    def mock_object(self, path):
        return dbus.Interface(self.bus.get_object("org.bluez", path), "org.freedesktop.DBus.Mock")

    def test_bonds_open_and_close_blue_periods(self):
        self.start()
        self.dev.devsim("bt", "pair", "00:11:22:33:44:55", "0x240404")  # audio/video, minor 1
        wait_for(lambda: self.snapshot("BLUE")[1] > 0, message="BLUE open")
        self.dev.devsim("bt", "pair", "00:11:22:33:44:66", "0x5a020c")  # phone, minor 3
        self.dev.devsim("bt", "unpair", "00:11:22:33:44:55")
        wait_for(lambda: self.rows("BLUE"), message="BLUE row")
        self.dev.devsim("bt", "unpair", "00:11:22:33:44:66")  # nothing open any more

        # A device without Class, signals of the wrong shape, Paired of the wrong type.
        root = self.mock_object("/")
        path = "/org/bluez/hci0/dev_00_11_22_33_44_77"
        root.AddObject(path, "org.bluez.Device1",
                       {"Address": "00:11:22:33:44:77", "Paired": False}, [])
        self.mock_object(path).UpdateProperties("org.bluez.Device1",
                                                {"Paired": dbus.Boolean(True)})
        self.mock_object(path).EmitSignal(
            "org.freedesktop.DBus.Properties", "PropertiesChanged", "ss",
            dbus.Array(["org.bluez.Device1", "Paired"], signature="v"))
        root.AddObject("/org/bluez/hci0/dev_00_11_22_33_44_88", "org.bluez.Device1",
                       {"Address": "00:11:22:33:44:88", "Class": dbus.UInt32(0x000104),
                        "Paired": False}, [])
        self.mock_object("/org/bluez/hci0/dev_00_11_22_33_44_88").UpdateProperties(
            "org.bluez.Device1", {"Paired": "yes"})

        # Then a bond that ends by Paired turning false (computer, minor 1).
        self.dev.devsim("bt", "pair", "00:11:22:33:44:99", "0x000104")
        wait_for(lambda: self.snapshot("BLUE")[1] > 0, message="BLUE open again")
        self.mock_object("/org/bluez/hci0/dev_00_11_22_33_44_99").UpdateProperties(
            "org.bluez.Device1", {"Paired": dbus.Boolean(False)})
        wait_for(lambda: len(self.rows("BLUE")) == 2, message="second BLUE row")
        blue = self.rows("BLUE")
        self.assertEqual([r[1] for r in blue], [str(4 * 256 + 1), str(1 * 256 + 1)])
        self.assertTrue(all(r[2] > 0 for r in blue), blue)
        self.assertEqual(self.snapshot("BLUE"), ("", 0))


class RestartTest(DeviceStatusCase):
    def test_crash_and_clean_stop_close_the_open_periods(self):
        clock = MsClock(self.dev)
        self.dev.vconf_set("memory/pm/state", "int", "1")
        first = self.start(clock)
        self.assertEqual(self.snapshot("SCRN"), ("", clock.now_ms))
        screen = "SELECT value FROM use_app_feature_survey WHERE feature = 'SCRN' ORDER BY _id"
        clock.advance_ms(10000)
        self.dev.devsim("capture")
        wait_for(lambda: self.rows("CAPT"), message="CAPT")

        # Crash: nothing recorded the stop, so the last row written marks it.
        first.send_signal(signal.SIGKILL)
        self.dev.wait_exit(first)
        clock.advance_ms(90000)
        self.start(clock)
        self.assertEqual(self.dev.query(FEATURE_DB, screen), [(10000,)])
        self.assertEqual(self.snapshot("SCRN"), ("", clock.now_ms))
        clock.advance_ms(100000)
        self.dev.devsim("capture")
        wait_for(lambda: self.rows("CAPT"), message="CAPT")

        # A clean stop, later than the last row; charger and headset plugged in meanwhile.
        clock.advance_ms(100000)
        self.dev.signal(signal.SIGTERM)
        self.dev.wait_exit()
        clock.advance_ms(100000)
        self.dev.devsim("charger", "plug", "usb", "70")
        self.dev.devsim("earjack", "in")
        self.start(clock)
        self.assertEqual(self.dev.query(FEATURE_DB, screen), [(10000,), (200000,)])
        self.assertEqual(self.dev.pref("key_last_shutdown_time"), "0")
        # The initial snapshot samples the charger (after its wait) and the headset.
        self.assertEqual(self.dev.query(FEATURE_DB, "SELECT extra, value FROM "
                                        "use_app_feature_survey WHERE feature = 'BAT1'"),
                         [("U", 70000)])
        self.assertEqual(self.snapshot("CHAR"), ("U", clock.now_ms))
        self.assertEqual(self.snapshot("HEAD"), ("", clock.now_ms))
