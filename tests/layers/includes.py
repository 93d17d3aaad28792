"""Fails on an include that runs against the layers, or on a name of another layer in a link line.

Statistics -> platform interfaces <- platform/linux; everything may use base and propertylist; ipc and client use wire;
only the process entry sees both sides.
"""
import os
import re
import sys

PURE = ("base/", "propertylist/")
LINUX = "platform/linux/"
ALLOWED = {  # room -> prefixes of the headers it may include beside its own; the longest room that fits a file counts
    "base": (),
    "propertylist": ("base/",),
    "wire": PURE,
    "platform": PURE,
    "platform/linux": (*PURE, "platform/"),
    "Statistics": (*PURE, "platform/"),
    "client": (*PURE, "wire/"),
    "tools": (*PURE, "client/"),
    **{f"platform/linux/{wing}": (*PURE, "platform/", *others) for wing, others in {
        "execution": (),
        "settings": (),
        "diagnostics": (LINUX + "execution/",),
        "device": (LINUX + "execution/",),
        "store": (LINUX + "execution/", LINUX + "RelayBackend.h"),
        "ipc": (LINUX + "execution/", "wire/"),
    }.items()},
}
ENTRY = "Statistics/Service/main.cpp"
STANDARD_ONLY = ("Statistics", "platform", "propertylist", "wire")
OUTSIDE = re.compile(r"<([a-z0-9_]+/|sqlite3|toml|unistd|fcntl|pthread|poll|signal\.h|malloc)")


def room_of(path):
    return next((room for room in sorted(ALLOWED, key=len, reverse=True) if path.startswith(room + "/")), None)


def may_include(room, target):
    if target.startswith(LINUX) and room.startswith("platform/linux/"):
        return target.startswith((room + "/", *(p for p in ALLOWED[room] if p.startswith(LINUX))))
    if target.startswith(LINUX):
        return room == "platform/linux"
    return target.startswith((room + "/", *ALLOWED[room]))


def faults_of(path, text):
    room = room_of(path)
    if room is None or path == ENTRY:
        return
    for number, line in enumerate(text.splitlines(), 1):
        match = re.match(r'\s*#\s*include\s*(["<][^">]+[">])', line)
        if not match:
            continue
        name = match.group(1)
        if name[0] == '"':
            if not may_include(room, name[1:-1]):
                yield f"{path}:{number}: {room}/ must not include {name[1:-1]}"
        elif room in STANDARD_ONLY and OUTSIDE.match(name):
            yield f"{path}:{number}: {room}/ uses the standard library alone, not {name}"


WRONG = [  # one of each wrong arrow: the check itself must be able to fail
    ("Statistics/a.cpp", "platform/linux/execution/EventLoop.h"), ("Statistics/a.cpp", "client/a.h"),
    ("Statistics/a.cpp", "wire/Protocol.h"), ("platform/a.h", "platform/linux/LinuxPlatform.h"),
    ("platform/a.h", "Statistics/a.h"), ("platform/a.h", "wire/Protocol.h"), ("platform/linux/a.cpp", "Statistics/a.h"),
    ("platform/linux/store/a.cpp", "platform/linux/ipc/SocketListener.h"), ("platform/linux/store/a.cpp", "wire/a.h"),
    ("platform/linux/execution/a.cpp", "platform/linux/store/a.h"), ("platform/linux/ipc/a.cpp", "Statistics/a.h"),
    ("platform/linux/ipc/a.cpp", "platform/linux/PlatformConfiguration.h"), ("client/a.cpp", "platform/Log.h"),
    ("client/a.cpp", "platform/linux/ipc/a.h"), ("wire/a.h", "platform/Log.h"), ("wire/a.h", "client/a.h"),
    ("propertylist/a.h", "wire/a.h"), ("propertylist/a.h", "platform/Log.h"), ("base/a.h", "propertylist/a.h"),
    ("tools/a.cpp", "platform/Log.h"),
]


def main(root):
    for path, target in WRONG:
        assert list(faults_of(path, f'#include "{target}"')), (path, target)
    assert list(faults_of("Statistics/a.cpp", "#include <sys/socket.h>"))
    assert not list(faults_of("platform/linux/ipc/a.cpp", '#include "wire/a.h"\n#include <sys/socket.h>'))
    faults, files = [], 0
    for top in sorted({room.split("/")[0] for room in ALLOWED}):
        for parent, _, names in os.walk(os.path.join(root, top)):
            for name in names:
                if name.endswith((".h", ".cpp")):
                    path = os.path.join(parent, name)
                    files += 1
                    with open(path) as f:
                        faults += faults_of(os.path.relpath(path, root), f.read())
    print("\n".join(faults) or f"{files} files keep to the layers")
    return 1 if faults or files < 20 else 0


sys.exit(main(sys.argv[1]))
