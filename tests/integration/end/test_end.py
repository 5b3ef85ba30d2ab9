"""The daemon's end: no call that is sent is lost, and every accepted request ends once."""
import contextlib
import fcntl
import os
import random
import signal
import subprocess
import sys
import time
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path[:0] = [os.path.join(HERE, ".."), os.path.join(HERE, "../bus")]
from bus_client import INTERFACE, NAME, PATH, Client, integer, request  # noqa: E402
from gi.repository import GLib  # noqa: E402
from quarn_test import BIN_DIR, TestCase, make_source, silent_server, wait_until  # noqa: E402

#: Calls of all four clients together. Sanitizers make every start of the daemon slow.
CALLS = int(os.environ.get("QUARN_END_CALLS", "10000" if "release" in BIN_DIR or
                           BIN_DIR.rstrip("/").endswith("build/bin") else "1500"))
PACKAGES = ["org.example.app%d" % index for index in range(2)]
CANCELLED = 17
SECONDS_OF_A_SIGNAL = 1.0
SECONDS_OF_A_SLOW_MACHINE = 2.0


def package(name, number):
    return GLib.Variant("(su)", (name, number))


class EndTest(TestCase):
    def setUp(self):
        self.device = self.new_device(serial="350000000000001", model="Orvane One")
        self.device.start()
        self.clients = []
        self.client = self.new_client()

    def tearDown(self):
        for client in self.clients:
            if not client.connection.is_closed():
                client.close()

    def new_client(self):
        client = Client(self.device.bus_address())
        self.clients.append(client)
        return client

    def install(self, packages=PACKAGES, size=1000):
        for name in packages:
            self.device.install(make_source(self.path(name), name, "1.0.0",
                                            {"data/content": os.urandom(size)}))

    def pid(self):
        return wait_until(self.device.daemon_pid, "the daemon runs")

    def slow_cloud(self):
        """Whatever asks the cloud waits: nobody answers at its address."""
        server = silent_server()
        self.addCleanup(server.close)
        self.device.call("set", "cloud", "s3+http://127.0.0.1:%d/bucket/prefix" %
                         server.getsockname()[1], "--user", "somebody", input="secret\n")

    def pid_of(self, owner):
        return self.client.bus("GetConnectionUnixProcessID", GLib.Variant("(s)", (owner,)))[0]

    def until_gone(self, pid):
        self.client.until(lambda: not os.path.exists("/proc/%d" % pid), "the process ends")

    def finals(self, client, method, number):
        """Last callbacks of a request."""
        return [arguments for _, arguments in client.callbacks(method)
                if arguments[-1] == number and not (method == "manual_backup_status" and
                                                    arguments[1] == 2)]

    def states(self, number, client=None):
        return [arguments[:2] for _, arguments in
                (client or self.client).callbacks("manual_backup_status")
                if arguments[2] == number]


class Caller:
    """Calls without a pause, until it has made its share; notes what went wrong."""

    def __init__(self, client, calls, choose):
        self.client = client
        self.left = calls
        self.choose = choose
        self.errors = []
        self.accepted = []
        self.done = False
        self.next()

    def next(self):
        if self.left == 0:
            self.done = True
            return
        self.left -= 1
        method, arguments, final, number = self.choose(self.left)

        def answered(connection, result):
            try:
                reply = connection.call_finish(result).unpack()
                if final is not None:
                    self.accepted.append((final, number, reply))
            except GLib.Error as error:
                self.errors.append((method, error.message))
            self.next()
        self.client.connection.call(NAME, PATH, INTERFACE, method, arguments, None, 0, 60000, None,
                                    answered)


