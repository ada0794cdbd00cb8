# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Who may knock and nothing more: what such an account sends along holds up neither clients nor newcomers."""
import ctypes
import os
import pwd
import resource
import signal
import socket
import struct
import threading
import time
import traceback

import wire
from harness import ERROR, SLOWNESS, HelperTest, as_account, eventually, main, refused_with, stop_process

LONGEST_CALL = 0.1 * SLOWNESS  # seconds, of a client that is checked in, while others do what they like
CHECK_IN_REFUSED = "out of descriptors or memory: a check-in was refused"


class HangingFiles:
    """A file system of the account's own, with one file. It answers until the file is open, then nothing any more."""

    IN, OUT = struct.Struct("<IIQQIIII"), struct.Struct("<IiQ")
    INIT, LOOKUP, GETATTR, OPEN, ACCESS, FLUSH = 26, 1, 3, 14, 34, 25

    def __init__(self, account_number):
        self.folder = "/tmp/hanging"
        os.makedirs(self.folder, exist_ok=True)
        self.device = os.open("/dev/fuse", os.O_RDWR)
        options = f"fd={self.device},rootmode=40000,user_id={account_number},group_id={account_number},allow_other"
        if ctypes.CDLL(None, use_errno=True).mount(b"hanging", self.folder.encode(), b"fuse.hanging", 0, options.encode()):
            os.close(self.device)
            raise OSError(ctypes.get_errno(), "mount")
        self.asked_for = []  # what it was asked to do, and by which account
        self.thread = threading.Thread(target=self._serve, daemon=True)
        self.thread.start()

    def _serve(self):
        while True:
            try:
                request = os.read(self.device, 1 << 20)
            except OSError:
                return  # unmounted
            _, code, unique, node, account, *_ = self.IN.unpack_from(request)
            self.asked_for.append((code, account))
            answer = {self.INIT: lambda: struct.pack("<IIIIHHIIHH", 7, 31, 0, 0, 16, 12, 1 << 16, 1, 0, 0) + bytes(32),
                      self.LOOKUP: lambda: struct.pack("<QQQQII", 2, 0, 3600, 3600, 0, 0) + self._facts(2),
                      self.GETATTR: lambda: struct.pack("<QII", 3600, 0, 0) + self._facts(node),
                      self.OPEN: lambda: struct.pack("<QII", 1, 0, 0), self.ACCESS: bytes}.get(code)
            if answer is not None:  # a close (FLUSH, RELEASE) is never answered
                body = answer()
                os.write(self.device, self.OUT.pack(self.OUT.size + len(body), 0, unique) + body)

    @staticmethod
    def _facts(node):
        mode = 0o100666 if node == 2 else 0o40777
        return struct.pack("<QQQQQQIIIIIIIIII", node, 0, 0, 0, 0, 0, 0, 0, 0, mode, 1, 602, 602, 0, 4096, 0)

    def end(self):
        force, detach = 1, 2  # the connection breaks, and whoever waits for an answer goes on
        ctypes.CDLL(None).umount2(self.folder.encode(), force | detach)
        self.thread.join()
        os.close(self.device)


def lingering_socket():
    """A TCP socket that is full, so that its last close waits an hour."""
    listening = socket.socket()
    listening.setsockopt(socket.SOL_SOCKET, socket.SO_RCVBUF, 1)
    listening.bind(("127.0.0.1", 0))
    listening.listen(1)
    sock = socket.socket()
    sock.setsockopt(socket.SOL_SOCKET, socket.SO_SNDBUF, 1)
    sock.connect(listening.getsockname())
    sock.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, struct.pack("ii", 1, 3600))
    sock.setblocking(False)
    try:
        while True:
            sock.send(bytes(65536))
    except BlockingIOError:
        pass
    return sock, listening


