"""quarn-device: what happens between start and stop, and when things go wrong."""
import os
import select
import shutil
import signal
import stat
import subprocess
import sys
import time
import unittest

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
from quarn_test import (  # noqa: E402
    BIN_DIR, DEADLINE, TestCase, make_source, processes_naming, read_bytes, read_file,
    run_contained, wait_until)

BUS = ("gdbus", "call", "--system", "--dest", "org.freedesktop.DBus", "--object-path", "/",
       "--method")


def kill_supervisor(device):
    pid = int(read_file(os.path.join(device.path, "run/supervisor")).split()[0])
    process = os.pidfd_open(pid)
    os.kill(pid, signal.SIGKILL)
    ready, _, _ = select.select([process], [], [], DEADLINE)
    os.close(process)
    assert ready


class FakeDaemon(TestCase):
    """Devices whose quarnd is a script of the test's own beside a copy of the tool."""

    WRAPPER = """#!/bin/sh
test "$1" = --recover && exit 0
exec "$(dirname "$0")/script"
"""

    def device_with(self, script):
        os.mkdir(self.path("bin"))
        shutil.copy2(os.path.join(BIN_DIR, "quarn-device"), self.path("bin"))
        if script is not None:
            # What is run once at the device's start is no start of the daemon.
            for name, text in (("script", script), ("quarnd", self.WRAPPER)):
                with open(self.path("bin", name), "w") as file:
                    file.write(text)
                os.chmod(self.path("bin", name), 0o755)
        device = self.new_device()
        device.tool = self.path("bin", "quarn-device")
        device.start()
        return device

    def starts(self, device):
        try:
            return len(read_file(os.path.join(device.path, "starts")).split())
        except FileNotFoundError:
            return 0

    # Takes the bus name, as often as it is started, and ends as it is told by its count.
    NAMED = """#!/usr/bin/python3
import os
import signal
from gi.repository import Gio, GLib

path = os.environ["QUARN_DEVICE_DIR"] + "/starts"
with open(path, "a") as file:
    file.write("x ")
with open(path) as file:
    count = len(file.read().split())
loop = GLib.MainLoop()
Gio.bus_own_name(Gio.BusType.SYSTEM, "org.orvane.Quarn", 0, None, lambda *_: loop.quit(), None)
loop.run()
%s
"""

    def test_a_daemon_that_asks_for_its_restart_is_started_again(self):
        device = self.device_with(self.NAMED % "os._exit(255 if count < 3 else 0)")
        device.activate()
        wait_until(lambda: self.starts(device) == 3, "the daemon is started again")
        restarts = os.path.join(device.path, "run/restarts")
        wait_until(lambda: not os.path.exists(restarts), "its clean end is noticed")
        self.assertEqual(self.starts(device), 3)

    def test_restarts_are_bounded(self):
        device = self.device_with(self.NAMED % "os._exit(255)")
        device.activate()
        restarts = os.path.join(device.path, "run/restarts")
        wait_until(lambda: self.starts(device) == 6 and not os.path.exists(restarts),
                   "the device gives the daemon up")
        self.assertEqual(self.starts(device), 6)

    def test_a_daemon_that_was_killed_is_not_started_again(self):
        device = self.device_with(self.NAMED % "os.kill(os.getpid(), signal.SIGKILL)")
        # A count that is there goes away with an end that is no failure.
        with open(os.path.join(device.path, "run/restarts"), "w") as file:
            file.write("1\n")
        device.activate()
        wait_until(lambda: not os.path.exists(os.path.join(device.path, "run/restarts"))
                   or self.starts(device) > 1, "its end is noticed")
        self.assertEqual(self.starts(device), 1)

    def test_a_daemon_that_is_told_to_end_before_it_can_hear_of_it_loses_no_call(self):
        """The bus keeps the call that it was started for, and waits for the next one's name."""
        device = self.device_with(self.NAMED.replace(
            "loop =", "if count < 4:\n    os.kill(os.getpid(), (15, 1, 15)[count - 1])\nloop =") %
            "os._exit(0)")
        device.activate()
        self.assertEqual(self.starts(device), 4)

    def test_a_daemon_that_is_always_told_to_end_is_given_up(self):
        device = self.device_with('#!/bin/sh\necho x >> "$QUARN_DEVICE_DIR/starts"\nkill -TERM $$\n')
        result = device.activate(check=False)
        self.assertIn("org.freedesktop.DBus.Error.Spawn.ChildExited", result.stderr)
        self.assertEqual(self.starts(device), 6)

    def test_a_daemon_that_fails_before_it_has_its_name_is_not_started_again(self):
        device = self.device_with('#!/bin/sh\necho x >> "$QUARN_DEVICE_DIR/starts"\nexit 255\n')
        result = device.activate(check=False)
        self.assertIn("org.freedesktop.DBus.Error.Spawn.ChildExited", result.stderr)
        self.assertEqual(self.starts(device), 1)

    def test_a_daemon_that_ends_without_its_name_fails_its_callers_at_once(self):
        device = self.device_with("#!/bin/sh\nexit 0\n")
        result = device.activate(check=False)
        self.assertIn("org.freedesktop.DBus.Error.Spawn.ChildExited", result.stderr)

    def test_a_daemon_that_dies_gives_its_power_lock_back(self):
        device = self.device_with('#!/bin/sh\nprintf "[cpu]\\npid=%d\\n" $$ > '
                                  '"$QUARN_DEVICE_DIR/state/power.ini"\nkill -9 $$\n')
        device.activate(check=False)
        self.assertNotIn("pid", read_file(os.path.join(device.path, "state/power.ini")))

    def test_the_daemon_runs_in_the_device(self):
        device = self.device_with('#!/bin/sh\n{ env; ls -d /tmp/inside /opt/usr/apps/org.example.a; } > '
                                  '"$QUARN_DEVICE_DIR/seen"\n')
        device.install(make_source(self.path("src"), "org.example.a", "1.0.0", {}))
        device.exec("touch", "/tmp/inside")
        device.activate(check=False)
        seen = read_file(os.path.join(device.path, "seen"))
        for line in ("QUARN_DEVICE_DIR=" + device.path,
                     "QUARN_CLOUD_CONFIG=%s/state/cloud.conf" % device.path,
                     "DBUS_SYSTEM_BUS_ADDRESS=unix:path=%s/run/bus" % device.path,
                     "/tmp/inside", "/opt/usr/apps/org.example.a"):
            self.assertIn(line + "\n", seen)


