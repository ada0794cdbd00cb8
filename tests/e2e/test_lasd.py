# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Database updates: the real daemon, a real web server over TLS, networks of our own."""
import gzip
import os
import pathlib
import plistlib
import random
import socket
import struct
import subprocess
import threading
import time

import network
import wire
from harness import ERROR, INFO, Daemon, HelperTest, eventually, main

HOST = os.environ.get("BRENVIK_LASD_HOST", "lasd.norvale.example")
ORDER = ["gsm", "umts", "cdma", "lte", "scdma"]
MASKS = {"umts": 1, "cdma": 2, "lte": 4, "gsm": 8, "scdma": 16}
ALL = 31
DIRECTORY = pathlib.Path("/var/mobile/Library/LASD")
RECORDS = pathlib.Path("/root/Library/Preferences/com.norvale.lasd.plist")
MANIFEST = f"https://{HOST}/1/v3/lasd.plist"


def request_check(client, mask):
    message = wire.simple("CheckLASDUpdate", struct.pack("<I", mask))
    reply, _ = client.channel.exchange(message)
    # This routine's reply carries no NDR record on success.
    assert wire.check_status(message, reply, ndr=bytes(8)) == 0


def available(names=ORDER):
    return [f"UpdateAvailable {name}" for name in names]


class UpdateTest(HelperTest):
    """An update server on this machine, its authority trusted, and somebody at the message port."""

    def prepare(self):
        network.default_settings()
        DIRECTORY.parent.mkdir(parents=True, exist_ok=True)
        self.addCleanup(subprocess.run, ["rm", "-rf", str(DIRECTORY)])
        self.addCleanup(RECORDS.unlink, missing_ok=True)
        self.set_hosts(f"127.0.0.1 {HOST}")
        self.authority = network.Authority(self)
        self.authority.trust(self)
        self.port = network.MessagePort(self)
        self.server = self.make_server()

    def make_server(self):
        self.good = self.authority.issue([HOST])
        return network.Nginx(self, *self.good)

    def set_hosts(self, *lines):
        hosts = pathlib.Path("/etc/hosts")
        before = hosts.read_text()
        hosts.write_text("127.0.0.1 localhost\n" + "".join(line + "\n" for line in lines))
        self.addCleanup(hosts.write_text, before)

    def serve(self, versions, contents=None, **urls):
        """Puts a manifest with these versions on the server, and each database of it."""
        (self.server.root / "1/v3").mkdir(parents=True, exist_ok=True)
        manifest = {}
        for name, version in versions.items():
            path = f"content/{name}.db.gz"
            manifest[name] = {"Version": version, "ContentURL": urls.get(name, f"https://{HOST}/{path}")}
            file = self.server.root / path
            file.parent.mkdir(exist_ok=True)
            file.write_bytes(gzip.compress((contents or self.content)(name, version), 1))
        (self.server.root / "1/v3/lasd.plist").write_bytes(plistlib.dumps(manifest))
        return manifest

    @staticmethod
    def content(name, version):
        return f"{name} {version}\n".encode() * 1000

    def check(self, mask=ALL, count=None):
        """One check; the notifications it brought."""
        before = len(self.port.texts())
        request_check(self.client_for_all(), mask)
        return self.port.wait_for(before + (count or 1))[before:]

    def client_for_all(self):
        if getattr(self, "_client", None) is None:
            self._client = self.client()
        return self._client

    def records(self):
        return plistlib.loads(RECORDS.read_bytes()) if RECORDS.exists() else {}

    def assert_installed(self, manifest, contents=None):
        self.assertEqual(self.records(), manifest)
        for name, entry in manifest.items():
            self.assertEqual((DIRECTORY / f"{name}.db").read_bytes(),
                             (contents or self.content)(name, entry["Version"]), name)
        self.assertEqual(sorted(file.name for file in DIRECTORY.iterdir()), sorted(f"{name}.db" for name in manifest))

    def assert_asked(self, *paths, since=0):
        eventually(lambda: len(self.server.requests()) >= since + len(paths), what=f"requests for {paths}")
        self.assertEqual(self.server.requests()[since:], list(paths))

    def failure(self, url, error, code=0, status="no status"):
        return f"HTTP request failed for URL {url} with error {error} errorcode {code} ({status})"

    def assert_check_fails(self, error, code=0, status="no status"):
        self.assertEqual(self.check(), ["UpdateFailed"])
        self.logs.wait_for("unified", ERROR, self.failure(MANIFEST, error, code, status))
        self.logs.wait_for("unified", ERROR, f"Could not fetch data from source {MANIFEST}")
        self.assertFalse(DIRECTORY.exists())


