# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""A siege: clients of every hostile kind at once, for as long as is asked, and a well-behaved one beside them.

The well-behaved client, under another account, never fails and never waits more than 100 ms for an optimised daemon,
a second for one built to be debugged (under a sanitizer, which slows it down many times over, it only must not fail).
The machine itself may stand still for longer: a process on each processor watches for that, and what of a wait falls
into such gaps is told, but nobody's fault. When the besiegers have gone, the daemon is as it was.

BRENVIK_SIEGE_SECONDS says how long (default 15), BRENVIK_SIEGE_SEED makes a run's choices come again, as far as
the order of processes allows.
"""
import array
import collections
import contextlib
import json
import os
import pathlib
import pwd
import plistlib
import random
import re
import resource
import signal
import socket
import struct
import time
import traceback

import wire
from harness import BUILD, SANITIZED, HelperTest, as_account, entitle, eventually, main, open_files

SECONDS = float(os.environ.get("BRENVIK_SIEGE_SECONDS", 15))
SEED = int(os.environ.get("BRENVIK_SIEGE_SEED", random.SystemRandom().randrange(1 << 32)))
OPTIMISED = "CMAKE_BUILD_TYPE:STRING=Release" in (BUILD / "CMakeCache.txt").read_text(encoding="utf-8")
LONGEST_WAIT = 0.1 if OPTIMISED else 1.0  # seconds
STANDSTILL = 0.025  # seconds that a processor gives to nobody, and more
PATIENCE = 2.0 if SANITIZED else 0.2  # of besiegers with a daemon that does not take what they send

PLACES = ["/etc/passwd", "/dev/zero", "/dev/full", "/proc/kmsg", "/proc/self/mem", "/tmp/siege/fifo", "/tmp/siege/loop",
          "/tmp/siege/folder", "/tmp/siege/file", "/var/mobile/Library/Carrier Bundles/x", "/var/mobile/../../etc",
          "/private/var/mobile/Library/Preferences/com.example.plist", "relative", "", "/" * 200, "\xff\xfe", "%n%s%s"]


def make_places():
    os.makedirs("/tmp/siege/folder")
    os.mkfifo("/tmp/siege/fifo")
    os.symlink("/tmp/siege/loop", "/tmp/siege/loop")
    with open("/tmp/siege/file", "wb") as file:
        file.write(bytes(1 << 16))


def argument_bytes(generator, count):
    """Bytes of a request's arguments: texts at odd places, numbers, noise."""
    kind = generator.randrange(4)
    if kind == 0:
        return generator.randbytes(count)
    if kind == 1:
        return bytes([generator.randrange(256)]) * count
    data = bytearray(count)
    for start in range(0, count, generator.choice((4, 64, 256, 1024))):
        text = generator.choice(PLACES).encode("utf-8", "surrogateescape")
        data[start:start + len(text)] = text
    return bytes(data[:count])


def property_list(generator):
    """Something that is, was or claims to be a property list."""
    kind = generator.randrange(6)
    if kind == 0:
        return generator.randbytes(generator.randrange(1, 5000))
    if kind == 1:
        return b"<plist version=\"1.0\">" + b"<array>" * generator.choice((10, 600, 100000))
    if kind == 2:
        return b"bplist00" + generator.randbytes(generator.randrange(1, 3000))
    value = {"key": [generator.random(), generator.randbytes(generator.randrange(2000)), "text" * generator.randrange(50)]}
    good = bytearray(plistlib.dumps(value, fmt=generator.choice((plistlib.FMT_XML, plistlib.FMT_BINARY))))
    for _ in range(generator.randrange(4)):
        good[generator.randrange(len(good))] = generator.randrange(256)
    return bytes(good[:generator.randrange(1, len(good) + 1)] if generator.random() < 0.3 else good)


