"""The Python package: both clients with the real daemon, and with services that are hostile."""
import asyncio
import contextlib
import datetime
import os
import socket
import struct
import tempfile
import threading
import time
import unittest

import vxreporting
from harness import Daemon, DaemonTest, frame

MESSAGE = {"gain": 0.5, "frames": -3, "big": 2**64 - 1, "on": True, "route": "Köln", "at": datetime.datetime.fromtimestamp(0),
           "inner": {"list": [1, "x", {}]}}
STORED = ('{"gain":0.5,"frames":-3,"big":18446744073709551615,"on":true,"route":"Köln","at":"1970-01-01T00:00:00Z",'
          '"inner":{"list":[1,"x",{}]}}')
TYPE_2 = "SELECT session_id, payload FROM session_messages WHERE category = 3 ORDER BY id"


class Blocking:
    """An AsyncClient used as a Client, so that each test tries both."""

    def __init__(self, *arguments, **options):
        self.loop = asyncio.new_event_loop()
        self.client = vxreporting.AsyncClient(*arguments, **options)

    def __getattr__(self, name):
        member = getattr(self.client, name)

        def call(*arguments, wait=True, **options):
            async def run():
                result = (member if wait else self.client.post_message)(*arguments, **options)
                return await result if asyncio.iscoroutine(result) else result
            return self.loop.run_until_complete(run())
        return call if callable(member) else member

    def __enter__(self):
        try:
            self.loop.run_until_complete(self.client.__aenter__())
        except vxreporting.Error:
            self.loop.close()
            raise
        return self

    def __exit__(self, *error):
        try:
            self.loop.run_until_complete(self.client.__aexit__(*error))
        finally:
            self.loop.close()


CLIENTS = (vxreporting.Client, Blocking)


