"""A fleet of devices on a distributed S3 store that loses a storage server; called by scripts/scale.

Every device is an embedded one with a daemon of its own, an account of its own (a prefix of the
bucket), and ten applications. Halfway one of the three storage servers is killed. At the end every
object is fetched with another program and held against what the devices have.
"""
import argparse
import concurrent.futures
import json
import os
import random
import shutil
import signal
import subprocess
import sys
import tempfile
import threading
import time
import zipfile

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
import cloud  # noqa: E402
import trees  # noqa: E402
from harness import Device, Table  # noqa: E402

VERSION = "1.0.0"
FILES = 4


class CountingProxy:
    """Forwards HTTP/1.1 to a port and counts requests and bytes."""

    def __init__(self, target):
        self.target = target
        self.process = None

    def __enter__(self):
        self.report = tempfile.NamedTemporaryFile(mode="r", prefix="quarn-count-")
        self.process = subprocess.Popen(
            [sys.executable, os.path.join(os.path.dirname(os.path.abspath(__file__)),
                                          "counting_proxy.py"), str(self.target),
             self.report.name], stdout=subprocess.PIPE, text=True)
        self.port = int(self.process.stdout.readline())
        return self

    def take(self):
        """What was counted since the last time."""
        self.process.send_signal(signal.SIGUSR1)
        self.process.stdout.readline()
        self.report.seek(0)
        return json.load(self.report)

    def __exit__(self, *_exception):
        self.process.kill()
        self.process.wait()
        self.report.close()


def serial_of(number):
    return "35%013d" % number


def package_of(number):
    return "org.example.p%02d" % number


def make_sources(work, packages):
    """One source a package; the devices' data differs by a file that is written into it later."""
    rng = random.Random(5)
    sources = []
    for number in range(packages):
        source = os.path.join(work, "source-%d" % number)
        trees.make_package(source, package_of(number), VERSION, lambda root: [
            trees._write(os.path.join(root, "data/%d.txt" % index), trees._text(rng, 8000))
            for index in range(FILES)])
        sources.append(source)
    return sources


def own_text(device, package):
    return b"device %d, package %d\n" % (device, package)


def configure(device, port, prefix):
    password = os.path.join(device.path, "state", "password")
    with open(password, "w") as file:
        file.write(cloud.PASSWORD)
    device.run("set", "cloud", "s3+http://127.0.0.1:%d/bucket/%s" % (port, prefix), "--user",
               cloud.S3.user, "--password-file", password)
    os.unlink(password)


def back_up(options, port, sources, number):
    """One device's life: made, filled, backed up (again when the store was in trouble), gone."""
    path = os.path.join(options.work, "device-%d" % number)
    device = Device(options.bin, path, "--serial", serial_of(number))
    attempts, failed = 0, None
    try:
        configure(device, port, "account-%d" % number)
        for package, source in enumerate(sources):
            device.install(source)
            name = os.path.join(path, "root/opt/usr/apps", package_of(package), "data/own.txt")
            with open(name, "wb") as file:
                file.write(own_text(number, package))
        begin = time.monotonic()
        while attempts < options.attempts:
            attempts += 1
            try:
                device.client("backup")
                failed = None
                break
            except subprocess.CalledProcessError as error:
                failed = error.returncode
        wall = time.monotonic() - begin
    finally:
        device.stop()
        shutil.rmtree(path)
    return number, wall, attempts, failed


def verify(options, server, store):
    """Every device's list and archives, as another program reads them. @return what is wrong"""
    # By their names: after a fault the service's listings lag behind.
    names = os.path.join(options.work, "names")
    with open(names, "w") as file:
        for device in range(options.devices):
            file.write("account-%d/app_list/app_list.txt\n" % device)
            for package in range(options.packages):
                file.write("account-%d/%s/%s/%s/%s.zip\n" % (
                    device, serial_of(device), package_of(package), VERSION, package_of(package)))
    # What is missing is noticed below.
    subprocess.run(["rclone", "copy", "--transfers", "8", "--no-traverse", "--files-from-raw", names,
                    "-q", "bench:bucket", store],
                   check=False, env=cloud.rclone_environment(server.rclone(server.port)))
    wrong = []
    for device in range(options.devices):
        top = os.path.join(store, "account-%d" % device)
        try:
            with open(os.path.join(top, "app_list/app_list.txt")) as file:
                models = json.load(file)["model_list"]
            entries = {entry["pkg_id"]: entry for entry in models[0]["pkg_list"]}
            if len(models) != 1 or models[0]["backup_info"]["serial_number"] != serial_of(device):
                wrong.append("device %d: the list is not its own" % device)
            for package in range(options.packages):
                entry = entries.pop(package_of(package))
                path = os.path.join(top, serial_of(device), entry["pkg_id"], entry["version"],
                                    entry["pkg_id"] + ".zip")
                with zipfile.ZipFile(path) as archive:
                    if archive.testzip() is not None:
                        wrong.append("device %d: %s is damaged" % (device, path))
                    if archive.read("data/own.txt") != own_text(device, package):
                        wrong.append("device %d: %s has other content" % (device, path))
            if entries:
                wrong.append("device %d: the list names too much" % device)
        except (OSError, KeyError, ValueError, IndexError, zipfile.BadZipFile) as error:
            wrong.append("device %d: %s" % (device, error))
    return wrong


def kill_server(server, number):
    for kind in ("object", "container", "account"):
        with open(os.path.join(server.dir, "run/%s-%d.pid" % (kind, number))) as file:
            os.kill(int(file.read()), signal.SIGKILL)