def request(generator):
    """A request: well-formed, nearly so, or not at all; and the descriptors to send with it."""
    name, size, _ = generator.choice(wire.ROUTINES)
    bits = generator.choice((18, 18, 18, wire.COMPLEX | 18, 0, generator.randrange(1 << 32)))
    reply_port = generator.choice((0x1234, 0x1234, 0, generator.randrange(1 << 32)))
    if name == "SetPreferenceValue" or generator.random() < 0.2:
        message, fds = wire.set_preference_message(
            generator.choice(("com.example.siege", "", "\xff", "../../etc/x")), generator.choice(("key", "", "%s")),
            property_list(generator), way=generator.choice(("in line", "memfd")))
        message = bytearray(message)
    else:
        length = max(24, size + generator.choice((0, 0, 0, 0, -1, 1, generator.randrange(-size, 70))))
        message, fds = bytearray(wire.header(wire.ID[name], size, bits, reply_port)), []
        body = argument_bytes(generator, length - 24)
        message += wire.NDR + body[8:] if generator.random() < 0.8 and len(body) >= 8 else body
    for _ in range(generator.choice((0, 0, 0, 1, 2, 8))):
        message[generator.randrange(len(message))] = generator.randrange(256)
    return bytes(message[:wire.LARGEST]), fds


def odd_descriptors(generator):
    """Descriptors of many kinds, some of which cost whoever looks into them."""
    fds = []
    for _ in range(generator.choice((0, 1, 1, 2, 3, 16, 253))):
        kind = generator.randrange(8)
        if kind == 0:
            fds.append(wire.memfd_of(generator.randbytes(generator.randrange(100)), generator.choice((None, 0, 2, 8))))
        elif kind == 1:
            large = wire.memfd_of(b"<plist>", 0)
            os.ftruncate(large, 1 << 30)  # no memory behind it
            fds.append(large)
        elif kind == 2:
            fds += os.pipe()
        elif kind == 3:
            fds.append(os.open(generator.choice(("/dev/zero", "/dev/null", "/proc/self", "/tmp/siege")), os.O_RDONLY))
        elif kind == 4:
            fds += [end.detach() for end in socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)]
        elif kind == 5:
            fds.append(socket.socket(socket.AF_UNIX, generator.choice((socket.SOCK_STREAM, socket.SOCK_DGRAM))).detach())
        elif kind == 6:
            fds.append(os.memfd_create("empty", os.MFD_CLOEXEC | os.MFD_ALLOW_SEALING))
        else:
            fds.append(os.dup(fds[-1]) if fds else os.open("/dev/null", os.O_RDONLY))
    for fd in fds[253:]:
        os.close(fd)
    return fds[:253]


def close_all(fds):
    for fd in fds:
        os.close(fd)


def drain(channel, limit=50):
    """Takes the answers that are there, and waits for none."""
    patience = channel.sock.gettimeout()
    channel.sock.settimeout(0)
    for _ in range(limit):
        try:
            data, ancillary, _, _ = channel.sock.recvmsg(wire.LARGEST, socket.CMSG_SPACE(8))
        except BlockingIOError:
            break
        for _, _, raw in ancillary:
            fds = array.array("i")
            fds.frombytes(raw[:len(raw) - len(raw) % 4])
            close_all(fds)
        if not data:
            raise wire.Closed()
    channel.sock.settimeout(patience)


# What a besieger does, over and over. Each takes its random generator; whatever the daemon answers or refuses, and
# however it closes the channel, is all right.

def send_anything(generator):
    with wire.Client() as client:
        client.channel.sock.settimeout(PATIENCE)
        for _ in range(generator.randrange(1, 200)):
            message, fds = request(generator)
            extra = odd_descriptors(generator) if generator.random() < 0.1 else []
            try:
                client.channel.send(message, (fds + extra)[:253])
            finally:
                close_all(fds + extra)
            if generator.random() < 0.7:
                drain(client.channel)


