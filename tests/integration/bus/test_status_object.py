"""The status object is what its introspection document says."""
import os
import sys
import unittest
import xml.etree.ElementTree as ElementTree

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, ".."))
from quarn_test import TestCase  # noqa: E402

INTERFACE = "org.orvane.Quarn.Status"
DOCUMENT = os.path.join(HERE, "../../../data/%s.xml" % INTERFACE)


def outline(xml):
    """The interface's elements with their attributes, without comments and white space."""
    wanted = ElementTree.fromstring(xml).find("interface[@name='%s']" % INTERFACE)
    return [(element.tag, sorted(element.attrib.items())) for element in wanted.iter()]


class StatusObject(TestCase):
    def test_the_daemon_introspects_as_the_installed_document(self):
        device = self.new_device(model="Orvane One", serial="350000000000017", account="ada")
        device.start()
        served = device.exec("gdbus", "introspect", "--xml", "--system", "--dest",
                             "org.orvane.Quarn", "--object-path", "/org/orvane/Quarn/Status").stdout
        with open(DOCUMENT) as file:
            self.assertEqual(outline(served), outline(file.read()))


if __name__ == "__main__":
    unittest.main()
