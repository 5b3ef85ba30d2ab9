"""Uploads to real servers on loopback, near and far, against another program's copy."""
import configparser
import os
import pwd
import random
import shutil
import signal
import socket
import subprocess
import sys
import tempfile
import threading
import time

import trees
from harness import CEILING_KB, Table, median, peak_pss

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, "../tests/integration"))
from quarn_test import free_ports  # noqa: E402

FIXTURES = os.path.join(HERE, "../tests/integration/cloud")
USER, PASSWORD = "device", "right"
#: Quarnd may use this much of the other's wall time.
NEAR_LIMIT, FAR_SMALL_LIMIT, FAR_LARGE_LIMIT = 1.0, 0.5, 1.0
FAR_MS = 80
LOADS = {"200 of 100 kB": (200, 100 * 1000), "8 of 25 MiB": (8, 25 * trees.MIB)}


def wait_for(condition, what, seconds=60):
    end = time.monotonic() + seconds
    while not condition():
        if time.monotonic() > end:
            raise SystemExit("did not happen: " + what)
        time.sleep(0.02)


def answers(port):
    try:
        socket.create_connection(("127.0.0.1", port), 1).close()
        return True
    except OSError:
        return False


class Dav:
    """A WebDAV server, its files in the work directory."""
    kind = "WebDAV"

    def __init__(self, work):
        self.dir = os.path.join(work, "dav")
        nobody = pwd.getpwnam("nobody")
        for name in ("", "disk", "htdocs", "state", "locks"):
            os.makedirs(os.path.join(self.dir, name), exist_ok=True)
            os.chown(os.path.join(self.dir, name), nobody.pw_uid, nobody.pw_gid)
        # The server is not root's.
        for path in (work, os.path.dirname(work), os.path.dirname(os.path.dirname(work))):
            if path != tempfile.gettempdir():
                os.chmod(path, 0o755)
        self.port, = free_ports(1)
        with open(os.path.join(FIXTURES, "apache.conf")) as file:
            text = file.read().replace("@DIR@", self.dir).replace("@PORT@", str(self.port))
        with open(os.path.join(self.dir, "server.conf"), "w") as file:
            file.write(text)
        digest = subprocess.run(["openssl", "passwd", "-apr1", PASSWORD], check=True, text=True,
                                stdout=subprocess.PIPE).stdout.strip()
        with open(os.path.join(self.dir, "htpasswd"), "w") as file:
            file.write("%s:%s\n" % (USER, digest))
        self.process = subprocess.Popen(["/usr/sbin/apache2", "-X", "-f",
                                         os.path.join(self.dir, "server.conf")])
        try:
            wait_for(lambda: answers(self.port), "the WebDAV server answers")
        except BaseException:
            self.stop()
            raise

    def config(self, port):
        return {"url": "webdav+http://127.0.0.1:%d/dav" % port, "user": USER,
                "password": PASSWORD}

    def rclone(self, port):
        obscured = subprocess.run(["rclone", "obscure", PASSWORD], check=True, text=True,
                                  stdout=subprocess.PIPE).stdout.strip()
        return {"TYPE": "webdav", "URL": "http://127.0.0.1:%d/dav" % port, "VENDOR": "other",
                "USER": USER, "PASS": obscured}

    def stop(self):
        self.process.send_signal(signal.SIGKILL)
        self.process.wait()