class Daemon(TestCase):
    def test_nobody_waits_for_a_daemon_that_does_not_run_without_an_account(self):
        device = self.new_device(account=None)
        device.start()
        result = device.activate(check=False)
        self.assertIn("ChildExited", result.stderr)
        self.assertIn("no signed-in. Daemon stop", device.log())

    def test_an_alarm_that_falls_due_starts_the_daemon(self):
        device = self.new_device()
        device.start()
        self.add_alarm(device, time.time() * 1000 + 300)
        device.wait_for_log("alarm(id:77) was expired")
        device.wait_for_daemon_end()

    def test_an_alarm_of_a_stopped_device_fires_at_its_start(self):
        device = self.new_device()
        self.add_alarm(device, time.time() * 1000 - 5000)
        device.start()
        device.wait_for_log("alarm(id:77) was expired")
        self.assertNotIn(77, [alarm["id"] for alarm in device.alarms()])

    def test_fire_starts_the_daemon_once_for_one_alarm(self):
        device = self.new_device()
        device.start()
        self.add_alarm(device, time.time() * 1000 + 3600000)
        device.fire(77)
        device.wait_for_log("alarm(id:77) was expired")
        device.wait_for_daemon_end()
        self.assertEqual(device.log().count("alarm(id:77) was expired"), 1)
        self.assertEqual(device.log().count("Quarn Daemon start"), 1)

    def test_fire_of_an_unknown_alarm_starts_nothing(self):
        device = self.new_device()
        device.start()
        result = device.call("fire", "78", check=False)
        self.assertEqual((result.returncode, result.stderr), (1, "quarn-device: no alarm 78\n"))
        self.assertEqual(device.log_of_daemons(), "")

    def test_log_shows_and_follows(self):
        device = self.new_device()
        self.assertEqual(device.call("log").stdout, "")
        device.start()
        follower = subprocess.Popen([device.tool, "log", device.path, "--follow"],
                                    stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, text=True)
        try:
            device.activate()
            for line in follower.stdout:
                if "== main loop begin ==" in line:
                    break
            else:
                self.fail("the log ended")
        finally:
            follower.kill()
            follower.wait()
            follower.stdout.close()
        self.assertIn("== main loop begin ==", device.call("log").stdout)

    def test_a_name_does_not_speak_to_a_terminal(self):
        """Neither from the file nor from what shows it, even a file of earlier days."""
        name = "\x1b]0;owned\x07\x1b[2J\u009b31m\x7f\n"
        device = self.new_device()
        log = os.path.join(device.path, "log/quarnd.log")
        with open(log, "ab") as file:
            file.write(b"an old line \x1b[5m\n")
        device.start()
        device.install(make_source(self.path("src"), "org.example.a", "1.0.0", {
            "data/" + name: b"x", "data/" + os.fsdecode(b"\x9b31m"): ("->", "anywhere"),
            "data/link" + name: ("->", "to" + name)}))
        follower = subprocess.Popen([device.tool, "log", device.path, "--follow"],
                                    stdout=subprocess.PIPE, stderr=subprocess.DEVNULL)
        self.addCleanup(follower.wait)
        self.addCleanup(follower.stdout.close)
        self.addCleanup(follower.kill)
        device.quarnctl("backup")
        device.wait_for_log("\\x1b]0;owned\\x07\\x1b[2J\\u{9b}31m\\x7f\\n")
        logged = read_bytes(log).split(b"\n", 1)[1]
        self.assert_speaks_to_no_terminal(logged)
        self.assertIn(b"\\x9b31m", logged)
        shown = device.call("log", text=False).stdout
        self.assert_speaks_to_no_terminal(shown)
        self.assertTrue(shown.startswith(b"an old line \\x1b[5m\n"), shown[:80])
        followed = b""
        while b"\\x1b]0;owned" not in followed:
            followed += follower.stdout.readline()
        self.assert_speaks_to_no_terminal(followed)

    def assert_speaks_to_no_terminal(self, text):
        self.assertEqual([c for c in text.decode() if c != "\n" and
                          (ord(c) < 0x20 or 0x7f <= ord(c) < 0xa0)], [])

    def test_a_name_in_a_failure_does_not_speak_to_a_terminal(self):
        device = self.new_device()
        source = make_source(self.path("src"), "org.example.a", "1.0.0", {})
        os.makedirs(os.path.join(source, "data"))
        os.mkfifo(os.path.join(source, "data/\x1b[2Jpipe\n"))
        result = device.call("install", source, check=False)
        self.assertEqual(result.returncode, 1)
        self.assertEqual(result.stderr, "quarn-device: %s/data/\\x1b[2Jpipe\\n is neither file, "
                         "directory nor link\n" % source)

    @staticmethod
    def add_alarm(device, due_ms):
        path = os.path.join(device.path, "state/alarms.ini")
        with open(path + ".new", "w") as file:
            file.write("[counters]\nnext_id=78\n\n[alarm 77]\nowner=quarn\ndue_ms=%d\n"
                       "interval_ms=0\n" % due_ms)
        os.replace(path + ".new", path)


