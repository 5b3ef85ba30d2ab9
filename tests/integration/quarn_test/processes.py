"""Processes of the machine, as proc(5) shows them; only those are found that a path is named by,
since others run tests as well."""
import os

from .files import read_bytes, read_text


def _content(pid, name):
    try:
        return read_bytes("/proc/%d/%s" % (pid, name))
    except OSError:
        return b""


def _pids():
    return [int(entry) for entry in os.listdir("/proc") if entry.isdigit()]


def has_ended(pid):
    """Also when nobody has waited for it yet."""
    status = read_text("/proc/%d/stat" % pid)
    return not status or status.rsplit(")", 1)[1].split()[0] in "ZX"


def processes_naming(path):
    """All others whose command line or environment names `path`."""
    return [pid for pid in _pids() if pid != os.getpid() and
            any(path.encode() in _content(pid, name) for name in ("cmdline", "environ"))]


def daemons_of(path):
    """The device's daemons: two where one takes over from the other."""
    wanted = ("QUARN_DEVICE_DIR=" + path).encode()
    return [pid for pid in _pids() if _content(pid, "comm") == b"quarnd\n" and
            wanted in _content(pid, "environ").split(b"\0")]
