"""Whole-run benchmarks: prints tables in Markdown. Called by scripts/bench."""
import argparse
import json
import os
import shutil
import statistics
import subprocess
import sys
import tempfile
import threading
import time

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
import trees  # noqa: E402

PACKAGE = "org.example.bench"
CEILING_KB = 20480


def measure(command, cwd=None):
    """Run a command; CPU seconds of it and its children, wall seconds."""
    start = time.monotonic()
    pid = os.posix_spawnp(command[0], command, os.environ,
                          file_actions=[(os.POSIX_SPAWN_OPEN, 1, "/dev/null", os.O_WRONLY, 0)]) \
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
        if value > limit:
            self.failed.append("%s is %s, allowed %s" % (what, value, limit))


def archives(tool, work, runs, checks):
    pack = Table("tree", "files", "MiB", "quarnd CPU s", "zip -1 CPU s", "bsdtar CPU s",
                 "CPU / zip -1", "CPU / best", "wall / zip -1", "size / zip -1", "size / bsdtar")
    unpack = Table("tree", "quarnd CPU s", "unzip CPU s", "bsdtar CPU s", "CPU / unzip",
                   "CPU / bsdtar", "wall / unzip")
    for kind in trees.TREES:
        root = os.path.join(work, "tree-" + kind)
        trees.make(kind, root)
        sizes = [os.path.getsize(os.path.join(folder, name))
                 for folder, _, names in os.walk(root) for name in names]
        ours, theirs, tars = (os.path.join(work, name) for name in ("q.zip", "z.zip", "b.zip"))
        cpu = {"q": [], "z": [], "b": []}
        wall = {"q": [], "z": [], "b": []}
        for run in range(runs + 1):
            for key, command, cwd, out in (
                    ("q", [tool, "pack", root, PACKAGE, ours], None, ours),
                    ("z", ["zip", "-q", "-1", "-r", theirs, "data", "shared"], root, theirs),
                    ("b", ["bsdtar", "-c", "--format", "zip", "--options",
                           "zip:compression=deflate,zip:compression-level=1", "-f", tars,
                           "data", "shared"], root, tars)):
                if os.path.exists(out):
                    os.unlink(out)
                used, took = measure(command, cwd)
                if run > 0:
                    cpu[key].append(used)
                    wall[key].append(took)
        q, z, b = (median(cpu[key]) for key in "qzb")
        best = median([x / min(y, w) for x, y, w in zip(cpu["q"], cpu["z"], cpu["b"])])
        size = os.path.getsize(ours) / os.path.getsize(theirs)
        pack.add(kind, len(sizes), "%.1f" % (sum(sizes) / trees.MIB), "%.3f" % q, "%.3f" % z,
                 "%.3f" % b, "%.2f" % (q / z), "%.2f" % best,
                 "%.2f" % (median(wall["q"]) / median(wall["z"])), "%.3f" % size,
                 "%.3f" % (os.path.getsize(ours) / os.path.getsize(tars)))
        checks.at_most("archive CPU of %s / zip -1" % kind, q / z, 1.0)
        checks.at_most("archive size of %s / zip -1" % kind, size, 1.001)
        cpu = {"q": [], "u": [], "b": []}
        wall = {"q": [], "u": [], "b": []}
        for run in range(runs + 1):
            for key, command in (("q", [tool, "unpack", None, PACKAGE, ours]),
                                 ("u", ["unzip", "-q", ours, "-d", None]),
                                 ("b", ["bsdtar", "-x", "-f", ours, "-C", None])):
                target = os.path.join(work, "out-" + key)
                shutil.rmtree(target, ignore_errors=True)
                os.makedirs(target)
                used, took = measure([target if part is None else part for part in command])
                if run > 0:
                    cpu[key].append(used)
                    wall[key].append(took)
                shutil.rmtree(target)
        q, u, b = (median(cpu[key]) for key in "qub")
        by_tar = median([x / y for x, y in zip(cpu["q"], cpu["b"])])
        unpack.add(kind, "%.3f" % q, "%.3f" % u, "%.3f" % b, "%.2f" % (q / u), "%.2f" % by_tar,
                   "%.2f" % (median(wall["q"]) / median(wall["u"])))
        checks.at_most("unpack CPU of %s / unzip" % kind, q / u, 1.0)
        shutil.rmtree(root)
    pack.show("Archive writing, %d paired runs" % runs)
    unpack.show("Archive reading (attributes not counted), %d paired runs" % runs)


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


