"""A daemon that is killed at any moment: nothing half done stays, on the device or in the cloud."""
import json
import os
import random
import shutil
import signal
import subprocess
import sys
import time
import unittest
import zipfile

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
from quarn_test import DEADLINE, TestCase, make_source, tree, wait_until  # noqa: E402

SERIAL = "350000000000001"
PACKAGE = "org.example.notes"
#: Files of the package that is restored; enough for a restore to be met in its middle.
FILES = 300
LABELS = ("security.SMACK64", "user.quarn.SMACK64")


def saved_tree(root):
    """Everything of the package that is backed up, with owners and labels, by path."""
    return tree(root, ("data", "shared/data", "shared/trusted"), LABELS)


class CrashTest(TestCase):
    def setUp(self):
        self.device = self.new_device(serial=SERIAL, model="Orvane One")
        self.device.start()
        seed = int(os.environ.get("QUARN_CRASH_SEED") or time.time_ns() % 1000000)
        self.random = random.Random(seed)
        self.hint = "QUARN_CRASH_SEED=%d" % seed

    def ask(self, *arguments):
        """A client that waits for its answer."""
        client = self.device.begin("quarnctl", *arguments, stdout=subprocess.PIPE,
                                   stderr=subprocess.STDOUT, text=True)
        self.addCleanup(client.communicate)
        self.addCleanup(client.kill)
        return client

    def kill_daemon_when(self, happened, client):
        """Kill the daemon as soon as `happened()`, or let it be when the client has its answer."""
        wait_until(lambda: self.device.daemon_pid() or client.poll() is not None,
                   "the daemon runs")
        pid = self.device.daemon_pid()
        end = time.monotonic() + DEADLINE
        while not happened():
            self.assertLess(time.monotonic(), end, self.hint)
            if client.poll() is not None:
                break
        if pid is not None and client.poll() is None:
            try:
                os.kill(pid, signal.SIGKILL)
            except ProcessLookupError:
                pass  # it has ended on its own meanwhile
        client.communicate(timeout=DEADLINE)
        # A client that had its answer before the kill came is content.
        killed = client.returncode != 0
        if killed:
            self.end_daemons()
        return killed

    def end_daemons(self):
        """None is left: a call on its way to the killed one has started another."""
        wait_until(lambda: not self.device.signal_daemon(signal.SIGTERM), "the daemons end")

    def log_size(self):
        return os.path.getsize(os.path.join(self.device.path, "log/quarnd.log"))


class KilledBackup(CrashTest):
    PACKAGES = ["org.example.p%d" % index for index in range(6)]

    def objects(self):
        """What the cloud shows: its objects, without the store's own unfinished files."""
        return [os.path.join(folder, name) for folder, _, names in os.walk(self.device.cloud)
                for name in names if name == "app_list.txt" or name.endswith(".zip")]

    def change(self, package):
        content = self.random.randbytes(200000)
        with open(self.device.app_path(package, "data/content"), "wb") as file:
            file.write(content)
        return content

    def assert_objects_are_whole(self, contents):
        """Each archive is one of those that were ever to be sent."""
        for path in self.objects():
            if path.endswith("app_list.txt"):
                with open(path) as file:
                    self.assertEqual(json.load(file)["format_ver"], 1, self.hint)
                continue
            with zipfile.ZipFile(path) as archive:
                self.assertIsNone(archive.testzip(), self.hint)
                package = os.path.basename(path)[:-len(".zip")]
                self.assertIn(archive.read("data/content"), contents[package], self.hint)

    def test_no_half_object_is_in_the_cloud_and_the_next_backup_is_whole(self):
        contents = {package: [] for package in self.PACKAGES}
        for package in self.PACKAGES:
            self.device.install(make_source(self.path(package), package, "1.0.0",
                                            {"data/content": b"first"}))
            contents[package].append(b"first")
        before = self.log_size() if os.path.exists(
            os.path.join(self.device.path, "log/quarnd.log")) else 0
        self.device.quarnctl("backup")
        whole_run = self.log_size() - before
        killed = 0
        for _ in range(8):
            for package in self.PACKAGES:
                contents[package].append(self.change(package))
            target = self.log_size() + self.random.randrange(whole_run)
            client = self.ask("backup")
            killed += self.kill_daemon_when(lambda: self.log_size() >= target, client)
            self.assert_objects_are_whole(contents)
        self.assertGreater(killed, 0, self.hint)

        self.device.quarnctl("backup")
        self.assert_objects_are_whole(contents)
        found = sorted(os.path.relpath(os.path.join(folder, name), self.device.cloud)
                       for folder, _, names in os.walk(self.device.cloud) for name in names
                       if not name.startswith("."))
        archives = [os.path.relpath(self.device.archive(package), self.device.cloud)
                    for package in self.PACKAGES]
        self.assertEqual(found, sorted(archives + ["app_list/app_list.txt"]))
        for package in self.PACKAGES:
            with zipfile.ZipFile(self.device.archive(package)) as archive:
                self.assertEqual(archive.read("data/content"), contents[package][-1], self.hint)
        left = [os.path.join(folder, name)
                for folder, _, names in os.walk(os.path.join(self.device.path, "root"))
                for name in names if name.endswith(("_upload.zip", ".perm", "app_list.txt"))]
        self.assertEqual(left, [], self.hint)


