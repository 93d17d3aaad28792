"""I/O calls fail, one or a stretch of them: at start, under load, at the stop. Nothing breaks or is lost in silence."""
import errno
import random

from service import spread
from store_check import stopped
from traffic import scene

# Kinds as in io_shim.cpp, with about as many calls as there are.
CALLS = {"o": 24, "r": 60, "w": 90, "s": 30, "t": 6, "a": 6, "m": 12, "n": 4, "u": 6}
FAULTS = {"o": (errno.EIO, errno.ENOSPC, errno.EACCES, errno.EINTR, errno.EROFS), "r": (errno.EIO, errno.EINTR),
          "w": (errno.ENOSPC, errno.EIO, errno.EINTR, errno.EROFS, 0), "s": (errno.EIO, errno.ENOSPC, errno.EINTR),
          "t": (errno.EIO, errno.ENOSPC, errno.EINTR), "a": (errno.ENOSPC, errno.EIO), "m": (errno.ENOMEM,),
          "n": (errno.EIO, errno.ENOSPC), "u": (errno.EIO, errno.EROFS)}
BRIEF = 20  # seconds, for what must go on while the disk does not


def watched(service, journal):
    return service.folder + "/state/" + (f":{service.folder}/run/journal" if journal else "")


def one(argument):
    seed, kind, error, first, times, journal, used = argument
    with scene(seed) as (r, service, traffic):
        if used:
            traffic.healthy_life()
        service.launch(match=watched(service, journal), fault=f"{kind},{error},{first},{times}")
        wrong, lost = [], 0
        if service.is_ready():
            try:
                if not traffic.life(12, BRIEF):
                    wrong.append(("hung", "answers did not come"))
            except OSError:
                pass  # it died; said below
            status = service.stop(BRIEF) if service.process.poll() is None else service.process.returncode
            lost = service.rows_lost()
            if status != int(lost > 0):
                wrong.append(("untrue" if status in (0, 1) else "crashed", f"status {status}, rows_lost={lost}"))
        else:
            status = service.process.returncode
            wrong.append(("refused" if status == 1 else "crashed", f"status {status}: {service.life_log().strip()[-200:]}"))
        traffic.process_ended("service_stopped")
        service.start()
        check = stopped(traffic, argument)
        if check.figures["missing"] + check.figures["no_end"] <= max(lost, 0) + sum(rows for _, rows in service.ledger()):
            check.forgive()
        for figure, text in wrong:
            check.found(figure, text)
        return check


def run(options):
    r = random.Random(options.seed)
    points = []
    while len(points) < (options.rounds or (60 if options.small else 2000)):
        journal, used = r.random() < 0.25, r.random() < 0.6
        kind = r.choice(list(CALLS))
        error = r.choice(FAULTS[kind])
        times = r.choice((1, 1, 1, r.randrange(2, 30), 0 if error != errno.EINTR else 3))
        points.append((options.seed * 10000 + len(points), kind, error, r.randrange(1, CALLS[kind] + 1), times, journal, used))
    return spread(one, points, options)
