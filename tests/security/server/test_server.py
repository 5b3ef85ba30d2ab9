"""What a hostile server, or a hostile phone, can do by what it sends: lists, bodies, archives."""
import io
import json
import os
import sys
import unittest
import zipfile

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path[:0] = [HERE, os.path.join(HERE, "../../integration"), os.path.join(HERE, "../../integration/bus")]
from bus_client import Client, GLib  # noqa: E402
from hostile_cloud import HostileCloud  # noqa: E402
from quarn_test import TestCase, is_sanitized, make_source, tree, wait_until  # noqa: E402

PACKAGE = "org.example.notes"
COMPANION = "com.velmor.pellix-efl"
SERIAL = "350000000000001"
LIST = "/app_list/app_list.txt"
ARCHIVE = "/%s/%s/1.0/%s.zip" % (SERIAL, PACKAGE, PACKAGE)
TABLE = "shared/data/%s.perm" % PACKAGE
ATTRIBUTES = {"0": 420, "1": 5000, "2": 5000, "3": PACKAGE}

UNREADABLE = 31
TRANSFER_FAILED = 12
CANCELLED = 17
#: Bytes that an attack may take beside what the daemon has at rest.
MOST_MEMORY = 8 << 20
#: The same where the largest list there may be is taken apart and written anew.
MOST_LIST_MEMORY = 40 << 20
#: Bytes of the log that one attack may fill.
MOST_LOG = 256 << 10


def number(pid, field):
    with open("/proc/%d/status" % pid) as file:
        return next(int(line.split()[1]) * 1024 for line in file if line.startswith(field + ":"))


def archive(entries, table=None):
    """A zip of these (name, content), and of a table: a text, or of the entries' attributes."""
    if table is None:
        folders = {name.rpartition("/")[0] for name, _ in entries}
        names = [name for name, _ in entries] + sorted(folders)
        table = json.dumps({"quarn_symbolic_info": [], **{name: ATTRIBUTES for name in names}})
    data = io.BytesIO()
    with zipfile.ZipFile(data, "w", zipfile.ZIP_DEFLATED) as made:
        for name, content in entries:
            made.writestr(name, content)
        if table:
            made.writestr(TABLE, table)
    return data.getvalue()


def hostile_archives():
    """Name and archive of each that is refused whole."""
    good = [("data/new", b"planted")]
    yield "deep", archive(good + [("data" + "/d" * 30000 + "/a", b"")])
    yield "deep folder", archive(good + [("data" + "/d" * 30000 + "/", b"")])
    yield "table of 50 MiB", archive(good, "{" + " " * (50 << 20) + "}")
    yield "table of one text", archive(good, '{"a": "' + "x" * (30 << 20) + '"}')
    yield "table of millions of members", archive(good, "{" + '"":{},' * 3000000 + '"":{}}')
    yield "table of millions of values", archive(good, '{"a":[' + "0," * 5000000 + "0]}")
    yield "table of a million links", archive(
        good, '{"quarn_symbolic_info":[' + "{}," * 1000000 + "{}]}")
    yield "table of brackets", archive(good, '{"a":' + "[" * (20 << 20))


