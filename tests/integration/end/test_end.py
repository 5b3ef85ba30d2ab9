"""The daemon's end: no call that is sent is lost, and every accepted request ends once."""
import os
import random
import signal
import subprocess
import sys
import time
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path[:0] = [os.path.join(HERE, ".."), os.path.join(HERE, "../bus")]
from bus_client import INTERFACE, NAME, PATH, Client  # noqa: E402
from gi.repository import GLib  # noqa: E402
from quarn_test import BIN_DIR, TestCase, make_source, wait_until  # noqa: E402

#: Calls of all four clients together. Sanitizers make every start of the daemon slow.
CALLS = int(os.environ.get("QUARN_END_CALLS", "10000" if "release" in BIN_DIR or
                           BIN_DIR.rstrip("/").endswith("build/bin") else "1500"))
PACKAGES = ["org.example.app%d" % index for index in range(2)]
CANCELLED = 17
SECONDS_OF_A_SIGNAL = 1.0
SECONDS_OF_A_SLOW_MACHINE = 2.0


def request(number):
    return GLib.Variant("(u)", (number,))


def integer(number):
    return GLib.Variant("(i)", (number,))


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
        self.assertGreater(self.device.log().count("Quarn Daemon start"), CALLS // 500)

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


if __name__ == "__main__":
    unittest.main(verbosity=2)
