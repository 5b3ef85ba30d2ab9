"""What a backup removes from the cloud, and what it leaves there for a restore."""
import json
import os
import shutil
import signal
import subprocess
import sys
import unittest

sys.path[:0] = [os.path.join(os.path.dirname(os.path.abspath(__file__)), folder)
                for folder in ("..", "../bus")]
from bus_client import Client, GLib  # noqa: E402
from quarn_test import TestCase, make_source, read_bytes, read_file, wait_until  # noqa: E402

SERIAL = "350000000000001"
OTHER = "350000000000002"
GONE = "org.example.gone"
HERE = "org.example.here"
OWN_BACKUP = "db/private/quarn/own_backup"
#: Bytes that an application list has at the most.
BOUND = 4 << 20
LAST_TIME = "db/private/quarn/last_time"


class CleanUp(TestCase):
    def setUp(self):
        self.device = self.new_device(serial=SERIAL, model="Orvane One", account="ada")
        self.device.start()
        for package in (HERE, GONE):
            self.install(self.device, package, b"of " + package.encode())
        self.device.quarnctl("backup")
        self.device.remove(GONE)

    def install(self, device, package, content, version="1.0"):
        name = "src-%s-%d" % (package, len(os.listdir(self.directory)))
        device.install(make_source(self.path(name), package, version, {"data/file": content}))

    def entries(self):
        for entry in self.device.app_list()["model_list"]:
            if entry["backup_info"]["serial_number"] == SERIAL:
                return {package["pkg_id"]: package for package in entry["pkg_list"]}
        return {}

    def archive(self, package, version="1.0"):
        return self.device.archive(package, version)

    def backup(self, *options, status=0):
        result = self.device.quarnctl("backup", *options, check=False)
        self.assertEqual(result.returncode, status, result.stdout + result.stderr)
        return result

    def restore_on(self, serial, packages):
        client = Client(self.device.bus_address())
        self.addCleanup(client.close)
        reply = client.call("restore_enable",
                            GLib.Variant("(iissu)", (1, 0, serial, json.dumps(packages), 7)))
        self.assertEqual(reply, (0,))
        return client

    @staticmethod
    def stops(client):
        return [event for event in client.callbacks("restore_enable_cb")
                if event[1][1] == "restore_stop"]

    def status(self):
        return json.loads(self.device.quarnctl("status", "--json").stdout)

    def nightly(self):
        """One automatic run, by its alarm."""
        device = self.device
        runs = device.log().count("auto backup successful!")
        device.setting(LAST_TIME, "0")
        device.quarnctl("auto", "on")
        device.set("charger", "on")
        device.set("display", "off")
        alarm = wait_until(lambda: self.status()["condition_alarm_ms"], "the conditions hold")
        due = min(device.alarms(), key=lambda one: abs(one["due_ms"] - alarm))
        device.fire(due["id"])
        device.wait_for_log("auto backup successful!", runs + 1)
        # What is off, on and off again within its services' grain has not changed for the daemon.
        seen = device.log().count("Lcd_Off=>0")
        device.set("display", "on")
        device.wait_for_log("Lcd_Off=>0", seen + 1)

    def assert_kept(self):
        self.assertIn(GONE, self.entries())
        self.assertTrue(os.path.exists(self.archive(GONE)))

    def assert_removed(self):
        self.assertNotIn(GONE, self.entries())
        self.assertFalse(os.path.exists(self.archive(GONE)))

    def test_a_backup_names_what_it_would_remove_and_wants_it_confirmed(self):
        result = self.backup(status=65)
        self.assertIn("the backup would remove 1 package that is not installed from the cloud: " +
                      GONE, result.stderr)
        document = json.loads(self.backup("--json", status=65).stdout)
        self.assertEqual(document["would_remove"], [GONE])
        self.assert_kept()
        self.backup("--yes")
        self.assert_removed()
        self.backup()

    def test_what_restore_mode_waits_for_survives_every_run_and_comes_back(self):
        before = self.entries()[GONE]
        client = self.restore_on(SERIAL, [GONE])
        self.backup()
        self.backup("--yes")
        self.nightly()
        self.assertEqual(self.entries()[GONE], before)
        self.install(self.device, GONE, b"as it comes from the shop")
        path = self.device.app_path(GONE, "data/file")

        def is_back():
            return read_bytes(path) == b"of " + GONE.encode()
        client.until(lambda: self.stops(client) and is_back(), "the data is back")
        self.backup()
        self.assertEqual(set(self.entries()), {HERE, GONE})

    def test_a_mode_whose_daemon_is_killed_keeps_the_backup_from_the_nights(self):
        self.restore_on(SERIAL, [GONE])
        os.kill(self.device.daemon_pid(), signal.SIGKILL)
        self.device.wait_for_daemon_end()
        for _ in range(2):
            self.nightly()
            self.assert_kept()
        client = self.restore_on(SERIAL, [GONE])
        client.call("restore_enable", GLib.Variant("(iissu)", (0, 0, "", "[]", 8)))
        client.until(lambda: self.stops(client), "the mode ends")
        self.nightly()
        self.assert_removed()

    def content(self, package):
        return read_bytes(self.device.app_path(package, "data/file"))

    def set_network(self, network, wifi):
        """Network and packages are told by different services, so that what is told of one may
        overtake what is told of the other."""
        self.device.set("network", network)
        wait_until(lambda: self.status()["wifi_connected"] is wifi, "the daemon knows of it")

    def fail_to_restore(self):
        """The package is installed where there is no Wi-Fi, so its restore is not even begun."""
        client = self.restore_on(SERIAL, [GONE])
        self.set_network("none", wifi=False)
        self.install(self.device, GONE, b"as it comes from the shop")
        client.until(lambda: self.stops(client), "the mode ends")
        self.assertEqual(self.content(GONE), b"as it comes from the shop")
        self.set_network("wifi", wifi=True)

    def test_what_a_failed_restore_did_not_bring_is_not_backed_up_over(self):
        before = self.entries()[GONE]
        self.fail_to_restore()
        for _ in range(2):
            result = self.backup("--json")
            outcome = [one for one in json.loads(result.stdout)["packages"]
                       if one["package"] == GONE]
            self.assertEqual([(one["outcome"], one["reason"]) for one in outcome],
                             [("skipped", "restoring")])
            self.device.quarnctl("deactivate")
            self.device.wait_for_daemon_end()
            self.nightly()
        self.assertEqual(self.entries()[GONE], before)
        self.device.quarnctl("app", "restore", GONE)
        self.assertEqual(self.content(GONE), b"of " + GONE.encode())
        self.assertEqual(os.listdir(self.device.app_path(GONE, "shared/data")), [])
        with open(self.device.app_path(GONE, "data/file"), "wb") as file:
            file.write(b"newer")
        self.backup()
        self.assertNotEqual(self.entries()[GONE]["crc"], before["crc"])

    def test_a_restore_whose_daemon_is_killed_is_not_backed_up_over(self):
        self.restore_on(SERIAL, [GONE])
        # nobody listens there, so the download is tried again for a while
        self.device.call("set", "cloud", "webdav+http://127.0.0.1:9/nowhere", "--user", "ada",
                         input="x\n")
        self.install(self.device, GONE, b"as it comes from the shop")
        self.device.wait_for_log("request download for (%s)" % GONE)
        os.kill(self.device.daemon_pid(), signal.SIGKILL)
        self.device.wait_for_daemon_end()
        self.device.set("cloud", "file://" + self.device.cloud)
        self.backup()
        self.assert_kept()
        self.device.quarnctl("app", "restore", GONE)
        self.assertEqual(self.content(GONE), b"of " + GONE.encode())

    def test_backing_up_just_the_package_replaces_what_a_failed_restore_left(self):
        self.fail_to_restore()
        self.device.quarnctl("app", "backup", GONE)
        self.backup()
        self.device.remove(GONE)
        client = self.restore_on(SERIAL, [GONE])
        self.install(self.device, GONE, b"once more from the shop")
        client.until(lambda: self.stops(client), "the mode ends")
        self.assertEqual(self.content(GONE), b"as it comes from the shop")

    def test_the_mode_for_another_device_keeps_nothing_of_this_one(self):
        self.restore_on(OTHER, [GONE])
        self.backup("--yes")
        self.assert_removed()

    def test_a_device_that_was_reset_keeps_its_backup_through_its_nights(self):
        self.device.setting(OWN_BACKUP, "0")
        for _ in range(2):
            self.nightly()
            self.assert_kept()
        # Forgetting the time of the last backup is not what a reset is.
        self.device.quarnctl("deactivate")
        self.nightly()
        self.assert_kept()
        self.backup("--yes")
        self.assert_removed()

    def test_forgetting_the_last_time_leaves_nightly_runs_what_they_were(self):
        self.device.quarnctl("deactivate")
        self.nightly()
        self.assert_removed()

    def test_restores_and_backups_that_meet_lose_nothing(self):
        packages = ["org.example.p%d" % index for index in range(6)]
        for package in packages:
            self.install(self.device, package, b"old data of " + package.encode())
        self.backup("--yes")
        for package in packages:
            self.device.remove(package)
        client = self.restore_on(SERIAL, packages)
        backups = []
        try:
            for index, package in enumerate(packages):
                backups.append(self.device.begin(
                    "quarnctl", "backup", "--yes", stdout=subprocess.PIPE,
                    stderr=subprocess.STDOUT, text=True))
                self.install(self.device, package, b"new data")
            client.until(lambda: self.stops(client), "the mode ends")
        finally:
            ends = [(run.communicate(timeout=120)[0], run.returncode) for run in backups]
        self.assertEqual([status for _out, status in ends], [0] * len(backups), ends)
        for package in packages:
            self.assertEqual(read_bytes(self.device.app_path(package, "data/file")),
                             b"old data of " + package.encode())
        self.backup()
        self.assertEqual(set(self.entries()), set(packages) | {HERE})
        for package in packages:
            self.assertTrue(os.path.exists(self.archive(package)), package)


