"""SIGTERM while every sync is slow, or none returns, and much is queued: nothing is missing after the next start, and the
word was true."""
import glob

from service import PATIENCE, spread
from store_check import stopped
from traffic import ALARMS, scene

DOCUMENTED_SECONDS = 5  # of a stop; for more it has to ask
MOST_SECONDS = 11       # where nothing gets done: with the time to move the journal, and that for the threads
HUNG = {"store": "telemetry.db", "folder": ""}  # which syncs never return; the journal is moved unless all hang


def one(argument):
    seed, hung = argument
    with scene(seed) as (r, service, traffic):
        hanging = {"match": f"{service.folder}/state/{HUNG.get(hung)}", "while": service.folder + "/mean", "sync_ms": "600000,600000"}
        service.start(**(hanging if hung else {"sync_ms": "20,200"}))
        traffic.connect(3)
        for peer in traffic.peers:
            for type_ in (None, None, None, ALARMS):
                traffic.create(peer, type_, start=type_ is None)
        if hung:
            service.replace_file("mean", "")
        while traffic.numbers < (500 if hung else 10000):
            traffic.burst(r.choice(traffic.peers), 200)
            traffic.take()
        answered = traffic.until_answered()
        status = service.stop(2 * PATIENCE)
        traffic.process_ended("service_stopped")
        lost, seconds = service.rows_lost(), service.stopped_in
        moved = bool(glob.glob(service.folder + "/state/journal/segment*"))
        asked = not hung and "EXTEND_TIMEOUT_USEC=" in service.told
        service.start()
        check = stopped(traffic, argument)
        check.found("unanswered", "messages", not answered)
        most = MOST_SECONDS if hung else DOCUMENTED_SECONDS + 1
        check.found("overdue", f"the stop took {seconds:.1f} s", seconds > most and not asked)
        check.found("untrue", f"status {status}, rows_lost={lost}, {check.lacks()} are missing after the next start",
                    (lost != 0) != (check.lacks() > 0) or status != int(lost != 0))
        check.found("not_moved", "the journal is still in the runtime folder", hung == "store" and not moved)
        check.figures["slowest_stop_s"] = seconds
        return check


def run(options):
    kinds = ("", "", "store", "", "", "folder")
    rounds = options.rounds or (6 if options.small else 30)
    return spread(one, [(options.seed * 1000 + i, kinds[i % len(kinds)]) for i in range(rounds)], options)
