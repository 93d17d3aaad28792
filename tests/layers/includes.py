"""Fails on an include that runs against the layers.

Statistics -> platform interfaces <- platform/linux; client -> platform; only the process entry sees both sides.
"""
import os
import re
import sys

ALLOWED = {  # folder -> folders whose headers it may include, longest prefix first
    "Statistics": ("Statistics/", "platform/"),
    "platform/linux": ("platform/",),
    "platform": ("platform/",),
    "client": ("client/", "platform/"),
}
FORBIDDEN = {"Statistics": ("platform/linux/",), "platform": ("platform/linux/",), "client": ("platform/linux/",)}
ENTRY = "Statistics/Service/main.cpp"
PRODUCT_LIBRARIES = re.compile(r"<(sys/|systemd|sqlite3|toml|unistd|fcntl|pthread|linux/)")


def folder_of(path):
    return next((f for f in sorted(ALLOWED, key=len, reverse=True) if path.startswith(f + "/")), None)


def faults_of(path, text):
    folder = folder_of(path)
    if folder is None or path == ENTRY:
        return
    for number, line in enumerate(text.splitlines(), 1):
        match = re.match(r'\s*#\s*include\s*(["<][^">]+[">])', line)
        if not match:
            continue
        name = match.group(1)
        if name[0] == '"':
            target = name[1:-1]
            if not target.startswith(ALLOWED[folder]) or target.startswith(FORBIDDEN.get(folder, ())):
                yield f"{path}:{number}: {folder}/ must not include {target}"
        elif folder in ("Statistics", "platform") and PRODUCT_LIBRARIES.match(name):
            yield f"{path}:{number}: {folder}/ uses the standard library alone, not {name}"


def main(root):
    # The check itself must be able to fail.
    assert list(faults_of("Statistics/a.cpp", '#include "platform/linux/EventLoop.h"'))
    assert list(faults_of("platform/linux/a.cpp", '#include "Statistics/x.h"'))
    assert list(faults_of("Statistics/a.cpp", "#include <sys/socket.h>"))
    faults, files = [], 0
    for folder in ("Statistics", "platform", "client"):
        for parent, _, names in os.walk(os.path.join(root, folder)):
            for name in names:
                if name.endswith((".h", ".cpp")):
                    path = os.path.join(parent, name)
                    files += 1
                    with open(path) as f:
                        faults += faults_of(os.path.relpath(path, root), f.read())
    print("\n".join(faults) or f"{files} files keep to the layers")
    return 1 if faults or files < 20 else 0


sys.exit(main(sys.argv[1]))
