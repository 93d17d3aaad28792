"""Starts the real daemon in a temporary folder and talks to it over its socket.

The protocol is spoken here from its description (docs/protocol.md), not through the client library, so that the two
are checked against each other.
"""
import contextlib
import os
import pathlib
import shutil
import signal
import socket
import sqlite3
import struct
import subprocess
import tempfile
import time
import unittest

from cbor2 import dumps, loads

DAEMON = os.environ["VXREPORTINGD"]
# In seconds: a bound on waiting for something that must happen, never a measurement.
PATIENCE = float(os.environ.get("VX_PATIENCE", 60))

# In memory where that can be had: how long a daemon takes to end must not depend on who else writes to the disk.
tempfile.tempdir = "/dev/shm" if os.access("/dev/shm", os.W_OK) else None

INTERNAL = "[device]\ninternal_build = true\n"
(CREATE, SET_TYPE, GET_TYPE, CONFIGURE, START, SEND, STOP, DESTROY, VALIDATE, REPORTERS, KILL) = range(1, 12)
HELLO, CALL, REPLY, ERROR, GOODBYE = range(5)


def frame(*items):
    body = dumps(items)
    return struct.pack("<I", len(body)) + body


def replace(path, text):
    pathlib.Path(path + ".new").write_text(text)
    os.rename(path + ".new", path)


class Client:
    """One connection. Calls may be sent without waiting; answers are kept by call number."""

    def __init__(self, path, hello=True):
        self.socket = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self.socket.settimeout(PATIENCE)
        self.socket.connect(path)
        self.number = 0
        self.stream = self.socket.makefile("rb")
        self.answers = {}
        self.goodbye = False
        if hello:
            self.raw(frame(HELLO, 1))
            self.next_frame()

    def raw(self, data):
        self.socket.sendall(data)

    def post(self, operation, *arguments):
        self.number += 1
        self.raw(frame(CALL, self.number, operation, *arguments))
        return self.number

    def next_frame(self):
        """The next frame, or None at the end of the stream."""
        try:
            length = self.stream.read(4)
            body = self.stream.read(struct.unpack("<I", length)[0]) if length else b""
        except ConnectionResetError:
            return None
        return loads(body) if body else None

    def pump(self):
        f = self.next_frame()
        if f is None:
            return False
        if f[0] == GOODBYE:
            self.goodbye = True
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

    def started(self, reporter, service_type=7, configuration=None):
        """Creates, sets up and starts a session; returns the number of the held start call."""
        self.call(CREATE, reporter)
        self.call(SET_TYPE, service_type, reporter)
        if configuration is not None:
            self.call(CONFIGURE, configuration, reporter)
        number = self.post(START, reporter)
        self.call(VALIDATE, reporter)  # a later call's answer: the start has run
        return number

    def session(self, reporter, configuration=None, message={"a": 1}):
        """A whole one, with one message."""
        self.started(reporter, 2, configuration)
        self.call(SEND, message, 3, 1, [reporter])
        self.call(STOP, reporter)

    def close(self):
        self.stream.close()
        self.socket.close()


class Daemon:
    def __init__(self, config="", environment=None, folder=None, wait=True, preexec=None, program=DAEMON):
        self.folder = folder or tempfile.mkdtemp(prefix="vx")
        for name in ("run", "state", "etc", "log", "drivers"):
            os.makedirs(f"{self.folder}/{name}", exist_ok=True)
        sensor = "" if "[orientation]" in config else "[orientation]\ndevice_sensor = false\n"
        store = "" if "[store]" in config else "[store]\ncommit_interval_ms = 100\n"
        with open(f"{self.folder}/etc/platform.toml", "w") as f:
            f.write(f'[log]\ndestination = "stderr"\nlevel = "info"\nburst = 0\n'
                    f'[drivers]\nroot = "{self.folder}/drivers"\n{sensor}{store}{config}')
        self.environment = dict(
            os.environ, RUNTIME_DIRECTORY=f"{self.folder}/run", STATE_DIRECTORY=f"{self.folder}/state",
            CONFIGURATION_DIRECTORY=f"{self.folder}/etc", LOGS_DIRECTORY=f"{self.folder}/log", **(environment or {}))
        for name in ("NOTIFY_SOCKET", "WATCHDOG_USEC", "LISTEN_FDS"):
            if name not in (environment or {}):
                self.environment.pop(name, None)
        self.program = program
        self.socket_path = f"{self.folder}/run/service.socket"
        self.database = f"{self.folder}/state/telemetry.db"
        self.log_path = f"{self.folder}/daemon.log"
        self.preexec = preexec
        self.clients = []
        self.start(wait)

    def start(self, wait=True):
        before = len(self.log()) if os.path.exists(self.log_path) else 0
        with open(self.log_path, "ab") as log:
            self.process = subprocess.Popen([self.program], env=self.environment, stderr=log, stdin=subprocess.DEVNULL,
                                            preexec_fn=self.preexec, close_fds=self.preexec is None)
        if wait:
            self.wait_until(self.listening, "the daemon listens")
            # The probe was a client too; what follows starts from a clean list.
            self.wait_until(lambda: "dealloc" in self.log()[before:], "the probe is gone")

    def listening(self):
        if self.process.poll() is not None:
            raise AssertionError(f"the daemon ended with {self.process.returncode}:\n{self.log()}")
        with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as s:
            return s.connect_ex(self.socket_path) == 0

    def wait_until(self, condition, what):
        end = time.monotonic() + PATIENCE
        while time.monotonic() < end:
            if condition():
                return
            time.sleep(0.01)
        raise AssertionError(f"waited in vain until {what}; the log ends:\n{self.log()[-3000:]}")

    def client(self, **options):
        c = Client(self.socket_path, **options)
        self.clients.append(c)
        return c

    def log(self):
        return pathlib.Path(self.log_path).read_text(errors="replace")

    def summaries(self):
        """The summary files' paths, oldest first."""
        folder = f"{self.folder}/log/Audio/Reporting"
        return sorted(f"{folder}/{n}" for n in os.listdir(folder)) if os.path.isdir(folder) else []

    def stop(self):
        """Ends the daemon in order and returns its exit status."""
        # It has a few seconds, and threads that give way to everybody: on a busy machine they would run out. Where that
        # is allowed, they come first for once.
        with contextlib.suppress(OSError):
            for task in os.listdir(f"/proc/{self.process.pid}/task"):
                os.setpriority(os.PRIO_PROCESS, int(task), -10)
        self.process.send_signal(signal.SIGTERM)
        try:
            return self.process.wait(PATIENCE)
        except subprocess.TimeoutExpired:
            self.process.kill()
            self.process.wait()
            raise AssertionError("the daemon did not end:\n" + self.log()[-3000:])

    def rows(self, query, *arguments):
        with contextlib.closing(sqlite3.connect(f"file:{self.database}?mode=ro", uri=True, timeout=PATIENCE)) as connection:
            return connection.execute(query, arguments).fetchall()

    def wait_for_messages(self, count):
        """Stopping has a limit of time, which much that is not stored yet may pass on a busy machine."""
        self.wait_until(lambda: self.rows("SELECT count(*) FROM relay_messages") == [(count,)], f"{count} messages are stored")

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
