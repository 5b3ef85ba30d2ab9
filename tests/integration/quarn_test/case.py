"""What every test on a device is."""
import os
import shutil
import tempfile
import unittest

from .devices import Device
from .places import enter_own_mounts


class TestCase(unittest.TestCase):
    """A test with a directory of its own and devices that are stopped after it."""

    maxDiff = None

    def run(self, result=None):
        enter_own_mounts()
        self.directory = tempfile.mkdtemp(prefix="quarn-it-")
        self.devices = []
        failures = 0 if result is None else len(result.failures) + len(result.errors)
        try:
            super().run(result)
        finally:
            failed = result is not None and len(result.failures) + len(result.errors) > failures
            for device in self.devices:
                device.call("stop", check=False)
                if failed:
                    print("---- log of %s\n%s" % (device.path, device.log()[-20000:]))
            shutil.rmtree(self.directory, ignore_errors=True)

    def path(self, *names):
        return os.path.join(self.directory, *names)

    def new_device(self, name=None, **options):
        device = Device(self.path(name or "device%d" % len(self.devices)), **options)
        self.devices.append(device)
        return device
