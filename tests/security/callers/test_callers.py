"""An application, a stranger and a client that never answers, against everybody else's daemon."""
import os
import signal
import subprocess
import sys
import time
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, "../../integration"))
sys.path.insert(0, os.path.join(HERE, "../../integration/bus"))
from bus_client import INTERFACE, NAME, PATH, Client, request  # noqa: E402
from gi.repository import GLib  # noqa: E402
from quarn_test import (  # noqa: E402
    APPLICATION, TestCase, is_sanitized, make_source, read_bytes, wait_until)

STRANGER = 65534
NOTES = "org.example.notes"
COMPANION = "com.velmor.pellix-efl"
STATUS = "/org/orvane/Quarn/Status"
PACKAGES = "/org/orvane/Quarn/Packages"
DENIED = "org.freedesktop.DBus.Error.AccessDenied"
INVALID = "org.freedesktop.DBus.Error.InvalidArgs"
MEMORY_LIMIT_KB = 20480
#: Bytes of the largest message.
LARGEST = 20000000
#: Seconds that unanswered callbacks may hold up another client's run, and what a slow machine adds.
HOLD_UP = 60
SLOWNESS = 45

#: Makes each call of its arguments, (path, interface, method, arguments as text), from a connection
#: of its own, as the user that runs it, and prints the name of the error that each ends with.
CALLER = """
import ast, sys
import gi
gi.require_version("Gio", "2.0")
from gi.repository import Gio, GLib
for path, interface, method, arguments in ast.literal_eval(sys.argv[3]):
    bus = Gio.DBusConnection.new_for_address_sync(
        sys.argv[1], Gio.DBusConnectionFlags.AUTHENTICATION_CLIENT |
        Gio.DBusConnectionFlags.MESSAGE_BUS_CONNECTION, None, None)
    try:
        bus.call_sync(sys.argv[2], path, interface, method,
                      GLib.Variant.parse(None, arguments, None, None), None,
                      Gio.DBusCallFlags.NONE, 60000, None)
        print(method, "answered")
    except GLib.Error as error:
        print(method, Gio.dbus_error_get_remote_error(error))
"""

#: Sends so many calls that want no answer, as fast as the bus takes them, with descriptors.
FLOOD = """
import os, sys
import gi
gi.require_version("Gio", "2.0")
from gi.repository import Gio, GLib
address, name, calls, size, descriptors = sys.argv[1:3] + [int(each) for each in sys.argv[3:]]
bus = Gio.DBusConnection.new_for_address_sync(
    address, Gio.DBusConnectionFlags.AUTHENTICATION_CLIENT |
    Gio.DBusConnectionFlags.MESSAGE_BUS_CONNECTION, None, None)
null = os.open("/dev/null", os.O_RDONLY)
for number in range(calls):
    call = Gio.DBusMessage.new_method_call(name, "/org/orvane/Quarn/GDBus", "org.orvane.Quarn",
                                           "make_app_data")
    call.set_flags(Gio.DBusMessageFlags.NO_REPLY_EXPECTED)
    call.set_body(GLib.Variant("(s)", ("a" * size,)))
    if descriptors:
        brought = Gio.UnixFDList.new()
        for _ in range(descriptors):
            brought.append(null)
        call.set_unix_fd_list(brought)
    bus.send_message(call, Gio.DBusSendMessageFlags.NONE)
    if number % 500 == 499:
        bus.flush_sync(None)
bus.call_sync("org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus", "GetId",
              None, None, Gio.DBusCallFlags.NONE, 60000, None)
"""

