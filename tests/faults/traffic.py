"""Random traffic of several clients that knows what it was answered, and what must therefore be in the store."""
import contextlib
import dataclasses
import random
import select
import time

from harness import CONFIGURE, CREATE, DESTROY, ERROR, GOODBYE, REPLY, SEND, SET_TYPE, START, STOP, Client, frame, loads
from service import CONFIGURATION, PATIENCE, Service

NEVER = float("inf")
ALARMS = 4
NAMES = {0: "generic", 1: "ondi", 2: "telephony", 3: "haptics", 4: "alarms", 7: "longformaudio", 8: "nonlongformaudio",
         10: "alerts"}
# Category and type: power records come of type 6. The event's name is not looked at.
KINDS = ((0x08000005, 1), (3, 0), (0x40000007, 5), (0x30000001, 6))
POWER = 6
STATISTICS, SUMMARY = 9, 65535
LONGEST_DELAY = 60  # seconds, of a standalone of an alarms session
TEXT = "What is accepted is kept, whatever ends the process. " * 8


def payload(n, kind, size=0):
    """A message's, from its number alone. With a blank in a key, the event's text does not extend the relayed one's."""
    p = {"n": n, "value": n % 97 + 0.5, "text": TEXT[:n * 7 % 200] + "x" * size}
    if n % 3 == 0:
        p["a key"] = n % 2 == 0
    if KINDS[kind][1] == POWER:
        p["EngineOnTime"] = n
    return p


class Session:
    def __init__(self, id_, type_, app):
        self.id, self.type, self.app = id_, type_, app  # the app is its HostApplicationDisplayID; no other session's
        self.start, self.starts = None, []              # the one under way, and all of them


@dataclasses.dataclass(eq=False)
class Start:
    """One start of a session: one row of relay_sessions. Moments are ticks of the traffic."""
    session: Session
    round: int
    call: int
    posted: int
    known: float = NEVER         # when an answer told that it had run
    end_posted: float = NEVER
    end_known: float = NEVER
    how: object = None           # how it may have ended: a set
    statistics: tuple = (0, 0)   # at least and at most so many messages of driver statistics
    counted: bool = False        # the counter grew while it was surely started


@dataclasses.dataclass(eq=False)
class Message:
    n: int
    kind: int
    size: int
    round: int
    peer: object
    posted: int
    targets: list                # the client's own sessions and the start under way; None: to all that are started
    due: float                   # when a standalone's delay has passed
    answered: float = NEVER
    refused: bool = False

    def __str__(self):
        return f"message {self.n} of round {self.round}"


class Peer(Client):
    """A client whose answers are taken whenever some are there."""

    def __init__(self, traffic, path):
        super().__init__(path)
        self.traffic, self.waiting, self.sessions, self.unknown, self.highest = traffic, {}, {}, [], 0
        self.data = b""

    def take(self, wait=0):
        """Takes what was answered; False at the end of the stream."""
        while select.select([self.socket], [], [], wait)[0]:
            wait = 0
            try:
                got = self.socket.recv(1 << 18)
            except ConnectionResetError:
                got = b""
            if not got:
                return False
            self.data += got
            at = 0
            while len(self.data) >= at + 4:
                end = at + 4 + int.from_bytes(self.data[at:at + 4], "little")
                if len(self.data) < end:
                    break
                f = loads(self.data[at + 4:end])
                at = end
                if f[0] in (REPLY, ERROR) and f[1] is not None:
                    self.traffic.answered(self, f)
            self.data = self.data[at:]
        return True


