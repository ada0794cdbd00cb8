# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""A helper without CAP_SYS_PTRACE, as its unit has it: a worker tells it which programs its callers run."""
import array
import contextlib
import json
import os
import pathlib
import re
import select
import shutil
import signal
import socket
import struct
import subprocess
import sys
import threading
import time
import unittest

import harness
import wire
from harness import (BUILD, ERROR, SOCKET, Daemon, Logs, as_account, entitle, eventually, in_a_new_process, refused_with,
                     stop_process)

PROGRAM = "brenvik-caller-worker"
CALLERS = pathlib.Path(f"{SOCKET}.callers")
# What the unit leaves the helper.
LESS = ("setpriv", "--bounding-set", "-all,+chown,+fowner,+dac_override", "--inh-caps", "-all", "--no-new-privs")
FACTS = struct.pack("<I", 1)  # the kind of a channel, a question and an answer
DIED = f"{PROGRAM} has died"
ENDED = f"{PROGRAM} does not answer as it should, and is ended"
SYS_PTRACE = 1 << 19


def send(sock, data, *descriptors):
    sock.sendmsg([data], [(socket.SOL_SOCKET, socket.SCM_RIGHTS, array.array("i", descriptors))] if descriptors else [])


def receive(sock):
    """The data, and the sockets that came with it."""
    data, descriptors, _, _ = socket.recv_fds(sock, 65536, 4)
    return data, descriptors


class Question:
    """A connection to the worker, as the helper has it."""

    def __init__(self):
        self.main = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        self.main.settimeout(20)
        self.main.connect(str(CALLERS))
        self.channel, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        self.channel.settimeout(20)
        with theirs:
            send(self.main, FACTS, theirs.fileno())

    def about(self, folder):
        """The answer; empty when the worker hangs up."""
        descriptor = os.open(folder, os.O_PATH)
        try:
            send(self.channel, FACTS, descriptor)
        finally:
            os.close(descriptor)
        return self.channel.recv(65536)

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.channel.close()
        self.main.close()


class Service:
    """The worker's socket, and behind it the worker, started by a connection: a service manager's part. The first
    connections go to other functions, one each."""

    def __init__(self, *before):
        self.listening = harness.listen(CALLERS)
        CALLERS.chmod(0o600)
        self.before = list(before)
        self.process = None
        self.starts = 0
        self.wake_read, self.wake_write = os.pipe()
        self.thread = threading.Thread(target=self._serve, daemon=True)
        self.thread.start()

    def _serve(self):
        while self.wake_read not in select.select([self.listening, self.wake_read], [], [])[0]:
            if self.before:
                connection, _ = self.listening.accept()
                with connection, contextlib.suppress(OSError):
                    self.before.pop(0)(connection)
                continue
            self.starts += 1
            command = f'exec 3<&{self.listening.fileno()}; LISTEN_PID=$$ exec "$0"'
            self.process = subprocess.Popen(["/bin/sh", "-c", command, str(BUILD / PROGRAM)], stdin=subprocess.DEVNULL,
                                            pass_fds=[self.listening.fileno()],
                                            env={"LISTEN_FDS": "1", "LISTEN_FDNAMES": CALLERS.name})
            self.process.wait()

    def worker(self):
        """Its process id, when it has taken a connection and given up its rights."""
        def is_ready():
            with contextlib.suppress(FileNotFoundError, AttributeError):
                status = pathlib.Path(f"/proc/{self.process.pid}/status").read_text()
                return re.search(r"^Seccomp:\t2$", status, re.M) and self.process.poll() is None
            return False
        eventually(is_ready, what="a worker at work")
        return self.process.pid

    def kill(self):
        """The worker, and waits until it has gone."""
        process = self.process
        process.send_signal(signal.SIGKILL)
        process.wait(20)

    def close(self):
        os.write(self.wake_write, b"x")
        if self.process is not None and self.process.poll() is None:
            self.process.kill()
        self.thread.join(20)
        for each in (self.wake_read, self.wake_write):
            os.close(each)
        self.listening.close()
        CALLERS.unlink()


def takes_and_dies(connection):
    """The first message, which brings the channel."""
    _, (channel,) = receive(connection)
    os.close(channel)


def takes_the_question_and_dies(connection):
    _, (channel,) = receive(connection)
    with socket.socket(fileno=channel) as asked:
        _, descriptors = receive(asked)
        for each in descriptors:
            os.close(each)


def answers(data, *descriptors):
    def serve(connection):
        _, (channel,) = receive(connection)
        with socket.socket(fileno=channel) as asked:
            _, folders = receive(asked)
            for each in folders:
                os.close(each)
            send(asked, data, *descriptors)
            asked.recv(1)  # until the helper hangs up
    return serve


