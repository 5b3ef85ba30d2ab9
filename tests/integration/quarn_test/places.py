"""Mounts, folders and names of the machine that only a test and its children see."""
import ctypes
import functools
import os
import subprocess

from .programs import BIN_DIR

#: Fixed names lie below these: the daemon's staging directory, exported archives, applications.
_PLACES = ("/tmp", "/opt")
_TESTS = os.path.realpath(os.path.join(os.path.dirname(os.path.abspath(__file__)), "../.."))

# of sched.h and sys/mount.h
_CLONE_NEWNS = 0x00020000
_CLONE_NEWUTS = 0x04000000
_MS_BIND = 0x1000
_MS_REC = 0x4000
_MS_PRIVATE = 0x40000
_MS_SHARED = 0x100000
_LIBC = ctypes.CDLL(None, use_errno=True)


def _checked(result, what):
    if result != 0:
        raise OSError(ctypes.get_errno(), os.strerror(ctypes.get_errno()), what)


def _unshare(kind):
    _checked(_LIBC.unshare(kind), "unshare")


def _mount(source, place, kind=None, flags=0, options=None):
    _checked(_LIBC.mount(source.encode(), place.encode(), kind and kind.encode(),
                         ctypes.c_ulong(flags), options and options.encode()), place)


@functools.cache
def enter_own_mounts():
    """From here on, what this process mounts is seen by its children alone and goes with them, also
    behind a kill, and what others mount is not seen here. Mounts of children that do not take care
    reach this process, as they would reach the machine. Before the first thread; where it is not
    permitted, the mounts stay the machine's."""
    try:
        _unshare(_CLONE_NEWNS)
    except PermissionError:
        return
    _mount("none", "/", flags=_MS_REC | _MS_PRIVATE)
    _mount("none", "/", flags=_MS_REC | _MS_SHARED)


def enter_own_names():
    """The settings kernel.hostname and kernel.domainname are this process's and its children's."""
    _unshare(_CLONE_NEWUTS)


def run_contained(command, *shown, **keywords):
    """subprocess.run() of a command that may not mount, as in many containers, with an empty /tmp
    and /opt of its own, where all that is there are the folders in `shown` and what is tested."""
    shown += (_TESTS, os.path.dirname(os.path.realpath(BIN_DIR)))

    def cover():
        _unshare(_CLONE_NEWNS)
        _mount("none", "/", flags=_MS_REC | _MS_PRIVATE)
        kept = [(path, os.open(path, os.O_PATH | os.O_DIRECTORY)) for path in shown
                if path.startswith(tuple(place + "/" for place in _PLACES))]
        for place in _PLACES:
            _mount("none", place, "tmpfs", options="mode=1777")
        for path, folder in kept:
            os.makedirs(path, exist_ok=True)
            _mount("/proc/self/fd/%d" % folder, path, flags=_MS_BIND | _MS_REC)
            os.close(folder)
    return subprocess.run(["setpriv", "--bounding-set=-sys_admin", "--inh-caps=-sys_admin",
                           *command], preexec_fn=cover, **keywords)
