"""The service's account of itself: inspect.socket, and the commands of vxreport that ask there."""
import json
import re
import tomllib

from harness import *

VXREPORT = os.environ["VXREPORT"]
(STATUS, CONNECTIONS, SESSIONS, SESSION, FOLLOW, ERASE) = range(1, 7)
EXAMPLE = os.path.join(os.path.dirname(__file__), "../../packaging/platform.toml.example")
MEMBER, OUTSIDER, GROUP = 54321, 54322, "games"
CATEGORY = 0x2000000A


class InspectTest(DaemonTest):
    def daemon(self, config="", **options):
        d = super().daemon(f'[inspect]\ngroup = "{GROUP}"\n{config}', **options)
        os.chmod(d.folder, 0o755)
        self.environment = dict(d.environment, VXREPORTING_SOCKET=d.socket_path)
        return d

    def inspector(self, d, **options):
        c = Client(f"{d.folder}/run/inspect.socket", **options)
        d.clients.append(c)
        return c

    def vxreport(self, *words, status=0, **options):
        done = subprocess.run([VXREPORT, *words], env=self.environment, capture_output=True, text=True, timeout=PATIENCE, **options)
        self.assertEqual(done.returncode, status, (words, done.stdout, done.stderr))
        return done.stdout if status == 0 else done.stderr

    def test_account_of_what_was_accepted_relayed_stored_and_left_out(self):
        d = self.daemon()
        client = d.client()
        client.started(7, 2, {"HostApplicationDisplayID": "com.example.phone"})
        for i in range(5):
            client.call(SEND, {"n": i}, CATEGORY, 1, [7])
        client.call(SEND, {"n": 9}, CATEGORY, 2, [7, 4711])  # which nobody has
        client.call(CREATE, 8)
        client.call(SEND, {"alone": 1}, CATEGORY, 1, [8])    # not started
        d.wait_for_messages(7)
        inspector = self.inspector(d)
        d.wait_until(lambda: inspector.call(STATUS)["queues"]["store"]["records"] == 0, "everything is stored")
        status = inspector.call(STATUS)
        self.assertEqual(status["service"] | {"watchers": 0}, {
            "reporting": True, "clients": 1, "sessions": 2, "sessions_started": 1, "delayed_messages": 0,
            "delayed_messages_bound": 16384, "watchers": 0,
            "messages": {"delivered": 7, "standalone": 0, "unknown_session": 1, "reporting_off": 0, "drivers": 0}})
        self.assertEqual(status["pid"], d.process.pid)
        self.assertEqual(status["durability"]["commit_lag_ms"], 0)
        self.assertEqual(status["store"]["bytes"], os.stat(d.database).st_size)
        self.assertGreaterEqual(status["store"]["rows_committed"], 9)
        self.assertLess(abs(status["store"]["oldest"].timestamp() - time.time()), PATIENCE)
        with open(EXAMPLE, "rb") as f:
            example = {table: set(keys) - {"mapped"} for table, keys in tomllib.load(f).items()}
        self.assertEqual({table: set(keys) - {"mapped"} for table, keys in status["configuration"].items()}, example)
        self.assertEqual(status["configuration"]["store"]["commit_interval_ms"], 100)

        (connection,) = inspector.call(CONNECTIONS, 0)["connections"]
        self.assertEqual((connection["pid"], connection["user"], connection["sessions"]), (os.getpid(), os.getuid(), 2))
        listed = inspector.call(SESSIONS, 0)
        self.assertEqual([(s["session"], s["started"], s["messages"], s["relay"]) for s in listed["sessions"]],
                         [(7, True, 6, "open"), (8, False, 1, "none")])
        self.assertEqual(inspector.call(SESSIONS, 1)["sessions"], listed["sessions"][1:])
        (session,) = inspector.call(SESSION, 7)["sessions"]
        self.assertEqual(session["application"], "com.example.phone")
        self.assertEqual(sorted(session["messages_by_kind"].values()), [1, 5])
        self.assertEqual(session["configuration"], {"HostApplicationDisplayID": "com.example.phone"})
        nothing = {"sent_alone_not_started": 0, "test_service_type": 0, "no_relay_session": 0, "refused_by_relay": 0}
        self.assertEqual(session["since_last_start"], {
            "accepted": 6, "aggregated": 6, "waiting_for_relay": 0, "relayed": 6, "left_out": nothing, "stored": 6,
            "waiting_for_commit": 0})
        (alone,) = inspector.call(SESSION, 8)["sessions"]
        self.assertEqual(alone["since_last_start"]["left_out"], nothing | {"sent_alone_not_started": 1})

        # The same, as an operator asks for it.
        self.assertRegex(self.vxreport("status"), r"(?s)^vxreporting \S+, pid \d+, up 0d.*delivered +7 .*unknown_session +1 ")
        self.assertEqual(json.loads(self.vxreport("status", "--json"))["service"]["messages"]["delivered"], 7)
        metrics = self.vxreport("status", "--metrics")
        self.assertIn("\n# TYPE vxreporting_service_messages_delivered_total counter\n"
                      "vxreporting_service_messages_delivered_total 7\n", metrics)
        for line in metrics.splitlines():
            self.assertRegex(line, r"^(# TYPE [a-z_]+ (counter|gauge)|[a-z_]+(\{version=\"[0-9.]+\"\})? [0-9.e+-]+)$")
        self.assertEqual([json.loads(line)["session"] for line in self.vxreport("sessions", "--json").splitlines()], [7, 8])
        self.assertIn("com.example.phone", self.vxreport("sessions"))
        self.assertIn(str(os.getpid()), self.vxreport("connections"))
        self.assertEqual(json.loads(self.vxreport("session", "7", "--json"))["messages"], 6)
        self.assertIn("nobody has a session 99", self.vxreport("session", "99", status=1))
        self.assertNotIn("\033", self.vxreport("top", "--interval", "1", "--count", "1"))
        self.vxreport("status", "--wrong", status=2)
        for command in ("status", "top", "connections", "sessions", "session", "tail", "erase"):
            self.assertIn(f"usage: vxreport {command}", self.vxreport(command, "--help"))
        self.assertIn("STATUS=Serving", d.told)
        self.assertEqual(d.stop(), 0)
        self.assertFalse(os.path.exists(f"{d.folder}/run/inspect.socket"))
        self.assertIn("no service runs there", self.vxreport("status", status=1))

    def test_follower_is_told_what_passes_and_never_waited_for(self):
        d = self.daemon()
        client = d.client()
        client.started(1, 2)
        client.started(2, 2)
        everything, some, lazy = (self.inspector(d) for _ in range(3))
        told = everything.post(FOLLOW, 0, None), some.post(FOLLOW, 2, [CATEGORY]), lazy.post(FOLLOW, 0, None)
        for c in everything, some, lazy:
            c.call(STATUS)  # by now they follow
        client.call(SEND, {"a": 1}, CATEGORY, 1, [1])
        client.call(SEND, {"b": "x" * 20000}, 3, 1, [2])
        client.call(SEND, {"c": 3}, CATEGORY, 1, [2])
        messages = []
        while len(messages) < 3:
            messages += everything.answer(told[0])[2]["messages"]
            told = everything.post(FOLLOW, 0, None), *told[1:]
        self.assertEqual([(m["session"], m["fate"], m["category"], m.get("message")) for m in messages],
                         [(1, "delivered", CATEGORY, {"a": 1}), (2, "delivered", 3, None), (2, "delivered", CATEGORY, {"c": 3})])
        self.assertGreater(messages[1]["message_left_out_bytes"], 20000)
        self.assertEqual([m["message"] for m in some.answer(told[1])[2]["messages"]], [{"c": 3}])
        # One answer is all that a follower gets who does not ask again; it is counted what he missed.
        lazy.answer(told[2])
        for _ in range(10):
            for number in [client.post(SEND, {"n": i}, CATEGORY, 1, [1]) for i in range(100)]:
                client.answer(number)
        late = lazy.call(FOLLOW, 0, None)
        self.assertLessEqual(len(late["messages"]), 256)
        self.assertGreaterEqual(late["left_out"], 1000 - 256)
        self.assertEqual(len(late["messages"]) + late["left_out"], 1002)
        self.assertGreaterEqual(everything.call(STATUS)["left_out"]["not_followed"], late["left_out"])

        # Whoever follows wakes nobody while nothing passes.
        d.wait_until(lambda: everything.call(STATUS)["queues"]["store"]["records"] == 0, "everything is stored")
        tail = subprocess.Popen([VXREPORT, "tail", "--session", "2", "--count", "2"], env=self.environment, stdout=subprocess.PIPE, text=True)
        d.wait_until(lambda: everything.call(STATUS)["service"]["watchers"] >= 4, "it follows")
        time.sleep(0.5)  # what has just been done is over
        before = self.switches(d)
        time.sleep(1)
        self.assertLessEqual(self.switches(d) - before, 1)
        client.call(SEND, {"quote\u001b\u009b\u00e9": 1}, CATEGORY, 1, [2])
        client.call(STOP, 2)
        client.call(SEND, {"last": 1}, CATEGORY, 1, [2])
        lines = tail.communicate(timeout=PATIENCE)[0].splitlines()
        self.assertEqual(len(lines), 2)
        self.assertRegex(lines[0], r'^\d\d:\d\d:\d\d\.\d{3} delivered session 2 telephony \S+ \{"quote\\u001b\\xC2\\x9Bé":1\}$')

    @staticmethod
    def switches(d):
        tasks = pathlib.Path(f"/proc/{d.process.pid}/task").glob("*/status")
        return sum(int(re.search(r"^voluntary_ctxt_switches:\s*(\d+)", task.read_text(), re.M).group(1)) for task in tasks)

    def test_hostile_frames_end_their_connection_alone(self):
        d = self.daemon()
        good = self.inspector(d)
        for data, code in ((frame(CALL, 1, STATUS), 1), (frame(HELLO, 2), 7), (struct.pack("<I", 1 << 30), 2), (struct.pack("<I", 0), 1),
                           (frame(HELLO, 1) + b"\x03\0\0\0\xff\xff\xff", 1), (frame(HELLO, 1) + frame(CALL, -1, STATUS), 1),
                           (frame(HELLO, 1) + struct.pack("<I", 256 * 1024 + 1), 2)):
            c = self.inspector(d, hello=False)
            c.raw(data)
            self.assertEqual(c.until_closed().answers[None][0][2], code, data[:20])
        for arguments, code in (((99,), 3), ((0,), 3), ((STATUS, 1), 4), ((SESSION,), 4), ((SESSION, "x"), 4), ((FOLLOW, 0, ["x"]), 4),
                                ((FOLLOW, 0, [1] * 65), 11), ((ERASE, 5), 4)):
            self.assertEqual(good.answer(good.post(*arguments))[:1] + [good.answers[good.number][0][2]], [ERROR, code], arguments)
        for extreme in (-2**63, 2**63 - 1):
            self.assertEqual(good.call(SESSION, extreme), {"sessions": []})
            self.assertEqual(good.call(SESSIONS, extreme)["sessions"], [])
            self.assertEqual(len(good.call(CONNECTIONS, extreme)["connections"]), 0)
        numbers = [good.post(FOLLOW, 0, None) for _ in range(500)]  # each takes the place of the one before
        self.assertEqual([good.answer(n)[2] for n in numbers[:-1]], [{"messages": [], "left_out": 0}] * 499)
        others = [self.inspector(d) for _ in range(7)]
        refused = self.inspector(d, hello=False)
        self.assertEqual(refused.until_closed().answers[None][0][2], 6)
        self.assertEqual(others[-1].call(STATUS)["inspect"]["refused_connections"], 1)
        d.client().session(1)

    @unittest.skipUnless(os.geteuid() == 0, "only root can be somebody else")
    def test_only_root_the_service_and_the_group_are_let_in(self):
        import grp
        d = self.daemon()
        path = f"{d.folder}/run/inspect.socket"
        self.assertEqual((os.stat(path).st_mode & 0o777, os.stat(path).st_gid), (0o660, grp.getgrnam(GROUP).gr_gid))

        def answer_for(user, groups):
            done = subprocess.run([VXREPORT, "status"], env=self.environment, capture_output=True, text=True, timeout=PATIENCE,
                                  user=user, group=OUTSIDER, extra_groups=groups)
            return done.returncode, done.stderr
        group = grp.getgrnam(GROUP).gr_gid
        self.assertEqual(answer_for(MEMBER, [OUTSIDER + 1, group])[0], 0)
        self.assertIn("members of the group", answer_for(OUTSIDER, [OUTSIDER + 1])[1])
        os.chmod(path, 0o666)  # the kernel is asked who it is, whatever the file's mode lets through
        status, text = answer_for(OUTSIDER, list(range(60000, 60100)))
        self.assertEqual((status, text), (1, f"vxreport: the service refuses: user {OUTSIDER} may not look into the service; "
                                             f"root and members of the group {GROUP} may\n"))
        self.assertEqual(answer_for(MEMBER, [*range(60000, 60100), group])[0], 0)
        done = subprocess.run([VXREPORT, "erase", "--user", "1"], env=self.environment, capture_output=True, text=True,
                              timeout=PATIENCE, user=MEMBER, extra_groups=[group])
        self.assertEqual((done.returncode, "erase is not for user" in done.stderr), (1, True))

    def test_what_a_person_asks_to_have_removed_is_gone(self):
        d = self.daemon(INTERNAL)
        secret, other = "com.example.secret-one", "com.example.other"

        def sessions_of(application):
            c = d.client()
            c.started(5, 3, {"HostApplicationDisplayID": application})
            c.call(SEND, {"EngineOnTime": 1.5, "vxreporting_timestamp": 1.0, "what": application}, 0x20000001, 6, [5])
            c.call(STOP, 5)
        for application in (secret, other):
            sessions_of(application)
        d.wait_until(lambda: d.rows("SELECT count(*) FROM relay_sessions WHERE ended_at IS NOT NULL") == [(2,)], "both are stored")
        everything = d.rows("SELECT (SELECT count(*) FROM session_messages), (SELECT count(*) FROM analytics_events), (SELECT count(*) FROM haptics_runs)")
        self.assertEqual(len(d.summaries()), 2)

        def where(text):
            return [path for path in pathlib.Path(d.folder, "state").glob("telemetry.db*") if text.encode() in path.read_bytes()]
        self.assertTrue(where(secret))
        self.assertIn("erased: 2 messages", self.vxreport("erase", "--application", secret))
        self.assertEqual(where(secret), [])
        self.assertTrue(where(other))
        self.assertEqual(len(d.summaries()), 1)
        self.assertIn(other, d.summaries()[0])
        self.assertEqual(d.rows("SELECT DISTINCT application FROM sessions UNION SELECT application FROM haptics_runs"), [(other,)])
        self.assertEqual(d.rows("SELECT 2 * (SELECT count(*) FROM session_messages), 2 * (SELECT count(*) FROM haptics_runs)"),
                         [(everything[0][0], everything[0][2])])
        ((cause, rows, detail, meaning),) = d.rows("SELECT cause, rows, detail, meaning FROM losses")
        self.assertEqual((cause, meaning), ("erased", "a person asked to have it removed"))
        self.assertIn("messages 2", detail)
        self.assertNotIn(secret, detail)
        sessions_of(secret)  # the store goes on
        d.wait_until(lambda: d.rows("SELECT count(*) FROM sessions WHERE ended IS NOT NULL") == [(2,)], "the next is stored")

        def refused_beside_a_reader(*words):
            with contextlib.closing(sqlite3.connect(d.database)) as reader:
                reader.execute("BEGIN")
                reader.execute("SELECT count(*) FROM relay_messages").fetchall()
                self.assertIn("somebody reads the store", self.vxreport("erase", *words, status=1))
        refused_beside_a_reader("--application", secret)
        self.assertEqual(len(d.summaries()), 1)
        self.vxreport("erase", "--application", secret)
        self.assertEqual(where(secret), [])
        self.assertIn("erased: 0 messages", self.vxreport("erase", "--before", "1d"))
        self.assertEqual(self.inspector(d).call(ERASE, {"user": -1})["error"][:16], "erase takes one ")
        self.assertEqual(d.stop(), 0)
        refused_beside_a_reader("--user", str(os.getuid()))  # nobody serves
        self.assertIn("erased: 0 messages", self.vxreport("erase", "--user", str(os.getuid())))
        self.assertEqual(where(other), [])
        self.assertEqual(d.rows("SELECT (SELECT count(*) FROM relay_messages) + (SELECT count(*) FROM power_records) + "
                                "(SELECT count(*) FROM relay_sessions)"), [(0,)])
        self.assertEqual(d.summaries(), [])
        d.start()
        d.client().session(1)
        self.assertEqual(d.stop(), 0)
        self.assertEqual(d.rows("SELECT count(*) FROM sessions"), [(1,)])