class Callers(unittest.TestCase):
    def setUp(self):
        self.logs = Logs()
        self.addCleanup(self.logs.close)
        entitle()
        entitle("60-telephony.plist", user="telephony")

    def daemon(self):
        daemon = Daemon(prefix=LESS)
        self.addCleanup(daemon.stop)
        return daemon

    def service(self, *before):
        service = Service(*before)
        self.addCleanup(service.close)
        return service

    def lines(self):
        with self.logs.changed:
            return [text for _, _, text in self.logs.lines if PROGRAM in text]

    def test_the_helper_has_no_more_than_its_unit_leaves_it(self):
        status = pathlib.Path(f"/proc/{self.daemon().pid}/status").read_text()
        for name in ("CapPrm", "CapEff", "CapBnd"):
            self.assertEqual(int(re.search(rf"{name}:\t(\w+)", status)[1], 16), 1 << 0 | 1 << 1 | 1 << 3, name)

    def test_callers_are_told_apart_as_ever(self):
        service = self.service()
        self.daemon()
        self.assertEqual(in_a_new_process(), 0)
        self.assertEqual(as_account("telephony", refused_with), 0)
        other = pathlib.Path("/tmp/python-copy")
        shutil.copy2(pathlib.Path(sys.executable).resolve(), other)
        self.addCleanup(other.unlink)
        self.assertEqual(in_a_new_process(str(other)), 35, "another program")
        self.assertEqual(as_account("stranger", refused_with), 35, "another account")
        self.assertEqual((service.starts, self.lines()), (1, []), "one worker for all")

    def test_who_was_refused_is_told_with_its_program(self):
        self.service()
        self.daemon()
        other = pathlib.Path("/tmp/python-copy")
        shutil.copy2(pathlib.Path(sys.executable).resolve(), other)
        self.addCleanup(other.unlink)
        self.assertEqual(in_a_new_process(str(other)), 35)
        eventually(lambda: any(each.get("BRENVIK_CALLER_EXE") == str(other) for each in self.logs.entries),
                   what="a line about it")

    def test_a_caller_with_a_user_namespace_of_its_own_is_refused(self):
        self.service()
        self.daemon()
        code = "import sys; sys.path.insert(0, '.'); import harness; sys.exit(harness.refused_with())"
        done = subprocess.run(["unshare", "--user", "--map-root-user", sys.executable, "-c", code], check=False)
        self.assertEqual(done.returncode, 35)

    def test_the_status_tells_whether_the_worker_runs(self):
        service = self.service()
        daemon = self.daemon()

        def workers():
            done = subprocess.run([BUILD / "bvhelperctl", "--json", "status"], capture_output=True, check=False, timeout=60)
            return json.loads(done.stdout).get("workers")  # none while the status socket is not there yet
        others = [{"name": "network", "running": False}, {"name": "stores", "running": False}]
        for runs in (False, True):
            wanted = [{"name": "callers", "running": runs}, *others]
            eventually(lambda: workers() == wanted, what=f"a status that says {wanted}")
            self.assertEqual(in_a_new_process(), 0)
        service.worker()
        service.kill()
        self.assertEqual(workers(), [{"name": "callers", "running": False}, *others])
        self.assertTrue(daemon.running())

    def test_where_nobody_listens_nobody_is_let_in_and_the_log_says_why(self):
        self.daemon()
        self.assertEqual(in_a_new_process(), 35)
        self.logs.wait_for("unified", ERROR, f"cannot connect to {CALLERS}: No such file or directory")
        service = self.service()
        self.assertEqual(in_a_new_process(), 0, "the next question finds it")
        self.assertEqual(service.starts, 1)

    def test_a_worker_that_died_is_replaced_and_no_caller_notices(self):
        service = self.service()
        self.daemon()
        self.assertEqual(in_a_new_process(), 0)
        for deaths in range(1, 11):
            service.worker()
            service.kill()
            self.assertEqual(as_account("telephony", refused_with), 0, deaths)
            self.assertEqual(service.starts, deaths + 1)
        self.assertIn(DIED, self.lines())

    def test_a_death_at_each_step_is_made_up_for_by_the_next_worker(self):
        for step in (lambda connection: None, takes_and_dies, takes_the_question_and_dies):
            with self.subTest(step.__name__):
                service = Service(step)
                daemon = Daemon(prefix=LESS)
                try:
                    self.assertEqual(in_a_new_process(), 0)
                    self.assertEqual(service.starts, 1)
                finally:
                    daemon.stop()
                    service.close()

    def test_two_deaths_of_one_question_refuse_it_and_the_next_is_answered(self):
        self.service(takes_the_question_and_dies, takes_the_question_and_dies)
        self.daemon()
        self.assertEqual(in_a_new_process(), 35)
        self.assertEqual(self.lines(), [DIED, DIED])
        self.assertEqual(in_a_new_process(), 0)

    def test_a_lie_refuses_the_caller_and_ends_the_liar(self):
        whole = FACTS + bytes([1]) + bytes(16) + struct.pack("<I", 1) + b"/" + bytes([1]) + bytes(16)
        for lie in (whole[:-1], whole + b"x", struct.pack("<I", 2) + whole[4:], FACTS, b"abc"):
            service = Service(answers(lie))
            daemon = Daemon(prefix=LESS)
            try:
                self.logs.clear()
                self.assertEqual(in_a_new_process(), 35, lie)
                self.assertEqual(self.lines(), [ENDED], lie)
                self.assertEqual(in_a_new_process(), 0, "another worker answers")
            finally:
                daemon.stop()
                service.close()

    def test_a_lie_of_the_right_form_lets_nobody_in_who_runs_nothing(self):
        nothing = FACTS + bytes([0]) + struct.pack("<I", 0) + bytes([0])
        self.service(answers(nothing))
        self.daemon()
        self.assertEqual(in_a_new_process(), 35)

    def test_a_worker_that_hangs_is_waited_for_two_seconds_and_its_successor_answers(self):
        service = self.service()
        self.daemon()
        with contextlib.closing(wire.Client()):
            stop_process(service.worker())
            began = time.monotonic()
            self.assertEqual(in_a_new_process(), 35)
            self.assertGreater(time.monotonic() - began, 1.9)
            self.logs.wait_for("unified", ERROR, ENDED)
            service.kill()
            self.assertEqual(in_a_new_process(), 0)

    def test_the_worker_stays_for_the_next_helper(self):
        service = self.service()
        daemon = self.daemon()
        self.assertEqual(in_a_new_process(), 0)
        worker = service.worker()
        daemon.stop()
        self.daemon()
        self.assertEqual(in_a_new_process(), 0)
        self.assertEqual(service.worker(), worker)

    def test_the_worker_has_one_capability_and_no_account_of_anybodys(self):
        service = self.service()
        self.daemon()
        self.assertEqual(in_a_new_process(), 0)
        status = pathlib.Path(f"/proc/{service.worker()}/status").read_text()
        for name in ("CapPrm", "CapEff"):
            self.assertEqual(int(re.search(rf"{name}:\t(\w+)", status)[1], 16), SYS_PTRACE, name)
        for name, wanted in (("CapInh", "0" * 16), ("CapAmb", "0" * 16), ("NoNewPrivs", "1"), ("Seccomp", "2"),
                             ("Uid", "65534\t" * 3 + "65534"), ("Gid", "65534\t" * 3 + "65534"), ("Groups", " ")):
            self.assertIn(f"\n{name}:\t{wanted}\n", status)

    def test_it_serves_root_alone(self):
        service = self.service()
        CALLERS.chmod(0o666)  # the mode is the first lock, and this one the second

        def asks():
            with contextlib.suppress(ConnectionError), Question() as question:  # the worker may hang up at any step
                return 1 if question.about("/proc/self") else 0
            return 0
        self.assertEqual(as_account("mobile", asks), 0)
        with Question() as question:
            self.assertIn(os.path.realpath(sys.executable).encode(), question.about("/proc/self"))
        self.assertEqual(service.starts, 1, "the stranger did not end it")


