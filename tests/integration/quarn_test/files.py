"""Files of a test."""
import os
import stat


def read_file(path):
    """The text of a file that is there."""
    with open(path) as file:
        return file.read()


def read_bytes(path):
    """The same of one that is no text."""
    with open(path, "rb") as file:
        return file.read()


def read_text(path):
    """What can be read as text, "" when there is no file."""
    try:
        with open(path, errors="replace") as file:
            return file.read()
    except OSError:
        return ""


def label_of(path):
    """A file's label, wherever the kernel lets it be kept; None when it has none."""
    for name in ("security.SMACK64", "user.quarn.SMACK64"):
        try:
            return os.getxattr(path, name, follow_symlinks=False).decode()
        except OSError:
            continue
    return None


def tree(root, folders=("",), labels=()):
    """Everything below `folders` of `root`, by its path from there: content (of a file, the target
    of a link), mode, owner, group, and of the extended attributes those in `labels`."""
    found = {}
    for top in folders:
        for folder, below, names in os.walk(os.path.join(root, top)):
            for name in below + names:
                path = os.path.join(folder, name)
                status = os.lstat(path)
                content = None
                if stat.S_ISLNK(status.st_mode):
                    content = os.readlink(path)
                elif stat.S_ISREG(status.st_mode):
                    content = read_bytes(path)
                kept = {key: os.getxattr(path, key, follow_symlinks=False)
                        for key in os.listxattr(path, follow_symlinks=False) if key in labels}
                found[os.path.relpath(path, root)] = (content, status.st_mode, status.st_uid,
                                                      status.st_gid, kept)
    return found
