"""What an application does, with its rights."""
import contextlib
import ctypes
import os
import signal
import sys

#: The applications' user and group.
APPLICATION = 5000

_AT_FDCWD = -100
_RENAME_EXCHANGE = 2
_LIBC = ctypes.CDLL(None, use_errno=True)


def exchange_names(one, other):
    """Each is what the other was, at once. Whether that was so."""
    return _LIBC.renameat2(_AT_FDCWD, one.encode(), _AT_FDCWD, other.encode(),
                           _RENAME_EXCHANGE) == 0


def as_application(work):
    """A child process of the applications' user that does `work`; its id."""
    child = os.fork()
    if child == 0:
        try:
            os.setgroups([])
            os.setresgid(APPLICATION, APPLICATION, APPLICATION)
            os.setresuid(APPLICATION, APPLICATION, APPLICATION)
            work()
        except BaseException as error:  # whatever it is, the parent goes on
            print("application:", repr(error), file=sys.stderr)
            os._exit(1)
        os._exit(0)
    return child


@contextlib.contextmanager
def application(work):
    """`work` again and again as the applications' user, until the end of the block."""
    def for_ever():
        while True:
            work()
    child = as_application(for_ever)
    try:
        yield
        if os.waitpid(child, os.WNOHANG) != (0, 0):
            raise AssertionError("the application has ended")
    finally:
        with contextlib.suppress(ProcessLookupError, ChildProcessError):
            os.kill(child, signal.SIGKILL)
            os.waitpid(child, 0)
