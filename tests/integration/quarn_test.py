"""What the integration tests share: embedded devices, package sources, clients on the bus.

The programs are those in $QUARN_BIN_DIR. Every device lies in a directory of its own test, is
stopped when the test ends, and its log is shown when the test failed.
"""
import json
import os
import shutil
import subprocess
import tempfile
import time
import unittest

BIN_DIR = os.environ.get("QUARN_BIN_DIR") or os.path.join(
    os.path.dirname(os.path.abspath(__file__)), "../../build/bin")
#: How long a test waits for what must happen, in seconds; sanitizers are slow.
DEADLINE = 60


def is_sanitized(program):
    """Whether what it takes of memory is the sanitizer's."""
    with open(program, "rb") as file:
        content = file.read()
    return b"__asan_init" in content or b"__tsan_init" in content


def wait_until(condition, what, deadline=DEADLINE):
    """Poll until `condition()` is true; its value is returned."""
    end = time.monotonic() + deadline
    while True:
        value = condition()
        if value:
            return value
        if time.monotonic() > end:
            raise AssertionError("did not happen in %d s: %s" % (deadline, what))
        time.sleep(0.02)


def make_source(path, package, version, files, metadata=None, apps=None, **keys):
    """A package source: `files` maps relative paths to bytes, (bytes, mode), or ("->", target)."""
    os.makedirs(path, exist_ok=True)
    for name, content in files.items():
        target = os.path.join(path, name)
        os.makedirs(os.path.dirname(target), exist_ok=True)
        mode = None
        if isinstance(content, tuple) and content[0] == "->":
            os.symlink(content[1], target)
            continue
        if isinstance(content, tuple):
            content, mode = content
        with open(target, "wb") as file:
            file.write(content)
        if mode is not None:
            os.chmod(target, mode)
    lines = ["[package]", "id=" + package, "version=" + version,
             "type=" + keys.get("type", "tpk")]
    for key in ("preload", "storage"):
        if key in keys:
            value = keys[key]
            lines.append("%s=%s" % (key, str(value).lower() if isinstance(value, bool) else value))
    for app in apps or [package]:
        lines += ["", "[app %s]" % app, "api-version=4.0"]
        lines += ["metadata.%s=%s" % item for item in (metadata or {}).items()]
    with open(os.path.join(path, "package.ini"), "w") as file:
        file.write("\n".join(lines) + "\n")
    return path


def read_text(path):
    """"" when there is none."""
    try:
        with open(path, errors="replace") as file:
            return file.read()
    except OSError:
        return ""


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

    def bus_address(self):
        return "unix:path=" + os.path.join(self.path, "run/bus")

    def daemon_pid(self):
        """The daemon's process, None when it does not run."""
        wanted = ("QUARN_DEVICE_DIR=" + self.path).encode()
        for entry in os.listdir("/proc"):
            if not entry.isdigit():
                continue
            try:
                with open("/proc/%s/comm" % entry) as file:
                    if file.read().strip() != "quarnd":
                        continue
                with open("/proc/%s/environ" % entry, "rb") as file:
                    if wanted in file.read().split(b"\0"):
                        return int(entry)
            except OSError:
                continue
        return None

    def wait_for_log(self, text, count=1):
        wait_until(lambda: self.log().count(text) >= count, "log line: " + text)

    def wait_for_daemon_end(self):
        wait_until(lambda: self.daemon_pid() is None, "the daemon ends")


class TestCase(unittest.TestCase):
    """A test with a directory of its own and devices that are stopped after it."""

    maxDiff = None

    def run(self, result=None):
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