class Watch:
    """Samples the daemon's PSS, and its CPU time, while a block runs."""

    def __init__(self, device):
        self.device = device
        self.peak = 0
        self.done = threading.Event()
        self.thread = threading.Thread(target=self._sample)

    def _sample(self):
        pid = None
        while not self.done.wait(0.003):
            pid = pid or self.device.daemon_pid()
            if pid is None:
                continue
            try:
                with open("/proc/%d/smaps_rollup" % pid) as file:
                    for line in file:
                        if line.startswith("Pss:"):
                            self.peak = max(self.peak, int(line.split()[1]))
            except OSError:
                pid = None

    def __enter__(self):
        self.thread.start()
        self.start = time.monotonic()
        return self

    def __exit__(self, *exc):
        self.wall = time.monotonic() - self.start
        self.done.set()
        self.thread.join()


def fleet(bin_dir, work, counts, checks):
    """A whole backup of many small packages: time per package must stay flat."""
    table = Table("packages", "first run s", "ms a package", "unchanged run s", "ms a package",
                  "peak PSS kB")
    per_package = []
    source = os.path.join(work, "package")

    def fill(root):
        import random
        rng = random.Random(9)
        for index in range(8):
            trees._write(os.path.join(root, "data/%d.txt" % index), trees._text(rng, 6000))

    for count in counts:
        device = Device(bin_dir, os.path.join(work, "device-%d" % count))
        try:
            for index in range(count):
                shutil.rmtree(source, ignore_errors=True)
                trees.make_package(source, "org.example.p%05d" % index, "1.0.0", fill)
                device.install(source)
            with Watch(device) as first:
                device.client("backup")
            with Watch(device) as second:
                device.client("backup")
        finally:
            device.stop()
        shutil.rmtree(device.path)
        peak = max(first.peak, second.peak)
        per_package.append((count, first.wall / count, second.wall / count))
        table.add(count, "%.2f" % first.wall, "%.2f" % (1000 * first.wall / count),
                  "%.2f" % second.wall, "%.2f" % (1000 * second.wall / count), peak)
        checks.hard("peak PSS with %d packages" % count, peak, CEILING_KB)
    table.show("A whole manual backup of small packages (8 files, 48 kB each)")
    for index in range(1, len(per_package)):
        for column, name in ((1, "first"), (2, "unchanged")):
            ratio = per_package[index][column] / per_package[index - 1][column]
            checks.at_most("time a package (%s run), %d against %d packages" %
                           (name, per_package[index][0], per_package[index - 1][0]), ratio, 1.3)


