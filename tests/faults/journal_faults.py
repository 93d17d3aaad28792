"""A torn, foreign or poisoned journal: the daemon starts, says so once, keeps the file, and serves."""
import glob
import os

from harness import SEND
from service import PATIENCE, Outcome, spread
from store_check import stopped
from traffic import scene

POISON = "poisoned" * 4  # in a message: the daemon ends when it writes this to the store


def write(path, content, at=0):
    with open(path, "r+b") as f:
        f.seek(at)
        f.write(content)


def flip_bits(r, path):
    used = [i for i, byte in enumerate(content(path)[:1 << 16]) if byte] or [0]
    for i in r.sample(used, min(len(used), 8)):
        write(path, bytes([content(path)[i] ^ 1 << r.randrange(8)]), i)


def garbage(r, path):
    with open(path, "wb") as f:
        f.write(r.randbytes(r.choice((0, 1, 100, 1 << 16, 2 << 20))))


def link(r, path):
    victim = path.split("/run/journal/")[0] + "/victim"
    os.rename(path, victim)
    os.symlink(victim, path)


DAMAGES = {
    "bits": flip_bits,
    "version": lambda r, path: write(path, b"\x7f\x7f\x7f\x7f", 8),
    "cut": lambda r, path: os.truncate(path, r.randrange(os.path.getsize(path))),
    "owner": lambda r, path: os.geteuid() or os.chown(path, 12345, 12345),
    "fifo": lambda r, path: os.remove(path) or os.mkfifo(path),
    "folder": lambda r, path: os.remove(path) or os.mkdir(path),
    "garbage": garbage,
    "link": link,
}


def files_below(*folders):
    return [p for folder in folders for p in glob.glob(folder + "/**", recursive=True) if os.path.isfile(p)]


def content(path):
    with open(path, "rb") as f:
        return f.read()


def damaged(seed, damage):
    with scene(seed) as (r, service, traffic):
        service.start()
        traffic.life(15)
        service.kill()
        traffic.process_ended("crashed")
        path = r.choice([p for p in files_below(service.folder + "/run/journal") if os.path.getsize(p)])
        victim = service.folder + "/victim"
        before = content(path)
        DAMAGES[damage](r, path)
        kept = content(path) if os.path.isfile(path) else b""
        service.start()
        said = [line for line in service.life_log().splitlines() if "journal" in line and line[:3] in ("<3>", "<5>")]
        traffic.life(5)
        check = stopped(traffic, (seed, damage))
        lost = check.lacks() > 0
        # What cannot be read goes, with a word; a session whose configuration goes has its rows under no name.
        check.forgive(*(("unexpected", "twice") if damage == "bits" else ()))
        check.found("silent", "nothing was said of what was lost", lost and not said)
        check.found("loud", said, len(said) > 2)
        check.found("followed", "a link", damage == "link" and content(victim) != before)
        kept_files = files_below(service.folder + "/run", service.folder + "/state", victim)
        check.found("not_kept", path, lost and kept not in [b"", *map(content, kept_files)])
        return check


def poisoned(seed):
    """Every start dies of one message, until its journal is moved aside: after the second death in recovery."""
    with scene(seed) as (r, service, traffic):
        service.start(abort=POISON)
        traffic.life(5)
        traffic.peers[0].post(SEND, {"text": POISON}, 3, 1, None)
        service.process.wait(PATIENCE)
        traffic.process_ended("crashed")
        deaths = 0
        while deaths < 5:
            service.launch(abort=POISON)
            if service.is_ready() and service.stop() == 0:  # which writes everything
                break
            deaths += 1
        outcome = Outcome(f"{seed} poisoned")
        outcome.found("deaths", f"{deaths} of those that recovered", deaths != 2)
        outcome.found("not_kept", "no file is aside", not glob.glob(service.folder + "/run/journal.aside-*/segment*"))
        outcome.found("silent", "the ledger does not name a journal", not any("journal" in text for text, _ in service.ledger()))
        return outcome


def one(argument):
    return poisoned(argument[0]) if argument[1] == "poison" else damaged(*argument)


def run(options):
    kinds = [*DAMAGES, "poison"]
    rounds = options.rounds or (18 if options.small else 180)
    return spread(one, [(options.seed * 1000 + i, kinds[i % len(kinds)]) for i in range(rounds)], options)
