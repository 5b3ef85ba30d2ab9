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

APPLICATIONS = 5000
GROUP = "quarn"
STRANGER = 65534
STATUS = "/org/orvane/Quarn/Status"
SHIPPED = os.path.join(BIN_DIR, "../data/org.orvane.Quarn.conf")


def as_user(user, group=None):
    groups = ("--clear-groups",) if group is None else ("--groups=%s" % group,)
    return ("setpriv", "--reuid=%d" % user, "--regid=%d" % user, *groups)


class Bus(TestCase):
    def setUp(self):
        self.device = self.new_device(serial="350000000000001")
        for path in (self.directory, self.device.path):
            os.chmod(path, 0o755)
        self.device.start()
        self.device.install(make_source(self.path("source"), "org.example.notes", "1.0.0",
                                        {"data/note": b"text"}))

    def call_as(self, user, method, *arguments, path=PATH, destination=NAME, group=None):
        """Exit status of a call from within the device, and what was printed."""
        result = self.device.exec(*as_user(user, group), "gdbus", "call", "--system", "--dest",
                                  destination, "--object-path", path, "--method", method,
                                  *arguments, check=False, cwd="/")
        return result.returncode, result.stdout + result.stderr

    def quarnctl_as(self, user, *arguments, group=None):
        return self.device.exec(*as_user(user, group), os.path.join(BIN_DIR, "quarnctl"),
                                *arguments, check=False, cwd="/")

    def assert_denied(self, outcome):
        self.assertEqual(outcome[0], 1, outcome[1])
        self.assertIn("AccessDenied", outcome[1])

    def test_root_and_the_group_may_call(self):
        for user, group in ((0, None), (STRANGER, GROUP), (APPLICATIONS, GROUP)):
            status, text = self.call_as(user, INTERFACE + ".last_bu_time", group=group)
            self.assertEqual(status, 0, text)
            status, text = self.call_as(user, "org.freedesktop.DBus.Properties.GetAll",
                                        INTERFACE + ".Status", path=STATUS, group=group)
            self.assertEqual(status, 0, text)
            status, text = self.call_as(user, "org.freedesktop.DBus.Introspectable.Introspect",
                                        path=STATUS, group=group)
            self.assertEqual(status, 0, text)

    def test_a_member_of_the_group_is_called_back_and_told(self):
        for user in (STRANGER, 0):
            group = GROUP if user else None
            result = self.quarnctl_as(user, "backup", group=group)
            self.assertEqual(result.returncode, 0, result.stdout + result.stderr)
            self.assertIn("org.example.notes: ", result.stdout + result.stderr, "progress is told")
            result = self.quarnctl_as(user, "app", "restore", "org.example.notes", group=group)
            self.assertEqual(result.returncode, 0, result.stdout + result.stderr)

    def test_an_application_without_a_label_may_nothing(self):
        # There are no labels on this device: whose application it is nobody can tell.
        self.device.quarnctl("status")
        for method, arguments, path in (
                ("app_data_backup_start", ("org.example.notes", "uint32 1"), PATH),
                ("app_data_restore_start", ("org.example.notes", "uint32 1"), PATH),
                ("make_app_data", ("org.example.notes",), PATH),
                ("get_app_list", ("1", "uint32 1"), PATH),
                ("restore_enable", ("1", "1", "", "[]", "uint32 1"), PATH),
                ("Packages.CancelOwn", (), "/org/orvane/Quarn/Packages")):
            status, text = self.call_as(APPLICATIONS, INTERFACE + "." + method, *arguments,
                                        path=path)
            self.assert_denied((status, text))
            member = method.rsplit(".", 1)[-1]
            self.assertIn(member + " is refused: its security label is no package's", text)
            self.device.wait_for_log("refused : %s of (" % member)
        self.assertFalse(os.path.exists(os.path.join(self.device.path, "root/tmp",
                                                     "org.example.notes_tmp.zip")))

    def test_who_is_refused_is_told_what_it_needs(self):
        for user in (APPLICATIONS, STRANGER):
            for arguments in (("backup",), ("status",), ("app", "restore", "org.example.notes")):
                result = self.quarnctl_as(user, *arguments)
                self.assertEqual(result.returncode, 77, result.stdout + result.stderr)
                self.assertEqual(result.stderr, "quarnctl: not permitted: this needs root, or to be "
                                                "in the group quarn\n")

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

    def test_applications_do_not_reach_what_is_for_the_group(self):
        for method, path in ((INTERFACE + ".last_bu_time", PATH),
                             (INTERFACE + ".manual_backup_start", PATH),
                             ("org.freedesktop.DBus.Peer.Ping", PATH),
                             ("org.freedesktop.DBus.Properties.GetAll", STATUS),
                             ("org.example.Other.Method", PATH)):
            self.assert_denied(self.call_as(APPLICATIONS, method, path=path))
        self.assertEqual(self.device.log_of_daemons(), "", "nothing is started")

    def test_only_root_may_own_the_name(self):
        for user in (APPLICATIONS, STRANGER):
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
