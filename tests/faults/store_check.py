"""What the store holds, against what the clients were answered."""
import collections
import glob
import json
import sqlite3
import time

from service import Outcome, PATIENCE
from traffic import ALARMS, KINDS, NAMES, NEVER, POWER, STATISTICS, SUMMARY, payload


def text_of(value):
    """As a summary has it."""
    return str(int(value)) if isinstance(value, bool) else str(value)


def stopped(traffic, name):
    """Stops the daemon, which must end well, and checks its store."""
    status = traffic.service.stop()
    traffic.process_ended("service_stopped")
    check = Check(traffic, name)
    check.found("bad_status", status, status != 0)
    check.found("store_moved", "a healthy store was moved aside", len(traffic.service.stores_aside()))
    return check


class Check(Outcome):
    """patient: a standalone may still wait for its delay."""
    LOSSES = ("missing", "no_end", "files_missing", "summaries_differ", "wrong_end")

    def __init__(self, traffic, name="", patient=False):
        super().__init__(name)
        self.t, self.patient = traffic, patient
        self.figures.update(dict.fromkeys(("answered", "stored", "twice", "disorder", "unexpected", "corrupt", *self.LOSSES), 0))
        try:
            self.read()
        except (sqlite3.Error, TypeError, ValueError) as e:
            self.found("corrupt", repr(e))
        else:
            self.compare()
        self.t = self.database = None

    def lacks(self):
        return sum(self.figures[k] for k in ("missing", "no_end", "corrupt"))

    def forgive(self, *others):
        """What was lost with a word."""
        for figure in (*self.LOSSES, *others):
            self.figures[figure] = 0
            self.findings.pop(figure, None)

    def rows(self, query):
        return self.database.execute(query).fetchall()

    def read(self):
        f = self.t.service.database
        self.database = sqlite3.connect(f"file:{f}?mode=ro", uri=True, timeout=PATIENCE)
        self.runs, self.alone = collections.defaultdict(list), set()  # rows of sessions by application; of standalones
        sessions = self.rows("SELECT id, session_id, user_info, ended_how FROM relay_sessions ORDER BY id")
        for row, number, information, ended in sessions:
            if number == -1:
                self.alone.add(row)
            else:
                self.runs[json.loads(information).get("HostApplicationDisplayID")].append((row, ended))
        self.relayed = collections.defaultdict(list)  # by message: rows of relay_sessions
        self.of_run = collections.defaultdict(list)   # by row of relay_sessions: (category, payload)
        for run, category, text in self.rows("SELECT relay_session, category, payload FROM relay_messages ORDER BY id"):
            body = json.loads(text)
            self.of_run[run].append((category, body))
            if category not in (STATISTICS, SUMMARY):
                self.relayed[body.get("n")].append((run, body))
        self.events = collections.defaultdict(list)
        self.statistics = collections.Counter()
        uptimes = 0
        for name, text in self.rows("SELECT name, payload FROM analytics_events"):
            body = json.loads(text)
            uptimes += name.endswith("vxreportingclientuptime")
            self.statistics[body.get("HostApplicationDisplayID")] += name.endswith("ChannelReporting.Generic")
            if "n" in body:
                self.events[body["n"]].append(body)
        self.found("twice", "uptimes", uptimes - self.t.connections)
        records = self.rows("SELECT record FROM power_records")
        self.power = collections.Counter(json.loads(text)["EngineOnDuration"] for (text,) in records)
        for (result,) in self.rows("PRAGMA integrity_check(3)"):
            self.found("corrupt", result, result != "ok")
        self.database.close()

    def compare(self):
        for start in self.t.starts:
            index = start.session.starts.index(start)
            runs = self.runs[start.session.app]
            start.row, start.ended = runs[index] if index < len(runs) else (None, None)
            if start.row is None and start.known < NEVER:
                self.found("missing", f"the row of session {start.session.app}")
        for app, runs in self.runs.items():
            relayed = sum(category == STATISTICS for row, _ in runs for category, _ in self.of_run[row])
            starts = self.t.apps[app].starts if app in self.t.apps else []
            self.count(f"statistics events of {app}", self.statistics[app], relayed, sum(s.statistics[1] for s in starts))
            self.found("twice", f"sessions of {app}", len(runs) - len(starts))
        for row in self.alone:
            self.count(f"messages of standalone {row}", len(self.of_run[row]), 1, 1)
        for m in self.t.messages.values():
            self.message(m)
        for start in self.t.starts:
            if start.row is not None:
                self.session(start)

    # Rows of a message: one relayed and one event for each session that it reached, power records.
    def message(self, m):
        relayed, events, power = self.relayed[m.n], self.events[m.n], self.power[m.n]
        any_row = bool(relayed or events or power)
        answered = m.answered < NEVER and not m.refused
        self.figures["answered"] += answered
        if m.refused or not (answered or any_row):
            self.found("unexpected", f"{m}, which was refused", any_row)
            return
        by = min(m.answered, self.t.round_ends[m.round])
        sent = payload(m.n, m.kind, m.size)
        wanted = {k.replace(" ", "_"): v for k, v in sent.items()}
        self.found("unexpected", f"another text of {m}", sum(body != wanted for _, body in relayed) + sum(
            body != dict(sent, HostApplicationDisplayID=body.get("HostApplicationDisplayID")) for body in events))
        rows = collections.Counter(run if run not in self.alone else -1 for run, _ in relayed)
        apps = collections.Counter(body.get("HostApplicationDisplayID") for body in events)
        if m.targets is None:
            least, most = self.broadcast(m, by, rows)
            self.count(f"events of {m}", sum(apps.values()), 0 if -1 in rows else least, most)
        else:
            self.listed(m, rows, apps)
            least = most = len(m.targets)
        if KINDS[m.kind][1] == POWER:
            self.count(f"power record of {m}", power, least, most)
        elif power:
            self.found("unexpected", f"power record of {m}")

    def count(self, what, there, least, most):
        self.figures["stored"] += min(there, most)
        self.found("missing", what, least - there)
        self.found("twice", what, there - most)

    def listed(self, m, rows, apps):
        alone = late = 0
        for s, start in m.targets:
            self.count(f"event of {m}", apps.pop(s.app, 0), 1, 1)
            if start is not None:  # without a row it was found missing, or its start did not count
                self.count(f"relayed row of {m}", rows.pop(start.row, 0) if start.row else 0, 1, 1)
            else:
                alone += 1
                late += self.patient and s.type == ALARMS and time.monotonic() < m.due
        self.count(f"standalone row of {m}", rows.pop(-1, 0), alone - late, alone)
        self.found("unexpected", f"rows {dict(rows + apps)} of {m}", sum((rows + apps).values()))

    def broadcast(self, m, by, rows):
        may = [s for s in self.t.starts if s.round == m.round and s.posted < by and s.end_known > m.posted]
        must = {s for s in may if s.known < m.posted and s.end_posted > by}
        reached = 0
        for start in may:
            there = rows.pop(start.row, 0) if start.row else 0
            reached += there > 0
            self.count(f"row in {start.session.app} of {m}", there, start in must, 1)
        self.count(f"standalone row of {m}", rows.get(-1, 0), not reached and not must, not reached)
        self.found("unexpected", f"rows {dict(rows)} of {m}", sum(rows.values()) - rows.get(-1, 0))
        return max(reached, 1), max(len(may), 1)

    # A session: the order of its messages, its end, its summary and its file.
    def session(self, start):
        app, rows = start.session.app, self.of_run[start.row]
        last, latest = collections.Counter(), 0
        for category, body in rows:
            m = self.t.messages.get(body.get("n"))
            if m is None or category == SUMMARY:
                continue
            if m.n <= last[m.peer] or m.answered < latest:
                self.found("disorder", f"message {m.n} in {app}")
            last[m.peer], latest = m.n, max(latest, m.posted)
        statistics = sum(category == STATISTICS for category, _ in rows)
        self.count(f"statistics in {app}", statistics, *start.statistics)
        if start.how is None:
            return
        summaries = [i for i, (category, _) in enumerate(rows) if category == SUMMARY]
        if start.ended not in start.how:
            self.found("wrong_end", f"{app}: {start.ended}, not {start.how}")
        if not rows:
            return
        self.found("twice", f"summary of {app}", len(summaries) - 1)
        if summaries[-1:] != [len(rows) - 1]:
            self.found("no_end", f"{app} of {len(rows)} messages, {start.how}")
            return
        groups = {"VX_Session_Summary_Event": [str(start.session.type)]}
        for _, body in rows[:-1]:
            for key, value in body.items():
                groups.setdefault(key, []).append(text_of(value))
        if rows[-1][1] != {key: ",".join(values) for key, values in groups.items()}:
            self.found("summaries_differ", app)
        self.file(start, [body for _, body in rows])

    def file(self, start, bodies):
        """Another start's file of the same second replaces one: then any of them will do."""
        folder = self.t.service.folder + "/log/Audio/Reporting"
        files = glob.glob(f"{folder}/*-sonik-{start.session.app}-{NAMES[start.session.type]}.json")
        self.found("twice", f"files of {start.session.app}", len(files) - len(start.session.starts))
        for path in files:
            with open(path) as f:
                header, *elements = json.load(f)
            last = {}
            for key, number in (name.rsplit("_", 1) for e in elements for name in e):
                self.found("disorder", f"{key}_{number} in {path}", last.get(key, int(number) - 1) != int(number) - 1)
                last[key] = int(number)
            if [body for e in elements for body in e.values()] == bodies:
                if header.get("HostApplicationDisplayID") != start.session.app:
                    self.found("summaries_differ", path)
                return
        if len(start.session.starts) == 1 or not files:
            self.found("files_missing", start.session.app)
