# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Starts the real daemon inside the sandbox and records both of its logs.

Every test runs as root in a machine of its own (see the sandbox script): it may write entitlements, become
another account and stop the daemon it started.
"""
import bisect
import contextlib
import grp
import os
import pathlib
import plistlib
import pwd
import re
import resource
import select
import signal
import socket
import struct
import subprocess
import sys
import threading
import time
import unittest

import wire

BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
DAEMON = BUILD / "BrenvikMobileHelper"
# A sanitizer keeps freed memory for a while, and its own besides: what is measured then is not the daemon's.
SANITIZED = any(name in DAEMON.read_bytes() for name in (b"__asan_init", b"__tsan_init"))
# By how much an emulator makes the daemon slower: limits of time are so much longer.
SLOWNESS = float(os.environ.get("BRENVIK_SLOWNESS", "1"))
SOCKET = pathlib.Path(wire.BOOTSTRAP) / wire.SERVICE
ENTITLEMENTS = pathlib.Path("/etc/brenvik/entitlements.d")
ALLOW = "com.norvale.Teravox.BrenvikHelper.allow"
ERROR, DEFAULT, INFO, DEBUG = 3, 5, 6, 7  # levels of the unified log
LOG_ERR, LOG_NOTICE = 3, 5  # priorities of the BSD log
LOG_DAEMON = 3  # its facility


def entitle(name="50-test.plist", executable=None, user="root", value=True, **more):
    """Writes an entitlement file for an executable (default: this Python)."""
    ENTITLEMENTS.mkdir(parents=True, exist_ok=True)
    content = {"Executable": os.path.realpath(executable or sys.executable), "Entitlements": {ALLOW: value}, **more}
    if user is not None:
        content["User"] = user
    path = ENTITLEMENTS / name
    path.write_bytes(plistlib.dumps(content))
    path.chmod(0o644)
    return path


class Logs:
    """Stands where the journal and syslog stand and keeps each line as (channel, level, text)."""

    JOURNAL = "/run/systemd/journal/socket"
    SYSLOG = "/dev/log"

    def __init__(self):
        self.lines = []
        self.entries = []  # of the journal, as dictionaries
        self.changed = threading.Condition()
        os.makedirs(os.path.dirname(self.JOURNAL), exist_ok=True)
        self.sockets = {}
        for channel, path in (("unified", self.JOURNAL), ("bsd", self.SYSLOG)):
            if os.path.exists(path):
                os.unlink(path)
            sock = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
            sock.bind(path)
            os.chmod(path, 0o666)
            self.sockets[sock] = channel
        self.wake_read, self.wake_write = os.pipe()
        self.thread = threading.Thread(target=self._read, daemon=True)
        self.thread.start()

    def _read(self):
        while True:
            ready, _, _ = select.select([*self.sockets, self.wake_read], [], [])
            if self.wake_read in ready:
                return
            for sock in ready:
                data = sock.recv(1 << 20)
                with self.changed:
                    if self.sockets[sock] == "unified":
                        entry = self._journal(data)
                        self.entries.append(entry)
                        self.lines.append(("unified", int(entry["PRIORITY"]), entry["MESSAGE"]))
                    elif line := re.fullmatch(rb"<(\d+)>.{15} BrenvikMobileHelper: (.*)", data, re.S):
                        facility, level = divmod(int(line[1]), 8)
                        self.lines.append(("bsd" if facility == LOG_DAEMON else f"bsd facility {facility}", level,
                                           line[2].decode()))
                    else:
                        self.lines.append(("bsd, of somebody else", None, data))
                    self.changed.notify_all()

    @staticmethod
    def _journal(data):
        entry = {}
        while data:
            line, _, rest = data.partition(b"\n")
            if b"=" in line:
                key, _, value = line.partition(b"=")
            else:
                key = line
                length, = struct.unpack_from("<Q", rest)
                value, rest = rest[8:8 + length], rest[8 + length + 1:]
            entry[key.decode()] = value.decode()
            data = rest
        return entry

    def wait_for(self, channel, level, text, timeout=10):
        """Waits until the very line has been logged; fails the test when it is not."""
        with self.changed:
            if not self.changed.wait_for(lambda: (channel, level, text) in self.lines, timeout):
                raise AssertionError(f"no {channel}/{level} line {text!r} among {self.lines}")

    def clear(self):
        with self.changed:
            self.lines.clear()
            self.entries.clear()

    def close(self):
        os.write(self.wake_write, b"x")
        self.thread.join()
        os.close(self.wake_read)
        os.close(self.wake_write)
        for sock in self.sockets:
            sock.close()
        os.unlink(self.JOURNAL)
        os.unlink(self.SYSLOG)


class Daemon:
    """The real daemon, standing alone or activated through a listening socket that the test holds."""

    def __init__(self, activated=False, wait=True, arguments=(), environment=None, listening=None, prefix=()):
        environment = {**os.environ, **(environment or {})}
        self.listening = listening
        command = [*prefix, str(DAEMON), *arguments]
        if activated:
            if self.listening is None:
                self.listening = listen()
            descriptor = self.listening.fileno()
            # LISTEN_PID must be the daemon's own, so a shell sets it and becomes the daemon.
            command = ["/bin/sh", "-c", f'exec 3<&{descriptor}; LISTEN_PID=$$ exec "$@"', "sh", *command]
            environment |= {"LISTEN_FDS": "1", "LISTEN_FDNAMES": wire.SERVICE}
        self.process = subprocess.Popen(
            command, env=environment, stderr=subprocess.PIPE, stdin=subprocess.DEVNULL,
            pass_fds=[self.listening.fileno()] if activated else ())
        self.stderr = b""
        self.reader = threading.Thread(target=self._read_stderr, daemon=True)
        self.reader.start()
        if wait and not activated:
            self.wait_until_listening()

    def _read_stderr(self):
        self.stderr = self.process.stderr.read()

    @property
    def pid(self):
        return self.process.pid

    def wait_until_listening(self, timeout=20):
        end = time.monotonic() + timeout
        while time.monotonic() < end:
            if self.process.poll() is not None:
                self.reader.join()
                raise AssertionError(f"the daemon exited with {self.process.returncode}: {self.stderr.decode()}")
            try:
                service = wire.connect()
                peer = service.sock.getsockopt(socket.SOL_SOCKET, socket.SO_PEERCRED, 12)
                service.close()
                # A child that a killed daemon was just making holds that one's socket for a moment longer.
                if struct.unpack("3i", peer)[0] == self.pid:
                    return
            except (FileNotFoundError, ConnectionRefusedError):
                time.sleep(0.01)
        raise AssertionError("the daemon does not listen")

    def wait(self, timeout=30):
        """The exit status."""
        status = self.process.wait(timeout)
        self.reader.join()
        return status

    def stop(self):
        children = self._children()
        if self.process.poll() is None:
            self.process.terminate()
        self.process.wait(20)
        self.reader.join(10)
        if self.reader.is_alive():  # somebody still has its standard error
            for pid in children:
                with contextlib.suppress(ProcessLookupError):
                    os.kill(pid, signal.SIGKILL)
            raise AssertionError(f"processes that the daemon had started outlived it: {children}")
        self.process.stderr.close()
        if self.listening is not None:
            self.listening.close()

    def _children(self):
        paths = pathlib.Path(f"/proc/{self.pid}/task").glob("*/children")
        with contextlib.suppress(FileNotFoundError, ProcessLookupError):
            return [int(pid) for path in paths for pid in path.read_text().split()]
        return []

    def running(self):
        return self.process.poll() is None

    def descriptors(self):
        return len(os.listdir(f"/proc/{self.pid}/fd"))

    def settled_descriptors(self):
        """How many it has when it has done all that was asked of it."""
        seen = []

        def settled():
            seen.append(self.descriptors())
            time.sleep(0.02)
            return len(seen) > 10 and len(set(seen[-10:])) == 1
        eventually(settled, what="descriptors that stay")
        return seen[-1]

    def sockets(self):
        """How many of its descriptors are sockets: what a connection costs, without what is opened once and kept."""
        return sum(each.startswith("socket:") for each in open_files(self.pid))

    def threads(self):
        """Their names. One that ends while they are read, a resolver's for instance, is not among them."""
        names = []
        for task in os.listdir(f"/proc/{self.pid}/task"):
            with contextlib.suppress(FileNotFoundError, ProcessLookupError):
                names.append(pathlib.Path(f"/proc/{self.pid}/task/{task}/comm").read_text().strip())
        return sorted(names)

    def network_worker(self):
        """The process id of its network worker, None when there is none."""
        for pid in self._children():
            with contextlib.suppress(FileNotFoundError, ProcessLookupError):
                if "brenvik-network" in pathlib.Path(f"/proc/{pid}/cmdline").read_text():
                    return pid
        return None

    def network_worker_maps(self):
        return pathlib.Path(f"/proc/{self.network_worker()}/maps").read_text()

    def cpu_seconds(self):
        """What it has computed so far, which no other work of the machine makes more."""
        fields = pathlib.Path(f"/proc/{self.pid}/stat").read_text().rsplit(")", 1)[1].split()
        return sum(map(int, fields[11:13])) / os.sysconf("SC_CLK_TCK")

    def resident_kib(self):
        return int(re.search(r"VmRSS:\s+(\d+)", pathlib.Path(f"/proc/{self.pid}/status").read_text())[1])

    def maps(self):
        return pathlib.Path(f"/proc/{self.pid}/maps").read_text()


