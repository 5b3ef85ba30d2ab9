#!/usr/bin/python3 -B
"""cloud_story.py KIND: one device's backup, its change and its restore on another, over a store.

KIND is file, webdav, swift or ceph.
"""
import base64
import hashlib
import os
import pwd
import signal
import socket
import subprocess
import sys
import unittest
import urllib.parse
import urllib.request

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, ".."))
from quarn_test import (  # noqa: E402
    TestCase, free_ports, make_source, read_bytes, read_file, read_text, wait_until)

KIND = sys.argv.pop(1)
#: By chance: what other processes of the machine show may hold what is another run's.
SECRET = "never-to-be-seen-" + os.urandom(4).hex()
BUCKET = "fleet"
FIRST = "350000000000001"
SECOND = "350000000000002"
NOTES = "org.example.notes"
BANK = "org.example.bank"


class FileStore:
    """A folder."""

    user = None

    def __init__(self, folder):
        self.root = os.path.join(folder, "store")
        self.url = "file://" + self.root

    def objects(self):
        found = {}
        for folder, _, names in os.walk(self.root):
            for name in names:
                path = os.path.join(folder, name)
                found[os.path.relpath(path, self.root)] = read_bytes(path)
        return found

    def logs(self):
        return ""

    def close(self):
        pass


class WebdavStore:
    """A collection of apache's WebDAV."""

    user = "device"

    def __init__(self, folder):
        self.folder = os.path.join(folder, "service")
        self.root = os.path.join(self.folder, "disk/of ada")
        os.chmod(folder, 0o755)
        nobody = pwd.getpwnam("nobody")
        for name in ("disk", "htdocs", "state"):
            os.makedirs(os.path.join(self.folder, name))
            os.chown(os.path.join(self.folder, name), nobody.pw_uid, nobody.pw_gid)
        digest = base64.b64encode(hashlib.sha1(SECRET.encode()).digest()).decode()
        self.write("htpasswd", "%s:{SHA}%s\n" % (self.user, digest))
        self.port, = free_ports(1)
        text = read_file(os.path.join(HERE, "apache.conf"))
        self.write("server.conf",
                   text.replace("@DIR@", self.folder).replace("@PORT@", str(self.port)))
        self.process = subprocess.Popen(
            ["/usr/sbin/apache2", "-f", os.path.join(self.folder, "server.conf"), "-DFOREGROUND"],
            start_new_session=True)
        wait_until(self.answers, "apache answers")
        self.url = "webdav+http://127.0.0.1:%d/dav/of%%20ada" % self.port

    def answers(self):
        with socket.socket() as client:
            return client.connect_ex(("127.0.0.1", self.port)) == 0

    def write(self, name, text):
        with open(os.path.join(self.folder, name), "w") as file:
            file.write(text)

    def objects(self):
        found = {}
        for folder, folders, names in os.walk(self.root):
            # Where apache keeps track of locks.
            folders[:] = [name for name in folders if name != ".DAV"]
            for name in names:
                path = os.path.join(folder, name)
                found[os.path.relpath(path, self.root)] = read_bytes(path)
        return found

    def logs(self):
        return "".join(read_text(os.path.join(self.folder, "state", name))
                       for name in ("error.log", "requests.log"))

    def close(self):
        os.killpg(self.process.pid, signal.SIGKILL)
        self.process.wait()


class S3Store:
    """A bucket of a service that a launcher beside this file starts."""

    LAUNCHERS = {"swift": ("swift_cluster.py", "test:device", "test:admin"),
                 "ceph": ("ceph_gateway.py", "device", "device:swift")}

    def __init__(self, folder):
        script, self.user, self.admin = self.LAUNCHERS[KIND]
        self.folder = os.path.join(folder, "service")
        os.mkdir(self.folder)
        with open(os.path.join(self.folder, "secret"), "w") as file:
            file.write(SECRET)
        self.process = subprocess.Popen([os.path.join(HERE, script), self.folder],
                                        start_new_session=True)
        ready = os.path.join(self.folder, "ready")
        wait_until(lambda: os.path.exists(ready) or self.process.poll() is not None,
                   "the service is ready", 120)
        self.port = read_file(ready).split()[0]
        answer = self.ask("http://127.0.0.1:%s/auth/v1.0" % self.port,
                          {"X-Auth-User": self.admin, "X-Auth-Key": "admin"})
        self.storage = answer.headers["X-Storage-Url"]
        self.token = {"X-Auth-Token": answer.headers["X-Auth-Token"]}
        self.ask(self.storage + "/" + BUCKET, self.token, "PUT")
        self.url = "s3+http://127.0.0.1:%s/%s/of%%20mine" % (self.port, BUCKET)

    @staticmethod
    def ask(url, headers, method="GET"):
        return urllib.request.urlopen(
            urllib.request.Request(url, headers=headers, method=method), timeout=60)

    def objects(self):
        bucket = self.storage + "/" + BUCKET
        names = self.ask(bucket, self.token).read().decode().splitlines()
        return {name[len("of mine/"):]:
                self.ask(bucket + "/" + urllib.parse.quote(name), self.token).read()
                for name in names}

    def logs(self):
        log = os.path.join(self.folder, "log")
        return "".join(read_text(os.path.join(log, name)) for name in os.listdir(log))

    def close(self):
        self.process.send_signal(signal.SIGTERM)
        self.process.wait()


