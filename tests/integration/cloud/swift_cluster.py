#!/usr/bin/python3 -B
"""swift_cluster.py DIR: a Swift cluster on loopback, with the S3 interface, in the foreground.

Three nodes with an object, a container and an account server each, three copies of everything, a
proxy and memcached. DIR/ready holds the proxy's port and how often the proxy was started, once it
answers; DIR/run the process ids. The secret of user "test:device" is in DIR/secret. SIGHUP starts
what has ended, and the proxy anew with the secret of then. SIGTERM ends everything.
"""
import os
import pwd
import signal
import socket
import sys
import time

import swift.common.utils as utils

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
from cloud_process import fork_into, write  # noqa: E402
from quarn_test import free_ports, read_file  # noqa: E402

NODES = 3
SERVERS = ("object", "container", "account")
DIR = os.path.abspath(sys.argv[1])
USER = pwd.getpwuid(os.getuid()).pw_name

PIPELINE = ("catch_errors", "gatekeeper", "healthcheck", "cache", "listing_formats", "s3api",
            "tempauth", "bulk", "container_quotas", "slo", "proxy-server")


def storage_config(server, node, port):
    return f"""[DEFAULT]
bind_ip = 127.0.0.1
bind_port = {port}
swift_dir = {DIR}
devices = {DIR}/n{node}
mount_check = false
user = {USER}
workers = 0
log_name = {server}-{node}
recon_cache_path = {DIR}/run
disable_fallocate = true
[pipeline:main]
pipeline = {server}-server
[app:{server}-server]
use = egg:swift#{server}
"""


def proxy_config(port, cache_port):
    secret = read_file(f"{DIR}/secret").strip()
    settings = {
        "cache": f"memcache_servers = 127.0.0.1:{cache_port}\n",
        "tempauth": f"user_test_admin = admin .admin\nuser_test_device = {secret} .admin\n",
        "s3api": "location = us-east-1\ns3_acl = false\nstorage_domain = localhost\n",
    }
    entry_points = {"cache": "memcache"}
    text = f"""[DEFAULT]
bind_ip = 127.0.0.1
bind_port = {port}
swift_dir = {DIR}
user = {USER}
workers = 0
log_name = proxy
[pipeline:main]
pipeline = {' '.join(PIPELINE)}
[app:proxy-server]
use = egg:swift#proxy
account_autocreate = true
node_timeout = 3
conn_timeout = 0.5
"""
    for name in PIPELINE[:-1]:
        text += f"[filter:{name}]\nuse = egg:swift#{entry_points.get(name, name)}\n"
        text += settings.get(name, "")
    return text


class Cluster:
    def __init__(self):
        ports = free_ports(2 + NODES * len(SERVERS))
        self.proxy_port, self.cache_port = ports[:2]
        self.proxy_starts = 0
        self.pids = {}  # by name
        self.ports = {"memcached": self.cache_port}
        self.apps = {}
        for folder in ("run", "log"):
            os.makedirs(os.path.join(DIR, folder))
        write(f"{DIR}/swift.conf", "[swift-hash]\nswift_hash_path_suffix = a\nswift_hash_path_prefix = b\n"
              "[storage-policy:0]\nname = p0\ndefault = yes\n")
        utils.SWIFT_CONF_FILE = os.path.join(DIR, "swift.conf")
        self.make_storage(dict(zip([(node, server) for node in range(1, NODES + 1)
                                    for server in SERVERS], ports[2:])))
        self.ports["proxy"] = self.proxy_port
        self.apps["proxy"] = "proxy-server"

    def make_storage(self, ports):
        from swift.common.ring import RingBuilder
        for server in SERVERS:
            builder = RingBuilder(5, NODES, 0)
            for node in range(1, NODES + 1):
                port = ports[(node, server)]
                builder.add_dev({"region": 1, "zone": node, "ip": "127.0.0.1", "port": port,
                                 "replication_ip": "127.0.0.1", "replication_port": port,
                                 "device": f"d{node}", "weight": 100.0, "meta": ""})
                os.makedirs(f"{DIR}/n{node}/d{node}", exist_ok=True)
                name = f"{server}-{node}"
                write(f"{DIR}/{name}.conf", storage_config(server, node, port))
                self.ports[name] = port
                self.apps[name] = server + "-server"
            builder.rebalance(seed="1")
            builder.get_ring().save(f"{DIR}/{server}.ring.gz")

    def start(self, name):
        if name == "proxy":
            write(f"{DIR}/proxy.conf", proxy_config(self.proxy_port, self.cache_port))
            self.proxy_starts += 1
        self.pids[name] = fork_into(f"{DIR}/log/{name}.log", lambda: self.become(name))
        write(f"{DIR}/run/{name}.pid", str(self.pids[name]))

    def become(self, name):
        signal.signal(signal.SIGHUP, signal.SIG_IGN)
        if name == "memcached":
            as_user = ["-u", "root"] if os.getuid() == 0 else []
            os.execvp("memcached", ["memcached", "-l", "127.0.0.1", "-p", str(self.cache_port),
                                    "-U", "0", "-m", "16", *as_user])
        from swift.common.wsgi import run_wsgi
        app = self.apps[name]
        config = f"{DIR}/{name}.conf"
        sys.argv = ["swift-" + app, config]
        options = {}
        if app == "object-server":
            options["global_conf_callback"] = __import__(
                "swift.obj.server", fromlist=["server"]).global_conf_callback
        os._exit(run_wsgi(config, app, verbose=True, **options) or 0)

    def wait_for(self, name):
        while self.pids.get(name):
            try:
                socket.create_connection(("127.0.0.1", self.ports[name]), 1).close()
                return
            except OSError:
                time.sleep(0.02)
                self.reap()

    def start_missing(self):
        for name in self.ports:
            if name not in self.pids:
                self.start(name)
        for name in self.ports:
            self.wait_for(name)
        write(f"{DIR}/ready", f"{self.proxy_port} {self.proxy_starts}\n")

    def end(self, name):
        pid = self.pids.pop(name)
        os.kill(pid, signal.SIGCONT)
        os.kill(pid, signal.SIGKILL)
        os.waitpid(pid, 0)

    def reap(self):
        for name, pid in list(self.pids.items()):
            if os.waitpid(pid, os.WNOHANG)[0]:
                del self.pids[name]


def load_everything():
    """What every server needs, once, so that starting them costs little."""
    utils.eventlet_monkey_patch()
    import swift.account.server  # noqa: F401
    import swift.common.middleware.s3api.s3api  # noqa: F401
    import swift.container.server  # noqa: F401
    import swift.obj.server  # noqa: F401
    import swift.proxy.server  # noqa: F401


def main():
    wanted = {signal.SIGTERM: False, signal.SIGINT: False, signal.SIGHUP: False}

    def note(number, _):
        wanted[number] = True

    for number in wanted:
        signal.signal(number, note)
    cluster = Cluster()
    load_everything()
    cluster.start_missing()
    while not (wanted[signal.SIGTERM] or wanted[signal.SIGINT]):
        cluster.reap()
        if wanted[signal.SIGHUP]:
            wanted[signal.SIGHUP] = False
            if "proxy" in cluster.pids:
                cluster.end("proxy")
            cluster.start_missing()
        time.sleep(0.05)
    for name in list(cluster.pids):
        cluster.end(name)


main()