class Traffic:
    def __init__(self, random, service):
        self.random, self.service = random, service
        self.tick = self.numbers = self.identifiers = self.connections = self.round = 0
        self.messages, self.starts, self.peers = {}, [], []
        self.apps = {}        # sessions by application
        self.round_ends = []  # the ticks at which processes had ended

    def now(self):
        self.tick += 1
        return self.tick

    def connect(self, count):
        for _ in range(count):
            self.connections += 1
            self.peers.append(Peer(self, self.service.socket_path))

    def take(self):
        for peer in self.peers:
            peer.take()

    def post(self, peer, what, *call):
        peer.waiting[peer.post(*call)] = what

    def answered(self, peer, f):
        now = self.now()
        what = peer.waiting.pop(f[1], None)
        if isinstance(what, Message):
            what.answered, what.refused = now, f[2] is not None
        elif isinstance(what, Start) and f[0] == REPLY:  # of the call that ended it
            what.end_known = now
            what.how -= {"crashed"}
            what.statistics = (int(what.counted), what.statistics[1])
        if f[1] > peer.highest:  # calls of one connection run in order
            peer.highest = f[1]
            for start in [s for s in peer.unknown if s.call < f[1]]:
                start.known = now
                peer.unknown.remove(start)

    def create(self, peer, type_=None, start=True):
        self.identifiers += 1
        type_ = self.random.choice(tuple(NAMES)) if type_ is None else type_
        s = Session(self.identifiers, type_, f"app.{self.identifiers}")
        self.apps[s.app] = peer.sessions[s.id] = s
        self.post(peer, None, CREATE, s.id)
        self.post(peer, None, SET_TYPE, s.type, s.id)
        self.post(peer, None, CONFIGURE, {"HostApplicationDisplayID": s.app, "a b": 1}, s.id)
        if start:
            self.start(peer, s)
        return s

    def start(self, peer, s):
        s.start = Start(s, self.round, peer.number + 1, self.now())
        for starts in (s.starts, self.starts, peer.unknown):
            starts.append(s.start)
        self.post(peer, None, START, s.id)

    def end(self, s, *how):
        start, s.start = s.start, None
        if start is not None:
            start.end_posted, start.how = self.now(), set(how)
        return start

    def stop(self, peer, s):
        start = self.end(s, "stopped", "crashed")
        start.statistics, start.counted = (0, 1), start.known < NEVER
        self.service.replace_file("drivers/Speaker/underruns", str(self.now()))
        self.post(peer, start, STOP, s.id)

    def destroy(self, peer, s):
        self.post(peer, self.end(s, "destroyed", "crashed"), DESTROY, s.id)
        del peer.sessions[s.id]

    def leave(self, peer):
        for s in peer.sessions.values():
            self.end(s, "disconnected", "crashed")
        if self.random.random() < 0.5:
            peer.raw(frame(GOODBYE))
            while peer.take(PATIENCE):
                pass
        else:
            peer.take()
        peer.close()
        self.peers.remove(peer)

    def send(self, peer, ids, kind=None, size=0, targets=()):
        self.numbers += 1
        kind = self.random.randrange(len(KINDS)) if kind is None else kind
        m = Message(self.numbers, kind, size, self.round, peer, self.now(),
                    None if ids is None else [(s, s.start) for s in targets], time.monotonic() + LONGEST_DELAY)
        self.messages[m.n] = m
        self.post(peer, m, SEND, payload(m.n, m.kind, size), *KINDS[m.kind], ids)

    def burst(self, peer, count, size=0):
        """Messages to some of the client's own sessions."""
        own = list(peer.sessions.values())
        for _ in range(count):
            targets = self.random.sample(own, min(len(own), self.random.choice((1, 1, 1, 2, 3))))
            self.send(peer, [s.id for s in targets], size=size, targets=targets)

    def step(self):
        """One thing that a random client does."""
        r = self.random
        peer = r.choice(self.peers)
        own = list(peer.sessions.values())
        p = r.random()
        if p < 0.25 and len(own) < 6 or not own:
            self.create(peer, start=r.random() < 0.8)
        elif p < 0.75:
            self.burst(peer, r.randrange(1, 40))
        elif p < 0.83:
            self.send(peer, None)
        elif p < 0.94:
            s = r.choice(own)
            self.start(peer, s) if s.start is None else self.stop(peer, s)
        elif p < 0.97:
            self.destroy(peer, r.choice(own))
        elif p < 0.985:
            keys = f"disable_reporting = {str(r.random() < 0.3).lower()}\ndevice_name = '{p}'\n"
            self.service.replace_file("etc/preferences/com.quorvel.sonik.toml", keys)
        else:
            self.leave(peer)
            self.connect(1)
        self.take()

    def until_answered(self, patience=PATIENCE):
        """Waits for every message's and end's answer; False when some did not come."""
        end = time.monotonic() + patience
        for peer in self.peers:
            while any(peer.waiting.values()):
                if not peer.take(0.05) or time.monotonic() > end:
                    return False
        return True

    def process_ended(self, how):
        """Takes the last answers. What was started and not ended, the end of the process ends."""
        for peer in self.peers:
            while peer.take(1):
                pass
        self.round_ends.append(self.now())
        for peer in self.peers:
            peer.close()
            for s in peer.sessions.values():
                self.end(s, how)
        now = self.now()
        for start in self.starts:
            if start.end_known == NEVER:
                start.end_known = now
        self.peers = []
        self.round += 1

    def life(self, steps, patience=PATIENCE):
        """Some traffic of new clients; whether all of it was answered."""
        self.connect(2)
        for _ in range(steps):
            self.step()
        return self.until_answered(patience)

    def healthy_life(self, steps=6):
        """Of a daemon that starts and ends as it should, so that there is a store."""
        self.service.start()
        self.life(steps)
        self.service.stop()
        self.process_ended("service_stopped")


@contextlib.contextmanager
def scene(seed, configuration=CONFIGURATION):
    r = random.Random(seed)
    service = Service(configuration)
    try:
        yield r, service, Traffic(r, service)
    finally:
        service.clean_up()
