"""Everything at once, at random: in the end every request was answered, and nothing is lost.

Several clients ask for backups, restores, exports and lists, switch the restore mode and settings
and cancel; packages come, change and go; applications write; the network flaps, the clock jumps,
and the daemon is ended and killed. $QUARN_CHURN_SEED repeats a run's choices, $QUARN_CHURN_SECONDS
makes it another length.
"""
import json
import os
import random
import re
import signal
import subprocess
import sys
import time
import unittest
import zipfile
import zlib

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path[:0] = [os.path.join(HERE, ".."), os.path.join(HERE, "../bus")]
from bus_client import NAME, Client, GLib  # noqa: E402
from quarn_test import (  # noqa: E402
    TestCase, daemons_of, has_ended, make_source, read_bytes, wait_until)

SERIAL = "350000000000001"
APPLICATION_USER = 5000
PACKAGES = ["org.example.p%d" % index for index in range(6)]
VERSIONS = ("1.0.0", "2.0.0")
#: What every application has, always: a backup with fewer files is one of lost files.
FILES = ("data/one", "data/deep/er/two", "data/sp ace/three", "shared/data/four",
         "shared/data/more/five", "shared/trusted/six")
CLIENTS = 4
SECONDS = float(os.environ.get("QUARN_CHURN_SECONDS") or 40)
#: How long everything may take to come to rest; sanitizers are slow.
PATIENCE = 120
#: The last callback of each request that has one, and where in it the request's number is.
LAST = {"manual_backup_start": "manual_backup_status",
        "manual_backup_cancel": "manual_backup_cancel_result",
        "app_data_backup_start": "app_data_backup_complete",
        "app_data_restore_start": "app_data_restore_complete",
        "get_app_list": "get_app_list_cb",
        "restore_enable": "restore_enable_cb"}
IN_PROGRESS = 2
#: Empty files that stay: they are what processes lock, and a lock that is deleted locks nothing.
LOCKS = ("lock",)


class Request:
    """One call, and what became of it."""

    def __init__(self, number, client, method, package, call):
        self.number = number
        self.client = client
        self.method = method
        self.package = package
        self.call = call
        self.last = []
        #: A daemon that may have had it was killed: it may be lost.
        self.killed = False
        #: The daemon was told to end, or had no network, before the answer: it may keep no mode.
        self.unsure = False
        #: It was waited for in vain, once.
        self.given_up = False

    def accepted(self):
        return self.call.done and self.call.error is None and self.call.reply in ((0,), (1,))

    def ended(self):
        if not self.call.done:
            return self.given_up
        if self.method not in LAST or not self.accepted() or self.killed or self.last or \
                self.given_up:
            return True
        return self.method == "restore_enable" and (self.unsure or self.call.reply != (0,))

    def __repr__(self):
        return "%s(%s) number %d: reply %s, error %s, last %s%s%s" % (
            self.method, self.package or "", self.number, self.call.reply, self.call.error,
            self.last, ", daemon killed" if self.killed else "", ", unsure" if self.unsure else "")


class Application:
    """A package, what it has ever written, and whether it may write now."""

    def __init__(self, device, package, sources):
        self.device = device
        self.package = package
        self.sources = sources
        self.written = {path: set() for path in FILES}
        self.generation = 0
        self.installed = False

    def root(self, path=""):
        return self.device.app_path(self.package, path)

    def content(self, path, generation):
        """Text that tells whose and which it is, and whether it is whole."""
        body = ("%s %s %d " % (self.package, path, generation)).encode() * 40
        return body + b"%08x" % zlib.crc32(body)

    def write(self, path):
        """As an application does it: a new file over the old one, with the application's owner."""
        self.generation += 1
        content = self.content(path, self.generation)
        new = self.root("cache-%d" % self.generation)
        try:
            with open(new, "wb") as file:
                file.write(content)
            os.chown(new, APPLICATION_USER, APPLICATION_USER)
            # Counted first: nobody can read what was not written.
            self.written[path].add(content)
            os.rename(new, self.root(path))
        except OSError:
            # It is just being removed.
            try:
                os.unlink(new)
            except OSError:
                pass

    def restoring(self):
        return os.path.lexists(self.root("shared/data/quarn_tmp_rst_dir"))

    def files(self):
        """What lies in the data folders: content by path, None for what is no file."""
        found = {}
        for top in ("data", "shared/data", "shared/trusted"):
            for folder, folders, names in os.walk(self.root(top)):
                for name in names:
                    path = os.path.join(folder, name)
                    found[os.path.relpath(path, self.root())] = read_bytes(path)
        return found