class ServerTest(TestCase):
    def setUp(self):
        self.cloud = HostileCloud()
        self.addCleanup(self.cloud.close)
        self.device = self.new_device(serial=SERIAL)
        self.device.call("set", "cloud", self.cloud.url, "--user", "ada", input="secret\n")
        self.device.install(make_source(self.path("notes"), PACKAGE, "1.0",
                                        {"data/old": b"old", "shared/data/kept": b"kept"}))
        self.device.start()
        self.client = Client(self.device.bus_address())
        self.addCleanup(self.client.close)
        # A package that never comes keeps the daemon, which would end with the last restore.
        keeper = Client(self.device.bus_address())
        self.addCleanup(keeper.close)
        self.assertEqual(keeper.call("restore_enable", GLib.Variant(
            "(iissu)", (1, 0, SERIAL, '["org.example.absent"]', 1))), (0,))
        self.count = 0
        # the session, the HTTP library and an ordinary restore are there by now
        self.cloud.put(LIST, b"{}")
        self.cloud.put(ARCHIVE, archive([("data/old", b"old"), ("shared/data/kept", b"kept")]))
        self.assertEqual(self.list(), (0, "{}"))
        self.assertEqual(self.restore(), 0)
        self.pid = self.device.daemon_pid()
        self.memory = number(self.pid, "VmHWM")
        self.before = self.tree()
        self.log = len(self.device.log())

    def ask(self, method, callback, types, *arguments):
        self.count += 1
        call = self.client.start(method, GLib.Variant(types, (*arguments, self.count)))
        asked = self.count
        return call, lambda: next((one for name, one in self.client.callbacks(callback)
                                   if one[2] == asked), None)

    def list(self):
        _, answer = self.ask("get_app_list", "get_app_list_cb", "(iu)", 0)
        self.client.until(answer, "the list")
        return answer()[:2]

    def start_restore(self):
        return self.ask("app_data_restore_start", "app_data_restore_complete", "(su)", PACKAGE)[1]

    def restore(self):
        answer = self.start_restore()
        self.client.until(answer, "the restore", 300)
        return answer()[0]

    def tree(self):
        """Everything of the application: its name, kind, owner, mode and content."""
        return tree(self.device.app_path(PACKAGE))

    def assert_unharmed(self, memory=MOST_MEMORY):
        self.assertEqual(self.device.daemon_pid(), self.pid, "the daemon is another one")
        if not is_sanitized():
            self.assertLess(number(self.pid, "VmHWM") - self.memory, memory)
        self.assertLess(len(self.device.log()) - self.log, MOST_LOG)
        self.assertEqual(self.tree(), self.before)


class Lists(ServerTest):
    def refused(self, content):
        self.cloud.put(LIST, content)
        self.assertEqual(self.list(), (1, "none"))
        self.assert_unharmed()

    def test_46_mib(self):
        self.refused(b'{"a": "' + b"x" * (46 << 20) + b'"}')

    def test_more_than_a_message_of_the_bus_holds(self):
        self.refused(self.cloud.announced(200 << 20))
        endless = self.cloud.endless()
        self.refused(endless)
        wait_until(endless.ended.is_set, "the connection ends")

    def test_no_text(self):
        self.refused(b"\xff" * (4 << 20))

    def test_one_that_forges_lines_of_the_log(self):
        forged = "\nE/QUARND(1): forged \x1b[2J" + "y" * 1000
        self.cloud.put(LIST, forged.encode())
        self.assertEqual(self.list(), (0, forged))
        line = [line for line in self.device.log().splitlines() if "app list : " in line][-1]
        self.assertIn("\\nE/QUARND(1): forged \\x1b[2Jyyyy", line)
        self.assertTrue(line.endswith("y..."))
        self.assertLess(line.count("y"), 256)
        self.assert_unharmed()

    def backup(self):
        self.ask("manual_backup_start", None, "(u)")
        self.client.until(lambda: [one for _, one in self.client.callbacks("manual_backup_status")
                                   if one[1] != 2 and one[2] == self.count],
                          "the end of the backup")
        return self.client.callbacks("manual_backup_status")[-1][1][:2]

    def test_the_run_of_a_backup_is_as_careful(self):
        self.cloud.put(LIST, self.cloud.endless())
        self.assertEqual(self.backup(), (13, 5))
        self.assert_unharmed()

    def test_a_run_takes_no_memory_for_a_million_values(self):
        objects = b"[" + b"{}," * 1300000 + b"{}]"
        own = b'{"backup_info":{"serial_number":"%s"},%%s}' % SERIAL.encode()
        for entries in (b"0," * 2000000 + b"0", b'{"a":%s}' % objects, own % (b'"a":' + objects),
                        own % (b'"pkg_list":' + objects), own % (b'"pkg_list":[%s]' % objects)):
            self.cloud.put(LIST, b'{"format_ver":1,"model_list":[%s]}' % entries)
            self.assertEqual(self.backup(), (12, 5))
            self.device.wait_for_log("json token error")
            self.assert_unharmed(MOST_LIST_MEMORY)


