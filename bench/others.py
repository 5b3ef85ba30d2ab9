"""A whole manual backup to a folder against two programs that keep versions of files."""
import os
import resource
import shutil
import subprocess
import time

import trees
from harness import Device, Table, median

#: quarnd may use this much of either's time, CPU and wall.
LIMIT = 0.5
PACKAGE = "org.example.bench"
TICKS = os.sysconf("SC_CLK_TCK")


def children_cpu():
    usage = resource.getrusage(resource.RUSAGE_CHILDREN)
    return usage.ru_utime + usage.ru_stime


def daemon_cpu(device):
    with open("/proc/%d/stat" % device.daemon_pid()) as file:
        fields = file.read().rsplit(")", 1)[1].split()
    return (int(fields[11]) + int(fields[12])) / TICKS


def timed(command, environment=None):
    """CPU and wall seconds of a command and its children."""
    before, begin = children_cpu(), time.monotonic()
    subprocess.run(command, check=True, env=environment, stdout=subprocess.DEVNULL,
                   stderr=subprocess.DEVNULL)
    return children_cpu() - before, time.monotonic() - begin


def ours(device):
    """The same of a manual backup: the client's and the daemon's."""
    before, begin, daemon = children_cpu(), time.monotonic(), daemon_cpu(device)
    device.client("backup")
    wall = time.monotonic() - begin
    return children_cpu() - before + daemon_cpu(device) - daemon, wall


def one_round(bin_dir, work, source):
    """(first, unchanged) as (CPU, wall) of each program."""
    shutil.rmtree(work, ignore_errors=True)
    os.makedirs(work)
    environment = dict(os.environ, HOME=work, RESTIC_PASSWORD="bench",
                       BORG_UNKNOWN_UNENCRYPTED_REPO_ACCESS_IS_OK="yes")
    restic = ["restic", "--no-cache", "-r", os.path.join(work, "restic")]
    repository = os.path.join(work, "borg")
    timed(restic + ["init"], environment)
    timed(["borg", "init", "-e", "none", repository], environment)
    device = Device(bin_dir, os.path.join(work, "device"))
    results = {"quarnd": [], "restic": [], "borg": []}
    try:
        device.install(source)
        device.client("activate")
        data = os.path.join(device.path, "root/opt/usr/apps", PACKAGE)
        for number in range(2):
            results["quarnd"].append(ours(device))
            results["restic"].append(timed(restic + ["backup", data], environment))
            results["borg"].append(timed(
                ["borg", "create", "-C", "lz4", "%s::%d" % (repository, number), data],
                environment))
    finally:
        device.stop()
    return results


def others(bin_dir, work, checks, runs):
    table = Table("tree", "run", "quarnd CPU s", "restic CPU s", "borg CPU s", "CPU / better",
                  "quarnd wall s", "restic wall s", "borg wall s", "wall / better")
    for kind in trees.TREES:
        source = os.path.join(work, "others-" + kind)
        trees.make_package(source, PACKAGE, "1.0.0", lambda root: trees.make(kind, root))
        rounds = [one_round(bin_dir, os.path.join(work, "others"), source) for _ in range(runs)]
        for number, name in ((0, "first"), (1, "unchanged")):
            cells, ratios = [], []
            for column in (0, 1):
                values = {program: median([one[program][number][column] for one in rounds])
                          for program in ("quarnd", "restic", "borg")}
                ratio = values["quarnd"] / min(values["restic"], values["borg"])
                cells += ["%.2f" % values[program] for program in values] + ["%.2f" % ratio]
                ratios.append(ratio)
            table.add(kind, name, *cells)
            for what, ratio in zip(("CPU", "wall"), ratios):
                checks.at_most("%s of the %s backup of %s, against the better of the others" %
                               (what, name, kind), ratio, LIMIT)
        shutil.rmtree(source)
    table.show("A whole manual backup to a folder, %d rounds" % runs)
