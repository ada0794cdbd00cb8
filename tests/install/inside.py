#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The life of the packages on a real system, from installation to purge. Runs in a container, as root, once."""
import contextlib
import ctypes
import fcntl
import glob
import grp
import gzip
import http.server
import json
import os
import pathlib
import plistlib
import pwd
import resource
import select
import socket
import sqlite3
import ssl
import stat
import struct
import subprocess
import sys
import threading
import time
import zlib

SERVICE = "brenvik-mobile-helper.service"
SOCKET = "brenvik-mobile-helper.socket"
PATH = "/run/brenvik/bootstrap/com.norvale.brenvik.mobile-helper"
WORKERS = {"caller": PATH + ".callers", "network": PATH + ".network", "store": PATH + ".stores"}
HELPER = "/usr/libexec/brenvik/BrenvikMobileHelper"
IDLE = 10.0
CIVIC_PUSH, ADDRESS_PUSH = 'country "NO", city "Oslo"', 'address "203.0.113.9"'
UPDATE_NOTICE = 'notification "com.norvale.lasd.UpdateAvailable"'


def run(*command, check=True, **more):
    done = subprocess.run([str(each) for each in command], capture_output=True, text=True, timeout=120, check=False, **more)
    if check and done.returncode != 0:
        raise AssertionError(f"{' '.join(map(str, command))}: status {done.returncode}\n{done.stdout}{done.stderr}")
    return done


def expect(condition, what):
    if not condition:
        raise AssertionError(what)


def expect_equal(got, wanted, what=""):
    expect(got == wanted, f"{what}: got {got!r}, wanted {wanted!r}")


def property_of(unit, name):
    return run("systemctl", "show", "-P", name, unit).stdout.strip()


def wait_for(condition, what, seconds=20):
    end = time.monotonic() + seconds
    while not condition():
        expect(time.monotonic() < end, f"not in {seconds} s: {what}")
        time.sleep(0.05)


class Standstills:
    """Watches for moments in which the machine lets nobody run: a thread sleeps for a moment, over and over, and tells
    what it oversleeps."""

    def __enter__(self):
        self.gaps, self.seen, self.ended = [], 0.0, False
        self.thread = threading.Thread(target=self._watch)
        self.thread.start()
        return self

    def __exit__(self, *_):
        self.ended = True
        self.thread.join()

    def _watch(self):
        while not self.ended:
            slept = time.monotonic()
            time.sleep(0.01)
            if (woke := time.monotonic()) - slept > 0.05:
                self.gaps.append((slept, woke))
            self.seen = woke

    def between(self, start, end):
        """Seconds between two moments of time.monotonic() in which it stood still."""
        while self.seen < end:
            time.sleep(0.001)
        return sum(max(min(woke, end) - max(slept, start), 0) for slept, woke in self.gaps)


def log_of_the_helper():
    return run("journalctl", "-t", "BrenvikMobileHelper", "-o", "cat").stdout


def starts_of(unit):
    run("journalctl", "--sync")
    return run("journalctl", "-o", "cat", "-u", unit, "-g", "^Started ", check=False).stdout.count("Started ")


def bvhelperctl(*arguments, check=True):
    return run("bvhelperctl", *arguments, check=check)


class Library:
    """The installed C library: connects again by itself when the helper has left before it answered."""

    def __init__(self):
        self.lib = ctypes.CDLL("libbrenvik-mobile-helper.so.0")
        self.lib.bvmh_client_create.restype = ctypes.c_void_p
        self.lib.bvmh_error_text.restype = ctypes.c_char_p
        for name in ("bvmh_client_free", "bvmh_connect", "bvmh_client_set_socket", "BVMobileHelperCopyVoicemailToken",
                     "BVMobileHelperCopyCountryCode"):
            getattr(self.lib, name).argtypes = [ctypes.c_void_p]
        self.lib.bvmh_client_set_socket.argtypes = [ctypes.c_void_p, ctypes.c_char_p]
        for name in ("BVMobileHelperCopyVoicemailToken", "BVMobileHelperCopyCountryCode"):
            getattr(self.lib, name).argtypes = [ctypes.c_void_p, ctypes.c_char_p, ctypes.c_size_t]

    def ask(self, client, routine="BVMobileHelperCopyVoicemailToken"):
        """Returns the code and the text that is answered."""
        buffer = ctypes.create_string_buffer(257)
        code = getattr(self.lib, routine)(client, buffer, 257)
        return code, buffer.value.decode()

    def request(self, path, routine="BVMobileHelperCopyVoicemailToken"):
        """One client, one check-in, one request. Returns the code and the text that is answered."""
        client = self.lib.bvmh_client_create()
        try:
            code = self.lib.bvmh_client_set_socket(client, path.encode())
            if code == 0:
                code = self.lib.bvmh_connect(client)
            return self.ask(client, routine) if code == 0 else (code, "")
        finally:
            self.lib.bvmh_client_free(client)

    @contextlib.contextmanager
    def connected(self, path):
        """A client that asks for nothing, but when the function is called that it is given: as long as it is there, the helper
        does not leave."""
        client = self.lib.bvmh_client_create()
        try:
            expect_equal(self.lib.bvmh_client_set_socket(client, path.encode()), 0, "its socket")
            expect_equal(self.lib.bvmh_connect(client), 0, "its check-in")
            yield lambda: self.ask(client)
        finally:
            self.lib.bvmh_client_free(client)


def zip_of(entries):
    """A stored zip archive of {name: content}."""
    body, directory = b"", b""
    for name, content in entries.items():
        common = struct.pack("<HHHHHIIIHH", 20, 0x800, 0, 0, 0x21, zlib.crc32(content), len(content), len(content),
                             len(name), 0)
        directory += b"PK\1\2" + struct.pack("<H", 0x314) + common + struct.pack("<HHHII", 0, 0, 0, 0o100644 << 16, len(body))
        directory += name.encode()
        body += b"PK\3\4" + common + name.encode() + content
    return body + directory + b"PK\5\6" + struct.pack("<HHHHIIH", 0, 0, len(entries), len(entries), len(directory),
                                                      len(body), 0)


class Tunnel:
    """A network interface whose far end is this object: what the kernel sends there is read here."""
    TUNSETIFF, SIOCSIFFLAGS, SIOCSIFADDR, SIOCSIFNETMASK = 0x400454CA, 0x8914, 0x8916, 0x891C
    TUN_WITHOUT_HEADER, UP_AND_RUNNING = 0x1001, 0x41

    def __init__(self, name, address, mask="255.255.255.0"):
        self.fd = os.open("/dev/net/tun", os.O_RDWR | os.O_NONBLOCK | os.O_CLOEXEC)
        fcntl.ioctl(self.fd, self.TUNSETIFF, struct.pack("16sH22x", name.encode(), self.TUN_WITHOUT_HEADER))
        with socket.socket(socket.AF_INET, socket.SOCK_DGRAM) as control:
            for request, value in ((self.SIOCSIFADDR, address), (self.SIOCSIFNETMASK, mask)):
                fcntl.ioctl(control, request, struct.pack("16sHH4s16x", name.encode(), socket.AF_INET, 0,
                                                          socket.inet_aton(value)))
            fcntl.ioctl(control, self.SIOCSIFFLAGS, struct.pack("16sH22x", name.encode(), self.UP_AND_RUNNING))

    def __enter__(self):
        return self

    def __exit__(self, *_):
        os.close(self.fd)

    def echo_requests(self, atleast=0, seconds=0.0):
        """The ICMP echo requests that have come, each a whole IPv4 packet."""
        found, end = [], time.monotonic() + seconds
        while True:
            left = max(0.0, end - time.monotonic()) if len(found) < atleast else 0
            if not select.select([self.fd], [], [], left)[0]:
                return found
            packet = os.read(self.fd, 2048)
            if packet[0] == 0x45 and packet[9] == socket.IPPROTO_ICMP and packet[20] == 8:
                found.append(packet)

    def answer(self, request):
        """The echo reply to a request: its addresses change places, and the checksum knows of the other type."""
        total = struct.unpack_from("!H", request, 22)[0] + 0x0800
        os.write(self.fd, request[:12] + request[16:20] + request[12:16] + b"\0\0"
                 + struct.pack("!H", (total & 0xFFFF) + (total >> 16)) + request[24:])


@contextlib.contextmanager
def names(**addresses):
    """These host names are known: an underscore for each dot."""
    hosts = pathlib.Path("/etc/hosts")
    before = hosts.read_text() if hosts.exists() else ""
    hosts.write_text(before + "".join(f"{address} {name.replace('_', '.')}\n" for name, address in addresses.items()))
    try:
        yield
    finally:
        hosts.write_text(before)