class S3:
    """An S3 service of three storage nodes."""
    kind = "S3"
    user = "test:device"

    def __init__(self, work):
        self.dir = os.path.join(work, "s3")
        os.makedirs(self.dir)
        with open(os.path.join(self.dir, "secret"), "w") as file:
            file.write(PASSWORD)
        self.process = subprocess.Popen(
            ["/usr/bin/python3", "-B", os.path.join(FIXTURES, "swift_cluster.py"), self.dir],
            stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        try:
            self.make_bucket()
        except BaseException:
            self.stop()
            raise

    def make_bucket(self):
        ready = os.path.join(self.dir, "ready")
        wait_for(lambda: os.path.exists(ready), "the S3 service answers")
        with open(ready) as file:
            self.port = int(file.read().split()[0])
        subprocess.run(["rclone", "mkdir", "bench:bucket"], check=True,
                       env=rclone_environment(self.rclone(self.port)))

    def config(self, port):
        return {"url": "s3+http://127.0.0.1:%d/bucket" % port, "user": self.user,
                "password": PASSWORD}

    def rclone(self, port):
        return {"TYPE": "s3", "PROVIDER": "Other", "ENDPOINT": "http://127.0.0.1:%d" % port,
                "ACCESS_KEY_ID": self.user, "SECRET_ACCESS_KEY": PASSWORD, "REGION": "us-east-1"}

    def stop(self):
        self.process.terminate()
        self.process.wait()


def rclone_environment(options):
    # Nothing of the machine's own S3 setting.
    inherited = {name: value for name, value in os.environ.items() if not name.startswith("AWS_")}
    return dict(inherited, RCLONE_CONFIG="/dev/null",
                **{"RCLONE_CONFIG_BENCH_" + name: value for name, value in options.items()})


def watch(pid, done, result):
    # The peak goes with the process, so it is read as long as that is there.
    while not done.wait(0.003):
        result.append(peak_pss(pid))


def timed(command, environment):
    """Wall and CPU seconds, and the peak PSS in kB."""
    begin = time.monotonic()
    process = subprocess.Popen(command, env=environment)
    done, samples = threading.Event(), [0]
    watcher = threading.Thread(target=watch, args=(process.pid, done, samples))
    watcher.start()
    _, status, usage = os.wait4(process.pid, 0)
    wall = time.monotonic() - begin
    done.set()
    watcher.join()
    process.returncode = os.waitstatus_to_exitcode(status)
    if process.returncode != 0:
        raise SystemExit("%s ended with %d" % (command[0], process.returncode))
    if max(samples) == 0:
        raise SystemExit("%s was not seen: its memory is not measured" % command[0])
    return wall, usage.ru_utime + usage.ru_stime, max(samples)


def make_load(path, count, size):
    rng = random.Random(size)
    os.makedirs(path)
    for index in range(count):
        with open(os.path.join(path, "%03d.zip" % index), "wb") as file:
            file.write(rng.randbytes(size))


def one_row(bin_dir, work, server, port, load, runs, numbers):
    config = configparser.ConfigParser(interpolation=None)
    config["cloud"] = server.config(port)
    path = os.path.join(work, "cloud.conf")
    with open(path, "w") as file:
        os.chmod(path, 0o600)
        config.write(file, space_around_delimiters=False)
    ours, theirs = [], []
    for _ in range(runs):
        # A new folder each time: both programs send everything.
        number = next(numbers)
        ours.append(timed([os.path.join(bin_dir, "upload_tool"), load, "/q%d" % number],
                          dict(os.environ, QUARN_CLOUD_CONFIG=path)))
        top = "bucket/" if server.kind == "S3" else ""
        theirs.append(timed(["rclone", "copy", load, "bench:%sr%d" % (top, number)],
                            rclone_environment(server.rclone(port))))
    return [tuple(median([run[i] for run in each]) for i in range(3)) for each in (ours, theirs)]


def cloud(bin_dir, work, checks, runs, kinds=(Dav, S3)):
    table = Table("store", "added round trip", "load", "quarnd s", "rclone s", "wall / rclone",
                  "quarnd CPU s", "rclone CPU s", "peak PSS kB")
    numbers = iter(range(10 ** 6))
    work = os.path.join(work, "cloud")
    os.makedirs(work)
    for name, (count, size) in LOADS.items():
        make_load(os.path.join(work, name), count, size)
    for kind in kinds:
        server = kind(work)
        try:
            for delay in (0, FAR_MS):
                proxy = None
                port = server.port
                if delay:
                    proxy = subprocess.Popen([sys.executable,
                                              os.path.join(HERE, "delay_proxy.py"),
                                              str(server.port), str(delay)],
                                             stdout=subprocess.PIPE, text=True)
                    port = int(proxy.stdout.readline())
                try:
                    for name, (count, _size) in LOADS.items():
                        ours, theirs = one_row(bin_dir, work, server, port,
                                               os.path.join(work, name), runs, numbers)
                        ratio = ours[0] / theirs[0]
                        table.add(server.kind, "%d ms" % delay, name, "%.2f" % ours[0],
                                  "%.2f" % theirs[0], "%.2f" % ratio, "%.2f" % ours[1],
                                  "%.2f" % theirs[1], ours[2])
                        limit = NEAR_LIMIT if not delay else (
                            FAR_SMALL_LIMIT if count > 100 else FAR_LARGE_LIMIT)
                        what = "%s to %s at %d ms" % (name, server.kind, delay)
                        checks.at_most("wall of %s, against rclone" % what, ratio, limit)
                        checks.hard("peak PSS of " + what, ours[2], CEILING_KB)
                finally:
                    if proxy:
                        proxy.kill()
                        proxy.wait()
        finally:
            server.stop()
    shutil.rmtree(work)
    table.show("Uploads to servers on loopback, %d paired runs" % runs)
