# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Location: the real daemon, a telephony daemon that takes its pushes, coturn, and a map server over HTTPS."""
import http.server
import json
import os
import pathlib
import plistlib
import socket
import ssl
import struct
import subprocess
import sys
import threading
import time
import unittest
import urllib.parse

import harness
import network
import wire
from harness import DEBUG, DEFAULT, ERROR, LOG_ERR, LOG_NOTICE, HelperTest, eventually, main

STUN = os.environ.get("BRENVIK_STUN_SERVER", "stun.norvale.example:3478").rsplit(":", 1)[0]
GEOCODER = "geocoder.norvale.example"
GAZETTEER = pathlib.Path("/usr/share/brenvik/gazetteer.db")
COUNTRY = pathlib.Path("/var/lib/brenvik/country.plist")
SET_CIVIC_INFO, SET_ADDRESS = 9100001, 9100002

CIVIC_ASKED = ("bsd", LOG_ERR, "server_BVMobileHelperRequestCountryCodeFromLocation ")
CIVIC_SENT = ("bsd", LOG_NOTICE, "sendCivicInfoToQV sent civic info to Brenvik successfully")
NO_MAP_ITEMS = ("bsd", LOG_ERR, "_RequestCivicInfoFromLatitudeLongitude didn't get any mapItems")
CIVIC_NOT_AWAITED = ("bsd", LOG_ERR, "_RequestCivicInfoFromLatitudeLongitude wasn't waiting for response from GEO")
WAN_IP_ASKED = ("unified", DEBUG, "server_BVMobileHelperRequestWanIPFromLocation")
WAN_IP_SENT = ("unified", DEFAULT, "sendWanIPToQV sent WAN IP to Brenvik successfully")
WAN_IP_NOT_AWAITED = ("unified", DEFAULT, "_RequestWanIPFromLocation wasn't waiting for response from GEO")


class Brenvik:
    """The telephony daemon's service, written from the protocol: keeps every push, answers as it is told."""

    def __init__(self, test, answers=True, return_code=0, result=0, backlog=64):
        self.answers, self.return_code, self.result = answers, return_code, result
        self.path = pathlib.Path(wire.BOOTSTRAP) / "com.norvale.brenvik"
        self.path.parent.mkdir(parents=True, exist_ok=True)
        self.path.unlink(missing_ok=True)
        self.listening = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        self.listening.bind(str(self.path))
        self.listening.listen(backlog)
        self.changed = threading.Condition()
        self.pushes, self.clients = [], []
        self.kept = []
        self.thread = threading.Thread(target=self._serve, daemon=True)
        self.thread.start()
        test.addCleanup(self._close)

    def _serve(self):
        while True:
            try:
                connection, _ = self.listening.accept()
            except OSError:
                return
            data = connection.recv(wire.LARGEST)
            if not data:  # the helper thought better of it
                connection.close()
                continue
            bits, size, reply_port, local, voucher, message_id, count = struct.unpack_from("<IIIIIiI", data)
            address, _, _, _, kind, length = struct.unpack_from("<QBBBBI", data, 28)
            assert (bits, size, local, voucher, count, address, kind) == (wire.COMPLEX | 18, 52, 0, 0, 1, 56, 1), data
            assert reply_port != 0 and data[44:52] == wire.NDR and len(data) == 56 + length
            values = plistlib.loads(data[56:], fmt=plistlib.FMT_BINARY)
            if self.answers:
                # Answered first: whoever sees the push may rely on its being answered.
                connection.send(struct.pack("<IIIIIi", 18, 44, 0, reply_port, 0, message_id + 100) + wire.NDR
                                + struct.pack("<iQ", self.return_code, self.result))
                connection.close()
            else:
                self.kept.append(connection)
            with self.changed:
                self.clients.append(values.pop("Client"))
                self.pushes.append((message_id, values))
                self.changed.notify_all()

    def _close(self):
        self.listening.shutdown(socket.SHUT_RDWR)
        self.thread.join()
        self.listening.close()
        for connection in self.kept:
            connection.close()
        self.path.unlink(missing_ok=True)

    def wait_for(self, count, timeout=20):
        """The first `count` pushes."""
        with self.changed:
            if not self.changed.wait_for(lambda: len(self.pushes) >= count, timeout):
                raise AssertionError(f"{len(self.pushes)} of {count} pushes: {self.pushes}")
            return list(self.pushes)