@contextlib.contextmanager
def web_server(host, files):
    """Serves {path: content} by HTTPS at 127.0.0.1, with a certificate that this system trusts meanwhile. A content may be a
    function that returns it, as late as it likes."""
    certificate, key = pathlib.Path("/run/brenvik-test.crt"), pathlib.Path("/run/brenvik-test.key")
    run("openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256", "-nodes", "-days", "2",
        "-subj", "/CN=test", "-addext", f"subjectAltName=DNS:{host}", "-keyout", key, "-out", certificate)
    trusted = pathlib.Path("/etc/ssl/certs/ca-certificates.crt")
    before = trusted.read_bytes()
    trusted.write_bytes(before + certificate.read_bytes())

    class Handler(http.server.BaseHTTPRequestHandler):
        def do_GET(self):  # as the base class has it
            content = files.get(self.path)
            if callable(content):
                content = content()
            self.send_response(404 if content is None else 200)
            self.send_header("Content-Type", "application/gzip" if self.path.endswith(".gz") else "application/xml")
            self.send_header("Content-Length", str(len(content or b"")))
            self.end_headers()
            self.wfile.write(content or b"")

        def log_message(self, *_):
            pass

    server = http.server.ThreadingHTTPServer(("127.0.0.1", 443), Handler)
    context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
    context.load_cert_chain(certificate, key)
    server.socket = context.wrap_socket(server.socket, server_side=True)
    thread = threading.Thread(target=server.serve_forever)
    thread.start()
    try:
        yield
    finally:
        server.shutdown()
        thread.join()
        server.server_close()
        trusted.write_bytes(before)
        certificate.unlink()
        key.unlink()


@contextlib.contextmanager
def stun_server(seen_as):
    """Answers Binding requests at 127.0.0.1 with this address."""
    with socket.socket(socket.AF_INET, socket.SOCK_DGRAM) as server:
        server.bind(("127.0.0.1", 3478))
        server.settimeout(0.1)
        ended = threading.Event()

        def serve():
            while not ended.is_set():
                with contextlib.suppress(TimeoutError):
                    request, sender = server.recvfrom(2048)
                    mapped = bytes(a ^ b for a, b in zip(socket.inet_aton(seen_as), request[4:8]))
                    server.sendto(b"\1\1\0\x0c" + request[4:20] + b"\0\x20\0\x08\0\1\0\0" + mapped, sender)

        thread = threading.Thread(target=serve)
        thread.start()
        try:
            yield
        finally:
            ended.set()
            thread.join()


# ---- steps, in order -------------------------------------------------------------------------------------------


PACKAGES = sorted({os.path.basename(each).split("_")[0] for each in glob.glob("/packages/*_*.deb")})
# What is there before the packages come. What the package manager, accounts and the journal write is theirs.
BEFORE = set()
NOT_THE_PACKAGES_OWN = ("/proc", "/sys", "/dev", "/run", "/tmp", "/out", "/test", "/packages", "/var/lib/dpkg", "/var/log",
                        "/var/cache", "/var/lib/systemd")


def everything():
    found = set()
    for folder, folders, files in os.walk("/"):
        folders[:] = [each for each in folders if os.path.join(folder, each) not in NOT_THE_PACKAGES_OWN]
        found.update(os.path.join(folder, each) for each in folders + files)
    return found


def workers_listen():
    for worker, path in WORKERS.items():
        listening = f"brenvik-{worker}-worker.socket"
        expect_equal((property_of(listening, "ActiveState"), property_of(listening, "UnitFileState")), ("active", "enabled"),
                     listening)
        facts = os.stat(path)
        expect_equal((facts.st_uid, facts.st_gid, stat.S_IMODE(facts.st_mode)), (0, 0, 0o600), path)


def install():
    BEFORE.update(everything())
    install_all("/packages")
    expect_equal(property_of(SOCKET, "ActiveState"), "active", SOCKET)
    expect_equal(property_of(SOCKET, "UnitFileState"), "enabled", SOCKET)
    expect_equal(property_of(SERVICE, "ActiveState"), "inactive", "nobody has asked yet")
    facts = os.stat(PATH)
    expect_equal((facts.st_uid, facts.st_gid, stat.S_IMODE(facts.st_mode)), (0, grp.getgrnam("brenvik").gr_gid, 0o660),
                 "owner, group and mode of the socket")
    workers_listen()
    mobile = pwd.getpwnam("mobile")
    expect_equal(mobile.pw_dir, "/var/mobile")
    expect_equal(os.stat("/var/mobile").st_uid, mobile.pw_uid)
    expect(os.path.samefile("/private/var/mobile", "/var/mobile"), "/private/var leads to /var")
    # The heartbeat's ping sockets, for which the network worker has no other right.
    expect_equal(pathlib.Path("/proc/sys/net/ipv4/ping_group_range").read_text().split(), ["0", "2147483647"], "ping sockets")
    socket.socket(socket.AF_INET, socket.SOCK_DGRAM, socket.IPPROTO_ICMP).close()
    expect_equal(run("dpkg", "-V", *PACKAGES, check=False).stdout, "", "dpkg --verify")
    for folder in ("/etc/brenvik/entitlements.d", "/usr/lib/brenvik/entitlements.d"):
        facts = os.stat(folder)
        expect_equal((facts.st_uid, stat.S_IMODE(facts.st_mode)), (0, 0o755), folder)


def passes_its_own_smoke_test():
    """What a distribution would run of the source package (debian/tests)."""
    run("/test/smoke")
    run("rm", "/etc/brenvik/entitlements.d/50-bvhelperctl.plist")
    run("systemctl", "stop", SERVICE)


def refused_without_an_entitlement():
    done = bvhelperctl("ping", check=False)
    expect_equal(done.returncode, 4, "ping without an entitlement")
    expect("com.norvale.Teravox.BrenvikHelper.allow" in done.stderr, "says how to get one")


def served_with_one():
    run("cp", "/usr/share/doc/bvhelperctl/examples/50-bvhelperctl.plist", "/etc/brenvik/entitlements.d/")
    bvhelperctl("ping")
    expect_equal(property_of(SERVICE, "ActiveState"), "active", "started by the client")


def python_works():
    entitlement = pathlib.Path("/etc/brenvik/entitlements.d/70-python.plist")
    entitlement.write_bytes(plistlib.dumps({"Executable": os.path.realpath(sys.executable), "Entitlements": {
        "com.norvale.Teravox.BrenvikHelper.allow": True}}))
    code = """from brenvik_mobile_helper import Client
with Client() as helper:
    helper.set_preference_value("com.example.install", "python", ["Grüße"])
    print(helper.copy_preference_value("com.example.install", "python"))
    helper.set_preference_value("com.example.install", "python", None)"""
    expect_equal(run("/usr/bin/python3", "-c", code).stdout, "['Grüße']\n")
    entitlement.unlink()
    # The mock takes the helper's place for one command, and nobody else notices.
    script = pathlib.Path("/tmp/answers.mock")
    script.write_text('on CopyCountryCode\n  answer "QQ"\n')
    expect_equal(run("brenvik-mobile-helper-mock", script, "--", "bvhelperctl", "location", "country").stdout, "QQ\n")
    expect(bvhelperctl("location", "country", check=False).stdout != "QQ\n", "the real helper is where it was")


