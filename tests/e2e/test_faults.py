"""Bad input and failing surroundings: each is answered, the other clients notice nothing, nothing accepted is lost."""
import os
import resource
import signal
import socket
import struct
import subprocess
import unittest

from harness import *


class BadInput(DaemonTest):
    def assert_refused(self, d, data, code):
        c = d.client()
        c.raw(data)
        c.until_closed()
        self.assertEqual(c.connection_error[:3], [ERROR, None, code], data[:40])

    def test_broken_frames_close_that_connection_only(self):
        d = self.daemon()
        bystander = d.client()
        bystander.started(1)
        message = lambda body: framed(b"\x87" + dumps([CALL, 1, SEND])[1:] + body + dumps([3, 1, None])[1:])
        self.assert_refused(d, b"\xff\xff\xff\xff" + b"x" * 100, 2)
        self.assert_refused(d, struct.pack("<I", (1 << 20) + 1), 2)
        self.assert_refused(d, framed(b"\x81" * 100000), 1)
        for broken in (b"", b"\x80", b"\x81\xf6", b"\x9f\xff", b"\xa0", b"\x81\x01\x01", b"\x81\x18\x63"):
            self.assert_refused(d, framed(broken), 1)
        for body in (b"\xa1\x61\xff\x01", b"\xa2\x61a\x01\x61a\x02", b"\xa1\x01\x01", b"\xa1\x61a\x41x",
                     b"\xa1\x61a\xf6", b"\xa1\x61a\xc2\x41\x01", b"\xbb" + b"\xff" * 8, b"\xbf\xff",
                     b"\xa1\x61a" + b"\x81" * 40 + b"\x01"):
            self.assert_refused(d, message(body), 1)
        self.assertIs(bystander.call(STOP, 1), True)
        self.assert_unharmed(d)

    def test_wrong_calls_are_answered_and_do_nothing(self):
        d = self.daemon()
        c = d.client()
        for arguments, code in (((12,), 3), ((0,), 3), ((-1,), 3), ((CREATE,), 4), ((CREATE, 1, 2), 4), ((CREATE, "1"), 4),
                                ((CREATE, True), 4), ((CREATE, 1 << 63), 4), ((SET_TYPE, 65536, 1), 4),
                                ((SET_TYPE, -1, 1), 4), ((SEND, [], 1, 1, None), 4), ((SEND, None, 1, 1, None), 4),
                                ((SEND, {}, 1 << 32, 1, None), 4), ((SEND, {}, 1, 1, [1.5]), 4),
                                ((SEND, {}, 1, 1, 7), 4), ((CONFIGURE, 3, 1), 4)):
            f = c.answer(c.post(*arguments))
            self.assertEqual((f[0], f[2]), (ERROR, code), arguments)
            self.assertGreater(len(f[3]), 10)
        self.assertEqual(c.call(REPORTERS), [])

    def test_descriptor_exhaustion(self):
        d = self.daemon(preexec=lambda: resource.setrlimit(resource.RLIMIT_NOFILE, (48, 48)))
        first = d.client()
        crowd, refused = [], 0
        for _ in range(80):
            c = Client(d.socket_path, hello=False)
            crowd.append(c)
            try:
                c.raw(frame(HELLO, 1))
            except BrokenPipeError:
                pass  # turned away before the hello was sent; the reason is there to read all the same
            f = c.next_frame()
            refused += f is not None and f[0] == ERROR and f[2] == 6
        self.assertGreater(refused, 20)
        first.started(5)
        self.assertIsNone(first.call(SEND, {"a": 1}, 3, 1, [5]))
        for c in crowd:
            c.close()
        d.wait_until(lambda: d.log().count("removing") >= len(crowd) - refused, "the crowd has gone")
        self.assert_unharmed(d)
        self.assertEqual(d.stop(), 0)
        self.assertEqual(d.rows("SELECT count(*) FROM relay_messages WHERE category = 3"), [(1,)])