def send_descriptors(generator):
    with wire.Client() as client:
        client.channel.sock.settimeout(PATIENCE)
        for _ in range(30):
            fds = odd_descriptors(generator)
            value = property_list(generator)
            message, own = wire.set_preference_message("com.example.siege", "key", b"", way="memfd",
                                                       size=generator.choice((len(value), 1 << 20, (1 << 32) - 1, 0)))
            if generator.random() < 0.3:
                fds.append(client.channel.sock.fileno())  # a channel that holds itself
            try:
                client.channel.send(message, fds[-253:])
            finally:
                close_all(own + [fd for fd in fds if fd != client.channel.sock.fileno()])
            drain(client.channel)


def knock(generator):
    """At the service's door: noise, half a check-in, a check-in with the wrong thing in hand, or silence."""
    connections = []
    try:
        for _ in range(generator.choice((1, 5, 100))):
            connection = wire.connect(timeout=0.2)
            connections.append(connection)
            message = bytearray(wire.check_in_message(disposition=generator.choice((17, 17, 19, 20, 0)),
                                                      count=generator.choice((1, 1, 0, 2, 1 << 31))))
            if generator.random() < 0.5:
                message[generator.randrange(len(message))] = generator.randrange(256)
            fds = odd_descriptors(generator)
            try:
                if generator.random() < 0.8:
                    connection.send(bytes(message[:generator.randrange(1, len(message) + 1)]), fds)
            finally:
                close_all(fds)
        time.sleep(generator.random() * 0.05)
    finally:
        for connection in connections:
            with contextlib.suppress(OSError, wire.Closed):
                drain(connection, 1)
            connection.close()


def flood(generator):
    """Asks and never reads an answer; now and then it stands still with all of that in hand."""
    with wire.Client() as client:
        client.channel.sock.settimeout(0)
        message = wire.simple("CopyPreferenceValue", wire.field("com.example.large", 256), wire.field("key", 256))
        with contextlib.suppress(BlockingIOError):
            for _ in range(5000):
                client.channel.send(message)
        time.sleep(generator.random() * 0.2)


def come_and_go(generator):
    clients = []
    try:
        for _ in range(generator.randrange(1, 60)):
            clients.append(wire.Client())
        generator.shuffle(clients)
        for client in clients:
            client.channel.send(request(generator)[0] if generator.random() < 0.5 else bytes(7))
            if generator.random() < 0.5:
                client.life.close()  # the port it is known by dies first, its requests are on their way
    finally:
        for client in clients:
            client.close()


def victim(generator):
    """A client that is killed, or stopped for a while and then killed, in the middle of whatever it does."""
    pid = os.fork()
    if pid == 0:
        try:
            while True:
                generator.choice((send_anything, flood, come_and_go))(generator)
        except BaseException:
            os._exit(0)
    time.sleep(generator.random() * 0.1)
    if generator.random() < 0.5:
        os.kill(pid, signal.SIGSTOP)
        time.sleep(generator.random())
    os.kill(pid, signal.SIGKILL)
    os.waitpid(pid, 0)


BESIEGERS = [("root", send_anything), ("root", send_descriptors), ("root", flood), ("root", come_and_go),
             ("root", victim), ("root", knock), ("stranger", knock)]


class Reporter:
    """A process under an account, and the values that it reports by say()."""

    def __init__(self, account, work):
        read, write = os.pipe()
        self.pid = os.fork()
        if self.pid == 0:
            def run():
                work(lambda value: os.write(write, (json.dumps(value) + "\n").encode()))
                return 0
            try:
                os.close(read)
                os._exit(as_account(account, run))
            finally:
                os._exit(255)  # whatever happened, this process is not the test's
        os.close(write)
        self.report = os.fdopen(read, "r", encoding="utf-8")

    def lines(self):
        """All of them, once the process has ended."""
        with self.report:
            values = [json.loads(line) for line in self.report]
        status = os.waitstatus_to_exitcode(os.waitpid(self.pid, 0)[1])
        if status != 0:
            raise AssertionError(f"a process of the siege ended with {status} and said {values}")
        return values