def works_in_its_sandbox():
    bvhelperctl("prefs", "set", "com.example.install", "text", "Grüße")
    expect_equal(bvhelperctl("prefs", "get", "com.example.install", "text").stdout, "Grüße\n")
    stored = plistlib.loads(pathlib.Path("/root/Library/Preferences/com.example.install.plist").read_bytes())
    expect_equal(stored, {"text": "Grüße"}, "preferences outlive the sandbox")
    # Too large for a datagram, so it comes in a memfd.
    pathlib.Path("/tmp/large.plist").write_bytes(plistlib.dumps({"text": "x" * 300_000}))
    expect("x" * 300_000 in bvhelperctl("plist", "load", "/tmp/large.plist").stdout, "a large region")
    bvhelperctl("voicemail", "set-token", "a-token")
    expect_equal(bvhelperctl("voicemail", "token").stdout, "a-token\n")
    expect_equal(os.stat("/var/mobile/Library/Voicemail/voicemail.db").st_uid, pwd.getpwnam("mobile").pw_uid)
    # An archive: the reader runs under its own filter inside the service's, and without capabilities.
    pathlib.Path("/tmp/bundle.zip").write_bytes(zip_of({"Info.plist": b"content", "deep/er/file": b"deep"}))
    bvhelperctl("carrier", "unpack", "/tmp/bundle.zip", "/tmp/bundle")
    expect_equal(pathlib.Path("/tmp/bundle/deep/er/file").read_text(), "deep")
    # A move from /tmp to the home of "mobile" goes from one mount to another there.
    bundles = "/private/var/mobile/Library/Carrier Bundles"
    bvhelperctl("carrier", "move-bundle", "/tmp/bundle", bundles, "Test.bundle")
    expect_equal(pathlib.Path(bundles, "Test.bundle/Info.plist").read_text(), "content")
    expect(not os.path.exists("/tmp/bundle"), "moved, not copied")
    pathlib.Path("/tmp/a.tcpk").write_text("package")
    os.chown("/tmp/a.tcpk", 12345, 12345)  # somebody else's, in a sticky folder
    bvhelperctl("carrier", "copy-file", "/tmp", bundles, "a.tcpk")
    expect_equal(os.stat(f"{bundles}/a.tcpk").st_uid, pwd.getpwnam("mobile").pw_uid)
    bvhelperctl("carrier", "remove", "/tmp/a.tcpk")
    expect(not os.path.exists("/tmp/a.tcpk"), "the package is gone")
    bvhelperctl("carrier", "replace-link", "/target", "/private/var/mobile/Library/Carrier Bundle.bundle")
    expect_equal(os.readlink("/var/mobile/Library/Carrier Bundle.bundle"), "/target")
    bvhelperctl("carrier", "create-link", "/target", "/private/var/mobile/Library/Carrier Bundles/a.link")
    expect_equal(os.readlink(f"{bundles}/a.link"), "/target")
    pathlib.Path("/tmp/logs").mkdir()
    pathlib.Path("/tmp/logs/crash.txt").write_text("boom")
    run("install", "-d", "-o", "mobile", "-g", "mobile", "/var/mobile/Library/Logs", "/var/mobile/Library/Logs/CrashReporter")
    bvhelperctl("carrier", "copy-crash-logs", "/tmp/logs")
    expect_equal(pathlib.Path("/var/mobile/Library/Logs/CrashReporter/logs/crash.txt").read_text(), "boom")
    expect_equal(bvhelperctl("labels", "badges", "--language", "de", "--label", "business").stdout, "G\n")
    expect_equal(bvhelperctl("labels", "localized", "--language", "de", "--label", "travel").stdout, "Reise\n")


def served_by(worker):
    """The account of a worker that is at work."""
    process = int(property_of(f"brenvik-{worker}-worker.service", "MainPID"))
    expect(process > 0, f"brenvik-{worker}-worker.service is at work")
    fields = dict(line.split(":\t") for line in pathlib.Path(f"/proc/{process}/status").read_text().splitlines() if ":\t" in line)
    for each in ("CapInh", "CapPrm", "CapEff", "CapBnd", "CapAmb"):
        expect_equal(int(fields[each], 16), 0, f"{worker}: {each}")
    expect_equal((fields["NoNewPrivs"], fields["Seccomp"]), ("1", "2"), f"{worker}: no new privileges, a filter")
    account = int(fields["Uid"].split()[0])
    try:
        return pwd.getpwuid(account).pw_name
    except KeyError:
        return account


def works_for_the_whole_phone():
    """The routines whose work lies in files of others, in libraries that are not there, on the system bus."""
    pathlib.Path("/var/lib/brenvik/Library/Preferences").mkdir(parents=True, exist_ok=True)
    pathlib.Path("/var/lib/brenvik/Library/Preferences/com.example.all.plist").write_bytes(plistlib.dumps({"text": "for all"}))
    expect_equal(bvhelperctl("prefs", "get-app", "com.example.all", "text").stdout, "for all\n")
    bvhelperctl("prefs", "set", "com.example.all", "text", "for root")
    expect_equal(bvhelperctl("prefs", "get-app", "com.example.all", "text").stdout, "for root\n")
    bvhelperctl("prefs", "delete", "com.example.all", "text")
    expect_equal(bvhelperctl("prefs", "get-app", "com.example.all", "text").stdout, "for all\n")

    bvhelperctl("voicemail", "set-token", "--key", "a-key", "another-token")
    bvhelperctl("voicemail", "clear")
    expect_equal(bvhelperctl("voicemail", "token", check=False).stdout, "(no token)\n")
    expect_equal(bvhelperctl("voicemail", "token", "--key", "a-key").stdout, "another-token\n")
    bvhelperctl("voicemail", "reset")
    expect_equal(bvhelperctl("voicemail", "subscribed").stdout, "not subscribed\n")
    bvhelperctl("voicemail", "set-token", "a-token")

    folder = pathlib.Path("/var/mobile/Library/AddressBook")
    folder.mkdir()
    with contextlib.closing(sqlite3.connect(folder / "contacts.db", isolation_level=None)) as contacts:
        contacts.execute("CREATE TABLE contact_channels(contact_id INTEGER NOT NULL, channel_identifier TEXT NOT NULL)")
        contacts.execute("INSERT INTO contact_channels VALUES(1, 'old')")
        # As the account has its files: nothing but root's right to overlook that lets the helper in.
        mobile = pwd.getpwnam("mobile")
        for path, mode in ((folder, 0o700), (folder / "contacts.db", 0o600)):
            os.chown(path, mobile.pw_uid, mobile.pw_gid)
            os.chmod(path, mode)
        bvhelperctl("contacts", "remap", "old", "new")
        expect_equal(contacts.execute("SELECT * FROM contact_channels").fetchall(), [(1, "new")])

    pathlib.Path("/var/lib/brenvik/country.plist").write_bytes(plistlib.dumps({"CountryCode": "NO"}))
    expect_equal(bvhelperctl("location", "country").stdout, "NO\n")

    os.makedirs("/run/dbus", exist_ok=True)
    with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as bus:
        bus.settimeout(10)
        bus.bind("/run/dbus/system_bus_socket")
        bus.listen(4)
        expect("the system bus does not answer" in bvhelperctl("radio-logs", "on").stderr, "says that nobody was told")
        helper, callers = int(property_of(SERVICE, "MainPID")), []
        while helper not in callers:  # bvhelperctl asks the bus as well
            with bus.accept()[0] as connection:
                connection.settimeout(10)
                callers.append(struct.unpack("iII", connection.getsockopt(socket.SOL_SOCKET, socket.SO_PEERCRED, 12))[0])
                expect(connection.recv(64).startswith(b"\0AUTH"), "whoever connects speaks to the bus")
        # A queue for "utility" work, which the unit lets lower its own priority.
        tasks = pathlib.Path(f"/proc/{helper}/task").iterdir()
        niceness = [int((task / "stat").read_text().rpartition(")")[2].split()[16]) for task in tasks
                    if (task / "comm").read_text() == "RadioManagerLog\n"]
        expect_equal(niceness, [10])
    os.unlink("/run/dbus/system_bus_socket")
    expect_equal(served_by("store"), "mobile", "who has the databases")


def asks_the_network():
    """A database over HTTPS, the address under which the machine is seen, and where a place is: the answers arrive at the
    telephony daemon."""
    host, content = "lasd.norvale.example", b"of today\n" * 1000
    manifest = {"gsm": {"Version": "1.0", "ContentURL": f"https://{host}/gsm.db.gz"}}
    files = {"/1/v3/lasd.plist": plistlib.dumps(manifest), "/gsm.db.gz": gzip.compress(content)}
    with contextlib.ExitStack() as stack:
        stack.enter_context(names(lasd_norvale_example="127.0.0.1", stun_norvale_example="127.0.0.1"))
        stack.enter_context(web_server(host, files))
        stack.enter_context(stun_server("203.0.113.9"))
        daemon = stack.enter_context(subprocess.Popen(["brenvik-standin", "--json"], stdout=subprocess.PIPE,
                                                      stderr=subprocess.PIPE, text=True))
        stack.callback(daemon.terminate)
        expect("listening" in daemon.stderr.readline(), "the telephony daemon")

        def heard():
            expect(select.select([daemon.stdout], [], [], 20)[0], "nothing arrives at the telephony daemon")
            event = json.loads(daemon.stdout.readline())
            return event["event"], event["values"]

        bvhelperctl("lasd", "check", "--type", "gsm")
        kind, values = heard()
        expect_equal((kind, values["Notification"], values.get("DBType")),
                     ("notification", "com.norvale.lasd.UpdateAvailable", "gsm"))
        bvhelperctl("location", "wan-ip")
        kind, values = heard()
        expect_equal((kind, values["Address"]), ("local-address", "203.0.113.9"))
        bvhelperctl("location", "civic", "59.9133", "10.739")
        kind, values = heard()
        expect_equal((kind, values["CountryCode"], values["City"]), ("civic-info", "NO", "Oslo"))
    account = served_by("network")
    expect(account not in ("root", "mobile", 0), f"who has the network: {account}")
    process = int(property_of("brenvik-network-worker.service", "MainPID"))
    niceness = int(pathlib.Path(f"/proc/{process}/stat").read_text().rpartition(")")[2].split()[16])
    expect_equal(niceness, 10, "the priority of what the helper calls utility work")
    expect_equal(pathlib.Path("/var/mobile/Library/LASD/gsm.db").read_bytes(), content)
    expect_equal(plistlib.loads(pathlib.Path("/root/Library/Preferences/com.norvale.lasd.plist").read_bytes()), manifest)


