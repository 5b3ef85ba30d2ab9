"""A device's own clock: what follows when it jumps, and what must not depend on it."""
import json
import os
import re
import sys
import time
import unittest
from datetime import datetime, timezone

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
from quarn_test import TestCase, make_source, read_bytes, read_file, wait_until  # noqa: E402

SETTING = "db/private/quarn/backup_status"
LAST_TIME = "db/private/quarn/last_time"
SERIAL = "350000000000001"
PACKAGE = "org.example.notes"
HOUR = 3600
#: Between something that is stamped and the look at it.
SLACK = 120
EXPIRED = re.compile(r"alarm\(id:\d+\) was expired\. backup time term in second = (\d+)")


class ClockTest(TestCase):
    def setUp(self):
        self.device = self.new_device(serial=SERIAL)
        self.device.start()
        self.device.install(make_source(self.path("source"), PACKAGE, "1.0.0",
                                        {"data/note": b"a note"}))

    def jump(self, seconds):
        """The device's clock is so far ahead of the machine's from now on."""
        self.device.set("clock", "%+d" % seconds)

    def now_inside(self):
        """What the daemon says the time is, in seconds."""
        return json.loads(self.device.quarnctl("last-time", "--json").stdout)["time_ms"] / 1000

    def assert_ahead(self, seconds, by):
        self.assertLess(abs(seconds - time.time() - by), SLACK)

    def last_backup(self):
        result = self.device.call("setting", LAST_TIME, check=False)
        return float(result.stdout) / 1000 if result.returncode == 0 else None

    def dues(self):
        return [alarm["due_ms"] / 1000 for alarm in self.device.alarms()]

    def terms(self):
        """Seconds since the last backup, as each alarm that expired found them."""
        return [int(term) for term in EXPIRED.findall(self.device.log())]

    def wait_for_terms(self, count):
        wait_until(lambda: len(self.terms()) >= count, "alarm %d expires" % count)
        return self.terms()[-1]

    def ready(self):
        """Automatic backup is on, its conditions hold, and the daemon has seen it."""
        self.device.setting(SETTING, "1")
        for key, value in (("charger", "on"), ("network", "wifi"), ("display", "off")):
            self.device.set(key, value)
        self.device.wait_for_log("alarm registered for auto backup")


class Following(ClockTest):
    def test_a_running_daemon_follows_and_comes_back(self):
        for seconds in (25 * HOUR, -25 * HOUR, 0):
            self.jump(seconds)
            self.assert_ahead(self.now_inside(), seconds)
        self.jump(HOUR)
        self.device.set("clock", "real")
        self.assert_ahead(self.now_inside(), 0)
        self.device.set("clock", "0")
        self.assert_ahead(self.now_inside(), 0)
        self.assertEqual(self.device.log().count("Quarn Daemon start"), 1)

    def test_a_jump_is_not_added_to_the_one_before(self):
        self.jump(HOUR)
        self.jump(HOUR)
        self.assert_ahead(self.now_inside(), HOUR)

    def test_it_is_kept_while_the_device_is_stopped(self):
        self.jump(-30 * 24 * HOUR)
        self.device.stop()
        self.device.start()
        self.assert_ahead(self.now_inside(), -30 * 24 * HOUR)

    def test_stamps_follow(self):
        self.jump(10 * 24 * HOUR)
        self.device.quarnctl("backup")
        self.assert_ahead(self.last_backup(), 10 * 24 * HOUR)
        stamps = re.findall(r'"timestamp":\s*(\d+)',
                            read_file(os.path.join(self.device.cloud, "app_list/app_list.txt")))
        self.assertTrue(stamps)
        for stamp in stamps:
            self.assert_ahead(int(stamp) / 1000, 10 * 24 * HOUR)
        logged = self.device.log().splitlines()[-1].split("Z ")[0]
        self.assert_ahead(datetime.fromisoformat(logged).replace(tzinfo=timezone.utc).timestamp(),
                          10 * 24 * HOUR)
        status = json.loads(self.device.quarnctl("status", "--json").stdout)
        self.assertLess(abs(status["last_backup_age_ms"]), SLACK * 1000)

    def test_what_is_no_time_is_refused_and_changes_nothing(self):
        self.jump(HOUR)
        for value in ("3600", "+", "-", "+-5", "++5", "1h", "+1.5", "", "noon",
                      "+99999999999999999999", "-%d" % (int(time.time()) + HOUR)):
            result = self.device.call("set", "clock", value, check=False)
            self.assertEqual(result.returncode, 1, value)
            self.assertEqual(result.stderr.count("\n"), 1, value)
        self.assert_ahead(self.now_inside(), HOUR)


