#!/usr/bin/python3
"""Kernel settings for as long as a test needs them, put back however it ends.

    with kernel_settings({"fs.protected_hardlinks": "0"}):
        ...

or around a program: kernel_settings.py fs.protected_hardlinks=0 -- PROGRAM [ARGUMENT ...]

The settings are of the whole machine. A keeper, which is no child of the test and in no group of its,
puts them back when the test's end of a pipe is closed: also behind a SIGKILL. One test at a time has
them, whichever suite it belongs to; uses are not nested.
"""
import contextlib
import fcntl
import os
import signal
import subprocess
import sys

LOCK = "/run/quarn-kernel-settings.lock"


def path_of(name):
    return os.path.join("/proc/sys", name.replace(".", "/"))


def read_setting(name):
    with open(path_of(name)) as file:
        return file.read().strip()


def write_setting(name, value):
    with open(path_of(name), "w") as file:
        file.write(value)


def keep(wanted, test_end, tell):
    """The keeper: never returns. `test_end` is at its end when the test is."""
    os.setsid()
    for number in (signal.SIGTERM, signal.SIGINT, signal.SIGHUP, signal.SIGQUIT):
        signal.signal(number, signal.SIG_IGN)
    answer = b"R"
    before = {}
    try:
        # Nothing but these: whoever started the test may wait for its descriptors to close.
        lock = os.open(LOCK, os.O_RDWR | os.O_CREAT | os.O_CLOEXEC | os.O_NOFOLLOW, 0o600)
        kept = {test_end, tell, lock}
        for name in os.listdir("/proc/self/fd"):
            if int(name) not in kept:
                with contextlib.suppress(OSError):
                    os.close(int(name))
        fcntl.flock(lock, fcntl.LOCK_EX)
        for name, value in wanted.items():
            present = read_setting(name)
            if present != value:
                before[name] = present
                write_setting(name, value)
    except OSError as error:
        answer = str(error).encode()
    try:
        os.write(tell, answer)
        os.read(test_end, 1)
    finally:
        for name, value in before.items():
            write_setting(name, value)
        os._exit(0)


@contextlib.contextmanager
def kernel_settings(wanted):
    """Set `wanted` (a dict of names with dots to values); fails where that is not permitted."""
    test_end, hold = os.pipe()
    answer, tell = os.pipe()
    child = os.fork()
    if child == 0:
        # A grandchild: who ends the test's children does not end it.
        if os.fork() == 0:
            os.close(hold)
            keep(wanted, test_end, tell)
        os._exit(0)
    os.waitpid(child, 0)
    os.close(test_end)
    os.close(tell)
    try:
        text = os.read(answer, 4096)
        if text != b"R":
            raise OSError("the kernel's settings cannot be changed here: %s" %
                          (text.decode() or "their keeper has ended"))
        yield
    finally:
        os.close(hold)
        os.read(answer, 1)  # its end: everything is put back
        os.close(answer)


def main(arguments):
    end = arguments.index("--")
    wanted = dict(argument.split("=", 1) for argument in arguments[:end])
    with kernel_settings(wanted):
        return subprocess.call(arguments[end + 1:])


if __name__ == "__main__":
    sys.exit(main(sys.argv[1:]))