def beats_over_the_cellular_link():
    """With the kernel's ping sockets: neither a raw socket nor a packet socket is allowed. The better way to the address is
    another, so the interface is chosen by the helper."""
    try:
        os.close(os.open("/dev/net/tun", os.O_RDWR))
    except OSError as error:
        print(f"    left out, for this machine has no tunnels: {error}", flush=True)
        return

    def waiting():
        return len(pathlib.Path("/proc/net/icmp").read_text().splitlines()) - 1

    with Tunnel("pdp_ip0", "10.5.0.1") as cellular, Tunnel("wifi0", "192.0.2.2") as other, Standstills() as machine:
        bvhelperctl("heartbeat", "on")
        identifier = int(property_of(SERVICE, "MainPID")) & 0xFFFF
        arrivals = []
        for number in range(4):  # of the start, of the timer's first firing, and of two more
            waited_from = time.monotonic()
            requests = cellular.echo_requests(1, 10)
            arrivals.append(time.monotonic())
            # A machine that stands still lets a wait run out, and what comes of it is no more than late.
            stood = machine.between(waited_from, arrivals[-1]) > 0
            expect(len(requests) == 1 or stood and requests, f"{len(requests)} echo requests arrive at the far end")
            request = requests[-1]
            expect_equal((socket.inet_ntoa(request[16:20]), len(request)), ("192.0.2.1", 20 + 48), "the request")
            expect_equal(struct.unpack_from("!HH", request, 24), (identifier, 0), "identifier and sequence number")
            expect(waiting() == 1 or stood, f"{waiting()} sockets wait for a reply")
            cellular.answer(request)
            if number > 0:
                answered = time.monotonic()
                wait_for(lambda: waiting() == 0, "the reply ends the wait")
                ended = time.monotonic()
                took = ended - answered - machine.between(answered, ended)
                expect(took < 0.5, f"the reply ends the wait after {took:.2f} s")
        # The second waits for the reply to the first, which would be a second's wait without one.
        apart = arrivals[1] - arrivals[0] - machine.between(*arrivals[:2])
        expect(apart < 0.5, f"the second request after {apart:.2f} s")
        for earlier, later in zip(arrivals[1:], arrivals[2:]):
            room = 0.5 + machine.between(earlier - 2, later)  # after a late one, the next comes the sooner
            expect(abs(later - earlier - 2) < room, f"requests {later - earlier:.2f} s apart")
        bvhelperctl("heartbeat", "off")
        wait_for(lambda: waiting() == 0, "the end of the last request")
        time.sleep(0.2)
        cellular.echo_requests()
        time.sleep(2.5)
        expect_equal(cellular.echo_requests(), [], "after it was switched off")
        expect_equal(other.echo_requests(), [], "by the other interface")


def stores_no_preference_where_it_would_be_lost():
    """Without its folder, what the helper sees of the home is empty and read-only."""
    folder = pathlib.Path("/root/Library")
    run("systemctl", "stop", SERVICE)
    folder.rename("/root/Library.away")
    try:
        bvhelperctl("prefs", "set", "com.example.lost", "text", "lost")
        run("journalctl", "--sync")
        expect("Preferences /root/Library/Preferences/com.example.lost.plist: mkdir: Read-only file system"
               in log_of_the_helper(), "a line says that it was not stored")
        expect("lost" not in bvhelperctl("prefs", "get", "com.example.lost", "text", check=False).stdout,
               "it is not there")
        expect(not folder.exists(), "nothing was made in the real home either")
        run("systemctl", "stop", SERVICE)
    finally:
        pathlib.Path("/root/Library.away").rename(folder)
    # Without any folder there, what makes the system's folders makes it again.
    folder.rename("/root/Library.away")
    run("systemd-tmpfiles", "--create", "--prefix=/root")
    expect_equal(stat.S_IMODE(os.stat(folder / "Preferences").st_mode), 0o700, "mode of the folder that is made")
    (folder / "Preferences").rmdir()
    folder.rmdir()
    pathlib.Path("/root/Library.away").rename(folder)
    bvhelperctl("prefs", "set", "com.example.kept", "text", "kept")
    run("systemctl", "stop", SERVICE)
    expect_equal(bvhelperctl("prefs", "get", "com.example.kept", "text").stdout, "kept\n", "after another start")


def held_in_its_sandbox():
    before = pathlib.Path("/etc/hostname").read_bytes() if os.path.exists("/etc/hostname") else None
    expect_equal(bvhelperctl("carrier", "create-link", "/x", "/etc/hostname", check=False).returncode, 1)
    expect_equal(pathlib.Path("/etc/hostname").read_bytes() if before is not None else None, before)
    expect_equal(bvhelperctl("carrier", "unpack", "/tmp/bundle.zip", "/usr/bundle", check=False).returncode, 1)
    pathlib.Path("/home/secret.plist").write_bytes(plistlib.dumps({"a": 1}))
    expect_equal(bvhelperctl("plist", "load", "/home/secret.plist", check=False).returncode, 1)
    os.unlink("/home/secret.plist")
    main = int(property_of(SERVICE, "MainPID"))
    status = pathlib.Path(f"/proc/{main}/status").read_text()
    fields = dict(line.split(":\t") for line in status.splitlines() if ":\t" in line)
    bits = {"CAP_CHOWN": 0, "CAP_DAC_OVERRIDE": 1, "CAP_FOWNER": 3}
    expect_equal(int(fields["CapBnd"], 16), sum(1 << each for each in bits.values()), "bounding set")
    expect_equal((fields["NoNewPrivs"], fields["Seccomp"]), ("1", "2"), "no new privileges, a filter")
    # Privileges of the archive reader are looked at by its tests; here: it was started in the same sandbox.
    expect("ArkCopier signaled fatal file error" in log_of_the_helper(), "the refused archive is in the log")


def probed(unit):
    """What came of a program's attempts in the place of a service: see probe.py."""
    folder = pathlib.Path(f"/run/systemd/system/{unit}.d")
    folder.mkdir(parents=True)
    output = pathlib.Path("/run/brenvik-probe.json")
    # Where every service can read it, and with an end of its own.
    program = pathlib.Path("/usr/local/lib/brenvik-probe.py")
    program.write_bytes(pathlib.Path("/test/probe.py").read_bytes())
    program.chmod(0o644)
    victim = subprocess.Popen(["sleep", "60"])
    try:
        (folder / "probe.conf").write_text(f"[Service]\nType=oneshot\nExecStart=\nExecStart=/usr/bin/python3 -E -s {program} "
                                           f"{victim.pid}\nStandardOutput=truncate:{output}\nTimeoutStartSec=30s\n")
        run("systemctl", "daemon-reload")
        run("systemctl", "stop", unit)
        run("systemctl", "start", unit)
        return json.loads(output.read_text())
    finally:
        victim.kill()
        victim.wait()
        (folder / "probe.conf").unlink()
        folder.rmdir()
        program.unlink()
        output.unlink(missing_ok=True)
        run("systemctl", "daemon-reload")


def expect_refused(found, **wanted):
    for key, error in wanted.items():
        expect_equal(found[key], error, key)


# Nothing of another process can be had, and nothing of the kernel's own: its settings, its log, its symbols, its name.
OF_OTHERS = {"vm_write": "EPERM", "vm_read": "EPERM", "ptrace": "EPERM", "take_descriptor": "EPERM", "settings": "ENOENT",
             "kernel_log": "EPERM", "kernel_log_file": "ENOENT", "kernel_log_device": "ENOENT", "symbols": "ENOENT", "host_name": "EPERM"}
NO_NETWORK = {"inet": "EAFNOSUPPORT", "inet6": "EAFNOSUPPORT", "netlink": "EAFNOSUPPORT", "packet": "EAFNOSUPPORT",
              "raw": "no network"}


