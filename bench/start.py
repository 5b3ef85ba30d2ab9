"""From the activating call to its reply, and the memory of a daemon that has nothing to do."""
import os
import signal
import subprocess
import time

import gi

gi.require_version("Gio", "2.0")
from gi.repository import Gio, GLib  # noqa: E402

from harness import Table, median  # noqa: E402

#: Reply and memory of the daemon against those of the least service that can be.
START_LIMIT = 2.0
#: Idle PSS against that of the same daemon with the HTTP library linked in.
IDLE_LIMIT = 0.7
#: Until an idle daemon has nothing more to do after its start.
SETTLE_S = 1.0

BUS = """<!DOCTYPE busconfig PUBLIC "-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN"
 "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">
<busconfig><type>session</type><listen>unix:path={0}/bus</listen><servicedir>{0}</servicedir>
<policy context="default"><allow send_destination="*" eavesdrop="true"/>
<allow receive_sender="*"/><allow own="*"/><allow user="*"/></policy></busconfig>"""


class Service:
    def __init__(self, name, path, program):
        self.name = name
        self.path = path
        self.program = program


class Bus:
    """A bus that starts the services."""

    def __init__(self, work, services, environment):
        os.makedirs(work)
        with open(os.path.join(work, "bus.conf"), "w") as file:
            file.write(BUS.format(work))
        for service in services:
            with open(os.path.join(work, service.name + ".service"), "w") as file:
                file.write("[D-BUS Service]\nName=%s\nExec=%s\n" % (service.name, service.program))
        address = "unix:path=%s/bus" % work
        self.process = subprocess.Popen(
            ["dbus-daemon", "--config-file", os.path.join(work, "bus.conf"), "--nofork",
             "--print-address=1"], stdout=subprocess.PIPE, stderr=subprocess.DEVNULL,
            env=dict(environment, DBUS_SYSTEM_BUS_ADDRESS=address))
        self.process.stdout.readline()
        self.connection = Gio.DBusConnection.new_for_address_sync(
            address, Gio.DBusConnectionFlags.AUTHENTICATION_CLIENT |
            Gio.DBusConnectionFlags.MESSAGE_BUS_CONNECTION, None, None)

    def call(self, name, path, interface, method, arguments=None):
        return self.connection.call_sync(name, path, interface, method, arguments, None,
                                         Gio.DBusCallFlags.NONE, 60000, None).unpack()

    def ask(self, method, name):
        return self.call("org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
                         method, GLib.Variant("(s)", (name,)))[0]

    def activate(self, service):
        """Milliseconds from the call to the reply; the service runs afterwards."""
        begin = time.monotonic()
        self.call(service.name, service.path, service.name, "last_bu_time")
        return 1000 * (time.monotonic() - begin)

    def end(self, service):
        """The process ends, and its name is free."""
        pid = self.ask("GetConnectionUnixProcessID", service.name)
        os.kill(pid, signal.SIGTERM)
        while self.ask("NameHasOwner", service.name):
            time.sleep(0.002)

    def idle_pss(self, service):
        self.activate(service)
        time.sleep(SETTLE_S)
        pid = self.ask("GetConnectionUnixProcessID", service.name)
        with open("/proc/%d/smaps_rollup" % pid) as file:
            pss = next(int(line.split()[1]) for line in file if line.startswith("Pss:"))
        self.end(service)
        return pss

    def stop(self):
        self.connection.close_sync(None)
        self.process.terminate()
        self.process.wait()


def start(bin_dir, work, checks, runs):
    device = os.path.join(work, "device-start")
    subprocess.run([os.path.join(bin_dir, "quarn-device"), "create", device], check=True)
    environment = dict(os.environ, QUARN_DEVICE_DIR=device,
                       QUARN_CLOUD_CONFIG=os.path.join(device, "state/cloud.conf"))
    daemon = Service("org.orvane.Quarn", "/org/orvane/Quarn/GDBus",
                     os.path.join(bin_dir, "quarnd"))
    empty = Service("org.orvane.Empty", "/org/orvane/Empty",
                    os.path.join(bin_dir, "empty_service"))

    bus = Bus(os.path.join(work, "bus"), (daemon, empty), environment)
    times = {daemon: [], empty: []}
    try:
        for _ in range(runs):
            for service in times:
                times[service].append(bus.activate(service))
                bus.end(service)
        pss = bus.idle_pss(daemon)
        pss_empty = bus.idle_pss(empty)
    finally:
        bus.stop()
    linked = Bus(os.path.join(work, "bus-linked"), (daemon,),
                 dict(environment, LD_PRELOAD="libcurl.so.4"))
    try:
        pss_linked = linked.idle_pss(daemon)
    finally:
        linked.stop()

    table = Table("service", "call to reply ms", "/ empty", "idle PSS kB")
    ratio = median(times[daemon]) / median(times[empty])
    table.add("empty", "%.1f" % median(times[empty]), "", pss_empty)
    table.add("quarnd", "%.1f" % median(times[daemon]), "%.2f" % ratio, pss)
    table.add("quarnd with libcurl linked in", "", "", pss_linked)
    table.show("Start on an activating call (%d paired runs), and idle memory" % runs)
    checks.at_most("call to reply, against an empty service", ratio, START_LIMIT)
    checks.at_most("idle PSS, against the daemon with libcurl linked in", pss / pss_linked,
                   IDLE_LIMIT)
