"""What applications write themselves is backed up and comes back, as if a kernel had labelled it."""
import json
import os
import stat
import subprocess
import sys
import unittest
import zipfile

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
from quarn_test import TestCase, make_source, run_contained, tree  # noqa: E402

PACKAGE = "org.example.notes"
FOLDERS = ("data", "shared/data", "shared/trusted")
AS_APPLICATION = ("setpriv", "--reuid=5000", "--regid=5000", "--clear-groups")

#: What a newcomer's application does: new files and folders, links, renames, all kinds of modes.
WRITE = r"""
set -eu
cd /opt/usr/apps/org.example.notes
umask 022
mkdir -p data/notes/2026
printf 'my first note' > data/notes/2026/first
printf 'secret' > data/notes/2026/private
chmod 600 data/notes/2026/private
ln -s first data/notes/2026/latest
ln -s /nowhere/at/all data/dangling
printf 'draft' > data/notes/draft.tmp
mv data/notes/draft.tmp data/notes/draft
printf 'written anew' > data/installed.new
mv data/installed.new data/installed
mv shared/data/help shared/data/help.old
cp shared/data/help.old shared/data/help
mkdir shared/data/before
printf 'x' > shared/data/before/file
mv shared/data/before shared/data/after
printf 'trusted' > shared/trusted/key
chmod 440 shared/trusted/key
mkdir -m 700 shared/trusted/closed
printf 'c' > shared/trusted/closed/content
"""