def civic(country="", state="", city="", postal=""):
    return SET_CIVIC_INFO, {"CountryCode": country, "State": state, "City": city, "PostalCode": postal}


def address(text):
    return SET_ADDRESS, {"Address": text}


def coordinate(latitude, longitude):
    return struct.pack("<dd", latitude, longitude)


class LocationTest(HelperTest):
    def prepare(self):
        network.default_settings()
        self.configure("NO")

    def configure(self, code):
        COUNTRY.parent.mkdir(parents=True, exist_ok=True)
        COUNTRY.write_bytes(plistlib.dumps({"CountryCode": code}))
        self.addCleanup(COUNTRY.unlink, missing_ok=True)

    def resolve(self, *lines):
        hosts = pathlib.Path("/etc/hosts")
        before = hosts.read_text()
        hosts.write_text(before + "".join(line + "\n" for line in lines))
        self.addCleanup(hosts.write_text, before)

    def ask_civic(self, client, latitude, longitude):
        self.assertEqual(client.status("RequestCountryCodeFromLocation", coordinate(latitude, longitude)), 0)

    def ask_wan_ip(self, client):
        self.assertEqual(client.status("RequestWanIPFromLocation"), 0)

    def check_others_are_served(self, client):
        """While something waits for a second or more: other requests take milliseconds."""
        machine = self.watch_machine()
        moments = [time.monotonic()]
        for _ in range(11):
            client.text("CopyCountryCode", size=64)
            moments.append(time.monotonic())
        times = list(map(machine.ran, moments, moments[1:]))
        # Room for a busy machine, but none for a wait.
        self.assertLess(sorted(times)[5], 0.05)
        self.assertLess(max(times), 0.5)

    def lines(self, *wanted):
        for line in wanted:
            self.logs.wait_for(*line)


