# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The system calls of a process, by strace."""
import pathlib
import re
import signal
import subprocess

from harness import eventually


def traced(case, pid, work, *options):
    """What strace writes of the process while work() runs, from one wait to the next."""
    output = pathlib.Path("/tmp/trace")
    tracer = subprocess.Popen(["strace", "-f", "-p", str(pid), "-o", str(output), *options], stderr=subprocess.PIPE)
    case.assertIn(b"attached", tracer.stderr.readline())
    work()
    # The reply is seen before the tracer has written what comes after it.
    eventually(lambda: re.search(rb"epoll_wait\([^\n]*\Z", output.read_bytes().rstrip()), what="the next wait")
    tracer.send_signal(signal.SIGINT)
    tracer.communicate(timeout=10)
    return output.read_text()
