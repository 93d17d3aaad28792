#!/usr/bin/env python3
"""Runs the fault programs against a built daemon: ./check --faults, or
   tests/faults/run.py --build build/dev [--small] [--only kill,io] [--rounds N] [--seed S] [--jobs N]
Each prints one line of figures; the last line says how many passed."""
import argparse
import importlib
import os
import random
import shutil
import sys
import tempfile
import time

SCRATCH_BYTES = 2 << 30
PROGRAMS = ("kill", "term", "io", "power", "disk", "journal", "fair", "mixed")
LONG = ("soak",)  # ten minutes by itself: with the others only in small


def main():
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("--build", default="build/dev")
    parser.add_argument("--small", action="store_true", help="three minutes at most instead of twenty")
    parser.add_argument("--only", help=f"programs, with commas between: {', '.join(PROGRAMS + LONG)}")
    parser.add_argument("--seconds", type=int, help="how long soak takes; 600, in small 20")
    parser.add_argument("--rounds", type=int, help="rounds, points or images of each program")
    parser.add_argument("--seed", type=int, default=random.randrange(1 << 30))
    parser.add_argument("--jobs", type=int, default=2 * (os.cpu_count() or 1))
    options = parser.parse_args()
    build, here = os.path.abspath(options.build), os.path.dirname(os.path.abspath(__file__))
    roomy = os.path.isdir("/dev/shm") and shutil.disk_usage("/dev/shm").free > SCRATCH_BYTES
    scratch = tempfile.mkdtemp(prefix="vxfaults", dir="/dev/shm" if roomy else None)
    os.environ.update(VXREPORTINGD=build + "/Statistics/vxreportingd", VX_FAULTS_FOLDER=scratch,
                      VX_IO_SHIM=build + "/tests/faults/libvx_io_shim.so")
    print(f"seed {options.seed}, {options.jobs} at once, in {scratch}", flush=True)
    sys.path[:0] = [here, here + "/../e2e"]
    sys.dont_write_bytecode = True
    passed = failed = 0
    try:
        for name in options.only.split(",") if options.only else PROGRAMS + (LONG if options.small else ()):
            began = time.monotonic()
            outcome = importlib.import_module(name + "_faults").run(options)
            if outcome.skipped:
                print(f"{name}: skipped, {outcome.skipped}", flush=True)
                continue
            for figure, texts in outcome.findings.items():
                for text in texts[:3]:
                    print(f"  {name}: {figure}: {text}")
            figures = " ".join(f"{k}={round(v, 2)}" for k, v in outcome.figures.items())
            word = "passed" if outcome.ok() else "FAILED"
            print(f"{name}: {word} {figures} ({time.monotonic() - began:.0f} s)", flush=True)
            passed, failed = passed + outcome.ok(), failed + (not outcome.ok())
    finally:
        shutil.rmtree(scratch, ignore_errors=True)
    print(f"{passed} passed, {failed} failed")
    return 1 if failed else 0


if __name__ == "__main__":
    sys.exit(main())
