# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The cellular heartbeat of the real daemon, captured on the far end of an interface named pdp_ip0.

How it keeps the process from leaving is in test_heartbeat_idle.
"""
import os
import pathlib
import socket
import struct
import time

import network
from harness import HelperTest, eventually, main

ADDRESS = os.environ.get("BRENVIK_REACHABILITY_ADDRESS", "192.0.2.1")
INTERVAL = 2.0


def checksum(data):
    total = sum(struct.unpack(f">{len(data) // 2}H", data))
    while total >> 16:
        total = (total & 0xFFFF) + (total >> 16)
    return total ^ 0xFFFF


class Proc:
    """A writable view of this network's settings; the sandbox's own is not."""

    def __init__(self, test):
        self.path = pathlib.Path("/tmp/proc")
        self.path.mkdir(exist_ok=True)
        network.run("mount", "-t", "proc", "proc", self.path)
        test.addCleanup(network.run, "umount", self.path)

    def set(self, name, value):
        (self.path / "sys" / name).write_text(value)


class HeartbeatTest(HelperTest):
    ping_group_range = "1 0"

    def prepare(self):
        network.default_settings()
        proc = Proc(self)
        proc.set("net/ipv4/ping_group_range", self.ping_group_range)
        self.far = self.make_far_end()
        if self.far is not None:
            self.tap = self.far.tap()
            self.addCleanup(self.tap.close)

    def make_far_end(self):
        far = network.FarEnd(self, "pdp_ip0", "10.5.0.1/24", ["10.5.0.2/24", f"{ADDRESS}/32"])
        network.ip("route", "add", "default", "via", "10.5.0.2")
        return far

    def silence_kernel(self):
        """The far kernel does not answer echo requests any more."""
        network.run(*self.far.command("sh", "-c",
                                      "mount -t proc proc /tmp/proc && echo 1 > /tmp/proc/sys/net/ipv4/icmp_echo_ignore_all"
                                      "; umount /tmp/proc"))

    def switch(self, on, client=None):
        client = client or self.client()
        self.assertEqual(client.status("CellularHeartbeat", struct.pack("<i", on)), 0)
        return client

    def probes(self, atleast=0, timeout=0.0):
        """[(time, IP packet)] of the echo requests that reached the far end; the time is that of time.monotonic."""
        result, end = [], time.monotonic() + timeout
        while True:
            for at, protocol, data in self.tap.packets(1, max(0.0, end - time.monotonic())):
                if protocol == network.ETH_P_IP and data[9] == socket.IPPROTO_ICMP and data[20] == 8:
                    result.append((at, data))
            if len(result) >= atleast or time.monotonic() >= end:
                return result

    def check_probe(self, packet):
        icmp = packet[20:]
        self.assertEqual(packet[0], 0x45)
        self.assertEqual(socket.inet_ntoa(packet[16:20]), ADDRESS)
        self.assertEqual(len(icmp), 48)
        kind, code, _, identifier, sequence, seconds, microseconds = struct.unpack_from(">BBHHH", icmp) + struct.unpack_from(
            "=qq", icmp, 8)
        self.assertEqual((kind, code, sequence), (8, 0, 0))
        self.assertEqual(identifier, self.daemon.pid & 0xFFFF)
        self.assertEqual(checksum(icmp), 0)
        self.assertLess(abs(time.time() - seconds - microseconds / 1e6), 60)
        self.assertEqual(icmp[24:], bytes(24))


class RawSocket(HeartbeatTest):
    """Where the group range is closed, as it is by default."""

    socket_table = "raw"

    def test_probes_go_out_by_pdp_ip0_every_two_seconds_byte_for_byte(self):
        self.machine = self.watch_machine()
        client = self.switch(1)
        # Two at once: one of the start itself, one of the timer's first firing.
        probes = self.probes(5, 20)
        self.assertGreaterEqual(len(probes), 5)
        for _, packet in probes:
            self.check_probe(packet)
        times = [at for at, _ in probes]
        self.assertLess(self.machine.ran(times[0], times[1]), 0.5)
        for earlier, later in zip(times[1:], times[2:]):
            self.check_interval(earlier, later)
        self.switch(0, client)
        time.sleep(0.3)
        eventually(lambda: self.sockets() == 0, what="the end of the last probe")
        self.probes()
        time.sleep(2 * INTERVAL)
        self.assertEqual(self.probes(), [])
        self.assertEqual(self.logs.lines, [])

    def check_interval(self, earlier, later):
        # Where the machine stood still, a probe is late, and the next one comes the sooner after it.
        room = 0.6 + self.machine.between(earlier - INTERVAL, later)
        self.assertAlmostEqual(later - earlier, INTERVAL, delta=room)

    def sockets(self):
        """How many ICMP sockets are open in our network: one while a probe waits for its reply."""
        lines = pathlib.Path(f"/proc/{self.daemon.pid}/net/{self.socket_table}").read_text().splitlines()
        return len(lines) - 1

    def answer(self, packet, identifier=None, size=48):
        reply = bytearray(packet[20:20 + size])
        reply[0], reply[2:4] = 0, b"\0\0"
        if identifier is not None:
            reply[4:6] = struct.pack(">H", identifier)
        reply[2:4] = struct.pack(">H", checksum(bytes(reply)))
        self.raw.sendto(bytes(reply), (socket.inet_ntoa(packet[12:16]), 0))

    def test_strangers_replies_and_short_ones_are_skipped_and_the_right_one_ends_the_wait(self):
        self.silence_kernel()
        self.raw = self.far.within(lambda: socket.socket(socket.AF_INET, socket.SOCK_RAW, socket.IPPROTO_ICMP))
        self.addCleanup(self.raw.close)
        self.machine = self.watch_machine()
        client = self.switch(1)

        def skipped_replies():
            *_, (at, packet) = self.probes(1, 10)
            self.answer(packet, identifier=(self.daemon.pid + 1) & 0xFFFF)
            self.answer(packet, size=46)
            return at, packet

        # The probe of the start itself: nothing that comes matches, so the timer and its first probe wait for it.
        first, _ = skipped_replies()
        second, packet = skipped_replies()
        self.assertGreater(second - first, 0.95)
        self.assertLess(self.machine.ran(first, second), 2.5)
        # A reply that is late, but not too late. When the machine has made us late as well, it is the next probe.
        for _ in range(5):
            time.sleep(0.5)
            waiting = self.sockets()
            if time.monotonic() - second < 0.7:
                break
            second, packet = skipped_replies()
        self.assertEqual(waiting, 1, "still waiting")
        self.answer(packet)
        eventually(lambda: self.sockets() == 0, 0.5, "the end of the probe")
        self.assertLess(self.machine.ran(second), 0.95, "the reply ends it, not the time-out")
        # And one in time.
        *_, (at, packet) = self.probes(1, 10)
        self.check_interval(second, at)
        self.answer(packet)
        eventually(lambda: self.sockets() == 0, 0.5, "the end of the probe")
        self.switch(0, client)


class DatagramSocket(RawSocket):
    """Where the group range is open."""

    ping_group_range = "0 2147483647"
    socket_table = "icmp"


class NoCellularInterface(HeartbeatTest):
    def make_far_end(self):
        far = network.FarEnd(self, "wifi0", "10.6.0.1/24", ["10.6.0.2/24", f"{ADDRESS}/32"])
        network.ip("route", "add", "default", "via", "10.6.0.2")
        return far

    def test_the_probe_is_still_sent_by_the_default_route(self):
        client = self.switch(1)
        (_, packet), *_ = self.probes(1, 10)
        self.check_probe(packet)
        self.switch(0, client)


class OtherRoute(HeartbeatTest):
    def make_far_end(self):
        cellular = super().make_far_end()
        wifi = network.FarEnd(self, "wifi0", "10.6.0.1/24", ["10.6.0.2/24", f"{ADDRESS}/32"], number=1)
        self.wifi_tap = wifi.tap()
        self.addCleanup(self.wifi_tap.close)
        network.ip("route", "add", f"{ADDRESS}/32", "via", "10.6.0.2")
        return cellular

    def test_the_probe_goes_by_pdp_ip0_whatever_the_better_route(self):
        client = self.switch(1)
        self.assertGreaterEqual(len(self.probes(2, 10)), 2)
        self.switch(0, client)
        self.assertEqual([p for p in self.wifi_tap.packets() if p[1] == network.ETH_P_IP], [])


class NoWayOut(HeartbeatTest):
    def make_far_end(self):
        return None

    def test_probes_that_cannot_be_sent_are_nobodys_business(self):
        client = self.switch(1)
        time.sleep(3)
        self.assertEqual(self.logs.lines, [])
        self.assertTrue(self.daemon.running())
        self.switch(0, client)


if __name__ == "__main__":
    main()