def fleet(options, server):
    sources = make_sources(options.work, options.packages)
    half = options.devices // 2
    done, killed = 0, threading.Event()
    walls, again, lost = [], 0, []
    begin = time.monotonic()
    with concurrent.futures.ThreadPoolExecutor(options.parallel) as pool:
        runs = [pool.submit(back_up, options, server.port, sources, number)
                for number in range(options.devices)]
        for run in concurrent.futures.as_completed(runs):
            number, wall, attempts, failed = run.result()
            done += 1
            walls.append(wall)
            again += attempts > 1
            if failed is not None:
                lost.append("device %d: its last backup ended with %d" % (number, failed))
            if done >= half and not killed.is_set():
                kill_server(server, 2)
                killed.set()
                print("after %d devices: one of three storage servers is killed" % done)
            if done % 50 == 0:
                print("%d of %d devices backed up (%d s)" %
                      (done, options.devices, time.monotonic() - begin))
                sys.stdout.flush()
    total = time.monotonic() - begin
    wrong = lost + verify(options, server, os.path.join(options.work, "fetched"))
    table = Table("devices", "packages each", "at a time", "s", "devices/s", "median backup s",
                  "slowest s", "runs repeated", "complete and verified")
    walls.sort()
    table.add(options.devices, options.packages, options.parallel, "%.0f" % total,
              "%.1f" % (options.devices / total), "%.2f" % walls[len(walls) // 2],
              "%.2f" % walls[-1], again, options.devices - len(wrong))
    table.show("A fleet, one of three storage servers lost halfway")
    return wrong


def growth(options, server):
    """Requests and bytes of one device's runs."""
    table = Table("packages", "other devices in the list", "run", "requests", "of them",
                  "kB sent", "kB received")
    with CountingProxy(server.port) as proxy:
        for packages, others in ((1, 0), (10, 0), (50, 0), (10, 10), (10, 50)):
            work = os.path.join(options.work, "growth-%d-%d" % (packages, others))
            os.makedirs(work)
            sources = make_sources(work, packages)
            device = Device(options.bin, os.path.join(work, "device"), "--serial", serial_of(0))
            prefix = "growth-%d-%d" % (packages, others)
            try:
                if others:
                    put_list(server, work, prefix, others, 200)
                configure(device, proxy.port, prefix)
                for source in sources:
                    device.install(source)
                proxy.take()
                for run in ("first", "unchanged", "one changed", "one updated"):
                    if run == "one changed":
                        touch(device, b"changed\n")
                    if run == "one updated":
                        update(device, sources[0])
                    device.client("backup")
                    count = proxy.take()
                    table.add(packages, others, run, sum(count["requests"].values()),
                              ", ".join("%d %s" % (number, method) for method, number
                                        in sorted(count["requests"].items())),
                              "%.1f" % (count["sent"] / 1000), "%.1f" % (count["received"] / 1000))
            finally:
                device.stop()
            shutil.rmtree(work)
    table.show("What one run costs (archives of about 10 kB, other devices with 200 packages each)")


def put_list(server, work, prefix, others, packages):
    path = os.path.join(work, "app_list.txt")
    with open(path, "w") as file:
        json.dump({"format_ver": 1, "model_list": [
            {"backup_info": {"timestamp": 1700000000000, "serial_number": serial_of(100 + number),
                             "model_name": "Orvane One"},
             "pkg_list": [{"pkg_id": "org.example.q%03d" % index, "version": VERSION,
                           "crc": 7919 * index} for index in range(packages)]}
            for number in range(others)]}, file)
    subprocess.run(["rclone", "copy", path, "bench:bucket/%s/app_list" % prefix], check=True,
                   env=cloud.rclone_environment(server.rclone(server.port)))


def touch(device, text):
    path = os.path.join(device.path, "root/opt/usr/apps", package_of(0), "data/0.txt")
    with open(path, "ab") as file:
        file.write(text)


def update(device, source):
    manifest = os.path.join(source, "package.ini")
    with open(manifest) as file:
        text = file.read()
    with open(manifest, "w") as file:
        file.write(text.replace("version=" + VERSION, "version=2.0.0"))
    device.install(source)


def main():
    parser = argparse.ArgumentParser(description=__doc__.split("\n")[0])
    parser.add_argument("--bin", required=True)
    parser.add_argument("--devices", type=int, default=200)
    parser.add_argument("--packages", type=int, default=10)
    parser.add_argument("--parallel", type=int, default=4, help="devices at a time")
    parser.add_argument("--attempts", type=int, default=3,
                        help="runs of a device, as the next nights would bring them")
    parser.add_argument("--only", choices=("growth", "fleet"))
    options = parser.parse_args()
    # Servers, devices and mounts go also when somebody ends this.
    signal.signal(signal.SIGTERM, lambda *_: sys.exit(128 + signal.SIGTERM))
    options.bin = os.path.abspath(options.bin)
    with tempfile.TemporaryDirectory(prefix="quarn-scale-") as options.work:
        wrong = []
        server = cloud.S3(options.work)
        try:
            if options.only != "fleet":
                growth(options, server)
            if options.only != "growth":
                wrong = fleet(options, server)
        finally:
            server.stop()
    for line in wrong:
        print("not as it should be: " + line)
    if wrong:
        sys.exit(1)
    if options.only != "growth":
        print("\nevery device has a complete, verified backup")


if __name__ == "__main__":
    main()