class Inside(TestCase):
    def test_exec_sets_the_environment_and_finds_the_programs_first(self):
        device = self.new_device()
        device.start()
        seen = device.exec("sh", "-c", "env; command -v quarn-device").stdout
        self.assertIn("QUARN_DEVICE_DIR=%s\n" % device.path, seen)
        self.assertIn("QUARN_CLOUD_CONFIG=%s/state/cloud.conf\n" % device.path, seen)
        self.assertIn("DBUS_SYSTEM_BUS_ADDRESS=unix:path=%s/run/bus\n" % device.path, seen)
        self.assertTrue(seen.endswith(os.path.join(os.path.realpath(BIN_DIR), "quarn-device\n")))

    def test_exec_reaches_paths_in_options(self):
        device = self.new_device()
        device.start()
        other = TestCaseDirectory(self)
        with open(other.path("file"), "w") as file:
            file.write("found\n")
        self.assertEqual(device.exec("sed", "--file=/dev/null", other.path("file"),
                                     cwd="/").stdout, "found\n")
        script = other.path("script")
        with open(script, "w") as file:
            file.write("s/found/seen/\n")
        second = TestCaseDirectory(self)
        with open(second.path("script"), "w") as file:
            file.write("s/found/seen/\n")
        self.assertEqual(device.exec("sed", "--file=" + second.path("script"), cwd="/",
                                     input="found\n").stdout, "seen\n")

    def test_exec_shows_a_single_file_of_tmp(self):
        device = self.new_device()
        device.start()
        name = "/tmp/quarn-it-file-%d" % os.getpid()
        with open(name, "w") as file:
            file.write("whole\n")
        self.addCleanup(os.unlink, name)
        self.assertEqual(device.exec("cat", name, cwd="/").stdout, "whole\n")
        device.stop()
        self.assertEqual(read_file(name), "whole\n")
        self.assertEqual(os.listdir(os.path.join(device.path, "root/tmp")), [])

    def test_a_directory_with_blanks_and_letters_of_the_world_is_a_device(self):
        device = self.new_device(name="my dévice & more")
        device.start()
        device.activate()
        self.assertIn("Quarn Daemon start", device.log())

    def test_a_user_without_rights_can_call_the_bus(self):
        device = self.new_device()
        os.chmod(self.directory, 0o755)
        os.chmod(device.path, 0o755)
        device.start()
        result = device.exec("setpriv", "--reuid=5000", "--regid=5000", "--clear-groups", *BUS,
                             "org.freedesktop.DBus.GetId")
        self.assertTrue(result.stdout.startswith("('"))


