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

#: How often a short run measures what it does not find met: a busy machine is no regression.
SHORT_ATTEMPTS = 3


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


#: By name: what measures it, given the programs, a directory, whether the run is short, and checks.
SECTIONS = {
    "archives": lambda bin_dir, work, short, checks:
        archives(bin_dir, work, 3 if short else 7, checks),
    "start": lambda bin_dir, work, short, checks:
        start.start(bin_dir, work, checks, 7 if short else 15),
    "fleet": lambda bin_dir, work, short, checks:
        fleet(bin_dir, work, (10, 100, 300) if short else (10, 100, 1000, 5000), checks),
    "files": lambda bin_dir, work, short, checks:
        growth.files(bin_dir, work, checks,
                     (10, 100, 1000) if short else (10, 100, 1000, 5000, 20000)),
    "list": lambda bin_dir, work, short, checks:
        growth.listed(bin_dir, work, checks, (5, 10, 25) if short else (5, 10, 25, 50)),
    "installed": lambda bin_dir, work, short, checks: installed_at_once(bin_dir, work, checks),
    "large": lambda bin_dir, work, short, checks: large(bin_dir, work, checks),
    "others": lambda bin_dir, work, short, checks:
        others.others(bin_dir, work, checks, 1 if short else 7),
    "cloud": lambda bin_dir, work, short, checks:
        cloud.cloud(bin_dir, work, checks, 1 if short else 7),
}


def measured(name, bin_dir, work, short):
    """What of a section is not met, in the best of its attempts."""
    failed = []
    for attempt in range(SHORT_ATTEMPTS if short else 1):
        checks = Checks(1.5 if short else 1.0)
        place = os.path.join(work, "%s-%d" % (name, attempt))
        os.makedirs(place)
        SECTIONS[name](bin_dir, place, short, checks)
        failed = checks.failed
        if not failed:
            break
        if short:
            print("\nnot met in attempt %d: %s" % (attempt + 1, "; ".join(failed)), flush=True)
    return failed


def main():
    parser = argparse.ArgumentParser(description=__doc__)
    parser.add_argument("--bin", required=True, help="directory of the programs")
    parser.add_argument("--short", action="store_true",
                        help="few runs, and ratios may be off by half")
    parser.add_argument("--only", choices=list(SECTIONS), action="append")
    options = parser.parse_args()
    # Servers, devices and mounts go also when somebody ends this.
    signal.signal(signal.SIGTERM, lambda *_: sys.exit(128 + signal.SIGTERM))
    bin_dir = os.path.abspath(options.bin)
    failed = []
    with tempfile.TemporaryDirectory(prefix="quarn-bench-") as work:
        for name in SECTIONS:
            if options.only is None or name in options.only:
                failed += measured(name, bin_dir, work, options.short)
    if failed:
        print()
        for line in failed:
            print("not met: " + line)
        sys.exit(1)
    print("\nall required ratios met")


if __name__ == "__main__":
    main()
