"""Power cuts: images of the disk in which what was not synced is dropped, reordered or torn. What a reader saw committed
before the cut is in each of them."""
import os
import shutil
import sqlite3
import struct
import time

from service import CONFIGURATION, Outcome, PATIENCE, spread
from traffic import scene

SECTOR = 512
HEADER = struct.Struct("<IIQQQQ")  # RecordHeader of io_shim.cpp
MESSAGES, BYTES = 1500, 9000      # enough for checkpoints between
NUMBERS = "SELECT json_extract(payload, '$.n') FROM relay_messages WHERE category = 3 ORDER BY id"


class File:
    def __init__(self):
        self.durable, self.pending, self.gone = bytearray(), [], False

    @staticmethod
    def apply(content, offset, data):
        """data of None: its length becomes offset."""
        if data is None:
            del content[offset:]
        content.extend(bytes(max(0, offset - len(content))))
        content[offset:offset + len(data or b"")] = data or b""

    def sync(self):
        for write in self.pending:
            self.apply(self.durable, *write)
        self.pending = []

    def after_cut(self, r, keep):
        """keep: how likely a write that was not synced is there; below 1 half of those are torn."""
        content = bytearray(self.durable)
        for offset, data in self.pending:
            if r.random() >= keep:
                continue
            if data is None or keep == 1 or r.random() < 0.5:
                self.apply(content, offset, data)
                continue
            for at in range(0, len(data), SECTOR):
                if r.random() < 0.5:
                    self.apply(content, offset + at, data[at:at + SECTOR])
        return content


def recorded(service):
    with open(service.folder + "/record", "rb") as f:
        while header := f.read(HEADER.size):
            kind, fd, size, offset, seconds, ns = HEADER.unpack(header)
            yield chr(kind), fd, offset, seconds * 10**9 + ns, f.read(size)


def record(service, traffic):
    """Runs a load; the moments at which a reader saw messages: (ns, the highest number)."""
    service.start(record=service.folder + "/record")
    traffic.connect(1)
    peer, seen = traffic.peers[0], []
    session = traffic.create(peer, 7)
    reader = sqlite3.connect(f"file:{service.database}?mode=ro", uri=True, timeout=PATIENCE)
    deadline = time.monotonic() + PATIENCE
    while not seen or seen[-1][1] < MESSAGES and time.monotonic() < deadline:
        for _ in range(20 if traffic.numbers < MESSAGES else 0):
            traffic.send(peer, [session.id], kind=1, size=BYTES, targets=[session])
        traffic.until_answered()
        rows = reader.execute(NUMBERS + " DESC LIMIT 1").fetchall()
        seen.append((time.monotonic_ns(), rows[0][0] if rows else 0))
    reader.close()
    service.stop()
    traffic.process_ended("service_stopped")
    return seen


def images(service, r, count):
    """Puts images into the state folder one after the other; gives the time of each cut, and what to call it."""
    total = sum(1 for _ in recorded(service))
    cuts = sorted(r.randrange(total) for _ in range(count))
    files, names, state = {}, {}, service.folder + "/state"
    for i, (kind, fd, offset, when, data) in enumerate(recorded(service)):
        if kind == "o":
            names[fd] = data.decode()
        elif kind in "wt":
            files.setdefault(names[fd], File()).pending.append((offset, data if kind == "w" else None))
        elif kind == "s" and names[fd] in files:
            files[names[fd]].sync()
            # What was done to names comes to the disk in order, with the next sync of anything.
            files = {name: f for name, f in files.items() if not f.gone}
        elif kind == "n":
            old, new = data.decode().split("\n")
            files[new] = files.pop(old, File())
        elif kind == "u" and data.decode() in files:
            files[data.decode()].gone = True
        while cuts and cuts[0] == i:
            cuts.pop(0)
            shutil.rmtree(state)
            os.mkdir(state)
            keep = r.choice((0, 0.3, 0.7, 1))
            for name, f in files.items():
                # That a file was removed may be forgotten; an index in shared memory is made anew.
                if not name.endswith("-shm") and not (f.gone and r.random() < 0.5):
                    with open(name, "wb") as image:
                        image.write(f.after_cut(r, keep))
            yield when, f"cut {i} of {total}, keeping {keep}"


def one(argument):
    seed, count = argument
    outcome = Outcome(argument)
    with scene(seed, CONFIGURATION + "[store]\ncommit_interval_ms = 50\n") as (r, service, traffic):
        seen = record(service, traffic)
        for number, (when, name) in enumerate(images(service, r, count)):
            due = max((n for t, n in seen if t < when), default=0)
            outcome.figures["seen"] += due
            if number % 5 == 0:
                service.start()
                status = service.stop()
                outcome.found("bad_status", f"{name}: {status}", status != 0)
                outcome.found("store_moved", name, len(service.stores_aside()))
            database = sqlite3.connect(service.database)
            try:
                ((result,),) = database.execute("PRAGMA integrity_check(1)").fetchall()
                outcome.found("corrupt", f"{name}: {result}", result != "ok")
                rows = []  # before the schema is there
                if database.execute("PRAGMA user_version").fetchone()[0]:
                    rows = [n for (n,) in database.execute(NUMBERS)]
                outcome.found("twice", name, len(rows) - len(set(rows)))
                outcome.found("missing", f"{name}: of {due} that a reader had seen", due - len(rows))
                outcome.found("missing", f"{name}: in the middle", set(rows) != set(range(1, len(set(rows)) + 1)))
            except sqlite3.Error as e:
                outcome.found("corrupt", f"{name}: {e!r}")
            finally:
                database.close()
        outcome.figures["rounds"] = count - 1  # one is added for each recording
    return outcome


def run(options):
    count = options.rounds or (20 if options.small else 200)
    recordings = max(1, min(8, count // 10))
    return spread(one, [(options.seed * 1000 + i, count // recordings) for i in range(recordings)], options)
