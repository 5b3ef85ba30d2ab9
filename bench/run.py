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


ARCHIVE = "archive CPU / best of zip -1 and bsdtar"
SIZE = "archive size / zip -1"
UNPACK = "unpack CPU / bsdtar"
RESTORE = "whole restore CPU / (cp -a and bsdtar -x)"
REQUIRED = {
    ARCHIVE: {"small": 0.40, "db": 0.30, "media": 0.15, "mixed": 0.25},
    SIZE: {"small": 1.00, "db": 1.00, "media": 1.001, "mixed": 1.00},
    UNPACK: {"small": 0.65, "db": 0.65, "media": 0.85, "mixed": 0.65},
    RESTORE: {"small": 0.75, "db": 0.75, "media": 0.95, "mixed": 0.75},
}
CALLS_PER_FILE = 9


class Checks:
    """Ratios and ceilings that are required; a short run allows them half as much again."""

    def __init__(self, slack):
        self.slack = slack
        self.failed = []
        self.ratios = []

    def at_most(self, what, value, limit):
        allowed = limit * self.slack
        if value > allowed:
            self.failed.append("%s is %.3f, allowed %.3f" % (what, value, allowed))

    def hard(self, what, value, limit):
        if value > limit:
            self.failed.append("%s is %s, allowed %s" % (what, value, limit))

    def ratio(self, what, kind, value):
        """One of REQUIRED, for the table of all of them."""
        limit = REQUIRED[what][kind]
        self.ratios.append((what, kind, value, limit))
        self.at_most("%s of %s" % (what, kind), value, limit)

    def show(self):
        if not self.ratios:
            return
        table = Table("ratio", *trees.TREES)
        for what in REQUIRED:
            cells = {kind: "%.3f of %.3f %s" % (value, limit, "PASS" if value <= limit else "MISS")
                     for name, kind, value, limit in self.ratios if name == what}
            table.add(what, *(cells.get(kind, "") for kind in trees.TREES))
        table.show("Required ratios, medians of paired runs")


class Disk:
    """
    A file system of its own below `path`: ext4 with a journal, as devices have it. What other
    processes do to the machine's disk then changes nothing; an ext4 without a journal, for one,
    looks through every inode deleted lately before it makes a file. Where no image can be
    mounted it is a plain directory.
    """

    def __init__(self, path, mib):
        self.path = path
        self.image = path + ".img"
        os.makedirs(path)
        with open(self.image, "wb") as file:
            file.truncate(mib * trees.MIB)
        self.mounted = all(
            shutil.which(command[0]) is not None and
            subprocess.run(command, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL,
                           check=False).returncode == 0
            for command in (["mkfs.ext4", "-q", "-F", self.image],
                            ["mount", "-o", "loop", self.image, path]))

    def __enter__(self):
        return self

    def __exit__(self, *exc):
        if self.mounted:
            subprocess.run(["umount", self.path], check=True)
        os.unlink(self.image)


def label_tree(root):
    """Label everything as an application's data are, where this process may."""
    paths = [root] + [os.path.join(folder, name) for folder, folders, names in os.walk(root)
                      for name in folders + names]
    for attribute in ("security.SMACK64", "user.quarn.SMACK64"):
        try:
            for path in paths:
                os.setxattr(path, attribute, b"User::App::Bench")
            return
        except OSError:
            continue


def paired(runs, variants):
    """
    Run each variant (name: a callable that prepares a run and gives its command and directory)
    once a round, after one round to warm up. CPU and wall seconds by name.
    """
    cpu = {name: [] for name in variants}
    wall = {name: [] for name in variants}
    for run in range(runs + 1):
        for name, prepare in variants.items():
            used, took = measure(*prepare(run))
            if run > 0:
                cpu[name].append(used)
                wall[name].append(took)
    return cpu, wall


def median_ratio(values, others):
    return median([value / other for value, other in zip(values, others)])


def calls_per_file(tool, root, out, files):
    """System calls of the writer for one file; None where nothing can be traced."""
    if shutil.which("strace") is None:
        return None
    log = out + ".strace"
    done = subprocess.run(["strace", "-f", "-c", "-o", log, tool, "pack", root, PACKAGE, out],
                          check=False)
    if done.returncode != 0:
        return None
    with open(log) as file:
        total = [line.split() for line in file if line.rstrip().endswith("total")][-1]
    return int(total[3 if len(total) > 4 else 2]) / files