class RealServiceTest(DaemonTest):
    def test_a_session_in_ten_lines(self):
        daemon = self.daemon()

        async def whole_life():
            async with vxreporting.AsyncClient(daemon.socket_path) as client:
                async with client.session(2, service_type=2, configuration={"HostApplicationDisplayID": "b"}) as session:
                    session.post(MESSAGE, category="Playback", type="generic")
                    await session.send({}, category=0x08000005, type=1)
                    return await client.reporters(), await client.validate(2), await client.service_type(2)

        with vxreporting.Client(daemon.socket_path) as client:
            with client.session(1, service_type="longformaudio", configuration={"HostApplicationDisplayID": "a"}) as session:
                session.send(MESSAGE, category="Playback", type="Generic")
                session.send({}, category="Session_Setup", type="Start", wait=False)
                self.assertEqual((client.reporters(), client.validate(1), client.service_type(1)),
                                 ([1], vxreporting.Reporter(1, 7), 7))
            self.assertEqual(client.validate(1), vxreporting.Reporter(0, 65535))
        self.assertEqual(asyncio.run(whole_life()), ([2], vxreporting.Reporter(2, 2), 2))
        self.assertEqual(daemon.stop(), 0)
        self.assertEqual(daemon.rows(TYPE_2), [(1, STORED), (2, STORED)])
        self.assertEqual(daemon.rows("SELECT count(*) FROM session_messages WHERE category = 5 AND type = 1"), [(2,)])

    def test_kept_sessions_outlive_the_service(self):
        for kind in CLIENTS:
            for end in (Daemon.kill, Daemon.stop):
                daemon = self.daemon()
                with self.subTest(kind=kind, end=end), kind(daemon.socket_path, keep_sessions=True, timeout=20,
                                                            max_buffered_bytes=400) as client:
                    client.create_session(7)
                    client.set_service_type(7, "telephony")
                    start = client.start_session(7)
                    client.create_session(8)
                    client.create_session(9)
                    client.destroy_session(9)
                    client.send_message({"before": 1}, category=3, type=0, sessions=[7])
                    end(daemon)
                    with self.assertRaises(vxreporting.BufferFull):
                        for i in range(100):
                            client.send_message({"during": i}, category=3, type=0, sessions=[7], wait=False)
                    self.assertFalse(client.connected)
                    daemon.start()
                    client.flush()
                    client.send_message({"after": 1}, category=3, type=0, sessions=[7])
                    self.assertEqual(sorted(client.reporters()), [7, 8])
                    self.assertEqual(client.service_type(7), 2)
                    self.assertFalse(start.done)
                    client.stop_session(7)
                    self.assertIs(start.result(), True)
                    self.assertEqual(client.counters, vxreporting.Counters(reconnections=1, dropped=1))
                self.assertEqual(daemon.stop(), 0)
                self.assertEqual(daemon.rows(TYPE_2), [(7, '{"before":1}'), *((7, f'{{"during":{n}}}') for n in range(i)),
                                                       (7, '{"after":1}')])

    def test_failures_say_what_is_wrong(self):
        daemon = self.daemon(config="[listener]\nmax_sessions_per_connection = 1\nmax_identifiers = 2\nmax_frame_bytes = 4096\n")
        deep = {}
        for _ in range(32):
            deep = {"a": deep}
        for kind in CLIENTS:
            with kind(daemon.socket_path) as client:
                client.create_session(1)
                for call, text in (
                        (lambda: client.create_session(2), "sessions"),
                        (lambda: client.create_session("7"), "'7'"),
                        (lambda: client.create_session(2**63), "9223372036854775807"),
                        (lambda: client.set_service_type(1, "phone"), "'phone' is no service type"),
                        (lambda: client.set_service_type(1, True), "True"),
                        (lambda: client.configure(1, 5), "a dictionary, not 5"),
                        (lambda: client.send_message({"a": None}, category=3, type=0), "NoneType"),
                        (lambda: client.send_message({"a": 2**64}, category=3, type=0), "64 bits"),
                        (lambda: client.send_message({1: 1}, category=3, type=0), "key 1"),
                        (lambda: client.send_message({"a": "\ud800"}, category=3, type=0), "Unicode"),
                        (lambda: client.send_message(deep, category=3, type=0), "32"),
                        (lambda: client.send_message({"a": "x" * 5000}, category=3, type=0), "4096"),
                        (lambda: client.send_message({}, category="Setup_Session", type=0), "no area"),
                        (lambda: client.send_message({}, category=-1, type=0), "-1")):
                    with self.assertRaisesRegex(vxreporting.Error, text, msg=text):
                        call()
                client.send_message({}, category=3, type=0, sessions=[1, 2, 3], wait=False)
                with self.assertRaisesRegex(vxreporting.ServiceError, "identifiers"):
                    client.flush()
                client.send_message(deep["a"], category=3, type=0)
                self.assertEqual(client.reporters(), [1])
            with self.assertRaisesRegex(vxreporting.NotConnected, "goodbye"):
                client.client.start_session(1) if kind is Blocking else client.start_session(1)
            with self.assertRaisesRegex(vxreporting.NotConnected, "/nonexistent.*No such file"), kind("/nonexistent"):
                pass
        with vxreporting.Client(daemon.socket_path) as client:
            if os.fork() == 0:
                with contextlib.suppress(vxreporting.NotConnected):
                    client.create_session(3)
                    os._exit(1)
                client.__del__()
                os._exit(0)
            self.assertEqual(os.wait()[1], 0)
            self.assertEqual(client.reporters(), [])


