"""A full or read-only disk, while running and at start: everybody is answered, and when there is room again all is there."""
import errno
import os
import subprocess
import time

from harness import CREATE, DESTROY, REPORTERS, Client
from io_faults import BRIEF
from kill_faults import settled
from service import Outcome, spread
from store_check import stopped
from traffic import scene


LONGEST_PAUSE = 10  # seconds, between two attempts to write


def mount(path, options):
    subprocess.run(["mount", "-t", "tmpfs", "-o", options, "tmpfs", path], check=True, capture_output=True)


def fill(path):
    with open(path, "wb", buffering=0) as f:
        for size in (65536, 4096, 1):
            try:
                while f.write(bytes(size)):
                    pass
            except OSError as e:
                assert e.errno == errno.ENOSPC, e


def newcomer_is_served(service, traffic):
    traffic.connections += 1
    began = time.monotonic()
    c = Client(service.socket_path)
    for call in ((CREATE, 1 << 40), (REPORTERS,), (DESTROY, 1 << 40)):
        c.call(*call)
    c.close()
    return time.monotonic() < began + BRIEF


def one(argument):
    seed, full, at_start, used = argument
    with scene(seed) as (r, service, traffic):
        state, mean = service.folder + "/state", service.folder + "/mean"
        mount(state, "size=4m")
        try:
            if used:
                traffic.healthy_life()
            # A tmpfs with files open does not become read-only; then the calls say that it is.
            shim = {} if full or at_start else {"fault": f"owtanu,{errno.EROFS},1,0", "while": mean}
            if full:
                begin, end = (lambda: fill(state + "/filler")), (lambda: os.remove(state + "/filler"))
            elif at_start:
                begin, end = (lambda: mount(state, "remount,ro")), (lambda: mount(state, "remount,rw"))
            else:
                begin, end = (lambda: open(mean, "w").close()), (lambda: os.remove(mean))
            if at_start:
                begin()
            service.launch(**shim)
            if not service.is_ready():
                refused = Outcome(argument)
                refused.found("refused", service.life_log().strip()[-200:])
                return refused
            if not at_start:
                traffic.life(6)
                begin()
            answered = traffic.life(20, BRIEF) and newcomer_is_served(service, traffic)
            end()
            traffic.round_ends.append(traffic.now())  # for a look at it while it runs
            live = settled(traffic, seconds=LONGEST_PAUSE)
            traffic.round_ends.pop()
            check = stopped(traffic, argument)
            check.found("unanswered", "calls", not answered)
            check.found("late", [*live.findings.values()], live.lacks())
            return check
        finally:
            subprocess.run(["umount", "-l", state], check=False, capture_output=True)


def run(options):
    if os.geteuid() != 0:
        return Outcome(skipped="only root can mount a small tmpfs")
    cases = [(options.seed * 100 + i, full, at_start, used) for i in range(options.rounds or (1 if options.small else 4))
             for full in (True, False) for at_start in (True, False) for used in (False, True)]
    return spread(one, cases, options)
