"""Failing surroundings: the other clients notice nothing, and nothing accepted is lost."""
import glob
import re
import resource

from harness import *


class Faults(DaemonTest):
    @unittest.skipIf("ASAN_OPTIONS" in os.environ, "UBSan asks through a pipe whether an object can be read")
    def test_descriptor_exhaustion(self):
        d = self.daemon("[relay]\nbackends = []\ntypo = 1\n",
                        preexec=lambda: resource.setrlimit(resource.RLIMIT_NOFILE, (48, 48)))
        first = d.client()
        first.started(5)
        d.wait_until(lambda: "No backends found" in d.log() and "relay.typo: unknown" in d.log(), "the relay is looked for")
        crowd, refused = [], 0
        for _ in range(80):
            crowd.append(c := d.client(hello=False))
            with contextlib.suppress(BrokenPipeError):  # turned away already; the reason is there to read all the same
                c.raw(frame(HELLO, 1))
            f = c.next_frame()
            refused += f is not None and f[0] == ERROR and f[2] == 6
        self.assertGreater(refused, 20)
        self.assertIsNone(first.call(SEND, {"a": 1}, 3, 1, [5]))
        for c in crowd:
            c.close()
        d.wait_until(lambda: d.log().count("removing") >= len(crowd) - refused, "the crowd has gone")
        d.process.send_signal(signal.SIGUSR1)
        d.wait_until(lambda: f" refused_connections={refused} " in d.log(), "the service accounts for itself")
        self.assert_unharmed(d)

    @unittest.skipUnless(os.geteuid() == 0, "needs a second user")
    def test_whose_messages_wait_behind_a_set_up_waits_alone_and_goes_on(self):
        d = self.daemon("[relay]\nbackends = []\n[memory]\nmax_user_waiting_bytes = 65536\n")  # set-ups take 9 s
        os.chmod(d.folder, 0o755)
        flood = d.client()
        flood.started(1)
        began = time.monotonic()
        posts = 0
        flood.socket.settimeout(0.5)
        with contextlib.suppress(TimeoutError):
            while time.monotonic() < began + 5:
                flood.raw(frame(CALL, 1000 + posts, SEND, {"text": "x" * 1000}, 3, 1, [1]))
                posts += 1
        self.assertLess(time.monotonic(), began + 5, "the flood is held up")
        os.seteuid(65534)
        try:
            other = d.client()
        finally:
            os.seteuid(0)
        self.assertIs(other.call(CREATE, 2), True)
        self.assertLess(time.monotonic(), began + 7, "the other user is not")
        flood.socket.settimeout(PATIENCE)
        flood.answer(1000 + posts - 1)
        self.assertGreater(time.monotonic(), began + 8)

    @unittest.skipUnless(os.geteuid() == 0, "needs a second user")
    def test_who_holds_too_much_is_refused_and_left_out_of_summaries_and_of_the_same_ones_after_a_crash(self):
        def send(client, numbers, *ids, size=15000):
            for n in numbers:
                client.call(SEND, {"n": n, "text": f"{n:03}" * (size // 3)}, 3, 1, ids)

        summaries = []
        for crash in (False, True):
            d = self.daemon("[memory]\nmax_user_bytes = 100000\n")
            os.chmod(d.folder, 0o755)
            c = d.client()
            for id_ in (1, 2):
                c.started(id_, 2)
            send(c, range(10), 1)
            send(c, range(10, 15), 1, 2)
            for call in ((CREATE, 3), (CONFIGURE, {"a": 1}, 2)):
                self.assertEqual(c.answer(c.post(*call))[2], 9)
            os.seteuid(65534)
            try:
                other = d.client()
            finally:
                os.seteuid(0)
            other.started(5, 2, {"a": 1})
            send(other, range(15, 17), 5, 2, size=300)
            c.call(STOP, 1)
            d.wait_until(lambda: c.answer(c.post(CREATE, 3))[0] == REPLY, "there is space again")
            send(c, range(17, 20), 2)
            if crash:
                d.kill()
                d.start()
            else:
                c.call(STOP, 2)
                other.call(STOP, 5)
            self.assertEqual(d.stop(), 0)
            self.assertEqual(d.rows("SELECT count(*) FROM relay_messages WHERE category = 3"), [(27,)])
            summaries.append({session: payload for session, payload in d.rows(
                "SELECT session_id, json_extract(payload, '$.n') FROM relay_messages JOIN relay_sessions s"
                " ON s.id = relay_session WHERE category = 65535")})
            left_out = d.rows("SELECT detail, rows FROM store_ledger WHERE event = 'aggregate_left_out' AND rows > 0")
            self.assertEqual(len(left_out), 2)
        self.assertEqual(summaries[0], summaries[1])
        self.assertEqual(summaries[0][5], "15,16")
        self.assertEqual(summaries[0][2], "15,16,17,18,19")
        self.assertNotIn("9", summaries[0][1])

    def test_without_memory_calls_end_and_not_the_service(self):
        d = self.daemon()
        c = d.client()
        c.started(1, 2)
        with open(f"/proc/{d.process.pid}/status") as status:
            size = int(re.search(r"VmSize:\s+(\d+)", status.read()).group(1)) << 10
        if size > 1 << 40:
            self.skipTest("a sanitizer has all the addresses there are")
        resource.prlimit(d.process.pid, resource.RLIMIT_AS, (size + (8 << 20), resource.RLIM_INFINITY))
        errors = set()
        with contextlib.suppress(OSError):  # the connection may end
            for n in range(400):
                f = c.answer(c.post(SEND, {"n": n, "text": f"{n:05}" * 40000}, 3, 1, [1]))
                errors.update(f[2:3] if f[0] == ERROR else ())
        errors.update(f[2] for f in c.answers.get(None, ()))
        resource.prlimit(d.process.pid, resource.RLIMIT_AS, (resource.RLIM_INFINITY, resource.RLIM_INFINITY))
        self.assertTrue(errors and errors <= {8, 9}, errors)
        self.assert_unharmed(d)
        d.client().session(2)
        self.assertEqual(d.stop(), 0)

    def test_what_is_in_use_or_unusable_is_named(self):
        d = self.daemon()
        free = {"RUNTIME_DIRECTORY": d.folder + "/log"}
        for changed, said in (({}, "another .*RUNTIME_"), (free, "another .*STATE_"),
                              ({"RUNTIME_DIRECTORY": d.log_path}, "service.lock: Not a directory")):
            second = subprocess.run([DAEMON], env=dict(d.environment, **changed), stderr=subprocess.PIPE, text=True,
                                    timeout=PATIENCE)
            self.assertEqual(second.returncode, 1)
            self.assertRegex(second.stderr, r"^<3>vxreportingd: .*" + said)
        self.assert_unharmed(d)

    def test_unusable_state_directory_is_named_and_rows_wait_for_it(self):
        d = self.daemon()
        d.stop()
        path = d.folder + "/file"
        open(path, "w").close()
        d.environment["STATE_DIRECTORY"] = path + "/x"
        d.start()
        d.client().session(1)
        d.wait_until(lambda: path + "/x: Not a directory (set STATE_DIRECTORY" in d.log(), "the folder is named")
        os.unlink(path)
        os.mkdir(path)
        d.database = path + "/x/telemetry.db"
        d.wait_until(lambda: os.path.exists(d.database) and "written again" in d.log(), "the rows are written")
        self.assertEqual(d.rows("SELECT category FROM relay_messages ORDER BY id"), [(3,), (0xFFFF,)])

    def test_what_is_delayed_goes_out_with_a_stop_that_is_asked_for_twice(self):
        d = self.daemon()
        c = d.client()
        c.call(CREATE, 1)
        c.call(SET_TYPE, 4, 1)
        for _ in range(20):  # each up to a minute, to a session that is not started
            c.call(SEND, {"a": 1}, 3, 1, [1])
        d.process.send_signal(signal.SIGTERM)
        self.assertEqual(d.stop(), 0)
        self.assertEqual(d.rows("SELECT count(*) FROM relay_messages"), [(20,)])
        self.assertEqual(glob.glob(d.folder + "/*/journal/*"), [])

    def test_killed_and_started_again(self):
        d = self.daemon()
        began = time.time()
        self.assertEqual(os.stat(d.socket_path).st_mode & 0o777, 0o666)
        d.client().session(1)
        d.wait_for_messages(2)
        d.kill()
        # What is recorded runs again elsewhere too, although all of it is done, at its own time.
        replay = [os.environ["VXREPLAY"], "--journal", d.folder + "/run/journal", "--into", d.folder + "/again"]
        self.assertEqual(subprocess.run(replay, stderr=subprocess.PIPE, timeout=PATIENCE).returncode, 0)
        self.assertEqual(subprocess.run(replay, stderr=subprocess.PIPE, timeout=PATIENCE).returncode, 1)  # it is there now
        query = "SELECT category, payload, time FROM relay_messages ORDER BY id"
        with contextlib.closing(sqlite3.connect(d.folder + "/again/state/telemetry.db")) as again:
            for first, second in zip(d.rows(query), again.execute(query).fetchall(), strict=True):
                self.assertEqual(first[:2], second[:2])
                self.assertTrue(began <= second[2] <= first[2])
        d.start()
        d.client().session(1)
        self.assertEqual(d.stop(), 0)
        self.assertEqual(d.rows("SELECT count(*), uid FROM relay_messages WHERE category = 3"), [(2, os.getuid())])

    def test_socket_activation_and_readiness(self):
        folder = tempfile.mkdtemp(prefix="vx")
        os.makedirs(folder + "/run")
        with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as listener:
            listener.bind(folder + "/run/service.socket")
            listener.listen(16)
            # LISTEN_PID must be the daemon's own: a shell sets it and becomes the daemon.
            wrapper = folder + "/activate"
            pathlib.Path(wrapper).write_text(f'#!/bin/sh\nLISTEN_PID=$$ LISTEN_FDS=1 exec "{DAEMON}"\n')
            os.chmod(wrapper, 0o755)
            d = self.daemon(folder=folder, program=wrapper, environment={"WATCHDOG_USEC": "600000000"},
                            preexec=lambda: (os.dup2(listener.fileno(), 3), os.set_inheritable(3, True)))
            self.assert_unharmed(d)
            self.assertEqual(d.stop(), 0)
            self.assertRegex(d.told, "(?s)READY=1.*WATCHDOG=1.*STOPPING=1")
        self.assertTrue(os.path.exists(folder + "/run/service.socket"))  # the service manager's to remove
