"""The files that the bus and the service manager read: well-formed, and saying what they should."""
import configparser
import os
import subprocess
import sys
import tempfile
import unittest
import xml.etree.ElementTree as ElementTree

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
from bus_client import INTERFACE, NAME, PATH, Client  # noqa: E402
from gi.repository import GLib  # noqa: E402
from quarn_test import BIN_DIR  # noqa: E402

DATA_DIR = os.path.join(BIN_DIR, "../data")
#: The client user of the default build; a bus takes only users that the system knows.
CONFIGURED_USER = 5000
#: These two are known everywhere.
CLIENT_USER = 1
STRANGER = 65534

#: What a distribution's system bus allows before the policies of services.
BUS = """<!DOCTYPE busconfig PUBLIC "-//freedesktop//DTD D-BUS Bus Configuration 1.0//EN"
 "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">
<busconfig>
  <listen>unix:path=%(directory)s/bus</listen>
  <auth>EXTERNAL</auth>
  <policy context="default">
    <allow user="*"/>
    <deny own="*"/>
    <deny send_type="method_call"/>
    <allow send_type="signal"/>
    <allow send_requested_reply="true" send_type="method_return"/>
    <allow send_requested_reply="true" send_type="error"/>
    <allow receive_type="method_call"/>
    <allow receive_type="method_return"/>
    <allow receive_type="error"/>
    <allow receive_type="signal"/>
    <allow send_destination="org.freedesktop.DBus"/>
  </policy>
  <include>%(policy)s</include>
</busconfig>
"""


class Policy(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.directory = tempfile.TemporaryDirectory(prefix="quarn-policy-")
        os.chmod(cls.directory.name, 0o755)
        with open(os.path.join(DATA_DIR, "org.orvane.Quarn.conf")) as file:
            policy = file.read()
        configured = '<policy user="%d">' % CONFIGURED_USER
        assert configured in policy
        policy_file = os.path.join(cls.directory.name, "policy.conf")
        with open(policy_file, "w") as file:
            file.write(policy.replace(configured, '<policy user="%d">' % CLIENT_USER))
        config = os.path.join(cls.directory.name, "bus.conf")
        with open(config, "w") as file:
            file.write(BUS % {"directory": cls.directory.name, "policy": policy_file})
        cls.bus = subprocess.Popen(["dbus-daemon", "--nofork", "--nopidfile", "--nosyslog",
                                    "--print-address", "--config-file=" + config],
                                   stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, text=True)
        cls.address = cls.bus.stdout.readline().strip()
        # It stands for the daemon: owns the name, exports an object of the same path.
        cls.owner = Client(cls.address)

    @classmethod
    def tearDownClass(cls):
        cls.owner.close()
        cls.bus.terminate()
        cls.bus.wait()
        cls.bus.stdout.close()
        cls.directory.cleanup()

    def test_1_root_may_own_the_name(self):
        self.assertEqual(self.owner.bus("RequestName", GLib.Variant("(su)", (NAME, 4))), (1,))

    def call_as(self, user, method, path=PATH, arguments=()):
        """Exit status and what was printed by a caller of that user."""
        caller = subprocess.Popen(
            ["gdbus", "call", "--address", self.address, "--dest", NAME, "--object-path", path,
             "--method", method, *arguments],
            stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, user=user, group=user,
            extra_groups=[])
        self.owner.until(lambda: caller.poll() is not None, "the call ends")
        with caller.stdout:
            return caller.returncode, caller.stdout.read()

    CALLBACK = INTERFACE + ".manual_backup_cancel_result"
    ARGUMENTS = ("0", "uint32 1")

    def test_2_root_and_the_client_user_may_call(self):
        for user in (0, CLIENT_USER):
            status, text = self.call_as(user, self.CALLBACK, arguments=self.ARGUMENTS)
            self.assertEqual((status, text.strip()), (0, "(0,)"), user)

    def test_3_the_client_user_may_look_but_call_nothing_else(self):
        status, text = self.call_as(CLIENT_USER, "org.freedesktop.DBus.Introspectable.Introspect")
        self.assertEqual(status, 0, text)
        status, text = self.call_as(CLIENT_USER, "org.freedesktop.DBus.Properties.GetAll",
                                    path="/org/orvane/Quarn/Status", arguments=("org.x",))
        self.assertNotIn("AccessDenied", text)
        status, text = self.call_as(CLIENT_USER, "org.orvane.Quarn.Packages.CancelOwn",
                                    path="/org/orvane/Quarn/Packages")
        self.assertNotIn("AccessDenied", text)
        status, text = self.call_as(CLIENT_USER, "org.example.Other.method")
        self.assertNotEqual(status, 0)
        self.assertIn("AccessDenied", text)

    def test_4_strangers_may_not_call(self):
        for method, path in ((self.CALLBACK, PATH),
                             ("org.orvane.Quarn.Packages.CancelOwn", "/org/orvane/Quarn/Packages"),
                             ("org.freedesktop.DBus.Properties.GetAll", "/org/orvane/Quarn/Status")):
            status, text = self.call_as(STRANGER, method, path=path,
                                        arguments=self.ARGUMENTS[:2])
            self.assertNotEqual(status, 0)
            self.assertIn("AccessDenied", text)

    def test_5_only_root_may_own_the_name(self):
        for user in (CLIENT_USER, STRANGER):
            result = subprocess.run(
                ["gdbus", "call", "--address", self.address, "--dest", "org.freedesktop.DBus",
                 "--object-path", "/", "--method", "org.freedesktop.DBus.RequestName", NAME, "4"],
                stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, user=user, group=user,
                extra_groups=[])
            self.assertNotEqual(result.returncode, 0)
            self.assertIn("AccessDenied", result.stdout)

    def test_6_root_may_call_clients_back(self):
        client = Client(self.address)
        call = self.owner.start("manual_backup_status", GLib.Variant("(iiu)", (0, 2, 1)),
                                destination=client.name)
        self.owner.until(lambda: call.done, "the callback is answered")
        self.assertEqual((call.reply, call.error), ((0,), None))
        client.close()


class Files(unittest.TestCase):
    def ini(self, name):
        parser = configparser.ConfigParser(strict=False, interpolation=None)
        parser.optionxform = str
        with open(os.path.join(DATA_DIR, name)) as file:
            text = file.read()
        self.assertNotRegex(text, "@[A-Z_]+@")
        parser.read_string(text)
        return parser

    def test_policy_is_well_formed(self):
        tree = ElementTree.parse(os.path.join(DATA_DIR, "org.orvane.Quarn.conf"))
        self.assertEqual(tree.getroot().tag, "busconfig")

    def test_activation_and_unit_name_one_program_and_one_name(self):
        activation = self.ini("org.orvane.Quarn.service")["D-BUS Service"]
        unit = self.ini("quarnd.service")["Service"]
        self.assertEqual(activation["Name"], NAME)
        self.assertEqual(unit["BusName"], NAME)
        self.assertEqual(activation["Exec"], unit["ExecStart"])
        self.assertEqual(activation["SystemdService"], "quarnd.service")
        self.assertEqual(activation["User"], "root")

    def test_unit_starts_the_daemon_again_after_a_wanted_restart_only(self):
        unit = self.ini("quarnd.service")["Service"]
        self.assertEqual(unit["Restart"], "on-failure")
        self.assertEqual(unit["RestartPreventExitStatus"], "0")


if __name__ == "__main__":
    unittest.main(verbosity=2)
