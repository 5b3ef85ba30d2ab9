"""Requests that wait beside each other: how many may, whom a cancel meets, and what each gets."""
import collections
import os
import random
import sys
import time
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path[:0] = [os.path.join(HERE, ".."), os.path.join(HERE, "../bus")]
from bus_client import Client, GLib  # noqa: E402
from quarn_test import TestCase, is_sanitized, make_source, silent_server  # noqa: E402

PACKAGES = ["org.example.p%d" % index for index in range(8)]
OF_A_CALLER = 64
OF_ALL = 512
MEMORY_LIMIT_KB = 20480
TOO_MANY = "org.freedesktop.DBus.Error.LimitsExceeded"
CANCELLED = 17
#: The last callback of each method's requests, and where its result stands.
LAST = {"manual_backup_start": "manual_backup_status",
        "manual_backup_cancel": "manual_backup_cancel_result",
        "app_data_backup_start": "app_data_backup_complete",
        "app_data_restore_start": "app_data_restore_complete",
        "get_app_list": "get_app_list_cb"}


def cancel_own(client):
    return client.call("CancelOwn", path="/org/orvane/Quarn/Packages",
                       interface="org.orvane.Quarn.Packages")[0]


def answers(client):
    """Results by request, of final callbacks only."""
    told = collections.defaultdict(list)
    for method, arguments in client.callbacks():
        if method == "manual_backup_status" and arguments[1] == 2:
            continue
        if method == "restore_enable_cb" and arguments[1] != "restore_stop":
            continue
        told[arguments[-1]].append(arguments[0])
    return told


class WaitingTest(TestCase):
    def set_up_device(self, **options):
        self.device = self.new_device(serial="350000000000001", model="Orvane One", **options)
        self.device.start()
        for package in PACKAGES:
            self.device.install(make_source(self.path(package), package, "1.0.0",
                                            {"data/content": os.urandom(200000)}))

    def new_clients(self, count):
        return [Client(self.device.bus_address()) for _ in range(count)]


