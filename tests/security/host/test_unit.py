"""What the service manager lets the daemon do: no more than the threat model gives a reason for."""
import configparser
import os
import re
import shutil
import stat
import subprocess
import sys
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, "../../integration"))
from quarn_test import (  # noqa: E402
    BIN_DIR, TestCase, is_sanitized, make_source, read_bytes, read_file, wait_until)

import system_calls  # noqa: E402

UNITS = os.path.join(BIN_DIR, "../data")
MODEL = os.path.join(HERE, "../../../docs/threat-model.md")
MOST_EXPOSED = 3.0
BOTH = ("quarnd.service", "quarnd-recover.service")


def table(heading):
    """First cells of the table below a heading of the threat model."""
    text = read_file(MODEL)
    section = text[text.index("\n#### " + heading):].split("\n#", 2)[1]
    rows = [re.split(r"(?<!\\)\|", line)[1].strip() for line in section.splitlines()
            if line.startswith("|")]
    return {re.sub(r"[`\\]", "", cell) for row in rows[2:] for cell in row.split(", ")}


def section_of(unit):
    parser = configparser.RawConfigParser(strict=False, interpolation=None)
    parser.optionxform = str
    parser.read(os.path.join(UNITS, unit))
    return parser["Service"]


def analysis(unit):
    """Overall exposure, and the names of what counts to it."""
    told = subprocess.run(
        ["systemd-analyze", "security", "--offline=yes", "--no-pager", os.path.join(UNITS, unit)],
        stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True,
        env=dict(os.environ, LC_ALL="C.UTF-8"))
    overall = re.search(r"Overall exposure level for \S+: ([0-9.]+)", told.stdout)
    assert overall, told
    open_ones = {line.split()[1] for line in told.stdout.splitlines() if line.startswith("✗")}
    return float(overall.group(1)), open_ones


class Unit(unittest.TestCase):
    def test_exposes_at_most_what_is_agreed(self):
        for unit in BOTH:
            with self.subTest(unit):
                self.assertLessEqual(analysis(unit)[0], MOST_EXPOSED)

    def test_each_exposure_that_stays_has_its_reason(self):
        self.assertEqual(table("What stays open"), analysis("quarnd.service")[1])
        self.assertLessEqual(analysis("quarnd-recover.service")[1],
                             table("What stays open") | {"RestrictAddressFamilies=~AF_UNIX"})

    def test_capabilities_are_those_that_have_a_use(self):
        for unit in BOTH:
            with self.subTest(unit):
                self.assertEqual(table("Capabilities"),
                                 set(section_of(unit)["CapabilityBoundingSet"].split()))
                self.assertEqual("", section_of(unit)["AmbientCapabilities"])

    def test_private_data_reaches_no_core_file_and_memory_is_bounded(self):
        for unit in BOTH:
            with self.subTest(unit):
                section = section_of(unit)
                self.assertEqual("0", section["LimitCORE"])
                self.assertRegex(section["MemoryMax"], r"^[0-9]+%$")
                self.assertRegex(section["LimitDATA"], r"^[0-9]+M$")

    def test_is_one_that_the_service_manager_understands(self):
        for unit in BOTH:
            with self.subTest(unit):
                told = subprocess.run(["systemd-analyze", "verify", os.path.join(UNITS, unit)],
                                      stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True)
                # Beside the daemon's program, which is installed or not.
                unknown = [line for line in told.stdout.splitlines()
                           if unit in line and "is not executable" not in line]
                self.assertEqual([], unknown)


