"""What clients get and what the store holds, end to end."""
import json
import os
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

    def test_start_is_answered_when_the_session_stops_or_goes(self):
        d = self.daemon()
        c = d.client()
        start = c.started(1)
        destroyed = c.started(2)
        self.assertEqual(sorted(c.call(REPORTERS)), [1, 2])
        self.assertNotIn(start, c.answers)
        stop = c.post(STOP, 1)
        self.assertIs(c.answer(stop)[2], True)
        self.assertEqual(list(c.answers)[-2:], [start, stop])  # the start's answer left first
        self.assertIs(c.call(DESTROY, 2), True)
        self.assertEqual(c.answer(destroyed)[:3], [ERROR, destroyed, 8])


class Store(DaemonTest):
    def test_a_session_from_start_to_store(self):
        d = self.daemon()
        c = d.client()
        start = c.started(42, 7, {"HostApplicationDisplayID": "com.example.player"})
        payload = {"sample rate": 48000, "gain": 0.5, "muted": False, "route": "Speaker", "list": [1, "x"]}
        self.assertIsNone(c.call(SEND, payload, 0x08000005, 1, None))
        self.assertIs(c.call(STOP, 42), True)
        self.assertIs(c.answer(start)[2], True)
        self.assertIsNone(c.call(SEND, {"EngineOnTime": 3, "vxreporting_timestamp": 1.5}, 1, 6, None))  # goes out alone
        self.assertIsNone(c.call(SEND, {"a": 1}, 1, 0, []))  # an empty list routes nothing
        c.raw(frame(GOODBYE))
        c.until_closed()
        self.assertEqual(d.stop(), 0)
        self.assertEqual(os.listdir(f"{d.folder}/log"), [])  # only internal builds write summary files
        session, single = d.rows("SELECT id, session_id, client_type, client_version, client_name, service_name,"
                            " batch_event, contains_realtime_events, user_info FROM relay_sessions ORDER BY session_id DESC")
        self.assertEqual(session[1:8], (42, 19, 2.0, "com.quorvel.sonik", "longformaudio_session", 1, 0))
        self.assertEqual(json.loads(session[8])["HostApplicationDisplayID"], "com.example.player")
        self.assertEqual((single[1], single[5], single[6]), (-1, "standalone", None))
        self.assertEqual(d.rows("SELECT category, type FROM relay_messages WHERE relay_session = ?", single[0]), [(1, 6)])
        first, last = d.rows("SELECT category, type, payload FROM relay_messages WHERE relay_session = ? ORDER BY id",
                             session[0])
        self.assertEqual(first[:2], (5, 1))
        stored = dict(payload, sample_rate=48000)
        del stored["sample rate"]
        self.assertEqual(json.loads(first[2]), stored)
        # The summary is relayed like any message, and comes last.
        self.assertEqual(last[:2], (0xFFFF, 0xFFFF))
        self.assertEqual(json.loads(last[2])["sample_rate"], "48000")
        events = dict(d.rows("SELECT name, payload FROM analytics_events"))
        self.assertEqual(json.loads(events["com.quorvel.sonik.Session_Setup.Start"]),
                         dict(payload, HostApplicationDisplayID="com.example.player"))
        uptime = json.loads(events["com.quorvel.sonik.vxreportingclientuptime"])
        self.assertTrue(uptime["processName"].startswith("python"), uptime)
        self.assertGreaterEqual(uptime["seconds"], 0)
        (power,) = d.rows("SELECT client_identifier, name, record FROM power_records")
        self.assertEqual((*power[:2], json.loads(power[2])), (
            28, "Lumo_Haptics", {"EngineOnDuration": 3, "ApplicationName": "Unknown", "TimestampEnd": 1.5}))

    def test_driver_counters_over_a_session(self):
        folder = tempfile.mkdtemp(prefix="vx")

        def write(**counters):
            for name, value in counters.items():
                path = f"{folder}/drivers/{name.replace('_', '/')}"
                os.makedirs(os.path.dirname(path), exist_ok=True)
                with open(path, "w") as f:
                    f.write(value)

        write(Speaker_underruns="5\n", Speaker_gone="1", Haptics_Stats_clicks="0x10", Other_MCA_frames="7")
        d = self.daemon(folder=folder)
        c = d.client()
        c.started(1)
        write(Speaker_underruns="12", Haptics_Stats_clicks="0x11\n", Other_MCA_frames="9")
        os.remove(f"{folder}/drivers/Speaker/gone")
        c.call(STOP, 1)
        self.assertEqual(d.stop(), 0)
        ((payload,),) = d.rows("SELECT payload FROM analytics_events"
                               " WHERE name = 'com.quorvel.sonik.ChannelReporting.Generic'")
        self.assertEqual(json.loads(payload), {"Speaker_underruns": 7, "Haptics_Stats_clicks": 1, "MCA_frames": 2,
                                               "HostApplicationDisplayID": "Unknown"})
        self.assertEqual(d.rows("SELECT category, type FROM relay_messages ORDER BY id LIMIT 1"), [(9, 0)])

    def test_two_hundred_clients_at_once(self):
        clients, messages = 200, 20
        d = self.daemon()
        crowd = [d.client() for _ in range(clients)]
        starts = [c.started(number) for number, c in enumerate(crowd, 1)]
        # All send before anybody reads an answer.
        posts = [[c.post(SEND, {"client": number, "i": i}, 3, 1, [number]) for i in range(messages)]
                 for number, c in enumerate(crowd, 1)]
        for number, (c, start, sent) in enumerate(zip(crowd, starts, posts), 1):
            self.assertEqual([c.answer(n) for n in sent], [[REPLY, n, None] for n in sent])
            self.assertIs(c.call(STOP, number), True)
            self.assertEqual([len(c.answers[n]) for n in (start, *sent)], [1] * (messages + 1))
        d.wait_for_messages(clients * (messages + 1))
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
