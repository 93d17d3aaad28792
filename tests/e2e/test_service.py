"""What clients get and what the store holds, end to end."""
import json
import os
import threading
import unittest

from harness import *


class Sessions(DaemonTest):
    def test_every_operation_answers(self):
        d = self.daemon()
        c = d.client()
        self.assertEqual(c.hello[:2], [HELLO, 1])
        self.assertEqual(c.hello[2]["interface"], "VXReportingServiceProtocol")
        self.assertIs(c.call(CREATE, 5), True)
        self.assertEqual(c.call(GET_TYPE, 5), 65535)
        self.assertIs(c.call(SET_TYPE, 7, 5), True)
        self.assertEqual(c.call(GET_TYPE, 5), 7)
        self.assertIs(c.call(CONFIGURE, {"HostApplicationDisplayID": "com.example"}, 5), True)
        self.assertIs(c.call(CONFIGURE, None, 5), True)
        self.assertEqual(c.call(VALIDATE, 5), {"reporterID": 5, "serviceType": 7})
        self.assertEqual(c.call(VALIDATE, 6), {"reporterID": 0, "serviceType": 65535})
        self.assertEqual(c.call(REPORTERS), [5])
        self.assertIsNone(c.call(SEND, {"a": 1}, 3, 1, [5]))
        self.assertIs(c.call(DESTROY, 5), True)
        self.assertEqual(c.call(REPORTERS), [])
        for operation in (START, STOP, DESTROY):
            self.assertIs(c.call(operation, 0), True)
        self.assertIs(c.call(SET_TYPE, 1, 0), True)
        n = c.post(GET_TYPE, 0)  # replied to twice, of which the transport drops the second
        c.call(REPORTERS)
        self.assertEqual(c.answers[n], [[REPLY, n, 65535]])

    def test_start_is_answered_when_the_session_stops(self):
        d = self.daemon()
        c = d.client()
        start = c.started(1)
        self.assertFalse(c.is_answered(start))
        stop = c.post(STOP, 1)
        self.assertIs(c.answer(stop)[2], True)
        self.assertEqual(list(c.answers)[-2:], [start, stop])  # the start's answer left first

    def test_destroyed_session_lets_go_of_its_start(self):
        d = self.daemon()
        c = d.client()
        start = c.started(1)
        self.assertIs(c.call(DESTROY, 1), True)
        self.assertEqual(c.answer(start)[:3], [ERROR, start, 8])

    def test_kill_ends_the_service_with_status_2(self):
        d = self.daemon()
        c = d.client()
        n = c.post(KILL)
        c.until_closed()
        self.assertNotIn(n, c.answers)
        self.assertEqual(d.process.wait(PATIENCE), 2)