class Downloads(ServerTest):
    def test_a_body_of_4_gib(self):
        for body in (self.cloud.announced(4 << 30), self.cloud.endless()):
            self.cloud.put(ARCHIVE, body)
            self.assertEqual(self.restore(), TRANSFER_FAILED)
            wait_until(body.ended.is_set, "the connection ends")
            self.assertLess(body.sent, 512 << 20)
            self.assert_unharmed()

    def test_a_restore_ends_with_what_its_caller_withdraws(self):
        body = self.cloud.trickle()
        self.cloud.put(ARCHIVE, body)
        answer = self.start_restore()
        wait_until(body.begun.is_set, "the download")
        self.assertEqual(self.client.call("CancelOwn", path="/org/orvane/Quarn/Packages",
                                          interface="org.orvane.Quarn.Packages"), (1,))
        self.client.until(answer, "the end of the restore")
        self.assertEqual(answer()[0], CANCELLED)
        wait_until(body.ended.is_set, "the connection ends")
        self.assertTrue(body.left)
        self.device.wait_for_log("restore of (%s) was cancelled" % PACKAGE)
        self.assert_unharmed()

    def test_a_list_ends_with_what_its_caller_withdraws(self):
        body = self.cloud.trickle()
        self.cloud.put(LIST, body)
        _, answer = self.ask("get_app_list", "get_app_list_cb", "(iu)", 0)
        wait_until(body.begun.is_set, "the download")
        self.assertEqual(self.client.call("CancelOwn", path="/org/orvane/Quarn/Packages",
                                          interface="org.orvane.Quarn.Packages"), (1,))
        self.client.until(answer, "the end of the request")
        self.assertEqual(answer()[:2], (CANCELLED, "failed"))
        wait_until(body.ended.is_set, "the connection ends")
        self.assert_unharmed()

    def test_nobody_elses_transfer_ends_with_it(self):
        body = self.cloud.trickle()
        self.cloud.put(ARCHIVE, body)
        answer = self.start_restore()
        wait_until(body.begun.is_set, "the download")
        other = Client(self.device.bus_address())
        self.addCleanup(other.close)
        self.assertEqual(other.call("CancelOwn", path="/org/orvane/Quarn/Packages",
                                    interface="org.orvane.Quarn.Packages"), (0,))
        sent = body.sent
        wait_until(lambda: body.sent > sent, "it goes on")
        self.assertIsNone(answer())

    def test_the_daemon_ends_in_the_middle_of_one(self):
        body = self.cloud.trickle()
        self.cloud.put(ARCHIVE, body)
        answer = self.start_restore()
        wait_until(body.begun.is_set, "the download")
        os.kill(self.pid, 15)
        self.client.until(answer, "the end of the restore")
        self.assertEqual(answer()[0], CANCELLED)
        wait_until(body.ended.is_set, "the connection ends")
        self.device.wait_for_daemon_end()
        self.assertEqual(self.tree(), self.before)


class Archives(ServerTest):
    def test_from_the_cloud(self):
        for name, content in hostile_archives():
            with self.subTest(name):
                self.cloud.put(ARCHIVE, content)
                self.assertEqual(self.restore(), UNREADABLE)
                self.assert_unharmed()

    def test_from_the_companion(self):
        self.device.install(make_source(self.path("companion"), COMPANION, "1.0", {"data/x": b""}))
        place = self.device.app_path(COMPANION, "shared/data/%s_1.0.zip" % PACKAGE)
        self.assertEqual(self.client.call("restore_enable", GLib.Variant(
            "(iissu)", (1, 1, "", '["org.example.absent"]', 1000))), (0,))
        for name, content in hostile_archives():
            with self.subTest(name):
                with open(place, "wb") as file:
                    file.write(content)
                self.assertEqual(self.restore(), UNREADABLE)
                self.assert_unharmed()
        for table in ("not json", "{", '{"a": tru}', ""):
            with self.subTest(table=table):
                with open(place, "wb") as file:
                    file.write(archive([("data/new", b"planted")], table))
                self.assertEqual(self.restore(), 0)
                self.assert_unharmed()


if __name__ == "__main__":
    unittest.main()
