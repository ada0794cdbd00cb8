#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The Python package beside a bare exchange of the same bytes over a socket, from Python, too, with the same daemon.

usage, as root: tests/e2e/sandbox build/release /usr/bin/python3 $PWD/build/release/bench/PythonBenchmark.py [ROUNDS]
Prints the median of the rounds, which are made in turns, and ratios last. Exits with 1 when a limit is passed.
"""
import asyncio
import compileall
import os
import pathlib
import resource
import shutil
import statistics
import subprocess
import sys
import tempfile
import time

# A copy that is compiled, as an installed package is.
FOLDER = tempfile.mkdtemp(prefix="brenvik-python-")
shutil.copytree(pathlib.Path(os.environ["BRENVIK_BUILD"]) / "python", FOLDER, dirs_exist_ok=True)
compileall.compile_dir(FOLDER, quiet=1)
sys.path[:0] = [FOLDER, os.getcwd()]
import harness  # noqa: E402
import wire  # noqa: E402
from brenvik_mobile_helper import AsyncClient, Client  # noqa: E402

CALLS = 2000
AT_ONCE = 1000
MOST_MICROSECONDS = 60  # of a blocking call
MOST_IMPORT = 60  # milliseconds of processor time, the start of Python included


def microseconds(work, count):
    start = time.perf_counter()
    work(count)
    return (time.perf_counter() - start) / count * 1e6


def start_of(code):
    """Milliseconds of processor time: what else the machine does at that moment makes it no longer."""
    before = resource.getrusage(resource.RUSAGE_CHILDREN)
    subprocess.run([sys.executable, "-S", "-c", code], check=True, env={**os.environ, "PYTHONPATH": FOLDER})
    after = resource.getrusage(resource.RUSAGE_CHILDREN)
    return (after.ru_utime + after.ru_stime - before.ru_utime - before.ru_stime) * 1e3


async def in_turn(client):
    for _ in range(AT_ONCE):
        await client.copy_country_code()


async def at_once(client):
    await asyncio.gather(*(client.copy_country_code() for _ in range(AT_ONCE)))


def main():
    rounds = int(sys.argv[1]) if len(sys.argv) > 1 else 15
    harness.entitle()
    daemon = harness.Daemon()
    raw = wire.Client()
    sock, message = raw.channel.sock, wire.simple("CopyCountryCode")
    sock.settimeout(None)

    def bare(count):
        for _ in range(count):
            sock.send(message)
            sock.recv(wire.LARGEST)

    rows = {"bare exchange": [], "blocking call": [], "Python alone, started": [], "import, started": [],
            "asyncio, in turn": [], "asyncio, at once": []}
    # Both ends on one processor, as in the other benchmarks; the daemon has inherited none of it.
    cpu = sorted(os.sched_getaffinity(0))[-1]
    os.sched_setaffinity(0, {cpu})
    os.sched_setaffinity(daemon.pid, {cpu})
    loop = asyncio.new_event_loop()
    with Client() as client:
        asynchronous = AsyncClient()
        loop.run_until_complete(asynchronous.connect())

        def ours(count):
            for _ in range(count):
                client.copy_country_code()

        for _ in range(rounds):
            rows["bare exchange"].append(microseconds(bare, CALLS))
            rows["blocking call"].append(microseconds(ours, CALLS))
            rows["Python alone, started"].append(start_of("pass"))
            rows["import, started"].append(start_of("import brenvik_mobile_helper"))
            for name, work in (("asyncio, in turn", in_turn), ("asyncio, at once", at_once)):
                rows[name].append(microseconds(lambda _: loop.run_until_complete(work(asynchronous)), AT_ONCE))
        asynchronous.close()
    loop.close()
    raw.close()
    daemon.stop()
    shutil.rmtree(FOLDER)

    median = {name: statistics.median(values) for name, values in rows.items()}
    for name, value in median.items():
        print(f"{name:24} {value:8.1f} {'ms' if 'started' in name else 'us'}")
    ratios = (("blocking call to bare exchange", median["blocking call"] / median["bare exchange"]),
              ("1000 at once to in turn", median["asyncio, at once"] / median["asyncio, in turn"]))
    for name, value in ratios:
        print(f"{name:32} {value:6.2f}")
    if median["blocking call"] > MOST_MICROSECONDS or median["import, started"] > MOST_IMPORT:
        sys.exit(f"more than {MOST_MICROSECONDS} us a call, or {MOST_IMPORT} ms to import")


if __name__ == "__main__":
    main()