class CallsAtTheEnd(EndTest):
    def churn(self, calls, choose):
        callers = [Caller(self.new_client(), calls // 4, lambda left, who=who: choose(who, left))
                   for who in range(4)]
        self.client.until(lambda: all(caller.done for caller in callers), "all calls", 240)
        for caller in callers:
            self.assertEqual(caller.errors, [])
            for final, number, reply in caller.accepted:
                caller.client.until(lambda: self.finals(caller.client, final, number),
                                    "the last callback of %s" % number)
        # One more, to find a second last callback behind it.
        self.client.call("last_bu_time")
        for caller in callers:
            for final, number, _ in caller.accepted:
                self.assertEqual(len(self.finals(caller.client, final, number)), 1)
        return callers

    def test_calls_of_four_clients_to_a_daemon_that_keeps_ending_are_all_answered(self):
        quiet = [("last_bu_time", None), ("backup_enable", integer(0)),
                 ("set_activation", integer(1)), ("manual_backup_cancel", None)]

        def choose(who, left):
            if left % 12 == who:
                return "set_activation", integer(0), None, 0
            method, arguments = quiet[(left + who) % len(quiet)]
            if method == "manual_backup_cancel":
                return method, request(left), "manual_backup_cancel_result", left
            return method, arguments, None, 0
        self.churn(CALLS, choose)
        self.assertGreater(self.device.log().count("Quarn Daemon start"), CALLS // 1000)

    def test_requests_to_a_daemon_that_keeps_ending_each_end_once(self):
        self.install()

        def choose(who, left):
            if who == 0:
                return "set_activation", integer(0), None, 0
            if who == 1:
                return "manual_backup_start", request(left), "manual_backup_status", left
            name = PACKAGES[who - 2]
            if left % 2:
                return ("app_data_backup_start", package(name, left), "app_data_backup_complete",
                        left)
            return ("app_data_restore_start", package(name, left), "app_data_restore_complete",
                    left)
        self.churn(160, choose)

    def test_calls_right_behind_a_deactivation_are_all_answered(self):
        for _ in range(5):
            calls = [self.client.start("set_activation", integer(0))]
            calls += [self.client.start("last_bu_time") for _ in range(60)]
            self.client.until(lambda: all(call.done for call in calls), "the replies")
            self.assertEqual([call.error for call in calls], [None] * 61)

    def test_restores_back_to_back_are_all_served(self):
        self.install(PACKAGES[:1])
        self.client.call("app_data_backup_start", package(PACKAGES[0], 1))
        for number in range(2, 152):
            self.assertEqual(
                self.client.call("app_data_restore_start", package(PACKAGES[0], number)), (0,))
            self.assertEqual(self.finals(self.client, "app_data_restore_complete", number),
                             [(0, PACKAGES[0], number)])

    def test_backup_in_the_same_breath_as_an_end_gets_its_outcome(self):
        self.install()
        for number in range(10):
            calls = [self.client.start("set_activation", integer(0)),
                     self.client.start("manual_backup_start", request(number)),
                     self.client.start("set_activation", integer(0))]
            self.client.until(lambda: all(call.done for call in calls) and
                              len(self.states(number)) == 2, "the outcome")
            self.assertEqual([call.error for call in calls], [None] * 3)
            self.assertEqual(self.states(number), [(0, 2), (0, 4)])



class Signals(EndTest):
    def end(self, number=signal.SIGTERM):
        """Seconds until the daemon has ended."""
        pid = self.pid()
        begin = time.monotonic()
        os.kill(pid, number)
        self.until_gone(pid)
        return time.monotonic() - begin

    def assert_at_once(self, seconds):
        self.assertLess(seconds, SECONDS_OF_A_SIGNAL + SECONDS_OF_A_SLOW_MACHINE)

    def test_per_application_requests_get_callback_and_reply(self):
        self.install()
        self.slow_cloud()
        calls = [self.client.start("app_data_backup_start", package(PACKAGES[0], 1)),
                 self.client.start("app_data_restore_start", package(PACKAGES[1], 2)),
                 self.client.start("get_app_list", GLib.Variant("(iu)", (0, 3)))]
        self.device.wait_for_log("try to init cloud")
        self.client.call("last_bu_time")
        self.assert_at_once(self.end())
        self.client.until(lambda: all(call.done for call in calls), "the replies")
        self.assertEqual([call.error for call in calls], [None] * 3)
        self.assertEqual(self.client.callbacks("app_data_backup_complete"),
                         [("app_data_backup_complete", (CANCELLED, PACKAGES[0], 1))])
        self.assertEqual(self.client.callbacks("app_data_restore_complete"),
                         [("app_data_restore_complete", (CANCELLED, PACKAGES[1], 2))])
        self.assertEqual(self.client.callbacks("get_app_list_cb"),
                         [("get_app_list_cb", (CANCELLED, "failed", 3))])

    def test_calls_that_the_daemon_has_not_come_to_are_answered(self):
        """Its main thread is in the middle of something that does not end within the second."""
        self.install()
        self.client.call("last_bu_time")
        with open(os.path.join(self.device.path, "state/.lock")) as lock:
            fcntl.flock(lock, fcntl.LOCK_EX)
            calls = {
                "backup_enable": integer(1), "set_activation": integer(1), "last_bu_time": None,
                "auto_backup_start": GLib.Variant("(s)", ("",)),
                "get_app_list": GLib.Variant("(iu)", (0, 1)),
                "manual_backup_start": request(2), "manual_backup_cancel": request(3),
                "app_data_backup_start": package(PACKAGES[0], 4),
                "app_data_restore_start": package(PACKAGES[1], 5),
                "make_app_data": GLib.Variant("(s)", (PACKAGES[0],)),
                "restore_enable": GLib.Variant("(iissu)", (1, 0, "350000000000001",
                                                           '["%s"]' % PACKAGES[0], 6)),
                "fly": None}
            calls = {method: self.client.start(method, arguments)
                     for method, arguments in calls.items()}
            calls["manual"] = self.client.start("manual_backup_start")
            calls["CancelOwn"] = self.client.start("CancelOwn",
                                                   path="/org/orvane/Quarn/Packages",
                                                   interface="org.orvane.Quarn.Packages")
            self.client.owner()
            self.assert_at_once(self.end())
            self.client.until(lambda: all(call.done for call in calls.values()), "the replies")
        self.assertGreater(calls.pop("last_bu_time").reply[0], 0)
        self.assertEqual(calls.pop("fly").error,
                         "GDBus.Error:org.freedesktop.DBus.Error.UnknownMethod: "
                         "Method fly is not implemented on interface org.orvane.Quarn")
        self.assertEqual({method: call.error or call.reply for method, call in calls.items()},
                         {"backup_enable": (CANCELLED,), "set_activation": (CANCELLED,),
                          "auto_backup_start": (), "get_app_list": (CANCELLED,),
                          "manual_backup_start": (0,), "manual_backup_cancel": (0,),
                          "app_data_backup_start": (0,), "app_data_restore_start": (0,),
                          "make_app_data": (CANCELLED,), "restore_enable": (36,),
                          "manual": (-1,), "CancelOwn": (0,)})
        self.assertEqual(sorted(self.client.callbacks()),
                         [("app_data_backup_complete", (CANCELLED, PACKAGES[0], 4)),
                          ("app_data_restore_complete", (CANCELLED, PACKAGES[1], 5)),
                          ("get_app_list_cb", (CANCELLED, "failed", 1)),
                          ("manual_backup_cancel_result", (CANCELLED, 3)),
                          ("manual_backup_status", (CANCELLED, 6, 2))])

    def test_running_and_queued_backups_are_told(self):
        self.install()
        self.slow_cloud()
        other = self.new_client()
        for number in (1, 2):
            self.client.call("manual_backup_start", request(number))
        other.call("manual_backup_start", request(1))
        self.assert_at_once(self.end())
        self.client.until(lambda: len(self.states(2)) == 2, "the last status")
        other.until(lambda: len(self.states(1, other)) == 2, "the last status")
        for states in (self.states(1), self.states(2), self.states(1, other)):
            self.assertEqual(states, [(0, 2), (CANCELLED, 6)])

    def test_client_that_answers_nothing_does_not_keep_the_others_from_being_told(self):
        self.install()
        self.slow_cloud()
        self.client.call("manual_backup_start", request(1))
        silent = self.new_client()
        silent.hold = lambda method, arguments: True
        silent.start("manual_backup_start", request(7))
        silent.until(lambda: silent.held, "the callback that is not answered")
        self.assert_at_once(self.end())
        self.client.until(lambda: len(self.states(1)) == 2, "the last status")
        self.assertEqual(self.states(1), [(0, 2), (CANCELLED, 6)])
        silent.until(lambda: len(self.states(7, silent)) == 2, "the last status")
        self.assertEqual(self.states(7, silent), [(0, 2), (CANCELLED, 6)])

    def test_restore_mode_ends_with_its_last_callback(self):
        for end in (self.end, lambda: self.client.call("set_activation", integer(0))):
            self.client.events.clear()
            arguments = GLib.Variant("(iissu)", (1, 0, "350000000000001", '["%s"]' % PACKAGES[0], 5))
            self.assertEqual(self.client.call("restore_enable", arguments), (0,))
            pid = self.pid()
            end()
            self.until_gone(pid)
            self.client.until(lambda: self.client.callbacks("restore_enable_cb"), "the last one")
            self.assertEqual(self.client.callbacks("restore_enable_cb"),
                             [("restore_enable_cb", (CANCELLED, "restore_stop", 5))])

    def test_while_the_daemon_starts_the_calls_that_started_it_are_answered(self):
        for number in range(10):
            starts = self.device.log().count("init backup resource")
            calls = [self.client.start("last_bu_time"),
                     self.client.start("manual_backup_start", request(number))]
            self.device.wait_for_log("init backup resource", starts + 1)
            os.kill(self.pid(), signal.SIGTERM)
            self.client.until(lambda: all(call.done for call in calls), "the replies")
            self.assertEqual([call.error for call in calls], [None] * 2)
            self.client.until(lambda: len(self.states(number)) == 2, "the last status")
            self.device.wait_for_daemon_end()

    def test_at_any_moment_each_request_is_answered_and_ends_once(self):
        self.install(size=200000)
        choice = random.Random(11)
        methods = [("manual_backup_start", lambda number: request(number), "manual_backup_status"),
                   ("app_data_backup_start", lambda number: package(PACKAGES[0], number),
                    "app_data_backup_complete"),
                   ("app_data_restore_start", lambda number: package(PACKAGES[1], number),
                    "app_data_restore_complete"),
                   ("get_app_list", lambda number: GLib.Variant("(iu)", (0, number)),
                    "get_app_list_cb")]
        number = 0
        ever = []
        for _ in range(12):
            asked = []
            for _ in range(choice.randrange(1, 12)):
                number += 1
                method, arguments, final = choice.choice(methods)
                asked.append((self.client.start(method, arguments(number)), final, number))
            # Somewhere between the first callback and the last.
            events = len(self.client.events) + choice.randrange(0, 2 * len(asked))
            self.client.until(lambda: len(self.client.events) >= events, "some of it happens")
            pid = self.device.daemon_pid()
            with contextlib.suppress(ProcessLookupError, TypeError):
                os.kill(pid, signal.SIGTERM)  # it may have ended by itself
            self.client.until(lambda: all(call.done for call, _, _ in asked), "the replies")
            self.assertEqual([call.error for call, _, _ in asked], [None] * len(asked))
            for _, final, each in asked:
                self.client.until(lambda: self.finals(self.client, final, each), "the last one")
            ever += asked
        self.client.call("last_bu_time")
        for _, final, each in ever:
            self.assertEqual(len(self.finals(self.client, final, each)), 1)


class Successor(EndTest):
    """One process runs a backup that it was asked for at its end; another has taken the name."""

    def setUp(self):
        super().setUp()
        self.install()
        self.slow_cloud()
        self.client.call("last_bu_time")
        self.first = self.pid()
        second = self.device.begin(os.path.join(BIN_DIR, "quarnd"), stderr=subprocess.DEVNULL)
        self.addCleanup(second.wait)
        self.addCleanup(second.kill)
        self.device.wait_for_log("Lost the name org.orvane.Quarn")
        # Both calls have arrived before the first one is looked at.
        os.kill(self.first, signal.SIGSTOP)
        calls = [self.client.start("set_activation", integer(0)),
                 self.client.start("manual_backup_start", request(1))]
        self.client.owner()
        os.kill(self.first, signal.SIGCONT)
        self.client.until(lambda: all(call.done for call in calls), "the replies")
        self.client.until(lambda: self.pid_of(self.client.owner()) != self.first, "the name passes")
        self.second = self.pid_of(self.client.owner())
        self.assertEqual(self.states(1), [(0, 2)])

    def assert_second_waits(self):
        self.assertIn("an earlier process still works", self.device.log())
        self.assertEqual(self.device.log().count("checking if previous backup item exist"), 1)

    def test_answers_at_once_and_waits_before_it_touches_data(self):
        waiting = self.client.start("app_data_backup_start", package(PACKAGES[0], 2))
        self.client.call("manual_backup_start", request(3))
        self.client.call("last_bu_time")
        self.assertFalse(waiting.done)
        self.assert_second_waits()
        self.device.set("cloud", "file://" + self.device.cloud)
        os.kill(self.first, signal.SIGTERM)
        self.client.until(lambda: waiting.done and len(self.states(3)) == 2, "its turn")
        self.assertEqual(waiting.reply, (0,))
        self.assertEqual(self.states(1), [(0, 2), (CANCELLED, 6)])
        self.assertEqual(self.finals(self.client, "app_data_backup_complete", 2)[0][1:],
                         (PACKAGES[0], 2))
        self.assertEqual(self.pid_of(self.client.owner()), self.second)

    def test_passes_a_cancel_on_and_the_first_ends_when_it_has_finished(self):
        self.assertEqual(self.client.call("manual_backup_cancel", request(9)), (0,))
        self.client.until(lambda: len(self.states(1)) == 2, "the cancelled backup ends")
        self.assertEqual(self.states(1), [(0, 2), (CANCELLED, 6)])
        self.assertEqual(self.device.log().count("cancel from the next process"), 1)
        self.until_gone(self.first)
        self.device.wait_for_log("checking if previous backup item exist", 2)

    def test_cancel_of_a_backup_that_waits_for_its_turn_is_told_at_once(self):
        self.client.call("manual_backup_start", request(4))
        self.client.call("manual_backup_cancel", request(9))
        self.client.until(lambda: len(self.states(4)) == 2, "the cancelled backup ends")
        self.assertEqual(self.states(4), [(0, 2), (CANCELLED, 6)])

    def test_signal_answers_what_waits_for_its_turn(self):
        calls = [self.client.start("app_data_backup_start", package(PACKAGES[0], 2)),
                 self.client.start("make_app_data", GLib.Variant("(s)", (PACKAGES[0],)))]
        self.client.call("last_bu_time")
        os.kill(self.second, signal.SIGTERM)
        self.client.until(lambda: all(call.done for call in calls), "the replies")
        self.assertEqual([call.reply for call in calls], [(0,), (CANCELLED,)])
        self.assertEqual(self.finals(self.client, "app_data_backup_complete", 2),
                         [(CANCELLED, PACKAGES[0], 2)])
        self.assertTrue(os.path.exists("/proc/%d" % self.first))

    def test_deactivation_is_dropped_while_a_call_waits_for_its_turn(self):
        self.client.start("app_data_backup_start", package(PACKAGES[0], 2))
        self.assertEqual(self.client.call("set_activation", integer(0)), (0,))
        self.assertEqual(self.pid_of(self.client.owner()), self.second)
        self.assertIn("Not in idle state", self.device.log())


class Bus(EndTest):
    def test_work_is_finished_when_the_bus_is_gone(self):
        self.install(size=2000000)
        self.client.call("manual_backup_start", request(1))
        daemon = self.pid()
        bus = self.client.bus("GetConnectionUnixProcessID",
                              GLib.Variant("(s)", ("org.freedesktop.DBus",)))[0]
        self.client.connection.set_exit_on_close(False)
        os.kill(bus, signal.SIGKILL)
        wait_until(lambda: not os.path.exists("/proc/%d" % daemon), "the daemon ends")
        self.assertNotIn("SIGNAL", self.device.log())
        self.assertIn("manual backup successful!", self.device.log())
        self.assertIn("the bus is gone : ", self.device.log())
        self.assertIn("Good-Bye from Quarn", self.device.log())


if __name__ == "__main__":
    unittest.main(verbosity=2)