class CloudStory(TestCase):
    def setUp(self):
        # In the directory of the test, which its devices see.
        kinds = {"file": FileStore, "webdav": WebdavStore}
        self.store = kinds.get(KIND, S3Store)(self.directory)
        self.addCleanup(self.store.close)
        self.seen = ""

    def device_on_store(self, serial):
        device = self.new_device(serial=serial, account="ada")
        if self.store.user is None:
            device.set("cloud", self.store.url)
        else:
            device.call("set", "cloud", self.store.url, "--user", self.store.user,
                        input=SECRET + "\n")
        device.call("start", env={**os.environ, "G_MESSAGES_DEBUG": "all"})
        return device

    def install(self, device, package, version="1.0.0", **files):
        source = self.path("source-%s-%s-%s" % (device.serial, package, version))
        device.install(make_source(source, package, version,
                                   {"data/" + name: content for name, content in files.items()}))

    def backup(self, device):
        result = device.quarnctl("backup", "--yes", check=False)
        self.assertEqual(result.returncode, 0, result.stdout + result.stderr)
        status = device.quarnctl("status", "--json").stdout
        self.seen += result.stdout + result.stderr + status + device.shown_by_processes()

    def read(self, device, package, name):
        return read_bytes(device.app_path(package, "data/" + name))

    def test_backup_change_and_restore_on_another_device(self):
        first = self.device_on_store(FIRST)
        large = os.urandom(3000000)
        self.install(first, NOTES, text=b"first words", large=large)
        self.install(first, BANK, account=b"1")
        self.backup(first)
        notes = "%s/%s/1.0.0/%s.zip" % (FIRST, NOTES, NOTES)
        bank = "%s/%s/1.0.0/%s.zip" % (FIRST, BANK, BANK)
        before = self.store.objects()
        self.assertEqual(set(before), {"app_list/app_list.txt", notes, bank})

        with open(first.app_path(NOTES, "data/text"), "r+b") as file:
            file.write(b"other words")
        self.backup(first)
        after = self.store.objects()
        self.assertEqual(set(after), set(before))
        self.assertNotEqual(after[notes], before[notes])
        self.assertEqual(after[bank], before[bank])

        self.install(first, BANK, "2.0.0")
        self.backup(first)
        newer = "%s/%s/2.0.0/%s.zip" % (FIRST, BANK, BANK)
        self.assertEqual(set(self.store.objects()), {"app_list/app_list.txt", notes, newer})

        second = self.device_on_store(SECOND)
        watcher = second.begin("quarnctl", "restore", "on", "--from", FIRST, "--watch",
                               stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
        try:
            self.assertIn("restore mode is on for 2 packages", watcher.stdout.readline())
            self.install(second, NOTES)
            self.install(second, BANK, "2.0.0")
            out, err = watcher.communicate(timeout=120)
        finally:
            watcher.kill()
        self.assertEqual(watcher.returncode, 0, out + err)
        self.assertEqual(self.read(second, NOTES, "text"), b"other words")
        self.assertEqual(self.read(second, NOTES, "large"), large)
        self.assertEqual(self.read(second, BANK, "account"), b"1")

        self.backup(second)
        first.remove(BANK)
        self.backup(first)
        self.assertEqual(set(self.store.objects()),
                         {"app_list/app_list.txt", notes,
                          *(name.replace(FIRST, SECOND) for name in (notes, newer))})

        self.assertIn("QUARN_DEVICE_DIR=" + second.path, self.seen)
        for text in (self.seen, out, err, first.logs(), second.logs(), self.store.logs()):
            self.assertNotIn(SECRET, text)


if __name__ == "__main__":
    unittest.main()
