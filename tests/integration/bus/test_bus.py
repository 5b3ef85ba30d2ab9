"""The daemon's process and its bus interface: start, end, signals, replies, callbacks."""
import os
import signal
import subprocess
import sys
import time
import unittest

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
from bus_client import INTERFACE, NAME, Client, integer, request  # noqa: E402
from gi.repository import GLib  # noqa: E402
from quarn_test import BIN_DIR, TestCase, make_source, read_file, wait_until  # noqa: E402

#: A process under a signal ends within a second; the rest is for a slow machine.
SIGNAL_SECONDS = 1.0
MACHINE_SECONDS = 2.0
#: What poll() and ppoll() are called in /proc/PID/syscall, and how each says "no time-out".
WAITS = {"x86_64": {"7": ("0xffffffff", "0xffffffffffffffff"), "271": ("0x0",)},
         "aarch64": {"73": ("0x0",)}}

TEAR_DOWN = ["connection destroy ~", "backup-transport deinit ~", "remove alarm ~",
             "quarnd_dbus_deinit ~", "ecore_shutdown ~", "Good-Bye from Quarn"]


def texts(log):
    """The messages alone, in order."""
    return [line.split(" > ", 1)[1] for line in log.splitlines() if " > " in line]


class BusTest(TestCase):
    def setUp(self):
        self.clients = []
        self.daemons = []

    def tearDown(self):
        for client in self.clients:
            if not client.connection.is_closed():
                client.close()
        for daemon in self.daemons:
            if daemon.poll() is None:
                daemon.kill()
                daemon.wait()

    def device_with(self, packages=1, **options):
        options.setdefault("account", "someone@example.org")
        options.setdefault("serial", "350000000000001")
        self.device = self.new_device(**options)
        self.device.set("network", "wifi")
        self.device.start()
        for index in range(packages):
            self.device.install(make_source(
                self.path("source%d" % index), "org.example.app%d" % index, "1.0.0",
                {"data/text": b"text" * 100}))
        self.client = self.new_client()

    def new_client(self, **options):
        client = Client(self.device.bus_address(), **options)
        self.clients.append(client)
        return client

    def pid(self):
        return wait_until(self.device.daemon_pid, "the daemon runs")

    def run_daemon(self):
        """The daemon as a child, so that its exit status can be had."""
        daemon = self.device.begin(os.path.join(BIN_DIR, "quarnd"), stderr=subprocess.DEVNULL)
        self.daemons.append(daemon)
        return daemon

    def run_owning_daemon(self):
        daemon = self.run_daemon()
        self.client.until(lambda: self.client.owner() is not None, "the name is owned")
        return daemon

    def finished(self, daemon):
        """Exit status, the client being served meanwhile."""
        self.client.until(lambda: daemon.poll() is not None, "the daemon ends")
        return daemon.returncode

    def lines(self):
        return texts(self.device.log())

    def assert_lines_in_order(self, expected):
        """Each once, in this order; the worker's lines may be between them."""
        self.assertEqual([line for line in self.lines() if line in expected], expected)