def listen(path=SOCKET):
    """A listening socket as the service manager would make it: root's and the group's."""
    path = pathlib.Path(path)
    path.parent.mkdir(parents=True, exist_ok=True)
    if path.exists():
        path.unlink()
    sock = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
    sock.bind(str(path))
    os.chown(path, 0, grp.getgrnam("brenvik").gr_gid)
    os.chmod(path, 0o660)
    sock.listen(128)
    return sock


def as_account(name, work):
    """Runs work() in a child process under another account; returns what it returns (a number 0..255)."""
    pid = os.fork()
    if pid == 0:
        status = 255
        try:
            account = pwd.getpwnam(name)
            os.initgroups(name, account.pw_gid)
            os.setresgid(account.pw_gid, account.pw_gid, account.pw_gid)
            os.setresuid(account.pw_uid, account.pw_uid, account.pw_uid)
            status = work()
        except BaseException as error:  # the parent sees the number only
            sys.stderr.write(f"as {name}: {error!r}\n")
        finally:
            os._exit(status)
    return os.waitstatus_to_exitcode(os.waitpid(pid, 0)[1])


def refused_with():
    """Checks in; the code of the refusal, 0 for none."""
    try:
        wire.Client().close()
        return 0
    except wire.Status as status:
        return status.code


def in_a_new_process(program=sys.executable):
    """The same from a process of its own: a grant is kept for the life of a process."""
    code = "import sys; sys.path.insert(0, '.'); import harness; sys.exit(harness.refused_with())"
    return subprocess.run([program, "-c", code], check=False).returncode


