"""What one user does is not felt by another: his round trips while the first one floods, and what is left of it afterwards."""
import os
import re
import shutil
import subprocess
import time

from service import Outcome, Service

FLOODER, OTHER = 64001, 64002  # users that need not exist
LOAD = os.path.join(os.environ["VX_IO_SHIM"].rpartition("/")[0], "vx_load")
FLOODS = (("flood", 1), ("flood", 16), ("flood", 200), ("hostile", 1 << 30), ("reporters", 16), ("mixed", 64), ("sessions", 1024))
SLOW_SYNC = {"sync_ms": "20,20"}
# A percentile far beyond what was measured is a finding, on however busy a machine: taking turns is not a matter of luck.
MOST_P99_MS, MOST_RATIO = 25, 60
KEPT_MIB = 8  # of memory, after everybody has left


def load(user, service, seconds, kind, count=1):
    return subprocess.Popen(["setpriv", f"--reuid={user}", "--clear-groups", LOAD, service.socket_path, str(seconds), kind,
                             str(count)], stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True)


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
    flood = load(FLOODER, service, seconds + 2, kind, count) if kind else None
    time.sleep(1 if kind else 0)
    status, seen, text = figures(load(OTHER, service, seconds, "probe"), seconds + 60)
    outcome.found("probe_lost", f"{kind} {count}: {text}", status != 0 or seen["refused"] > 0 or seen["answers"] < seconds)
    if flood:
        status, did, text = figures(flood, seconds + 60)
        outcome.found("flood_lost", f"{kind} {count}: {text}", status != 0 or did["answers"] == 0)
        p99 = seen["p99_us"] / 1000
        print(f"  {kind} {count}: {did['answers'] / (seconds + 2):.0f}/s; the other user's round trip: p50 {seen['p50_us'] / 1000:.2f} ms,"
              f" p99 {p99:.2f} ms, most {seen['max_us'] / 1000:.2f} ms (p99 of nobody else's: {quiet / 1000:.2f} ms)", flush=True)
        outcome.found("held_up", f"p99 {p99} ms beside {kind} {count}", p99 > max(MOST_P99_MS, MOST_RATIO * quiet / 1000))
    return seen["p99_us"]


def run(options):
    if os.geteuid() != 0 or not shutil.which("setpriv"):
        return Outcome(skipped="only root has two users")
    outcome = Outcome("fair")
    seconds = 2 if options.small else 8
    for shim in ({}, SLOW_SYNC):
        service = Service()
        os.chmod(service.folder, 0o755)
        os.chmod(os.environ["VX_FAULTS_FOLDER"], 0o755)
        try:
            service.start(**shim)
            quiet = one(outcome, service, seconds, None, 0, 0)
            one(outcome, service, seconds, "flood", 200, quiet)  # whatever is kept for good is there afterwards
            time.sleep(2)
            before, files = memory(service), descriptors(service)
            for kind, count in FLOODS[::3] if options.small else FLOODS:
                print("  with each sync 20 ms slow," if shim else "  quickly synced,", end="")
                one(outcome, service, seconds, kind, count, quiet)
                outcome.figures["rounds"] += 1
            deadline = time.monotonic() + 20
            while time.monotonic() < deadline and (memory(service) > before + KEPT_MIB * 1024 or descriptors(service) > files):
                time.sleep(0.5)
            outcome.found("memory_kept", f"{memory(service) - before} KiB more than after the first flood",
                          memory(service) > before + KEPT_MIB * 1024)
            outcome.found("descriptors_kept", "more than after the first flood", descriptors(service) - files)
            outcome.found("stop", service.life_log()[-500:], service.stop() != 0 or service.rows_lost() != 0)
        finally:
            service.clean_up()
    return outcome