class MadeByTheApplication(TestCase):
    def setUp(self):
        self.source = make_source(self.path("source"), PACKAGE, "1.0.0",
                                  {"data/installed": b"came with the package",
                                   "shared/data/help": b"help"})
        self.device = self.new_device(serial="350000000000001")
        for path in (self.directory, self.device.path):
            os.chmod(path, 0o755)
        self.device.start()
        self.device.install(self.source)

    def as_application(self, script):
        self.device.exec(*AS_APPLICATION, "sh", "-c", script, cwd="/")

    def tree(self):
        """All files and folders below the data folders, without the links."""
        return {path: entry for path, entry in tree(self.device.app_path(PACKAGE), FOLDERS).items()
                if not stat.S_ISLNK(entry[1])}

    def assert_restored(self, written, before):
        """All that was backed up is there again, and of what is beside it nothing has changed."""
        restored = self.tree()
        self.assertEqual({path: restored.get(path) for path in written}, written)
        for path in set(restored) - set(written):
            self.assertEqual(restored[path], before.get(path), path)

    def labels_recorded(self):
        """The labels in the archive's table, of files and of links."""
        archive = os.path.join(self.device.cloud, "350000000000001", PACKAGE, "1.0.0",
                               PACKAGE + ".zip")
        table = self.json_of(archive)
        links = {link["real_name"]: link["perm"]["3"] for link in table.pop("quarn_symbolic_info")}
        return {key: value["3"] for key, value in table.items()}, links

    @staticmethod
    def json_of(archive):
        with zipfile.ZipFile(archive) as content:
            return json.loads(content.read("shared/data/%s.perm" % PACKAGE))

    def test_a_first_note_is_back_after_the_package_was_removed(self):
        self.as_application(WRITE)
        written = self.tree()
        self.device.quarnctl("backup")
        self.device.remove(PACKAGE)
        self.device.install(self.source)
        fresh = self.tree()
        self.assertNotIn("data/notes/2026/first", fresh)
        self.device.quarnctl("app", "restore", PACKAGE)
        self.assert_restored(written, fresh)

    def test_what_is_recorded_is_the_packages_label(self):
        self.as_application(WRITE)
        self.device.quarnctl("backup")
        files, links = self.labels_recorded()
        self.assertEqual(set(files.values()), {PACKAGE}, files)
        self.assertIn("data/notes/2026/first", files)
        # Where labels are user attributes, a link cannot have one.
        labelled = os.environ.get("QUARN_TEST_LINKS_LABELLED", "1") == "1"
        self.assertEqual(links, dict.fromkeys(("data/notes/2026/latest", "data/dangling"),
                                              PACKAGE if labelled else "_"))

    def test_a_backup_comes_back_over_newer_data(self):
        self.as_application(WRITE)
        written = self.tree()
        self.device.quarnctl("app", "backup", PACKAGE)
        self.as_application("""set -eu
            cd /opt/usr/apps/org.example.notes/data
            printf 'changed' > notes/2026/first
            rm notes/draft
            printf 'newer' > notes/new && mv notes/new notes/2026/private""")
        newer = self.tree()
        self.device.quarnctl("app", "restore", PACKAGE)
        self.assert_restored(written, newer)

    def test_data_that_a_restore_refuses_stays_as_the_application_wrote_it(self):
        self.as_application(WRITE)
        self.device.quarnctl("app", "backup", PACKAGE)
        self.as_application("""set -eu
            cd /opt/usr/apps/org.example.notes/data
            printf 'changed' > notes/2026/first
            mkdir later && printf 'not in the backup' > later/file""")
        newer = self.tree()
        result = self.device.quarnctl("app", "restore", PACKAGE, check=False)
        self.assertEqual(result.returncode, 36, result.stdout + result.stderr)
        self.assertEqual(self.tree(), newer)

    def test_an_archive_with_the_floor_label_is_replaced_by_the_next_backup(self):
        """As a device recorded them that knew no label of what applications make."""
        self.as_application(WRITE)
        written = self.tree()
        paths = [self.device.app_path(PACKAGE, path) for path in written]
        labelled = os.environ.get("QUARN_TEST_LINKS_LABELLED", "1") == "1"
        attribute = "security.SMACK64" if labelled else "user.quarn.SMACK64"
        for path in paths:
            os.setxattr(path, attribute, b"_")
        self.device.quarnctl("backup")
        self.assertEqual(set(self.labels_recorded()[0].values()), {"_"})
        # No package may have that label from an archive: on a kernel that labels it is root's.
        result = self.device.quarnctl("app", "restore", PACKAGE, check=False)
        self.assertEqual(result.returncode, 36, result.stdout + result.stderr)
        self.assertEqual(self.tree(), written)
        for path in paths:
            os.removexattr(path, attribute)
        self.device.quarnctl("backup")
        self.assertEqual(set(self.labels_recorded()[0].values()), {PACKAGE})
        self.device.quarnctl("app", "restore", PACKAGE)
        self.assertEqual(self.tree(), written)

    def test_a_second_backup_of_the_same_files_changes_nothing(self):
        self.as_application(WRITE)
        self.device.quarnctl("backup")
        sent = "request upload for (%s)" % PACKAGE
        self.assertEqual(self.device.log().count(sent), 1)
        self.device.quarnctl("backup")
        self.assertEqual(self.device.log().count(sent), 1)

    def test_what_an_update_finds_is_backed_up_too(self):
        self.as_application(WRITE)
        self.device.install(make_source(self.path("second"), PACKAGE, "2.0.0",
                                        {"data/installed": b"of the second version"}))
        written = self.tree()
        self.device.quarnctl("backup")
        self.device.remove(PACKAGE)
        self.device.install(self.path("second"))
        fresh = self.tree()
        self.device.quarnctl("app", "restore", PACKAGE)
        self.assert_restored(written, fresh)

    def test_restore_mode_brings_the_notes_back_on_installation(self):
        self.as_application(WRITE)
        written = self.tree()
        self.device.quarnctl("backup")
        self.device.remove(PACKAGE)
        bare = make_source(self.path("bare"), PACKAGE, "1.0.0", {})
        watcher = self.device.begin("quarnctl", "restore", "on", "--from", "350000000000001",
                                    PACKAGE, "--watch", stdout=subprocess.PIPE, text=True)
        try:
            for line in watcher.stdout:
                if "restore mode" in line.lower():
                    break
            self.device.install(bare)
            shown = watcher.communicate(timeout=60)[0]
        finally:
            watcher.kill()
            watcher.communicate()
        self.assertEqual(watcher.returncode, 0, shown)
        self.assertEqual(self.tree(), written)


class Contained(TestCase):
    """The same where neither mount namespaces nor the kernel's own attribute are permitted."""

    def test_everything_comes_back_there_too(self):
        result = run_contained(
            [sys.executable, "-B", os.path.abspath(__file__), "MadeByTheApplication"],
            env={**os.environ, "TMPDIR": "/tmp", "QUARN_TEST_LINKS_LABELLED": "0"},
            capture_output=True, text=True)
        self.assertEqual(result.returncode, 0, result.stdout + result.stderr)


if __name__ == "__main__":
    unittest.main(verbosity=2)