def pack_tree(tool, work, kind, root, runs, table, checks):
    sizes = [os.path.getsize(os.path.join(folder, name))
             for folder, _, names in os.walk(root) for name in names]
    ours, theirs, tars = (os.path.join(work, name) for name in ("q.zip", "z.zip", "b.zip"))

    def fresh(out, command, cwd=None):
        def prepare(_):
            if os.path.exists(out):
                os.unlink(out)
            return command, cwd
        return prepare

    cpu, wall = paired(runs, {
        "q": fresh(ours, [tool, "pack", root, PACKAGE, ours]),
        "z": fresh(theirs, ["zip", "-q", "-1", "-r", theirs, "data", "shared"], root),
        "b": fresh(tars, ["bsdtar", "-c", "--format", "zip", "--options",
                          "zip:compression=deflate,zip:compression-level=1", "-f", tars,
                          "data", "shared"], root)})
    best = median_ratio(cpu["q"], [min(z, b) for z, b in zip(cpu["z"], cpu["b"])])
    size = os.path.getsize(ours) / os.path.getsize(theirs)
    table.add(kind, len(sizes), "%.1f" % (sum(sizes) / trees.MIB),
              *("%.3f" % median(cpu[name]) for name in "qzb"), "%.2f" % best,
              "%.2f" % median_ratio(wall["q"], wall["z"]), "%.3f" % size,
              "%.3f" % (os.path.getsize(ours) / os.path.getsize(tars)))
    checks.ratio(ARCHIVE, kind, best)
    checks.ratio(SIZE, kind, size)
    if kind == "small":
        calls = calls_per_file(tool, root, ours + ".traced", len(sizes))
        if calls is not None:
            print("\nsystem calls per archived small file: %.1f, at most %d" %
                  (calls, CALLS_PER_FILE))
            checks.hard("system calls per archived small file", calls, CALLS_PER_FILE)
    return ours


def unpack_tree(tool, disk, kind, archive, runs, table, checks):
    kept = []

    def into(name, command):
        def prepare(run):
            target = os.path.join(disk, "%s-%d-%s" % (kind, run, name))
            os.makedirs(target)
            kept.append(target)  # deleted when all is measured: deleting has consequences
            return [target if part is None else part for part in command], None
        return prepare

    cpu, wall = paired(runs, {
        "q": into("q", [tool, "unpack", None, PACKAGE, archive]),
        "u": into("u", ["unzip", "-q", archive, "-d", None]),
        "b": into("b", ["bsdtar", "-x", "-f", archive, "-C", None])})
    by_tar = median_ratio(cpu["q"], cpu["b"])
    table.add(kind, *("%.3f" % median(cpu[name]) for name in "qub"),
              "%.2f" % median_ratio(cpu["q"], cpu["u"]), "%.2f" % by_tar,
              "%.2f" % median_ratio(wall["q"], wall["u"]))
    checks.ratio(UNPACK, kind, by_tar)
    for target in kept:
        shutil.rmtree(target)


def restore_tree(tool, disk, kind, root, archive, runs, table, checks):
    script = ('mkdir "$1/copy" && cp -a "$1/data" "$1/shared" "$1/copy" && '
              'bsdtar -x -f "$2" -C "$1"')

    def on_copy(name, command):
        def prepare(run):
            target = os.path.join(disk, "restore-%s-%d-%s" % (kind, run, name))
            subprocess.run(["cp", "-a", root, target], check=True)
            subprocess.run(["sync", "-f", target], check=True)  # else a restore's own sync does it
            return [target if part is None else part for part in command], None
        return prepare

    cpu, wall = paired(runs, {
        "q": on_copy("q", [tool, "restore", None, PACKAGE, archive]),
        "c": on_copy("c", ["sh", "-c", script, "sh", None, archive])})
    ratio = median_ratio(cpu["q"], cpu["c"])
    table.add(kind, *("%.3f" % median(cpu[name]) for name in "qc"), "%.2f" % ratio,
              "%.2f" % median_ratio(wall["q"], wall["c"]))
    checks.ratio(RESTORE, kind, ratio)
    for name in os.listdir(disk):
        if name.startswith("restore-"):
            shutil.rmtree(os.path.join(disk, name))


def archives(bin_dir, work, runs, checks):
    pack = Table("tree", "files", "MiB", "quarnd CPU s", "zip -1 CPU s", "bsdtar CPU s",
                 "CPU / best", "wall / zip -1", "size / zip -1", "size / bsdtar")
    unpack = Table("tree", "quarnd CPU s", "unzip CPU s", "bsdtar CPU s", "CPU / unzip",
                   "CPU / bsdtar", "wall / unzip")
    restore = Table("tree", "quarnd CPU s", "cp -a and bsdtar -x CPU s", "CPU ratio", "wall ratio")
    tool = os.path.join(bin_dir, "archive_tool")
    with Disk(os.path.join(work, "disk"), 3072) as disk:
        for kind in trees.TREES:
            root = os.path.join(disk.path, "tree-" + kind)
            trees.make(kind, root)
            label_tree(root)
            archive = pack_tree(tool, work, kind, root, runs, pack, checks)
            unpack_tree(tool, disk.path, kind, archive, runs, unpack, checks)
            restore_tree(os.path.join(bin_dir, "restore_tool"), disk.path, kind, root, archive,
                         runs, restore, checks)
            shutil.rmtree(root)
    pack.show("Archive writing, %d paired runs" % runs)
    unpack.show("Archive reading (attributes not counted), %d paired runs" % runs)
    restore.show("Whole restores (snapshot, unpacking, attributes), %d paired runs" % runs)
    checks.show()


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
            archives(bin_dir, work, 3 if options.short else 7, checks)
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
