"""What is installed on a device."""
import os


def make_source(path, package, version, files, metadata=None, apps=None, **keys):
    """A package source: `files` maps relative paths to bytes, (bytes, mode), or ("->", target)."""
    os.makedirs(path, exist_ok=True)
    for name, content in files.items():
        target = os.path.join(path, name)
        os.makedirs(os.path.dirname(target), exist_ok=True)
        mode = None
        if isinstance(content, tuple) and content[0] == "->":
            os.symlink(content[1], target)
            continue
        if isinstance(content, tuple):
            content, mode = content
        with open(target, "wb") as file:
            file.write(content)
        if mode is not None:
            os.chmod(target, mode)
    lines = ["[package]", "id=" + package, "version=" + version,
             "type=" + keys.get("type", "tpk")]
    for key in ("preload", "storage"):
        if key in keys:
            value = keys[key]
            lines.append("%s=%s" % (key, str(value).lower() if isinstance(value, bool) else value))
    for app in apps or [package]:
        lines += ["", "[app %s]" % app, "api-version=4.0"]
        lines += ["metadata.%s=%s" % item for item in (metadata or {}).items()]
    with open(os.path.join(path, "package.ini"), "w") as file:
        file.write("\n".join(lines) + "\n")
    return path
