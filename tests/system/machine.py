"""A minimal Debian 12 that a real systemd has booted in a container. As root.

Nothing of the host is used but its kernel and its network, where packages come from: a tmpfs of its own on /run/systemd
and a control group of its own make the host look as systemd-nspawn wants it, also where the host runs no systemd.
"""
import contextlib
import os
import pathlib
import shutil
import signal
import subprocess
import time

BOOT = """
mount --make-rprivate / && mount -t tmpfs tmpfs /run/systemd || exit 1
for tree in /sys/fs/cgroup/systemd /sys/fs/cgroup/unified /sys/fs/cgroup; do
  if [ -w $tree/cgroup.procs ]; then mkdir -p $tree/$2 && echo $$ >$tree/$2/cgroup.procs; fi
done
exec systemd-nspawn --quiet --directory="$1" --boot --keep-unit --register=no --console=pipe
"""
PATH = "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin"
# Beyond a system that boots: what the packages depend on, so that installing them needs no network, and compilers for the
# clients.
INCLUDED = "systemd-sysv,dbus,sqlite3,python3,libwayland-client0,gcc,g++,libc6-dev,pkg-config"


def base(folder):
    """The root that every machine begins as; made once."""
    root = pathlib.Path(folder) / "base"
    if not root.exists():
        fresh = root.with_name("base.new")
        shutil.rmtree(fresh, ignore_errors=True)
        print("Making a minimal Debian 12 with debootstrap, once ...", flush=True)
        log = root.with_name("debootstrap.log")
        fresh.parent.mkdir(parents=True, exist_ok=True)
        with open(log, "w") as out:
            made = subprocess.run(["debootstrap", "--variant=minbase", f"--include={INCLUDED}", "bookworm", fresh,
                                   os.environ.get("VX_DEBIAN_MIRROR", "http://deb.debian.org/debian")],
                                  stdout=out, stderr=out, stdin=subprocess.DEVNULL, timeout=900)
        assert made.returncode == 0, f"debootstrap failed, see {log}"
        fresh.rename(root)
    return root


class Machine:
    def __init__(self, folder):
        self.root = pathlib.Path(folder) / "root"
        shutil.rmtree(self.root, ignore_errors=True)
        subprocess.run(["cp", "-a", "--reflink=auto", base(folder), self.root], check=True, timeout=300)
        self.group = f"vxsystem.{os.getpid()}"
        self.console = self.root.with_name("console.log")
        self.leader = None
        self.processes = 0

    def boot(self):
        with open(self.console, "w") as out:
            self.container = subprocess.Popen(["unshare", "--mount", "sh", "-c", BOOT, "sh", self.root, self.group],
                                              stdin=subprocess.DEVNULL, stdout=out, stderr=out, start_new_session=True)
        children = pathlib.Path(f"/proc/{self.container.pid}/task/{self.container.pid}/children")

        def is_running():
            assert self.container.poll() is None, "the container ended:\n" + self.console.read_text()[-2000:]
            with contextlib.suppress(OSError):
                self.leader = next(iter(children.read_text().split()), None)
            return self.leader and self.run("systemctl is-system-running", check=False).stdout.strip() in ("running", "degraded")
        self.wait_until(is_running, "the system has booted", 120)

    def run(self, command, user=None, check=True, timeout=120, **options):
        """In a shell of the machine."""
        as_user = ["setpriv", f"--reuid={user}", f"--regid={user}", "--init-groups"] if user else []
        ended = subprocess.run(["nsenter", "--target", self.leader, "--all", "env", "-i", f"PATH={PATH}", "LC_ALL=C.UTF-8",
                                "DEBIAN_FRONTEND=noninteractive", *as_user, "sh", "-c", "cd /; " + command],
                               capture_output=True, text=True, timeout=timeout, **({"stdin": subprocess.DEVNULL} | options))
        assert not check or ended.returncode == 0, f"{command}: {ended.returncode}\n{ended.stdout[-2000:]}\n{ended.stderr[-2000:]}"
        return ended

    def start(self, command, user):
        """A process of the machine, with a pipe into it and a file out of it."""
        self.processes += 1
        out = open(self.root.with_name(f"process.{self.processes}.log"), "w+")
        process = subprocess.Popen(["nsenter", "--target", self.leader, "--all", "env", "-i", f"PATH={PATH}", "setpriv",
                                    f"--reuid={user}", f"--regid={user}", "--init-groups", "sh", "-c", "cd /; exec " + command],
                                   stdin=subprocess.PIPE, stdout=out, stderr=out, text=True)
        process.said = lambda: open(out.name).read()
        return process

    def wait_until(self, condition, what, patience=60):
        end = time.monotonic() + patience
        while not condition():
            assert time.monotonic() < end, f"waited in vain until {what() if callable(what) else what}"
            time.sleep(0.1)

    def power_off(self):
        if self.leader:
            self.container.send_signal(signal.SIGTERM)  # an orderly poweroff
        try:
            self.container.wait(30)
        except subprocess.TimeoutExpired:
            os.killpg(self.container.pid, signal.SIGKILL)
            self.container.wait()
        for tree in ("systemd", "unified", "."):
            group = pathlib.Path("/sys/fs/cgroup", tree, self.group)
            for folder in sorted(group.rglob("*/"), reverse=True) if group.exists() else ():
                with contextlib.suppress(OSError):
                    folder.rmdir()
            with contextlib.suppress(OSError):
                group.rmdir()
        shutil.rmtree(self.root, ignore_errors=True)