class TestCaseDirectory:
    """A directory directly below /tmp, removed with the test."""

    def __init__(self, test):
        self.directory = subprocess.run(["mktemp", "-d", "/tmp/quarn-it-XXXXXX"], check=True,
                                        capture_output=True, text=True).stdout.strip()
        test.addCleanup(shutil.rmtree, self.directory, True)

    def path(self, name):
        return os.path.join(self.directory, name)


class Ends(TestCase):
    def test_stop_ends_what_forgot_its_environment(self):
        device = self.new_device()
        device.start()
        child = device.begin("env", "-i", "sleep", "1000")
        wait_until(lambda: read_file("/proc/%d/cmdline" % child.pid).startswith("sleep\0"),
                   "sleep runs")
        device.stop()
        self.assertEqual(child.wait(timeout=DEADLINE), -signal.SIGTERM)

    def test_stop_ends_what_does_not_want_to_end(self):
        device = self.new_device()
        device.start()
        child = device.begin("sh", "-c", "trap '' TERM; echo ready; while :; do sleep 1000; done",
                             stdout=subprocess.PIPE)
        self.assertEqual(child.stdout.readline(), b"ready\n")
        device.stop()
        self.assertEqual(child.wait(timeout=DEADLINE), -signal.SIGKILL)
        child.stdout.close()
        self.assertEqual(processes_naming(device.path), [])

    def test_stop_cleans_up_after_a_supervisor_that_was_killed(self):
        device = self.new_device()
        device.start()
        device.activate()
        device.exec("true", cwd=self.directory)
        kill_supervisor(device)
        device.stop()
        self.assertEqual(processes_naming(device.path), [])
        self.assertEqual(os.listdir(os.path.join(device.path, "root/tmp")), [])

    def test_start_takes_over_after_a_supervisor_that_was_killed(self):
        device = self.new_device()
        device.start()
        device.activate()
        daemon = device.daemon_pid()
        kill_supervisor(device)
        device.start()
        device.activate()
        self.assertNotIn(device.daemon_pid(), (None, daemon))

    def test_stop_leaves_no_mount_and_no_socket(self):
        device = self.new_device()
        before = read_file("/proc/self/mounts")
        device.start()
        device.activate()
        self.assertEqual(read_file("/proc/self/mounts"), before)
        device.stop()
        self.assertEqual(read_file("/proc/self/mounts"), before)
        self.assertFalse(os.path.exists(os.path.join(device.path, "run/bus")))

    def test_start_says_when_the_path_is_too_long_for_a_socket(self):
        device = self.new_device(name="d" * 100)
        result = device.call("start", check=False)
        self.assertEqual(result.returncode, 1)
        self.assertEqual(result.stderr, "quarn-device: the path of the device is too long for its "
                                        "bus socket\n")

    def test_start_says_when_there_is_no_bus_program(self):
        device = self.new_device()
        os.mkdir(self.path("empty"))
        result = device.call("start", check=False, env={"PATH": self.path("empty")})
        self.assertEqual(result.returncode, 1)
        self.assertEqual(result.stderr.count("\n"), 1)
        self.assertIn("the bus did not start", result.stderr)
        device.start()

    def test_a_daemon_is_looked_for_where_it_can_be(self):
        os.mkdir(self.path("bin"))
        shutil.copy2(os.path.join(BIN_DIR, "quarn-device"), self.path("bin"))
        device = self.new_device()
        device.tool = self.path("bin", "quarn-device")
        device.start()
        if any(os.path.exists(path) for path in ("/usr/sbin/quarnd", "/usr/local/sbin/quarnd")):
            device.activate()
        else:
            self.assertIn("ChildExited", device.activate(check=False).stderr)


