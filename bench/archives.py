"""Archive writing, reading and whole restores against the usual tools on the same trees."""
import os
import shutil
import subprocess

import trees
from harness import Table, measure, median, touch_memory

PACKAGE = "org.example.bench"
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
#: Restores are written back to the disk, which makes single runs swing by a fifth.
MORE_RESTORES = 4


class Ratios:
    """The required ratios of the trees, for one table of all of them."""

    def __init__(self, checks):
        self.checks = checks
        self.rows = []

    def add(self, what, kind, value):
        limit = REQUIRED[what][kind]
        self.rows.append((what, kind, value, limit))
        self.checks.at_most("%s of %s" % (what, kind), value, limit)

    def show(self):
        table = Table("ratio", *trees.TREES)
        for what in REQUIRED:
            cells = {kind: "%.3f of %.3f %s" % (value, limit, "PASS" if value <= limit else "MISS")
                     for name, kind, value, limit in self.rows if name == what}
            table.add(what, *(cells.get(kind, "") for kind in trees.TREES))
        table.show("Required ratios, medians of paired runs")


class Disk:
    """
    A file system of its own below `path`: ext4 with a journal, as devices have it. What other
    processes do to the machine's disk then changes nothing; an ext4 without a journal, for one,
    looks through every inode deleted lately before it makes a file. Where no image can be
    mounted it is a plain directory, and says so.
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
        if not self.mounted:
            print("\nno file system of its own could be mounted: measured in a plain directory",
                  flush=True)

    def settle(self):
        """
        Everything is on the disk and nothing of it in memory, as after a start: what the kernel
        keeps of files that were just made lies scattered, and is slower to find.
        """
        subprocess.run(["sync", "-f", self.path], check=True)
        if self.mounted:
            subprocess.run(["umount", self.path], check=True)
            subprocess.run(["mount", "-o", "loop", self.image, self.path], check=True)

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
    once a round, after one round to warm up; the order changes with every round, since the second
    finds the machine as the first left it. CPU and wall seconds by name.
    """
    cpu = {name: [] for name in variants}
    wall = {name: [] for name in variants}
    for run in range(runs + 1):
        for name, prepare in list(variants.items())[::1 if run % 2 else -1]:
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


def pack_tree(tool, work, kind, root, runs, table, ratios):
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
    ratios.add(ARCHIVE, kind, best)
    ratios.add(SIZE, kind, size)
    if kind == "small":
        calls = calls_per_file(tool, root, ours + ".traced", len(sizes))
        print("\nsystem calls per archived small file: %s, at most %d" %
              ("not measured" if calls is None else "%.1f" % calls, CALLS_PER_FILE))
        ratios.checks.hard("system calls per archived small file", calls, CALLS_PER_FILE)
    return ours


def unpack_tree(tool, disk, kind, archive, runs, table, ratios):
    kept = []

    def into(name, command):
        def prepare(run):
            target = os.path.join(disk, "%s-%d-%s" % (kind, run, name))
            os.makedirs(target)
            kept.append(target)  # deleted when all is measured: deleting has consequences
            touch_memory()
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
    ratios.add(UNPACK, kind, by_tar)
    for target in kept:
        shutil.rmtree(target)


def restore_tree(tool, disk, kind, root, archive, runs, table, ratios):
    script = ('mkdir "$1/copy" && cp -a "$1/data" "$1/shared" "$1/copy" && '
              'bsdtar -x -f "$2" -C "$1"')

    def on_copy(name, command):
        def prepare(run):
            target = os.path.join(disk, "restore-%s-%d-%s" % (kind, run, name))
            subprocess.run(["cp", "-a", root, target], check=True)
            subprocess.run(["sync", "-f", target], check=True)  # else a restore's own sync does it
            touch_memory()
            return [target if part is None else part for part in command], None
        return prepare

    cpu, wall = paired(runs, {
        "q": on_copy("q", [tool, "restore", None, PACKAGE, archive]),
        "c": on_copy("c", ["sh", "-c", script, "sh", None, archive])})
    ratio = median_ratio(cpu["q"], cpu["c"])
    table.add(kind, *("%.3f" % median(cpu[name]) for name in "qc"), "%.2f" % ratio,
              "%.2f" % median_ratio(wall["q"], wall["c"]))
    ratios.add(RESTORE, kind, ratio)
    for name in os.listdir(disk):
        if name.startswith("restore-"):
            shutil.rmtree(os.path.join(disk, name))


def limits(tool, disk, kind, root, archive, runs, table):
    """What an archive cannot be faster than: the codec alone, a copy, reading the tree."""
    speeds = []
    for _ in range(runs):
        text = subprocess.run([tool, "codec", root], check=True, stdout=subprocess.PIPE, text=True)
        size, *seconds = (float(number) for number in text.stdout.split())
        speeds.append([size / 1e6 / second for second in seconds])
    copies = []

    def copy(run):
        target = os.path.join(disk, "limit-%s-%d" % (kind, run))
        copies.append(target)
        return ["cp", "-a", root, target], None

    cpu, _ = paired(runs, {
        "read": lambda _: (["sh", "-c", "find . -type f -exec cat {} + > /dev/null"], root),
        "copy": copy,
        "crc": lambda _: (["cat", archive], None)})
    table.add(kind, *("%.0f" % median(column) for column in zip(*speeds)),
              *("%.3f" % median(cpu[name]) for name in ("read", "copy", "crc")))
    for target in copies:
        shutil.rmtree(target)


def archives(bin_dir, work, runs, checks):
    pack = Table("tree", "files", "MiB", "quarnd CPU s", "zip -1 CPU s", "bsdtar CPU s",
                 "CPU / best", "wall / zip -1", "size / zip -1", "size / bsdtar")
    unpack = Table("tree", "quarnd CPU s", "unzip CPU s", "bsdtar CPU s", "CPU / unzip",
                   "CPU / bsdtar", "wall / unzip")
    restore = Table("tree", "quarnd CPU s", "cp -a and bsdtar -x CPU s", "CPU ratio", "wall ratio")
    held = Table("tree", "codec alone: deflate MB/s", "inflate MB/s", "reading the tree CPU s",
                 "cp -a CPU s", "reading the archive CPU s")
    tool = os.path.join(bin_dir, "archive_tool")
    ratios = Ratios(checks)
    with Disk(os.path.join(work, "disk"), 3072) as disk:
        for kind in trees.TREES:
            root = os.path.join(disk.path, "tree-" + kind)
            trees.make(kind, root)
            label_tree(root)
            disk.settle()
            archive = pack_tree(tool, work, kind, root, runs, pack, ratios)
            unpack_tree(tool, disk.path, kind, archive, runs, unpack, ratios)
            restore_tree(os.path.join(bin_dir, "restore_tool"), disk.path, kind, root, archive,
                         runs + MORE_RESTORES, restore, ratios)
            limits(tool, disk.path, kind, root, archive, runs, held)
            shutil.rmtree(root)
    pack.show("Archive writing, %d paired runs" % runs)
    unpack.show("Archive reading (attributes not counted), %d paired runs" % runs)
    restore.show("Whole restores (snapshot, unpacking, attributes), %d paired runs" %
                 (runs + MORE_RESTORES))
    held.show("What these are held against")
    ratios.show()