#: What an application or a stranger would like to have.
WISHES = [
    (PATH, INTERFACE, "make_app_data", "('%s',)" % NOTES),
    (PATH, INTERFACE, "app_data_backup_start", "('%s', uint32 1)" % NOTES),
    (PATH, INTERFACE, "app_data_restore_start", "('%s', uint32 1)" % NOTES),
    (PATH, INTERFACE, "get_app_list", "(1, uint32 1)"),
    (PATH, INTERFACE, "get_app_list", "(0, uint32 1)"),
    (PATH, INTERFACE, "restore_enable", "(1, 0, '35', '[\"%s\"]', uint32 1)" % NOTES),
    (PATH, INTERFACE, "restore_enable", "(0, 0, '', '', uint32 1)"),
    (PATH, INTERFACE, "backup_enable", "(0,)"),
    (PATH, INTERFACE, "set_activation", "(0,)"),
    (PATH, INTERFACE, "last_bu_time", "()"),
    (PATH, INTERFACE, "manual_backup_start", "(uint32 1,)"),
    (PATH, INTERFACE, "manual_backup_cancel", "(uint32 1,)"),
    (PATH, INTERFACE, "auto_backup_start", "('',)"),
    (PATH, INTERFACE, "fly", "()"),
    (PATH, INTERFACE, "set_activation", "()"),
    (PACKAGES, INTERFACE + ".Packages", "CancelOwn", "()"),
    (STATUS, "org.freedesktop.DBus.Properties", "GetAll", "('%s.Status',)" % INTERFACE),
    (STATUS, "org.freedesktop.DBus.Properties", "Get", "('%s.Status', 'SerialNumber')" % INTERFACE),
    (STATUS, "org.freedesktop.DBus.Properties", "Get", "('%s.CleanUp', 'KeptPackages')" % INTERFACE),
    (STATUS, "org.freedesktop.DBus.Introspectable", "Introspect", "()"),
    (PATH, "org.freedesktop.DBus.Peer", "Ping", "()")]


class Attack(TestCase):
    def setUp(self):
        self.device = self.new_device(serial="350000000000001")
        for path in (self.directory, self.device.path):
            os.chmod(path, 0o755)
        self.device.start()
        self.clients = []
        self.device.install(make_source(self.path(NOTES), NOTES, "1.0.0", {"data/note": b"mine"}))

    def tearDown(self):
        for client in self.clients:
            if not client.connection.is_closed():
                client.close()

    def new_client(self, mute=False):
        client = Client(self.device.bus_address())
        client.hold = lambda method, arguments: mute
        self.clients.append(client)
        return client

    def refused(self, user, wishes=None, destination=NAME):
        """What each wish of that user ends with."""
        result = subprocess.run(
            [sys.executable, "-c", CALLER, self.device.bus_address(), destination,
             repr(wishes or WISHES)], capture_output=True, text=True, user=user, group=user,
            extra_groups=[])
        self.assertEqual(result.stderr, "")
        return [line.split(" ", 1) for line in result.stdout.splitlines()]


class Outsiders(Attack):
    def test_have_none_of_their_wishes(self):
        self.device.setting("db/private/quarn/backup_status", "1")
        self.device.install(make_source(self.path(COMPANION), COMPANION, "1.0.0", {}))
        self.device.quarnctl("backup")
        for user in (APPLICATION, STRANGER):
            self.assertEqual(self.refused(user), [[wish[2], DENIED] for wish in WISHES])
        self.assertEqual(self.device.setting("db/private/quarn/backup_status"), "1")
        self.assertFalse(os.path.exists(os.path.join(self.device.path, "root/tmp",
                                                     NOTES + "_tmp.zip")))
        self.assertEqual(os.listdir(self.device.app_path(COMPANION, "shared/data")), [])
        self.assertEqual(read_bytes(self.device.app_path(NOTES, "data/note")), b"mine")

    def test_nor_by_the_name_of_the_daemons_own_connection(self):
        client = self.new_client()
        client.call("last_bu_time")
        owner = client.owner()
        for user in (APPLICATION, STRANGER):
            self.assertEqual(self.refused(user, destination=owner),
                             [[wish[2], DENIED] for wish in WISHES])

    def test_do_not_keep_root_from_being_served(self):
        client = self.new_client()
        client.call("last_bu_time")
        flood = [subprocess.Popen(
            [sys.executable, "-c", CALLER, self.device.bus_address(), NAME, repr(WISHES * 40)],
            stdout=subprocess.DEVNULL, user=APPLICATION, group=APPLICATION, extra_groups=[])
            for _ in range(2)]
        served = 0
        while any(process.poll() is None for process in flood):
            client.call("last_bu_time")
            served += 1
        self.assertGreater(served, 10)
        self.assertEqual([process.wait() for process in flood], [0, 0])
        if not is_sanitized():
            self.assertLess(self.device.daemon_memory_kb(), MEMORY_LIMIT_KB)


