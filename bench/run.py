"""Whole-run benchmarks: prints tables in Markdown. Called by scripts/bench."""
import argparse
import os
import random
import shutil
import signal
import subprocess
import sys
import tempfile

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
import cloud  # noqa: E402
import growth  # noqa: E402
import others  # noqa: E402
import start  # noqa: E402
import trees  # noqa: E402
from archives import archives  # noqa: E402
from harness import CEILING_KB, Checks, Device, Table, Watch  # noqa: E402

SECTIONS = ("archives", "start", "fleet", "files", "list", "installed", "large", "others", "cloud")


def fleet(bin_dir, work, counts, checks):
    """A whole backup of many small packages: time per package must stay flat."""
    table = Table("packages", "first run s", "ms a package", "unchanged run s", "ms a package",
                  "peak PSS kB")
    per_package = []
    source = os.path.join(work, "package")

    def fill(root):
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
    for column, name in ((1, "first"), (2, "unchanged")):
        growth.flat(checks, "time a package (%s run)" % name,
                    [(row[0], row[column]) for row in per_package])


def installed_at_once(bin_dir, work, checks, count=100):
    """Restore mode on a second device, and the packages of the first one installed in a row."""
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
    parser.add_argument("--only", choices=SECTIONS, action="append")
    options = parser.parse_args()
    # Servers, devices and mounts go also when somebody ends this.
    signal.signal(signal.SIGTERM, lambda *_: sys.exit(128 + signal.SIGTERM))
    checks = Checks(1.5 if options.short else 1.0)
    bin_dir = os.path.abspath(options.bin)
    wanted = options.only or SECTIONS
    short = options.short
    with tempfile.TemporaryDirectory(prefix="quarn-bench-") as work:
        if "archives" in wanted:
            archives(bin_dir, work, 3 if short else 7, checks)
        if "start" in wanted:
            start.start(bin_dir, work, checks, 7 if short else 15)
        if "fleet" in wanted:
            fleet(bin_dir, work, (10, 100) if short else (10, 100, 1000, 5000), checks)
        if "files" in wanted:
            growth.files(bin_dir, work, checks,
                         (10, 100, 1000) if short else (10, 100, 1000, 5000, 20000))
        if "list" in wanted:
            growth.listed(bin_dir, work, checks, (5, 10) if short else (5, 10, 25, 50))
        if "installed" in wanted:
            installed_at_once(bin_dir, work, checks)
        if "large" in wanted:
            large(bin_dir, work, checks)
        if "others" in wanted:
            others.others(bin_dir, work, checks, 1 if short else 3)
        if "cloud" in wanted:
            cloud.cloud(bin_dir, work, checks, 1 if short else 3)
    if checks.failed:
        print()
        for line in checks.failed:
            print("not met: " + line)
        sys.exit(1)
    print("\nall required ratios met")


if __name__ == "__main__":
    main()