class Environment(UpdateTest):
    def test_nothing_in_it_changes_a_download_or_tells_of_its_keys(self):
        keys = pathlib.Path("/tmp/keys")
        self.daemon.stop()
        proxies = {name: "http://127.0.0.1:9" for name in ("https_proxy", "HTTPS_PROXY", "all_proxy", "ALL_PROXY")}
        self.daemon = Daemon(environment={
            **proxies, "SSLKEYLOGFILE": str(keys), "SSL_CERT_FILE": "/nowhere", "SSL_CERT_DIR": "/nowhere",
            "CURL_CA_BUNDLE": "/nowhere", "OPENSSL_CONF": "/nowhere", "RES_OPTIONS": "use-vc", "HOSTALIASES": "/nowhere",
            "HOME": "/nowhere", "CURL_HOME": "/nowhere", "TZ": "Nowhere/Nothing"})
        manifest = self.serve({"gsm": 1})
        self.assertEqual(self.check(), ["UpdateAvailable gsm"])
        self.assert_installed(manifest)
        self.assertFalse(keys.exists())


class Updates(UpdateTest):
    def test_all_five_are_installed_and_announced_in_order_and_a_second_check_finds_nothing_to_do(self):
        self.assertIsNone(self.daemon.network_worker(), "it must not cost a start that has no use for it")
        manifest = self.serve({name: "1.0" for name in ORDER})
        self.assertEqual(self.check(count=5), available())
        self.assert_installed(manifest)
        self.assertEqual(DIRECTORY.stat().st_mode & 0o7777, 0o755)
        self.assert_asked("/1/v3/lasd.plist", *(f"/content/{n}.db.gz" for n in ORDER))
        for header in self.port.headers:
            self.assertEqual((header[0], header[2], header[3], header[4], header[5]), (0, 0, 0, 0, 0))
        self.assertIn("libcurl", self.daemon.network_worker_maps())
        for library in ("libcurl", "libssl", "libz."):
            self.assertNotIn(library, self.daemon.maps())
        self.logs.wait_for("unified", INFO, "Trying to see if update available for mask 1f")
        self.logs.wait_for("unified", INFO, "Downloaded scdma database version 1.0 successfully")

        self.assertEqual(self.check(), ["NoUpdateRequired"])
        self.logs.wait_for("unified", ERROR, "No update required for any databases")
        self.assert_asked("/1/v3/lasd.plist", since=6)

    def test_versions_compare_by_the_table(self):
        local = {"gsm": "2.0", "umts": "ABC", "cdma": "3.1", "lte": "1.9", "scdma": "1"}
        server = {"gsm": "2.00", "umts": "abc", "cdma": "3.0", "lte": "1.10", "scdma": "1.0"}
        RECORDS.parent.mkdir(parents=True, exist_ok=True)
        RECORDS.write_bytes(plistlib.dumps({n: {"Version": v} for n, v in local.items()}, fmt=plistlib.FMT_BINARY))
        self.serve(server)
        self.assertEqual(self.check(count=3), available(["cdma", "lte", "scdma"]))
        self.logs.wait_for("unified", INFO, "gsm version 2.0 matches server version")
        self.logs.wait_for("unified", INFO, "umts version ABC matches server version")
        self.logs.wait_for("unified", INFO, "We have cdma version 3.1, server has 3.0, update required")

    def test_an_update_replaces_the_older_database(self):
        self.serve({"gsm": "1"})
        self.check(MASKS["gsm"])
        manifest = self.serve({"gsm": "2"})
        self.assertEqual(self.check(MASKS["gsm"]), available(["gsm"]))
        self.assert_installed(manifest)
        self.logs.wait_for("unified", INFO, f"Removed old database {DIRECTORY}/gsm.db")

    def test_a_record_that_another_process_removes_or_replaces_decides_the_next_check(self):
        manifest = self.serve({"gsm": "1"})
        self.assertEqual(self.check(MASKS["gsm"]), available(["gsm"]))
        self.assertEqual(self.check(MASKS["gsm"]), ["NoUpdateRequired"])
        changed = RECORDS.with_suffix(".new")
        for records in ({"other": "stays"}, {"gsm": {"Version": "0"}, "other": "stays"}):
            changed.write_bytes(plistlib.dumps(records))
            changed.rename(RECORDS)
            self.assertEqual(self.check(MASKS["gsm"]), available(["gsm"]))
            self.assertEqual(self.records(), {**manifest, "other": "stays"})
        RECORDS.unlink()
        self.assertEqual(self.check(MASKS["gsm"]), available(["gsm"]))
        self.assertEqual(self.records(), manifest)

    def test_mask_0_fetches_the_manifest_and_finds_nothing(self):
        self.serve({"gsm": "1"})
        self.assertEqual(self.check(0), ["NoUpdateRequired"])
        self.assert_asked("/1/v3/lasd.plist")

    def test_a_failed_database_does_not_stop_the_others(self):
        self.serve({name: "1" for name in ORDER})
        (self.server.root / "content/umts.db.gz").unlink()
        cut = self.server.root / "content/lte.db.gz"
        cut.write_bytes(cut.read_bytes()[:-5])
        self.assertEqual(self.check(count=5), ["UpdateAvailable gsm", "UpdateFailed", "UpdateAvailable cdma",
                                               "UpdateFailed", "UpdateAvailable scdma"])
        url = f"https://{HOST}/content/umts.db.gz"
        self.logs.wait_for("unified", ERROR, self.failure(url, "no error", 404, "Not Found"))
        self.logs.wait_for("unified", ERROR,
                           f"Cannot download file {url}. Either Wifi is turned OFF or not Wifi attached")
        self.logs.wait_for("unified", ERROR, f"Failed to commit the data to file for {DIRECTORY}/lte.db.tmp")
        self.assertEqual(sorted(self.records()), ["cdma", "gsm", "scdma"])
        self.assertEqual(sorted(f.name for f in DIRECTORY.iterdir()), ["cdma.db", "gsm.db", "scdma.db"])
        manifest = self.serve({name: "1" for name in ORDER})
        self.assertEqual(self.check(count=2), available(["umts", "lte"]))
        self.assert_installed(manifest)

    def test_a_manifest_that_is_no_dictionary_means_nothing_to_do(self):
        self.serve({})
        (self.server.root / "1/v3/lasd.plist").write_text("<html>log in first</html>")
        self.assertEqual(self.check(), ["NoUpdateRequired"])
        self.logs.wait_for("unified", ERROR, "Could not create version dictionary from downloaded plist!")

    def test_an_update_without_a_url_is_not_announced(self):
        manifest = self.serve({"gsm": "1", "umts": "1", "lte": "1"}, umts="")
        del manifest["lte"]["ContentURL"]
        (self.server.root / "1/v3/lasd.plist").write_bytes(plistlib.dumps(manifest))
        self.assertEqual(self.check(), available(["gsm"]))
        self.logs.wait_for("unified", ERROR, "URL for umts database is empty")
        self.logs.wait_for("unified", ERROR, "Could not find lte database URL")
        # Only those two are left, so a second check brings nothing; the third shows that it has ended.
        request_check(self.client_for_all(), ALL)
        self.assertEqual(self.check(MASKS["gsm"]), ["NoUpdateRequired"])

    def test_gzip_members_are_joined_and_a_cut_file_or_bytes_after_the_last_member_are_refused(self):
        manifest = self.serve({name: "1" for name in ORDER})
        content = self.server.root / "content"
        whole = gzip.compress(self.content("gsm", "1"))
        half = len(self.content("gsm", "1")) // 2
        (content / "gsm.db.gz").write_bytes(gzip.compress(self.content("gsm", "1")[:half]) + gzip.compress(b"")
                                            + gzip.compress(self.content("gsm", "1")[half:]))
        (content / "umts.db.gz").write_bytes(whole[:-1])
        (content / "cdma.db.gz").write_bytes(whole + b"trailing bytes")
        (content / "lte.db.gz").write_bytes(whole + gzip.compress(b"cut")[:-4])
        self.assertEqual(self.check(count=5), ["UpdateAvailable gsm", "UpdateFailed", "UpdateFailed", "UpdateFailed",
                                               "UpdateAvailable scdma"])
        self.assert_installed({name: manifest[name] for name in ("gsm", "scdma")})

    def test_with_nobody_at_the_message_port_a_check_completes(self):
        path = pathlib.Path(wire.BOOTSTRAP) / self.port.NAME
        path.unlink()
        manifest = self.serve({"gsm": "1"})
        request_check(self.client_for_all(), ALL)
        eventually(lambda: self.records() == manifest)

    def mount_directory(self, size):
        """A disk of that size for the databases. It goes at once, whatever of it somebody still has open."""
        DIRECTORY.mkdir()
        network.run("mount", "-t", "tmpfs", "-o", f"size={size}", "none", DIRECTORY)
        self.addCleanup(network.run, "umount", "--lazy", DIRECTORY)

    def test_a_gzip_bomb_stops_before_the_disk_is_full(self):
        self.mount_directory("24m")
        self.serve({"gsm": "1", "lte": "1"}, lambda name, version: bytes(1 << 27) if name == "gsm" else b"small")
        self.assertEqual(self.check(count=2), ["UpdateFailed", "UpdateAvailable lte"])
        room = (24 << 20) - (24 << 20) // 50
        self.logs.wait_for("unified", ERROR, f"No room for {DIRECTORY}/gsm.db.tmp: it needs {1 << 27} bytes or more, "
                                             f"{room} are free beyond the reserve")
        self.logs.wait_for("unified", ERROR, f"Could not uncompress HTTP response to {DIRECTORY}/gsm.db.tmp!")
        self.assertEqual([f.name for f in DIRECTORY.iterdir()], ["lte.db"])

    def test_a_disk_of_a_few_megabytes_takes_a_database(self):
        self.mount_directory("4m")
        manifest = self.serve({"gsm": "1"}, lambda name, version: bytes(3 << 20))
        self.assertEqual(self.check(), available(["gsm"]))
        self.assert_installed(manifest, lambda name, version: bytes(3 << 20))