#: Calls that want no answer, of which the bus lets any number wait.
SHOUTER = """
import sys
from gi.repository import Gio, GLib
flags = Gio.DBusConnectionFlags
bus = Gio.DBusConnection.new_for_address_sync(
    sys.argv[1], flags.AUTHENTICATION_CLIENT | flags.MESSAGE_BUS_CONNECTION, None, None)
for _ in range(20000):
    call = Gio.DBusMessage.new_method_call(
        sys.argv[2], "/org/orvane/Quarn/GDBus", "org.orvane.Quarn", "make_app_data")
    call.set_body(GLib.Variant("(s)", ("a" * 4000,)))
    call.set_flags(Gio.DBusMessageFlags.NO_REPLY_EXPECTED)
    bus.send_message(call, Gio.DBusSendMessageFlags.NONE)
bus.flush_sync(None)
"""
#: Bytes of the log that the refusals of one user may fill, other calls' lines included.
MOST_LOG = 512 << 10


class Shouting(Attack):
    def test_takes_neither_memory_nor_the_log(self):
        client = self.new_client()
        client.call("last_bu_time")
        before = len(self.device.log())
        shouters = [subprocess.Popen(
            [sys.executable, "-c", SHOUTER, self.device.bus_address(), NAME],
            user=APPLICATION, group=APPLICATION, extra_groups=[]) for _ in range(2)]
        most = 0
        while any(process.poll() is None for process in shouters):
            client.call("last_bu_time")
            most = max(most, self.device.daemon_memory_kb())
        self.assertEqual([process.wait() for process in shouters], [0, 0])
        client.call("last_bu_time")
        self.assertLess(len(self.device.log()) - before, MOST_LOG)
        if not is_sanitized():
            self.assertLess(max(most, self.device.daemon_memory_kb()), MEMORY_LIMIT_KB)


class Floods(Attack):
    """Calls that are refused, faster than they can be."""

    def flood(self, connections, calls, size, descriptors):
        """The most descriptors that the daemon was seen to have."""
        client = self.new_client()
        client.call("last_bu_time")
        daemon = self.device.daemon_pid()
        senders = [subprocess.Popen(
            [sys.executable, "-c", FLOOD, self.device.bus_address(), NAME, str(calls), str(size),
             str(descriptors)], user=APPLICATION, group=APPLICATION, extra_groups=[])
            for _ in range(connections)]
        most = 0
        while any(sender.poll() is None for sender in senders):
            most = max(most, len(os.listdir("/proc/%d/fd" % daemon)))
        self.assertEqual([sender.wait() for sender in senders], [0] * connections)
        client.call("last_bu_time")
        self.assertEqual(self.device.daemon_pid(), daemon)
        return most

    def test_of_calls_do_not_fill_the_daemons_memory(self):
        self.flood(connections=3, calls=25000, size=4000, descriptors=0)
        if not is_sanitized():
            self.assertLess(self.device.daemon_memory_kb(), MEMORY_LIMIT_KB)

    def test_of_descriptors_leave_it_its_own(self):
        self.assertLess(self.flood(connections=2, calls=2000, size=10, descriptors=16), 200)


