"""SIGTERM while every sync is slow and much is queued: nothing is missing after the next start, and the word was true."""
from service import PATIENCE, spread
from store_check import stopped
from traffic import ALARMS, scene

DOCUMENTED_SECONDS = 5  # of a stop; for more it has to ask
MESSAGES = 10000


def one(seed):
    with scene(seed) as (r, service, traffic):
        service.start(sync_ms="20,200")
        traffic.connect(3)
        for peer in traffic.peers:
            for _ in range(3):
                traffic.create(peer)
            traffic.create(peer, ALARMS, start=False)
        while traffic.numbers < MESSAGES:
            traffic.burst(r.choice(traffic.peers), 200)
            for peer in traffic.peers:
                peer.take()
        answered = traffic.until_answered()
        status = service.stop(2 * PATIENCE)
        traffic.process_ended("service_stopped")
        lost, seconds = service.rows_lost(), service.stopped_in
        overdue = seconds > DOCUMENTED_SECONDS + 1 and "EXTEND_TIMEOUT_USEC=" not in service.told
        service.start()
        check = stopped(traffic, seed)
        check.found("unanswered", "messages", not answered)
        check.found("overdue", f"the stop took {seconds:.1f} s and asked for no time", overdue)
        check.found("untrue", f"status {status}, rows_lost={lost}, {check.lacks()} are missing after the next start",
                    (lost != 0) != (check.lacks() > 0) or status != int(lost != 0))
        check.figures["slowest_stop_s"] = seconds
        return check


def run(options):
    rounds = options.rounds or (4 if options.small else 24)
    return spread(one, [options.seed * 1000 + i for i in range(rounds)], options)
