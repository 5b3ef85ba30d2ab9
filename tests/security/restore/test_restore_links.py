"""An application that links root's files into its data while it is restored and rolled back."""
import contextlib
import os
import shutil
import sys
import unittest
import zipfile

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, "../../integration"))
sys.path.insert(0, os.path.join(HERE, ".."))
from kernel_settings import kernel_settings  # noqa: E402
from quarn_test import (  # noqa: E402
    APPLICATION, TestCase, application, as_application, exchange_names, make_source, read_bytes)

SERIAL = "350000000000001"
PACKAGE = "org.example.notes"
SECRET = b"root's alone"
FILES = 60
ROUNDS = 12
SNAPSHOT = "shared/data/quarn_tmp_rst_dir"


def attributes(path):
    status = os.lstat(path)
    content = read_bytes(path)
    labels = {key: os.getxattr(path, key) for key in os.listxattr(path)}
    return (content, status.st_mode, status.st_uid, status.st_gid, labels)


class RestoreLinks(TestCase):
    def setUp(self):
        self.device = self.new_device(serial=SERIAL)
        self.device.start()
        os.chmod(self.directory, 0o755)
        os.mkdir(self.path("vault"), 0o755)
        self.secret = self.path("vault", "secret")
        with open(self.secret, "wb") as file:
            file.write(SECRET)
        os.chmod(self.secret, 0o600)
        self.names = ["data/%d" % index for index in range(FILES)]
        self.device.install(make_source(self.path("source"), PACKAGE, "1.0.0", {
            name: b"kept" for name in self.names}))
        self.device.quarnctl("backup")
        archive = self.device.archive(PACKAGE)
        self.archive = archive
        self.good = shutil.copy(archive, self.path("good.zip"))
        self.broken = self.path("broken.zip")
        with zipfile.ZipFile(self.good) as good, zipfile.ZipFile(self.broken, "w") as broken:
            for entry in good.infolist():
                whole = good.read(entry)
                # the last file's line is missing: everything is unpacked, and then rolled back
                if entry.filename.endswith(".perm"):
                    whole = whole.replace(b'"data/%d"' % (FILES - 1), b'"data/none"')
                broken.writestr(entry.filename, whole)

    def make_one_link(self):
        os.link(self.secret, self.app("data/can"))
        os.unlink(self.app("data/can"))

    def app(self, name):
        return self.device.app_path(PACKAGE, name)

    def put_links(self):
        for name in self.names:
            with contextlib.suppress(OSError):
                os.link(self.secret, self.app("data/link"))
            with contextlib.suppress(OSError):
                os.rename(self.app("data/link"), self.app(name))
            with contextlib.suppress(OSError):
                os.unlink(self.app("data/link"))

    def make_snapshot_of_links(self):
        mine = self.app("shared/data/mine")
        for name in self.names[:3]:
            path = os.path.join(mine, name)
            # what has that name at the moment may be the daemon's
            with contextlib.suppress(OSError):
                os.makedirs(os.path.dirname(path), exist_ok=True)
                os.link(self.secret, path)

    def put_snapshots(self):
        self.make_snapshot_of_links()
        for _ in range(100):
            exchange_names(self.app(SNAPSHOT), self.app("shared/data/mine"))

    def assert_nothing_was_reached(self):
        self.assertEqual(self.before, attributes(self.secret))
        for folder, _, names in os.walk(self.app("")):
            for name in names:
                path = os.path.join(folder, name)
                if os.path.samefile(path, self.secret) or os.lstat(path).st_uid != APPLICATION:
                    continue
                self.assertNotIn(SECRET, read_bytes(path), path)

    def restores_against(self, work):
        self.before = attributes(self.secret)
        with kernel_settings({"fs.protected_hardlinks": "0"}):
            for number in range(ROUNDS):
                shutil.copy(self.broken if number % 2 else self.good, self.archive)
                self.assertEqual(0, os.waitpid(as_application(self.make_one_link), 0)[1])
                with application(work):
                    self.device.quarnctl("app", "restore", PACKAGE, check=False)
                self.assert_nothing_was_reached()
        # and afterwards it goes on as if nothing had been
        shutil.rmtree(self.app("data"))
        os.mkdir(self.app("data"))
        os.chown(self.app("data"), APPLICATION, APPLICATION)
        for name in os.listdir(self.app("shared/data")):
            shutil.rmtree(self.app("shared/data/" + name), ignore_errors=True)
        shutil.copy(self.good, self.archive)
        self.device.quarnctl("app", "restore", PACKAGE)
        for name in self.names:
            self.assertEqual((b"kept", APPLICATION), (attributes(self.app(name))[0],
                                                      attributes(self.app(name))[2]))

    def test_links_in_the_place_of_its_files(self):
        self.restores_against(self.put_links)

    def test_a_folder_of_links_in_the_place_of_the_snapshot(self):
        self.restores_against(self.put_snapshots)


if __name__ == "__main__":
    unittest.main()
