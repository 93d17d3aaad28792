"""A torn, foreign or poisoned journal: the daemon starts, says so once, keeps the file, and serves."""
import glob
import os

from harness import SEND
from service import PATIENCE, Outcome, spread
from store_check import stopped
from traffic import scene

POISON = "poisoned" * 4  # in a message: the daemon ends when it writes this to the store


def change(path, how):
    with open(path, "r+b") as f:
        content = bytearray(f.read(1 << 16))
        how(content)
        f.seek(0)
        f.write(content)


def flip_bits(r, content):
    used = [i for i, byte in enumerate(content) if byte] or [0]
    for i in r.sample(used, min(len(used), 8)):
        content[i] ^= 1 << r.randrange(8)


def replace(path, make):
    os.remove(path)
    make(path)


def garbage(r, path):
    with open(path, "wb") as f:
        f.write(r.randbytes(r.choice((0, 1, 100, 1 << 16, 2 << 20))))


def link(r, path):
    victim = path.split("/run/journal/")[0] + "/victim"
    os.rename(path, victim)
    os.symlink(victim, path)


DAMAGES = {
    "bits": lambda r, path: change(path, lambda content: flip_bits(r, content)),
    "version": lambda r, path: change(path, lambda content: content.__setitem__(slice(8, 12), b"\x7f\x7f\x7f\x7f")),
    "cut": lambda r, path: os.truncate(path, r.randrange(os.path.getsize(path))),
    "owner": lambda r, path: os.geteuid() or os.chown(path, 12345, 12345),
    "fifo": lambda r, path: replace(path, os.mkfifo),
    "folder": lambda r, path: replace(path, os.mkdir),
    "garbage": garbage,
    "link": link,
}


def files_below(*folders):
    return [p for folder in folders for p in glob.glob(folder + "/**", recursive=True) if os.path.isfile(p)]


def content(path):
    with open(path, "rb") as f:
        return f.read()


def damaged(argument):
    seed, damage = argument
    with scene(seed) as (r, service, traffic):
        service.start()
        traffic.life(15)
        service.kill()
        traffic.process_ended("crashed")
        files = [p for p in files_below(service.folder + "/run/journal") if os.path.getsize(p)]
        if not files:
            none = Outcome(damage)
            none.found("no_journal", "there is no file in run/journal after kill -9")
            return none
        path, victim = r.choice(files), service.folder + "/victim"
        before = content(path)
        DAMAGES[damage](r, path)
        kept = content(path) if os.path.isfile(path) else b""
        service.start()
        said = [line for line in service.life_log().splitlines() if "journal" in line and line[:3] in ("<3>", "<5>")]
        traffic.life(5)
        check = stopped(traffic, argument)
        lost = check.lacks() > 0
        check.forgive()  # what cannot be read goes, with a word
        check.found("silent", "nothing was said of what was lost", lost and not said)
        check.found("loud", said, len(said) > 2)
        check.found("followed", "a link", damage == "link" and content(victim) != before)
        check.found("not_kept", path, lost and kept not in [b"", *map(content, files_below(
            service.folder + "/run", service.folder + "/state", victim))])
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
        kept = [p for p in files_below(service.folder + "/run", service.folder + "/state") if "aside" in p]
        outcome = Outcome(f"{seed} poisoned")
        outcome.found("deaths", f"{deaths} of those that recovered", deaths - 2)
        outcome.found("not_kept", "no file is aside", not kept)
        named = any("journal" in text for text, _ in service.ledger())
        outcome.found("silent", "the ledger does not name a journal", not named)
        return outcome


def one(argument):
    return poisoned(argument[0]) if argument[1] == "poison" else damaged(argument)


def run(options):
    kinds = [*DAMAGES, "poison"]
    rounds = options.rounds or (18 if options.small else 180)
    return spread(one, [(options.seed * 1000 + i, kinds[i % len(kinds)]) for i in range(rounds)], options)