# As a helper that was taken over: what it has left, and what it can ask.
ATTACK = """
import contextlib, errno, os, sys
sys.path.insert(0, ".")
import test_callers
tried = {}
victim = os.getppid()
for path, flags in ((f"/proc/{victim}/mem", os.O_WRONLY), (f"/proc/{victim}/mem", os.O_RDONLY), (f"/proc/{victim}/root", os.O_RDONLY),
                    (f"/proc/{victim}/root/etc", os.O_RDONLY), (f"/proc/{victim}/cwd", os.O_RDONLY),
                    (f"/proc/{victim}/fd/0", os.O_RDONLY), (f"/proc/{victim}/exe", os.O_RDONLY),
                    (f"/proc/{victim}/environ", os.O_RDONLY), (f"/proc/{victim}/maps", os.O_RDONLY)):
    try:
        os.close(os.open(path, flags))
        print("opened", path)
    except OSError as error:
        if error.errno not in (errno.EACCES, errno.EPERM):
            print(path, error)
os.mkdir("/tmp/made")
for target in ("/proc/1/root/etc/hostname", "/proc/1/exe"):
    os.symlink(target, "/tmp/made/exe")
    with test_callers.Question() as question:
        if question.about("/tmp/made"):
            print("told where a link leads that somebody made")
    os.unlink("/tmp/made/exe")
with test_callers.Question() as question:
    answer = question.about(f"/proc/{victim}")
    if os.path.realpath(sys.executable).encode() not in answer:
        print("not told what a process executes:", answer)
os.rmdir("/tmp/made")
"""


class TakenOver(unittest.TestCase):
    def test_with_the_rights_of_the_helper_nothing_behind_the_links_of_another_process_is_reached(self):
        logs = Logs()
        self.addCleanup(logs.close)
        service = Service()
        self.addCleanup(service.close)
        done = subprocess.run([*LESS, sys.executable, "-c", ATTACK], capture_output=True, text=True, timeout=60, check=False)
        self.assertEqual((done.returncode, done.stdout, done.stderr), (0, "", ""))


if __name__ == "__main__":
    unittest.main()