@contextlib.contextmanager
def a_home_with_a_secret():
    pathlib.Path("/home/somebody").mkdir()
    try:
        yield
    finally:
        pathlib.Path("/home/somebody").rmdir()


def a_helper_that_was_taken_over_is_held():
    with a_home_with_a_secret():
        found = probed(SERVICE)
    expect_refused(found, memory="EROFS", **OF_OTHERS, **NO_NETWORK)
    expect_equal((found["sees /home"], found["sees /root"], found["sees /run/user"]), ([], ["Library"], []), "homes")
    expect_equal([each for each in found["writable"] if not each.startswith("/dev/")],
                 ["/root/Library", PATH.rpartition("/")[0], "/tmp", "/var/lib/brenvik", "/var/mobile", "/var/tmp"],
                 "places where it could write a file")
    expect_equal((found["around"], found["memory_around"]), ("EACCES", "EACCES"), "the way around through /proc/PID/root")
    # From the one that may look into processes it learns what they execute, and nothing else.
    expect("/sleep" in found["told"], f"which program runs: {found['told']!r}")
    expect_equal(found["told_of_a_link"], "", "where a link leads that it made itself")


def a_caller_worker_that_was_taken_over_is_held():
    """By its unit: no network, nothing to write but what everybody may, no account of anybody's. Its capability would lead it
    further, but by then the program has a filter of its own, without a call that opens anything: its unit test tries them all."""
    with a_home_with_a_secret():
        found = probed("brenvik-caller-worker.service")
    expect_refused(found, signal="EPERM", root_account="EPERM", **OF_OTHERS, **NO_NETWORK)
    # Places of everybody's are not taken away, since each takes time of the first caller's: the filter opens none.
    expect_equal(found["writable"], ["/dev/mqueue", "/dev/shm", "/tmp", "/var/tmp"], "places where it could write a file")
    expect_equal((found["sees /home"], found["sees /root"], found["sees /tmp"]), ("EACCES", "EACCES", []), "homes, packages")
    bvhelperctl("ping")
    process = property_of("brenvik-caller-worker.service", "MainPID")
    fields = dict(line.split(":\t") for line in pathlib.Path(f"/proc/{process}/status").read_text().splitlines() if ":\t" in line)
    expect_equal((int(fields["CapPrm"], 16), int(fields["CapEff"], 16), int(fields["CapBnd"], 16)), (1 << 19,) * 3, "CAP_SYS_PTRACE")
    expect_equal((fields["NoNewPrivs"], fields["Seccomp"]), ("1", "2"), "no new privileges, filters")
    expect_equal(int(fields["Seccomp_filters"]), found["filters"] + 2, "the unit's filters and two of its own")
    expect(0 not in map(int, fields["Uid"].split() + fields["Gid"].split()), "it is not root")


def a_network_worker_that_was_taken_over_is_held():
    with a_home_with_a_secret():
        found = probed("brenvik-network-worker.service")
    expect_refused(found, memory="ENOENT", signal="EPERM", packet="EAFNOSUPPORT", raw="EPERM", root_account="EPERM",
                   around="ENOENT", memory_around="ENOENT", **OF_OTHERS)
    expect_equal(found["writable"], [], "places where it could write a file")
    expect_equal((found["sees /home"], found["sees /root"], found["sees /var/mobile"], found["sees /tmp"]), ("EACCES",) * 4,
                 "homes and packages")


def a_store_worker_that_was_taken_over_is_held():
    with a_home_with_a_secret():
        found = probed("brenvik-store-worker.service")
    expect_refused(found, memory="ENOENT", signal="EPERM", root_account="EPERM", around="ENOENT", memory_around="ENOENT",
                   **OF_OTHERS, **NO_NETWORK)
    expect_equal(found["writable"], [], "places where it could write a file")
    expect_equal((found["sees /home"], found["sees /root"], found["sees /var/mobile"], found["sees /tmp"]),
                 ("EACCES", "EACCES", "ENOENT", "EACCES"), "homes and packages")


def serves_without_the_account_mobile():
    """A machine without it: the packages' units are as they are, and the helper finds no home to look in."""
    accounts = pathlib.Path("/etc/passwd")
    before = accounts.read_text()
    run("systemctl", "stop", SERVICE, "brenvik-store-worker.service")
    try:
        accounts.write_text("".join(line for line in before.splitlines(True) if not line.startswith("mobile:")))
        bvhelperctl("ping")
        expect_equal(bvhelperctl("voicemail", "token", check=False).stdout, "(no token)\n")
        expect_equal(property_of("brenvik-store-worker.service", "ActiveState"), "inactive", "nobody asks for a worker")
        run("systemctl", "restart", "brenvik-store-worker.socket")
        workers_listen()
    finally:
        accounts.write_text(before)
        run("systemctl", "stop", SERVICE)


def only_root_reaches_a_worker():
    for path in WORKERS.values():
        done = run("setpriv", "--reuid=mobile", "--regid=mobile", "--groups", "brenvik", sys.executable, "-c",
                   "import socket, sys; socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET).connect(sys.argv[1])", path,
                   check=False)
        expect(done.returncode != 0 and "PermissionError" in done.stderr, f"mobile at {path}: {done.stderr}")


def other_accounts_are_told_apart():
    """Reading the executable of another account's process is what the caller worker is for."""
    run("useradd", "--system", "--no-create-home", "telephony")
    done = run("setpriv", "--reuid=telephony", "--regid=telephony", "--init-groups", "bvhelperctl", "ping", check=False)
    expect_equal(done.returncode, 4, "an account that is not in the group")
    expect("usermod -aG brenvik telephony" in done.stderr, "what to do about it")
    run("usermod", "-aG", "brenvik", "telephony")
    done = run("setpriv", "--reuid=telephony", "--regid=telephony", "--init-groups", "bvhelperctl", "ping", check=False)
    expect_equal(done.returncode, 4, "another account, the same program")
    file = pathlib.Path("/etc/brenvik/entitlements.d/60-telephony.plist")
    file.write_bytes(plistlib.dumps({"Executable": "/usr/bin/bvhelperctl", "User": "telephony",
                                     "Entitlements": {"com.norvale.Teravox.BrenvikHelper.allow": True}}))
    os.chmod(file, 0o644)
    run("setpriv", "--reuid=telephony", "--regid=telephony", "--init-groups", "bvhelperctl", "ping")


def commands_of(page):
    """What a reader of the page types: its indented lines."""
    with open(page, encoding="utf-8") as lines:
        return [line.strip() for line in lines if line.startswith("    ")]


def the_handbook_is_whole():
    pages = glob.glob("/usr/share/doc/brenvik-mobile-helper-doc/html/**", recursive=True)
    expect(any(each.endswith("/integrate.html") for each in pages), f"no handbook: {pages}")
    expect_equal([each for each in pages if each.endswith(".gz")], [], "a page that no browser reads")
    expect_equal([each for each in pages if not os.path.exists(each)], [], "links that lead nowhere")


@contextlib.contextmanager
def telephony_daemon():
    """The daemon of the handbook's page "Integrate a telephony daemon", installed and started command by command. Gives a
    function that returns what it has printed."""
    example = "/usr/share/doc/libbrenvik-mobile-helper-dev/examples/brenvikd"
    here = {"apt": None,  # the packages are installed, by this very test
            "cc": "install -D -m 755 /test/brenvikd /usr/libexec/brenvikd"}  # compiled outside, with the same command
    commands = [here.get(command.split()[0], command) for command in commands_of("/test/integrate.md")]
    expect(len(commands) >= 8 and commands.count(None) == 1, f"not the page that was thought of: {commands}")
    made = [] if os.path.exists("/etc/sysusers.d") else ["/etc/sysusers.d"]
    for folder in made:
        os.mkdir(folder)
    began = f"@{time.time():.6f}"
    for command in filter(None, commands):
        run("/bin/sh", "-ec", command, cwd=example)
    yield lambda: run("journalctl", "-u", "brenvikd.service", "-o", "cat", "--since", began).stdout
    units = ("brenvikd.socket", "brenvikd-lasd.socket", "brenvikd.service")
    run("systemctl", "stop", *units)
    run("rm", "/usr/libexec/brenvikd", "/etc/sysusers.d/brenvikd.conf", "/etc/brenvik/entitlements.d/60-brenvikd.plist",
        *(f"/etc/systemd/system/{unit}" for unit in units))
    run("systemctl", "daemon-reload")
    for folder in made:
        os.rmdir(folder)