class Store(DaemonTest):
    def test_a_session_from_start_to_store(self):
        d = self.daemon()
        c = d.client()
        start = c.started(42, 7, {"HostApplicationDisplayID": "com.example.player"})
        payload = {"sample rate": 48000, "gain": 0.5, "muted": False, "route": "Speaker", "list": [1, "x"],
                   "single": F32(0.25)}
        self.assertIsNone(c.call(SEND, payload, 0x08000005, 1, None))
        self.assertIs(c.call(STOP, 42), True)
        self.assertIs(c.answer(start)[2], True)
        c.raw(frame(GOODBYE))
        c.until_closed()
        self.assertEqual(d.stop(), 0)
        (session,) = d.rows("SELECT id, session_id, client_type, client_version, client_name, service_name,"
                            " batch_event, contains_realtime_events, user_info FROM relay_sessions")
        self.assertEqual(session[1:8], (42, 19, 2.0, "com.quorvel.sonik", "longformaudio_session", 1, 0))
        self.assertEqual(json.loads(session[8])["HostApplicationDisplayID"], "com.example.player")
        messages = d.rows("SELECT relay_session, category, type, payload FROM relay_messages ORDER BY id")
        self.assertEqual(messages[0][:3], (session[0], 5, 1))
        stored = dict(payload, sample_rate=48000)
        del stored["sample rate"]
        self.assertEqual(json.loads(messages[0][3]), stored)
        # The summary is relayed like any message, and comes last.
        self.assertEqual(messages[-1][1:3], (0xFFFF, 0xFFFF))
        self.assertEqual(json.loads(messages[-1][3])["sample_rate"], "48000")
        events = dict(d.rows("SELECT name, payload FROM analytics_events"))
        self.assertEqual(json.loads(events["com.quorvel.sonik.Session_Setup.Start"]),
                         dict(payload, HostApplicationDisplayID="com.example.player"))
        uptime = json.loads(events["com.quorvel.sonik.vxreportingclientuptime"])
        self.assertTrue(uptime["processName"].startswith("python"), uptime)
        self.assertGreaterEqual(uptime["seconds"], 0)

    def test_message_without_a_started_session_goes_out_alone(self):
        d = self.daemon()
        c = d.client()
        self.assertIsNone(c.call(SEND, {"EngineOnTime": 3, "vxreporting_timestamp": 1.5}, 1, 6, None))
        self.assertIsNone(c.call(SEND, {"a": 1}, 1, 0, []))  # an empty list routes nothing
        self.assertEqual(d.stop(), 0)
        self.assertEqual(d.rows("SELECT session_id, service_name, batch_event FROM relay_sessions"),
                         [(-1, "standalone", None)])
        self.assertEqual(d.rows("SELECT category, type FROM relay_messages"), [(1, 6)])
        (power,) = d.rows("SELECT client_identifier, name, record FROM power_records")
        self.assertEqual(power[:2], (28, "Lumo_Haptics"))
        self.assertEqual(json.loads(power[2]),
                         {"EngineOnDuration": 3, "ApplicationName": "Unknown", "TimestampEnd": 1.5})

    def test_driver_counters_over_a_session(self):
        folder = tempfile.mkdtemp(prefix="vx")
        counters = {"Speaker/underruns": "5\n", "Speaker/gone": "1", "Haptics/Stats/clicks": "0x10",
                    "QuorvelAE2MCA/bad": "1", "Other/MCA/frames": "7"}
        for name, value in counters.items():
            os.makedirs(os.path.dirname(f"{folder}/drivers/{name}"), exist_ok=True)
            with open(f"{folder}/drivers/{name}", "w") as f:
                f.write(value)
        d = self.daemon(folder=folder)
        c = d.client()
        c.started(1)
        for name, value in {"Speaker/underruns": "12", "Haptics/Stats/clicks": "0x11\n",
                            "QuorvelAE2MCA/bad": "many"}.items():
            with open(f"{folder}/drivers/{name}", "w") as f:
                f.write(value)
        os.remove(f"{folder}/drivers/Speaker/gone")
        c.call(STOP, 1)
        self.assertEqual(d.stop(), 0)
        ((payload,),) = d.rows("SELECT payload FROM analytics_events"
                               " WHERE name = 'com.quorvel.sonik.ChannelReporting.Generic'")
        self.assertEqual(json.loads(payload), {"Speaker_underruns": 7, "Haptics_Stats_clicks": 1,
                                               "HostApplicationDisplayID": "Unknown"})
        self.assertIn("ChannelReportCreateSamples error", d.log())
        self.assertEqual(d.rows("SELECT category, type FROM relay_messages ORDER BY id LIMIT 1"), [(9, 0)])

    def test_two_hundred_clients_at_once(self):
        clients, messages = 200, 100
        d = self.daemon()
        failures = []

        def run(number):
            try:
                c = Client(d.socket_path)
                c.call(CREATE, number)
                c.post(START, number)
                barrier.wait()
                posts = [c.post(SEND, {"client": number, "i": i}, 3, 1, [number]) for i in range(messages)]
                for n in posts:
                    if c.answer(n) != [REPLY, n, None]:
                        failures.append((number, c.answer(n)))
                barrier.wait()
                c.call(STOP, number)
                c.raw(frame(GOODBYE))
                c.until_closed()
            except Exception as e:
                failures.append((number, repr(e)))
                barrier.abort()

        barrier = threading.Barrier(clients, timeout=PATIENCE * 4)
        threads = [threading.Thread(target=run, args=(i + 1,)) for i in range(clients)]
        for t in threads:
            t.start()
        for t in threads:
            t.join()
        self.assertEqual(failures, [])
        self.assertEqual(d.stop(), 0)
        per_session = d.rows("SELECT s.session_id, count(*), count(DISTINCT json_extract(m.payload, '$.i')),"
                             " min(json_extract(m.payload, '$.client')), max(json_extract(m.payload, '$.client'))"
                             " FROM relay_messages m JOIN relay_sessions s ON s.id = m.relay_session"
                             " WHERE m.category = 3 GROUP BY s.session_id ORDER BY s.session_id")
        self.assertEqual(per_session, [(i, messages, messages, i, i) for i in range(1, clients + 1)])
        self.assertEqual(d.rows("SELECT count(*) FROM analytics_events"
                                " WHERE name = 'com.quorvel.sonik.Playback.Start'"), [(clients * messages,)])
        self.assertEqual(d.rows("SELECT count(*) FROM relay_messages WHERE category = 65535"), [(clients,)])

    def test_no_back_ends_ends_the_wait_with_dropped_messages(self):
        d = self.daemon(config="[relay]\nbackends = []\n")
        c = d.client()
        c.started(1)
        c.call(SEND, {"x": 1}, 4, 2, None)
        # Others are served while the session's relay waits.
        self.assert_unharmed(d)
        d.wait_until(lambda: "failed to find backend" in d.log(), "the wait for back ends ran out")
        d.wait_until(lambda: "No valid VyrReportingSession" in d.log(), "the message was dropped")
        self.assertIn("No backends found, this session won't get sent to the server", d.log())
        c.call(STOP, 1)
        self.assertEqual(d.stop(), 0)
        self.assertEqual(d.rows("SELECT count(*) FROM relay_messages"), [(0,)])
        self.assertEqual(d.rows("SELECT count(*) FROM analytics_events WHERE name LIKE '%PlaybackAndRecord.Stop'"),
                         [(1,)])


if __name__ == "__main__":
    unittest.main()
