"""Embedded devices."""
import json
import os
import subprocess

from .files import read_file, read_text
from .processes import daemons_of
from .programs import BIN_DIR
from .waiting import wait_until


class Device:
    """One embedded device and the tool that handles it."""

    def __init__(self, path, **options):
        self.path = path
        self.tool = os.path.join(BIN_DIR, "quarn-device")
        arguments = []
        for name, value in options.items():
            if name == "account" and value is None:
                arguments.append("--no-account")
            else:
                arguments += ["--" + name, value]
        self.call("create", *arguments)
        self.serial = options.get("serial")
        self.cloud = os.path.join(path, "cloud")

    def call(self, verb, *arguments, check=True, **keywords):
        result = subprocess.run([self.tool, verb, self.path, *arguments], stdout=subprocess.PIPE,
                                stderr=subprocess.PIPE, **{"text": True, **keywords})
        if check and result.returncode != 0:
            raise AssertionError("quarn-device %s %s: exit %d\n%s%s" %
                                 (verb, " ".join(arguments), result.returncode, result.stdout,
                                  result.stderr))
        return result

    def start(self):
        self.call("start")

    def stop(self):
        self.call("stop")

    def install(self, source):
        self.call("install", source)

    def remove(self, package):
        self.call("remove", package)

    def set(self, key, value):
        self.call("set", key, value)

    def setting(self, key, value=None):
        return self.call("setting", key, *([] if value is None else [value])).stdout.strip()

    def packages(self):
        return json.loads(self.call("list", "--json").stdout)

    def alarms(self):
        return json.loads(self.call("alarms", "--json").stdout)

    def fire(self, alarm):
        self.call("fire", str(alarm))

    def exec(self, *command, check=True, **keywords):
        return self.call("exec", "--", *command, check=check, **keywords)

    def activate(self, check=True):
        """Have the bus start the daemon, which its first caller does otherwise."""
        return self.exec("gdbus", "call", "--system", "--dest", "org.freedesktop.DBus",
                         "--object-path", "/", "--method",
                         "org.freedesktop.DBus.StartServiceByName", "org.orvane.Quarn", "0",
                         check=check)

    def begin(self, *command, **keywords):
        """A command on the device that runs beside the test; its process."""
        return subprocess.Popen([self.tool, "exec", self.path, "--", *command], **keywords)

    def quarnctl(self, *arguments, check=True, **keywords):
        return self.exec("quarnctl", *arguments, check=check, **keywords)

    def log(self):
        return read_text(os.path.join(self.path, "log/quarnd.log"))

    def log_of_daemons(self):
        """Without what the device's start recovers, which is no daemon."""
        return "".join(line for line in self.log().splitlines(True)
                       if "quarn_recover(" not in line)

    def logs(self):
        folder = os.path.join(self.path, "log")
        return "".join(read_text(os.path.join(folder, name)) for name in os.listdir(folder))

    def shown_by_processes(self):
        """Command lines of all that run now, and what the daemon was started with."""
        text = "".join(read_text("/proc/%s/cmdline" % entry)
                       for entry in os.listdir("/proc") if entry.isdigit())
        daemon = self.daemon_pid()
        return text + (read_text("/proc/%d/environ" % daemon) if daemon else "")

    def app_path(self, package, path=""):
        """Where a file of a package lies for those outside the device."""
        return os.path.join(self.path, "root/opt/usr/apps", package, path)

    def archive(self, package, version="1.0.0"):
        """Where a package's archive lies in the cloud that is a folder of the device."""
        return os.path.join(self.cloud, self.serial, package, version, package + ".zip")

    def app_list(self):
        """The application list of that cloud."""
        return json.loads(read_file(os.path.join(self.cloud, "app_list/app_list.txt")))

    def bus_address(self):
        return "unix:path=" + os.path.join(self.path, "run/bus")

    def daemon_pid(self):
        """The daemon's process, None when it does not run."""
        return next(iter(daemons_of(self.path)), None)

    def daemon_memory_kb(self):
        """Memory that the daemon alone takes, and its share of what others use as well."""
        for line in read_text("/proc/%d/smaps_rollup" % self.daemon_pid()).splitlines():
            if line.startswith("Pss:"):
                return int(line.split()[1])
        raise AssertionError("no memory use of the daemon")

    def signal_daemon(self, number):
        """Send the daemon a signal, when there is one; whether there was."""
        pid = self.daemon_pid()
        if pid is None:
            return False
        try:
            os.kill(pid, number)
        except ProcessLookupError:
            pass  # it has ended on its own meanwhile
        return True

    def wait_for_log(self, text, count=1):
        wait_until(lambda: self.log().count(text) >= count, "log line: " + text)

    def wait_for_daemon_end(self):
        wait_until(lambda: self.daemon_pid() is None, "the daemon ends")
