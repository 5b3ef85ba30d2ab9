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
from gi.repository import Gio, GLib  # noqa: E402
from quarn_test import BIN_DIR, read_file  # noqa: E402

DATA_DIR = os.path.join(BIN_DIR, "../data")
#: The client user of the default build; a bus takes only users that the system knows.
CONFIGURED_USER = 5000
CONFIGURED_GROUP = "quarn"
#: These are known everywhere: a user as which applications run here, one that may do nothing, and a
#: group that makes a member of him.
CLIENT_USER = 1
STRANGER = 65534
GROUP = "daemon"
GROUP_NUMBER = 1

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
        policy = read_file(os.path.join(DATA_DIR, "org.orvane.Quarn.conf"))
        user = '<policy user="%d">' % CONFIGURED_USER
        group = '<policy group="%s">' % CONFIGURED_GROUP
        assert user in policy and group in policy
        policy = policy.replace(group, '<policy group="%s">' % GROUP)
        policy_file = os.path.join(cls.directory.name, "policy.conf")
        with open(policy_file, "w") as file:
            file.write(policy.replace(user, '<policy user="%d">' % CLIENT_USER))
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

    def call_as(self, user, method, path=PATH, arguments=(), groups=(), destination=NAME):
        """Exit status and what was printed by a caller of that user."""
        caller = subprocess.Popen(
            ["gdbus", "call", "--address", self.address, "--dest", destination, "--object-path",
             path, "--method", method, *arguments],
            stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, user=user,
            group=STRANGER if user else 0, extra_groups=list(groups))
        self.owner.until(lambda: caller.poll() is not None, "the call ends")
        with caller.stdout:
            return caller.returncode, caller.stdout.read()

    CALLBACK = INTERFACE + ".manual_backup_cancel_result"
    ARGUMENTS = ("0", "uint32 1")
    STATUS = "/org/orvane/Quarn/Status"
    PACKAGES = "/org/orvane/Quarn/Packages"
    #: Method and path of what only root and the group may ask for.
    TRUSTED = (
        [(INTERFACE + "." + method, PATH) for method in (
            "set_activation", "backup_enable", "last_bu_time", "auto_backup_start",
            "manual_backup_start", "manual_backup_cancel", "manual_backup_cancel_result", "fly")] +
        [("org.freedesktop.DBus.Properties.GetAll", "/org/orvane/Quarn/Status"),
         ("org.freedesktop.DBus.Properties.Get", "/org/orvane/Quarn/Status"),
         ("org.orvane.Quarn.Packages.Restore", "/org/orvane/Quarn/Packages"),
         ("org.freedesktop.DBus.Peer.Ping", PATH), ("org.freedesktop.DBus.Peer.Ping", "/"),
         ("org.freedesktop.DBus.Introspectable.Introspect", PATH),
         ("org.freedesktop.DBus.Introspectable.Introspect", "/"),
         ("org.example.Other.method", PATH)])
    #: What reaches the daemon from the applications' user as well; the labels decide there.
    APPLICATIONS = (
        [(INTERFACE + "." + method, PATH) for method in (
            "app_data_backup_start", "app_data_restore_start", "make_app_data", "get_app_list",
            "restore_enable")] + [("org.orvane.Quarn.Packages.CancelOwn", PACKAGES)])

    def passes(self, user, method, path, **how):
        """Whether the bus lets the call through, whatever the other end makes of it."""
        status, text = self.call_as(user, method, path=path, **how)
        if status == 0:
            return True
        return "AccessDenied" not in text

    def test_2_root_and_the_group_may_call_everything(self):
        for user, groups in ((0, ()), (STRANGER, (GROUP_NUMBER,))):
            status, text = self.call_as(user, self.CALLBACK, arguments=self.ARGUMENTS,
                                        groups=groups)
            self.assertEqual((status, text.strip()), (0, "(0,)"), user)
            for method, path in self.TRUSTED + self.APPLICATIONS:
                self.assertTrue(self.passes(user, method, path, groups=groups), (user, method))

    def test_3_the_applications_user_reaches_what_applications_may_ask_for(self):
        for method, path in self.APPLICATIONS:
            self.assertTrue(self.passes(CLIENT_USER, method, path), method)
        for method, path in self.TRUSTED:
            self.assertFalse(self.passes(CLIENT_USER, method, path), method)
        # Neither under another path nor another interface.
        for method, path in ((INTERFACE + ".make_app_data", "/"),
                             ("org.example.Other.make_app_data", PATH),
                             ("org.example.Other.CancelOwn", self.PACKAGES)):
            self.assertFalse(self.passes(CLIENT_USER, method, path), method)

    def test_4_strangers_may_not_call(self):
        for method, path in self.TRUSTED + self.APPLICATIONS:
            status, text = self.call_as(STRANGER, method, path=path)
            self.assertNotEqual(status, 0)
            self.assertIn("AccessDenied", text)

    def test_a_daemon_that_has_given_its_name_up_is_reached_by_nobody_else(self):
        self.assertEqual(self.owner.bus("ReleaseName", GLib.Variant("(s)", (NAME,))), (1,))
        self.addCleanup(self.owner.bus, "RequestName", GLib.Variant("(su)", (NAME, 4)))
        # Its connection is called by its own name, which nobody can take from it.
        for user in (CLIENT_USER, STRANGER):
            for method, path in self.TRUSTED + self.APPLICATIONS:
                self.assertFalse(self.passes(user, method, path, destination=self.owner.name),
                                 method)
        self.assertEqual(self.owner.callbacks("fly"), [])

    LISTENER = """
import sys
import gi
gi.require_version("Gio", "2.0")
from gi.repository import Gio, GLib
bus = Gio.DBusConnection.new_for_address_sync(
    sys.argv[1], Gio.DBusConnectionFlags.AUTHENTICATION_CLIENT |
    Gio.DBusConnectionFlags.MESSAGE_BUS_CONNECTION, None, None)
loop = GLib.MainLoop()
def heard(_bus, _sender, path, interface, signal, _arguments):
    print(path, interface + "." + signal, flush=True)
    if signal == "Enough":
        loop.quit()
bus.signal_subscribe(None, None, None, None, None, Gio.DBusSignalFlags.NONE, heard)
# A round trip: the bus knows of the subscription.
bus.call_sync("org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus", "GetId",
              None, None, Gio.DBusCallFlags.NONE, -1, None)
print("ready", flush=True)
loop.run()
"""

    def heard_by(self, user, groups=()):
        """The signals of the daemon that a listener of that user receives."""
        listener = subprocess.Popen(
            [sys.executable, "-c", self.LISTENER, self.address], stdout=subprocess.PIPE, text=True,
            user=user, group=STRANGER if user else 0, extra_groups=list(groups))
        with listener.stdout:
            while listener.stdout.readline().strip() != "ready":
                self.assertIsNone(listener.poll())
            for path, interface, signal in (
                    ("/progress", INTERFACE, "progress"),
                    (self.STATUS, "org.freedesktop.DBus.Properties", "PropertiesChanged"),
                    ("/org/example", "org.example.End", "Enough")):
                self.owner.connection.emit_signal(None, path, interface, signal, None)
            lines = listener.stdout.read().splitlines()
        self.assertEqual(listener.wait(), 0)
        self.assertEqual(lines.pop(), "/org/example org.example.End.Enough")
        return [line for line in lines if "DBus.Name" not in line]

    def test_only_root_and_the_group_hear_what_the_daemon_tells_all(self):
        told = ["/progress org.orvane.Quarn.progress",
                self.STATUS + " org.freedesktop.DBus.Properties.PropertiesChanged"]
        self.assertEqual(self.heard_by(0), told)
        self.assertEqual(self.heard_by(STRANGER, (GROUP_NUMBER,)), told)
        self.assertEqual(self.heard_by(CLIENT_USER), [])
        self.assertEqual(self.heard_by(STRANGER), [])

    def test_nobody_else_tells_what_looks_like_the_daemons(self):
        told = []
        listener = Client(self.address)
        self.addCleanup(listener.close)
        listener.connection.signal_subscribe(
            None, INTERFACE, None, None, None, Gio.DBusSignalFlags.NONE,
            lambda *arguments: told.append(arguments[4]))
        listener.bus("GetId", None)
        for user in (CLIENT_USER, STRANGER, 0):
            emitter = subprocess.Popen(
                ["dbus-send", "--bus=" + self.address, "--type=signal", "/progress",
                 INTERFACE + ".user%d" % user], stderr=subprocess.DEVNULL, user=user,
                group=STRANGER if user else 0, extra_groups=[])
            listener.until(lambda: emitter.poll() is not None, "it has told")
        listener.until(lambda: told, "root's")
        self.assertEqual(told, ["user0"])

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
        text = read_file(os.path.join(DATA_DIR, name))
        self.assertNotRegex(text, "@[A-Z_]+@")
        parser.read_string(text)
        return parser

    def test_policy_is_well_formed(self):
        tree = ElementTree.parse(os.path.join(DATA_DIR, "org.orvane.Quarn.conf"))
        self.assertEqual(tree.getroot().tag, "busconfig")

    def test_group_is_made_by_the_system(self):
        lines = read_file(os.path.join(DATA_DIR, "quarnd-sysusers.conf")).splitlines()
        self.assertEqual(lines[-1], "g %s -" % CONFIGURED_GROUP)

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
