#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The listener: good pushes, broken ones, strangers, and sockets that somebody else made."""
import asyncio
import fcntl
import os
import plistlib
import shutil
import socket
import struct
import subprocess
import sys
import time
import unittest

import support
import brenvik_mobile_helper as package
from brenvik_mobile_helper import Listener
from brenvik_mobile_helper._listener import read_push

CIVIC, ADDRESS = 9100001, 9100002
PUSHES, NOTIFICATIONS = "com.norvale.brenvik", "com.norvale.Brenvik.lasd"


def plist(**values):
    return plistlib.dumps({"Client": ["BrenvikMobileHelper"], **values}, fmt=plistlib.FMT_BINARY)


def memory_of(data, seals=0xE):
    memory = os.memfd_create("region", os.MFD_ALLOW_SEALING)
    os.write(memory, data)
    if seals:
        fcntl.fcntl(memory, fcntl.F_ADD_SEALS, seals)
    return memory


def code_of(reply):
    return struct.unpack_from("<i", reply, 32)[0]


def lingering_socket():
    """A TCP socket whose last close waits an hour, and its other end, which does not read."""
    with socket.socket() as listening, socket.socket() as sock:
        listening.setsockopt(socket.SOL_SOCKET, socket.SO_RCVBUF, 1)
        listening.bind(("127.0.0.1", 0))
        listening.listen(1)
        sock.setsockopt(socket.SOL_SOCKET, socket.SO_SNDBUF, 1)
        sock.connect(listening.getsockname())
        reader = listening.accept()[0]
        sock.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, struct.pack("ii", 1, 3600))
        sock.setblocking(False)
        try:
            while True:
                sock.send(bytes(65536))
        except BlockingIOError:
            return sock.dup(), reader