class Process(BusTest):
    def test_without_an_account_it_exits_zero_and_never_owns_the_name(self):
        self.device_with(account=None)
        owners = []
        self.client.connection.signal_subscribe(
            "org.freedesktop.DBus", "org.freedesktop.DBus", "NameOwnerChanged",
            "/org/freedesktop/DBus", NAME, 0, lambda *arguments: owners.append(arguments[5]))
        self.client.owner()  # a round trip: the bus knows of the subscription now
        self.assertEqual(self.finished(self.run_daemon()), 0)
        self.assertIsNone(self.client.owner())
        self.assertEqual(owners, [])
        self.assert_lines_in_order(["Quarn Daemon start", "no signed-in. Daemon stop"])
        self.assertEqual(self.lines()[-1], "no signed-in. Daemon stop")

    def test_set_activation_zero_quits_when_idle_and_replies_first(self):
        self.device_with()
        daemon = self.run_owning_daemon()
        self.assertEqual(self.client.call("set_activation", integer(0)), (0,))
        self.assertEqual(self.finished(daemon), 0)
        self.assert_lines_in_order(["try to terminate quarn", "last backup time setted to 0",
                                    "terminate quarn"] + TEAR_DOWN)
        self.assertIsNone(self.client.owner())

    def test_set_activation_one_keeps_it(self):
        self.device_with()
        self.assertEqual(self.client.call("set_activation", integer(1)), (0,))
        first = self.pid()
        self.client.call("last_bu_time")
        self.assertEqual(self.pid(), first)
        self.assertIn("quarn activated successfully!", self.lines())

    def test_any_call_starts_a_daemon_that_does_not_run(self):
        self.device_with()
        self.assertIsNone(self.client.owner())
        self.client.call("last_bu_time")
        self.assertIsNotNone(self.client.owner())
        self.client.call("set_activation", integer(0))
        self.device.wait_for_daemon_end()
        self.client.call("last_bu_time")
        self.assertEqual(self.lines().count("Quarn Daemon start"), 2)

    def test_set_activation_zero_is_dropped_while_a_backup_runs(self):
        self.device_with()
        daemon = self.run_owning_daemon()
        # The run ends with its last callback, which waits for its answer.
        self.client.hold = lambda method, arguments: arguments[1] != 2
        self.client.call("manual_backup_start", request(1))
        self.client.until(lambda: self.client.held, "the last callback")
        other = self.new_client()
        self.assertEqual(other.call("set_activation", integer(0)), (0,))
        self.assertIn("Not in idle state", self.lines())
        self.assertIsNone(daemon.poll())
        self.client.release()
        # Idle comes with the worker's last step, which nobody is told of.
        while daemon.poll() is None and "terminate quarn" not in self.lines():
            self.assertEqual(other.call("set_activation", integer(0)), (0,))
        self.assertEqual(self.finished(daemon), 0)

    def test_second_daemon_waits_for_the_name(self):
        self.device_with()
        first = self.run_owning_daemon()
        owner = self.client.owner()
        second = self.run_daemon()
        self.device.wait_for_log("Lost the name org.orvane.Quarn")
        self.assertEqual(self.client.owner(), owner)
        self.assertIsNone(second.poll())
        self.client.call("set_activation", integer(0))
        self.assertEqual(self.finished(first), 0)
        self.client.until(lambda: self.client.owner() not in (None, owner), "the second owns it")
        self.client.call("set_activation", integer(0))
        self.assertEqual(self.finished(second), 0)

    def test_idle_daemon_waits_without_a_time_out(self):
        self.device_with()
        self.client.call("set_activation", integer(1))
        pid = self.pid()
        waits = WAITS[os.uname().machine]

        def waits_forever():
            fields = read_file("/proc/%d/syscall" % pid).split()
            # A process that runs has no system call to show.
            return len(fields) > 3 and fields[3] in waits.get(fields[0], ())
        wait_until(waits_forever, "the main thread waits for nothing but events")


