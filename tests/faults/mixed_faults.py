"""Every kind of client at once, and SIGTERM while they go on: for a daemon built with a sanitizer, which says on its way what
it saw; any daemon must end as if nothing were."""
import os
import subprocess
import time

from service import Outcome, Service

LOAD = os.path.join(os.environ["VX_IO_SHIM"].rpartition("/")[0], "vx_load")
LOADS = (("mixed", 8), ("sessions", 64), ("reporters", 4), ("hostile", 1 << 30), ("probe", 1))


def run(options):
    outcome, service, seconds = Outcome("mixed"), Service(), 5 if options.small else 20
    loads = []
    try:
        service.start()
        loads += [subprocess.Popen([LOAD, service.socket_path, str(seconds + 60), kind, str(count)], stdout=subprocess.DEVNULL,
                                   stderr=subprocess.DEVNULL) for kind, count in LOADS]
        time.sleep(seconds)
        outcome.found("ended", service.life_log()[-2000:], service.process.poll() is not None)
        outcome.figures["answered"] = service.counter("calls")
        outcome.found("left", "a load has ended before the service", sum(load.poll() is not None for load in loads))
        outcome.found("stop", service.life_log()[-2000:], service.stop() != 0)
    finally:
        for load in loads:
            load.kill()
            load.wait()
        service.clean_up()
    return outcome
