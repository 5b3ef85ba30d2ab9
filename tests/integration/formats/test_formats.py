"""docs/formats.md shows what is there: each of its examples is made here and compared.

With QUARN_FORMATS_WRITE=1 the examples in the page are replaced by what was made.
"""
import json
import os
import re
import stat
import sys
import unittest
import zipfile
import zlib

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), "../bus"))
from bus_client import Client, Gio  # noqa: E402
from quarn_test import TestCase, make_source, read_bytes, read_file, read_text  # noqa: E402

PAGE = os.path.join(os.path.dirname(os.path.abspath(__file__)), "../../../docs/formats.md")
SERIAL = "350000000000001"
PACKAGE = "org.example.notes"
FILES = {
    "data/db/notes.db": (b"first note\n", 0o600),
    "data/current": ("->", "db/notes.db"),
    "shared/data/list.txt": (b"for others\n", 0o644),
    "shared/trusted/key": (b"0123456789abcdef", 0o4711),
}
#: Times differ from run to run; everything else has to be what the page says.
TIMES = {"timestamp": 1795347393638, "last_time": 1795347393671, "due_ms": 1795390593547}


def example(name):
    """The pattern of one example in the page: its head, its text and its end."""
    return re.compile(r"(<!-- example: %s -->\n```\w*\n)(.*?)(```\n)" % name, re.S)


def tree_lines(root):
    """What the page shows of an application: path, mode, size or target."""
    lines = []
    for top in ("data", "shared"):
        paths = [top]
        for folder, folders, names in os.walk(os.path.join(root, top)):
            paths += [os.path.relpath(os.path.join(folder, name), root)
                      for name in folders + names]
        for path in sorted(paths):
            status = os.lstat(os.path.join(root, path))
            mode = "%04o" % stat.S_IMODE(status.st_mode)
            if stat.S_ISLNK(status.st_mode):
                lines.append("%-25s -> %s" % (path, os.readlink(os.path.join(root, path))))
            elif stat.S_ISDIR(status.st_mode):
                lines.append("%-25s %s" % (path + "/", mode))
            else:
                lines.append("%-25s %s  %d bytes" % (path, mode, status.st_size))
    return "\n".join(lines) + "\n"


class Formats(TestCase):
    def setUp(self):
        self.device = self.new_device(serial=SERIAL, model="Orvane One")
        self.device.start()
        source = make_source(self.path("notes"), PACKAGE, "1.0.0", FILES)
        os.mkdir(os.path.join(source, "data/empty"))
        self.device.install(source)
        self.archive = os.path.join(self.device.cloud, SERIAL, PACKAGE, "1.0.0", PACKAGE + ".zip")

    def assert_shown(self, name, made):
        text = read_text(PAGE)
        found = example(name).search(text)
        self.assertIsNotNone(found, "docs/formats.md has no example " + name)
        if os.environ.get("QUARN_FORMATS_WRITE"):
            with open(PAGE, "w") as page:
                page.write(text[:found.start(2)] + made + text[found.end(2):])
        else:
            self.assertEqual(found.group(2), made, "docs/formats.md, example " + name)

    def read_archive(self, name):
        with zipfile.ZipFile(self.archive) as archive:
            return archive.read(name)

    def test_application(self):
        self.assert_shown("application", tree_lines(self.device.app_path(PACKAGE)))

    def test_cloud(self):
        self.device.quarnctl("backup", "--yes")
        names = [os.path.relpath(os.path.join(folder, name), self.device.cloud)
                 for folder, _, names in os.walk(self.device.cloud) for name in names
                 if not name.startswith(".")]
        self.assert_shown("cloud", "".join(name + "\n" for name in sorted(names, reverse=True)))

    def test_list(self):
        self.device.quarnctl("backup", "--yes")
        text = read_file(os.path.join(self.device.cloud, "app_list/app_list.txt"))
        made = json.loads(text)
        package = made["model_list"][0]["pkg_list"][0]
        crc = zlib.crc32(read_bytes(self.archive))
        self.assertEqual(package["crc"] % (1 << 32), crc)
        info = made["model_list"][0]["backup_info"]
        self.assertGreater(info["timestamp"], 1600000000000)
        info["timestamp"] = TIMES["timestamp"]
        self.assert_shown("list", json.dumps(made, indent=2) + "\n")

    def test_archive(self):
        self.device.quarnctl("backup", "--yes")
        lines = []
        with zipfile.ZipFile(self.archive) as archive:
            for entry in archive.infolist():
                self.assertEqual((entry.date_time, entry.external_attr, entry.extra, entry.comment),
                                 ((1980, 0, 0, 0, 0, 0), 0, b"", b""))
                lines.append("%-39s method %d  flags 0x%04x  %s\n" % (
                    entry.filename, entry.compress_type, entry.flag_bits,
                    "the table" if entry.filename.endswith(".perm")
                    else "%d bytes" % entry.file_size))
        self.assert_shown("archive", "".join(lines))

    def test_table(self):
        self.device.quarnctl("backup", "--yes")
        table = json.loads(self.read_archive("shared/data/%s.perm" % PACKAGE))
        self.assert_shown("table", json.dumps(table, indent=2) + "\n")

    def test_the_same_data_makes_the_same_bytes_whatever_its_times(self):
        self.device.quarnctl("backup", "--yes")
        first = read_bytes(self.archive)
        os.utime(self.device.app_path(PACKAGE, "data/db/notes.db"), (1, 1))
        os.unlink(self.archive)
        self.device.quarnctl("app", "backup", PACKAGE)
        self.assertEqual(read_bytes(self.archive), first)

    def test_state(self):
        self.device.quarnctl("backup", "--yes")
        self.device.stop()
        state = os.path.join(self.device.path, "state")
        lines = []
        for name in ("settings.ini", "alarms.ini", "events.ini", "packages/%s.ini" % PACKAGE):
            text = read_text(os.path.join(state, name)).strip()
            for key, value in TIMES.items():
                text = re.sub(r"(?m)^(.*%s)=1\d{12}$" % key, r"\1=%d" % value, text)
            lines.append("# state/%s\n%s\n" % (name, text))
        self.assert_shown("state", "\n".join(lines))

    def test_progress(self):
        client = Client(self.device.bus_address(), with_object=False)
        self.addCleanup(client.close)
        events = []
        client.connection.signal_subscribe(
            None, "org.orvane.Quarn", "progress", "/progress", None, Gio.DBusSignalFlags.NONE,
            lambda *arguments: events.append(json.loads(arguments[5].unpack()[0])))
        client.bus("GetId", None)  # by its answer the bus knows what is listened to
        self.device.quarnctl("backup", "--yes")
        client.until(lambda: events and events[-1]["stage"] == "finished", "the last event")
        settled = [event for event in events if "outcome" in event] + [events[-1]]
        self.assertEqual(settled[0]["size"], os.path.getsize(self.archive))
        self.assert_shown("progress", "".join(json.dumps(event, separators=(",", ":")) + "\n"
                                              for event in settled))


if __name__ == "__main__":
    unittest.main(verbosity=2)