def ask_the_telephony_daemon_to_ask():
    run("systemctl", "kill", "--signal=SIGUSR1", "brenvikd.service")


def a_telephony_daemon_without_rights_lives_with_it():
    with telephony_daemon() as told:
        wait_for(lambda: CIVIC_PUSH in told(), "the push of where it is")
        expect_equal(property_of("brenvikd.service", "User"), "brenvikd")
        # The helper goes; the daemon asks again, and is told again.
        run("systemctl", "stop", SERVICE)
        ask_the_telephony_daemon_to_ask()
        wait_for(lambda: told().count(CIVIC_PUSH) == 2, "a second push, from another helper")
        with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as updater:
            updater.connect("/run/brenvik/bootstrap/com.norvale.Brenvik.lasd")
            updater.send(struct.pack("<6I", 0, 24, 0, 0, 0, 0)
                         + plistlib.dumps({"Notification": "com.norvale.lasd.NoUpdateRequired"}, fmt=plistlib.FMT_BINARY))
        wait_for(lambda: 'notification "com.norvale.lasd.NoUpdateRequired"' in told(), "the notification")


def journal_explains():
    bvhelperctl("plist", "load", "/nowhere.plist", check=False)
    bvhelperctl("carrier", "remove", "/etc/passwd", check=False)
    shown = run("journalctl", "-x", "-t", "BrenvikMobileHelper").stdout
    for text in ("Could not create data representation of dictionary", "The file is missing, cannot be read, or",
                 "NOT Allowing path /etc/passwd as it isn't within the wild card directories:",
                 "Refused: The path is neither a carrier file nor in the carrier bundles", "refused process",
                 "ArkCopier signaled fatal file error", "The archive is damaged, hostile or no zip archive"):
        expect(text in shown, f"journalctl -x does not show: {text}\n{shown[-3000:]}")
    expect("a-token" not in shown and "Grüße" not in shown, "no token and no value in the log")
    asked = run("journalctl", "BRENVIK_CALLER_EXE=/usr/bin/bvhelperctl", "BRENVIK_ROUTINE=BVMobileHelperRemoveCarrierFile",
                "-o", "cat").stdout
    expect("NOT Allowing path /etc/passwd" in asked, f"who asked for /etc/passwd is not told\n{asked[-2000:]}")


def tells_what_keeps_it():
    status = "/run/brenvik/bootstrap/com.norvale.brenvik.mobile-helper.status"
    wait_for(lambda: property_of(SERVICE, "ActiveState") == "inactive", "idle exit")
    expect(not os.path.exists(status), "the status socket goes with the helper")
    told = json.loads(bvhelperctl("--json", "status").stdout)
    expect_equal((told["running"], told["socket"]["state"]), (False, "listening"))
    expect_equal(property_of(SERVICE, "ActiveState"), "inactive", "asking starts nothing")
    bvhelperctl("ping")
    wait_for(lambda: os.path.exists(status), "the status socket")
    facts = os.stat(status)
    expect_equal((facts.st_uid, facts.st_gid, facts.st_mode & 0o7777), (0, grp.getgrnam("brenvik").gr_gid, 0o660))
    told = json.loads(bvhelperctl("--json", "status").stdout)
    expect_equal(told["pid"], int(property_of(SERVICE, "MainPID")))
    expect_equal((told["version"], told["restartPending"]), (told["installed"], False))
    expect_equal({each["name"]: each["running"] for each in told["workers"]},
                 {"callers": True, "network": False, "stores": False})
    wait_for(lambda: property_of(SERVICE, "StatusText") == "Idle, leaves soon", "the line of systemctl status")


def leaves_when_idle_and_comes_back():
    bvhelperctl("ping")
    left = time.monotonic()
    wait_for(lambda: property_of(SERVICE, "ActiveState") == "inactive", "idle exit")
    expect(IDLE - 0.5 < time.monotonic() - left < IDLE + 5, f"left after {time.monotonic() - left:.1f} s")
    expect_equal(property_of(SERVICE, "Result"), "success")
    expect_equal(property_of(SERVICE, "ExecMainStatus"), "0")
    expect_equal(property_of(SOCKET, "ActiveState"), "active", "the socket stays")
    expect_equal(bvhelperctl("voicemail", "token").stdout, "a-token\n")


def entitle_this_test():
    """The test speaks for itself, so its interpreter is entitled."""
    file = pathlib.Path("/etc/brenvik/entitlements.d/70-test.plist")
    file.write_bytes(plistlib.dumps({"Executable": os.path.realpath(sys.executable),
                                     "Entitlements": {"com.norvale.Teravox.BrenvikHelper.allow": True}}))
    os.chmod(file, 0o644)


def a_burst_is_one_start():
    """Many clients at once find nobody at work: the first starts the helper, the others wait in the socket's queue."""
    run("systemctl", "stop", SERVICE)
    entitle_this_test()
    before = starts_of(SERVICE)
    library, answers = Library(), []
    most = resource.getrlimit(resource.RLIMIT_NOFILE)[1]
    resource.setrlimit(resource.RLIMIT_NOFILE, (most, most))
    together = threading.Barrier(400)

    def client():
        together.wait()
        answers.append(library.request(PATH))

    threads = [threading.Thread(target=client) for _ in range(together.parties)]
    for thread in threads:
        thread.start()
    for thread in threads:
        thread.join()
    wrong = [answer for answer in answers if answer != (0, "a-token")]
    expect(not wrong, f"{len(wrong)} of {len(answers)} lost: {wrong[:5]}")
    expect_equal(len(answers), len(threads), "answers")
    expect_equal(starts_of(SERVICE) - before, 1, "starts")


