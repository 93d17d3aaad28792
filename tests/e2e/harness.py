"""Starts the real daemon in a temporary folder and talks to it over its socket, with nothing but the standard library.

The protocol is spoken here from its description (docs/protocol.md), not through the client library, so that the two
are checked against each other.
"""
import os
import select
import shutil
import signal
import socket
import sqlite3
import struct
import subprocess
import tempfile
import time
import unittest

DAEMON = os.environ["VXREPORTINGD"]
PATIENCE = 20.0  # seconds; a bound on waiting for something that must happen, never a measurement

(CREATE, SET_TYPE, GET_TYPE, CONFIGURE, START, SEND, STOP, DESTROY, VALIDATE, REPORTERS, KILL) = range(1, 12)
HELLO, CALL, REPLY, ERROR, GOODBYE = range(5)


class F32(float):
    """A number to be sent in single precision."""


def head(major, n):
    if n < 24:
        return bytes([major << 5 | n])
    for code, size in ((24, 1), (25, 2), (26, 4), (27, 8)):
        if n < 1 << 8 * size:
            return bytes([major << 5 | code]) + n.to_bytes(size, "big")
    raise ValueError(n)


def encode(v):
    if v is None:
        return b"\xf6"
    if v is True:
        return b"\xf5"
    if v is False:
        return b"\xf4"
    if isinstance(v, int):
        return head(0, v) if v >= 0 else head(1, -1 - v)
    if isinstance(v, F32):
        return b"\xfa" + struct.pack(">f", v)
    if isinstance(v, float):
        return b"\xfb" + struct.pack(">d", v)
    if isinstance(v, str):
        return head(3, len(v.encode())) + v.encode()
    if isinstance(v, (list, tuple)):
        return head(4, len(v)) + b"".join(encode(x) for x in v)
    if isinstance(v, dict):
        return head(5, len(v)) + b"".join(encode(k) + encode(x) for k, x in v.items())
    raise TypeError(type(v))


def decode(b, i=0):
    major, low = b[i] >> 5, b[i] & 31
    i += 1
    if major == 7:
        if low < 24:
            return {20: False, 21: True, 22: None}[low], i
        size = {26: 4, 27: 8}[low]
        return struct.unpack({4: ">f", 8: ">d"}[size], b[i:i + size])[0], i + size
    n = low
    if low >= 24:
        size = 1 << low - 24
        n = int.from_bytes(b[i:i + size], "big")
        i += size
    if major == 0:
        return n, i
    if major == 1:
        return -1 - n, i
    if major == 3:
        return b[i:i + n].decode(), i + n
    items = []
    for _ in range(n * (2 if major == 5 else 1)):
        item, i = decode(b, i)
        items.append(item)
    return (dict(zip(items[::2], items[1::2])) if major == 5 else items), i


def frame(*items):
    body = encode(items)
    return struct.pack("<I", len(body)) + body


class Client:
    """One connection. Calls may be sent without waiting; answers are kept by call number."""

    def __init__(self, path, hello=True):
        self.socket = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self.socket.settimeout(PATIENCE)
        self.socket.connect(path)
        self.number = 0
        self.data = b""
        self.answers = {}
        self.connection_error = None
        self.goodbye = self.closed = False
        if hello:
            self.raw(frame(HELLO, 1))
            self.hello = self.next_frame()

    def raw(self, data):
        self.socket.sendall(data)

    def post(self, operation, *arguments):
        self.number += 1
        self.raw(frame(CALL, self.number, operation, *arguments))
        return self.number

    def next_frame(self):
        """The next frame, or None at the end of the stream."""
        while True:
            if len(self.data) >= 4:
                n = struct.unpack("<I", self.data[:4])[0]
                if len(self.data) >= 4 + n:
                    body, self.data = self.data[4:4 + n], self.data[4 + n:]
                    return decode(body)[0]
            try:
                got = self.socket.recv(1 << 16)
            except ConnectionResetError:
                got = b""
            if not got:
                self.closed = True
                return None
            self.data += got

    def pump(self):
        f = self.next_frame()
        if f is None:
            return False
        if f[0] == HELLO:
            self.hello = f
        elif f[0] == GOODBYE:
            self.goodbye = True
        elif f[0] == ERROR and f[1] is None:
            self.connection_error = f
        else:
            self.answers.setdefault(f[1], []).append(f)
        return True

    def answer(self, number):
        while number not in self.answers:
            if not self.pump():
                raise ConnectionError(f"the connection ended before call {number} was answered")
        return self.answers[number][0]

    def call(self, operation, *arguments):
        f = self.answer(self.post(operation, *arguments))
        if f[0] == ERROR:
            raise AssertionError(f)
        return f[2]

    def until_closed(self):
        while self.pump():
            pass
        return self

    def is_answered(self, number, within=0.2):
        """Whether an answer has come; waits a little for one that should not come."""
        while number not in self.answers:
            if len(self.data) < 4 and not select.select([self.socket], [], [], within)[0]:
                return False
            if not self.pump():
                return False
        return True

    def started(self, reporter, service_type=7, configuration=None):
        """Creates, sets up and starts a session; returns the number of the held start call."""
        self.call(CREATE, reporter)
        self.call(SET_TYPE, service_type, reporter)
        if configuration is not None:
            self.call(CONFIGURE, configuration, reporter)
        number = self.post(START, reporter)
        self.call(VALIDATE, reporter)  # a later call's answer: the start has run
        return number

    def close(self):
        self.socket.close()


