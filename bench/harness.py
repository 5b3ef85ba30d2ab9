"""What the benchmarks share: measuring, tables, what is required, and embedded devices."""
import mmap
import os
import statistics
import subprocess
import sys
import threading
import time

#: Peak memory of the daemon, kB.
CEILING_KB = 20480


def touch_memory(size=256 << 20):
    """
    Use memory and free it again, more than what is measured next will use: for unpacking and
    restores. What a virtual machine leaves free its host may take back, and who uses it next pays
    for that, up to as much as for all else that unpacking a large file does.
    """
    with mmap.mmap(-1, size) as memory:
        memory[::mmap.PAGESIZE] = b"\1" * (size // mmap.PAGESIZE)


def measure(command, cwd=None):
    """Run a command; CPU seconds of it and its children, wall seconds."""
    start = time.monotonic()
    pid = os.posix_spawnp(command[0], command, os.environ,
                          file_actions=[(os.POSIX_SPAWN_OPEN, fd, "/dev/null", os.O_WRONLY, 0)
                                        for fd in (1, 2)]) \
        if cwd is None else None
    if pid is None:
        process = subprocess.Popen(command, cwd=cwd, stdout=subprocess.DEVNULL)
        pid = process.pid
    _, status, usage = os.wait4(pid, 0)
    wall = time.monotonic() - start
    if cwd is not None:
        process.returncode = os.waitstatus_to_exitcode(status)
    if os.waitstatus_to_exitcode(status) != 0:
        raise SystemExit("%s failed with %d" % (command[0], os.waitstatus_to_exitcode(status)))
    return usage.ru_utime + usage.ru_stime, wall


def wall_of(run):
    """Wall seconds of a call."""
    start = time.monotonic()
    run()
    return time.monotonic() - start


def median(values):
    return statistics.median(values)


class Table:
    def __init__(self, *columns):
        self.rows = [columns]

    def add(self, *cells):
        self.rows.append(tuple(str(cell) for cell in cells))

    def show(self, title):
        widths = [max(len(row[i]) for row in self.rows) for i in range(len(self.rows[0]))]
        print("\n### %s\n" % title)
        for index, row in enumerate(self.rows):
            print("| " + " | ".join(cell.ljust(width) for cell, width in zip(row, widths)) + " |")
            if index == 0:
                print("|" + "|".join("-" * (width + 2) for width in widths) + "|")
        sys.stdout.flush()


class Checks:
    """Ratios and ceilings that are required; a short run allows them half as much again."""

    def __init__(self, slack):
        self.slack = slack
        self.failed = []

    def at_most(self, what, value, limit):
        allowed = limit * self.slack
        if value > allowed:
            self.failed.append("%s is %.3f, allowed %.3f" % (what, value, allowed))

    def hard(self, what, value, limit):
        """
        `value` is None where it could not be measured, which is not met either; but no regression.
        """
        if value is None:
            if self.slack > 1:
                return
            self.failed.append("%s was not measured, allowed %s" % (what, limit))
        elif value > limit:
            self.failed.append("%s is %s, allowed %s" % (what, value, limit))


class Device:
    """An embedded device with the daemon's memory watched."""

    def __init__(self, bin_dir, path, *create_options):
        self.tool = os.path.join(bin_dir, "quarn-device")
        self.path = path
        self.run("create", *create_options)
        self.run("start")

    def run(self, verb, *arguments, **keywords):
        return subprocess.run([self.tool, verb, self.path, *arguments], check=True,
                              stdout=subprocess.PIPE, text=True, **keywords).stdout

    def client(self, *arguments):
        return self.run("exec", "--", "quarnctl", *arguments)

    def install(self, source):
        self.run("install", source)

    def daemon_pid(self):
        for entry in os.listdir("/proc"):
            if not entry.isdigit():
                continue
            try:
                with open("/proc/%s/comm" % entry) as file:
                    if file.read().strip() != "quarnd":
                        continue
                with open("/proc/%s/environ" % entry, "rb") as file:
                    if ("QUARN_DEVICE_DIR=" + self.path).encode() in file.read().split(b"\0"):
                        return int(entry)
            except OSError:
                continue
        return None

    def stop(self):
        self.run("stop")


def peak_pss(pid):
    """
    The peak PSS of a process in kB if it shared no page with another one, a library's neither:
    that is its resident set. On a device where nothing else has the same libraries loaded it is
    what counts. The kernel keeps the peak, so a short one is not missed. 0 where there is none.
    """
    try:
        with open("/proc/%d/status" % pid) as file:
            # A process that has ended but was not waited for has none.
            return next((int(line.split()[1]) for line in file if line.startswith("VmHWM:")), 0)
    except OSError:
        return 0


def forget_peak(pid):
    """From now on the peak is counted anew."""
    try:
        with open("/proc/%d/clear_refs" % pid, "w") as file:
            file.write("5")  # of proc(5): the peak becomes what is resident now
    except (FileNotFoundError, ProcessLookupError):
        pass


class Watch:
    """The daemon's peak memory while a block runs, as peak_pss() counts it."""

    def __init__(self, device):
        self.device = device
        self.peak = 0
        self.done = threading.Event()
        self.thread = threading.Thread(target=self._sample)

    def _sample(self):
        # Again and again, as the daemon may end; and once more when the block is over.
        pid = None
        over = False
        while not over:
            over = self.done.wait(0.003)
            pid = pid or self.device.daemon_pid()
            if pid is None:
                continue
            peak = peak_pss(pid)
            self.peak = max(self.peak, peak)
            if peak == 0:
                pid = None

    def __enter__(self):
        pid = self.device.daemon_pid()
        if pid is not None:
            forget_peak(pid)
        self.thread.start()
        self.start = time.monotonic()
        return self

    def __exit__(self, *exc):
        self.wall = time.monotonic() - self.start
        self.done.set()
        self.thread.join()
        if self.peak == 0 and exc[0] is None:
            raise SystemExit("the daemon was not seen: its memory is not measured")