class Alarms(ClockTest):
    def test_a_jump_past_an_alarm_starts_the_daemon_for_it(self):
        self.now_inside()
        self.device.quarnctl("backup")
        self.device.quarnctl("deactivate")
        self.device.wait_for_daemon_end()
        self.jump(12 * HOUR + 5)
        self.device.wait_for_log("Quarn Daemon start", 2)
        self.wait_for_terms(1)

    def test_a_jump_towards_an_alarm_leaves_it(self):
        self.now_inside()
        self.device.quarnctl("deactivate")
        self.device.wait_for_daemon_end()
        before = self.dues()
        self.jump(11 * HOUR)
        self.jump(-400 * 24 * HOUR)
        self.assertEqual(self.dues(), before)
        self.assertEqual(self.terms(), [])
        self.assertIsNone(self.device.daemon_pid())

    def test_alarms_are_added_by_the_devices_clock(self):
        self.jump(-400 * 24 * HOUR)
        self.now_inside()
        due = wait_until(self.dues, "the alarm of the start")
        self.assert_ahead(due[0], -400 * 24 * HOUR + 12 * HOUR)

    def test_a_stopped_device_finds_at_its_start_what_fell_due(self):
        self.now_inside()
        self.device.stop()
        self.jump(13 * HOUR)
        self.device.start()
        self.wait_for_terms(1)


class AutomaticBackup(ClockTest):
    """The rule of 24 hours, by a clock that jumps."""

    def setUp(self):
        super().setUp()
        self.device.quarnctl("backup")
        self.ready()

    def runs(self):
        return self.device.log().count("now auto backup start!")

    def change(self):
        with open(self.device.app_path(PACKAGE, "data/note"), "ab") as file:
            file.write(b" and another")

    def test_a_day_and_an_hour_later_it_is_due(self):
        self.change()
        self.jump(25 * HOUR)
        self.device.wait_for_log("request for auto backup")
        wait_until(lambda: self.last_backup() - time.time() > 24 * HOUR, "the run has ended")
        self.assertGreaterEqual(self.terms()[0], 25 * HOUR)
        self.assert_ahead(self.last_backup(), 25 * HOUR)
        self.assertGreaterEqual(self.runs(), 1)

    def test_within_a_day_it_is_not(self):
        self.jump(23 * HOUR)
        self.device.wait_for_log("auto backup period wasn't expired yet")
        self.assertLess(abs(self.terms()[0] - 23 * HOUR), SLACK)
        self.assertEqual(self.runs(), 0)

    def test_a_last_backup_in_the_future_is_due(self):
        """As on a device that lost its time: the difference is unsigned."""
        self.change()
        self.device.quarnctl("backup")
        alarm = wait_until(self.device.alarms, "an alarm")[0]["id"]
        self.jump(-400 * 24 * HOUR)
        self.device.fire(alarm)
        self.device.wait_for_log("request for auto backup")
        wait_until(lambda: self.last_backup() < time.time() - 399 * 24 * HOUR, "the run has ended")
        self.assertGreater(self.terms()[0], 10 ** 15)

    def test_back_in_the_present_the_backup_of_the_future_counts_no_more(self):
        self.jump(-400 * 24 * HOUR)
        alarm = wait_until(self.device.alarms, "an alarm")[0]["id"]
        self.device.fire(alarm)
        wait_until(lambda: self.last_backup() < time.time() - 399 * 24 * HOUR, "the first run")
        runs = self.runs()
        self.device.set("clock", "real")
        wait_until(lambda: self.runs() > runs, "400 days later, the next run")
        wait_until(lambda: abs(self.last_backup() - time.time()) < SLACK, "its time is stored")


class Recovery(ClockTest):
    def test_a_backup_and_a_restore_do_not_depend_on_the_clock(self):
        """A device without a clock of its own boots in the past, and gets the time later."""
        self.jump(-50 * 365 * 24 * HOUR)
        self.device.quarnctl("backup")
        self.device.set("clock", "real")
        with open(self.device.app_path(PACKAGE, "data/note"), "wb") as file:
            file.write(b"spoilt")
        self.jump(-40 * 365 * 24 * HOUR)
        self.device.quarnctl("app", "restore", PACKAGE)
        self.assertEqual(read_bytes(self.device.app_path(PACKAGE, "data/note")), b"a note")
        left = [name for _, _, names in os.walk(self.device.app_path(PACKAGE)) for name in names]
        self.assertEqual(left, ["note"])


if __name__ == "__main__":
    unittest.main(verbosity=2)