class SilentCloud(WaitingTest):
    """A store that takes connections and never answers: what is asked of it waits."""

    def setUp(self):
        self.server = silent_server()
        self.addCleanup(self.server.close)
        self.set_up_device()
        self.device.quarnctl("backup")
        self.device.set("cloud", "webdav+http://127.0.0.1:%d/dav" % self.server.getsockname()[1])

    def restore(self, client, request, package=None):
        return client.start("app_data_restore_start", GLib.Variant(
            "(su)", (package or PACKAGES[request % len(PACKAGES)], request)))

    def until_waiting(self, clients, calls):
        """Every call has been dispatched: one that came after them has its reply."""
        for client in clients:
            client.call("last_bu_time")
        self.assertFalse(any(call.done for call in calls))

    def test_a_caller_may_have_sixty_four_requests_waiting_and_all_five_hundred_and_twelve(self):
        clients = self.new_clients(OF_ALL // OF_A_CALLER)
        calls = []
        for client in clients:
            calls += [self.restore(client, request) for request in range(OF_A_CALLER)]
            self.until_waiting([client], calls)
            arguments = GLib.Variant("(su)", (PACKAGES[0], 1000))
            self.assertEqual(client.error_of("app_data_restore_start", arguments)[0], TOO_MANY)
        other = self.new_clients(1)[0]
        self.assertEqual(other.error_of("manual_backup_start", GLib.Variant("(u)", (1,)))[0],
                         TOO_MANY)
        if not is_sanitized():
            self.assertLess(self.device.daemon_memory_kb(), MEMORY_LIMIT_KB)
        # Who waits keeps nobody from being served, and from withdrawing.
        self.assertEqual(other.call("set_activation", GLib.Variant("(i)", (1,))), (0,))
        for client in clients:
            self.assertEqual(cancel_own(client), OF_A_CALLER)
        for client in clients:
            client.until(lambda c=client: len(answers(c)) == OF_A_CALLER, "its answers")
            self.assertEqual(dict(answers(client)),
                             {request: [CANCELLED] for request in range(OF_A_CALLER)})
        other.until(lambda: all(call.done for call in calls), "the replies")
        self.assertEqual({call.reply for call in calls}, {(0,)})

    def test_who_withdraws_ends_its_own_requests_and_nobody_elses(self):
        one, two = self.new_clients(2)
        calls = []
        for request in range(6):
            calls.append(self.restore(one, request))
            calls.append(self.restore(two, request))
        self.until_waiting([one, two], calls)
        self.assertEqual(cancel_own(one), 6)
        one.until(lambda: len(answers(one)) == 6, "its answers")
        self.assertEqual(cancel_own(one), 0)
        self.assertEqual(answers(two), {})
        self.assertEqual(set(sum(answers(one).values(), [])), {CANCELLED})
        # The store is there again, and somebody's cancel ends what waits for the silent one:
        # what still stands is begun again, and done.
        self.device.set("cloud", "file://" + self.device.cloud)
        one.call("manual_backup_cancel", GLib.Variant("(u)", (99,)))
        two.until(lambda: len(answers(two)) == 6, "its answers")
        self.assertEqual(set(sum(answers(two).values(), [])), {0})

    def test_a_withdrawn_backup_is_told_and_the_next_one_runs(self):
        one, two = self.new_clients(2)
        one.start("manual_backup_start", GLib.Variant("(u)", (1,)))
        one.until(lambda: self.device.log().count("=== checking app list from cloud ===") == 2,
                  "it runs")
        two.start("manual_backup_start", GLib.Variant("(u)", (1,)))
        two.until(lambda: two.callbacks(), "it is queued")
        self.assertEqual(cancel_own(two), 1)
        self.device.set("cloud", "file://" + self.device.cloud)
        self.assertEqual(cancel_own(one), 1)
        for client in (one, two):
            client.until(lambda c=client: answers(c), "its end")
            self.assertEqual(dict(answers(client)), {1: [CANCELLED]})
            self.assertEqual(client.callbacks("manual_backup_status")[-1][1], (CANCELLED, 6, 1))
        self.device.quarnctl("backup")



class EverythingAtOnce(WaitingTest):
    """Several clients that start, cancel and withdraw at moments that nobody chose."""

    SECONDS = 12
    CLIENTS = 4

    def setUp(self):
        self.set_up_device()
        self.device.quarnctl("backup")
        self.random = random.Random(20261122)
        self.requests = collections.defaultdict(dict)  # by client: method by request
        self.calls = []
        self.next_request = 0

    def ask(self, client):
        self.next_request += 1
        request, package = self.next_request, self.random.choice(PACKAGES)
        method, arguments = self.random.choice([
            ("manual_backup_start", GLib.Variant("(u)", (request,))),
            ("manual_backup_start", GLib.Variant("(u)", (request,))),
            ("manual_backup_cancel", GLib.Variant("(u)", (request,))),
            ("app_data_backup_start", GLib.Variant("(su)", (package, request))),
            ("app_data_backup_start", GLib.Variant("(su)", (package, request))),
            ("app_data_restore_start", GLib.Variant("(su)", (package, request))),
            ("get_app_list", GLib.Variant("(iu)", (0, request)))])
        self.requests[client][request] = method
        self.calls.append((method, client.start(method, arguments)))

    def withdraw(self, client):
        self.calls.append(("CancelOwn", client.start(
            "CancelOwn", path="/org/orvane/Quarn/Packages",
            interface="org.orvane.Quarn.Packages")))

    def test_every_request_has_one_reply_and_one_end(self):
        clients = self.new_clients(self.CLIENTS)
        end = time.monotonic() + self.SECONDS
        while time.monotonic() < end:
            client = self.random.choice(clients)
            if self.random.random() < 0.1:
                self.withdraw(client)
            elif len(self.requests[client]) - len(answers(client)) < OF_A_CALLER // 2:
                self.ask(client)
            for _ in range(self.random.randrange(12)):
                GLib.MainContext.default().iteration(False)
        clients[0].until(lambda: all(call.done for _, call in self.calls), "the replies")
        self.assertEqual([(method, call.error) for method, call in self.calls if call.error], [])
        for client in clients:
            asked = self.requests[client]
            client.until(lambda c=client: len(answers(c)) == len(self.requests[c]), "the ends")
            for request, results in answers(client).items():
                self.assertEqual(len(results), 1, (request, asked[request], results))
                self.assertIn(results[0], self.possible(asked[request]), asked[request])
        self.check_nothing_is_left()

    @staticmethod
    def possible(method):
        if method == "manual_backup_cancel":
            return (0,)
        return (0, CANCELLED)

    def check_nothing_is_left(self):
        self.device.quarnctl("backup")
        for package in PACKAGES:
            names = [name for _, _, names in os.walk(self.device.app_path(package))
                     for name in names]
            self.assertEqual(names, ["content"], package)
            self.device.quarnctl("app", "restore", package)


if __name__ == "__main__":
    unittest.main()