class Failures(UpdateTest):
    """Each way in which the server may not be reached; the check always ends, with one UpdateFailed.

    Those that take the client's own patience to notice are in test_lasd_stalls.
    """

    def restart(self, certificate, key, extra=""):
        self.server.stop()
        self.server.start(certificate, key, extra)
        self.serve({"gsm": "1"})

    def test_refused(self):
        self.server.stop()
        self.assert_check_fails("cannot connect")

    def test_no_manifest(self):
        self.assert_check_fails("no error", 404, "Not Found")

    def test_closed_without_a_word(self):
        self.restart(*self.good, "location /1/ { return 444; }")
        self.assert_check_fails("connection lost")

    def test_untrusted_certificate(self):
        self.restart(*network.Authority(self, "Somebody else").issue([HOST]))
        self.assert_check_fails("server certificate not trusted")

    def test_certificate_of_another_name(self):
        self.restart(*self.authority.issue(["other.example"]))
        self.assert_check_fails("server certificate not trusted")

    def test_expired_certificate_points_at_the_clock(self):
        self.restart(*self.authority.issue([HOST], "20200101000000Z", "20200201000000Z"))
        self.assert_check_fails("server certificate not valid at this time, check the system clock")

    def test_future_certificate_points_at_the_clock(self):
        self.restart(*self.authority.issue([HOST], "20480101000000Z", "20480201000000Z"))
        self.assert_check_fails("server certificate not valid at this time, check the system clock")

    def test_redirect_to_http_is_refused(self):
        self.restart(*self.good, f"location /1/ {{ return 301 http://{HOST}/elsewhere; }}")
        self.assert_check_fails("redirect to something other than https refused", 301, "Moved Permanently")

    def test_redirect_to_https_is_followed(self):
        self.restart(*self.good, f"location = /1/v3/lasd.plist {{ return 302 https://{HOST}/2/lasd.plist; }}")
        (self.server.root / "2").mkdir()
        (self.server.root / "1/v3/lasd.plist").rename(self.server.root / "2/lasd.plist")
        self.assertEqual(self.check(), available(["gsm"]))

    def test_oversized_body(self):
        self.restart(*self.good)
        with open(self.server.root / "1/v3/lasd.plist", "wb") as file:
            file.truncate((16 << 20) + 1)
        self.assert_check_fails("response too large", 200, "OK")

    def test_empty_body(self):
        self.restart(*self.good)
        (self.server.root / "1/v3/lasd.plist").write_bytes(b"")
        self.assertEqual(self.check(), ["UpdateFailed"])
        self.logs.wait_for("unified", INFO, f"URL retrieved {MANIFEST}, size: 0 ")

    def test_reset_in_the_middle(self):
        self.server.stop()
        certificate, key = self.good
        import ssl
        context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
        context.load_cert_chain(certificate, key)
        listener = socket.create_server(("127.0.0.1", 443))
        self.addCleanup(listener.close)

        def serve():
            connection, _ = listener.accept()
            tls = context.wrap_socket(connection, server_side=True)
            tls.recv(4096)
            tls.sendall(b"HTTP/1.1 200 OK\r\nContent-Length: 100000\r\n\r\nsome")
            tls.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, struct.pack("ii", 1, 0))
            tls.close()

        thread = threading.Thread(target=serve)
        thread.start()
        self.addCleanup(thread.join)
        self.assertEqual(self.check(), ["UpdateFailed"])
        # A reset throws away what the client has not read yet, so it may or may not have seen the status.
        expected = [("unified", ERROR, self.failure(MANIFEST, "connection lost", *seen))
                    for seen in ((200, "OK"), (0, "no status"))]
        eventually(lambda: any(line in self.logs.lines for line in expected), what="one of the two lines")
        self.logs.wait_for("unified", ERROR, f"Could not fetch data from source {MANIFEST}")
        self.assertFalse(DIRECTORY.exists())


