"""Files of a test."""
import os
import stat


def read_file(path):
    """The text of a file that is there."""
    with open(path) as file:
        return file.read()


def read_text(path):
    """"" when there is none."""
    try:
        with open(path, errors="replace") as file:
            return file.read()
    except OSError:
        return ""


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
                    with open(path, "rb") as file:
                        content = file.read()
                kept = {key: os.getxattr(path, key, follow_symlinks=False)
                        for key in os.listxattr(path, follow_symlinks=False) if key in labels}
                found[os.path.relpath(path, root)] = (content, status.st_mode, status.st_uid,
                                                      status.st_gid, kept)
    return found
