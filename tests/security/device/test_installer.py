"""An application against the installer, and against what the device keeps for root."""
import fcntl
import os
import re
import shutil
import signal
import subprocess
import sys
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, "../../integration"))
from quarn_test import (  # noqa: E402
    APPLICATION, TestCase, as_application, exchange_names, make_source, read_file, wait_until)

PACKAGE = "org.example.notes"
EXCHANGE = 2
AT_FDCWD = -100
#: Exchanges two names at one moment of a program, see exchange_at.cpp.
EXCHANGE_AT = os.path.join(os.environ["QUARN_BUILD_DIR"], "tests/libexchange_at.so")
#: Fewer were not the installer's.
FEWEST_MOMENTS = 30


class Installer(TestCase):
    def setUp(self):
        self.device = self.new_device(serial="350000000000001")
        os.chmod(self.directory, 0o755)
        self.vault = self.path("vault")
        os.mkdir(self.vault, 0o755)
        self.children = []

    def tearDown(self):
        for child in self.children:
            os.kill(child, signal.SIGKILL)
            os.waitpid(child, 0)

    def app_path(self, path):
        return self.device.app_path(PACKAGE, path)

    def attack(self, work):
        self.children.append(as_application(work))

    def update_with_exchange(self, at, folder):
        """An update to which the application exchanges a folder for a link at one moment of it.
        @return how many moments it had"""
        count = self.path("moments")
        environment = {**os.environ, "LD_PRELOAD": EXCHANGE_AT, "EXCHANGE_AT": str(at),
                       "EXCHANGE_ONE": self.app_path(folder),
                       "EXCHANGE_OTHER": self.app_path("link"), "EXCHANGE_COUNT": count,
                       "ASAN_OPTIONS": "verify_asan_link_order=0"}
        self.device.call("install", self.path("next"), check=False, env=environment)
        return int(read_file(count))

    def updates_against(self, folder):
        """Updates that add a file to a folder which the application exchanges for a link, each at
        another moment: an installer that goes by paths is led astray at one of them."""
        self.device.install(make_source(self.path("first"), PACKAGE, "1.0.0",
                                        {folder + "/there": b"there"}))
        make_source(self.path("next"), PACKAGE, "1.0.0", {folder + "/new": b"new"})
        link, added = self.app_path("link"), self.app_path(folder + "/new")
        os.symlink(self.vault, link)
        moments = self.update_with_exchange(0, folder)
        self.assertTrue(os.path.exists(added))
        self.assertGreater(moments, FEWEST_MOMENTS)
        exchanges = 0
        for at in range(1, moments + 1):
            os.unlink(added)
            self.update_with_exchange(at, folder)
            self.assertEqual([], os.listdir(self.vault),
                             "the installer was led astray at moment %d of %d" % (at, moments))
            if not os.path.islink(link):
                exchanges += 1
                exchange_names(link, self.app_path(folder))
            if not os.path.exists(added):
                shutil.copy(self.path("next/" + folder + "/new"), added)
        self.assertGreater(exchanges, moments // 2)
        self.assertEqual((0, 0o755), (os.stat(self.vault).st_uid,
                                      os.stat(self.vault).st_mode & 0o7777))

    def test_a_folder_that_becomes_a_link_during_an_update_leads_nowhere(self):
        self.updates_against("data/sub")

    def test_neither_does_a_data_folder(self):
        self.updates_against("shared/trusted")

    def test_a_folder_of_somebody_elses_in_an_applications_is_left_alone(self):
        self.device.install(make_source(self.path("first"), PACKAGE, "1.0.0", {"data/a": b"a"}))
        os.mkdir(self.app_path("data/roots"), 0o700)
        source = make_source(self.path("next"), PACKAGE, "2.0.0",
                             {"data/roots/planted": b"x", "data/b": b"b"})
        self.device.install(source)
        self.assertEqual([], os.listdir(self.app_path("data/roots")))
        self.assertEqual(["a", "b", "roots"], sorted(os.listdir(self.app_path("data"))))

    def test_resources_are_replaced_whatever_the_application_puts_there(self):
        self.device.install(make_source(self.path("first"), PACKAGE, "1.0.0", {"res/a": b"a"}))
        shutil.rmtree(self.app_path("res"))
        os.symlink(self.vault, self.app_path("res"))
        with open(os.path.join(self.vault, "roots"), "w") as file:
            file.write("root's")
        self.device.install(make_source(self.path("next"), PACKAGE, "2.0.0", {"res/b": b"b"}))
        self.assertEqual(["b"], os.listdir(self.app_path("res")))
        self.assertEqual(["roots"], os.listdir(self.vault))

    def test_a_removal_follows_nothing_and_ends_while_the_application_makes_more(self):
        with open(os.path.join(self.vault, "roots"), "w") as file:
            file.write("root's")
        for index in range(3):
            self.device.install(make_source(self.path("source%d" % index), PACKAGE, "1.0.0",
                                            {"data/deep/er/file": b"x"}))

            def make_for_ever():
                for name in ("data", "data/deep", "data/deep/er"):
                    os.chdir(self.app_path(""))
                    os.chdir(name)
                    for number in range(50):
                        os.symlink(self.vault, "link%d" % number)
                number = 0
                while number < 5000:
                    number += 1
                    try:
                        os.mkdir("more%d" % number)
                        os.symlink(self.vault, "more%d/link" % number)
                        os.rename("more%d/link" % number, "data%d" % number)
                    except OSError:
                        if not os.path.exists("."):
                            return

            self.attack(make_for_ever)
            wait_until(lambda: os.path.exists(self.app_path("data/deep/er/more1")), "it makes more")
            self.device.remove(PACKAGE)
            self.assertEqual(["roots"], os.listdir(self.vault))
            self.assertFalse(os.path.lexists(self.app_path("")))
            self.assertEqual(["apps"], os.listdir(os.path.join(self.device.path, "root/opt/usr")))

    def test_a_tree_of_any_depth_is_removed(self):
        self.device.install(make_source(self.path("source"), PACKAGE, "1.0.0", {"data/a": b"a"}))
        top = self.app_path("data")

        def dig():
            os.chdir(top)
            for _ in range(5000):
                os.mkdir("d" * 100)
                os.chdir("d" * 100)

        child = as_application(dig)
        self.assertEqual(0, os.waitpid(child, 0)[1])
        self.device.remove(PACKAGE)
        self.assertFalse(os.path.lexists(self.app_path("")))
        self.assertEqual(["apps"], os.listdir(os.path.join(self.device.path, "root/opt/usr")))

    def test_an_installation_is_there_as_a_whole_or_not_at_all(self):
        """What looks at the package's place meanwhile never sees a part of it."""
        files = {"data/%03d" % number: b"x" for number in range(200)}
        source = make_source(self.path("source"), PACKAGE, "1.0.0", files)
        for _ in range(5):
            with subprocess.Popen([self.device.tool, "install", self.device.path, source]) as tool:
                while tool.poll() is None:
                    try:
                        found = len(os.listdir(self.app_path("data")))
                    except FileNotFoundError:
                        continue
                    self.assertEqual(200, found)
            self.assertEqual(0, tool.returncode)
            self.device.remove(PACKAGE)


class RootsOwn(TestCase):
    """The device's folder is in reach of its applications, for the bus socket in it."""

    def setUp(self):
        self.device = self.new_device(serial="350000000000001")
        os.chmod(self.directory, 0o755)
        self.device.start()
        self.device.install(make_source(self.path("source"), PACKAGE, "1.0.0", {"data/a": b"a"}))
        self.device.quarnctl("backup")

    def reached(self, mode):
        """What of the device's folder the applications' user may open so, but for its packages."""
        top = self.device.path
        names = [os.path.join(folder, name) for folder, folders, files in os.walk(top)
                 for name in folders + files]
        names = [name for name in names
                 if not name.startswith(os.path.join(top, "root")) and not os.path.islink(name)]
        self.assertIn(os.path.join(top, "state/.lock"), names)
        self.assertIn(os.path.join(top, "run/bus"), names)
        told, tell = os.pipe()

        def try_all():
            for name in names:
                if os.access(name, mode):
                    os.write(tell, (os.path.relpath(name, top) + "\n").encode())

        os.waitpid(as_application(try_all), 0)
        os.close(tell)
        with os.fdopen(told) as file:
            return sorted(file.read().splitlines())

    def test_an_application_reads_nothing_of_what_the_device_keeps(self):
        self.assert_closed()

    def assert_closed(self):
        """What is in the folder of the bus socket is no secret, but for its locks."""
        reached = self.reached(os.R_OK)
        self.assertIn("run/bus", reached)
        self.assertEqual([], [name for name in reached if not re.match(r"run(/[a-z]|$)", name)])

    def test_an_application_writes_nothing_there(self):
        self.assertEqual(["run/bus"], self.reached(os.W_OK))

    def test_no_lock_of_the_devices_can_be_held_by_an_application(self):
        def hold_all():
            for name in ("state/.lock", "state/.installer", "run/.start", "run/.mounts"):
                for flags in (os.O_RDONLY, os.O_RDWR):
                    try:
                        fcntl.flock(os.open(os.path.join(self.device.path, name), flags),
                                    fcntl.LOCK_EX)
                        os._exit(3)
                    except PermissionError:
                        pass
            os._exit(0)

        self.assertEqual(0, os.waitpid(as_application(hold_all), 0)[1])

    def test_a_device_of_an_earlier_release_is_closed_at_its_start(self):
        self.device.stop()
        for name, mode in (("state", 0o755), ("log", 0o755), ("run", 0o755), ("state/.lock", 0o644)):
            os.chmod(os.path.join(self.device.path, name), mode)
        self.device.start()
        self.assert_closed()


class SomebodyElses(TestCase):
    def tool(self, *arguments):
        return self.device.call(*arguments, check=False)

    def test_no_device_is_made_in_a_folder_of_somebody_elses(self):
        place = self.path("place")
        os.mkdir(place)
        os.chown(place, APPLICATION, APPLICATION)
        made = subprocess.run([self.new_device("other").tool, "create", place],
                              stderr=subprocess.PIPE, text=True)
        self.assertEqual((1, "quarn-device: %s is not this user's own\n" % place),
                         (made.returncode, made.stderr))
        self.assertEqual([], os.listdir(place))

    def test_nor_in_one_that_others_may_write_to(self):
        place = self.path("place")
        os.mkdir(place)
        os.chmod(place, 0o777)
        made = subprocess.run([self.new_device("other").tool, "create", place],
                              stderr=subprocess.PIPE, text=True)
        self.assertEqual((1, "quarn-device: others may write to %s\n" % place),
                         (made.returncode, made.stderr))
        self.assertEqual([], os.listdir(place))

    def test_a_device_that_others_can_change_is_not_used(self):
        self.device = self.new_device()
        for part in (".", "state", "run", "root"):
            path = os.path.normpath(os.path.join(self.device.path, part))
            mode = os.stat(path).st_mode & 0o7777
            os.chown(path, APPLICATION, -1)
            self.assertEqual((1, "quarn-device: %s is not this user's own\n" % path),
                             (lambda r: (r.returncode, r.stderr))(self.tool("list")))
            os.chown(path, 0, -1)
            os.chmod(path, mode | 0o002)
            self.assertEqual((1, "quarn-device: others may write to %s\n" % path),
                             (lambda r: (r.returncode, r.stderr))(self.tool("list")))
            os.chmod(path, mode)
        self.assertEqual(0, self.tool("list").returncode)


if __name__ == "__main__":
    unittest.main()
