"""The status object is what its introspection document says."""
import os
import sys
import unittest
import xml.etree.ElementTree as ElementTree

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, ".."))
sys.path.insert(0, HERE)
from bus_client import Client, GLib  # noqa: E402
from gi.repository import Gio  # noqa: E402
from quarn_test import TestCase, make_source, read_file  # noqa: E402

INTERFACE = "org.orvane.Quarn.Status"
OBJECT = "/org/orvane/Quarn/Status"
PROPERTIES = "org.freedesktop.DBus.Properties"
SERIAL = "350000000000017"
DOCUMENT = os.path.join(HERE, "../../../data/%s.xml" % INTERFACE)


def outline(xml):
    """The interface's elements with their attributes, without comments and white space."""
    wanted = ElementTree.fromstring(xml).find("interface[@name='%s']" % INTERFACE)
    return [(element.tag, sorted(element.attrib.items())) for element in wanted.iter()]


class StatusObject(TestCase):
    def setUp(self):
        self.device = self.new_device(model="Orvane One", serial=SERIAL, account="ada")
        self.device.start()
        self.client = Client(self.device.bus_address())
        self.addCleanup(self.client.close)
        #: What the change signals have said, the last value of each property.
        self.told = {}
        self.client.connection.signal_subscribe(
            None, PROPERTIES, "PropertiesChanged", OBJECT, INTERFACE, Gio.DBusSignalFlags.NONE,
            lambda *arguments: self.told.update(arguments[5].unpack()[1]))

    def properties(self):
        return self.client.call("GetAll", GLib.Variant("(s)", (INTERFACE,)), path=OBJECT,
                                interface=PROPERTIES)[0]

    def wait_until_told(self, **expected):
        self.client.until(lambda: all(self.told.get(name) == value
                                      for name, value in expected.items()),
                          "told: %s" % expected)

    def test_the_daemon_introspects_as_the_installed_document(self):
        served = self.device.exec("gdbus", "introspect", "--xml", "--system", "--dest",
                                  "org.orvane.Quarn", "--object-path", OBJECT).stdout
        self.assertEqual(outline(served), outline(read_file(DOCUMENT)))

    def test_reading_starts_the_daemon_and_tells_everything(self):
        self.device.set("network", "wifi")
        values = self.properties()
        self.assertGreater(values.pop("NextAlarm"), 0)
        self.assertEqual(values, {
            "AutoBackup": False, "ChargerConnected": False, "WifiConnected": True,
            "ScreenOff": False, "ConditionAlarm": 0, "LastBackup": 0, "BackupRunning": False,
            "RestoreMode": False, "RestoreCandidates": [], "CloudProblem": "",
            "SerialNumber": SERIAL, "ModelName": "Orvane One"})

    def test_changes_of_the_device_and_the_setting_are_told(self):
        self.properties()
        self.client.call("backup_enable", GLib.Variant("(i)", (1,)))
        self.wait_until_told(AutoBackup=True)
        self.device.set("charger", "on")
        self.device.set("display", "off")
        self.client.until(lambda: self.told.get("ConditionAlarm", 0) > 0, "the alarm is told")
        self.assertIs(self.told["ScreenOff"], True)
        self.assertEqual(self.told["ConditionAlarm"], self.properties()["ConditionAlarm"])
        self.device.set("network", "none")
        self.wait_until_told(WifiConnected=False, ConditionAlarm=0)
        self.client.call("backup_enable", GLib.Variant("(i)", (0,)))
        self.wait_until_told(AutoBackup=False)

    def test_a_backups_begin_and_end_are_told(self):
        self.device.install(make_source(self.path("source"), "org.example.notes", "1.0",
                                        {"data/file": b"text"}))
        self.client.call("manual_backup_start", GLib.Variant("(u)", (1,)))
        self.client.until(lambda: self.client.callbacks("manual_backup_status")[-1:] ==
                          [("manual_backup_status", (0, 4, 1))], "the run succeeds")
        self.wait_until_told(BackupRunning=False)
        self.client.until(lambda: self.told.get("LastBackup", 0) > 0, "its time is told")
        self.assertEqual(self.properties()["LastBackup"], self.told["LastBackup"])

    def test_restore_mode_and_what_it_waits_for_are_told(self):
        self.properties()
        packages = '["org.example.notes", "org.example.maps"]'
        self.client.call("restore_enable", GLib.Variant("(iissu)", (1, 0, SERIAL, packages, 2)))
        self.wait_until_told(RestoreMode=True,
                             RestoreCandidates=["org.example.notes", "org.example.maps"])
        self.client.call("restore_enable", GLib.Variant("(iissu)", (0, 0, "", "[]", 3)))
        self.wait_until_told(RestoreMode=False, RestoreCandidates=[])

    def test_nothing_can_be_written(self):
        name, _text = self.client.error_of(
            "Set", GLib.Variant("(ssv)", (INTERFACE, "AutoBackup", GLib.Variant("b", True))),
            path=OBJECT, interface=PROPERTIES)
        self.assertEqual(name, "org.freedesktop.DBus.Error.InvalidArgs")
        self.assertIs(self.properties()["AutoBackup"], False)


if __name__ == "__main__":
    unittest.main()