class Kills(UpdateTest):
    def test_twenty_kills_during_an_install_are_each_repaired_by_the_next_check(self):
        seed = 20
        choose = random.Random(seed)
        blob = {name: choose.randbytes(300_000) for name in ORDER}

        def contents(name, version):
            return blob[name] + version.encode()

        self.serve({name: "0" for name in ORDER}, contents)
        self.check(count=5)
        self.serve({name: "0.1" for name in ORDER}, contents)  # the first has loaded the HTTP client
        begun = time.monotonic()
        self.check(count=5)
        whole = time.monotonic() - begun
        interrupted = 0
        for kill in range(1, 21):
            manifest = self.serve({name: str(kill) for name in ORDER}, contents)
            request_check(self.client_for_all(), ALL)
            time.sleep(whole * kill / 21)
            self.daemon.process.kill()
            self.daemon.wait()
            self.daemon.stop()
            if self.records() != manifest:
                interrupted += 1
                whole *= 1.05
            else:
                whole *= 0.6  # the machine is faster now than it was
            for name, entry in self.records().items():
                # Whatever is recorded is there whole: as recorded, or not there, or newer.
                file = DIRECTORY / f"{name}.db"
                if file.exists():
                    self.assertIn(file.read_bytes(),
                                  (contents(name, entry["Version"]), contents(name, str(kill))), f"seed {seed}")
            self._client = None
            self.port.clear()
            self.daemon = Daemon()
            self.addCleanup(self.daemon.stop)
            done = [name for name in ORDER if self.records().get(name) == manifest[name]]
            expected = available([n for n in ORDER if n not in done]) or ["NoUpdateRequired"]
            self.assertEqual(self.check(count=len(expected)), expected)
            self.assert_installed(manifest, contents)
        self.assertGreater(interrupted, 10, "the kills must fall into the installs")


