#!/usr/bin/python3 -B
"""ceph_gateway.py DIR: Ceph's object gateway on loopback, in the foreground.

A monitor, three object servers with three copies of everything, and the gateway with the S3
interface. DIR/ready holds its port, how often servers were started, and its port with TLS, once it
answers; DIR/run the process ids; DIR/ceph.conf is for its tools. User "device" has the access key
"device" and the secret in DIR/secret, and over the other interface "device:swift" the key "admin".
SIGHUP starts what has ended. SIGTERM ends everything.
"""
import os
import signal
import socket
import subprocess
import sys
import time
import uuid

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
from cloud_process import fork_into, write  # noqa: E402
from quarn_test import free_ports, read_file  # noqa: E402

OSDS = 3
DIR = os.path.abspath(sys.argv[1])


def config(mon_ports, port, tls_port, cluster):
    return f"""[global]
fsid = {cluster}
mon host = [v2:127.0.0.1:{mon_ports[0]},v1:127.0.0.1:{mon_ports[1]}]
mon initial members = a
public network = 127.0.0.0/8
public addr = 127.0.0.1
cluster addr = 127.0.0.1
keyring = {DIR}/keyring
run dir = {DIR}/run
admin socket = {DIR}/run/$name.asok
pid file = {DIR}/run/$name.own-pid
log file = {DIR}/log/$name.log
mon data = {DIR}/mon.$id
osd data = {DIR}/osd.$id
osd pool default size = 3
osd pool default min size = 2
osd pool default pg num = 4
osd pool default pg autoscale mode = off
osd crush chooseleaf type = 0
bluestore block size = 2147483648
osd memory target = 939524096
auth allow insecure global id reclaim = false
rgw dns name = localhost
rgw bucket quota ttl = 0
[client.rgw.a]
rgw frontends = beast endpoint=127.0.0.1:{port} ssl_endpoint=127.0.0.1:{tls_port} ssl_certificate={DIR}/cert.pem ssl_private_key={DIR}/key.pem
rgw data = {DIR}/rgw
rgw thread pool size = 32
"""


def run(*command):
    return subprocess.run(command, cwd=DIR, check=True, stdout=subprocess.PIPE,
                          stderr=subprocess.DEVNULL, text=True).stdout


class Gateway:
    def __init__(self):
        *self.mon_ports, self.port, self.tls_port = free_ports(4)
        self.starts = 0
        self.pids = {}
        self.commands = {}
        for folder in ("mon.a", "run", "log", "rgw"):
            os.makedirs(os.path.join(DIR, folder))
        self.cluster = str(uuid.uuid4())
        write(f"{DIR}/ceph.conf", config(self.mon_ports, self.port, self.tls_port, self.cluster))
        run("openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256",
            "-nodes", "-days", "2", "-subj", "/CN=localhost", "-addext",
            "subjectAltName=DNS:localhost,DNS:*.localhost,IP:127.0.0.1", "-keyout", "key.pem",
            "-out", "cert.pem")

    def start(self, name):
        command = self.commands[name]
        self.pids[name] = fork_into(f"{DIR}/log/{name}.out",
                                    lambda: os.execvp(command[0], command))
        write(f"{DIR}/run/{name}.pid", str(self.pids[name]))

    def make(self):
        run("ceph-authtool", "--create-keyring", "keyring", "--gen-key", "-n", "mon.", "--cap",
            "mon", "allow *")
        run("ceph-authtool", "keyring", "--gen-key", "-n", "client.admin", "--cap", "mon",
            "allow *", "--cap", "osd", "allow *", "--cap", "mgr", "allow *")
        run("monmaptool", "--create", "--fsid", self.cluster, "--addv", "a",
            f"[v2:127.0.0.1:{self.mon_ports[0]},v1:127.0.0.1:{self.mon_ports[1]}]", "monmap")
        conf = ("-c", f"{DIR}/ceph.conf")
        run("ceph-mon", *conf, "--mkfs", "-i", "a", "--monmap", "monmap", "--keyring", "keyring")
        self.commands["mon"] = ("ceph-mon", *conf, "-i", "a", "-f")
        self.start("mon")
        made = []
        for index in range(OSDS):
            os.makedirs(f"{DIR}/osd.{index}")
            identity = str(uuid.uuid4())
            run("ceph", *conf, "--connect-timeout", "60", "osd", "new", identity)
            keyring = f"{DIR}/osd.{index}/keyring"
            write(keyring, run("ceph", *conf, "auth", "get-or-create", f"osd.{index}", "mon",
                               "allow profile osd", "mgr", "allow profile osd", "osd", "allow *"))
            made.append(subprocess.Popen(
                ("ceph-osd", *conf, "-i", str(index), "--mkfs", "--osd-uuid", identity,
                 "--keyring", keyring), stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL))
            self.commands[f"osd{index}"] = ("ceph-osd", *conf, "-i", str(index), "-f",
                                            "--keyring", keyring)
        for index, each in enumerate(made):
            each.wait()
            self.start(f"osd{index}")
        write(f"{DIR}/rgw/keyring",
              run("ceph", *conf, "auth", "get-or-create", "client.rgw.a", "mon", "allow rw", "osd",
                  "allow rwx", "mgr", "allow rw"))
        self.commands["gateway"] = ("radosgw", *conf, "-n", "client.rgw.a", "-f", "--keyring",
                                    "rgw/keyring")
        self.start("gateway")
        self.wait_for_gateway()
        admin = ("radosgw-admin", *conf)
        run(*admin, "user", "create", "--uid=device", "--display-name=device",
            "--access-key=device", "--secret=" + read_file(f"{DIR}/secret").strip())
        run(*admin, "subuser", "create", "--uid=device", "--subuser=device:swift",
            "--access=full", "--key-type=swift", "--secret=admin")
        self.tell_ready()

    def wait_for_gateway(self):
        while self.pids.get("gateway"):
            try:
                socket.create_connection(("127.0.0.1", self.port), 1).close()
                return
            except OSError:
                time.sleep(0.05)
                self.reap()

    def tell_ready(self):
        self.starts += 1
        write(f"{DIR}/ready", f"{self.port} {self.starts} {self.tls_port}\n")

    def start_missing(self):
        for name in self.commands:
            if name not in self.pids:
                self.start(name)
        self.wait_for_gateway()
        self.tell_ready()

    def reap(self):
        for name, pid in list(self.pids.items()):
            if os.waitpid(pid, os.WNOHANG)[0]:
                del self.pids[name]

    def end(self):
        for pid in self.pids.values():
            os.kill(pid, signal.SIGCONT)
            os.kill(pid, signal.SIGKILL)
            os.waitpid(pid, 0)


def main():
    os.chdir(DIR)
    wanted = {signal.SIGTERM: False, signal.SIGINT: False, signal.SIGHUP: False}

    def note(number, _):
        wanted[number] = True

    for number in wanted:
        signal.signal(number, note)
    gateway = Gateway()
    gateway.make()
    while not (wanted[signal.SIGTERM] or wanted[signal.SIGINT]):
        gateway.reap()
        if wanted[signal.SIGHUP]:
            wanted[signal.SIGHUP] = False
            gateway.start_missing()
        time.sleep(0.05)
    gateway.end()


main()