class Churn(TestCase):
    def setUp(self):
        self.seed = int(os.environ.get("QUARN_CHURN_SEED") or time.time_ns() % 1000000)
        self.hint = "QUARN_CHURN_SEED=%d" % self.seed
        print(self.hint, flush=True)
        self.random = random.Random(self.seed)
        self.device = self.new_device(serial=SERIAL, model="Orvane One")
        self.device.start()
        self.applications = {}
        for package in PACKAGES:
            application = Application(self.device, package, {})
            for version in VERSIONS:
                files = {}
                for path in FILES:
                    application.generation += 1
                    files[path] = application.content(path, application.generation)
                    application.written[path].add(files[path])
                application.sources[version] = make_source(
                    self.path(package + "-" + version), package, version, files)
            self.applications[package] = application
        self.clients = [Client(self.device.bus_address()) for _ in range(CLIENTS)]
        for client in self.clients:
            self.addCleanup(client.close)
        self.requests = []
        self.jobs = {}
        self.done = {}
        self.network = "wifi"
        self.kills = 0

    # ---- what clients do ----

    def send(self, method, types=None, *values, package=None, **where):
        number = len(self.requests) + 1
        values = [number if value == "NUMBER" else value for value in values]
        client = self.random.choice(self.clients)
        call = client.start(method, GLib.Variant(types, tuple(values)) if types else None,
                            **where)
        request = Request(number, client, method, package, call)
        request.unsure = self.network != "wifi"
        self.requests.append(request)
        return request

    def any_package(self):
        return self.random.choice(PACKAGES)

    def backup(self):
        self.send("manual_backup_start", "(u)", "NUMBER")

    def cancel(self):
        self.send("manual_backup_cancel", "(u)", "NUMBER")

    def cancel_own(self):
        self.send("CancelOwn", path="/org/orvane/Quarn/Packages",
                  interface="org.orvane.Quarn.Packages")

    def app_backup(self):
        package = self.any_package()
        self.send("app_data_backup_start", "(su)", package, "NUMBER", package=package)

    def app_restore(self):
        package = self.any_package()
        self.send("app_data_restore_start", "(su)", package, "NUMBER", package=package)

    def export(self):
        package = self.any_package()
        self.send("make_app_data", "(s)", package, package=package)

    def app_list(self):
        self.send("get_app_list", "(iu)", 0, "NUMBER")

    def restore_mode(self):
        packages = self.random.sample(PACKAGES, self.random.randrange(1, 4))
        self.send("restore_enable", "(iissu)", 1, 0, SERIAL, json.dumps(packages), "NUMBER")

    def restore_mode_off(self):
        self.send("restore_enable", "(iissu)", 0, 0, "", "[]", "NUMBER").unsure = True

    def last_time(self):
        self.send("last_bu_time")

    def activation(self):
        self.send("set_activation", "(i)", self.random.randrange(2))

    def automatic(self):
        self.send("backup_enable", "(i)", self.random.randrange(2))

    # ---- what happens around them ----

    def start_job(self, package, *arguments):
        """The device's tool, one run for a package at a time as an installer has it."""
        if package in self.jobs:
            return
        self.jobs[package] = (arguments, subprocess.Popen(
            [self.device.tool, arguments[0], self.device.path, *arguments[1:]],
            stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, text=True))

    def collect_jobs(self):
        for package, (arguments, job) in list(self.jobs.items()):
            if job.poll() is None:
                continue
            told = job.stderr.read()
            job.stderr.close()
            self.assertEqual(job.returncode, 0, "%s %s: %s" % (self.hint, arguments, told))
            self.applications[package].installed = arguments[0] == "install"
            del self.jobs[package]

    def install(self):
        package = self.any_package()
        self.start_job(package, "install",
                       self.applications[package].sources[self.random.choice(VERSIONS)])

    def remove(self):
        package = self.any_package()
        if self.applications[package].installed:
            self.start_job(package, "remove", package)

    def write(self):
        application = self.applications[self.any_package()]
        if not application.installed or application.package in self.jobs:
            return
        # An application is not open while its data is put back.
        if application.restoring() or any(
                request.package == application.package and not request.ended()
                for request in self.requests if request.method == "app_data_restore_start"):
            return
        for path in self.random.sample(FILES, self.random.randrange(1, 3)):
            application.write(path)

    def set_network(self, network):
        self.network = network
        self.device.set("network", network)
        if network != "wifi":
            for request in self.requests:
                request.unsure = request.unsure or not request.call.done

    def flap(self):
        self.set_network(self.random.choice(("none", "cellular", "wifi", "wifi")))

    def conditions(self):
        self.device.set("charger", self.random.choice(("on", "off")))
        self.device.set("display", self.random.choice(("on", "off")))

    def clock(self):
        self.device.set("clock", "%+d" % self.random.choice((-400, -1, 0, 1, 2)) +
                        self.random.choice(("00000", "0000")))

    def end_daemon(self):
        for pid in daemons_of(self.device.path)[:1]:
            for request in self.requests:
                # What is switched on before its record is kept needs no end.
                request.unsure = request.unsure or not request.call.done
            self.signal(pid, signal.SIGTERM)

    def kill_daemon(self):
        for pid in daemons_of(self.device.path)[:1]:
            name = self.name_of(pid)
            # One that is killed before it has its name takes the calls of the next moment with it.
            if name is None:
                continue
            self.sort_callbacks()
            for request in self.requests:
                request.killed = request.killed or not request.ended() or (
                    request.method == "restore_enable" and not request.last)
            self.signal(pid, signal.SIGKILL)
            self.kills += 1
            # A call that is on its way to it is lost as well: none is sent until the bus knows.
            self.clients[0].until(lambda: has_ended(pid), "the daemon is gone")
            for client in self.clients:
                client.bus("GetId", None)
            while self.has_owner(name):
                self.serve(0)

    def has_owner(self, name):
        return self.clients[0].bus("NameHasOwner", GLib.Variant("(s)", (name,)))[0]

    def name_of(self, pid):
        """The unique name of that daemon, None when it does not own the well-known one."""
        def ask(method, name):
            call = self.clients[0].start(method, GLib.Variant("(s)", (name,)),
                                         destination="org.freedesktop.DBus",
                                         path="/org/freedesktop/DBus",
                                         interface="org.freedesktop.DBus")
            self.clients[0].until(lambda: call.done, method)
            return call.reply and call.reply[0]
        owner = ask("GetNameOwner", NAME)
        return owner if owner and ask("GetConnectionUnixProcessID", owner) == pid else None

    @staticmethod
    def signal(pid, number):
        try:
            os.kill(pid, number)
        except ProcessLookupError:
            pass

    # ---- the run ----

    def sort_callbacks(self):
        """Give each last callback to its request."""
        for client in self.clients:
            seen = self.done.get(client, 0)
            for name, arguments in client.events[seen:]:
                self.take_callback(client, name, arguments)
            self.done[client] = len(client.events)

    def take_callback(self, client, name, arguments):
        if name.startswith("reply of "):
            return
        if name == "manual_backup_status" and arguments[1] == IN_PROGRESS:
            return
        if name == "restore_enable_cb" and arguments[1] != "restore_stop":
            return
        request = self.requests[arguments[-1] - 1]
        self.assertEqual(LAST[request.method], name, self.hint)
        self.assertIs(request.client, client, "%s: a callback to another client" % self.hint)
        request.last.append(arguments)

    def serve(self, seconds):
        """The bus, for a pause of the load's own."""
        end = time.monotonic() + seconds
        while time.monotonic() < end:
            self.clients[0].until(lambda: True, "a round")
            GLib.MainContext.default().iteration(False)
            time.sleep(0.001)
        self.sort_callbacks()
        self.collect_jobs()

    ACTIONS = ((backup, 8), (cancel, 4), (cancel_own, 2), (app_backup, 12), (app_restore, 12),
               (export, 6), (app_list, 4), (restore_mode, 4), (restore_mode_off, 3), (last_time, 6),
               (activation, 6), (automatic, 3), (install, 14), (remove, 6), (write, 30), (flap, 5),
               (conditions, 3), (clock, 1), (end_daemon, 3), (kill_daemon, 2))

    def churn(self):
        actions, weights = zip(*self.ACTIONS)
        end = time.monotonic() + SECONDS
        while time.monotonic() < end:
            self.random.choices(actions, weights)[0](self)
            self.serve(self.random.choice((0, 0.002, 0.01, 0.04)))

    def until_at_rest(self, requests=None):
        def at_rest():
            self.sort_callbacks()
            self.collect_jobs()
            return not self.jobs and all(request.ended() for request in requests or self.requests)
        try:
            self.clients[0].until(at_rest, "every request ends", PATIENCE)
        except AssertionError:
            waiting = [request for request in self.requests if not request.ended()]
            for request in waiting:
                request.given_up = True
            self.fail("%s: these requests have not ended:\n%s" %
                      (self.hint, "\n".join(map(repr, waiting))))

    def come_to_rest(self):
        self.device.set("clock", "real")
        self.device.set("charger", "off")
        self.device.set("display", "on")
        self.set_network("wifi")
        self.until_jobs_end()
        self.send("backup_enable", "(i)", 0)
        # The mode has to end for its clients to be told so.
        off = self.send("restore_enable", "(iissu)", 0, 0, "", "[]", "NUMBER")
        off.unsure = True
        self.until_at_rest()

    def until_jobs_end(self):
        def ended():
            self.collect_jobs()
            return not self.jobs
        self.clients[0].until(ended, "the installations end", PATIENCE)

    def test_every_request_is_answered_and_nothing_is_lost(self):
        for package in PACKAGES[:4]:
            self.device.install(self.applications[package].sources[VERSIONS[0]])
            self.applications[package].installed = True
        self.churn()
        problems = []
        # All of it is looked at: one fault tells little of what it has done to the rest.
        for look in (self.come_to_rest, self.assert_answers, self.assert_data, self.settle,
                     self.assert_cloud, self.assert_nothing_left):
            try:
                look()
            except AssertionError as error:
                problems.append("%s: %s" % (look.__name__, error))
        self.assert_none(problems)

    # ---- what is looked for ----

    def assert_none(self, wrong):
        if wrong:
            self.fail("%s\n%s" % (self.hint, "\n".join(wrong)))

    def assert_answers(self):
        print("%d requests, %d kills" % (len(self.requests), self.kills), flush=True)
        self.assertGreater(len(self.requests), 100, self.hint)
        wrong = []
        for request in self.requests:
            refused = request.call.error is not None and "LimitsExceeded" in request.call.error
            if request.call.error is not None and not (request.killed or refused):
                wrong.append("not answered: %r" % request)
            if len(request.last) > 1:
                wrong.append("ended twice: %r" % request)
            if refused and request.last:
                wrong.append("refused and ended: %r" % request)
        self.assert_none(wrong)

    def assert_data(self):
        """Every application has its files and no others, each whole, its own, once written."""
        wrong = []
        for application in self.applications.values():
            if not application.installed:
                if os.path.lexists(application.root()):
                    wrong.append("%s is not installed and there: %s" % (
                        application.package, sorted(application.files())))
                continue
            files = {path: content for path, content in application.files().items()
                     if not self.is_ours(path)}
            if sorted(files) != sorted(FILES):
                wrong.append("%s has %s" % (application.package, sorted(files)))
            for path, content in files.items():
                if content not in application.written.get(path, ()):
                    wrong.append("%s/%s is %r" % (application.package, path, content[:80]))
        self.assert_none(wrong)

    @staticmethod
    def is_ours(path):
        return re.search(r"(_upload\.zip|_download\.zip|\.perm)$|quarn_tmp_rst_dir", path)

    def settle(self):
        """A new daemon, which finds what the last one left, and one more of everything."""
        def ended():
            self.end_daemon()
            return not daemons_of(self.device.path)
        # One may wait in the queue for the bus name behind another.
        wait_until(ended, "the daemons end")
        # Only what a run uploads is cleaned of its other versions.
        for application in self.applications.values():
            if application.installed:
                application.write(FILES[0])
        self.back_up_what_is_owed()
        request = self.send("manual_backup_start", "(u)", "NUMBER")
        self.until_at_rest()
        self.assertEqual([last[:2] for last in request.last], [(0, 4)], self.hint)
        for application in self.applications.values():
            if application.installed:
                request = self.send("make_app_data", "(s)", application.package)
                self.until_at_rest()
                self.assertEqual(request.call.reply, (0,), self.hint)
                exported = os.path.join(self.device.path, "root/tmp",
                                        application.package + "_tmp.zip")
                self.assert_archive(application, exported)
        # An export of a package that is gone is whoever asked for it's to take away.
        for package in PACKAGES:
            exported = os.path.join(self.device.path, "root/tmp", package + "_tmp.zip")
            if os.path.exists(exported):
                os.unlink(exported)
        self.send("set_activation", "(i)", 0)
        self.until_at_rest()
        # An alarm that falls due in this moment starts another, which nobody has asked to end.
        wait_until(ended, "the daemons end")

    def back_up_what_is_owed(self):
        """A package whose restore on installation failed is left out until somebody wants its data."""
        for application in self.applications.values():
            owed = application.root("shared/data/quarn_tmp_rst_dir.owed")
            if application.installed and os.path.exists(owed):
                request = self.send("app_data_backup_start", "(su)", application.package, "NUMBER",
                                    package=application.package)
                self.until_at_rest()
                self.assertEqual([last[0] for last in request.last], [0], self.hint)

    def assert_archive(self, application, path):
        """A good archive of exactly what the application has now."""
        subprocess.run(["unzip", "-tqq", path], check=True, stdout=subprocess.DEVNULL)
        with zipfile.ZipFile(path) as archive:
            self.assertIsNone(archive.testzip(), self.hint)
            table = "shared/data/%s.perm" % application.package
            content = {name: archive.read(name) for name in archive.namelist()
                       if name != table and not name.endswith("/")}
            recorded = json.loads(archive.read(table))
        self.assertEqual(content, application.files(), "%s %s" % (self.hint, path))
        self.assertEqual({recorded[name]["3"] for name in content}, {application.package})
        self.assertEqual({(recorded[name]["1"], recorded[name]["2"]) for name in content},
                         {(APPLICATION_USER, APPLICATION_USER)})

    def assert_cloud(self):
        """The list, the archives and the applications' data say the same."""
        sets = [one for one in self.device.app_list()["model_list"]
                if one["backup_info"]["serial_number"] == SERIAL]
        self.assertEqual(len(sets), 1, self.hint)
        listed = {entry["pkg_id"]: entry for entry in sets[0]["pkg_list"]}
        self.assertEqual(len(listed), len(sets[0]["pkg_list"]), self.hint)
        versions = {package["id"]: package["version"] for package in self.device.packages()}
        self.assertEqual({name: entry["version"] for name, entry in listed.items()}, versions,
                         self.hint)
        archives = {}
        for package, entry in listed.items():
            path = os.path.join(self.device.cloud, SERIAL, package, entry["version"],
                                package + ".zip")
            archives[path] = package
            self.assert_archive(self.applications[package], path)
            self.assertEqual(entry["crc"] & 0xffffffff, zlib.crc32(read_bytes(path)), self.hint)
        found = [os.path.join(folder, name)
                 for folder, _, names in os.walk(os.path.join(self.device.cloud, SERIAL))
                 for name in names]
        self.assertEqual(sorted(found), sorted(archives), self.hint)

    def assert_nothing_left(self):
        ours = [os.path.join(folder, name)
                for folder, folders, names in os.walk(os.path.join(self.device.path,
                                                                   "root/opt/usr/apps"))
                for name in folders + names if self.is_ours(name)]
        self.assertEqual(ours, [], self.hint)
        left = [os.path.join(folder, name)
                for folder, _, names in os.walk(os.path.join(self.device.path, "root/tmp"))
                for name in names if name not in LOCKS]
        self.assertEqual(left, [], self.hint)
        self.assertEqual([package for package in self.device.packages() if package["hidden"]], [],
                         self.hint)


if __name__ == "__main__":
    unittest.main(verbosity=2)
