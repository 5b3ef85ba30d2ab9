"""The device's bus is one with a distribution's defaults and the policy that is shipped."""
import os
import subprocess
import sys
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, ".."))
sys.path.insert(0, os.path.join(HERE, "../bus"))
from bus_client import INTERFACE, NAME, PATH, Client  # noqa: E402
from gi.repository import GLib  # noqa: E402
from quarn_test import BIN_DIR, TestCase, make_source, read_text  # noqa: E402

CLIENT_USER = 5000
STRANGER = 65534
STATUS = "/org/orvane/Quarn/Status"
SHIPPED = os.path.join(BIN_DIR, "../data/org.orvane.Quarn.conf")


def as_user(user):
    return ("setpriv", "--reuid=%d" % user, "--regid=%d" % user, "--clear-groups")


class Bus(TestCase):
    def setUp(self):
        self.device = self.new_device(serial="350000000000001")
        for path in (self.directory, self.device.path):
            os.chmod(path, 0o755)
        self.device.start()
        self.device.install(make_source(self.path("source"), "org.example.notes", "1.0.0",
                                        {"data/note": b"text"}))

    def call_as(self, user, method, *arguments, path=PATH, destination=NAME):
        """Exit status of a call from within the device, and what was printed."""
        result = self.device.exec(*as_user(user), "gdbus", "call", "--system", "--dest",
                                  destination, "--object-path", path, "--method", method,
                                  *arguments, check=False, cwd="/")
        return result.returncode, result.stdout + result.stderr

    def quarnctl_as(self, user, *arguments):
        return self.device.exec(*as_user(user), os.path.join(BIN_DIR, "quarnctl"), *arguments,
                                check=False, cwd="/")

    def assert_denied(self, outcome):
        self.assertEqual(outcome[0], 1, outcome[1])
        self.assertIn("AccessDenied", outcome[1])

    def test_root_and_the_client_user_may_call(self):
        for user in (0, CLIENT_USER):
            status, text = self.call_as(user, INTERFACE + ".last_bu_time")
            self.assertEqual(status, 0, text)
            status, text = self.call_as(user, "org.freedesktop.DBus.Properties.GetAll",
                                        INTERFACE + ".Status", path=STATUS)
            self.assertEqual(status, 0, text)

    def test_the_client_user_is_called_back(self):
        result = self.quarnctl_as(CLIENT_USER, "backup")
        self.assertEqual(result.returncode, 0, result.stdout + result.stderr)
        result = self.quarnctl_as(CLIENT_USER, "app", "restore", "org.example.notes")
        self.assertEqual(result.returncode, 0, result.stdout + result.stderr)

    def test_others_may_not_call_and_start_nothing(self):
        for path, method in ((PATH, INTERFACE + ".last_bu_time"),
                             (PATH, "org.freedesktop.DBus.Introspectable.Introspect"),
                             (PATH, "org.freedesktop.DBus.Peer.Ping")):
            self.assert_denied(self.call_as(STRANGER, method, path=path))
        self.assert_denied(self.call_as(STRANGER, "org.freedesktop.DBus.Properties.GetAll",
                                        INTERFACE + ".Status", path=STATUS))
        result = self.quarnctl_as(STRANGER, "backup")
        self.assertEqual(result.returncode, 77, result.stdout + result.stderr)
        self.assertEqual(self.device.log_of_daemons(), "")

    def test_the_client_user_may_call_nothing_else_of_the_daemon(self):
        self.assert_denied(self.call_as(CLIENT_USER, "org.freedesktop.DBus.Peer.Ping"))
        self.assert_denied(self.call_as(CLIENT_USER, "org.example.Other.Method"))

    def test_only_root_may_own_the_name(self):
        for user in (CLIENT_USER, STRANGER):
            self.assert_denied(self.call_as(user, "org.freedesktop.DBus.RequestName", NAME, "4",
                                            path="/org/freedesktop/DBus",
                                            destination="org.freedesktop.DBus"))
        client = Client(self.device.bus_address())
        self.addCleanup(client.close)
        self.assertEqual(client.bus("RequestName", GLib.Variant("(su)", (NAME, 4))), (1,))

    def test_a_stranger_from_outside_the_device_is_refused_too(self):
        result = subprocess.run(
            [*as_user(STRANGER), "gdbus", "call", "--address", self.device.bus_address(), "--dest",
             NAME, "--object-path", PATH, "--method", INTERFACE + ".last_bu_time"],
            capture_output=True, text=True, cwd="/")
        self.assert_denied((result.returncode, result.stderr))

    def test_clients_may_not_call_each_other(self):
        client = Client(self.device.bus_address())
        self.addCleanup(client.close)
        caller = subprocess.Popen(
            [*as_user(STRANGER), "gdbus", "call", "--address", self.device.bus_address(), "--dest",
             client.name, "--object-path", PATH, "--method",
             INTERFACE + ".manual_backup_cancel_result", "0", "uint32 1"],
            stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, cwd="/")
        client.until(lambda: caller.poll() is not None, "the call ends")
        with caller.stdout:
            self.assert_denied((caller.returncode, caller.stdout.read()))
        self.assertEqual(client.events, [])

    def test_the_policy_is_the_shipped_one(self):
        used = os.path.join(self.device.path, "run/org.orvane.Quarn.conf")
        self.assertEqual(read_text(used), read_text(SHIPPED))
        self.assertIn("<include>%s</include>" % used,
                      read_text(os.path.join(self.device.path, "run/bus.conf")))

    def test_a_policy_that_is_edited_is_the_next_starts_own_again(self):
        used = os.path.join(self.device.path, "run/org.orvane.Quarn.conf")
        with open(used, "w") as file:
            file.write("<busconfig/>")
        self.device.stop()
        self.device.start()
        self.assertEqual(read_text(used), read_text(SHIPPED))


if __name__ == "__main__":
    unittest.main(verbosity=2)