class WithTheUnitsCapabilities(TestCase):
    """The whole job, by a daemon that has only the rights and system calls that the unit leaves it."""

    PACKAGE = "org.example.notes"
    SERIAL = "350000000000001"
    #: Of the set-id bits, too, which need a capability of their own where the group is another's.
    FILES = {"data/program": (b"program", 0o6755), "data/closed": (b"closed", 0o000),
             "data/deep/er/text": (b"text", 0o640), "shared/data/list": (b"list", 0o666),
             "data/shut/text": (b"within", 0o600), "data/fixed/text": (b"fixed", 0o444)}
    #: Folders that their own application has closed to itself.
    FOLDERS = {"data/shut": 0o000, "data/fixed": 0o555}

    def setUp(self):
        wanted = section_of("quarnd.service")["CapabilityBoundingSet"].lower().replace("cap_", "+")
        self.limited = ["setpriv", "--no-new-privs",
                        "--bounding-set=-all," + ",".join(wanted.split()),
                        "--inh-caps=-all"]
        programs = self.path("programs")
        runtime = self.path("runtime")
        os.mkdir(programs)
        os.mkdir(runtime, 0o700)
        for name in ("quarn-device", "quarnctl"):
            shutil.copy(os.path.join(BIN_DIR, name), programs)
        unit = section_of("quarnd.service")
        daemon = [os.path.realpath(os.path.join(BIN_DIR, "quarnd"))]
        if not is_sanitized(daemon[0]):  # which maps more, and traces itself
            self.limited += ["prlimit", "--core=" + unit["LimitCORE"],
                             "--data=%d" % (int(unit["LimitDATA"].rstrip("M")) << 20)]
            if system_calls.known_here():
                daemon = ["/usr/bin/python3", "-B", system_calls.__file__,
                          os.path.realpath(os.path.join(UNITS, "quarnd.service")), *daemon]
        with open(os.path.join(programs, "quarnd"), "w") as file:
            # Where it has no folder of its own to run in, the main loop's library makes one, as others.
            file.write("#!/bin/sh\numask %s\nexport XDG_RUNTIME_DIR=%s\nexec %s \"$@\"\n" % (
                unit["UMask"], runtime, " ".join(self.limited + daemon)))
        os.chmod(os.path.join(programs, "quarnd"), 0o755)
        self.device = self.new_device(serial=self.SERIAL)
        self.device.tool = os.path.join(programs, "quarn-device")
        # Whoever labels the package may do no more than the daemon: labels are then of one kind.
        source = make_source(self.path("source"), self.PACKAGE, "1.0.0", self.FILES)
        subprocess.run([*self.limited, self.device.tool, "install", self.device.path, source],
                       check=True)
        for path, mode in self.FOLDERS.items():
            os.chmod(self.device.app_path(self.PACKAGE, path), mode)
        self.device.start()

    def present(self):
        found = {path: stat.S_IMODE(os.stat(self.device.app_path(self.PACKAGE, path)).st_mode)
                 for path in self.FOLDERS}
        for path in self.FILES:
            name = self.device.app_path(self.PACKAGE, path)
            status = os.stat(name)
            found[path] = (read_bytes(name), status.st_mode & 0o7777, status.st_uid, status.st_gid)
        return found

    def test_backup_export_and_restore(self):
        before = self.present()
        self.assertEqual({**self.FOLDERS, **{path: (content, mode, 5000, 5000)
                                             for path, (content, mode) in self.FILES.items()}},
                         before)
        self.device.quarnctl("backup")
        pid = wait_until(self.device.daemon_pid, "the daemon runs")
        status = read_file("/proc/%d/status" % pid)
        effective = re.search(r"CapEff:\s+([0-9a-f]+)", status).group(1)
        # CHOWN, DAC_OVERRIDE, FOWNER, FSETID, SETGID, SETUID, MAC_OVERRIDE, MAC_ADMIN
        self.assertEqual(0x3000000db, int(effective, 16))
        self.device.quarnctl("app", "export", self.PACKAGE)
        shutil.rmtree(self.device.app_path(self.PACKAGE, "data/deep"))
        for path in ("data/program", "data/closed", "shared/data/list", "data/shut/text",
                     "data/fixed/text"):
            os.unlink(self.device.app_path(self.PACKAGE, path))
        self.device.quarnctl("app", "restore", self.PACKAGE)
        self.assertEqual(before, self.present())


if __name__ == "__main__":
    unittest.main()