class Pushes(support.InFolder):
    def listener(self, **options):
        listener = Listener(self.folder, **options)
        self.addCleanup(listener.close)
        return listener

    def send(self, message, fds=(), service=PUSHES):
        sock = support.connected(self.folder / service)
        self.addCleanup(sock.close)
        socket.send_fds(sock, [message], list(fds))
        return sock

    def test_a_civic_push_is_answered_and_handed_over(self):
        listener = self.listener()
        for in_line in (True, False):
            region = plist(CountryCode="NO", City="Oslo", State="Oslo", PostalCode="0150")
            memory = memory_of(region)
            sock = self.send(support.push_message(CIVIC, region, in_line=in_line), [] if in_line else [memory])
            os.close(memory)
            event = listener.next(20)
            self.assertIsInstance(event, package.CivicInfo)
            self.assertEqual((event.country_code, event.state, event.city, event.postal_code), ("NO", "Oslo", "Oslo", "0150"))
            self.assertEqual(event.values["Client"], ["BrenvikMobileHelper"])
            self.assertEqual((event.sender_uid, event.sender_pid), (os.geteuid(), os.getpid()))
            reply = sock.recv(100)
            self.assertEqual(reply, struct.pack("<IIIIIi", 18, 44, 0, 7, 0, CIVIC + 100) + bytes([0, 0, 0, 0, 1, 0, 0, 0]) + bytes(12))
            self.assertFalse(event.wants_reply)

    def test_an_address_push_without_the_value(self):
        self.assertEqual(self.next_of(plist()).address, "")
        self.assertEqual(self.next_of(plist(Address="192.0.2.7")).address, "192.0.2.7")

    def next_of(self, region):
        with Listener(self.folder) as listener:
            self.send(support.push_message(ADDRESS, region))
            return listener.next(20)

    def test_the_caller_may_answer_itself_with_a_code(self):
        listener = self.listener(answer=False)
        sock = self.send(support.push_message(CIVIC, plist()))
        event = listener.next(20)
        self.assertTrue(event.wants_reply)
        event.reply(-7, 3)
        self.assertEqual(struct.unpack_from("<iII", sock.recv(100), 32), (-7, 3, 0xFFFFFFF9))
        with self.assertRaises(package.InvalidArgumentError):
            event.reply()
        sock = self.send(support.push_message(CIVIC, plist()))
        event = listener.next(20)
        sock.close()
        with self.assertRaises(package.NoLongerThereError):
            event.reply()

    def test_a_notification(self):
        listener = self.listener()
        for values, expected in (({"Notification": "com.norvale.lasd.UpdateAvailable", "DBType": "lte"}, ("UpdateAvailable", "lte")),
                                 ({"Notification": "com.norvale.lasd.UpdateFailed"}, ("UpdateFailed", ""))):
            self.send(struct.pack("<IIIIIi", 0, 24, 0, 0, 0, 0) + plistlib.dumps(values, fmt=plistlib.FMT_BINARY),
                      service=NOTIFICATIONS)
            event = listener.next(20)
            self.assertIsInstance(event, package.Notification)
            self.assertEqual((event.kind, event.database), expected)
            self.assertFalse(event.wants_reply)

    def test_no_event_in_time(self):
        self.assertIsNone(self.listener().next(0))

    def test_broken_messages_are_refused_and_skipped(self):
        listener = self.listener()
        good = support.push_message(CIVIC, plist())
        memory = memory_of(plist())
        unsealed = memory_of(plist(), 0)
        self.addCleanup(os.close, memory)
        self.addCleanup(os.close, unsealed)
        outside = support.push_message(CIVIC, plist(), in_line=False)
        for message, fds, code in (
                (good[:20] + struct.pack("<i", 5) + good[24:], [], -303), (good[:3] + b"\0" + good[4:], [], -304),
                (good[:24] + b"\2" + good[25:], [], -304), (good[:39] + b"\0" + good[40:], [], -300), (good + b"\0", [], -304),
                (good, [memory], -304), (outside, [], -304), (outside, [unsealed], -304), (outside, [memory, memory], -304),
                (outside, [memory] * 5, -304), (support.push_message(CIVIC, b"no list"), [], -304),
                (support.push_message(CIVIC, plistlib.dumps([1])), [], -304), (good[:24], [], -304)):
            sock = self.send(message, fds)
            self.assertIsNone(listener.next(0.0))
            reply = sock.recv(100)
            self.assertEqual((len(reply), code_of(reply)), (36, code), message[:56])
        sock = self.send(good[:23])
        self.assertIsNone(listener.next(0.0))
        with self.assertRaises(BlockingIOError):
            sock.setblocking(False)
            sock.recv(100)
        # And it goes on.
        self.send(good)
        self.assertIsInstance(listener.next(20), package.CivicInfo)

    def test_every_shorter_length_and_every_flipped_bit(self):
        good = support.push_message(CIVIC, plist(CountryCode="NO"))
        for length in range(24, len(good)):
            self.assertIn(read_push(good[:length], [], False), (-300, -303, -304), length)
        for bit in range(len(good) * 8):
            spoilt = bytearray(good)
            spoilt[bit // 8] ^= 1 << bit % 8
            result = read_push(bytes(spoilt), [], False)
            if bit == 31 or 20 <= bit // 8 < 36 or 39 <= bit // 8 < 44:
                self.assertIn(result if isinstance(result, int) else result[2],
                              (-300, -303, -304, ADDRESS) if 20 <= bit // 8 < 24 else (-300, -304), bit)
            else:
                self.assertTrue(isinstance(result, tuple) or result == -304, bit)

    @unittest.skipUnless(os.geteuid() == 0, "needs root to become somebody else")
    def test_a_push_of_a_stranger_is_not_taken(self):
        self.folder.chmod(0o755)
        for options, taken in (({}, False), ({"allowed_uid": 65534}, True)):
            listener = Listener(self.folder, **options)
            child = os.fork()
            if child == 0:
                os.setresuid(65534, 65534, 65534)
                sock = support.connected(self.folder / PUSHES)
                try:
                    sock.send(support.push_message(CIVIC, plist()))
                    os._exit(0 if sock.recv(100) else 1)
                except OSError:
                    os._exit(1)
            event = None
            end = time.monotonic() + 20
            while time.monotonic() < end:
                event = listener.next(0.01)
                done, status = os.waitpid(child, os.WNOHANG)
                if event or done:
                    break
            if not done:
                status = os.waitpid(child, 0)[1]
            self.assertEqual((event is not None, os.waitstatus_to_exitcode(status)), (taken, 0 if taken else 1))
            listener.close()

    @unittest.skipUnless(os.geteuid() == 0, "needs root to become somebody else")
    def test_what_a_stranger_sends_along_holds_up_nobody(self):
        self.folder.chmod(0o755)
        listener = self.listener()
        readers = []
        for _ in range(16):  # as many as it has threads for
            sock, reader = lingering_socket()
            self.addCleanup(reader.close)
            readers.append(reader)
            child = os.fork()
            if child == 0:
                os.setresuid(65534, 65534, 65534)
                with support.connected(self.folder / PUSHES) as stranger:
                    socket.send_fds(stranger, [b"x"], [sock.fileno()])
                os._exit(0)
            sock.close()
            self.assertEqual(os.waitstatus_to_exitcode(os.waitpid(child, 0)[1]), 0)
        self.assertIsNone(listener.next(0), "and not in an hour")
        self.send(support.push_message(CIVIC, plist(City="waits")))
        self.assertIsNone(listener.next(0))
        readers[0].close()  # nothing is left to wait for
        self.assertEqual(listener.next(60).city, "waits")
        for reader in readers:
            reader.close()
        self.assertIsNone(listener.next(0))

    def test_many_connections_push_out_the_oldest_and_nothing_is_lost(self):
        listener = self.listener()
        idle = []
        for _ in range(12):
            idle += [support.connected(self.folder / PUSHES) for _ in range(10)]
            listener.next(0.0)
        before = support.descriptors()
        self.assertLessEqual(len(listener._connections), 32)
        for each in idle:
            each.close()
        self.assertIsNone(listener.next(0.0))
        self.assertEqual(support.descriptors(), before - len(idle) - 32)
        self.send(support.push_message(CIVIC, plist()))
        self.assertIsInstance(listener.next(20), package.CivicInfo)


class Sockets(support.InFolder):
    def test_files_are_made_and_removed(self):
        folder = self.folder / "made" / "deep"
        with Listener(folder):
            self.assertEqual(sorted(os.listdir(folder)), sorted([PUSHES, NOTIFICATIONS]))
            self.assertEqual(os.stat(folder / PUSHES).st_mode & 0o777, 0o666)
            with self.assertRaises(package.NameInUseError):
                Listener(folder)
        self.assertEqual(os.listdir(folder), [])
        with Listener(folder, notifications=False):
            self.assertEqual(os.listdir(folder), [PUSHES])
        with self.assertRaises(package.InvalidArgumentError):
            Listener(folder, pushes=False, notifications=False)

    def test_a_file_that_nobody_serves_is_replaced_and_another_kind_of_file_is_not(self):
        old = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        old.bind(str(self.folder / PUSHES))
        old.close()
        Listener(self.folder).close()
        (self.folder / PUSHES).write_text("somebody's")
        with self.assertRaises(OSError):
            Listener(self.folder)
        self.assertEqual((self.folder / PUSHES).read_text(), "somebody's")

    def test_a_folder_that_vanished_is_told_once_and_who_is_connected_is_still_served(self):
        folder = self.folder / "folder"
        with Listener(folder) as listener, support.connected(folder / PUSHES) as sender:
            self.assertIsNone(listener.next(0))
            os.chmod(folder / PUSHES, 0o600)  # which is no loss
            self.assertIsNone(listener.next(0))
            shutil.rmtree(folder)
            with self.assertRaises(package.NameLostError) as caught:
                listener.next(20)
            self.assertIn(str(folder / PUSHES), str(caught.exception))
            self.assertIsNone(listener.next(0))
            sender.send(support.push_message(CIVIC, plist(City="Oslo")))
            self.assertEqual(listener.next(20).city, "Oslo")

        async def work():
            async with package.AsyncListener(folder) as listener:
                asyncio.get_running_loop().call_later(0.01, shutil.rmtree, folder)
                with self.assertRaises(package.NameLostError):
                    await anext(listener)

        asyncio.run(work())

    def test_no_descriptor_is_lost(self):
        def work():
            Listener(self.folder).close()
            with Listener(self.folder), self.assertRaises(package.NameInUseError):
                Listener(self.folder)

        self.expect_no_descriptor_lost(work)

    def test_a_file_of_somebody_else_stays(self):
        listener = Listener(self.folder)
        (self.folder / PUSHES).unlink()
        (self.folder / PUSHES).write_text("another's")
        listener.close()
        self.assertEqual((self.folder / PUSHES).read_text(), "another's")

    def listening(self, name, kind=socket.SOCK_SEQPACKET, listens=True):
        sock = socket.socket(socket.AF_UNIX, kind)
        self.addCleanup(sock.close)
        sock.bind(str(self.folder / name))
        if listens:
            sock.listen(4)
        return sock

    def test_sockets_of_somebody_else(self):
        sock = self.listening(PUSHES)
        with Listener.from_sockets(pushes=sock) as listener:
            sender = support.connected(self.folder / PUSHES)
            with sender:
                sender.send(support.push_message(CIVIC, plist(City="Oslo")))
                self.assertEqual(listener.next(20).city, "Oslo")
        self.assertTrue((self.folder / PUSHES).exists())

    def test_a_foreign_socket_is_refused_and_stays_open(self):
        stream = self.listening("stream", socket.SOCK_STREAM)
        silent = self.listening("silent", listens=False)
        good = self.listening("good")
        pair = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        internet = socket.socket()
        for each in (*pair, internet):
            self.addCleanup(each.close)
        before = support.descriptors()
        for wrong in ({"pushes": stream}, {"pushes": silent}, {"notifications": pair[0]}, {"pushes": internet}, {},
                      {"pushes": good, "notifications": stream}, {"pushes": good, "notifications": good}):
            with self.assertRaises(package.InvalidArgumentError):
                Listener.from_sockets(**wrong)
        self.assertGreaterEqual(good.fileno(), 0)
        self.assertEqual(support.descriptors(), before)

    def run_with(self, names, code, pid=None, count=None):
        """Runs the code with listening sockets from descriptor 3 on, as a service manager would."""
        sockets = [self.listening(f"{number}") for number in range(len(names))]
        environment = {**os.environ, "LISTEN_FDS": str(len(names)) if count is None else count, "LISTEN_FDNAMES": ":".join(names),
                       "PYTHONPATH": str(support.BUILD / "python")}

        def prepare():
            high = [fcntl.fcntl(each.fileno(), fcntl.F_DUPFD, 50) for each in sockets]
            for number, each in enumerate(high, 3):
                os.dup2(each, number, inheritable=True)
            os.environ["LISTEN_PID"] = str(os.getpid())

        shell = f"export LISTEN_PID={pid or '$$'}; exec \"$@\""
        done = subprocess.run(["/bin/sh", "-c", shell, "sh", sys.executable, "-c", code], env=environment, preexec_fn=prepare,
                              capture_output=True, text=True, timeout=60, close_fds=False)
        for each in sockets:
            (self.folder / each.getsockname()).unlink()
        self.assertEqual(done.stderr, "")
        return done.stdout.strip()

    CODE = """
import os
from brenvik_mobile_helper import *
try:
    listener = Listener.from_environment()
    print(sorted(name for name, _ in listener._services.values()), os.get_inheritable(3))
except Error as error:
    print(type(error).__name__)
"""

    def test_sockets_of_the_service_manager(self):
        self.assertEqual(self.run_with([PUSHES, NOTIFICATIONS], self.CODE), f"{sorted([PUSHES, NOTIFICATIONS])} False")
        self.assertEqual(self.run_with(["other", PUSHES], self.CODE), f"{[PUSHES]} True")
        self.assertEqual(self.run_with(["other"], self.CODE), "NotHandedOverError")
        self.assertEqual(self.run_with([PUSHES], self.CODE, pid=1), "NotHandedOverError")
        self.assertEqual(self.run_with([PUSHES], self.CODE, count="many"), "NotHandedOverError")


class Asynchronous(support.InFolder):
    def test_pushes_are_an_async_iterator(self):
        async def work():
            got = []
            async with package.AsyncListener(self.folder) as listener:
                def send(city):
                    sock = support.connected(self.folder / PUSHES)
                    self.addCleanup(sock.close)
                    sock.send(support.push_message(CIVIC, plist(City=city)))

                send("Oslo")
                asyncio.get_running_loop().call_later(0.01, send, "Bergen")
                async for event in listener:
                    got.append(event.city)
                    if len(got) == 2:
                        break
            with self.assertRaises(StopAsyncIteration):
                await anext(listener)
            return got

        self.assertEqual(asyncio.run(work()), ["Oslo", "Bergen"])

    def test_waiting_can_be_cancelled_and_begun_again(self):
        async def work():
            async with package.AsyncListener(self.folder) as listener:
                with self.assertRaises(TimeoutError):
                    await asyncio.wait_for(anext(listener), 0.01)
                sock = support.connected(self.folder / PUSHES)
                with sock:
                    sock.send(support.push_message(CIVIC, plist(City="Oslo")))
                    return (await anext(listener)).city

        self.assertEqual(asyncio.run(work()), "Oslo")


if __name__ == "__main__":
    unittest.main()
