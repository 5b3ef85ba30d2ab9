"""An application works against the backup of its own data: nothing but what was packed is sent, and
what it puts into /tmp stops nothing."""
import contextlib
import fcntl
import io
import os
import signal
import socket
import stat
import sys
import threading
import time
import unittest
import zipfile

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path[:0] = [os.path.join(HERE, ".."), os.path.join(HERE, "../../integration")]
from kernel_settings import kernel_settings  # noqa: E402
from quarn_test import APPLICATION, TestCase, application, make_source, wait_until  # noqa: E402

PACKAGE = "org.example.hostile"
OTHER = "org.example.notes"
MARKER = b"the secret of root: 6f1d0c52-9d7e-4b57-8ad5-0c9f3b3f2a11"
#: Seconds that a race runs.
RACE = float(os.environ.get("QUARN_RACE_SECONDS", "30"))


def exchange(place, folder, archives):
    """The file of root's in `place` in place of what is about to be sent from `folder`."""
    for archive in archives:
        with contextlib.suppress(OSError):
            if os.lstat(archive, dir_fd=folder).st_nlink == 1:
                os.link("huge", archive + ".other", src_dir_fd=place, dst_dir_fd=folder)
                os.rename(archive + ".other", archive, src_dir_fd=folder, dst_dir_fd=folder)


class Packing(TestCase):
    def setUp(self):
        os.chmod(self.directory, 0o755)
        self.device = self.new_device(serial="350000000000001", model="Orvane One")
        self.device.start()
        self.device.install(make_source(self.path(PACKAGE), PACKAGE, "1.0.0",
                                        {"data/file%d.own" % number: b"own" for number in range(4)}))
        self.device.install(make_source(self.path(OTHER), OTHER, "1.0.0", {"data/note": b"x"}))
        self.change = 0

    def sent(self):
        """Everything in the cloud, as (path, bytes)."""
        for folder, _, names in os.walk(self.device.cloud):
            for name in names:
                path = os.path.join(folder, name)
                with contextlib.suppress(FileNotFoundError), open(path, "rb") as file:
                    yield path, file.read()

    def check_cloud(self):
        for path, content in self.sent():
            self.assertNotIn(MARKER, content, path)
            if not path.endswith(".zip"):
                continue
            self.assertTrue(content.startswith(b"PK"), "%s is no archive" % path)
            with zipfile.ZipFile(io.BytesIO(content)) as archive:
                for entry in archive.namelist():
                    self.assertNotIn(MARKER, archive.read(entry), "%s: %s" % (path, entry))

    def back_up_changed(self):
        self.change += 1
        with open(self.device.app_path(PACKAGE, "data/change"), "w") as file:
            file.write(str(self.change))
        self.device.quarnctl("app", "backup", PACKAGE, check=False)

    def test_what_is_sent_is_the_archive_that_was_made(self):
        place = os.open(self.device.app_path(""), os.O_PATH | os.O_DIRECTORY)
        self.addCleanup(os.close, place)
        folder = os.open(self.device.app_path(PACKAGE, "shared/data"), os.O_PATH | os.O_DIRECTORY)
        self.addCleanup(os.close, folder)
        with open(os.open("huge", os.O_WRONLY | os.O_CREAT, 0o600, dir_fd=place), "wb") as file:
            file.write(MARKER)
            file.truncate(64 << 20)
        archives = [PACKAGE + "_upload.zip", "quarn_tmp_rst_dir." + PACKAGE + "_upload.zip"]
        end = time.monotonic() + RACE
        with kernel_settings({"fs.protected_hardlinks": "0"}):
            with application(lambda: exchange(place, folder, archives)):
                while time.monotonic() < end:
                    self.back_up_changed()
                    self.check_cloud()
        self.back_up_changed()
        self.assertIn(PACKAGE + ".zip", [os.path.basename(path) for path, _ in self.sent()],
                      "it is backed up when the attack has ended")


    def test_what_is_exchanged_while_the_store_is_slow_is_not_sent(self):
        packages = (PACKAGE, OTHER)
        for package in packages:
            with open(self.device.app_path(package, "data/much"), "wb") as file:
                file.write(os.urandom(8 << 20))
        huge = self.path("huge")
        with open(os.open(huge, os.O_WRONLY | os.O_CREAT, 0o600), "wb") as file:
            file.write(MARKER)
        # below the applications' folder, which the device's own hides from its users
        names = ["%s/shared/data/%s_upload.zip" % (package, package) for package in packages]
        archives = [self.device.app_path("", name) for name in names]
        places = [os.open(path, os.O_PATH | os.O_DIRECTORY)
                  for path in (self.directory, self.device.app_path(""))]
        store = os.open(self.device.cloud, os.O_RDONLY | os.O_DIRECTORY)
        for place in places:
            self.addCleanup(os.close, place)
        self.addCleanup(os.close, store)
        backup = threading.Thread(target=self.device.quarnctl, args=("backup",),
                                  kwargs={"check": False})
        # One lies there while the other is packed, and both while the store is slow.
        with kernel_settings({"fs.protected_hardlinks": "0"}), \
                application(lambda: exchange(*places, names)):
            backup.start()
            try:
                while backup.is_alive() and not any(map(os.path.lexists, archives)):
                    pass
                fcntl.flock(store, fcntl.LOCK_EX)
                wait_until(lambda: all("request upload for (%s)" % package in self.device.log()
                                       for package in packages), "both are to be sent")
            finally:
                fcntl.flock(store, fcntl.LOCK_UN)
                backup.join()
        self.check_cloud()
        self.assertIn("was exchanged, so it is not sent", self.device.log())
        self.device.quarnctl("backup")
        self.check_cloud()
        self.assertEqual(2, sum(path.endswith(".zip") for path, _ in self.sent()))