def besiege(what, seed, end, say):
    """Does so until `end`; reports what, how often to its end, and how often the daemon had enough before."""
    resource.setrlimit(resource.RLIMIT_NOFILE, (4096, 4096))
    os.nice(10)  # what is asked is whom the daemon lets wait, not how the kernel shares its processors
    generator = random.Random(seed)
    done = failed = 0
    while time.monotonic() < end:
        try:
            what(generator)
            done += 1
        except (OSError, wire.Closed, wire.Status, AssertionError, struct.error):
            failed += 1  # refused, closed, or an answer that does not fit what was sent
    say([what.__name__, done, failed])


def watch_processor(number, end, say):
    """Reports from when to when a processor did not let anybody run who wanted to."""
    os.sched_setaffinity(0, {number})
    while (slept := time.monotonic()) < end + 1:
        time.sleep(0.004)
        if (woke := time.monotonic()) - slept > STANDSTILL:
            say([slept, woke])


def outside(wait, gaps):
    """How many seconds of a wait are in none of the gaps. Both are pairs of from when to when."""
    seconds, (at, end) = 0.0, wait
    for gap in sorted(gaps):
        if gap[1] > at:
            seconds += max(min(gap[0], end) - at, 0)
            at = min(gap[1], end)
    return seconds + end - at