class Cellular(UpdateTest):
    """The update server is another machine; whether the way there is cellular is up to the test."""

    def make_server(self):
        return None

    def far_server(self, far):
        self.server = network.Nginx(self, *self.authority.issue([HOST]), prefix=far.command())
        return self.serve({"gsm": "1"})

    def set_name_server(self, address):
        resolver = pathlib.Path("/etc/resolv.conf")
        before = resolver.read_text()
        self.addCleanup(resolver.write_text, before)
        resolver.write_text(f"nameserver {address}\noptions timeout:1 attempts:1\n")

    def test_where_only_pdp_ip0_leads_out_nothing_is_fetched_and_the_other_side_sees_no_packet(self):
        far = network.FarEnd(self, "pdp_ip0", "10.5.0.1/24", "10.5.0.2/24")
        network.ip("route", "add", "default", "via", "10.5.0.2")
        self.far_server(far)
        tap = far.tap()
        self.addCleanup(tap.close)
        self.set_name_server("10.5.0.2")
        for hosts in ([], [f"10.5.0.2 {HOST}"]):  # the name to be looked up, and known
            self.set_hosts(*hosts)
            self.assertEqual(self.check(), ["UpdateFailed"])
        self.logs.wait_for("unified", ERROR, self.failure(MANIFEST, "cellular access not allowed"))
        self.assertEqual(tap.packets(), [])
        self.assertEqual(self.server.user_requests(), "")
        # The tap sees: the same way without the rule.
        with socket.create_connection(("10.5.0.2", 443), 5):
            self.assertGreater(len(tap.packets(1, 5)), 0)

    def test_with_another_way_the_update_takes_it_and_pdp_ip0_stays_silent(self):
        cellular = network.FarEnd(self, "pdp_ip0", "10.5.0.1/24", "10.5.0.2/24", number=0)
        wifi = network.FarEnd(self, "wifi0", "10.6.0.1/24", "10.6.0.2/24", number=1)
        network.ip("route", "add", "default", "via", "10.5.0.2")
        manifest = self.far_server(wifi)
        tap = cellular.tap()
        self.addCleanup(tap.close)
        self.set_name_server("10.5.0.2")
        self.set_hosts(f"10.6.0.2 {HOST}")
        self.assertEqual(self.check(), available(["gsm"]))
        self.assert_installed(manifest)
        self.assertEqual(tap.packets(), [])

    def test_a_database_whose_url_leads_over_pdp_ip0_is_refused(self):
        cellular = network.FarEnd(self, "pdp_ip0", "10.5.0.1/24", "10.5.0.2/24", number=0)
        wifi = network.FarEnd(self, "wifi0", "10.6.0.1/24", "10.6.0.2/24", number=1)
        self.far_server(wifi)
        self.serve({"gsm": "1"}, gsm="https://10.5.0.2/content/gsm.db.gz")
        tap = cellular.tap()
        self.addCleanup(tap.close)
        self.set_hosts(f"10.6.0.2 {HOST}")
        self.assertEqual(self.check(), ["UpdateFailed"])
        self.logs.wait_for("unified", ERROR,
                           self.failure("https://10.5.0.2/content/gsm.db.gz", "cellular access not allowed"))
        self.assertEqual(tap.packets(), [])


if __name__ == "__main__":
    main()
