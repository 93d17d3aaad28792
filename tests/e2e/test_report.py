"""What people learn from a store: the questions of docs/store.md, and the commands of vxreport that read it."""
import csv
import datetime
import io
import json
import math
import random
import re
import shutil

from browser import Browser
from harness import *

VXREPORT = os.environ["VXREPORT"]
csv.field_size_limit(1 << 24)
HOSTILE = "</script><script>document.title='taken'</script><!--\u202edesrever\u2028\"'&"
with open(os.path.join(os.path.dirname(__file__), "../../docs/store.md")) as f:
    QUESTIONS = re.findall(r"^([^\n]+):\n\n```sql\n(.*?)```", f.read(), re.M | re.S)


def answer_of(question, store):
    (sql,) = [sql for text, sql in QUESTIONS if question in text]
    with contextlib.closing(sqlite3.connect(f"file:{store}?mode=ro", uri=True)) as connection:
        connection.row_factory = sqlite3.Row
        return [dict(row) for row in connection.execute(sql)]


def vxreport(*words, stdin="", **options):
    return subprocess.run([VXREPORT, *words], input=stdin, capture_output=True, text=True, timeout=PATIENCE, **options)


class ReportTest(unittest.TestCase):
    """One store, made by real clients; `sent` has what they sent into each session."""

    @classmethod
    def setUpClass(cls):
        cls.daemon = d = Daemon(config='[store]\nmax_bytes = "8MiB"\n')
        cls.addClassCleanup(d.clean_up)
        counter = f"{d.folder}/drivers/Speaker/overcurrent_events"
        os.makedirs(os.path.dirname(counter))
        pathlib.Path(counter).write_text("5")
        d.start()
        cls.sent = {}
        chance = random.Random(7)
        calls = [[{"sample rate": rate, "codec": "aac"}] + [{"jitter_ms": chance.randrange(400) / 8} for _ in range(37)]
                 for rate in (96000, 624000, 96000)]
        sessions = [(2001, 2, "com.example.phone", calls[0], 8), (2001, 2, "com.example.phone", calls[1], 11),
                    (2002, 2, "com.example.other", calls[2], 12),
                    (3001, 3, "com.example.keys", [{"EngineOnTime": 0.25 * i, "vxreporting_timestamp": 1.0} for i in range(4)], 12),
                    # The summary of these is larger than a row may be.
                    (9, 7, HOSTILE, [{HOSTILE: HOSTILE, "k" * 900000: 1, "__proto__": 2**60}] + [{"v": "v" * 900000, "n": i} for i in range(3)], 12)]
        for place, (reporter, service_type, application, messages, counted) in enumerate(sessions, 1):
            c = d.client()
            start = c.started(reporter, service_type, {"HostApplicationDisplayID": application})
            for message in messages:
                c.call(SEND, message, 0x2000000A if service_type != 3 else 0x20000001, 6 if service_type == 3 else 0, [reporter])
            pathlib.Path(counter + ".new").write_text(str(counted))
            os.rename(counter + ".new", counter)
            c.call(STOP, reporter)
            assert c.answer(start)[2] is True
            c.raw(frame(GOODBYE))
            c.until_closed()
            d.wait_until(lambda: d.rows("SELECT count(ended_at) FROM relay_sessions") == [(place,)], "its rows are stored")
            cls.sent[place] = [{key.replace(" ", "_"): value for key, value in m.items()} for m in messages]
        last = d.client()
        last.call(SEND, {"boot": True}, 3, 1, None)  # goes out alone
        last.close()
        assert d.stop() == 0
        cls.store = d.database

    def test_each_question_has_the_answer_that_the_clients_know(self):
        answer = lambda question: answer_of(question, self.store)
        messages = {}
        for row in answer("Messages per application"):
            self.assertRegex(row["hour_utc"], datetime.datetime.now(datetime.timezone.utc).strftime(r"^%Y-%m-\d\d \d\d:00$"))
            messages[row["application"]] = messages.get(row["application"], 0) + row["messages"]
        # With what the drivers counted, where they did.
        self.assertEqual(messages, {"com.example.phone": 2 * 39, "com.example.other": 39, "com.example.keys": 4, HOSTILE: 4, "Unknown": 1})
        uptimes = [json.loads(text)["seconds"] for (text,) in self.daemon.rows(
            "SELECT payload FROM analytics_entries WHERE payload LIKE '%processName%'")]
        self.assertEqual(len(uptimes), 6)
        self.assertEqual([row["seconds"] for row in answer("longest uptime")], [max(uptimes)])
        (grown,) = answer("counter grew most")
        self.assertEqual((grown["relay_session"], grown["session_id"], grown["application"], grown["growth"]),
                         (1, 2001, "com.example.phone", 3))
        jitter = sorted(m["jitter_ms"] for place in (1, 2, 3) for m in self.sent[place][1:])
        self.assertEqual([row["value"] for row in answer("95th percentile")], [jitter[math.ceil(0.95 * len(jitter)) - 1]])
        rows = answer("All messages of one session")
        self.assertEqual([json.loads(row["payload"]) for row in rows[:38]], self.sent[2])
        self.assertEqual([row["category"] for row in rows[-2:]], [9, 65535])
        values = {}
        for row in answer("What its summary says"):
            self.assertEqual(row["position"], len(values.setdefault(row["key"], [])) + 1)
            values[row["key"]].append(row["number"] if row["number"] is not None else row["text"])
        self.assertEqual(values, {"VX_Session_Summary_Event": [2], "sample_rate": [624000], "codec": ["aac"],
                                  "jitter_ms": [m["jitter_ms"] for m in self.sent[2][1:]], "Speaker_overcurrent_events": [3]})
        self.assertEqual(answer("largest of a number"), [{"relay_session": 2, "largest": 624000}])
        self.assertEqual([(row["relay_session"], row["ended_how"], row["messages"]) for row in answer("ended today")],
                         [(1, "stopped", 40), (2, "stopped", 40), (3, "stopped", 40), (4, "stopped", 5), (5, "stopped", 5)])
        self.assertEqual(answer("haptics engines ran"), [{"application": "com.example.keys", "seconds": 1.5, "runs": 4}])
        (lost,) = answer("What was lost")
        self.assertEqual((lost["cause"], lost["table_name"], lost["rows"]), ("left_out", "relay_messages", 1))
        self.assertEqual(len(QUESTIONS), 10)

    def test_rows_for_other_programs(self):
        self.assertRegex(vxreport("ledger", "--store", self.store).stdout, r"UTC .*\n.* left_out +relay_messages +1  one payload")
        text = vxreport("export", "--csv", "--store", self.store, "session_messages").stdout
        names, *rows = csv.reader(io.StringIO(text, newline=""))
        self.assertEqual([row[names.index("payload")] for row in rows],
                         [text for (text,) in self.daemon.rows("SELECT payload FROM session_messages ORDER BY id")])
        lines = vxreport("export", "--jsonl", "--name", "*.HAL_Performance.*", "--store", self.store).stdout.split("\n")
        events = [json.loads(line) for line in lines[:-1]]
        jitters = [(e["payload"].get("jitter_ms"), e["relay_session"]) for e in events]
        expected = {place: [m["jitter_ms"] for m in self.sent[place][1:]] for place in (1, 2, 3)}
        self.assertEqual(sorted(value for value, _ in jitters if value is not None), sorted(sum(expected.values(), [])))
        self.assertTrue(all(value in expected[place] for value, place in jitters if value is not None and place))
        self.assertEqual(sum("sample rate" in e["payload"] for e in events), 3)
        self.assertEqual(vxreport("export", "--jsonl", "--since", "2100-01-01", "--store", self.store).stdout, "")
        trace = json.loads(vxreport("timeline", "2001", "-o", "-", "--store", self.store).stdout)
        counters = [e["args"]["value"] for e in trace["traceEvents"] if e["ph"] == "C" and e["name"] == "jitter_ms"]
        self.assertEqual(counters, [m["jitter_ms"] for m in self.sent[2][1:]])
        (whole,) = [e for e in trace["traceEvents"] if e["ph"] == "X"]
        self.assertAlmostEqual(whole["dur"] / 1e6, self.daemon.rows("SELECT seconds FROM sessions WHERE relay_session = 2")[0][0], 5)
        self.assertTrue(all(0 <= e["ts"] <= whole["dur"] + 1 for e in trace["traceEvents"] if e["ph"] in "iC"))
        self.assertEqual(trace["otherData"]["relay_session"], 2)

    def test_what_becomes_of_a_message(self):
        message = {"EngineOnTime": 0.5, "a b": 1, "a_b": [2, "x"], "_comparison_field_blacklist": ["a b"], "_throttle_seconds": 7}
        said = vxreport("explain", "--type", "6", "--application", "com.example.keys", "-", stdin=json.dumps(message)).stdout
        whole, *fields = [dict(re.findall(r"^  (\w+(?: log)?) +(.*)$", part, re.M)) for part in said.split("\n\n")]
        self.assertEqual(whole["power log"], "Lumo_Haptics {EngineOnDuration=0.5,ApplicationName=com.example.keys}")
        self.assertRegex(whole["throttle"], r"0\.5 s: Rejecting large throttle time")
        engine, blank, listed, *_ = fields
        self.assertEqual((engine["power log"], engine["summary"]), ('yes, as "EngineOnDuration"', '"EngineOnTime" has "0.5"'))
        self.assertEqual([blank[k].split(":")[0].split(",")[0] for k in ("key", "relayed", "event", "power log", "summary", "throttle")],
                         ['"a_b"', "no", "yes", "no", "no", "not compared"])
        self.assertIn('"(2,x)"', listed["summary"])
        for text, fault in (('{"a": null}', "null"), ('{"a": 1, "a": 2}', "twice"), ("[1]", "not a JSON object"), ('{"a":' * 40 + "1" + "}" * 40, "nested")):
            ended = vxreport("explain", "-", stdin=text)
            self.assertEqual((ended.returncode, ended.stderr.count("\n")), (1, 1))
            self.assertIn(fault, ended.stderr)

    def test_what_is_no_store_is_said_in_one_sentence(self):
        folder = tempfile.mkdtemp(prefix="vx")
        self.addCleanup(shutil.rmtree, folder)
        os.chmod(folder, 0o755)
        path = lambda name: f"{folder}/{name}"

        def changed(name, *statements):
            shutil.copy(self.store, path(name))
            with contextlib.closing(sqlite3.connect(path(name), isolation_level=None)) as connection:
                for sql in ("PRAGMA journal_mode = DELETE", *statements):
                    connection.execute(sql)

        changed("newer", "PRAGMA user_version = 5")
        changed("older", "PRAGMA user_version = 3")
        changed("tables", "DROP VIEW losses")
        changed("damaged")
        with open(path("damaged"), "r+b") as f:
            f.seek(3 * 8192)
            f.write(b"\xff" * (os.path.getsize(path("damaged")) - 3 * 8192))
        pathlib.Path(path("foreign")).write_text("x" * 5000)
        os.mkdir(path("folder"))
        for name, said in (("missing", "STATE_DIRECTORY"), ("newer", "newer version of the service (schema 5)"), ("older", "earlier version"),
                           ("tables", "not a store of the service"), ("damaged", "is damaged"), ("foreign", "not a store of the service"),
                           ("folder", "is not a file")):
            for words in (("page", "-o", "-"), ("export", "--csv", "session_messages"), ("timeline", "2001", "-o", "-"), ("ledger",)):
                ended = vxreport(*words, "--store", path(name))
                if name != "damaged" or ended.returncode:  # a command may not come across the damage
                    self.assertEqual((name, ended.returncode, ended.stderr.count("\n")), (name, 1, 1), ended.stderr)
                    self.assertIn(said, ended.stderr)
        self.assertEqual(vxreport("timeline", "77", "-o", "-", "--store", self.store).returncode, 1)
        # Where nothing may be written it is read all the same, and nothing is.
        changed("sealed", "PRAGMA journal_mode = WAL")
        os.chmod(path("sealed"), 0o444)
        before = sorted(os.listdir(folder))
        other = {"user": 65534, "extra_groups": []} if os.geteuid() == 0 else {}
        os.chmod(folder, 0o555)
        ended = vxreport("export", "--jsonl", "--store", path("sealed"), "sessions", **other)
        self.assertEqual((ended.stderr, ended.stdout.count("\n")), ("", 5))
        self.assertEqual(sorted(os.listdir(folder)), before)
        os.chmod(path("sealed"), 0)
        if os.geteuid() == 0:
            self.assertIn("Permission denied", vxreport("ledger", "--store", path("sealed"), **other).stderr)
        os.chmod(folder, 0o755)

    @unittest.skipUnless(shutil.which("chromium"), "needs chromium")
    def test_the_page_draws_asks_for_nothing_and_shows_texts_as_texts(self):
        page = self.daemon.folder + "/report.html"
        ended = vxreport("page", "-o", page, "--store", self.store)
        self.assertEqual((ended.returncode, ended.stderr), (0, ""))
        self.assertLess(os.path.getsize(page), 1 << 20)  # with 3.6 MB of texts in the store
        browser = Browser(PATIENCE)
        self.addCleanup(browser.close)
        ask = browser.evaluate
        backgrounds = set()
        for width, dark in ((1200, False), (1200, True), (390, False)):
            browser.open(page, width=width, dark=dark)
            self.assertEqual(ask("document.documentElement.dataset.drawn"), "yes")
            self.assertLessEqual(ask("document.documentElement.scrollWidth"), width)
            self.assertGreater(ask("""Math.min(...[...document.querySelectorAll("canvas")].map(c =>
                c.getContext("2d").getImageData(0, 0, c.width, c.height).data.reduce((n, v, i) => n + (i % 4 === 3 && v > 0), 0)))"""), 500)
            self.assertGreater(len(browser.picture()), 30000)
            self.assertEqual((browser.said(), browser.asked_for()), ([], []))
            backgrounds.add(ask("getComputedStyle(document.body).backgroundColor"))
        self.assertEqual(len(backgrounds), 2)
        tile = lambda name: ask(f"document.querySelector('[data-tile={name}] b').textContent")
        self.assertEqual([tile(name) for name in ("sessions", "messages", "applications", "haptics", "lost")],
                         ["5", "131", "4", "1.50 s", "1"])
        self.assertEqual(ask("document.title"), "Audio telemetry")
        self.assertEqual(ask("document.scripts.length"), 8)  # the data, five sessions, the library and the page's own
        cells = "[...document.querySelectorAll('td')].filter(c => c.textContent === %s).length"
        self.assertEqual(ask(cells % json.dumps(HOSTILE)), 1)
        # By keyboard from the session that is open to the last one, the hostile one.
        ask("document.querySelector('.track button[tabindex=\"0\"]').focus()")
        for key in ("End", "Enter"):
            for kind in ("keyDown", "keyUp"):
                browser.call("Input.dispatchKeyEvent", type=kind, key=key, code=key, text="\r" if key + kind == "EnterkeyDown" else "",
                             windowsVirtualKeyCode=13 if key == "Enter" else 35)
        self.assertEqual(ask("document.querySelector('#opened dd').textContent"), "9")
        shown = ask("document.querySelector('#opened tbody').innerText") + ask("document.querySelector('#opened').textContent")
        for text in (HOSTILE + " " + HOSTILE, "(900000 characters)", "__proto__ 1152921504606846976"):
            self.assertIn(text, shown)
        self.assertEqual((browser.said(), ask("document.title")), ([], "Audio telemetry"))
        only = vxreport("page", "-o", page, "--store", self.store, "--session", "2001", "--since", "1h")
        self.assertEqual(only.returncode, 0)
        browser.open(page)
        self.assertEqual([tile(name) for name in ("sessions", "messages", "lost")], ["1", "40", "1"])
        self.assertIn("--session 2001", ask("document.querySelector('#about').textContent"))
        empty = vxreport("page", "-o", page, "--store", self.store, "--since", "2100-01-01")
        self.assertEqual(empty.returncode, 0)
        browser.open(page)
        self.assertEqual((browser.said(), ask("document.querySelectorAll('.empty').length")), ([], 5))