def eventually(condition, timeout=10, what="the condition"):
    """Waits until condition() is true, for so many seconds of a machine that runs: one that stands still adds little."""
    left, looked = timeout, time.monotonic()
    while not condition():
        if left < 0:
            raise AssertionError(f"{what} did not come true in {timeout} s")
        time.sleep(0.01)
        last, looked = looked, time.monotonic()
        left -= min(looked - last, 0.1)


def open_files(pid):
    """What a process's descriptors are, as the kernel names it, without those that it closes meanwhile."""
    found = []
    for descriptor in pathlib.Path(f"/proc/{pid}/fd").iterdir():
        with contextlib.suppress(FileNotFoundError):
            found.append(os.readlink(descriptor))
    return found


def stop_process(pid):
    """Stops a process; returns when none of its threads runs any more. The kernel stops them one after the other, later."""
    def runs():
        for path in pathlib.Path(f"/proc/{pid}/task").glob("*/stat"):
            with contextlib.suppress(FileNotFoundError, ProcessLookupError):  # a thread that has ended
                if path.read_text().rsplit(")", 1)[1].split()[0] not in "TtZX":
                    return True
        return False

    os.kill(pid, signal.SIGSTOP)
    eventually(lambda: not runs(), what="the stop of every thread")


def has_ended(pid):
    """Whether its first thread has ended, waited for or not."""
    try:
        return "State:\tZ" in pathlib.Path(f"/proc/{pid}/status").read_text(encoding="ascii")
    except (FileNotFoundError, ProcessLookupError):
        return True


def kill_process(pid):
    """Kills a process of anybody's; returns when its last thread has ended, and with it closed what the process held.

    Its state is no sign of that: a process is a zombie as soon as its first thread has ended. False when there is none.
    """
    try:
        process = os.pidfd_open(pid)
    except ProcessLookupError:
        return False
    try:
        with contextlib.suppress(ProcessLookupError):
            signal.pidfd_send_signal(process, signal.SIGKILL)
        if not select.select([process], [], [], 20)[0]:
            raise AssertionError(f"process {pid} does not end")
    finally:
        os.close(process)
    return True