class OfflineTest(LocationTest):
    def test_well_known_places(self):
        brenvik = Brenvik(self)
        client = self.client()
        for latitude, longitude, country, state in (
                (48.8584, 2.2945, "FR", "Île-de-France"), (51.5007, -0.1246, "GB", "England"),
                (40.6892, -74.0445, "US", "New York"), (-33.8568, 151.2153, "AU", "New South Wales"),
                (35.6586, 139.7454, "JP", "Tokyo")):
            before = len(brenvik.pushes)
            self.ask_civic(client, latitude, longitude)
            message_id, values = brenvik.wait_for(before + 1)[-1]
            self.assertEqual(message_id, SET_CIVIC_INFO)
            self.assertEqual((values["CountryCode"], values["State"], values["PostalCode"]), (country, state, ""))
            self.assertTrue(values["City"])
        self.assertEqual(set(map(tuple, brenvik.clients)), {("BrenvikMobileHelper",)})

    def test_every_line_of_an_answer(self):
        brenvik = Brenvik(self)
        self.ask_civic(self.client(), 59.9133, 10.739)
        self.assertEqual(brenvik.wait_for(1), [civic("NO", "Oslo", "Oslo")])
        self.lines(CIVIC_SENT)
        self.assertEqual([line for line in self.logs.lines if line[0] == "bsd"], [
            CIVIC_ASKED,
            ("bsd", LOG_NOTICE, "_RequestCivicInfoFromLatitudeLongitude mapItems: (1)"),
            ("bsd", LOG_NOTICE, "_RequestCivicInfoFromLatitudeLongitude country code: NO"),
            ("bsd", LOG_NOTICE, "_RequestCivicInfoFromLatitudeLongitude state: Oslo"),
            ("bsd", LOG_NOTICE, "_RequestCivicInfoFromLatitudeLongitude city: Oslo"),
            CIVIC_SENT])

    def test_the_position_zero_is_the_configured_country(self):
        brenvik = Brenvik(self)
        self.ask_civic(self.client(), 0.0, 0.0)
        self.assertEqual(brenvik.wait_for(1), [civic("NO")])
        self.lines(CIVIC_ASKED, CIVIC_SENT)
        self.assertIsNone(self.daemon.network_worker())

    def test_numbers_that_are_no_coordinate_are_an_error_and_the_fallback(self):
        brenvik = Brenvik(self)
        client = self.client()
        inf, nan = float("inf"), float("nan")
        wrong = [(nan, nan), (inf, 0.0), (0.0, -inf), (90.1, 0.0), (0.0, 180.1), (1e308, -1e308)]
        for number, (latitude, longitude) in enumerate(wrong, 1):
            self.ask_civic(client, latitude, longitude)
            self.assertEqual(brenvik.wait_for(number)[-1], civic("NO"))
        self.lines(("bsd", LOG_ERR, "_RequestCivicInfoFromLatitudeLongitude error: (the coordinate is out of range)"),
                   NO_MAP_ITEMS)
        self.assertTrue(self.daemon.running())

    def test_the_open_sea_is_no_map_items(self):
        brenvik = Brenvik(self)
        self.ask_civic(self.client(), 0.0, -140.0)
        self.assertEqual(brenvik.wait_for(1), [civic("NO")])
        self.lines(NO_MAP_ITEMS)

    def test_without_gazetteer_a_request_ends_in_an_error(self):
        network.run("mount", "--bind", "/dev/null", GAZETTEER)
        self.addCleanup(network.run, "umount", GAZETTEER)
        brenvik = Brenvik(self)
        self.ask_civic(self.client(), 48.8584, 2.2945)
        self.assertEqual(brenvik.wait_for(1), [civic("NO")])
        self.lines(NO_MAP_ITEMS)
        errors = [text for _, _, text in self.logs.lines if "error: (the offline gazetteer cannot be read: " in text]
        self.assertEqual(len(errors), 1)

    def test_country_code(self):
        client = self.client()
        self.assertEqual(client.text("CopyCountryCode", size=64), b"NO" + bytes(62))
        self.configure("x" * 100)
        self.assertEqual(client.text("CopyCountryCode", size=64), b"x" * 64)
        COUNTRY.unlink()
        self.logs.clear()
        # The sandbox's time zone is the host's, which may have a country.
        zone = client.text("CopyCountryCode", size=64)
        if zone == bytes(64):
            self.lines(("bsd", LOG_ERR, "Didn't get valid country code from GeoService."))
        brenvik = Brenvik(self)
        self.ask_civic(client, 35.6586, 139.7454)
        brenvik.wait_for(1)
        self.assertEqual(client.text("CopyCountryCode", size=64), b"JP" + bytes(62))

    def test_of_requests_in_quick_succession_the_rest_finds_nothing_awaited(self):
        brenvik = Brenvik(self)
        client = self.client()
        # Sent without waiting for the replies, so that both are submitted before either is answered.
        message = wire.simple("RequestCountryCodeFromLocation", coordinate(48.8584, 2.2945))
        for _ in range(20):
            client.channel.send(message)
        for _ in range(20):
            self.assertEqual(wire.check_status(message, client.channel.receive()[0]), 0)
        eventually(lambda: len(brenvik.pushes) + self.logs.lines.count(CIVIC_NOT_AWAITED) == 20, what="every answer")
        self.assertEqual(self.logs.lines.count(CIVIC_ASKED), 20)
        self.assertTrue(all(values["CountryCode"] == "FR" for _, values in brenvik.pushes))


