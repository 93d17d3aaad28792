"""What clients get and what the store holds, end to end."""
import json

from harness import *


class Service(DaemonTest):
    def test_a_session_from_start_to_store(self):
        folder = tempfile.mkdtemp(prefix="vx")

        def count(**counters):
            for name, value in counters.items():
                path = f"{folder}/drivers/{name.replace('_', '/')}"
                os.makedirs(os.path.dirname(path), exist_ok=True)
                pathlib.Path(path).write_text(value)

        count(Speaker_underruns="5\n", Haptics_Stats_clicks="0x10", Other_MCA_frames="7")
        d = self.daemon(folder=folder)
        c = d.client()
        c.started(42, 7, {"HostApplicationDisplayID": "com.example.player"})
        count(Speaker_underruns="12", Haptics_Stats_clicks="0x11\n", Other_MCA_frames="9")
        payload = {"sample rate": 48000, "gain": 0.5, "muted": False, "route": "Speaker", "list": [1, "x"]}
        self.assertIsNone(c.call(SEND, payload, 0x08000005, 1, None))
        self.assertIs(c.call(STOP, 42), True)
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
        messages = {category: (type_, json.loads(text)) for category, type_, text in d.rows(
            "SELECT category, type, payload FROM relay_messages WHERE relay_session = ? ORDER BY id", session[0])}
        stored = dict(payload, sample_rate=48000)
        del stored["sample rate"]
        self.assertEqual(messages[5], (1, stored))
        self.assertEqual(messages[9][0], 0)  # what the drivers counted
        self.assertEqual(list(messages)[-1], 0xFFFF)  # the summary is relayed like any message, and comes last
        self.assertEqual(messages[0xFFFF][1]["sample_rate"], "48000")
        events = {name.removeprefix("com.quorvel.sonik."): json.loads(text)
                  for name, text in d.rows("SELECT name, payload FROM analytics_events")}
        self.assertEqual(events["Session_Setup.Start"], dict(payload, HostApplicationDisplayID="com.example.player"))
        self.assertRegex(events["vxreportingclientuptime"]["processName"], r"^python[\d.]*\Z")
        self.assertGreaterEqual(events["vxreportingclientuptime"]["seconds"], 0)
        (drivers,) = [e for name, e in events.items() if name.startswith("ChannelReporting.")]
        self.assertEqual(drivers, {"Speaker_underruns": 7, "Haptics_Stats_clicks": 1, "MCA_frames": 2,
                                   "HostApplicationDisplayID": "com.example.player"})
        (power,) = d.rows("SELECT client_identifier, name, record FROM power_records")
        self.assertEqual((*power[:2], json.loads(power[2])), (
            28, "Lumo_Haptics", {"EngineOnDuration": 3, "ApplicationName": "Unknown", "TimestampEnd": 1.5}))

    def test_what_is_listed_twice_or_named_0_and_a_start_of_a_session_of_others(self):
        d = self.daemon()
        owner, other = d.client(), d.client()
        owner.call(CREATE, 0)
        owner.call(CREATE, 7)
        owner.call(CREATE, 9)
        stopped, left = other.post(START, 7), other.post(START, 9)
        self.assertEqual(other.call(REPORTERS), [0, 7, 9])
        self.assertIs(owner.call(START, 0), True)
        self.assertIs(owner.call(DESTROY, 0), True)
        self.assertIsNone(other.call(SEND, {"a": 1}, 3, 1, [7, 0, 7]))
        self.assertIs(owner.call(STOP, 7), True)
        self.assertEqual(other.answer(stopped)[2], True)
        self.assertEqual(other.call(REPORTERS), [0, 7, 9])
        owner.close()
        self.assertEqual(other.answer(left)[0:3], [ERROR, left, 8])
        self.assertEqual(other.call(REPORTERS), [])
        self.assertEqual(d.stop(), 0)
        self.assertEqual(d.rows("SELECT count(*) FROM relay_messages WHERE category = 3"), [(2,)])

    def test_two_hundred_clients_at_once_a_small_queue_and_sessions_open_at_the_end(self):
        clients, messages = 200, 20
        d = self.daemon(config="[store]\nqueue_bytes = 65536\n")  # reading pauses, and nothing is lost
        crowd = [d.client() for _ in range(clients)]
        for number, c in enumerate(crowd, 1):
            c.started(number)
        # All send before anybody reads an answer.
        posts = [[c.post(SEND, {"client": number, "i": i, "text": "x" * 100}, 3, 1, [number]) for i in range(messages)]
                 for number, c in enumerate(crowd, 1)]
        for number, (c, sent) in enumerate(zip(crowd, posts), 1):
            self.assertEqual([c.answer(n) for n in sent], [[REPLY, n, None] for n in sent])
            if number > 100:
                self.assertIs(c.call(STOP, number), True)
        d.wait_for_messages(clients * messages + 100)
        self.assertEqual(d.stop(), 0)
        self.assertEqual([c.until_closed().goodbye for c in crowd], [True] * clients)
        self.assertFalse(os.path.exists(d.socket_path))
        self.assertEqual(d.rows("SELECT category, count(*) FROM relay_messages GROUP BY 1"),
                         [(3, clients * messages), (0xFFFF, clients)])
        self.assertEqual(d.rows("SELECT count(DISTINCT payload) FROM relay_messages JOIN relay_sessions s"
                                " ON s.id = relay_session AND session_id = json_extract(payload, '$.client')"),
                         [(clients * messages,)])