class TooMuch(Attack):
    def test_three_million_candidates_are_refused_and_the_daemon_goes_on(self):
        client = self.new_client()
        client.call("last_bu_time")
        daemon = self.device.daemon_pid()
        for ids in (["a"] * 3000000, ["a" * 300000], ["p%d" % i for i in range(4097)]):
            text = "[" + ",".join('"%s"' % each for each in ids) + "]"
            arguments = GLib.Variant("(iissu)", (1, 0, "35", text, 1))
            self.assertEqual(client.error_of("restore_enable", arguments)[0], INVALID)
        for method in ("app_data_backup_start", "app_data_restore_start"):
            arguments = GLib.Variant("(su)", ("a" * LARGEST, 1))
            self.assertEqual(client.error_of(method, arguments)[0], INVALID)
        self.assertEqual(client.error_of("make_app_data", GLib.Variant("(s)", ("a" * 256,)))[0],
                         INVALID)
        self.assertEqual(client.callbacks(), [])
        self.assertEqual(self.device.daemon_pid(), daemon)
        if not is_sanitized():
            # The room into which the bus library has read the largest message stays; that of its
            # copy goes, and the hundreds of megabytes that its packages would take are never made.
            self.assertLess(self.device.daemon_memory_kb(), MEMORY_LIMIT_KB + LARGEST // 1024)

    def test_what_an_honest_client_sends_is_taken(self):
        client = self.new_client()
        text = "[" + ",".join('"org.example.package.of.a.long.name.%04d"' % i
                              for i in range(4096)) + "]"
        arguments = GLib.Variant("(iissu)", (1, 0, "35", text, 1))
        self.assertEqual(client.call("restore_enable", arguments), (0,))
        if not is_sanitized():
            self.assertLess(self.device.daemon_memory_kb(), MEMORY_LIMIT_KB)


#: Bytes that the unit leaves the daemon for its data and its threads' stacks.
UNITS_LIMIT = 512 << 20


class Exports(Attack):
    """Nothing bounds an export: who asks for many at once, or for a large one, asks for much."""

    def ask(self, client, count, package=NOTES):
        return [client.start("make_app_data", GLib.Variant("(s)", (package,)))
                for _ in range(count)]

    def test_of_many_callers_at_once_do_not_end_the_daemon(self):
        clients = [self.new_client() for _ in range(4)]
        clients[0].call("last_bu_time")
        daemon = self.device.daemon_pid()
        if not is_sanitized():
            subprocess.run(["prlimit", "--pid", str(daemon), "--data=%d" % UNITS_LIMIT], check=True)
        calls = [call for client in clients for call in self.ask(client, 64)]
        clients[0].until(lambda: all(call.done for call in calls), "the exports", deadline=300)
        self.assertEqual({(call.reply, call.error) for call in calls}, {((0,), None)})
        self.assertEqual(self.device.daemon_pid(), daemon)
        if not is_sanitized():
            self.assertLess(self.device.daemon_memory_kb(), MEMORY_LIMIT_KB)

    def test_that_are_withdrawn_hold_up_nobody_while_another_is_made(self):
        with open(self.device.app_path(NOTES, "data/hole"), "wb") as file:
            os.chown(file.fileno(), APPLICATION, APPLICATION)
            file.truncate(16 << 30)
        first, second, honest = (self.new_client() for _ in range(3))
        large = self.ask(first, 1)
        wait_until(lambda: self.is_packing(), "it is packed")
        waiting = self.ask(second, 8)
        self.assertEqual(second.call("CancelOwn", path=PACKAGES, interface=INTERFACE + ".Packages"),
                         (8,))
        honest.call("last_bu_time")
        second.until(lambda: all(call.done for call in waiting), "they are withdrawn")
        self.assertEqual({call.reply for call in waiting}, {(17,)})
        self.assertFalse(large[0].done, "what it waited for is still being made")
        self.assertEqual(first.call("CancelOwn", path=PACKAGES, interface=INTERFACE + ".Packages"),
                         (1,))
        first.until(lambda: large[0].done, "it is withdrawn as well")
        self.assertEqual(large[0].reply, (17,))

    def is_packing(self):
        return any(os.path.exists("%s/%s/export.zip" % (folder, name))
                   for folder in [os.path.join(self.device.path, "root/tmp/quarn")]
                   if os.path.isdir(folder) for name in os.listdir(folder))


class NeverAnswering(Attack):
    """A client that takes its callbacks and says nothing to them."""

    CALLS = (("manual_backup_cancel", request(1)),
             ("app_data_backup_start", GLib.Variant("(su)", ("org.example.none", 2))),
             ("app_data_restore_start", GLib.Variant("(su)", ("org.example.none", 3))),
             ("get_app_list", GLib.Variant("(iu)", (2, 4))),
             ("manual_backup_start", request(5)))

    def hold_many(self, clients=20, rounds=2):
        mute = [self.new_client(mute=True) for _ in range(clients)]
        calls = []
        for client in mute:
            calls += [client.start(method, arguments) for method, arguments in self.CALLS * rounds]
        for client in mute:
            client.until(lambda c=client: len(c.held) == rounds * len(self.CALLS), "its callbacks")
        return mute, calls

    def test_holds_up_nobody_on_the_main_thread(self):
        mute, calls = self.hold_many()
        self.assertFalse(any(call.done for call in calls), "their handlers wait")
        honest = self.new_client()
        begin = time.monotonic()
        honest.call("last_bu_time")
        for method, arguments in self.CALLS[:4]:
            honest.call(method, arguments)
        self.assertEqual(len(honest.callbacks()), 4)
        self.assertLess(time.monotonic() - begin, SLOWNESS)
        self.device.quarnctl("status")
        self.device.quarnctl("backup")
        if not is_sanitized():
            self.assertLess(self.device.daemon_memory_kb(), MEMORY_LIMIT_KB)
        # And it is served itself, as soon as it answers.
        for client in mute:
            client.release()
        honest.until(lambda: all(call.done for call in calls), "the replies")
        self.assertEqual([call.error for call in calls], [None] * len(calls))

    def test_gets_its_replies_when_the_daemon_is_ended(self):
        mute, calls = self.hold_many(clients=6)
        honest = self.new_client()
        waiting = honest.start("manual_backup_start", request(7))
        daemon = self.device.daemon_pid()
        begin = time.monotonic()
        os.kill(daemon, signal.SIGTERM)
        honest.until(lambda: not os.path.exists("/proc/%d" % daemon), "the process ends")
        self.assertLess(time.monotonic() - begin, 1 + 4)
        honest.until(lambda: waiting.done and all(call.done for call in calls), "the replies")
        self.assertEqual([call.error for call in calls + [waiting]], [None] * (len(calls) + 1))

    def test_leaves_without_a_trace(self):
        mute, _ = self.hold_many(clients=4)
        for client in mute:
            client.close()
        honest = self.new_client()
        self.assertEqual(honest.call("set_activation", GLib.Variant("(i)", (0,))), (0,))
        self.device.quarnctl("backup")
        # What waited for them has gone with them: the daemon is idle and ends.
        def has_ended():
            honest.call("set_activation", GLib.Variant("(i)", (0,)))
            return "Good-Bye from Quarn" in self.device.log()

        wait_until(has_ended, "the daemon ends")

    def test_is_cancelled_though_it_has_not_answered_that_it_is_taken(self):
        mute = self.new_client(mute=True)
        mute.start("manual_backup_start", request(1))
        mute.until(lambda: mute.held, "it is told that it is taken")
        honest = self.new_client()
        honest.call("manual_backup_cancel", request(2))
        mute.release()
        mute.until(lambda: len(mute.callbacks()) == 2, "the last status")
        self.assertEqual(mute.callbacks("manual_backup_status"),
                         [("manual_backup_status", (0, 2, 1)),
                          ("manual_backup_status", (17, 6, 1))])
        self.assertNotIn("now manual backup start!", self.device.log())

    def test_holds_up_another_run_for_a_minute_and_no_longer(self):
        mute = [self.new_client(mute=True) for _ in range(3)]
        for client in mute:
            # Silent to its outcome only, on the worker.
            client.hold = lambda method, arguments: arguments[1] != 2
            client.call("manual_backup_start", request(1))
        honest = self.new_client()
        begin = time.monotonic()
        honest.call("manual_backup_start", request(1))
        honest.until(lambda: len(honest.callbacks()) == 2, "its outcome",
                     deadline=HOLD_UP + SLOWNESS)
        self.assertLess(time.monotonic() - begin, HOLD_UP + SLOWNESS)
        self.assertEqual(honest.callbacks()[-1], ("manual_backup_status", (0, 4, 1)))
        for client in mute:
            self.assertEqual(client.callbacks()[-1], ("manual_backup_status", (0, 4, 1)))
        self.assertIn(" does not answer its callback : others go on", self.device.log())


if __name__ == "__main__":
    unittest.main(verbosity=2)