class KilledRestore(CrashTest):
    def setUp(self):
        super().setUp()
        files = {}
        for index in range(FILES):
            top = ("data", "shared/data", "shared/trusted")[index % 3]
            files["%s/folder%d/file%d" % (top, index % 7, index)] = (b"saved %d\n" % index * 50,
                                                                     0o600 + index % 8)
        self.device.install(make_source(self.path("source"), PACKAGE, "1.0.0", files))
        self.device.install(make_source(self.path("other"), "org.example.other", "1.0.0",
                                        {"data/other": b"other"}))
        self.root = self.device.app_path(PACKAGE).rstrip("/")
        self.snapshot = os.path.join(self.root, "shared/data/quarn_tmp_rst_dir")
        self.snapshot_table = os.path.join(self.snapshot, "shared/data", PACKAGE + ".perm")
        self.device.quarnctl("backup")
        self.device.remove("org.example.other")
        self.saved = saved_tree(self.root)
        # Afterwards the application went on: other contents and modes, files that went.
        for index in range(FILES):
            top = ("data", "shared/data", "shared/trusted")[index % 3]
            path = os.path.join(self.root, top, "folder%d" % (index % 7), "file%d" % index)
            if index % 5 == 0:
                os.unlink(path)
                continue
            with open(path, "wb") as file:
                file.write(b"present %d\n" % index * 70)
            os.chmod(path, 0o640 + index % 4)
        self.present = saved_tree(self.root)
        self.kept = self.path("kept")
        shutil.copytree(self.root, self.kept, symlinks=True)
        self.device.quarnctl("app", "restore", PACKAGE)
        self.restored = saved_tree(self.root)
        self.assertNotEqual(self.restored, self.present)
        for path, entry in self.saved.items():
            self.assertEqual(self.restored[path], entry, path)

    def reset(self):
        for top in ("data", "shared/data", "shared/trusted"):
            shutil.rmtree(os.path.join(self.root, top))
            shutil.copytree(os.path.join(self.kept, top), os.path.join(self.root, top),
                            symlinks=True)
        for path, (_, mode, uid, gid, labels) in self.present.items():
            target = os.path.join(self.root, path)
            os.chown(target, uid, gid)
            os.chmod(target, mode & 0o7777)
            for key, value in labels.items():
                os.setxattr(target, key, value)
        for top in ("data", "shared/data", "shared/trusted"):
            os.chown(os.path.join(self.root, top), 5000, 5000)
        self.assertEqual(saved_tree(self.root), self.present)

    def count(self, *path, content=None):
        """Files below a folder of the package; those that begin with `content`, when given."""
        number = 0
        for folder, _, names in os.walk(os.path.join(self.root, *path)):
            if content is None:
                number += len(names)
                continue
            for name in names:
                try:
                    with open(os.path.join(folder, name), "rb") as file:
                        number += file.read(len(content)) == content
                except OSError:
                    continue
        return number

    def moments(self):
        """Conditions that hold from some moment of a restore on."""
        snapshot, table = self.snapshot, self.snapshot_table
        unpacked_table = os.path.join(self.root, "shared/data", PACKAGE + ".perm")
        yield lambda: os.path.exists(
            os.path.join(self.root, "shared/data", PACKAGE + "_download.zip"))
        yield lambda: os.path.exists(snapshot)
        for share in range(2):
            number = self.random.randrange(FILES * share // 2, FILES * (share + 1) // 2)
            yield lambda number=number: self.count("shared/data/quarn_tmp_rst_dir") > number
        yield lambda: os.path.exists(table)
        for share in range(2):
            number = self.random.randrange(FILES * share // 6, FILES * (share + 1) // 6)
            yield lambda number=number: os.path.exists(table) and self.count(
                "data", content=b"saved") > number
        yield lambda: os.path.exists(unpacked_table)
        yield lambda: os.path.exists(table) and self.random.random() < 0.02
        start = self.log_size()
        number = self.random.randrange(1, 4000)
        yield lambda: self.log_size() > start + number

    def leftovers(self):
        return [path for path in saved_tree(self.root)
                if "quarn_tmp_rst_dir" in path or path.endswith((".zip", ".perm"))]

    def test_the_tree_is_old_or_new_once_restore_mode_is_asked_for(self):
        killed = 0
        for moment in self.moments():
            self.reset()
            client = self.ask("app", "restore", PACKAGE)
            killed += self.kill_daemon_when(moment, client)
            # of another package
            self.device.quarnctl("restore", "on", "--from", SERIAL, "org.example.other")
            now = saved_tree(self.root)
            self.assertTrue(now in (self.present, self.restored),
                            self.hint + "\n" + self.difference(now))
            self.assertEqual(self.leftovers(), [], self.hint)
            self.device.quarnctl("restore", "off")
        self.assertGreater(killed, 0, self.hint)

    def test_the_package_is_restored_when_its_restore_is_asked_for_again(self):
        killed = 0
        for moment in list(self.moments())[1::2]:
            self.reset()
            client = self.ask("app", "restore", PACKAGE)
            killed += self.kill_daemon_when(moment, client)
            self.device.quarnctl("app", "restore", PACKAGE)
            now = saved_tree(self.root)
            self.assertTrue(now == self.restored, self.hint + "\n" + self.difference(now))
            self.assertEqual(self.leftovers(), [], self.hint)
        self.assertGreater(killed, 0, self.hint)

    def kill_half_way(self):
        """Leave the package with files of the archive beside its own."""
        self.reset()
        client = self.ask("app", "restore", PACKAGE)
        self.assertTrue(self.kill_daemon_when(
            lambda: (os.path.exists(self.snapshot_table)
                     and self.count("data", content=b"saved") > 5), client))
        self.assertNotIn(saved_tree(self.root), (self.present, self.restored))

    def test_whatever_starts_the_next_daemon_the_tree_is_the_old_one_again(self):
        self.kill_half_way()
        self.device.quarnctl("status")
        wait_until(lambda: not os.path.lexists(self.snapshot), "the snapshot is gone")
        self.assertEqual(self.leftovers(), [])
        now = saved_tree(self.root)
        self.assertTrue(now == self.present, self.difference(now))

    def test_the_device_recovers_without_an_account(self):
        self.kill_half_way()
        self.device.stop()
        self.device.set("account", "none")
        self.device.start()
        self.assertEqual(self.leftovers(), [])
        now = saved_tree(self.root)
        self.assertTrue(now == self.present, self.difference(now))

    def test_what_the_application_wrote_since_stays(self):
        self.kill_half_way()
        note = os.path.join(self.root, "data/folder3/file3")
        if os.path.exists(note):
            os.unlink(note)
        with open(note, "w") as file:
            file.write("newer than the restore")
        os.chown(note, 5000, 5000)
        before = {path: entry for path, entry in saved_tree(self.root).items()
                  if "quarn_tmp_rst_dir" not in path}
        self.device.stop()
        self.device.start()
        now = {path: entry for path, entry in saved_tree(self.root).items()
               if "quarn_tmp_rst_dir" not in path and not path.endswith((".zip", ".perm"))}
        before = {path: entry for path, entry in before.items()
                  if not path.endswith((".zip", ".perm"))}
        self.assertEqual(now, before)
        self.assertGreater(self.count("shared/data/quarn_tmp_rst_dir"), FILES // 2)
        self.device.quarnctl("app", "restore", PACKAGE)
        self.assertEqual(self.leftovers(), [])

    def test_a_backup_packs_a_half_restored_package_as_it_was_before_the_restore(self):
        self.kill_half_way()
        self.device.quarnctl("backup", "--yes")
        self.assertEqual(saved_tree(self.root), self.present)
        archive = os.path.join(self.device.cloud, SERIAL, PACKAGE, "1.0.0", PACKAGE + ".zip")
        with zipfile.ZipFile(archive) as packed:
            for path, (content, *_) in self.present.items():
                if content is not None:
                    self.assertEqual(packed.read(path), content, path)

    def difference(self, now):
        lines = []
        for name, wanted in (("present", self.present), ("restored", self.restored)):
            differing = sorted(path for path in set(now) | set(wanted)
                               if now.get(path) != wanted.get(path))
            lines.append("%d differ from %s: %s" % (len(differing), name, differing[:5]))
        return "\n".join(lines)


if __name__ == "__main__":
    unittest.main()