class Squatting(TestCase):
    """Whatever lies first where the daemon's files in /tmp are to be."""

    def setUp(self):
        self.device = self.new_device(serial="350000000000001", model="Orvane One")
        self.tmp = os.path.join(self.device.path, "root/tmp")
        os.chmod(self.tmp, 0o1777)

    def squat(self, kind, path):
        if kind == "file":
            with open(path, "w"):
                os.chmod(path, 0o666)
        elif kind == "directory":
            os.makedirs(os.path.join(path, "app_list.txt/in the way"))
        elif kind == "link":
            os.symlink("/etc", path)
        elif kind == "pipe":
            os.mkfifo(path, 0o666)
        else:
            with socket.socket(socket.AF_UNIX) as bound:
                bound.bind(path)
        os.lchown(path, APPLICATION, APPLICATION)

    def test_nothing_that_lies_there_stops_backups_and_exports(self):
        self.device.start()
        self.device.install(make_source(self.path(OTHER), OTHER, "1.0.0", {"data/note": b"x"}))
        for kind in ("file", "directory", "link", "pipe", "socket"):
            with self.subTest(kind):
                daemon = self.device.daemon_pid()
                if daemon:
                    os.kill(daemon, signal.SIGTERM)
                    self.device.wait_for_daemon_end()
                wait_until(lambda: not os.path.lexists(os.path.join(self.tmp, "quarn")),
                           "the daemon leaves nothing")
                export = os.path.join(self.tmp, OTHER + "_tmp.zip")
                with contextlib.suppress(FileNotFoundError):
                    os.unlink(export)
                self.squat(kind, os.path.join(self.tmp, "quarn"))
                self.squat(kind, export)
                self.assertEqual(self.device.quarnctl("backup", "--yes", check=False).returncode, 0)
                self.device.quarnctl("app", "export", OTHER)
                status = os.lstat(export)
                self.assertTrue(stat.S_ISREG(status.st_mode))
                self.assertEqual((status.st_uid, stat.S_IMODE(status.st_mode)),
                                 (os.getuid(), 0o600))
                self.assertTrue(zipfile.is_zipfile(export))


if __name__ == "__main__":
    unittest.main()