class BrenvikTest(LocationTest):
    """What the telephony daemon does to a push, and what that does to others."""

    def test_absent(self):
        self.ask_civic(self.client(), 0.0, 0.0)
        self.lines(("bsd", LOG_ERR, "sendCivicInfoToQV to Brenvik failed, could not open QVServerConnection"))

    def test_refusing(self):
        Brenvik(self, return_code=35)
        self.ask_civic(self.client(), 0.0, 0.0)
        self.lines(("bsd", LOG_NOTICE, "sendCivicInfoToQV failed civic info to Brenvik due to error: 35"))

    def test_failing(self):
        Brenvik(self, result=(22 << 32) | 1)
        self.ask_civic(self.client(), 0.0, 0.0)
        self.lines(("bsd", LOG_NOTICE, "sendCivicInfoToQV failed civic info to Brenvik due to error: 22"))

    def test_hanging(self):
        brenvik = Brenvik(self, answers=False)
        client = self.client()
        start = time.monotonic()
        self.ask_civic(client, 0.0, 0.0)  # the fallback: decided on the main queue
        brenvik.wait_for(1)
        self.check_others_are_served(client)
        self.lines(("bsd", LOG_NOTICE, "sendCivicInfoToQV failed civic info to Brenvik due to error: 110"))
        self.assertGreater(time.monotonic() - start, 0.9)

    def test_leaving(self):
        brenvik = Brenvik(self, answers=False)
        self.ask_civic(self.client(), 0.0, 0.0)
        brenvik.wait_for(1)
        eventually(lambda: brenvik.kept)
        brenvik.kept.pop().close()
        self.lines(("bsd", LOG_NOTICE, "sendCivicInfoToQV failed civic info to Brenvik due to error: 32"))

    def test_accepting_nobody(self):
        path = pathlib.Path(wire.BOOTSTRAP) / "com.norvale.brenvik"
        path.unlink(missing_ok=True)
        with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as listening:
            listening.bind(str(path))
            self.addCleanup(path.unlink)
            listening.listen(0)
            with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as first:
                first.connect(str(path))
                client = self.client()
                self.ask_civic(client, 0.0, 0.0)
                self.check_others_are_served(client)
                self.lines(("bsd", LOG_ERR, "sendCivicInfoToQV to Brenvik failed, could not open QVServerConnection"))

    def test_the_stand_in_prints_what_it_is_told(self):
        standin = subprocess.Popen(
            [harness.BUILD / "brenvik-standin", "--json", "--count", "1"], stdout=subprocess.PIPE,
            stderr=subprocess.PIPE, text=True)
        self.addCleanup(standin.wait)
        self.addCleanup(standin.kill)
        self.addCleanup(standin.stdout.close)
        self.addCleanup(standin.stderr.close)
        self.assertIn("listening in", standin.stderr.readline())
        self.ask_civic(self.client(), 59.9133, 10.739)
        self.lines(CIVIC_SENT)
        told = json.loads(standin.stdout.readline())
        self.assertIn("Oslo", json.dumps(told))