class Contained(TestCase):
    """Without the right to make mount namespaces, as in many containers."""

    SCRIPT = """
set -eu
tool=$1 one=$2 two=$3 source=$4
"$tool" start "$one" 2> "$one/told"
test "$(wc -l < "$one/told")" = 1
grep -q 'mount namespaces are not permitted here' "$one/told"
"$tool" install "$one" "$source"
test "$(readlink /opt/usr/apps)" = "$one/root/opt/usr/apps"
"$tool" exec "$one" -- cat /opt/usr/apps/org.example.a/data/x
"$tool" exec "$one" -- gdbus call --system --dest org.freedesktop.DBus --object-path / \
    --method org.freedesktop.DBus.StartServiceByName org.orvane.Quarn 0
/usr/bin/python3 -c 'import os
print(os.getxattr("/opt/usr/apps/org.example.a/data/x", "user.quarn.SMACK64").decode())'
! "$tool" start "$two" 2> "$two/told"
cat "$two/told"
"$tool" stop "$one"
"$tool" stop "$one"
test ! -e /opt/usr/apps -a ! -L /opt/usr/apps
"$tool" start "$two" 2> /dev/null
supervisor=$(cut -d ' ' -f 1 "$two/run/supervisor")
kill -9 "$supervisor"
timeout 60 sh -c 'while grep -qs "^State:.[^ZX]" "/proc/$0/status"; do sleep 0.02; done' $supervisor
"$tool" start "$one" 2> /dev/null
test "$(readlink /opt/usr/apps)" = "$one/root/opt/usr/apps"
"$tool" stop "$two"
test "$(readlink /opt/usr/apps)" = "$one/root/opt/usr/apps"
"$tool" stop "$one"
mkdir -p /opt/usr/apps/content
! "$tool" start "$one" 2> "$one/told"
cat "$one/told"
"""

    def test_the_device_maps_the_applications_path_itself(self):
        one, two = self.new_device("one"), self.new_device("two")
        source = make_source(self.path("src"), "org.example.a", "1.0.0",
                             {"data/x": b"content\n", "data/link": ("->", "x")})
        result = run_contained(
            ["sh", "-c", self.SCRIPT, "sh", one.tool, one.path, two.path, source],
            self.directory, capture_output=True, text=True)
        self.assertEqual(result.returncode, 0, result.stdout + result.stderr)
        self.assertEqual(
            result.stdout,
            "content\n(uint32 1,)\norg.example.a\n"
            "quarn-device: /opt/usr/apps is mapped to another device: stop that one first\n"
            "quarn-device: /opt/usr/apps is in use on this machine, and mount namespaces are not "
            "permitted\n")
        self.assertEqual(result.stderr, "")


