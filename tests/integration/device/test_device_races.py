"""The device's tool, several at once and killed in the middle: nothing is lost, nothing is left."""
import os
import random
import signal
import subprocess
import sys
import threading
import time
import unittest

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
from quarn_test import TestCase, has_ended, make_source, wait_until  # noqa: E402

PACKAGE = "org.example.notes"
FILES = 60


class Races(TestCase):
    def setUp(self):
        self.device = self.new_device(serial="350000000000001")
        seed = int(os.environ.get("QUARN_RACES_SEED") or time.time_ns() % 1000000)
        self.random = random.Random(seed)
        self.hint = "QUARN_RACES_SEED=%d" % seed
        self.source = make_source(self.path("source"), PACKAGE, "1.0.0", {
            "data/%03d" % index: b"content %d" % index for index in range(FILES)})

    def begin(self, verb, *arguments):
        return subprocess.Popen([self.device.tool, verb, self.device.path, *arguments],
                                stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, text=True)

    def outcome(self, tool):
        told = tool.communicate(timeout=60)[1]
        return tool.returncode, told

    def kill_within(self, tool, seconds):
        try:
            tool.wait(timeout=self.random.random() * seconds)
        except subprocess.TimeoutExpired:
            tool.kill()
        tool.communicate()

    def apps(self):
        return os.path.join(self.device.path, "root/opt/usr/apps")

    def names(self):
        return sorted(os.listdir(self.device.app_path(PACKAGE, "data")))

    def assert_whole(self):
        self.assertEqual([package["id"] for package in self.device.packages()], [PACKAGE],
                         self.hint)
        self.assertEqual(self.names(), ["%03d" % index for index in range(FILES)], self.hint)
        self.assertEqual(os.listdir(os.path.join(self.device.path, "root/opt/usr")), ["apps"])


class Installer(Races):
    def test_installations_at_once_are_one_after_the_other(self):
        tools = [self.begin("install", self.source) for _ in range(6)]
        self.assertEqual([self.outcome(tool) for tool in tools], [(0, "")] * 6)
        self.assert_whole()

    def test_an_installation_and_removals_at_once_end_with_all_or_nothing(self):
        for _ in range(5):
            self.device.install(self.source)
            tools = [self.begin(*arguments) for arguments in (
                ("remove", PACKAGE), ("install", self.source), ("remove", PACKAGE))]
            for tool in tools:
                self.assertIn(self.outcome(tool)[1],
                              ("", 'quarn-device: no package "%s"\n' % PACKAGE), self.hint)
            if self.device.packages():
                self.assert_whole()
                self.device.remove(PACKAGE)
            self.assertEqual(os.listdir(self.apps()), [])

    def test_an_installation_that_was_killed_is_made_good_by_the_next(self):
        for _ in range(10):
            self.kill_within(self.begin("install", self.source), 0.06)
            self.device.install(self.source)
            self.assert_whole()
            self.device.remove(PACKAGE)
            self.assertEqual(os.listdir(self.apps()), [])

    def test_a_removal_that_was_killed_is_made_good_by_the_next(self):
        for _ in range(10):
            self.device.install(self.source)
            self.kill_within(self.begin("remove", PACKAGE), 0.05)
            if self.device.packages():
                self.device.remove(PACKAGE)
            self.device.install(self.source)
            self.assert_whole()
            self.device.remove(PACKAGE)
            self.assertEqual(os.listdir(self.apps()), [])

    def test_a_package_whose_folders_are_written_to_is_removed(self):
        self.device.install(self.source)
        over = threading.Event()

        def write():
            number = 0
            while not over.is_set():
                number += 1
                try:
                    with open(self.device.app_path(PACKAGE, "data/new%d" % (number % 50)), "w"):
                        pass
                    os.unlink(self.device.app_path(PACKAGE, "data/new%d" % ((number + 25) % 50)))
                except OSError:
                    pass
        writer = threading.Thread(target=write)
        writer.start()
        try:
            for _ in range(10):
                self.device.remove(PACKAGE)
                self.assertEqual(os.listdir(self.apps()), [])
                self.device.install(self.source)
        finally:
            over.set()
            writer.join()


