"""Starts the real daemon in a temporary folder and talks to it over its socket.

The protocol is spoken here from its description (docs/protocol.md), not through the client library, so that the two
are checked against each other.
"""
import contextlib
import os
import pathlib
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
    """A set of folders, and the daemons that use them one after the other."""

    def __init__(self, config="", environment=None, folder=None, preexec=None, program=DAEMON):
        self.folder = folder or tempfile.mkdtemp(prefix="vx")
        for name in ("run", "state", "etc", "log", "drivers"):
            os.makedirs(f"{self.folder}/{name}", exist_ok=True)
        sensor = "" if "[orientation]" in config else "[orientation]\ndevice_sensor = false\n"
        store = "" if "[store]" in config else "[store]\ncommit_interval_ms = 100\n"
        log = "" if "[log]" in config else '[log]\ndestination = "stderr"\nlevel = "info"\nburst = 0\n'
        with open(f"{self.folder}/etc/platform.toml", "w") as f:
            f.write(f'{log}[drivers]\nroot = "{self.folder}/drivers"\n{sensor}{store}{config}')
        self.notify = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        self.notify.bind(self.folder + "/notify")
        self.environment = dict(
            os.environ, RUNTIME_DIRECTORY=f"{self.folder}/run", STATE_DIRECTORY=f"{self.folder}/state",
            CONFIGURATION_DIRECTORY=f"{self.folder}/etc", LOGS_DIRECTORY=f"{self.folder}/log",
            NOTIFY_SOCKET=self.folder + "/notify", **(environment or {}))
        for name in {"WATCHDOG_USEC", "LISTEN_FDS"}.difference(environment or {}):
            self.environment.pop(name, None)
        self.program = program
        self.socket_path = f"{self.folder}/run/service.socket"
        self.database = f"{self.folder}/state/telemetry.db"
        self.log_path = f"{self.folder}/daemon.log"
        self.preexec = preexec
        self.clients = []

    def launch(self, **variables):
        """Starts it with these in its environment."""
        while self.listen(0):
            pass
        self.told = ""
        with open(self.log_path, "ab") as log:
            self.log_before = log.tell()
            self.process = subprocess.Popen([self.program], env=dict(self.environment, **variables), stderr=log,
                                            stdin=subprocess.DEVNULL, preexec_fn=self.preexec, close_fds=self.preexec is None)
        self.started_at = time.monotonic()

    def start(self, **variables):
        self.launch(**variables)
        assert self.is_ready(), f"the daemon ended with {self.process.returncode}:\n{self.life_log()[-2000:]}"

    def listen(self, seconds):
        there = select.select([self.notify], [], [], seconds)[0]
        if there:
            self.told += self.notify.recv(4096).decode() + "\n"  # to the service manager
        return bool(there)

    def is_ready(self):
        """Waits until the process is ready (True) or has ended."""
        while "READY=1" not in self.told and self.process.poll() is None:
            assert time.monotonic() < self.started_at + PATIENCE, "it does not become ready:\n" + self.life_log()[-2000:]
            self.listen(0.005)
        return "READY=1" in self.told

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

    def life_log(self):
        """What the last process logged."""
        return pathlib.Path(self.log_path).read_bytes()[self.log_before:].decode(errors="replace")

    def replace_file(self, path, text):
        path = f"{self.folder}/{path}"
        os.makedirs(os.path.dirname(path), exist_ok=True)
        pathlib.Path(self.folder + "/.new").write_text(text)
        os.rename(self.folder + "/.new", path)

    def kill(self):
        self.process.kill()
        self.process.wait()

    def stop(self, patience=PATIENCE):
        """Ends the daemon in order; its exit status, -9 when it had to be killed."""
        # It has a few seconds, and threads that give way to everybody: on a busy machine they would run out. Where that
        # is allowed, they come first for once.
        with contextlib.suppress(OSError):
            for task in os.listdir(f"/proc/{self.process.pid}/task"):
                os.setpriority(os.PRIO_PROCESS, int(task), -10)
        self.process.send_signal(signal.SIGTERM)
        began = time.monotonic()
        while self.process.poll() is None:
            self.listen(0.01)
            if time.monotonic() > began + patience:
                self.kill()
        self.stopped_in = time.monotonic() - began
        while self.listen(0):
            pass
        return self.process.returncode

    def rows(self, query, *arguments):
        with contextlib.closing(sqlite3.connect(f"file:{self.database}?mode=ro", uri=True, timeout=PATIENCE)) as connection:
            return connection.execute(query, arguments).fetchall()

    def wait_for_messages(self, count):
        """Stopping has a limit of time, which much that is not stored yet may pass on a busy machine."""
        self.wait_until(lambda: self.rows("SELECT count(*) FROM relay_messages") == [(count,)], f"{count} messages are stored")

    def clean_up(self):
        for c in self.clients:
            c.close()
        self.notify.close()
        if hasattr(self, "process"):
            self.kill()
        shutil.rmtree(self.folder, ignore_errors=True)


class DaemonTest(unittest.TestCase):
    def daemon(self, *arguments, **options):
        d = Daemon(*arguments, **options)
        self.addCleanup(d.clean_up)
        d.start()
        return d

    def assert_unharmed(self, daemon):
        """Another client is served as ever."""
        c = daemon.client()
        self.assertIs(c.call(CREATE, 987654), True)
        self.assertEqual(c.call(VALIDATE, 987654), {"reporterID": 987654, "serviceType": 65535})
        self.assertIs(c.call(DESTROY, 987654), True)
        c.close()