class HostileServiceTest(unittest.TestCase):
    def serve(self, *behaviours):
        """A socket whose connections are treated by these, one after the other; each gets the client's bytes so far."""
        folder = tempfile.TemporaryDirectory()
        self.addCleanup(folder.cleanup)
        listener = socket.socket(socket.AF_UNIX)
        listener.bind(folder.name + "/s")
        listener.listen()
        listener.settimeout(10)

        def run():
            with listener:
                for behaviour in behaviours:
                    connection, _ = listener.accept()
                    with connection, contextlib.suppress(OSError):
                        connection.settimeout(10)
                        connection.recv(4096)
                        behaviour(connection)

        thread = threading.Thread(target=run)
        thread.start()
        self.addCleanup(thread.join)
        return folder.name + "/s"

    @staticmethod
    def answering(data, then=lambda connection: None):
        def behave(connection):
            connection.sendall(frame(0, 1, {"max_frame_bytes": 1 << 60}))
            connection.recv(4096)
            connection.sendall(data)
            then(connection)
        return behave

    def test_a_bad_answer_is_an_error(self):
        body = struct.pack
        cases = {
            "not the protocol": (frame(2, 1), frame(9, 1, True), frame("x"), frame(True, 1, 2), frame(0, 1), frame(2, 1.0, True),
                                 frame(), frame(3, 1, 4), frame(2, True, True)),
            "no call": (frame(3, "x", 1, "y"),),
            "of 4294967295 bytes": (b"\xff" * 64,),
            "no short array": (body("<I", 1) + b"\xa0", body("<I", 0), body("<I", 3) + b"\x98\x01\x01"),
            "ends too early": (body("<I", 3) + b"\x83\x02\x01", body("<I", 12) + b"\x83\x02\x01\x9b" + b"\xff" * 8,
                               body("<I", 12) + b"\x83\x02\x01\x7b" + b"\xff" * 8),
            "nests too deep": (body("<I", 100003) + b"\x83\x02\x01" + b"\x81" * 100000,),
            "behind": (body("<I", 5) + b"\x83\x02\x01\xf5\x00",),
            "without a length": (body("<I", 5) + b"\x83\x02\x01\x9f\xff",),
            "simple value": (body("<I", 4) + b"\x83\x02\x01\xf7",),
            "has not": (body("<I", 4) + b"\x83\x02\x01\x40", body("<I", 5) + b"\x83\x02\x01\xc2\x01"),
            "UTF-8": (body("<I", 5) + b"\x83\x02\x01\x61\xff",),
            "date": (body("<I", 5) + b"\x83\x02\x01\xc1\xf5", body("<I", 7) + b"\x83\x02\x01\xc1\xf9\x7e\x00"),
            "twice": (body("<I", 8) + b"\x83\x02\x01\xa2\x60\x01\x60\x01", body("<I", 6) + b"\x83\x02\x01\xa1\x01\x01"),
            "another kind": (frame(2, 1, 1), frame(2, 1, "x"), frame(2, 1, None), frame(2, 1, [])),
            "enough": (frame(3, None, 6, "enough"), frame(3, 1, 5, "enough")),
            "went away|closed": (b"", b"\x04", frame(2, 2, True) + frame(3, 77, 1, "x"), frame(2, 1, True)[:-1]),
            "ended": (frame(4),)}
        for kind in CLIENTS:
            for text, answers in cases.items():
                for answer in answers:
                    with self.subTest(kind=kind, answer=answer[:40]):
                        with self.assertRaisesRegex(vxreporting.Error, text), kind(self.serve(self.answering(answer))) as client:
                            client.create_session(1)

    def test_a_service_that_is_silent_or_never_pauses_is_not_waited_for(self):
        def flood(connection):
            while True:
                connection.sendall(frame(2, 99, True) * 1000)

        def silence(connection):
            while connection.recv(4096):
                pass

        for kind in CLIENTS:
            for behaviour in (silence, self.answering(b"", silence), self.answering(b"", flood)):
                began = time.monotonic()
                with self.assertRaises(vxreporting.TimedOut), kind(self.serve(behaviour), timeout=0.2) as client:
                    client.create_session(1)
                self.assertLess(time.monotonic() - began, 10)

    def test_what_was_written_is_not_sent_again(self):
        seen = []

        def leave(connection):
            connection.sendall(frame(0, 1, {}) + frame(4))  # what is sent now is for the next
            time.sleep(0.1)
            connection.setblocking(False)
            seen.append(connection.recv(4096))  # BlockingIOError: nothing

        def take(connection):
            connection.sendall(frame(0, 1, {}))
            seen.append(connection.recv(4096))

        def end(connection):
            connection.sendall(frame(0, 1, {}))
            seen.append(connection.recv(4096))
            connection.sendall(frame(2, 4, True) + frame(2, 2, True))
            connection.recv(4096)

        with vxreporting.Client(self.serve(take, leave, end), keep_sessions=True) as client:
            with self.assertRaises(vxreporting.ConnectionLost):
                client.create_session(1)
            client.create_session(2)
            self.assertEqual(client.counters, vxreporting.Counters(reconnections=2, unanswered=1))
        self.assertEqual(seen, [frame(1, 1, 1, 1), frame(1, 4, 1, 1) + frame(1, 2, 1, 2)])
