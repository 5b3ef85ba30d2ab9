"""Automatic backup as a device left alone gets it: conditions, alarms and the daemon's own end."""
import os
import signal
import sys
import time
import unittest

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
from quarn_test import TestCase, make_source, wait_until  # noqa: E402

SETTING = "db/private/quarn/backup_status"
LAST_TIME = "db/private/quarn/last_time"
SERIAL = "350000000000001"
PACKAGE = "org.example.notes"
HOUR = 3600
#: Between an alarm's making and the look at it.
SLACK = 120


class AutoBackup(TestCase):
    def setUp(self):
        self.device = self.new_device(serial=SERIAL, model="Orvane One")
        self.device.set("network", "wifi")
        self.device.set("charger", "off")
        self.device.set("display", "on")
        self.device.start()
        self.device.install(make_source(self.path("src"), PACKAGE, "1.0.0",
                                        {"data/notes.txt": b"a note\n" * 500}))

    # ---- what a test does with the device ----

    def start_daemon(self):
        self.device.activate()
        wait_until(self.device.daemon_pid, "the daemon runs")
        # It has added its first alarm and entered its loop.
        self.device.wait_for_log("== main loop begin ==", self.starts())

    def starts(self):
        return self.device.log().count("Quarn Daemon start")

    def stop_daemon(self):
        os.kill(self.device.daemon_pid(), signal.SIGTERM)
        self.device.wait_for_daemon_end()

    def switch_on(self):
        self.device.setting(SETTING, "1")

    def satisfy_conditions(self):
        self.device.set("charger", "on")
        self.device.set("network", "wifi")
        self.device.set("display", "off")

    def set_last_backup(self, hours_ago):
        self.device.setting(LAST_TIME, "%.1f" % ((time.time() - hours_ago * HOUR) * 1000))

    def last_backup(self):
        """When the last backup was stored, in milliseconds; 0 when there was none."""
        result = self.device.call("setting", LAST_TIME, check=False)
        return float(result.stdout) if result.returncode == 0 else 0.0

    # ---- what it looks for ----

    def alarms_in(self, seconds):
        """Alarms due about so many seconds from now."""
        due = (time.time() + seconds) * 1000
        return [alarm for alarm in self.device.alarms()
                if due - SLACK * 1000 <= alarm["due_ms"] <= due + 1000]

    def wait_for_condition_alarm(self):
        alarm = wait_until(lambda: self.alarms_in(HOUR), "the condition alarm is armed")
        self.assertEqual(len(alarm), 1)
        self.assertEqual(alarm[0]["owner"], "quarn")
        return alarm[0]

    def wait_for_no_condition_alarm(self):
        wait_until(lambda: not self.alarms_in(HOUR), "the condition alarm is disarmed")

    def archive(self):
        return self.device.archive(PACKAGE)

    def app_list(self):
        return os.path.join(self.device.cloud, "app_list/app_list.txt")

    def periodic_alarm(self):
        """The alarm that each start of the daemon adds, twelve hours ahead."""
        return wait_until(lambda: self.alarms_in(12 * HOUR), "the twelve-hour alarm")[-1]["id"]


class Conditions(AutoBackup):
    def setUp(self):
        super().setUp()
        self.start_daemon()

    def test_satisfied_conditions_arm_an_alarm_one_hour_ahead_and_the_screen_disarms_it(self):
        self.switch_on()
        self.device.wait_for_log("now auto backup state is 1")
        self.assertEqual(self.alarms_in(HOUR), [])
        self.satisfy_conditions()
        self.wait_for_condition_alarm()
        self.device.set("display", "on")
        self.wait_for_no_condition_alarm()
        self.device.wait_for_log("auto backup`s condition was broken")

    def test_each_satisfied_change_restarts_the_hour(self):
        self.switch_on()
        self.device.wait_for_log("now auto backup state is 1")
        self.satisfy_conditions()
        first = self.wait_for_condition_alarm()
        self.device.set("network", "cellular")
        self.wait_for_no_condition_alarm()
        self.device.set("network", "wifi")
        second = self.wait_for_condition_alarm()
        self.assertNotEqual(second["id"], first["id"])
        self.assertGreater(second["due_ms"], first["due_ms"])

    def test_switching_on_with_the_conditions_satisfied_arms_at_once_and_off_disarms(self):
        self.satisfy_conditions()
        self.switch_on()
        self.wait_for_condition_alarm()
        self.device.setting(SETTING, "0")
        self.wait_for_no_condition_alarm()
        self.device.wait_for_log("auto backup`s condition is broken")
        self.device.wait_for_log("now auto backup state is 0")

    def test_without_the_setting_no_condition_arms_an_alarm(self):
        self.satisfy_conditions()
        self.switch_on()
        self.wait_for_condition_alarm()
        self.device.setting(SETTING, "0")
        self.wait_for_no_condition_alarm()
        self.device.set("network", "none")
        self.device.set("network", "wifi")
        self.device.set("display", "on")
        self.device.set("display", "off")
        self.device.set("charger", "off")
        # Heard after all of it, and the daemon tells what it has seen.
        self.switch_on()
        self.device.wait_for_log("Charger_Conn=>0, Wifi_Conn=>1, Lcd_Off=>1")
        self.assertEqual(self.device.log().count("alarm registered for auto backup"), 1)
        self.assertEqual(self.alarms_in(HOUR), [])