class Daemon:
    def __init__(self, config="", environment=None, folder=None, wait=True, preexec=None,
                 device_sensor=False):
        self.folder = folder or tempfile.mkdtemp(prefix="vx")
        for name in ("run", "state", "etc", "log", "drivers"):
            os.makedirs(f"{self.folder}/{name}", exist_ok=True)
        with open(f"{self.folder}/etc/platform.toml", "w") as f:
            f.write(f'[log]\ndestination = "stderr"\nlevel = "info"\nburst = 0\n'
                    f'[drivers]\nroot = "{self.folder}/drivers"\n[orientation]\n'
                    f'device_sensor = {str(device_sensor).lower()}\n' + config)
        self.environment = dict(
            os.environ, RUNTIME_DIRECTORY=f"{self.folder}/run", STATE_DIRECTORY=f"{self.folder}/state",
            CONFIGURATION_DIRECTORY=f"{self.folder}/etc", LOGS_DIRECTORY=f"{self.folder}/log", **(environment or {}))
        for name in ("NOTIFY_SOCKET", "WATCHDOG_USEC", "LISTEN_FDS"):
            if name not in (environment or {}):
                self.environment.pop(name, None)
        self.socket_path = f"{self.folder}/run/service.socket"
        self.database = f"{self.folder}/state/telemetry.db"
        self.log_path = f"{self.folder}/daemon.log"
        self.preexec = preexec
        self.clients = []
        self.start(wait)

    def start(self, wait=True):
        with open(self.log_path, "ab") as log:
            self.process = subprocess.Popen([DAEMON], env=self.environment, stderr=log, stdin=subprocess.DEVNULL,
                                            preexec_fn=self.preexec, close_fds=self.preexec is None)
        if wait:
            self.wait_until(self.listening, "the daemon listens")
            # The probe above was a client too; what follows starts from a clean list.
            self.wait_until(lambda: "dealloc" in self.log(), "the probe is gone")
            self.quiet_before = len(self.log())

    def listening(self):
        if self.process.poll() is not None:
            raise AssertionError(f"the daemon ended with {self.process.returncode}:\n{self.log()}")
        try:
            s = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
            s.connect(self.socket_path)
            s.close()
            return True
        except OSError:
            return False

    def wait_until(self, condition, what):
        end = time.monotonic() + PATIENCE
        while time.monotonic() < end:
            value = condition()
            if value:
                return value
            time.sleep(0.01)
        raise AssertionError(f"waited in vain until {what}; the log ends:\n{self.log()[-3000:]}")

    def client(self, **options):
        c = Client(self.socket_path, **options)
        self.clients.append(c)
        return c

    def log_since_start(self):
        return self.log()[self.quiet_before:]

    def log(self):
        with open(self.log_path, errors="replace") as f:
            return f.read()

    def stop(self, signal_number=signal.SIGTERM):
        """Ends the daemon in order and returns its exit status."""
        if self.process.poll() is None:
            self.process.send_signal(signal_number)
        try:
            return self.process.wait(PATIENCE)
        except subprocess.TimeoutExpired:
            self.process.kill()
            self.process.wait()
            raise AssertionError("the daemon did not end:\n" + self.log()[-3000:])

    def rows(self, query, *arguments):
        connection = sqlite3.connect(f"file:{self.database}?mode=ro", uri=True, timeout=PATIENCE)
        try:
            return connection.execute(query, arguments).fetchall()
        finally:
            connection.close()

    def clean_up(self):
        for c in self.clients:
            c.close()
        if self.process.poll() is None:
            self.process.kill()
        self.process.wait()
        shutil.rmtree(self.folder, ignore_errors=True)


class DaemonTest(unittest.TestCase):
    def daemon(self, *arguments, **options):
        d = Daemon(*arguments, **options)
        self.addCleanup(d.clean_up)
        return d

    def assert_unharmed(self, daemon):
        """Another client is served as ever."""
        c = daemon.client()
        self.assertIs(c.call(CREATE, 987654), True)
        self.assertEqual(c.call(VALIDATE, 987654), {"reporterID": 987654, "serviceType": 65535})
        self.assertIs(c.call(DESTROY, 987654), True)
        c.close()
