"""kill -9 at random moments, during recovery too: what was answered is there exactly once, and every session is ended."""
import threading
import time

from harness import SEND, STOP, Client
from service import CONFIGURATION, spread
from store_check import Check, stopped
from traffic import ALARMS, Session, Start, scene

ROUNDS_IN_A_CHAIN = 10
MARKER = 1 << 40     # an identifier
CUT_BYTES = 9 << 20  # of messages: more than the journal takes before it is cut
LONGEST_START = 5    # seconds: no session's set-up is waited for again


def loaded_until_killed(r, service, traffic):
    killer = threading.Timer(10 ** r.uniform(-2.2, -0.3), service.process.kill)
    killer.start()
    try:
        traffic.connect(r.randrange(2, 5))
        while service.process.poll() is None:
            traffic.step()
    except OSError:
        pass  # the moment has come
    killer.join()


def kept_open_until_killed(r, service, traffic):
    """Sessions that stay open for so much traffic that the journal is cut meanwhile, again and again."""
    traffic.connect(2)
    for peer in traffic.peers:
        for type_ in (2, 7, ALARMS):
            traffic.create(peer, type_)
    for cut in range(1, 4):
        sent = 0
        while sent < CUT_BYTES:
            size = r.choice((0, 3000))
            for peer in traffic.peers:
                traffic.burst(peer, 60, size=size)
                sent += 60 * size
            traffic.take()
            traffic.send(r.choice(traffic.peers), None)
            if r.random() < 0.1:
                traffic.create(r.choice(traffic.peers), start=False)
        service.wait_until(lambda: service.counter("snapshots") >= cut, "the journal is cut")
    traffic.burst(r.choice(traffic.peers), r.randrange(100), size=100)


def end_marker_session(service, traffic):
    """When its end is stored, so is what was recovered before it, but for what is delayed."""
    traffic.connections += 1
    traffic.apps[None] = Session(MARKER, 12, "")
    traffic.apps[None].starts.append(Start(traffic.apps[None], 0, 0, 0))
    c = Client(service.socket_path)
    c.started(MARKER, 12)
    c.call(SEND, {"marker": 1}, 1, 0, [MARKER])
    c.call(STOP, MARKER)
    c.close()


COMMITTED = 6  # seconds within which what was accepted is in the store: commit_interval_ms is 5 s, and one to be seen


def settled(traffic, seconds=COMMITTED):
    """A check while the daemon runs, when nothing lacks or nothing has come for some seconds."""
    check, since = Check(traffic, patient=True), time.monotonic()
    while check.lacks() and time.monotonic() < since + seconds:
        time.sleep(0.2)
        before, check = check, Check(traffic, patient=True)
        since = time.monotonic() if check.lacks() != before.lacks() else since
    return check


def chain(argument):
    """Rounds in the same folders."""
    seed, rounds, waits, kept_open = argument
    with scene(seed, CONFIGURATION + '[store]\nmax_bytes = "1GiB"\n') as (r, service, traffic):  # nothing goes for its size
        # With slow syncs the store's thread lags: sessions stay in set-up, rows in the queue.
        shim = {"sync_ms": "5,80"} if r.random() < 0.5 else {}
        service.start(**shim)
        for _ in range(rounds):
            (kept_open_until_killed if kept_open else loaded_until_killed)(r, service, traffic)
            service.kill()
            traffic.process_ended("crashed")
            if r.random() < 0.4:  # one that recovers; after the second in a row the journal is moved aside
                service.launch(**shim)
                time.sleep(10 ** r.uniform(-3, -1))
                service.kill()
            service.start(**shim)
        end_marker_session(service, traffic)
        if waits:
            time.sleep(max(0, max((m.due for m in traffic.messages.values()), default=0) - time.monotonic()))
        live = settled(traffic)
        check = stopped(traffic, argument)
        check.found("not_before_stop", [*live.findings.values()], live.lacks() - check.lacks())
        aside = [text for text, _ in service.ledger() if "journal" in text]
        check.found("needlessly_aside", aside, len(aside))
        check.found("slow_start", f"{service.slowest_start:.1f} s", service.slowest_start > LONGEST_START)
        check.figures.update(slowest_start_s=service.slowest_start, rounds=rounds - 1)  # one is added for each chain
        return check


def run(options):
    rounds, seed = options.rounds or (50 if options.small else 500), options.seed * 1000
    chains = [(seed + at, min(ROUNDS_IN_A_CHAIN, rounds - at), at == 0 and not options.small, False)
              for at in range(0, rounds, ROUNDS_IN_A_CHAIN)]
    chains += [(seed + 999 - i, 2, False, True) for i in range(1 if options.small else 5)]
    return spread(chain, chains, options)
