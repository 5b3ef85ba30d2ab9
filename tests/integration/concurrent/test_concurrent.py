"""Requests that meet: every one is answered once, and nothing half done stays."""
import os
import subprocess
import sys
import unittest
import zipfile

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path[:0] = [os.path.join(HERE, ".."), os.path.join(HERE, "../bus")]
from bus_client import Client, GLib  # noqa: E402
from quarn_test import TestCase, make_source  # noqa: E402

PACKAGES = ["org.example.p%d" % index for index in range(6)]


class ConcurrentRequests(TestCase):
    def setUp(self):
        self.device = self.new_device(serial="350000000000001", model="Orvane One")
        self.device.start()
        self.install(self.device, PACKAGES)
        self.client = Client(self.device.bus_address())

    def install(self, device, packages):
        for package in packages:
            device.install(make_source(self.path(package), package, "1.0.0",
                                       {"data/content": os.urandom(1000000)}))

    def states(self, request):
        return [event[1][:2] for event in self.client.events
                if event[0] == "manual_backup_status" and event[1][2] == request]

    def start_backup(self, request):
        return self.client.start("manual_backup_start", GLib.Variant("(u)", (request,)))

    def until_ended(self, *requests):
        self.client.until(lambda: all(len(self.states(request)) == 2 for request in requests),
                          "the backups end")

    def until_archiving(self):
        self.client.until(lambda: "=== make backup items ===" in self.device.log(), "archiving")

    def test_a_cancel_ends_the_running_backup_and_those_that_wait(self):
        for request in (1, 2, 3):
            self.start_backup(request)
        self.until_archiving()
        self.client.start("manual_backup_cancel", GLib.Variant("(u)", (9,)))
        self.until_ended(1, 2, 3)
        for request in (1, 2, 3):
            self.assertEqual(self.states(request), [(0, 2), (17, 6)])
        self.start_backup(4)
        self.until_ended(4)
        self.assertEqual(self.states(4), [(0, 2), (0, 4)])

    def test_requests_of_every_kind_beside_a_backup_are_each_answered_once(self):
        client = self.client
        self.start_backup(1)
        self.until_archiving()
        calls = [client.start("app_data_backup_start", GLib.Variant("(su)", (package, 10 + index)))
                 for index, package in enumerate(PACKAGES + PACKAGES[:2])]
        calls.append(client.start("get_app_list", GLib.Variant("(iu)", (0, 50))))
        calls.append(client.start("set_activation", GLib.Variant("(i)", (0,))))
        calls.append(client.start("make_app_data", GLib.Variant("(s)", (PACKAGES[0],))))
        self.until_ended(1)
        client.until(lambda: all(call.done for call in calls), "the replies")
        client.until(lambda: any(event[0] == "get_app_list_cb" for event in client.events), "list")
        self.assertEqual([call.error for call in calls], [None] * len(calls))
        self.assertEqual(self.states(1), [(0, 2), (0, 4)])
        ended = [event[1] for event in client.events if event[0] == "app_data_backup_complete"]
        self.assertEqual(sorted(answer[2] for answer in ended), list(range(10, 18)))
        self.assertEqual({answer[0] for answer in ended}, {0})
        for package in PACKAGES:
            with zipfile.ZipFile(os.path.join(self.device.cloud, self.device.serial, package,
                                              "1.0.0", package + ".zip")) as archive:
                self.assertIsNone(archive.testzip())
        left = [name for package in PACKAGES
                for _, _, names in os.walk(self.device.app_path(package)) for name in names]
        self.assertEqual(left, ["content"] * len(PACKAGES))

    def test_a_client_that_is_gone_does_not_stop_its_backup(self):
        self.start_backup(1)
        self.until_archiving()
        self.client.connection.close_sync(None)
        self.device.wait_for_log("manual backup successful!")
        self.assertEqual(Client(self.device.bus_address()).call(
            "set_activation", GLib.Variant("(i)", (1,))), (0,))

    def test_two_devices_that_write_the_list_at_once_lose_no_entry(self):
        other = self.new_device(serial="350000000000002", model="Orvane Two",
                                cloud="file://" + self.device.cloud)
        other.start()
        self.install(other, ["org.example.q0"])
        for _ in range(3):
            both = [device.begin("quarnctl", "backup", stdout=subprocess.DEVNULL,
                                 stderr=subprocess.DEVNULL)
                    for device in (self.device, other)]
            for run in both:
                self.assertIn(run.wait(), (0, 12))
        for device in (self.device, other):
            device.quarnctl("backup")
        models = self.device.app_list()["model_list"]
        self.assertEqual({model["backup_info"]["serial_number"]: len(model["pkg_list"])
                          for model in models},
                         {"350000000000001": len(PACKAGES), "350000000000002": 1})


if __name__ == "__main__":
    unittest.main()
