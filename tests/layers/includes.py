"""Fails on an include that runs against the layers, or on a name of another layer in a link line.

Statistics -> platform interfaces <- platform/linux; everything may use base and propertylist; ipc and client use wire;
only the process entry and the replay tool see both sides.
"""
import pathlib
import re
import sys

PURE = ("base/", "propertylist/")
LINUX = "platform/linux/"
ALLOWED = {  # layer -> prefixes of the headers it may include beside its own; the longest layer that fits a file counts
    "base": (),
    "propertylist": ("base/",),
    "wire": PURE,
    "platform": PURE,
    "platform/linux": (*PURE, "platform/"),
    "Statistics": (*PURE, "platform/"),
    "client": (*PURE, "wire/"),
    "tools": (*PURE, "client/"),
    # Checks the configuration, asks the service, reads the store, explains a message.
    "tools/report": (*PURE, "client/", "wire/", "Statistics/", "platform/", LINUX + "store/", LINUX + "ConfigurationCheck.h",
                     LINUX + "PlatformConfiguration.h"),
    **{f"platform/linux/{wing}": (*PURE, "platform/", *others) for wing, others in {
        "execution": (LINUX + "journal/",),
        "settings": (LINUX + "execution/",),
        "diagnostics": (LINUX + "execution/",),
        "device": (LINUX + "execution/",),
        "journal": (),
        "aggregates": (LINUX + "execution/", LINUX + "journal/"),
        "store": (LINUX + "execution/", LINUX + "journal/", LINUX + "RelayBackend.h"),
        "ipc": (LINUX + "execution/", LINUX + "journal/", "wire/"),
        "recovery": (*(LINUX + wing for wing in ("execution/", "journal/", "store/", "ipc/")), "wire/"),
    }.items()},
}
ENTRIES = ("Statistics/Service/main.cpp", "tools/Replay.cpp")
STANDARD_ONLY = ("Statistics", "platform", "propertylist", "wire")
OUTSIDE = re.compile(r"<([a-z0-9_]+/|sqlite3|toml|unistd|fcntl|pthread|poll|signal\.h|malloc)")


def layer_of(path):
    return next((layer for layer in sorted(ALLOWED, key=len, reverse=True) if path.startswith(layer + "/")), None)


def may_include(layer, target):
    if target.startswith(LINUX) and layer != "platform/linux":
        others = [p for p in ALLOWED[layer] if p.startswith(LINUX)]
        return target.startswith((*((layer + "/",) if layer.startswith(LINUX) else ()), *others))
    return target.startswith((layer + "/", *ALLOWED[layer]))


def faults_of(path, text):
    layer = layer_of(path)
    if layer is None or path in ENTRIES:
        return
    for number, line in enumerate(text.splitlines(), 1):
        match = re.match(r'\s*#\s*include\s*(["<][^">]+[">])', line)
        name = match.group(1) if match else ""
        if name.startswith('"') and not may_include(layer, name[1:-1]):
            yield f"{path}:{number}: {layer}/ must not include {name[1:-1]}"
        elif layer in STANDARD_ONLY and OUTSIDE.match(name):
            yield f"{path}:{number}: {layer}/ uses the standard library alone, not {name}"


WRONG = {  # of each kind of wrong arrow: the check itself must be able to fail
    "Statistics/a.cpp": (LINUX + "execution/EventLoop.h", "client/a.h", "wire/Protocol.h"),
    LINUX + "store/a.cpp": (LINUX + "ipc/SocketListener.h", LINUX + "recovery/a.h", "wire/a.h", "Statistics/a.h"),
    "client/a.cpp": ("platform/Log.h", LINUX + "ipc/a.h"),
    "tools/report/a.cpp": (LINUX + "ipc/a.h",),
    "platform/a.h": (LINUX + "store/a.h",),
    "base/a.h": ("propertylist/a.h",),
}


def main(root):
    for path, targets in WRONG.items():
        for target in targets:
            assert list(faults_of(path, f'#include "{target}"')), (path, target)
    assert list(faults_of("Statistics/a.cpp", "#include <sys/socket.h>"))
    assert not list(faults_of(LINUX + "ipc/a.cpp", '#include "wire/a.h"\n#include <sys/socket.h>'))
    tops = {layer.split("/")[0] for layer in ALLOWED}
    paths = [p for top in sorted(tops) for p in sorted((root / top).rglob("*")) if p.suffix in (".h", ".cpp")]
    faults = [fault for p in paths for fault in faults_of(str(p.relative_to(root)), p.read_text())]
    print("\n".join(faults) or f"{len(paths)} files keep to the layers")
    return 1 if faults or len(paths) < 20 else 0


sys.exit(main(pathlib.Path(sys.argv[1])))