def installed_at_once(bin_dir, work, checks, count=100):
    """Restore mode on a second device, and the packages of the first one installed in a row."""
    import random
    serial = "350000000000033"
    first = Device(bin_dir, os.path.join(work, "device-from"), "--serial", serial)
    second = Device(bin_dir, os.path.join(work, "device-to"), "--cloud",
                    "file://" + os.path.join(first.path, "cloud"))
    table = Table("packages", "from the first installation to the last restore, s", "ms a package",
                  "peak PSS kB")

    def fill(root):
        rng = random.Random(9)
        for index in range(8):
            trees._write(os.path.join(root, "data/%d.txt" % index), trees._text(rng, 6000))

    try:
        bare = []
        for index in range(count):
            source = os.path.join(work, "full-%d" % index)
            trees.make_package(source, "org.example.p%05d" % index, "1.0.0", fill)
            first.install(source)
            bare.append(os.path.join(work, "bare-%d" % index))
            trees.make_package(bare[-1], "org.example.p%05d" % index, "1.0.0", lambda root: None)
        first.client("backup")
        second.client("activate")
        watcher = subprocess.Popen([second.tool, "exec", second.path, "--", "quarnctl", "restore",
                                    "on", "--from", serial, "--watch"],
                                   stdout=subprocess.PIPE, text=True)
        while "restore mode is on" not in watcher.stdout.readline():
            if watcher.poll() is not None:
                raise SystemExit("restore mode could not be switched on")
        with Watch(second) as watch:
            for source in bare:
                second.install(source)
            watcher.communicate(timeout=300)
        if watcher.returncode != 0:
            raise SystemExit("the restore ended with %d" % watcher.returncode)
    finally:
        first.stop()
        second.stop()
    table.add(count, "%.2f" % watch.wall, "%.2f" % (1000 * watch.wall / count), watch.peak)
    checks.hard("peak PSS of the restore of %d packages" % count, watch.peak, CEILING_KB)
    table.show("Restore of packages installed at once")


def large(bin_dir, work, checks):
    """Packages at the size cap, and their restore on a second device."""
    table = Table("run", "s", "peak PSS kB")
    cap = 25 * trees.MIB
    sources = []
    for index in range(4):
        source = os.path.join(work, "large-%d" % index)

        def fill(root, seed=index):
            import random
            rng = random.Random(100 + seed)
            if seed % 2:
                trees._write(os.path.join(root, "data/blob.bin"), rng.randbytes(cap))
            else:
                trees._write(os.path.join(root, "data/text.txt"), trees._text(rng, cap))

        trees.make_package(source, "org.example.large%d" % index, "1.0.0", fill)
        sources.append(source)
    device = Device(bin_dir, os.path.join(work, "device-large"))
    try:
        for source in sources:
            device.install(source)
        for name in ("backup of 4 packages of 25 MiB", "the same, unchanged"):
            with Watch(device) as watch:
                device.client("backup")
            table.add(name, "%.2f" % watch.wall, watch.peak)
            checks.hard("peak PSS: " + name, watch.peak, CEILING_KB)
        # As text: the client of an older checkout has no restore verb.
        with Watch(device) as watch:
            device.client("app", "restore", "org.example.large1")
        table.add("restore of one package of 25 MiB", "%.2f" % watch.wall, watch.peak)
        checks.hard("peak PSS: restore of 25 MiB", watch.peak, CEILING_KB)
    finally:
        device.stop()
    shutil.rmtree(device.path)
    table.show("Packages at the size cap")


def main():
    parser = argparse.ArgumentParser(description=__doc__)
    parser.add_argument("--bin", required=True, help="directory of the programs")
    parser.add_argument("--short", action="store_true",
                        help="few runs, and ratios may be off by half")
    parser.add_argument("--only", choices=("archives", "fleet", "installed", "large"), action="append")
    options = parser.parse_args()
    checks = Checks(1.5 if options.short else 1.0)
    bin_dir = os.path.abspath(options.bin)
    wanted = options.only or ("archives", "fleet", "installed", "large")
    with tempfile.TemporaryDirectory(prefix="quarn-bench-") as work:
        if "archives" in wanted:
            archives(os.path.join(bin_dir, "archive_tool"), work, 3 if options.short else 7, checks)
        if "fleet" in wanted:
            fleet(bin_dir, work, (10, 100) if options.short else (10, 100, 1000), checks)
        if "installed" in wanted:
            installed_at_once(bin_dir, work, checks)
        if "large" in wanted:
            large(bin_dir, work, checks)
    if checks.failed:
        print()
        for line in checks.failed:
            print("not met: " + line)
        sys.exit(1)
    print("\nall required ratios met")


if __name__ == "__main__":
    main()