def nothing_is_lost_at_the_idle_edge():
    """1,000 requests around 50 idle edges: as many instances of the unit, each asked twenty times around the moment in
    which it leaves. The first of the twenty comes between 5 ms before that moment and 35 ms after it; later where the
    machine is so busy that others have been there still."""
    instances, each_time = 50, 20
    unit = pathlib.Path(f"/lib/systemd/system/{SERVICE}").read_text().replace(SOCKET, "edge@%i.socket")
    pathlib.Path("/run/systemd/system/edge@.service").write_text(unit)
    listening = pathlib.Path(f"/lib/systemd/system/{SOCKET}").read_text().replace(PATH, "/run/edge/%i")
    pathlib.Path("/run/systemd/system/edge@.socket").write_text(listening)
    run("systemctl", "daemon-reload")
    names = [f"edge@{i}.socket" for i in range(instances)]
    run("systemctl", "start", *names)
    library = Library()
    routine = "BVMobileHelperCopyCountryCode"  # no worker's work: one worker does not serve fifty helpers
    run("systemctl", "stop", SERVICE)
    began = time.monotonic()
    expect_equal(library.request(PATH), (0, "a-token"), "a request that starts the helper")
    start = time.monotonic() - began
    answers = [[] for _ in range(instances)]
    busy = 0.0  # how much later processes leave than on an idle machine
    began = time.monotonic() + 0.5
    # Starts spread over ten seconds, or more on a slow machine, so that the processors are not what is measured.
    spacing = max(0.2, 2 * start)

    def client(number):
        nonlocal busy
        path = f"/run/edge/{number}"
        time.sleep(max(0.0, began + number * spacing - time.monotonic()))
        expect_equal(library.request(path, routine), (0, "NO"), f"first request of {number}")
        edge = time.monotonic() + IDLE
        before = property_of(f"edge@{number}.service", "MainPID")
        time.sleep(max(0.0, edge - 0.1 - time.monotonic()))
        first = busy - 0.005 + 0.040 * (number * 37 % instances) / instances
        for turn in range(each_time):
            time.sleep(max(0.0, edge + first + turn * 0.004 - time.monotonic()))
            answers[number].append(library.request(path, routine))
        met = property_of(f"edge@{number}.service", "MainPID") != before
        busy = max(0.0, busy + (-0.005 if met else 0.02))

    threads = [threading.Thread(target=client, args=(number,)) for number in range(instances)]
    for thread in threads:
        thread.start()
    for thread in threads:
        thread.join()
    flat = [answer for answers_of_one in answers for answer in answers_of_one]
    expect_equal(len(flat), instances * each_time, "requests")
    wrong = [answer for answer in flat if answer != (0, "NO")]
    expect(not wrong, f"{len(wrong)} of {len(flat)} lost: {wrong[:5]}")
    starts = starts_of("edge@*.service")
    print(f"    {len(flat)} requests, none lost; {starts} starts of {instances} instances", flush=True)
    expect(starts > instances + instances // 4, "too few edges were met for this to mean anything")
    run("systemctl", "stop", *names)


LIMIT_SEEN = pathlib.Path("/run/brenvik-test-limit-seen")


def hit_a_limit(result, **settings):
    """With a helper that dies of every client, and these settings for the units, until one of their limits is hit."""
    files = []
    for unit, text in (("service", "[Service]\nExecStart=\nExecStart=/bin/false\n"), ("socket", "")):
        files.append(pathlib.Path(f"/run/systemd/system/brenvik-mobile-helper.{unit}.d/broken.conf"))
        files[-1].parent.mkdir(parents=True, exist_ok=True)
        files[-1].write_text(text + settings[unit])
    LIMIT_SEEN.unlink(missing_ok=True)
    run("systemctl", "stop", SERVICE)
    run("systemctl", "daemon-reload")
    bvhelperctl("--timeout", "5", "ping", check=False)
    wait_for(lambda: property_of(SOCKET, "ActiveState") == "failed", "the limit")
    expect_equal(property_of(SOCKET, "Result"), result)
    for file in files:
        file.unlink()
    run("systemctl", "daemon-reload")
    LIMIT_SEEN.touch()
    wait_for(lambda: property_of(SOCKET, "ActiveState") == "active", "the way back", 30)
    bvhelperctl("ping")


def comes_back_after_a_limit():
    hit_a_limit("service-start-limit-hit", service="[Unit]\nStartLimitBurst=5\n", socket="")
    # The same way back, which need not be waited for: it is open when the limit has been seen.
    folder = pathlib.Path("/run/systemd/system/brenvik-mobile-helper-restore.service.d")
    folder.mkdir()
    wait = f"/bin/sh -c 'until [ -e {LIMIT_SEEN} ]; do sleep 0.1; done'"
    (folder / "sooner.conf").write_text(f"[Service]\nExecStart=\nExecStart={wait}\n" + "".join(
        line + "\n" for line in pathlib.Path("/lib/systemd/system/brenvik-mobile-helper-restore.service").read_text().splitlines()
        if line.startswith("ExecStart=/bin/systemctl")))
    hit_a_limit("trigger-limit-hit", service="[Unit]\nStartLimitBurst=1000\n", socket="[Socket]\nTriggerLimitIntervalSec=60s\nTriggerLimitBurst=5\n")


def install_all(folder):
    """All packages of the folder at once, the places first, and as apt does it. Returns what the package manager printed."""
    return run("dpkg", "--auto-deconfigure", "-i", *sorted(glob.glob(f"{folder}/*_*.deb")),
               env={**os.environ, "DEBIAN_FRONTEND": "noninteractive"}).stdout


def version_of(package):
    return run("dpkg-deb", "-f", package, "Version").stdout.strip()


def install_the_next_version():
    """Returns what the package manager printed. The daemon's package stays configured all the time."""
    printed = install_all("/packages/upgrade")
    expect("De-configuring" not in printed, printed)
    return printed


class AsksOn:
    """A client that asks over and over, on a channel of its own for each question."""

    def __enter__(self):
        self.library, self.codes, self.ended = Library(), [], False
        self.thread = threading.Thread(target=self._ask)
        self.thread.start()
        return self

    def __exit__(self, *_):
        self.ended = True
        self.thread.join()

    def _ask(self):
        while not self.ended:
            self.codes.append(self.library.request(PATH))
            time.sleep(0.02)


def upgrade_under_a_living_telephony_daemon():
    """All packages get a higher version while the daemon is connected, a database is on its way, and another client asks on.
    The daemon is told everything before, meanwhile and afterwards; the helper that was replaced is named until it has
    left."""
    host, content = "lasd.norvale.example", b"of tomorrow\n" * 1000
    manifest = {"umts": {"Version": "2.0", "ContentURL": f"https://{host}/umts.db.gz"}}
    asked_for, may_go_on = threading.Event(), threading.Event()

    def database():
        asked_for.set()
        may_go_on.wait(60)
        return gzip.compress(content)

    files = {"/1/v3/lasd.plist": plistlib.dumps(manifest), "/umts.db.gz": database}
    before, after = (version_of(glob.glob(f"/packages/{folder}brenvik-mobile-helper_*.deb")[0]) for folder in ("", "upgrade/"))
    ping_sockets = pathlib.Path("/proc/sys/net/ipv4/ping_group_range")
    ping_sockets.write_text("0 7")
    with contextlib.ExitStack() as stack:
        if "/usr/lib/sysctl.d" in pathlib.Path("/var/lib/dpkg/info/systemd.triggers").read_text():
            # After each upgrade of a package with kernel settings, that of the service manager applies those of all files.
            setting = pathlib.Path("/etc/sysctl.d/50-administrator.conf")
            if not setting.parent.exists():
                setting.parent.mkdir()
                stack.callback(setting.parent.rmdir)
            setting.write_text("net.ipv4.ping_group_range = 0 7\n")
            stack.callback(setting.unlink)
        stack.enter_context(names(lasd_norvale_example="127.0.0.1", stun_norvale_example="127.0.0.1"))
        stack.enter_context(web_server(host, files))
        stack.callback(may_go_on.set)  # or the server waits for it, when a check below has failed
        stack.enter_context(stun_server("203.0.113.9"))
        told = stack.enter_context(telephony_daemon())
        pushes = {CIVIC_PUSH: 0, ADDRESS_PUSH: 0, UPDATE_NOTICE: 0}

        def expect_push(line):
            pushes[line] += 1
            wait_for(lambda: told().count(line) == pushes[line], f"{line}, number {pushes[line]}")

        expect_push(CIVIC_PUSH)  # it asks when it starts
        bvhelperctl("location", "wan-ip")
        expect_push(ADDRESS_PUSH)
        bvhelperctl("lasd", "check", "--type", "umts")
        expect(asked_for.wait(20), "the database is asked for")
        helper = property_of(SERVICE, "MainPID")
        worker = property_of("brenvik-network-worker.service", "MainPID")
        expect(int(worker) > 0, "the network worker is at work")

        with AsksOn() as client:
            printed = install_the_next_version()
        expect_equal(set(client.codes), {(0, "a-token")}, f"each of {len(client.codes)} requests meanwhile")
        expect(len(client.codes) >= 5, f"only {len(client.codes)} requests meanwhile")
        expect_equal(property_of(SOCKET, "ActiveState"), "active", "listens on")
        workers_listen()
        expect_equal(property_of(SERVICE, "MainPID"), helper, "a helper at work is left alone")
        expect_equal(property_of("brenvik-network-worker.service", "MainPID"), worker, "a worker at work is left alone")
        for text in (f"process {helper}", "replaced", "bvhelperctl status", f"systemctl stop {SERVICE}"):
            expect(text in printed, f"the package manager does not print: {text}\n{printed}")

        # Nothing of what was under way is lost, and the old helper goes on.
        may_go_on.set()
        expect_push(UPDATE_NOTICE)
        expect_equal(pathlib.Path("/var/mobile/Library/LASD/umts.db").read_bytes(), content)
        ask_the_telephony_daemon_to_ask()
        expect_push(CIVIC_PUSH)
        bvhelperctl("location", "wan-ip")
        expect_push(ADDRESS_PUSH)
        status = json.loads(bvhelperctl("--json", "status").stdout)
        expect_equal((status["pid"], status["version"], status["installed"], status["restartPending"]),
                     (int(helper), before, after, True), "status")
        expect(f"restart pending: version {before} runs, version {after} is installed" in bvhelperctl("status").stderr,
               "status says what is pending")

        # Its clients allow it: the daemon lets go of its channel, and ten seconds later the helper leaves by itself.
        run("systemctl", "stop", "brenvikd.service")
        wait_for(lambda: property_of(SERVICE, "ActiveState") == "inactive", "the old helper leaves", IDLE + 10)
        expect_equal((property_of(SERVICE, "Result"), property_of(SERVICE, "ExecMainStatus")), ("success", "0"))
        run("systemctl", "start", "brenvikd.service")
        expect_push(CIVIC_PUSH)
        process = property_of(SERVICE, "MainPID")
        expect(process != helper and os.path.samefile(f"/proc/{process}/exe", HELPER), "the program that is installed runs")

        # Under a daemon that never lets go it is ended when it has nothing to do. The daemon does not notice.
        daemon = property_of("brenvikd.service", "MainPID")
        expect("runs on" in install_the_next_version(), "reinstalled, and told about as well")
        wait_for(lambda: json.loads(bvhelperctl("--json", "status").stdout)["busyTokens"] == 0, "nothing to do")
        run("systemctl", "stop", SERVICE)
        ask_the_telephony_daemon_to_ask()
        expect_push(CIVIC_PUSH)
        bvhelperctl("location", "wan-ip")
        expect_push(ADDRESS_PUSH)
        expect(os.path.samefile(f"/proc/{property_of(SERVICE, 'MainPID')}/exe", HELPER), "the program that is installed runs")
        expect_equal(property_of("brenvikd.service", "MainPID"), daemon, "it is the same daemon")
    expect_equal(ping_sockets.read_text().split(), ["0", "7"], "ping sockets that the administrator has opened")
    expect_equal(run("dpkg", "-V", *PACKAGES, check=False).stdout, "", "dpkg --verify")
    expect(os.path.exists("/etc/brenvik/entitlements.d/50-bvhelperctl.plist"), "entitlements stay")


def upgrade_from_a_version_without_workers():
    """With a client that stays connected: it is served on, and the workers' sockets are there afterwards."""
    run("dpkg", "-P", "brenvik-mobile-helper")
    expect(not os.path.exists("/run/brenvik"), "/run/brenvik is left behind")
    # The other packages are those of the new version, and say that they do not go with it.
    run("dpkg", "--force-depends", "--force-breaks", "-i", "/packages/earlier.deb")
    for path in WORKERS.values():
        expect(not os.path.exists(path), f"not yet there: {path}")
    with Library().connected(PATH):
        process = property_of(SERVICE, "MainPID")
        pathlib.Path("/proc/sys/net/ipv4/ping_group_range").write_text("0 0")  # as it left it
        printed = run("dpkg", "-i", *glob.glob("/packages/upgrade/brenvik-mobile-helper_*.deb")).stdout
        workers_listen()
        expect_equal(property_of(SERVICE, "MainPID"), process, "a helper at work is left alone")
        expect(f"process {process}" in printed, f"the helper that was replaced is not named\n{printed}")
        expect_equal(bvhelperctl("voicemail", "token").stdout, "a-token\n", "the helper that was there finds the new worker")
    expect_equal(pathlib.Path("/proc/sys/net/ipv4/ping_group_range").read_text().split(), ["0", "2147483647"], "ping sockets")


def owner_of(path):
    return run("dpkg", "-S", path).stdout.split(":")[0]


def install_the_earlier_release():
    BEFORE.update(everything())
    install_all("/packages/earlier")
    expect_equal(property_of(SOCKET, "ActiveState"), "active", SOCKET)
    run("cp", "/usr/share/doc/bvhelperctl/examples/50-bvhelperctl.plist", "/etc/brenvik/entitlements.d/")
    entitle_this_test()
    bvhelperctl("prefs", "set", "com.example.install", "text", "Grüße")
    bvhelperctl("voicemail", "set-token", "a-token")


def upgrade_from_the_earlier_release():
    """All packages at once, with a client that stays connected: the helper of the earlier release serves it on until it is
    ended as the manual page says, and the client goes on with the new one."""
    gazetteer = "/usr/share/brenvik/gazetteer.db"
    print(f"        {gazetteer} was in {owner_of(gazetteer)}", flush=True)
    with Library().connected(PATH) as ask:
        process = property_of(SERVICE, "MainPID")
        printed = install_all("/packages")
        for text in (f"process {process}", "replaced", "bvhelperctl status", f"systemctl stop {SERVICE}"):
            expect(text in printed, f"the package manager does not print: {text}\n{printed}")
        expect_equal(run("dpkg", "-V", *PACKAGES, check=False).stdout, "", "dpkg --verify")
        expect_equal(owner_of(gazetteer), "brenvik-mobile-helper-data", gazetteer)
        workers_listen()

        expect_equal(property_of(SERVICE, "MainPID"), process, "a helper at work is left alone")
        expect(os.readlink(f"/proc/{process}/exe").endswith(" (deleted)"), "it is the earlier program")
        expect_equal(ask(), (0, "a-token"), "it serves its client on")
        expect_equal(bvhelperctl("prefs", "get", "com.example.install", "text").stdout, "Grüße\n", "and the new bvhelperctl")
        told = bvhelperctl("status", check=False)
        expect(f"process {process}" in told.stdout + told.stderr and "restart pending" in told.stderr,
               f"what status says of it: {told.stdout}{told.stderr}")

        # As BrenvikMobileHelper(8) has it, "UPGRADING".
        run("sh", "-c", "while bvhelperctl --json status | grep -q '\"busyTokens\":[1-9]'; do sleep 1; done\n"
                        f"systemctl stop {SERVICE}")
        expect_equal(ask(), (0, "a-token"), "the client has not noticed")
        started = property_of(SERVICE, "MainPID")
        expect(started != process and os.path.samefile(f"/proc/{started}/exe", HELPER), "the program that is installed runs")
        expect_equal(bvhelperctl("prefs", "get", "com.example.install", "text").stdout, "Grüße\n", "what was stored stays")
        status = json.loads(bvhelperctl("--json", "status").stdout)
        expect_equal((status["pid"], status["restartPending"], "notes" in status), (int(started), False, False), "status")


def remove():
    run("dpkg", "-r", "brenvik-mobile-helper")
    for path in (PATH, *WORKERS.values()):
        expect(not os.path.exists(path), f"nobody listens at {path}")
    expect(not os.path.exists("/usr/libexec/brenvik"), "the programs are gone")
    running = []
    for each in glob.glob("/proc/[0-9]*/comm"):
        with contextlib.suppress(FileNotFoundError, ProcessLookupError):  # a process that has ended since it was listed
            if pathlib.Path(each).read_text() in ("BrenvikMobileHe\n", "brenvik-caller-\n", "brenvik-network\n", "brenvik-store-w\n"):
                running.append(each)
    expect_equal(running, [], "none is left running")
    expect_equal(bvhelperctl("ping", check=False).returncode, 5, "no helper")
    expect(os.path.exists("/etc/brenvik/entitlements.d/50-bvhelperctl.plist"), "entitlements stay")


def purge():
    run("rm", *glob.glob("/etc/brenvik/entitlements.d/*"))
    run("dpkg", "-P", *PACKAGES)
    # The user's data stay, and so do the accounts with the copies that their tools keep of the files.
    left = [each for each in sorted(everything() - BEFORE)
            if not (each + "/").startswith(("/root/Library/", "/var/mobile/"))
            and each not in ("/etc/passwd-", "/etc/group-", "/etc/shadow-", "/etc/gshadow-", "/etc/.pwd.lock")]
    expect_equal(left, [], "left behind")
    expect(not os.path.exists("/run/brenvik"), "/run/brenvik is left behind")
    for path in ("/root/Library/Preferences/com.example.install.plist", "/var/mobile/Library/Voicemail/voicemail.db"):
        expect(os.path.exists(path), f"the user's, and gone: {path}")
    expect_equal(run("dpkg-query", "-W", "-f=${Package}\n", "*brenvik*", "bvhelperctl", check=False).stdout, "")


def main():
    steps = [install, passes_its_own_smoke_test, refused_without_an_entitlement, served_with_one, python_works, works_in_its_sandbox,
             stores_no_preference_where_it_would_be_lost, works_for_the_whole_phone,
             asks_the_network, beats_over_the_cellular_link, held_in_its_sandbox,
             a_helper_that_was_taken_over_is_held, a_caller_worker_that_was_taken_over_is_held,
             a_network_worker_that_was_taken_over_is_held,
             a_store_worker_that_was_taken_over_is_held, serves_without_the_account_mobile,
             only_root_reaches_a_worker,
             other_accounts_are_told_apart, the_handbook_is_whole, a_telephony_daemon_without_rights_lives_with_it,
             journal_explains, tells_what_keeps_it, leaves_when_idle_and_comes_back,
             a_burst_is_one_start, nothing_is_lost_at_the_idle_edge, comes_back_after_a_limit,
             upgrade_under_a_living_telephony_daemon,
             upgrade_from_a_version_without_workers, remove, purge]
    if sys.argv[1:] == ["earlier"]:
        steps = [install_the_earlier_release, upgrade_from_the_earlier_release, remove, purge]
    for step in steps:
        began = time.monotonic()
        try:
            step()
        except Exception as error:  # the reason, and what the system says
            print(f"FAILED  {step.__name__}: {error}")
            print(run("journalctl", "--no-pager", "-n", "60", "-o", "short-monotonic", check=False).stdout)
            return 1
        print(f"ok      {step.__name__.replace('_', ' ')} ({time.monotonic() - began:.1f} s)", flush=True)
    return 0


if __name__ == "__main__":
    sys.exit(main())