class Causes(TestCase):
    """A device that is full, for the daemon's own files alone."""

    def setUp(self):
        self.device = self.new_device(serial=SERIAL, model="Orvane One", account="ada")
        self.staging = os.path.join(self.device.path, "root/tmp")
        subprocess.run(["mount", "-t", "tmpfs", "-o", "size=1m", "none", self.staging], check=True)
        self.addCleanup(subprocess.run, ["umount", "-l", self.staging])
        os.chmod(self.staging, 0o1777)
        self.device.start()
        self.addCleanup(self.device.stop)
        self.device.install(make_source(self.path("src"), HERE, "1.0", {"data/file": b"text"}))

    def fill(self):
        filler = os.open(os.path.join(self.staging, "filler"), os.O_WRONLY | os.O_CREAT)
        try:
            while os.write(filler, b"\0" * 4096) > 0:
                pass
        except OSError:
            pass
        finally:
            os.close(filler)

    def test_a_full_device_is_neither_lost_wifi_nor_an_empty_cloud(self):
        device = self.device
        device.quarnctl("backup")
        self.fill()
        failed = device.quarnctl("backup", check=False)
        self.assertEqual(failed.returncode, 13, failed.stdout + failed.stderr)
        self.assertEqual(failed.stderr,
                         "quarnctl: backup failed: this device has no room left (13)\n")
        listed = device.quarnctl("list", check=False)
        self.assertEqual(listed.returncode, 1)
        self.assertEqual(listed.stderr, "quarnctl: getting the application list failed: "
                                        "this device has no room left (1)\n")
        self.assertIn("last problem      this device has no room left\n",
                      device.quarnctl("status").stdout)
        os.unlink(os.path.join(self.staging, "filler"))
        device.quarnctl("backup")
        self.assertNotIn("last problem", device.quarnctl("status").stdout)

    def test_a_first_backup_that_cannot_write_its_list_sends_nothing(self):
        self.fill()
        failed = self.device.quarnctl("backup", check=False)
        self.assertEqual(failed.returncode, 12, failed.stdout + failed.stderr)
        self.assertEqual(failed.stderr,
                         "quarnctl: backup failed: this device has no room left (12)\n")
        self.assertEqual(os.listdir(self.device.cloud), [])

    def other_devices_list(self, size):
        """An application list of another device, of that many bytes."""
        folder = os.path.join(self.device.cloud, "app_list")
        os.makedirs(folder, exist_ok=True)
        text = ('{"format_ver":1,"model_list":[{"backup_info":{"serial_number":"%s"},'
                '"pkg_list":[],"x":"%s"}]}')
        text %= OTHER, "x" * (size - len(text) - len(OTHER) + 4)
        self.assertEqual(len(text), size)
        with open(os.path.join(folder, "app_list.txt"), "w") as file:
            file.write(text)
        return text

    def test_a_failed_upload_says_that_no_list_was_written(self):
        self.device.quarnctl("backup")
        path = os.path.join(self.device.cloud, SERIAL, HERE, "1.0")
        shutil.rmtree(path)
        with open(path, "w"):
            pass
        with open(self.device.app_path(HERE, "data/file"), "w") as file:
            file.write("changed")
        failed = self.device.quarnctl("backup", check=False)
        self.assertEqual(failed.returncode, 12, failed.stdout + failed.stderr)
        self.assertIn("quarnctl: no list was written: what this backup sent of changed packages "
                      "cannot be restored yet; the next backup sends it again\n", failed.stderr)
        self.assertIn("the cloud answered with an error\n", failed.stderr)
        document = json.loads(self.device.quarnctl("backup", "--json", check=False).stdout)
        self.assertEqual((document["cloud_problem"], document["list_written"]), ("server", False))
        os.unlink(path)
        self.device.quarnctl("backup")

    def test_a_list_near_its_bound_is_noted_and_one_beyond_it_stands(self):
        subprocess.run(["mount", "-o", "remount,size=64m", self.staging], check=True)
        self.other_devices_list(BOUND - 2000)
        noted = self.device.quarnctl("backup")
        self.assertIn("quarnctl: note: the application list is nearly full: 4.0 MiB of at most "
                      "4.0 MiB", noted.stderr)
        text = self.device.quarnctl("list").stdout
        self.assertIn(HERE, text)
        before = self.other_devices_list(BOUND)
        with open(self.device.app_path(HERE, "data/file"), "w") as file:
            file.write("changed")
        failed = self.device.quarnctl("backup", check=False)
        self.assertEqual(failed.returncode, 42, failed.stdout + failed.stderr)
        self.assertEqual(failed.stderr, "quarnctl: backup failed: the application list is larger "
                                        "than what devices can read (42)\n")
        self.assertNotIn("uploading", failed.stdout)
        self.assertEqual(
            read_file(os.path.join(self.device.cloud, "app_list/app_list.txt")), before)

    def test_packages_that_are_not_backed_up_are_told_apart(self):
        deep = self.device.app_path(HERE, "data")
        at = os.open(deep, os.O_RDONLY)
        for _ in range(401):
            os.mkdir("d", dir_fd=at)
            at, above = os.open("d", os.O_RDONLY, dir_fd=at), at
            os.close(above)
        os.close(at)
        for package, keys in (("org.example.external", {"storage": "external"}),
                              ("org.example.disabled", {"metadata": {"backup": "disable"}})):
            self.device.install(make_source(self.path(package), package, "1.0",
                                            {"data/file": b"x"}, **keys))
        self.device.install(make_source(self.path("broken"), "org.example.broken", "1.0",
                                        {"data/file": b"x"}))
        shutil.rmtree(self.device.app_path("org.example.broken", "shared/trusted"))
        document = json.loads(self.device.quarnctl("backup", "--json").stdout)
        self.assertEqual({one["package"]: one["reason"] for one in document["packages"]},
                         {HERE: "too-deep", "org.example.external": "external",
                          "org.example.disabled": "disabled",
                          "org.example.broken": "unreadable"})
        subprocess.run(["rm", "-rf", os.path.join(deep, "d")], check=True)

    def test_a_list_of_another_form_is_said_to_be_that_and_nothing_is_sent(self):
        folder = os.path.join(self.device.cloud, "app_list")
        os.makedirs(folder)
        with open(os.path.join(folder, "app_list.txt"), "w") as file:
            file.write('{"format_ver": 2, "model_list": []}')
        failed = self.device.quarnctl("backup", check=False)
        self.assertEqual(failed.returncode, 12)
        self.assertEqual(failed.stderr, "quarnctl: backup failed: the cloud's application list is "
                                        "in a form that this device does not know (12)\n")
        self.assertEqual(os.listdir(self.device.cloud), ["app_list"])


if __name__ == "__main__":
    unittest.main()