class Surroundings(DaemonTest):
    def test_killed_client_in_mid_session(self):
        d = self.daemon()
        ready, told = os.pipe()
        child = os.fork()
        if child == 0:
            try:
                c = Client(d.socket_path)
                c.started(6, 2)
                c.call(SEND, {"a": 1}, 3, 1, [6])
                os.write(told, b"ready")
                signal.pause()
            finally:
                os._exit(1)
        os.close(told)
        self.assertEqual(os.read(ready, 5), b"ready")
        os.kill(child, signal.SIGKILL)
        os.waitpid(child, 0)
        os.close(ready)
        d.wait_until(lambda: f"removing {child} from the server client list" in d.log(), "the client is removed")
        self.assertIn("InterruptionHandler: connection exited", d.log())
        self.assert_unharmed(d)
        self.assertEqual(d.stop(), 0)
        self.assertEqual(d.rows("SELECT category FROM relay_messages ORDER BY id"), [(3,), (0xFFFF,)])
        self.assertEqual(len(d.rows("SELECT 1 FROM analytics_events WHERE name LIKE '%clientuptime'"
                                    " AND json_extract(payload, '$.processName') LIKE 'python%'")), 3)

    def test_sigterm_with_a_hundred_started_sessions(self):
        d = self.daemon()
        clients = [d.client() for _ in range(10)]
        for i, c in enumerate(clients):
            for j in range(10):
                c.started(100 + 10 * i + j, 8)
                c.post(SEND, {"n": j}, 3, 0, [100 + 10 * i + j])
        for c in clients:
            c.raw(frame(CALL, 999, SEND, {"last": True}, 11, 0, [100 + 10 * clients.index(c)]))
        self.assertEqual(d.stop(), 0)
        for c in clients:
            c.until_closed()
            self.assertTrue(c.goodbye)
        self.assertEqual(d.rows("SELECT category, count(*) FROM relay_messages GROUP BY 1 ORDER BY 1"),
                         [(3, 100), (11, 10), (0xFFFF, 100)])
        self.assertFalse(os.path.exists(d.socket_path))

    def test_second_daemon_is_refused(self):
        d = self.daemon()
        c = d.client()
        c.started(1)
        for changed in ({}, {"RUNTIME_DIRECTORY": d.folder + "/log"}):
            second = subprocess.run([DAEMON], env=dict(d.environment, **changed), stderr=subprocess.PIPE, timeout=PATIENCE)
            self.assertEqual(second.returncode, 1)
            self.assertIn(b"another", second.stderr)
        self.assertIsNone(c.call(SEND, {"a": 1}, 3, 1, [1]))
        self.assert_unharmed(d)

    def test_unusable_directories_are_named(self):
        d = self.daemon()
        d.stop()
        for name in ("RUNTIME_DIRECTORY", "STATE_DIRECTORY"):
            path = d.folder + "/file"
            open(path, "w").close()
            got = subprocess.run([DAEMON], env=dict(d.environment, **{name: path + "/x"}), stderr=subprocess.PIPE,
                                 timeout=PATIENCE)
            self.assertEqual(got.returncode, 1)
            self.assertIn(path.encode(), got.stderr)

    def test_daemon_killed_and_started_again(self):
        d = self.daemon(config="[device]\ninternal_build = true\n")
        self.assertEqual(os.stat(d.socket_path).st_mode & 0o777, 0o666)
        c = d.client()
        c.started(1, 2)
        c.call(SEND, {"a": 1}, 3, 1, [1])
        d.wait_for_messages(1)
        self.assertEqual(d.rows("PRAGMA journal_mode"), [("wal",)])  # readers do not hold up the service
        d.process.kill()
        d.process.wait()
        self.assertTrue(os.path.exists(d.socket_path))
        os.makedirs(f"{d.folder}/log/Audio/Reporting")
        open(f"{d.folder}/log/Audio/Reporting/.vx.0123456789abcdef.tmp", "w").close()
        d.start()
        c = d.client()
        c.started(1, 2)
        c.call(SEND, {"a": 2}, 3, 1, [1])
        c.call(STOP, 1)
        self.assertEqual(len(d.summaries()), 1)  # what was half-written when it died is gone
        self.assertEqual(d.stop(), 0)
        self.assertEqual(d.rows("SELECT count(*) FROM relay_messages WHERE category = 3"), [(2,)])

    def test_garbage_database_is_moved_aside(self):
        d = self.daemon()
        self.assertEqual(d.stop(), 0)
        with open(d.database, "wb") as f:
            f.write(b"not a database " * 1000)
        d.start()
        c = d.client()
        c.started(1)
        c.call(SEND, {"a": 1}, 3, 1, [1])
        self.assertEqual(d.stop(), 0)
        self.assertEqual(d.rows("SELECT count(*) FROM relay_messages WHERE category = 3"), [(1,)])
        (aside,) = [n for n in os.listdir(d.folder + "/state") if n.startswith("telemetry.db.damaged")]
        with open(f"{d.folder}/state/{aside}", "rb") as f:
            self.assertTrue(f.read().startswith(b"not a database"))

    def test_full_disk_keeps_what_was_accepted(self):
        d = self.daemon()
        c = d.client()
        c.started(1)
        c.call(SEND, {"i": -1}, 3, 1, [1])
        d.wait_for_messages(1)
        # No file of the daemon may grow any more: to SQLite that is a full disk.
        resource.prlimit(d.process.pid, resource.RLIMIT_FSIZE, (4096, resource.RLIM_INFINITY))
        for i in range(200):
            self.assertIsNone(c.call(SEND, {"i": i}, 3, 1, [1]))
        d.wait_until(lambda: "<3>" in d.log(), "the failure is in the log")
        self.assert_unharmed(d)
        resource.prlimit(d.process.pid, resource.RLIMIT_FSIZE, (resource.RLIM_INFINITY, resource.RLIM_INFINITY))
        self.assertEqual(d.stop(), 0)
        self.assertEqual(d.rows("SELECT count(*), count(DISTINCT json_extract(payload, '$.i')) FROM relay_messages"
                                " WHERE category = 3"), [(201, 201)])

    def test_full_queue_pauses_reading_and_loses_nothing(self):
        d = self.daemon(config="[store]\nqueue_bytes = 65536\n")
        c = d.client()
        c.started(1)
        posts = [c.post(SEND, {"i": i, "text": "x" * 500}, 3, 1, [1]) for i in range(500)]
        for n in posts:
            self.assertIsNone(c.answer(n)[2])
        d.wait_for_messages(500)
        self.assertEqual(d.stop(), 0)

    def test_socket_activation_and_readiness(self):
        folder = tempfile.mkdtemp(prefix="vx")
        os.makedirs(folder + "/run")
        notify = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        notify.bind(folder + "/notify")
        notify.settimeout(PATIENCE)
        self.addCleanup(notify.close)
        listener = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        listener.bind(folder + "/run/service.socket")
        listener.listen(16)
        self.addCleanup(listener.close)

        # LISTEN_PID must be the daemon's own: a shell sets it and becomes the daemon.
        wrapper = folder + "/activate"
        with open(wrapper, "w") as f:
            f.write(f'#!/bin/sh\nLISTEN_PID=$$ LISTEN_FDS=1 exec "{DAEMON}"\n')
        os.chmod(wrapper, 0o755)
        d = self.daemon(folder=folder, wait=False, preexec=lambda: (os.dup2(listener.fileno(), 3), os.set_inheritable(3, True)),
                        environment={"NOTIFY_SOCKET": folder + "/notify"}, program=wrapper)
        self.assertIn(b"READY=1", notify.recv(4096))
        self.assert_unharmed(d)
        self.assertEqual(d.stop(), 0)
        self.assertIn(b"STOPPING=1", notify.recv(4096))
        self.assertTrue(os.path.exists(folder + "/run/service.socket"))  # the service manager's to remove


if __name__ == "__main__":
    unittest.main()
