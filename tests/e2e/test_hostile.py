# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Clients that misbehave: nobody else notices, and nothing is left behind."""
import os
import plistlib
import random
import resource
import select
import signal
import socket
import struct
import time

import wire
from harness import SANITIZED, HelperTest, as_account, eventually, main


class HostileClients(HelperTest):
    def setUp(self):
        super().setUp()
        self.good = self.client()
        self.machine = self.watch_machine()

    def assert_served(self, within=2.0):
        """The well-behaved client beside the hostile one gets its answer."""
        started = time.monotonic()
        self.assertEqual(self.good.copy_preference("com.example.none", "key"), b"")
        ended = time.monotonic()
        if ended - started > within:
            self.assertLess(self.machine.ran(started, ended), within)

    def test_messages_of_random_bytes_get_an_answer_of_the_protocol_or_silence(self):
        generator = random.Random(20260)
        bad = self.client()
        for _ in range(3000):
            size = generator.choice((0, 1, 23, 24, 25, 36, 40, 76, 288, 568, generator.randrange(70)))
            data = bytearray(generator.randbytes(size))
            if size >= 24:
                struct.pack_into("<I", data, 0, generator.choice((18, wire.COMPLEX | 18)))
                struct.pack_into("<I", data, 8, 1 + generator.randrange(1 << 31))
                struct.pack_into("<i", data, 20, wire.FIRST + generator.choice((6, 7, 21, 23, 24, 25, 40)))
            if not data:
                continue  # may be taken for the end of the channel
            bad.channel.send(bytes(data))
            if size >= 24:
                reply, fds = bad.channel.receive()
                self.assertEqual(struct.unpack_from("<i", reply, 20)[0], struct.unpack_from("<i", data, 20)[0] + 100)
                for fd in fds:
                    os.close(fd)
        self.assert_served()
        self.assertTrue(self.daemon.running())

    def test_a_message_shorter_than_a_header_gets_silence(self):
        for size in range(1, 24):
            self.good.channel.send(bytes(size))
        with self.assertRaises(TimeoutError):
            self.good.channel.receive(timeout=0.3)
        self.assert_served()

    def test_regions_that_lie_are_refused_and_leave_nothing_open(self):
        bad = self.client()
        value = plistlib.dumps("value")
        self.assert_served()
        before = self.daemon.settled_descriptors()
        unsealed = [wire.memfd_of(value, seals) for seals in (0, 0x2, 0x4 | 0x8, 0x2 | 0x4)]
        sealed = wire.memfd_of(value)
        zero = os.open("/dev/zero", os.O_RDONLY)
        message, _ = wire.set_preference_message("d", "k", b"", way="memfd", size=len(value))
        for fd in (*unsealed, zero):
            self.assertEqual(bad.channel.status(message, [fd]), -304)
        longer, _ = wire.set_preference_message("d", "k", b"", way="memfd", size=len(value) + 1)
        self.assertEqual(bad.channel.status(longer, [sealed]), -304)
        self.assertEqual(bad.channel.status(message, [sealed, sealed]), -304)
        self.assertEqual(bad.channel.status(message), -304)
        inline, _ = wire.set_preference_message("d", "k", value)
        for offset in (0, 8, 560, 569, 576 + 8, 1 << 40, (1 << 64) - 8):
            lying = bytearray(inline)
            struct.pack_into("<Q", lying, 28, offset)
            if offset:
                self.assertEqual(bad.channel.status(bytes(lying)), -304, offset)
        self.assertEqual(bad.channel.status(inline + b"\0"), -304)
        for fd in (*unsealed, sealed, zero):
            os.close(fd)
        eventually(lambda: self.daemon.descriptors() <= before, what="every descriptor being closed")
        self.assert_served()

    def test_a_client_that_never_reads_delays_nobody_but_itself(self):
        bad = self.client()
        self.good.set_preference("com.example.large", "key", plistlib.dumps(os.urandom(30000)))
        message = wire.simple("CopyPreferenceValue", wire.field("com.example.large", 256), wire.field("key", 256))
        bad.channel.sock.settimeout(0)
        sent = 0
        try:
            while sent < 10000:
                bad.channel.send(message)
                sent += 1
        except BlockingIOError:
            pass
        for _ in range(20):
            self.assert_served()
        # It may still change its mind: every request it got rid of is answered.
        for _ in range(sent):
            reply, _ = bad.channel.receive()
            self.assertGreater(len(reply), 30000)

    def test_a_client_that_is_stopped_or_killed_in_the_middle_is_not_noticed(self):
        self.assert_served()
        # The first caller to exit leaves the queue behind on which exits are handled.
        self.assertEqual(as_account("root", lambda: wire.Client().close() or 0), 0)
        eventually(lambda: "global" in self.daemon.threads(), what="the exit being handled")
        before = self.daemon.settled_descriptors()
        for what in (signal.SIGSTOP, signal.SIGKILL):
            pid = os.fork()
            if pid == 0:
                try:
                    client = wire.Client()
                    while True:
                        client.channel.send(wire.simple("CopyPreferenceValue", wire.field("d", 256), wire.field("k", 256)))
                finally:
                    os._exit(1)
            eventually(lambda: self.daemon.descriptors() >= before + 3, what="a second client")
            os.kill(pid, what)
            for _ in range(20):
                self.assert_served()
            os.kill(pid, signal.SIGKILL)
            os.waitpid(pid, 0)
            eventually(lambda: self.daemon.descriptors() <= before, what="its descriptors going back")

    def test_half_a_check_in_and_hundreds_of_silent_connections_crowd_nobody_out(self):
        self.assert_served()
        before = self.daemon.descriptors()
        all_there, crowd_there = os.pipe()
        let_go, crowd_let_go = os.pipe()[::-1]

        def silent_crowd():
            connections = []
            try:
                connections += [wire.connect() for _ in range(300)]
                connections[-1].send(wire.check_in_message()[:30])
            finally:
                os.write(crowd_there, b"x")
            select.select([crowd_let_go], [], [], 30)
            for connection in connections:
                connection.close()
            return 0
        pids = []
        for account in ("stranger", "mobile", "telephony"):
            pid = os.fork()
            if pid == 0:
                os._exit(as_account(account, silent_crowd))
            pids.append(pid)
        for _ in range(20):
            wire.Client().close()
            self.assert_served()
        for _ in pids:
            os.read(all_there, 1)
        self.assert_served()
        eventually(lambda: self.daemon.descriptors() <= before + 128, what="no more silent connections than a few")
        for end in (all_there, crowd_there, let_go, crowd_let_go):
            self.addCleanup(os.close, end)
        os.write(let_go, b"x")
        for pid in pids:
            self.assertEqual(os.waitstatus_to_exitcode(os.waitpid(pid, 0)[1]), 0)

    def test_a_client_whose_end_nobody_could_notice_is_not_let_in(self):
        self.assert_served()
        before = self.daemon.settled_descriptors()
        with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as listening:
            listening.bind("\0never-hangs-up")
            listening.listen()
            service = wire.connect()
            self.assertEqual(service.status(wire.check_in_message(), [listening.fileno()]), -304)
            service.close()
        eventually(lambda: self.daemon.descriptors() <= before, what="the descriptors going back")
        self.good.close()
        self.assertEqual(self.daemon.wait(), 0, "nobody holds the process")

    def test_a_client_that_the_helper_itself_would_keep_alive_is_not_let_in(self):
        self.assert_served()
        before = self.daemon.settled_descriptors()
        message = wire.check_in_message()
        failure = 5
        service, another = wire.connect(), wire.connect()
        one, other = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        self.assertEqual(service.status(message, [service.fileno()]), failure, "the other end is the helper's")
        self.assertEqual(service.status(message, [another.fileno()]), failure)
        reply, fds = service.exchange(message, [one.fileno()])
        self.assertEqual((len(reply), len(fds)), (40, 1))
        self.assertEqual(service.status(message, [other.fileno()]), failure, "the other end is watched")
        os.close(fds[0])
        for each in (service, another, one, other):
            each.close()
        eventually(lambda: self.daemon.descriptors() <= before, what="the descriptors going back")
        self.good.close()
        self.assertEqual(self.daemon.wait(), 0, "nobody holds the process")

    def test_500_clients_come_and_go_and_descriptors_and_memory_are_back(self):
        self.need_descriptors(2048)

        def crowd():
            clients = [wire.Client() for _ in range(500)]
            for client in clients:
                client.copy_preference("com.example.none", "key")
            for client in clients:
                client.close()
        crowd()
        eventually(lambda: self.daemon.descriptors() < 60, what="500 clients' descriptors going back")
        before, memory = self.daemon.settled_descriptors(), self.daemon.resident_kib()
        for _ in range(2):
            crowd()
        eventually(lambda: self.daemon.descriptors() <= before, what="the descriptors going back")
        if not SANITIZED:
            self.assertLess(self.daemon.resident_kib() - memory, 1024)
        self.assert_served()

    def test_a_client_that_shuts_its_channel_wakes_nobody_up(self):
        bad = self.client()
        bad.channel.sock.shutdown(socket.SHUT_RDWR)
        self.assert_served()
        with open(f"/proc/{self.daemon.pid}/stat", encoding="ascii") as stat:
            before = sum(map(int, stat.read().rsplit(")", 1)[1].split()[11:13]))
        time.sleep(0.5)
        with open(f"/proc/{self.daemon.pid}/stat", encoding="ascii") as stat:
            after = sum(map(int, stat.read().rsplit(")", 1)[1].split()[11:13]))
        self.assertLessEqual(after - before, 2, "clock ticks: it does not spin")

    def without_descriptors(self, beyond):
        """Lets the process have no more descriptors than it has now; its hard limit is `beyond` above that."""
        top = max(int(number) for number in os.listdir(f"/proc/{self.daemon.pid}/fd")) + 1
        resource.prlimit(self.daemon.pid, resource.RLIMIT_NOFILE, (top, top + beyond))

    def test_without_descriptors_the_helpers_own_work_still_has_threads_of_its_own(self):
        self.assert_served()
        self.without_descriptors(beyond=36)
        self.assertEqual(self.good.status("EnableRadioManagerLogs", struct.pack("<i", 1)), 0)
        check = wire.simple("CheckLASDUpdate", struct.pack("<i", 0))
        reply, _ = self.good.channel.exchange(check)
        self.assertEqual(wire.check_status(check, reply, ndr=bytes(8)), 0)
        eventually(lambda: {"LASDUpdater", "RadioManagerLog"} <= set(self.daemon.threads()), what="both threads")
        self.assert_served()

    def test_without_any_descriptor_work_is_refused_with_6_and_holds_nobody_up(self):
        self.assert_served()
        self.without_descriptors(beyond=0)
        self.assertEqual(self.good.status("CheckLASDUpdate", struct.pack("<i", 0)), 6)
        self.assertEqual(self.good.status("EnableRadioManagerLogs", struct.pack("<i", 1)), 0)
        self.assert_served()
        self.good.close()
        self.assertEqual(self.daemon.wait(), 0, "the refused check holds the process no longer")

    def test_one_way_requests_are_served_and_not_answered(self):
        value = plistlib.dumps("one way")
        message, _ = wire.set_preference_message("com.example.oneway", "key", value)
        message = bytearray(message)
        struct.pack_into("<I", message, 8, 0)
        for _ in range(50):
            self.good.channel.send(bytes(message))
        self.assertEqual(plistlib.loads(self.good.copy_preference("com.example.oneway", "key")), "one way")


if __name__ == "__main__":
    main()
