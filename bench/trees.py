"""The four application trees that the benchmarks run over. The same seed gives the same bytes."""
import os
import random
import sqlite3

#: Whose files an application's are.
APPLICATION_USER = 5000
KIB = 1024
MIB = 1024 * KIB
WORDS = ("watch step heart note sleep walk morning battery charge place street river cloud light "
         "paper letter number table window garden winter summer music record message reply").split()


def _write(path, data):
    os.makedirs(os.path.dirname(path), exist_ok=True)
    with open(path, "wb") as file:
        file.write(data)


def _text(rng, size):
    parts = []
    length = 0
    while length < size:
        line = " ".join(rng.choice(WORDS) for _ in range(9)) + " %d\n" % rng.randrange(10 ** 6)
        parts.append(line)
        length += len(line)
    return "".join(parts).encode()[:size]


def _database(path, rng, size):
    """A SQLite database of about `size` bytes: rows of text, numbers and small blobs."""
    os.makedirs(os.path.dirname(path), exist_ok=True)
    base = sqlite3.connect(path)
    base.execute("PRAGMA journal_mode=OFF")
    base.execute("PRAGMA synchronous=OFF")
    base.execute("CREATE TABLE entries(id INTEGER PRIMARY KEY, at INTEGER, title TEXT, body TEXT,"
                 " data BLOB)")
    base.execute("CREATE INDEX by_time ON entries(at)")
    row = 0
    while os.path.getsize(path) < size:
        with base:
            for _ in range(500):
                row += 1
                base.execute("INSERT INTO entries VALUES(?,?,?,?,?)",
                             (row, 1700000000 + row * 37, _text(rng, 40).decode(),
                              _text(rng, 400).decode(), rng.randbytes(160)))
    base.close()


def small(root):
    rng = random.Random(1)
    for index in range(2000):
        name = "data/notes/%02d/entry-%04d.txt" % (index % 40, index)
        _write(os.path.join(root, name), _text(rng, rng.randrange(512, 8 * KIB)))


def db(root):
    rng = random.Random(2)
    _database(os.path.join(root, "data/app.db"), rng, 20 * MIB)
    for index in range(5):
        _write(os.path.join(root, "data/conf/%d.ini" % index), _text(rng, 2 * KIB))


def media(root):
    rng = random.Random(3)
    for index in range(40):
        _write(os.path.join(root, "shared/data/photos/%02d.jpg" % index), rng.randbytes(500 * KIB))


def mixed(root):
    rng = random.Random(4)
    _database(os.path.join(root, "data/app.db"), rng, 8 * MIB)
    for index in range(300):
        _write(os.path.join(root, "data/text/%03d.txt" % index), _text(rng, 20 * KIB))
    for index in range(29):
        _write(os.path.join(root, "shared/data/media/%02d.bin" % index), rng.randbytes(350 * KIB))


TREES = {"small": small, "db": db, "media": media, "mixed": mixed}


def make(kind, root):
    """Make one tree below `root`, with the three data directories of an application, all its own."""
    for folder in ("data", "shared/data", "shared/trusted"):
        os.makedirs(os.path.join(root, folder), exist_ok=True)
    TREES[kind](root)
    for folder, folders, names in os.walk(root):
        for name in [".", *names]:
            os.chown(os.path.join(folder, name), APPLICATION_USER, APPLICATION_USER)


def make_package(source, package, version, fill):
    """A package source for quarn-device install; `fill(source)` writes its files."""
    for folder in ("data", "shared/data", "shared/trusted"):
        os.makedirs(os.path.join(source, folder), exist_ok=True)
    with open(os.path.join(source, "package.ini"), "w") as file:
        file.write("[package]\nid=%s\nversion=%s\ntype=tpk\n\n[app %s]\napi-version=4.0\n"
                   % (package, version, package))
    fill(source)