class Standstills:
    """Watches for moments in which the machine lets nobody run, so that a limit of time can leave them out.

    A thread on each processor sleeps for a moment, over and over. Where it oversleeps, the processor stood still. The
    first of them also adds up how long the daemon's main thread and the threads of this process waited for a processor
    that somebody else had, as the scheduler counts it.
    """

    MOMENT = 0.01
    MOST = 8  # processors of a large machine
    LONG = 0.05  # more than a busy machine lets somebody wait who hardly ever wants to run

    def __init__(self, test):
        self.test, self.gaps, self.ended = test, [], False
        self.waited, self.known, self.waits = 0.0, {}, []  # seconds; what each thread had waited; [(time, seconds)]
        self.threads = [threading.Thread(target=self._watch, args=(cpu,), daemon=True)
                        for cpu in sorted(os.sched_getaffinity(0))[:self.MOST]]
        self.seen = {}  # until when each thread has looked
        for thread in self.threads:
            thread.start()
        test.addCleanup(self._end)

    def _end(self):
        self.ended = True
        for thread in self.threads:
            thread.join()

    def _watch(self, cpu):
        with contextlib.suppress(OSError):  # a processor that has gone
            os.sched_setaffinity(0, {cpu})
        while not self.ended:
            slept = time.monotonic()
            time.sleep(self.MOMENT)
            if (woke := time.monotonic()) - slept > self.LONG:
                self.gaps.append((slept, woke))
            if threading.current_thread() is self.threads[0]:
                self._add_waits()
            self.seen[cpu] = woke

    def _add_waits(self):
        watchers = {str(thread.native_id) for thread in self.threads}
        tasks = [f"/proc/self/task/{task}" for task in os.listdir("/proc/self/task") if task not in watchers]
        daemon = getattr(self.test, "daemon", None)
        if daemon is not None:
            tasks.append(f"/proc/{daemon.pid}")
        for task in tasks:
            with contextlib.suppress(OSError, IndexError):  # a thread that has ended, or a kernel that does not count
                waited = int(pathlib.Path(f"{task}/schedstat").read_text().split()[1]) / 1e9
                self.waited += max(waited - self.known.get(task, waited), 0)
                self.known[task] = waited
        self.waits.append((time.monotonic(), self.waited))

    def _waited_until(self, moment):
        at = bisect.bisect(self.waits, (moment,))
        if at in (0, len(self.waits)):
            return self.waits[min(at, len(self.waits) - 1)][1]
        (before, low), (after, high) = self.waits[at - 1:at + 1]
        return low + (high - low) * (moment - before) / (after - before)

    def count(self, start, end):
        """How often a processor stood still between two moments of time.monotonic()."""
        self.between(start, end)
        return sum(slept < end and woke > start for slept, woke in self.gaps)

    def between(self, start, end):
        """Seconds between two moments of time.monotonic() in which a processor stood still."""
        # Whoever was woken first must wait for what the others saw.
        while len(self.seen) < len(self.threads) or min(self.seen.values()) < end:
            time.sleep(0.001)
        seconds, at = 0.0, start
        for slept, woke in sorted(self.gaps):
            seconds += max(min(woke, end) - max(slept, at), 0)
            at = max(at, min(woke, end))
        return seconds

    def ran(self, start, end=None):
        """Seconds from `start` to `end`, or until now, in which the machine ran, and had a processor for us and the daemon."""
        end = end or time.monotonic()
        stood = self.between(start, end)
        return end - start - max(stood, min(self._waited_until(end) - self._waited_until(start), end - start))


class HelperTest(unittest.TestCase):
    """A running daemon for each test, with this Python entitled and both logs recorded."""

    activated = False
    _standstills = None

    def setUp(self):
        self.logs = Logs()
        self.addCleanup(self.logs.close)
        entitle()
        self.prepare()
        self.daemon = Daemon(activated=self.activated)
        self.addCleanup(lambda: self.daemon.stop())  # whichever daemon the test has by then

    def prepare(self):
        """For what must be in place before the daemon starts."""

    def client(self):
        client = wire.Client()
        self.addCleanup(client.close)
        return client

    def need_descriptors(self, count):
        """Skips the test where processes may not have so many."""
        most = resource.getrlimit(resource.RLIMIT_NOFILE)[1]
        if most != resource.RLIM_INFINITY and most < count:
            self.skipTest(f"a process may have {most} descriptors here")

    def watch_machine(self):
        """From now on; the limits of time that a test sets leave its standstills out."""
        if self._standstills is None:
            self._standstills = Standstills(self)
        return self._standstills


class _Loader(unittest.TestLoader):
    """Leaves out what BRENVIK_WITHOUT names: classes, and tests as Class.test, with a blank between two."""

    def getTestCaseNames(self, testCaseClass):
        without, owner = os.environ.get("BRENVIK_WITHOUT", "").split(), testCaseClass.__name__
        return [name for name in super().getTestCaseNames(testCaseClass)
                if owner not in without and f"{owner}.{name}" not in without]


def main():
    unittest.main(verbosity=2, testLoader=_Loader())