class Alarm(AutoBackup):
    def end_by_alarm(self):
        """Twelve hours on, nothing is due: the daemon has nothing to stay for.

        A run that has stored its time may not have given back its lock yet; then the daemon stays
        for one more alarm.
        """
        before = self.device.log()
        while True:
            stays = self.device.log().count("add alarm for 5 min")
            self.device.fire(self.periodic_alarm())
            wait_until(lambda: self.device.daemon_pid() is None
                       or self.device.log().count("add alarm for 5 min") > stays,
                       "the alarm is answered")
            if self.device.daemon_pid() is None:
                break
        after = self.device.log()[len(before):]
        self.assertIn("auto backup period wasn't expired yet", after)
        self.assertNotIn("request for auto backup", after)

    def ready(self, hours_since_backup=None):
        """A device with the setting on, the conditions satisfied and the daemon not running."""
        self.switch_on()
        self.satisfy_conditions()
        if hours_since_backup is not None:
            self.set_last_backup(hours_since_backup)
        self.start_daemon()
        alarm = self.periodic_alarm()
        self.stop_daemon()
        return alarm

    def test_an_alarm_starts_the_daemon_which_backs_up_by_itself(self):
        alarm = self.ready(hours_since_backup=25)
        self.assertIsNone(self.device.daemon_pid())
        self.assertFalse(os.path.exists(self.archive()))
        before = time.time() * 1000
        self.device.fire(alarm)
        self.device.wait_for_log("request for auto backup")
        self.device.wait_for_log("now auto backup start!")
        wait_until(lambda: os.path.exists(self.archive()) and os.path.exists(self.app_list()),
                   "archive and list are in the cloud")
        wait_until(lambda: self.last_backup() >= before - 1000, "the time of the backup is stored")

    def test_after_an_uninterrupted_hour_a_running_daemon_backs_up_by_itself(self):
        self.start_daemon()
        self.set_last_backup(hours_ago=25)
        self.switch_on()
        self.satisfy_conditions()
        before = time.time() * 1000
        self.device.fire(self.wait_for_condition_alarm()["id"])
        wait_until(lambda: self.last_backup() >= before - 1000, "the time of the backup is stored")
        self.assertTrue(os.path.exists(self.archive()))
        self.assertEqual(self.device.log().count("Quarn Daemon start"), 1)

    def test_the_day_after_it_does_so_again_and_ends_in_between(self):
        alarm = self.ready()
        for day in (1, 2):
            before = time.time() * 1000
            self.device.fire(alarm)
            self.device.wait_for_log("now auto backup start!", day)
            wait_until(lambda: self.last_backup() >= before - 1000, "day %d's backup" % day)
            self.end_by_alarm()
            # The next day: something changed, and the device wakes the daemon.
            self.set_last_backup(hours_ago=25)
            with open(self.device.app_path(PACKAGE, "data/notes.txt"), "ab") as file:
                file.write(b"another day\n")
            alarm = self.periodic_alarm()

    def test_within_a_day_of_the_last_backup_the_daemon_only_ends_itself(self):
        alarm = self.ready(hours_since_backup=23)
        self.device.fire(alarm)
        self.device.wait_for_log("auto backup period wasn't expired yet")
        self.device.wait_for_log("terminate quarn")
        self.device.wait_for_daemon_end()
        self.assertNotIn("request for auto backup", self.device.log())
        self.assertFalse(os.path.exists(self.archive()))

    def test_with_a_condition_broken_nothing_is_backed_up_and_the_daemon_ends(self):
        alarm = self.ready(hours_since_backup=25)
        self.device.set("charger", "off")
        self.device.fire(alarm)
        self.device.wait_for_log("auto backup condition is invalid")
        self.device.wait_for_daemon_end()
        self.assertFalse(os.path.exists(self.archive()))

    def test_with_the_setting_off_nothing_is_backed_up_and_the_daemon_ends(self):
        alarm = self.ready(hours_since_backup=25)
        self.device.setting(SETTING, "0")
        self.device.fire(alarm)
        self.device.wait_for_log("auto backup condition is invalid")
        self.device.wait_for_daemon_end()
        self.assertFalse(os.path.exists(self.archive()))


class Setting(AutoBackup):
    def test_it_survives_the_daemon(self):
        self.start_daemon()
        self.switch_on()
        self.device.wait_for_log("now auto backup state is 1")
        self.stop_daemon()
        self.start_daemon()
        self.device.wait_for_log("now auto backup state is 1", 2)
        self.assertEqual(self.device.setting(SETTING), "1")

    def test_it_survives_the_device(self):
        self.start_daemon()
        self.switch_on()
        self.device.wait_for_log("now auto backup state is 1")
        self.device.stop()
        self.assertIsNone(self.device.daemon_pid())
        self.device.start()
        self.assertEqual(self.device.setting(SETTING), "1")
        self.satisfy_conditions()
        self.start_daemon()
        self.device.wait_for_log("now auto backup state is 1", 2)
        self.wait_for_condition_alarm()

    def test_the_daemons_end_takes_its_condition_alarm_along(self):
        self.start_daemon()
        self.satisfy_conditions()
        self.switch_on()
        self.wait_for_condition_alarm()
        self.stop_daemon()
        self.assertEqual(self.alarms_in(HOUR), [])


if __name__ == "__main__":
    unittest.main()
