"""The preference store across the daemon's stops and starts."""
import os
import signal
import time
import unittest

from harness import DeviceTestCase, wait_for

ID_PATTERN = r"^T[a-zA-Z0-9]{12}[0-9]{13}[A-Z][a-z][0-9][0-9][A-Z][a-z],?$"


class StorageTest(DeviceTestCase):

    def test_shutdown_time_written_at_stop_and_device_id_kept(self):
        self.dev.set_consent(True)
        self.dev.start_daemon()
        device_id = wait_for(lambda: self.dev.pref("key_deviceid"), message="the device id")
        self.assertRegex(device_id, ID_PATTERN)
        self.assertIsNone(self.dev.pref("key_last_shutdown_time"))
        for _ in range(2):
            before = int(time.time())
            self.dev.signal(signal.SIGTERM)
            self.assertEqual(self.dev.wait_exit(), 0)
            self.assertTrue(before <= int(self.dev.pref("key_last_shutdown_time")) <= time.time() + 1)
            self.assertEqual(self.dev.pref("key_deviceid"), device_id)
            self.dev.daemon = self.dev.start_daemon()
            self.assertIsNone(self.dev.daemon.poll())

    def test_unusable_store_ends_the_start_without_touching_the_file(self):
        path = self.dev.db_path(".pref.db")
        os.makedirs(os.path.dirname(path), exist_ok=True)
        junk = b"not a database " * 300
        with open(path, "wb") as f:
            f.write(junk)
        self.dev.set_consent(True)
        # A failed store ends the start with a status, not a crash.
        self.assertGreater(self.dev.wait_exit(self.dev.start_daemon(wait_for_name=False)), 0)
        with open(path, "rb") as f:
            self.assertEqual(f.read(), junk)


if __name__ == "__main__":
    unittest.main()
