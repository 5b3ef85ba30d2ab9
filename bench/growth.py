"""Cost that grows as it should: files in a package, entries in the application list."""
import json
import os
import random
import shutil

import trees
from archives import Disk
from harness import CEILING_KB, Device, Table, Watch, wall_of

#: Time a unit may grow by this from one size to the next, from the second size on.
FLAT = 1.2
#: How often the list is read; what else the machine does only adds to the fastest.
READS = 10
PACKAGE = "org.example.bench"


def flat(checks, what, rows):
    """`rows`: (size, time a unit), the sizes rising."""
    for (small, before), (large, after) in zip(rows[1:], rows[2:]):
        checks.at_most("%s, %d against %d" % (what, large, small), after / before, FLAT)


def backed_up_and_restored(bin_dir, place, count):
    """What a backup of a package of `count` files took, and a restore of it over them."""
    rng = random.Random(11)
    source = os.path.join(place, "files-%d" % count)
    trees.make_package(source, PACKAGE, "1.0.0", lambda root: [
        trees._write(os.path.join(root, "data/%03d/%05d.txt" % (index // 100, index)),
                     trees._text(rng, 1000)) for index in range(count)])
    device = Device(bin_dir, os.path.join(place, "device-files-%d" % count))
    try:
        device.install(source)
        device.client("activate")
        with Watch(device) as backup:
            device.client("app", "backup", PACKAGE)
        with Watch(device) as restore:
            device.client("app", "restore", PACKAGE)
    finally:
        device.stop()
    shutil.rmtree(device.path)
    shutil.rmtree(source)
    return backup, restore


def files(bin_dir, work, checks, counts):
    """One package of more and more files, backed up and restored."""
    table = Table("files", "backup s", "ms a file", "restore s", "ms a file", "peak PSS kB")
    packed, restored = [], []
    with Disk(os.path.join(work, "disk-files"), 2048) as disk:
        for count in counts:
            backup, restore = backed_up_and_restored(bin_dir, disk.path, count)
            peak = max(backup.peak, restore.peak)
            packed.append((count, backup.wall / count))
            restored.append((count, restore.wall / count))
            table.add(count, "%.2f" % backup.wall, "%.3f" % (1000 * backup.wall / count),
                      "%.2f" % restore.wall, "%.3f" % (1000 * restore.wall / count), peak)
            checks.hard("peak PSS with %d files" % count, peak, CEILING_KB)
    table.show("One package of many files (1 kB each)")
    flat(checks, "time a file, backup", packed)
    flat(checks, "time a file, restore", restored)


def listed(bin_dir, work, checks, counts, packages=200):
    """A backup of one package, and reading the list, with more and more other devices in it."""
    table = Table("devices", "entries", "list kB", "backup s", "list s", "us an entry",
                  "list: us an entry", "peak PSS kB")
    rows, reads = [], []
    source = os.path.join(work, "listed")
    trees.make_package(source, PACKAGE, "1.0.0",
                       lambda root: trees._write(os.path.join(root, "data/file"), b"text"))
    for count in counts:
        device = Device(bin_dir, os.path.join(work, "device-listed-%d" % count))
        try:
            device.install(source)
            path = os.path.join(device.path, "cloud/app_list/app_list.txt")
            os.makedirs(os.path.dirname(path))
            with open(path, "w") as file:
                json.dump({"format_ver": 1, "model_list": [
                    {"backup_info": {"timestamp": 1700000000000 + number,
                                     "serial_number": "36%013d" % number,
                                     "model_name": "Orvane One"},
                     "pkg_list": [{"pkg_id": "org.example.p%04d" % index, "version": "1.0.0",
                                   "crc": 7919 * index} for index in range(packages)]}
                    for number in range(count)]}, file)
            size = os.path.getsize(path) // 1000
            device.client("activate")
            with Watch(device) as backup:
                device.client("backup")
            with Watch(device) as read:
                fastest = min(wall_of(lambda: device.client("list")) for _ in range(READS))
        finally:
            device.stop()
        shutil.rmtree(device.path)
        entries = count * packages
        peak = max(backup.peak, read.peak)
        rows.append((entries, (backup.wall + fastest) / entries))
        # By itself too: most of a backup takes the same time at any size, which hides growth.
        reads.append((entries, fastest / entries))
        table.add(count, entries, size, "%.2f" % backup.wall, "%.3f" % fastest,
                  *("%.1f" % (1e6 * each[-1][1]) for each in (rows, reads)), peak)
        checks.hard("peak PSS with %d devices in the list" % count, peak, CEILING_KB)
    table.show("An application list of many devices with %d packages each" % packages)
    flat(checks, "time an entry of the list", rows)
    flat(checks, "time an entry of the list, reading alone", reads)
