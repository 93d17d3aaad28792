"""The daemon under a fault: its folders outlive it, and the I/O shim may be loaded into it."""
import collections
import concurrent.futures
import glob
import os
import re
import signal
import tempfile
import time

from harness import Daemon, PATIENCE

CONFIGURATION = '[device]\ninternal_build = true\n[preferences]\nsettle_ms = 10\n'


class Outcome:
    """Figures, of which all but COUNTS are counts of broken promises, and some findings of each."""
    COUNTS = {"rounds", "answered", "stored", "seen", "slowest_start_s", "slowest_stop_s"}

    def __init__(self, name="", skipped=None):
        self.name, self.skipped = name, skipped
        self.figures, self.findings = collections.Counter(), collections.defaultdict(list)

    def found(self, figure, text, count=1):
        if count > 0:
            self.figures[figure] += count
            self.findings[figure] = [*self.findings[figure], f"{self.name}: {text}"][:3]

    def add(self, other):
        for k, v in other.figures.items():
            self.figures[k] = max(self.figures[k], v) if k.startswith("slowest") else self.figures[k] + v
        for k, texts in other.findings.items():
            self.findings[k] += texts

    def ok(self):
        return not any(v for k, v in self.figures.items() if k not in self.COUNTS)


def spread(function, arguments, options):
    """Calls function(argument), which returns an Outcome, for each, several at once; their sum."""
    outcome = Outcome()
    with concurrent.futures.ProcessPoolExecutor(options.jobs) as pool:
        for argument, future in [(a, pool.submit(function, a)) for a in arguments]:
            try:
                outcome.add(future.result())
            except Exception as e:  # the others go on
                outcome.found("broken", f"{argument}: {e!r}"[:2000])
            outcome.figures["rounds"] += 1
    return outcome


class Service(Daemon):
    def __init__(self, configuration=CONFIGURATION):
        super().__init__(configuration, folder=tempfile.mkdtemp(dir=os.environ["VX_FAULTS_FOLDER"]))
        self.slowest_start = 0
        self.replace_file("drivers/Speaker/underruns", "0")

    def launch(self, **shim):
        """Keys of shim: match, fault, sync_ms, ... as io_shim.cpp reads them."""
        variables = {"VX_SHIM_" + k.upper(): str(v) for k, v in shim.items()}
        if shim:
            variables = {"VX_SHIM_MATCH": self.folder + "/state/", "LD_PRELOAD": os.environ["VX_IO_SHIM"], **variables}
        super().launch(**variables)

    def is_ready(self):
        if ready := super().is_ready():
            self.slowest_start = max(self.slowest_start, time.monotonic() - self.started_at)
        return ready

    def said(self, name):
        """A number, as the last process has logged it last; -1 when it has not."""
        return int(([-1] + re.findall(rf"\b{name}=(\d+)", self.life_log()))[-1])

    def rows_lost(self):
        return self.said("rows_lost")

    def counter(self, name):
        """What the daemon says when it is asked for its counters."""
        lines = self.life_log().count("counters: ")
        self.process.send_signal(signal.SIGUSR1)
        self.wait_until(lambda: self.life_log().count("counters: ") > lines, "it says its counters")
        return self.said(name)

    def ledger(self):
        """Rows: a text and a count."""
        return self.rows("SELECT event || ' ' || ifnull(detail, ''), ifnull(rows, 0) FROM store_ledger")

    def stores_aside(self):
        return [p for p in glob.glob(self.folder + "/state/*") if re.search(r"\.db.*(damaged|aside)", p)]
