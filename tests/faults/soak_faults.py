"""Clients that come and go for long: each message is stored once, nobody waits, and nothing grows."""
import contextlib
import os
import time

from fair_faults import descriptors, figures, load, memory
from service import Outcome, Service

PER_SECOND = 20_000
MOST_P99_MS = 5
GROWN_MIB = 8  # between the first and the last quarter
SEND, SUMMARY = 3, 65535  # categories
# As it is delivered: only the oldest rows go, long after they were counted.
CONFIGURATION = "[device]\ninternal_build = true\n[store]\ncommit_interval_ms = 5000\n[log]\ndestination = \"stderr\"\nlevel = \"info\"\n"


class Counted:
    """Rows by category, of what has been stored so far."""

    def __init__(self, service):
        self.service, self.last, self.rows = service, 0, {}

    def go_on(self):
        new = self.service.rows("SELECT category, count(*), max(id) FROM relay_messages WHERE id > ? GROUP BY category", self.last)
        for category, count, last in new:
            self.rows[category] = self.rows.get(category, 0) + count
            self.last = max(self.last, last)


def run(options):
    outcome = Outcome("soak")
    seconds = options.seconds or (20 if options.small else 600)
    service = Service(CONFIGURATION)
    try:
        service.start()
        os.chmod(service.folder, 0o755)
        os.chmod(os.environ["VX_FAULTS_FOLDER"], 0o755)
        counted, samples = Counted(service), []
        client = load(None, service, seconds, "soak", PER_SECOND)
        while client.poll() is None:
            time.sleep(1)
            samples.append((memory(service), descriptors(service)))
            counted.go_on()
            for path in service.summaries()[:-16]:  # not those that are being written
                with contextlib.suppress(FileNotFoundError):
                    os.remove(path)
        status, did, text = figures(client, 60)
        outcome.found("client_lost", text, status != 0 or did["refused"] > 0)
        outcome.found("stop", service.life_log()[-500:], service.stop() != 0 or service.rows_lost() != 0)
        counted.go_on()
        outcome.figures["answered"], outcome.figures["stored"] = did["sends"], counted.rows.get(SEND, 0)
        for category, wanted in ((SEND, did["sends"]), (SUMMARY, did["sessions"])):
            rows = counted.rows.get(category, 0)
            outcome.found("rows_missing", f"{rows} of {wanted}, category {category}", wanted - rows)
            outcome.found("rows_twice", f"{rows} of {wanted}, category {category}", rows - wanted)
        quarter = max(1, len(samples) // 4)
        of = [[max(s[i] for s in part) for i in (0, 1)] for part in (samples[quarter:2 * quarter], samples[-quarter:])]
        grown = (of[1][0] - of[0][0]) / 1024
        print(f"  {did['answers'] / seconds:.0f} answers/s, {did['sessions']} sessions; p50 {did['p50_us'] / 1000:.2f} ms, p99"
              f" {did['p99_us'] / 1000:.2f} ms, most {did['max_us'] / 1000:.1f} ms; memory {of[0][0] / 1024:.1f} MiB in the second quarter,"
              f" {of[1][0] / 1024:.1f} in the last; descriptors {of[0][1]}, {of[1][1]}", flush=True)
        if seconds >= 60:  # a short one is over before it has what it needs, and may share the machine
            outcome.found("held_up", f"p99 {did['p99_us']} us", did["p99_us"] > 1000 * MOST_P99_MS)
            outcome.found("memory_grown", f"{grown:.1f} MiB", grown > GROWN_MIB)
            outcome.found("descriptors_grown", str(of), of[1][1] - of[0][1] > 4)
    finally:
        service.clean_up()
    return outcome