class WanIpTest(LocationTest):
    def coturn(self, ours, theirs):
        """The real server on a machine of its own, joined to ours by a cable; its addresses."""
        far = network.FarEnd(self, "wan0", ours[0], theirs)
        for more in ours[1:]:
            network.ip("-6", "address", "add", more, "dev", "wan0", "nodad")
        listening = [f"--listening-ip={each.split('/')[0]}" for each in theirs]
        server = subprocess.Popen(
            far.command("turnserver", "-n", *listening, "--listening-port=3478", "--stun-only", "--no-tcp", "--no-tls",
                        "--no-dtls", "--no-cli", "--pidfile=/tmp/turnserver.pid", "--log-file=/dev/null",
                        "--userdb=/tmp/turnserver.db"),
            stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        self.addCleanup(server.wait)
        self.addCleanup(server.kill)
        def bound():
            sockets = network.run(*far.command("ss", "-Hlun", "sport", "=", "3478")).stdout
            return all(f"{each.split('/')[0]}" in sockets for each in theirs)
        eventually(bound, 20, "coturn")

    def test_ipv4(self):
        self.coturn(["198.51.100.7/24"], ["198.51.100.1/24"])
        self.resolve(f"198.51.100.1 {STUN}")
        brenvik = Brenvik(self)
        self.ask_wan_ip(self.client())
        self.assertEqual(brenvik.wait_for(1), [address("198.51.100.7")])
        self.lines(WAN_IP_ASKED, ("unified", DEFAULT, "_RequestWanIPFromLocation WAN IP: 198.51.100.7"), WAN_IP_SENT)

    @unittest.skipUnless(network.has_ipv6(), "this machine has no IPv6")
    def test_ipv6(self):
        self.coturn(["198.51.100.7/24", "2001:db8::7/64"], ["198.51.100.1/24", "2001:db8::1/64"])
        self.resolve(f"2001:db8::1 {STUN}")
        brenvik = Brenvik(self)
        self.ask_wan_ip(self.client())
        self.assertEqual(brenvik.wait_for(1), [address("2001:db8::7")])

    def test_a_server_nobody_reaches_on_one_family_answers_on_the_other(self):
        self.coturn(["198.51.100.7/24"], ["198.51.100.1/24"])
        configuration = pathlib.Path("/etc/host.conf")
        configuration.write_text("multi on\n")  # all lines of a name, not only the first
        self.addCleanup(configuration.unlink)
        self.resolve(f"2001:db8::1 {STUN}", f"198.51.100.1 {STUN}")
        brenvik = Brenvik(self)
        self.ask_wan_ip(self.client())
        self.assertEqual(brenvik.wait_for(1), [address("198.51.100.7")])

    def test_nobody_listening_is_an_error_at_once(self):
        self.resolve(f"127.0.0.1 {STUN}")
        brenvik = Brenvik(self)
        machine = self.watch_machine()
        start = time.monotonic()
        self.ask_wan_ip(self.client())
        self.assertEqual(brenvik.wait_for(1), [address("")])
        self.assertLess(machine.ran(start), 4)
        self.lines(("unified", ERROR, "_RequestWanIPFromLocation error: (the STUN server cannot be reached)"),
                   WAN_IP_SENT)

    def stun_server(self, answer):
        """A server of our own on this machine; answer(request, sender) gives the datagrams it sends."""
        server = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
        server.setsockopt(socket.SOL_SOCKET, network.SO_TIMESTAMPNS, 1)
        server.bind(("127.0.0.1", 3478))
        self.resolve(f"127.0.0.1 {STUN}")
        requests = []

        def serve():
            while True:
                try:
                    request, ancillary, _, sender = server.recvmsg(2048, 128)
                except OSError:
                    return
                if request == b"end":
                    return
                requests.append((network.arrival(ancillary), request))
                for datagram in answer(request, sender):
                    server.sendto(datagram, sender)

        thread = threading.Thread(target=serve, daemon=True)
        thread.start()

        def end():
            with socket.socket(socket.AF_INET, socket.SOCK_DGRAM) as ending:
                ending.sendto(b"end", ("127.0.0.1", 3478))
            thread.join()
            server.close()

        self.addCleanup(end)
        return requests

    def test_no_answer_within_five_seconds_is_an_empty_address_and_the_late_error_is_dropped(self):
        requests = self.stun_server(lambda request, sender: [])
        brenvik = Brenvik(self)
        machine = self.watch_machine()
        start = time.monotonic()
        self.ask_wan_ip(self.client())
        self.assertEqual(brenvik.wait_for(1), [address("")])
        self.assertGreaterEqual(time.monotonic() - start, 4.9)
        self.lines(WAN_IP_SENT, WAN_IP_NOT_AWAITED)
        self.assertEqual(len(brenvik.pushes), 1)
        # The same question five times, at 0, 0.25, 0.75, 1.75 and 3.75 s.
        self.assertEqual(len({request for _, request in requests}), 1)
        self.assertLessEqual(len(requests), 5)
        if requests[0][0] - start > 0.2 or machine.between(start, start + 5) > 0.2:
            return  # those that fall due while the machine stands still are one
        self.assertEqual(len(requests), 5)
        for (at, _), due in zip(requests, (0, 0.25, 0.75, 1.75, 3.75)):
            self.assertGreaterEqual(at - start, due - 0.05)
            self.assertLess(at - start, due + 1)

    @staticmethod
    def seen_as(text, request, identity=None):
        """The answer of a server that sees the request come from this IPv4 address."""
        cookie = request[4:8]
        mapped = bytes([0, 1, 0x11, 0x22, *(a ^ b for a, b in zip(socket.inet_aton(text), cookie))])
        return b"\x01\x01\x00\x0c" + cookie + (identity or request[8:]) + b"\x00\x20\x00\x08" + mapped

    def test_lies_are_ignored_and_said(self):
        def lies(request, sender):
            truth = self.seen_as("203.0.113.9", request)
            return [b"", b"no STUN", self.seen_as("203.0.113.66", request, bytes(12)), truth[:-1], truth]

        self.stun_server(lies)
        brenvik = Brenvik(self)
        self.ask_wan_ip(self.client())
        self.assertEqual(brenvik.wait_for(1), [address("203.0.113.9")])
        self.lines(("unified", ERROR, "geo service: ignored what does not answer the STUN request"))

    def test_a_second_question_goes_out_at_once_and_its_answer_counts(self):
        seen = []

        def answer(request, sender):
            if request not in seen:
                seen.append(request)
            return [self.seen_as("203.0.113.9", request)] if request != seen[0] else []

        self.stun_server(answer)
        brenvik = Brenvik(self)
        client = self.client()
        self.ask_wan_ip(client)
        eventually(lambda: seen, what="the first question")
        self.ask_wan_ip(client)
        self.assertEqual(brenvik.wait_for(1), [address("203.0.113.9")])
        self.assertEqual(len(seen), 2)

    def test_an_answer_without_an_address_ends_at_once_by_the_error_road(self):
        self.stun_server(lambda request, sender: [self.seen_as("0.1.2.3", request)])
        brenvik = Brenvik(self)
        self.ask_wan_ip(self.client())
        self.assertEqual(brenvik.wait_for(1), [address("")])
        self.lines(("unified", ERROR, "_RequestWanIPFromLocation error: (the STUN server's answer has no address)"),
                   WAN_IP_SENT)

    def test_a_civic_answer_takes_the_flag_of_an_outstanding_address_request(self):
        brenvik = Brenvik(self)
        self.stun_server(lambda request, sender: [self.seen_as("203.0.113.9", request)] if brenvik.pushes else [])
        client = self.client()
        self.ask_wan_ip(client)
        self.ask_civic(client, 59.9133, 10.739)
        self.assertEqual(brenvik.wait_for(1), [civic("NO", "Oslo", "Oslo")])
        self.lines(WAN_IP_NOT_AWAITED)
        self.assertEqual(len(brenvik.pushes), 1)

    def test_the_daemon_serves_others_while_it_waits(self):
        self.stun_server(lambda request, sender: [])
        client = self.client()
        self.ask_wan_ip(client)
        self.check_others_are_served(client)


class MapServer:
    """A Nominatim-compatible server over HTTPS; `answer` gets the handler and writes the response."""

    def __init__(self, test, certificate, key):
        self.requests, self.answer = [], self.not_found
        outer = self

        class Handler(http.server.BaseHTTPRequestHandler):
            def do_GET(self):
                outer.requests.append((self.path, dict(self.headers)))
                try:
                    outer.answer(self)
                except (BrokenPipeError, ConnectionResetError, ssl.SSLError):
                    pass

            def log_message(self, *_):
                pass

        class Server(http.server.ThreadingHTTPServer):
            daemon_threads = True

            def handle_error(self, *_):
                pass

        self.server = Server(("127.0.0.1", 443), Handler)
        context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
        context.load_cert_chain(certificate, key)
        self.server.socket = context.wrap_socket(self.server.socket, server_side=True)
        self.thread = threading.Thread(target=self.server.serve_forever, kwargs={"poll_interval": 0.05}, daemon=True)
        self.thread.start()
        test.addCleanup(self._end)

    def _end(self):
        self.server.shutdown()
        self.thread.join()
        self.server.server_close()

    @staticmethod
    def send(handler, status, body, kind="application/json"):
        body = body.encode() if isinstance(body, str) else body
        handler.send_response(status)
        handler.send_header("Content-Type", kind)
        handler.send_header("Content-Length", str(len(body)))
        handler.end_headers()
        handler.wfile.write(body)

    @classmethod
    def not_found(cls, handler):
        cls.send(handler, 404, "no")


PARIS = {"place_id": 1, "address": {"city": "Paris", "state": "Île-de-France", "postcode": "75007",
                                    "country": "France", "country_code": "fr"}}


class GeocoderTest(LocationTest):
    def prepare(self):
        super().prepare()
        daemon = harness.DAEMON
        harness.DAEMON = harness.BUILD / "BrenvikMobileHelper-geocoder"
        self.addCleanup(setattr, harness, "DAEMON", daemon)
        authority = network.Authority(self)
        authority.trust(self)
        self.resolve(f"127.0.0.1 {GEOCODER}")
        self.map = MapServer(self, *authority.issue([GEOCODER]))

    def says(self, body, status=200, kind="application/json"):
        self.map.answer = lambda handler: MapServer.send(handler, status, body, kind)

    def pushed(self, latitude=48.8584, longitude=2.2945):
        brenvik = Brenvik(self)
        self.ask_civic(self.client(), latitude, longitude)
        return brenvik.wait_for(1)[0]

    def assertOffline(self, pushed):
        self.assertEqual(pushed[1]["CountryCode"], "FR")
        self.assertEqual(pushed[1]["PostalCode"], "")

    def assertSaid(self, why):
        eventually(lambda: any(f"the geocoder failed ({why})" in text for _, _, text in self.logs.lines),
                   what=f"a line that says {why!r} among {self.logs.lines}")

    def test_the_servers_answer_is_pushed(self):
        self.says(json.dumps(PARIS))
        self.assertEqual(self.pushed(), civic("FR", "Île-de-France", "Paris", "75007"))
        (path, headers), = self.map.requests
        url = urllib.parse.urlsplit(path)
        self.assertEqual(url.path, "/nominatim/reverse")
        query = urllib.parse.parse_qs(url.query)
        self.assertEqual(query["format"], ["jsonv2"])
        self.assertEqual((float(query["lat"][0]), float(query["lon"][0])), (48.8584, 2.2945))
        self.assertTrue(headers["User-Agent"].startswith("BrenvikMobileHelper/"))
        # The gazetteer looks over the country code: its rules hold for servers, too.
        self.assertIn("sqlite", self.daemon.network_worker_maps())
        self.assertNotIn("sqlite", self.daemon.maps())

    def test_unable_to_geocode_is_no_map_items(self):
        self.says('{"error":"Unable to geocode"}')
        self.assertEqual(self.pushed(), civic("NO"))
        self.lines(NO_MAP_ITEMS)

    def test_html_is_answered_offline(self):
        self.says("<!DOCTYPE html><title>Sign in</title>", kind="text/html")
        self.assertOffline(self.pushed())
        self.assertSaid("the geocoder's answer is not a JSON object")

    def test_half_a_text_is_answered_offline(self):
        self.says(json.dumps(PARIS)[:-20])
        self.assertOffline(self.pushed())

    def test_noise_is_answered_offline(self):
        self.says(os.urandom(5000))
        self.assertOffline(self.pushed())

    def test_a_refusal_is_answered_offline(self):
        self.says('{"error":"slow down"}', status=429)
        self.assertOffline(self.pushed())

    def test_a_hundred_megabytes_are_cut_off(self):
        sent = []

        def flood(handler):
            handler.send_response(200)
            handler.send_header("Content-Length", str(100 << 20))
            handler.end_headers()
            chunk = b" " * (1 << 16)
            for _ in range(1600):
                handler.wfile.write(chunk)
                sent.append(len(chunk))

        self.map.answer = flood
        before = self.daemon.resident_kib()
        self.assertOffline(self.pushed())
        self.assertLess(sum(sent), 20 << 20)
        self.assertLess(self.daemon.resident_kib() - before, 60 << 10)

    def test_a_body_announced_without_end_is_cut_off(self):
        def flood(handler):
            handler.send_response(200)
            handler.end_headers()  # no length: until the connection closes
            while True:
                handler.wfile.write(b"[" * 4096)

        self.map.answer = flood
        self.assertOffline(self.pushed())

    def test_a_server_that_hangs_is_overtaken_by_the_time_out(self):
        release = threading.Event()
        self.addCleanup(release.set)

        def late(handler):
            release.wait(20)
            MapServer.send(handler, 200, json.dumps(PARIS))

        self.map.answer = late
        brenvik = Brenvik(self)
        self.ask_civic(self.client(), 48.8584, 2.2945)
        self.assertEqual(brenvik.wait_for(1), [civic("NO")])
        release.set()
        self.lines(CIVIC_NOT_AWAITED)
        self.assertEqual(len(brenvik.pushes), 1)

    def test_a_late_answer_serves_the_next_request(self):
        brenvik = Brenvik(self)
        release = threading.Event()
        self.addCleanup(release.set)

        def late(handler):
            if len(self.map.requests) == 1:
                release.wait(20)
                MapServer.send(handler, 200, json.dumps(PARIS))
            else:
                release.set()
                eventually(lambda: len(brenvik.pushes) == 2, 20)
                MapServer.send(handler, 200, '{"address":{"city":"Oslo","country_code":"no"}}')

        self.map.answer = late
        client = self.client()
        self.ask_civic(client, 48.8584, 2.2945)
        brenvik.wait_for(1)  # the first one's time-out
        self.ask_civic(client, 59.9133, 10.739)
        # The first answer to come finds an answer awaited, whosever it is; the other one does not.
        pushes = brenvik.wait_for(2)
        self.assertEqual(pushes[1], civic("FR", "Île-de-France", "Paris", "75007"))
        self.lines(CIVIC_NOT_AWAITED)

    def test_the_server_is_asked_once_a_second(self):
        times = []

        def note(handler):
            times.append(time.monotonic())
            MapServer.send(handler, 200, json.dumps(PARIS))

        self.map.answer = note
        client = self.client()
        asked = time.monotonic()
        for _ in range(3):
            self.ask_civic(client, 48.8584, 2.2945)
        eventually(lambda: len(times) == 3, 30, "three requests")
        # The first may be late, for it takes a connection; the third comes two seconds after it was due.
        self.assertGreater(times[2] - asked, 1.9)

    def test_a_certificate_nobody_trusts_is_answered_offline(self):
        self.map._end()
        stranger = network.Authority(self, "Stranger")
        self.map.__init__(self, *stranger.issue([GEOCODER]))
        self.assertOffline(self.pushed())
        self.assertEqual(self.map.requests, [])


if __name__ == "__main__":
    main()
