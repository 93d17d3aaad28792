"""What one user does is not felt by another: his round trips while the first one floods, and what is left of it afterwards."""
import os
import re
import resource
import shutil
import subprocess
import time

from service import Outcome, Service

OTHER, FLOODER = 64001, 64002  # users that need not exist; each round has the next flooder
LOAD = os.path.join(os.environ["VX_IO_SHIM"].rpartition("/")[0], "vx_load")
# What the first user does, and with how much of it.
FLOODS = (("flood", 1), ("flood", 16), ("flood", 200), ("sessions", 1024), ("reporters", 16), ("mixed", 64), ("dying", 100),
          ("large", 1), ("unknown", 1), ("hostile", 1_000_000))
IN_SMALL = (("flood", 1), ("dying", 100), ("unknown", 1), ("hostile", 1_000_000))
CROWD = 1000  # connections that do nothing, where the cost of a call must not depend on them
# A percentile far beyond what was measured is a finding, on however busy a machine: taking turns is not a matter of luck.
MOST_P99_MS, MOST_RATIO = 25, 60
KEPT_MIB = 4  # of memory, after everybody has left
GIVEN_BACK = 25  # seconds after load, by which it is
LIMITS = """[device]
internal_build = true
[listener]
max_connections = 12000
max_connections_per_user = 11000
[log]
destination = "stderr"
level = "info"
"""
# Name, configuration, shim and rounds of each service; without a back end each session's set-up waits its nine seconds.
SERVICES = (
    ("quickly synced", LIMITS, {}, FLOODS),
    ("with each sync 20 ms slow", LIMITS, {"sync_ms": "20,20"}, FLOODS),
    ("with no relay back end", LIMITS + "[relay]\nbackends = []\n", {}, (("flood", 4), ("large", 4))),
    ("beside many connections", LIMITS, {}, (("idle", 10000), ("idle", 1000))),
)
FEW_DESCRIPTORS = 300  # beside many connections, in the second round


def load(user, service, seconds, kind, count=1):
    become = ["setpriv", f"--reuid={user}", "--clear-groups"] if user else []
    return subprocess.Popen([*become, LOAD, service.socket_path, str(seconds), kind, str(count)], stdout=subprocess.PIPE,
                            stderr=subprocess.STDOUT, text=True)


def figures(process, patience):
    text = process.communicate(timeout=patience)[0]
    return process.returncode, {k: int(v) for k, v in re.findall(r"(\w+)=(\d+)", text)}, text


def memory(service):
    """In KiB, with what is shared."""
    with open(f"/proc/{service.process.pid}/status") as status:
        return sum(int(n) for n in re.findall(r"Rss(?:Anon|Shmem):\s+(\d+)", status.read()))


def descriptors(service):
    return len(os.listdir(f"/proc/{service.process.pid}/fd"))


def one(outcome, service, seconds, kind, count, quiet):
    """A round; the percentile of the other user, or of his sixteen clients beside a hostile one."""
    user = FLOODER + outcome.figures["rounds"]
    crowd = load(user, service, seconds + 4, "idle", CROWD) if kind == "unknown" else None
    time.sleep(1 if crowd else 0)
    probe = load(OTHER, service, seconds, "probe") if kind == "idle" else None  # it has its descriptor
    time.sleep(0.5 if probe else 0)
    flood = load(user, service, seconds + 2, kind, count) if kind else None
    time.sleep(1 if kind and not probe else 0)
    probe = probe or load(OTHER, service, seconds, "probe", 16 if kind == "hostile" else 1)
    status, seen, text = figures(probe, seconds + 60)
    outcome.found("probe_lost", f"{kind} {count}: {text}", status != 0 or seen["refused"] > 0 or seen["answers"] < 10 * seconds)
    for process in filter(None, (crowd, flood)):
        status, did, text = figures(process, seconds + 60)
        outcome.found("flood_lost", f"{kind} {count}: {text}", status != 0 or did["answers"] == 0)
    outcome.figures["rounds"] += 1
    if flood:
        p99 = seen["p99_us"] / 1000
        print(f"  {kind} {count}: {did['answers'] / (seconds + 2):.0f}/s; the other user's round trip: p50 {seen['p50_us'] / 1000:.2f} ms,"
              f" p99 {p99:.2f} ms, most {seen['max_us'] / 1000:.2f} ms (p99 of nobody else's: {quiet / 1000:.2f} ms)", flush=True)
        outcome.found("held_up", f"p99 {p99} ms beside {kind} {count}", p99 > max(MOST_P99_MS, MOST_RATIO * quiet / 1000))
    return seen["p99_us"]


def serve(outcome, seconds, small, name, configuration, shim, rounds):
    service = Service(configuration)
    os.chmod(service.folder, 0o755)
    try:
        service.start(**shim)
        quiet = one(outcome, service, seconds, None, 0, 0)
        one(outcome, service, seconds, "flood", 200, quiet)  # whatever is kept for good is there afterwards
        time.sleep(GIVEN_BACK)
        before, files = memory(service), descriptors(service)
        for kind, count in rounds:
            if small and rounds is FLOODS and (kind, count) not in IN_SMALL:
                continue
            print(f"  {name},", end="")
            if (kind, count) == ("idle", 1000):
                resource.prlimit(service.process.pid, resource.RLIMIT_NOFILE, (FEW_DESCRIPTORS, FEW_DESCRIPTORS))
            one(outcome, service, seconds, kind, count, quiet)
        deadline = time.monotonic() + 2 * GIVEN_BACK
        while time.monotonic() < deadline and (memory(service) > before + KEPT_MIB * 1024 or descriptors(service) > files):
            time.sleep(0.5)
        kept = memory(service) - before
        print(f"  {name}: {kept / 1024:.1f} MiB more than after the first flood", flush=True)
        outcome.found("memory_kept", f"{name}: {kept} KiB more than after the first flood", kept > KEPT_MIB * 1024)
        outcome.found("descriptors_kept", f"{name}: more than after the first flood", descriptors(service) - files)
        outcome.found("stop", service.life_log()[-500:], service.stop() != 0 or service.rows_lost() != 0)
    finally:
        service.clean_up()


def run(options):
    if os.geteuid() != 0 or not shutil.which("setpriv"):
        return Outcome(skipped="only root has two users")
    outcome = Outcome("fair")
    os.chmod(os.environ["VX_FAULTS_FOLDER"], 0o755)
    for name, configuration, shim, rounds in SERVICES[::2] if options.small else SERVICES:  # in small the first and the third
        serve(outcome, 2 if options.small else 6, options.small, name, configuration, shim, rounds)
    return outcome