class Life(Races):
    def test_starts_at_once_start_one_supervisor(self):
        for _ in range(3):
            tools = [self.begin("start") for _ in range(5)]
            self.assertEqual([self.outcome(tool) for tool in tools], [(0, "")] * 5)
            self.device.activate()
            self.assertEqual(len(self.supervisors()), 1)
            self.device.stop()
            self.assertEqual(self.supervisors(), [])

    def test_starts_and_stops_at_once_leave_it_started_or_stopped(self):
        for _ in range(4):
            tools = [self.begin(self.random.choice(("start", "stop"))) for _ in range(6)]
            self.assertEqual([self.outcome(tool) for tool in tools], [(0, "")] * 6, self.hint)
            self.device.start()
            self.device.activate()
        self.device.stop()
        self.assertEqual(self.supervisors(), [])

    def test_a_start_that_was_killed_is_made_good_by_the_next(self):
        for _ in range(6):
            self.kill_within(self.begin("start"), 0.1)
            self.device.start()
            self.device.activate()
            self.assertEqual(len(self.supervisors()), 1, self.hint)
            self.device.stop()
            self.assertEqual(self.supervisors(), [])

    def supervisors(self):
        """The processes that `start` leaves behind."""
        wanted = [b"start", self.device.path.encode(), b""]
        found = []
        for entry in os.listdir("/proc"):
            try:
                with open("/proc/%s/cmdline" % entry, "rb") as file:
                    if file.read().split(b"\0")[1:] == wanted:
                        found.append(int(entry))
            except OSError:
                continue
        return found

    def test_an_alarm_is_not_lost_to_a_kill_of_the_supervisor_or_the_daemon(self):
        for victim in ("supervisor", "daemon", "both"):
            self.device.start()
            self.device.activate()
            wait_until(self.device.alarms, "the alarm of the start")
            before = {alarm["id"] for alarm in self.device.alarms()}
            expired = self.device.log().count("was expired")
            if victim != "daemon":
                with open(os.path.join(self.device.path, "run/supervisor")) as file:
                    supervisor = int(file.read().split()[0])
                os.kill(supervisor, signal.SIGKILL)
            if victim != "supervisor":
                self.kill_daemon()
            wait_until(lambda: victim == "daemon" or has_ended(supervisor), "it is killed")
            self.assertLessEqual(before, {alarm["id"] for alarm in self.device.alarms()})
            self.device.set("clock", "+50000")
            self.device.start()
            self.device.wait_for_log("was expired", expired + 1)
            self.device.set("clock", "real")
            self.device.stop()

    def kill_daemon(self):
        self.device.signal_daemon(signal.SIGKILL)


class State(Races):
    def test_writers_at_once_lose_nothing(self):
        names = ["db/test/%d" % index for index in range(4)]
        failures = []

        def write(name):
            for number in range(25):
                result = self.device.call("setting", name, str(number), check=False)
                if result.returncode != 0:
                    failures.append(result.stderr)
        writers = [threading.Thread(target=write, args=(name,)) for name in names]
        for writer in writers:
            writer.start()
        for writer in writers:
            writer.join()
        self.assertEqual(failures, [])
        self.assertEqual([self.device.setting(name) for name in names], ["24"] * 4)

    def test_a_writer_that_was_killed_leaves_the_old_or_the_new(self):
        self.device.setting("db/other", "kept")
        for number in range(25):
            self.device.setting("db/value", "old%d" % number)
            self.kill_within(self.begin("setting", "db/value", "new%d" % number), 0.02)
            self.assertIn(self.device.setting("db/value"), ("old%d" % number, "new%d" % number),
                          self.hint)
            self.assertEqual(self.device.setting("db/other"), "kept")
        folder = os.path.join(self.device.path, "state/.tmp")
        self.device.start()
        self.assertEqual(os.listdir(folder), [], "a start clears what killed writers left")

    def test_a_full_device_refuses_and_keeps_its_state(self):
        place = self.path("small")
        os.mkdir(place)
        subprocess.run(["mount", "-t", "tmpfs", "-o", "size=1m", "none", place], check=True)
        self.addCleanup(subprocess.run, ["umount", "-l", place], check=True)
        device = self.new_device("small/device")
        self.addCleanup(device.stop)
        device.setting("db/value", "kept")
        filler = os.path.join(place, "filler")
        with open(filler, "wb", buffering=0) as file:
            try:
                while True:
                    file.write(b"x" * 4096)
            except OSError:
                pass
        result = device.call("setting", "db/value", "lost", check=False)
        self.assertEqual((result.returncode, result.stderr.count("\n")), (1, 1), result.stderr)
        self.assertEqual(device.setting("db/value"), "kept")
        result = device.call("install", self.source, check=False)
        self.assertEqual(result.returncode, 1)
        os.unlink(filler)
        self.assertEqual(device.packages(), [])
        self.assertEqual(os.listdir(os.path.join(device.path, "root/opt/usr/apps")), [])
        device.setting("db/value", "new")
        self.assertEqual(device.setting("db/value"), "new")


if __name__ == "__main__":
    unittest.main(verbosity=2)