class Signals(BusTest):
    def end_by(self, daemon, number):
        """The daemon's exit status, and the seconds it took."""
        pid = self.pid()
        begin = time.monotonic()
        os.kill(pid, number)
        daemon.wait(timeout=60)
        return daemon.returncode, time.monotonic() - begin

    def check_signal(self, number):
        self.device_with()
        daemon = self.run_owning_daemon()
        status, seconds = self.end_by(daemon, number)
        self.assertEqual(status, 0)
        self.assertLess(seconds, SIGNAL_SECONDS + MACHINE_SECONDS)
        self.assertIsNone(self.client.owner())
        self.assert_lines_in_order(["SIGNAL %d received" % number] + TEAR_DOWN)

    def test_interrupt(self):
        self.check_signal(signal.SIGINT)

    def test_hangup(self):
        self.check_signal(signal.SIGHUP)

    def test_terminate(self):
        self.check_signal(signal.SIGTERM)

    def test_quit(self):
        self.check_signal(signal.SIGQUIT)

    def test_many_signals_tear_down_once(self):
        self.device_with()
        daemon = self.run_owning_daemon()
        pid = self.pid()
        for number in (signal.SIGTERM, signal.SIGINT, signal.SIGHUP, signal.SIGQUIT):
            try:
                os.kill(pid, number)
            except ProcessLookupError:
                break
        self.assertEqual(self.finished(daemon), 0)
        self.assertEqual(self.lines().count("quarnd_dbus_deinit ~"), 1)

    def test_main_thread_that_waits_for_a_client(self):
        self.device_with()
        daemon = self.run_owning_daemon()
        self.client.hold = lambda method, arguments: True
        self.client.start("manual_backup_start", request(1))
        self.client.until(lambda: self.client.held, "the callback that is not answered")
        status, seconds = self.end_by(daemon, signal.SIGTERM)
        self.assertEqual(status, 0)
        self.assertLess(seconds, SIGNAL_SECONDS + MACHINE_SECONDS)
        self.assertIn("SIGNAL 15 received", self.lines())
        self.assertIsNone(self.client.owner())

    def test_worker_that_waits_for_a_client(self):
        self.device_with()
        daemon = self.run_owning_daemon()
        self.client.hold = lambda method, arguments: arguments[1] != 2
        self.client.call("manual_backup_start", request(1))
        self.client.until(lambda: self.client.held, "the last callback, not answered")
        self.assertEqual(self.end_by(daemon, signal.SIGTERM)[0], 0)
        self.assert_lines_in_order(["SIGNAL 15 received"] + TEAR_DOWN)


class Replies(BusTest):
    def setUp(self):
        super().setUp()
        self.device_with()

    def test_last_backup_time_is_the_present(self):
        for _ in range(2):
            before = int(time.time() * 1000)
            value = self.client.call("last_bu_time")[0]
            self.assertTrue(before <= value <= int(time.time() * 1000), value)

    def test_backup_enable_writes_the_setting(self):
        for on, stored in ((1, "1"), (0, "0"), (-7, "1")):
            self.assertEqual(self.client.call("backup_enable", integer(on)), (0,))
            self.assertEqual(self.device.setting("db/private/quarn/backup_status"), stored)

    def test_auto_backup_start_is_accepted_and_ignored(self):
        self.assertEqual(self.client.call("auto_backup_start", GLib.Variant("(s)", ("x",))), ())
        self.assertEqual(self.client.call("auto_backup_start"), ())
        self.assertEqual(self.client.callbacks(), [])

    def test_unknown_method(self):
        name, text = self.client.error_of("fly", GLib.Variant("(s)", ("high",)))
        self.assertEqual(name, "org.freedesktop.DBus.Error.UnknownMethod")
        self.assertEqual(text, "Method fly is not implemented on interface " + INTERFACE)

    def test_missing_arguments_are_answered_minus_one(self):
        for method in ("set_activation", "backup_enable", "restore_enable", "get_app_list",
                       "manual_backup_start", "manual_backup_cancel", "app_data_backup_start",
                       "app_data_restore_start", "make_app_data"):
            self.assertEqual(self.client.call(method), (-1,), method)
        self.assertEqual(self.client.callbacks(), [])

    def test_other_arguments_are_refused(self):
        name, _ = self.client.error_of("manual_backup_start", GLib.Variant("(s)", ("one",)))
        self.assertEqual(name, "org.freedesktop.DBus.Error.InvalidArgs")
        self.assertEqual(self.client.callbacks(), [])

    def test_introspection_tells_the_methods_in_order(self):
        xml = self.client.call("Introspect", interface="org.freedesktop.DBus.Introspectable")[0]
        own = xml.split('<interface name="org.orvane.Quarn">')[1].split("</interface>")[0]
        self.assertEqual([part.split('"')[1] for part in own.split("<method ")[1:]], [
            "set_activation", "backup_enable", "restore_enable", "last_bu_time", "get_app_list",
            "auto_backup_start", "manual_backup_start", "manual_backup_cancel",
            "app_data_backup_start", "app_data_restore_start", "make_app_data"])


