"""The daemon under a fault: its folders outlive it, READY is waited for, and the I/O shim may be loaded into it."""
import collections
import concurrent.futures
import glob
import os
import pathlib
import re
import select
import signal
import socket
import subprocess
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
    """One set of folders and the daemons that use them one after the other."""

    def __init__(self, configuration=CONFIGURATION):
        folder = tempfile.mkdtemp(dir=os.environ["VX_FAULTS_FOLDER"])
        self.notify = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        self.notify.bind(folder + "/notify")
        self.slowest_start, self.folder, self.told = 0, folder, ""
        super().__init__(configuration, folder=folder, environment={"NOTIFY_SOCKET": folder + "/notify"}, wait=False)
        self.replace_file("drivers/Speaker/underruns", "0")

    def start(self, wait=True, **shim):
        if wait:  # __init__ does not start one
            self.launch(**shim)
            assert self.is_ready(), f"the daemon ended with {self.process.returncode}:\n{self.life_log()[-2000:]}"

    def launch(self, **shim):
        """Keys of shim: match, fault, sync_ms, ... as io_shim.cpp reads them."""
        variables = {"VX_SHIM_" + k.upper(): str(v) for k, v in shim.items()}
        if shim:
            variables = {"VX_SHIM_MATCH": self.folder + "/state/", "LD_PRELOAD": os.environ["VX_IO_SHIM"], **variables}
        while self.listen(0):
            pass
        self.told = ""
        with open(self.log_path, "ab") as log:
            self.log_before = log.tell()
            self.process = subprocess.Popen([self.program], env=dict(self.environment, **variables), stderr=log,
                                            stdin=subprocess.DEVNULL)
        self.started_at = time.monotonic()

    def listen(self, seconds):
        there = select.select([self.notify], [], [], seconds)[0]
        if there:
            self.told += self.notify.recv(4096).decode() + "\n"  # to the service manager
        return bool(there)

    def is_ready(self):
        """Waits until the process is ready (True) or has ended."""
        while "READY=1" not in self.told and self.process.poll() is None:
            assert time.monotonic() < self.started_at + PATIENCE, "it does not become ready:\n" + self.life_log()[-2000:]
            self.listen(0.005)
        if ready := "READY=1" in self.told:
            self.slowest_start = max(self.slowest_start, time.monotonic() - self.started_at)
        return ready

    def kill(self):
        self.process.kill()
        self.process.wait()

    def stop(self, patience=PATIENCE):
        """Ends the daemon in order; its exit status, -9 when it had to be killed."""
        self.process.send_signal(signal.SIGTERM)
        began = time.monotonic()
        while self.process.poll() is None:
            self.listen(0.01)
            if time.monotonic() > began + patience:
                self.kill()
        self.stopped_in = time.monotonic() - began
        return self.process.returncode

    def life_log(self):
        """What the last process logged."""
        return pathlib.Path(self.log_path).read_bytes()[self.log_before:].decode(errors="replace")

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

    def replace_file(self, path, text):
        path = f"{self.folder}/{path}"
        os.makedirs(os.path.dirname(path), exist_ok=True)
        pathlib.Path(self.folder + "/.new").write_text(text)
        os.rename(self.folder + "/.new", path)

    def clean_up(self):
        self.notify.close()
        if hasattr(self, "process"):
            super().clean_up()