class Attack:
    """work() in a process under an account; it tells when it has done it and stays until it is told to leave.

    The helper stands still meanwhile: what the process closes then has the helper for its last holder.
    """

    def __init__(self, test, account, work):
        done, tell = os.pipe()
        stop_process(test.daemon.pid)
        self.pid = os.fork()
        if self.pid == 0:
            try:
                person = pwd.getpwnam(account)
                os.initgroups(account, person.pw_gid)
                os.setresgid(person.pw_gid, person.pw_gid, person.pw_gid)
                os.setresuid(person.pw_uid, person.pw_uid, person.pw_uid)
                kept = work()
                os.write(tell, b"x")
                while kept is not None:
                    signal.pause()
            except BaseException:
                traceback.print_exc()
            finally:
                os._exit(1)
        test.addCleanup(self.end)
        os.close(tell)
        told = os.read(done, 1)
        os.close(done)
        os.kill(test.daemon.pid, signal.SIGCONT)
        test.assertEqual(told, b"x", "the attack came about")

    def end(self):
        if self.pid:
            os.kill(self.pid, signal.SIGKILL)
            os.waitpid(self.pid, 0)
            self.pid = None


class Door(HelperTest):
    def setUp(self):
        super().setUp()
        self.good = self.client()
        self.good.copy_preference("com.example.none", "key")
        self.machine = self.watch_machine()

    def assert_nobody_waits(self, seconds=1.0):
        end = time.monotonic() + seconds
        while (started := time.monotonic()) < end:
            self.assertEqual(self.good.copy_preference("com.example.none", "key"), b"")
            self.assertLess(self.machine.ran(started, time.monotonic()), LONGEST_CALL)
        started = time.monotonic()
        wire.Client().close()
        self.assertLess(self.machine.ran(started), 1.0, "a newcomer")

    def knock_with(self, account, open_one, copies=(1, 2, 253), message=wire.check_in_message):
        """Sends check-ins with descriptors whose last holder is the helper, over connections of their own."""
        def work():
            kept = []
            for count in copies:
                one, *others = open_one()
                connection = wire.connect()
                connection.send(message(), [one.fileno()] * count)
                one.close()
                kept += [connection, *others]
            return kept
        return Attack(self, account, work)

    def test_a_socket_that_lingers_holds_up_nobody_however_it_is_sent(self):
        for name, message in (("check-in", wire.check_in_message), ("two ports", lambda: wire.check_in_message(count=2)),
                              ("unknown", lambda: wire.header(1, 24)), ("too short", lambda: bytes(8)),
                              ("too long", lambda: bytes(65537))):
            with self.subTest(name):
                attack = self.knock_with("stranger", lingering_socket, message=message)
                self.assert_nobody_waits(0.5)
                attack.end()
                self.assert_nobody_waits(0.5)

    def test_a_socket_that_lingers_in_the_queue_of_another_holds_up_nobody(self):
        def nested():
            sock, listening = lingering_socket()
            ours, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
            socket.send_fds(ours, [b"x"], [sock.fileno()])
            sock.close()
            ours.close()
            return theirs, listening
        self.knock_with("stranger", nested)
        self.assert_nobody_waits()

    def test_messages_that_nobody_reads_hold_up_nobody_when_their_connection_is_given_up(self):
        def work():
            connections = []
            for _ in range(80):  # more than are kept
                sock, listening = lingering_socket()
                connection = wire.connect()
                connection.send(wire.header(1, 24), [sock.fileno()])
                connection.send(wire.header(1, 24), [sock.fileno()])
                sock.close()
                connections += [connection, listening]
            return connections
        attack = Attack(self, "stranger", work)
        self.assert_nobody_waits()
        attack.end()
        self.assert_nobody_waits()
        eventually(lambda: self.daemon.descriptors() < 60, timeout=60, what="all of it being closed")

    def test_a_file_of_a_file_system_that_does_not_answer_holds_up_nobody(self):
        try:
            files = HangingFiles(602)
        except OSError as error:
            self.skipTest(f"no file system of one's own here: {error}")

        def work():
            os.close(files.device)  # only who serves it may hold it
            kept = []
            for count in (1, 2, 253):
                descriptor = os.open(f"{files.folder}/file", os.O_RDONLY)
                connection = wire.connect()
                connection.send(wire.check_in_message(), [descriptor] * count)
                # Closing it here would wait, too: this process is killed, and then the helper is the last holder.
                kept.append(connection)
            return kept
        try:
            attack = Attack(self, "stranger", work)
            self.assert_nobody_waits(0.5)
            os.kill(attack.pid, signal.SIGKILL)
            self.assert_nobody_waits()
            eventually(lambda: (files.FLUSH, 0) in files.asked_for, what="the helper waiting for a close")
            self.assert_nobody_waits(0.5)
        finally:
            files.end()  # before anybody waits for a process that waits for it

    def test_refused_check_ins_are_limited_in_rate_and_answered_all_the_same(self):
        def work():
            started, refused = time.monotonic(), 0
            while time.monotonic() - started < 2:
                if refused_with() == 35:
                    refused += 1
            return refused
        pid = os.fork()
        if pid == 0:
            os._exit(as_account("stranger", work))
        self.assert_nobody_waits(1.5)
        refused = os.waitstatus_to_exitcode(os.waitpid(pid, 0)[1])
        self.assertGreaterEqual(refused, 50)
        self.assertLessEqual(refused, 50 + 60, "twenty in a second, and those at once")

    def test_connections_of_3000_accounts_are_limited_in_all(self):
        before = self.daemon.descriptors()

        def crowd(first):
            connections = []
            for number in range(first, first + 750):
                os.setresuid(number, number, 0)
                connections.append(wire.connect())
                os.setresuid(0, 0, 0)
            return connections
        self.need_descriptors(2048)
        group = 604  # of those who may knock

        def work(first):
            os.setgroups([group])
            return crowd(first)
        for first in range(10000, 13000, 750):
            Attack(self, "root", lambda first=first: work(first))
        self.assert_nobody_waits()
        eventually(lambda: self.daemon.descriptors() <= before + 128, what="no more connections than are kept")

    def test_out_of_descriptors_an_entitled_caller_is_answered_6_with_a_line(self):
        top = max(int(number) for number in os.listdir(f"/proc/{self.daemon.pid}/fd")) + 1
        before = resource.prlimit(self.daemon.pid, resource.RLIMIT_NOFILE)
        resource.prlimit(self.daemon.pid, resource.RLIMIT_NOFILE, (top, before[1]))
        clients, codes = [], []
        for _ in range(20):
            try:
                clients.append(wire.Client())
            except wire.Status as status:
                codes.append(status.code)
        for client in clients:
            self.addCleanup(client.close)
        self.assertEqual(set(codes), {6})
        self.logs.wait_for("unified", ERROR, CHECK_IN_REFUSED)
        for client in clients:
            self.assertEqual(client.copy_preference("com.example.none", "key"), b"")
        resource.prlimit(self.daemon.pid, resource.RLIMIT_NOFILE, before)
        wire.Client().close()

    def test_4000_clients_fit_and_are_all_served(self):
        self.need_descriptors(8192 + 512)
        before = self.daemon.descriptors()
        resource.setrlimit(resource.RLIMIT_NOFILE, (8192 + 512, resource.getrlimit(resource.RLIMIT_NOFILE)[1]))
        clients = [wire.Client() for _ in range(4000)]
        self.assertLessEqual(self.daemon.descriptors() - before, 2 * 4000 + 32 + 8)
        for client in clients[::100]:
            self.assertEqual(client.copy_preference("com.example.none", "key"), b"")
        for client in clients:
            client.close()
        eventually(lambda: self.daemon.descriptors() <= before + 32, timeout=60, what="their descriptors going back")


if __name__ == "__main__":
    main()