class Callbacks(BusTest):
    def setUp(self):
        super().setUp()
        self.device_with()

    def states(self, client=None):
        return [arguments for _, arguments in
                (client or self.client).callbacks("manual_backup_status")]

    def until_final(self, number, client=None):
        client = client or self.client
        client.until(lambda: any(state != 2 and req == number
                                 for _, state, req in self.states(client)), "the final status")

    def test_manual_backup_tells_state_two_before_its_reply_then_the_outcome(self):
        self.assertEqual(self.client.call("manual_backup_start", request(7)), (0,))
        self.assertEqual(self.client.events[:1], [("manual_backup_status", (0, 2, 7))])
        self.until_final(7)
        self.assertEqual(self.states(), [(0, 2, 7), (0, 4, 7)])

    def test_manual_backup_without_wifi_tells_33_and_failed(self):
        self.device.set("network", "cellular")
        self.client.call("manual_backup_start", request(8))
        self.until_final(8)
        self.assertEqual(self.states(), [(0, 2, 8), (33, 5, 8)])

    def test_cancel_is_acknowledged_when_nothing_runs(self):
        self.assertEqual(self.client.call("manual_backup_cancel", request(9)), (0,))
        self.assertEqual(self.client.events, [("manual_backup_cancel_result", (0, 9)),
                                              ("reply of manual_backup_cancel", (0,))])

    def test_app_list_for_an_unknown_client_fails(self):
        for kind in (-1, 2):
            self.client.events.clear()
            arguments = GLib.Variant("(iu)", (kind, 3))
            self.assertEqual(self.client.call("get_app_list", arguments), (1,))
            self.assertEqual(self.client.callbacks(), [("get_app_list_cb", (1, "failed", 3))])

    def test_package_ids_that_lead_elsewhere_are_unknown(self):
        for number, package in enumerate(("", ".", "..", "../x", "a/b")):
            for method, callback in (("app_data_backup_start", "app_data_backup_complete"),
                                     ("app_data_restore_start", "app_data_restore_complete")):
                self.client.events.clear()
                arguments = GLib.Variant("(su)", (package, number))
                self.assertEqual(self.client.call(method, arguments), (1,), package)
                self.assertEqual(self.client.callbacks(), [(callback, (1, package, number))])

    def test_client_that_died_does_not_disturb_the_run(self):
        dying = self.new_client()
        dying.hold = lambda method, arguments: True
        dying.start("manual_backup_start", request(1))
        dying.until(lambda: dying.held, "state two")
        dying.close()
        # State two and the outcome of its run are both undeliverable.
        self.device.wait_for_log("g_dbus_connection_call_sync() Fail(", 2)
        self.client.call("manual_backup_start", request(2))
        self.until_final(2)
        self.assertEqual(self.states(), [(0, 2, 2), (0, 4, 2)])

    def test_client_without_the_callback_object_does_not_disturb_the_run(self):
        bare = self.new_client(with_object=False)
        self.assertEqual(bare.call("manual_backup_start", request(1)), (0,))
        self.client.until(
            lambda: self.device.log().count("g_dbus_connection_call_sync() Fail(") >= 2,
            "both callbacks fail")
        self.client.call("manual_backup_start", request(2))
        self.until_final(2)
        self.assertEqual(self.states(), [(0, 2, 2), (0, 4, 2)])

    def test_requests_of_two_clients_keep_their_senders_and_ids(self):
        other = self.new_client()
        first = self.client.start("manual_backup_start", request(11))
        second = other.start("manual_backup_start", request(22))
        self.client.until(lambda: first.done and second.done, "both replies")
        self.until_final(11)
        self.until_final(22, other)
        self.assertEqual(self.states(), [(0, 2, 11), (0, 4, 11)])
        self.assertEqual(self.states(other), [(0, 2, 22), (0, 4, 22)])

    def test_exported_archive_is_the_callers(self):
        reply = self.client.call("make_app_data", GLib.Variant("(s)", ("org.example.app0",)))
        self.assertEqual(reply, (0,))
        archive = self.device.exec("stat", "-c", "%u %a", "/tmp/org.example.app0_tmp.zip")
        self.assertEqual(archive.stdout.split(), [str(os.getuid()), "600"])


if __name__ == "__main__":
    unittest.main(verbosity=2)