def behave_well(end, say):
    """Two clients, one that stays and one that is new now and then. Reports the long waits and then a summary."""
    waits = []

    def timed(work):
        started = time.monotonic()
        answer = work()
        ended = time.monotonic()
        waits.append(ended - started)
        if ended - started > LONGEST_WAIT:
            say([started, ended])
        return answer

    rounds = 0
    try:
        with wire.Client() as client:
            while time.monotonic() < end:
                rounds += 1
                value = plistlib.dumps(f"value {rounds}")
                # What is written to the disk, what was, and what is not there.
                assert timed(lambda: client.set_preference("com.example.good", "key", value)) == 0
                read = timed(lambda: client.copy_preference("com.example.good", "key"))
                assert plistlib.loads(read) == f"value {rounds}", read
                assert timed(lambda: client.copy_preference("com.example.none", "key")) == b""
                if rounds % 20 == 0:
                    with timed(wire.Client) as newcomer:
                        assert timed(lambda: newcomer.copy_preference("com.example.none", "key")) == b""
                time.sleep(0.003)
    except BaseException:
        say({"failure": f"in round {rounds}: {traceback.format_exc()}"})
        return
    waits.sort()
    say({"answers": len(waits), "median": waits[len(waits) // 2], "most": waits[len(waits) * 99 // 100],
         "longest": waits[-1]})


class HeavilyUsed(HelperTest):
    """A daemon of which nothing may be left that it was not before."""

    def descriptors(self):
        """What the daemon has open. Files of preferences it may keep open, sixteen at most."""
        links = [re.sub(r":.*", "", each) for each in open_files(self.daemon.pid)]
        preferences = [link for link in links if "/Library/Preferences/" in link]
        self.assertLessEqual(len(preferences), 16)
        return sorted(link for link in links if link not in preferences)

    def settle(self):
        """What the daemon has open once that has not changed for five seconds: requests to the network take a while."""
        last, since = None, 0.0
        end = time.monotonic() + 90
        while time.monotonic() < end:
            now = self.descriptors()
            if now != last:
                last, since = now, time.monotonic()
            elif time.monotonic() - since > 5:
                break
            time.sleep(0.05)
        return collections.Counter(last)


class Siege(HeavilyUsed):
    def prepare(self):
        self.need_descriptors(8192)
        entitle("51-mobile.plist", user="mobile")
        make_places()
        resource.setrlimit(resource.RLIMIT_NOFILE, (8192, 8192))

    def lay_siege(self, seconds, seeds):
        """All besiegers for that long, and beside them the well-behaved client."""
        end = time.monotonic() + seconds
        besiegers = [Reporter(account, lambda say, what=what, seed=seeds.randrange(1 << 32): besiege(what, seed, end, say))
                     for account, what in BESIEGERS]
        watchers = [Reporter("root", lambda say, cpu=cpu: watch_processor(cpu, end, say)) for cpu in os.sched_getaffinity(0)]
        good = Reporter("mobile", lambda say: behave_well(end, say)).lines()
        standstills = [gap for watcher in watchers for gap in watcher.lines()]
        for besieger in besiegers:
            (what, done, failed), = besieger.lines()
            print(f"{what:18} {done:6} times to the end, {failed:6} not", flush=True)
            self.done[what] += done
        self.assertNotIn("failure", good[-1], good[-1])
        self.assertTrue(self.daemon.running())
        *long_waits, result = good
        blamed = [wait for wait in long_waits if outside(wait, standstills) > LONGEST_WAIT]
        print(f"{result['answers']} answers, median {result['median'] * 1e3:.2f} ms, 99 of 100 within "
              f"{result['most'] * 1e3:.2f} ms, the longest after {result['longest'] * 1e3:.1f} ms; {len(standstills)} times "
              f"a processor stood still, {len(long_waits) - len(blamed)} waits were long for that", flush=True)
        if not SANITIZED:
            self.assertEqual(blamed, [], "waits from when to when, in seconds")

    def use_everything(self):
        """Queues, databases and the like are made on first use, and stay."""
        with wire.Client() as client:
            for name, size, _ in wire.ROUTINES:
                body = bytes(size - 24 - len(wire.NDR)) if size > 24 else b""
                if size == 36:
                    body = struct.pack("<i", 1)
                elif size == 48:
                    body = struct.pack("<dd", 48.2, 16.4)
                client.channel.exchange(wire.simple(name, body))

    def open_store(self):
        """The voicemail store: its worker, channel and folder stay. One that is slower than a second is given up."""
        mobile = pwd.getpwnam("mobile")
        home = pathlib.Path(mobile.pw_dir)  # some of the besiegers make and remove folders like this one
        home.mkdir(parents=True, exist_ok=True)
        os.chown(home, mobile.pw_uid, mobile.pw_gid)

        def is_open():
            with wire.Client() as client:
                client.channel.exchange(wire.simple("SetVoicemailToken", b"a token".ljust(256, b"\0")))
                reply, _ = client.channel.exchange(wire.simple("CopyVoicemailToken"))
            return b"a token" in reply
        eventually(is_open, 60)
        time.sleep(1)

    def test_a_well_behaved_client_is_served_all_the_while_and_nothing_is_left_behind(self):
        print(f"{SECONDS:g} s, BRENVIK_SIEGE_SEED={SEED}", flush=True)
        with wire.Client() as first:
            self.assertEqual(first.set_preference("com.example.large", "key", plistlib.dumps(os.urandom(30000))), 0)
        self.use_everything()
        self.done = collections.Counter()
        seeds = random.Random(SEED)
        self.lay_siege(min(4.0, SECONDS), seeds)
        before, memory = self.settle(), self.daemon.resident_kib()
        self.open_store()
        before |= collections.Counter(self.descriptors())

        self.lay_siege(SECONDS, seeds)
        self.assertEqual([what for _, what in BESIEGERS if self.done[what.__name__] == 0], [], "never to the end")
        end = time.monotonic() + 90

        def left_over():
            return collections.Counter(self.descriptors()) - before

        while left_over() and time.monotonic() < end:
            time.sleep(0.05)
        self.assertFalse(left_over(), self.daemon.threads())
        self.assertNotIn("memfd:", self.daemon.maps())
        grown = self.daemon.resident_kib() - memory
        print(f"memory of the daemon: {memory} KiB before, {grown:+} KiB after", flush=True)
        if not SANITIZED:
            self.assertLess(grown, 24 << 10, "KiB; the documents of preferences it keeps are 16 MiB at most")
        with wire.Client() as last:
            self.assertEqual(last.copy_preference("com.example.none", "key"), b"")


if __name__ == "__main__":
    main()
