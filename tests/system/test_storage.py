"""The preference store across the daemon's stops and starts."""
import os
import re
import signal
import time
import unittest

from harness import DeviceTestCase, wait_for

ID_PATTERN = re.compile(r"^T[a-zA-Z0-9]{12}[0-9]{13}[A-Z][a-z][0-9][0-9][A-Z][a-z],?$")


class StorageTest(DeviceTestCase):

    def start(self):
        self.dev.set_consent(True)
        proc = self.dev.start_daemon()
        self.assertIsNone(proc.poll(), "logmgrd ended at start")
        return wait_for(lambda: self.dev.pref("key_deviceid"), message="the device id")

    def test_shutdown_time_written_at_stop_and_device_id_kept(self):
        device_id = self.start()
        self.assertRegex(device_id, ID_PATTERN)
        self.assertIsNone(self.dev.pref("key_last_shutdown_time"))

        before = int(time.time())
        self.dev.signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(), 0)
        after = time.time()
        stopped = int(self.dev.pref("key_last_shutdown_time"))
        self.assertGreaterEqual(stopped, before)
        self.assertLessEqual(stopped, after + 1)

        proc = self.dev.start_daemon()
        wait_for(lambda: self.dev.name_owner() is not None, message="the restarted daemon")
        self.assertIsNone(proc.poll())
        self.assertEqual(self.dev.pref("key_deviceid"), device_id)
        proc.send_signal(signal.SIGTERM)
        self.assertEqual(self.dev.wait_exit(proc), 0)
        self.assertEqual(self.dev.pref("key_deviceid"), device_id)

    def test_unusable_store_ends_the_start_without_touching_the_file(self):
        path = self.dev.db_path(".pref.db")
        os.makedirs(os.path.dirname(path), exist_ok=True)
        junk = b"not a database " * 300
        with open(path, "wb") as f:
            f.write(junk)
        self.dev.set_consent(True)
        proc = self.dev.start_daemon(wait_for_name=False)
        status = self.dev.wait_exit(proc)
        self.assertGreater(status, 0, "a failed store must end the start, not crash it")
        with open(path, "rb") as f:
            self.assertEqual(f.read(), junk)


if __name__ == "__main__":
    unittest.main()