class Installing(TestCase):
    def test_a_link_of_the_application_does_not_lead_an_update_astray(self):
        device = self.new_device()
        device.install(make_source(self.path("v1"), "org.example.a", "1.0.0", {"data/x": b"one"}))
        os.mkdir(self.path("outside"))
        for folder in ("data", "shared/data"):
            shutil.rmtree(device.app_path("org.example.a", folder))
            os.symlink(self.path("outside"), device.app_path("org.example.a", folder))
        result = device.call("install", make_source(self.path("v2"), "org.example.a", "2.0.0",
                                                    {"data/y": b"", "shared/data/z": b""}),
                             check=False)
        self.assertEqual(result.returncode, 1)
        self.assertEqual(os.listdir(self.path("outside")), [])

    def test_an_installation_that_fails_leaves_nothing(self):
        device = self.new_device()
        source = make_source(self.path("src"), "org.example.a", "1.0.0", {"data/x": b""})
        os.mkfifo(os.path.join(source, "data", "pipe"))
        result = device.call("install", source, check=False)
        self.assertEqual(result.returncode, 1)
        self.assertEqual(result.stderr.count("\n"), 1)
        self.assertEqual(device.packages(), [])
        self.assertFalse(os.path.lexists(device.app_path("org.example.a")))
        events = read_file(os.path.join(device.path, "state/events.ini"))
        self.assertIn("install;failed;tpk;org.example.a;", events)

    def test_events_tell_of_each_step(self):
        device = self.new_device()
        device.install(make_source(self.path("v1"), "org.example.a", "1.0.0", {}))
        device.install(make_source(self.path("v2"), "org.example.a", "2.0.0", {}))
        device.remove("org.example.a")
        events = read_file(os.path.join(device.path, "state/events.ini"))
        self.assertEqual([line.split("=")[1].split(";")[:2] for line in events.splitlines()
                          if ";" in line],
                         [[action, state] for action in ("install", "update", "uninstall")
                          for state in ("started", "completed")])

    def test_an_application_belongs_to_one_package(self):
        device = self.new_device()
        device.install(make_source(self.path("a"), "org.example.a", "1", {}, apps=["app"]))
        result = device.call("install", make_source(self.path("b"), "org.example.b", "1", {},
                                                    apps=["app"]), check=False)
        self.assertEqual(result.stderr,
                         'quarn-device: application "app" belongs to org.example.a\n')
        self.assertEqual([package["id"] for package in device.packages()], ["org.example.a"])

    def test_folders_keep_their_modes(self):
        device = self.new_device()
        source = make_source(self.path("src"), "org.example.a", "1.0.0", {"data/deep/x": b""})
        os.chmod(os.path.join(source, "data"), 0o700)
        os.chmod(os.path.join(source, "data/deep"), 0o2750)
        device.install(source)
        for folder, mode in (("data", 0o700), ("data/deep", 0o2750)):
            status = os.stat(device.app_path("org.example.a", folder))
            self.assertEqual(stat.S_IMODE(status.st_mode), mode)
            self.assertEqual((status.st_uid, status.st_gid), (5000, 5000))


class Facts(TestCase):
    def fact(self, device, key):
        lines = read_file(os.path.join(device.path, "state/device.ini")).splitlines()
        for line in lines[lines.index("[device]") + 1:]:
            if line.startswith(key + "="):
                return line[len(key) + 1:]
        return None

    def test_create_keeps_what_it_is_told(self):
        device = self.new_device(model="Orvane Two", serial="350000000000017", account="ada",
                                 cloud="webdav+https://cloud.example.org/dav")
        self.assertEqual([self.fact(device, key) for key in ("model", "serial", "account")],
                         ["Orvane Two", "350000000000017", "ada"])
        self.assertIn("url=webdav+https://cloud.example.org/dav",
                      read_file(os.path.join(device.path, "state/cloud.conf")))

    def test_create_gives_each_device_a_serial_number_of_its_own(self):
        serials = set()
        for _ in range(3):
            serial = self.fact(self.new_device(), "serial")
            self.assertRegex(serial, r"^\d{15}$")
            digits = [int(digit) for digit in serial]
            doubled = [sum(divmod(2 * digit, 10)) for digit in digits[1::2]]
            self.assertEqual((sum(digits[::2]) + sum(doubled)) % 10, 0)
            serials.add(serial)
        self.assertEqual(len(serials), 3)

    def test_a_new_device_is_on_wifi_and_lit_and_not_charging(self):
        device = self.new_device()
        self.assertEqual([self.fact(device, key)
                          for key in ("network", "charger", "display", "modem")],
                         ["wifi", "off", "on", "on"])

    def test_set_changes_each_key(self):
        device = self.new_device()
        for key, values in (("network", ("cellular", "none", "wifi")), ("charger", ("on", "off")),
                            ("display", ("dim", "off", "on")), ("modem", ("off", "on")),
                            ("account", ("grace",))):
            for value in values:
                device.set(key, value)
                self.assertEqual(self.fact(device, key), value)
        device.set("account", "none")
        self.assertEqual(self.fact(device, "account"), "")


if __name__ == "__main__":
    unittest.main()
