# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Networks, an authority, a web server and the telephony daemon's message port, for tests in the sandbox."""
import os
import pathlib
import plistlib
import select
import shutil
import socket
import struct
import subprocess
import tempfile
import threading
import time

import wire

ETH_P_ALL, ETH_P_IP, ETH_P_IPV6 = 3, 0x0800, 0x86DD
SO_TIMESTAMPNS = 35
SYSTEM_AUTHORITIES = "/etc/ssl/certs/ca-certificates.crt"


def run(*command, **options):
    return subprocess.run([str(word) for word in command], check=True, capture_output=True, text=True, **options)


def ip(*arguments):
    run("ip", *arguments)


def default_settings():
    """Loopback on; no IPv6, whose own chatter would fill every capture."""
    ip("link", "set", "lo", "up")


def has_ipv6():
    setting = pathlib.Path("/proc/sys/net/ipv6/conf/default/disable_ipv6")
    return setting.exists() and setting.read_text().strip() == "0"


class FarEnd:
    """Another machine: a network namespace joined to ours by one interface of the given name."""

    def __init__(self, test, name, ours, theirs, number=0):
        self.process = subprocess.Popen(["unshare", "-n", "sleep", "infinity"])
        test.addCleanup(self._end)
        self.name, self.far = name, f"far{number}"
        self._wait_for_own_namespace()
        ip("link", "add", name, "type", "veth", "peer", "name", self.far, "netns", self.process.pid)
        test.addCleanup(subprocess.run, ["ip", "link", "del", name], capture_output=True)
        ip("address", "add", ours, "dev", name)
        ip("link", "set", name, "up")
        self.ip("link", "set", "lo", "up")
        for address in [theirs] if isinstance(theirs, str) else theirs:
            self.ip("address", "add", address, "dev", self.far, *(["nodad"] if ":" in address else []))
        self.ip("link", "set", self.far, "up")
        self._wait_until_up()

    def _wait_until_up(self):
        """The kernel notices a little later that both ends are up, and drops what is sent before that."""
        end = time.monotonic() + 10
        for command in (["ip", "link", "show", "dev", self.name], self.command("ip", "link", "show", "dev", self.far)):
            while "state UP" not in run(*command).stdout:
                if time.monotonic() > end:
                    raise AssertionError(f"{self.name} does not come up")
                time.sleep(0.01)

    def _wait_for_own_namespace(self):
        end = time.monotonic() + 10
        ours = os.stat("/proc/self/ns/net").st_ino
        while os.stat(f"/proc/{self.process.pid}/ns/net").st_ino == ours:
            if time.monotonic() > end:
                raise AssertionError("no network namespace")
            time.sleep(0.01)

    def _end(self):
        self.process.kill()
        self.process.wait()

    def command(self, *command):
        return ["nsenter", f"--net=/proc/{self.process.pid}/ns/net", *map(str, command)]

    def ip(self, *arguments):
        run(*self.command("ip", *arguments))

    def within(self, work):
        """Runs work() in the far network, on a thread of its own, and returns what it returns."""
        result = []

        def body():
            with open(f"/proc/{self.process.pid}/ns/net") as namespace:
                os_setns(namespace.fileno())
            result.append(work())

        thread = threading.Thread(target=body)
        thread.start()
        thread.join()
        return result[0]

    def tap(self):
        """A socket that sees every packet that arrives there."""
        def make():
            sock = socket.socket(socket.AF_PACKET, socket.SOCK_DGRAM, socket.htons(ETH_P_ALL))
            sock.setsockopt(socket.SOL_SOCKET, SO_TIMESTAMPNS, 1)
            sock.bind((self.far, ETH_P_ALL))
            return sock
        return Tap(self.within(make))


def os_setns(descriptor):
    import ctypes
    libc = ctypes.CDLL(None, use_errno=True)
    if libc.setns(descriptor, 0x40000000) != 0:  # CLONE_NEWNET
        raise OSError(ctypes.get_errno(), "setns")


def arrival(ancillary):
    """When the kernel had a packet that came to a socket with SO_TIMESTAMPNS, on the clock of time.monotonic."""
    seconds, nanoseconds = next(struct.unpack("=qq", value) for _, kind, value in ancillary if kind == SO_TIMESTAMPNS)

    def look():
        before, day, after = time.monotonic(), time.time(), time.monotonic()
        return after - before, day - before
    # Of several looks at both clocks the one that was least held up.
    return seconds + nanoseconds / 1e9 - min(look() for _ in range(5))[1]


class Tap:
    def __init__(self, sock):
        self.sock = sock

    def packets(self, atleast=0, timeout=0.0):
        """[(time, protocol, bytes)] since the last call, the kernel's own IPv6 housekeeping left out.

        The time is the packet's arrival as the kernel had it, so that a test which reads late is told the truth; on the
        clock of time.monotonic.
        """
        result, end = [], time.monotonic() + timeout
        while True:
            left = max(0.0, end - time.monotonic()) if len(result) < atleast else 0
            if not select.select([self.sock], [], [], left)[0]:
                return result
            data, ancillary, _, (_, protocol, kind, *_) = self.sock.recvmsg(65536, 128)
            housekeeping = protocol == ETH_P_IPV6 and data[6] in (0, 58)
            if kind != socket.PACKET_OUTGOING and not housekeeping:
                result.append((arrival(ancillary), protocol, data))

    def close(self):
        self.sock.close()


class Authority:
    """Signs server certificates; trust() makes this machine believe it."""

    def __init__(self, test, name="Test authority"):
        self.folder = pathlib.Path(tempfile.mkdtemp())
        test.addCleanup(shutil.rmtree, self.folder)
        self.certificate, self.key = self.folder / "ca.pem", self.folder / "ca.key"
        run("openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256", "-nodes", "-days", "2",
            "-subj", f"/CN={name}", "-keyout", self.key, "-out", self.certificate)
        self.number = 0

    def issue(self, names, start=None, end=None):
        """(certificate, key) for DNS names; start and end as YYYYMMDDHHMMSSZ."""
        self.number += 1
        base = self.folder / f"server{self.number}"
        key, request, certificate = (base.with_suffix(s) for s in (".key", ".csr", ".pem"))
        run("openssl", "req", "-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:P-256", "-nodes", "-subj", "/CN=server",
            "-keyout", key, "-out", request)
        database = self.folder / f"db{self.number}"
        database.mkdir()
        (database / "index").touch()
        config = database / "config"
        config.write_text(
            "[ca]\ndefault_ca=c\n[c]\ndatabase=%s/index\nnew_certs_dir=%s\nrand_serial=yes\ndefault_md=sha256\n"
            "policy=p\nx509_extensions=x\n[p]\ncommonName=supplied\n[x]\nbasicConstraints=CA:FALSE\n"
            "subjectAltName=%s\n" % (database, database, ",".join(f"DNS:{name}" for name in names)))
        dates = ["-startdate", start, "-enddate", end] if start else ["-days", "1"]
        run("openssl", "ca", "-batch", "-config", config, "-cert", self.certificate, "-keyfile", self.key,
            "-in", request, "-out", certificate, "-notext", *dates)
        return certificate, key

    def trust(self, test):
        """Is the system's only authority until the test ends.

        To read the real ones takes a connection half a million blocks of memory, which under a sanitizer and beside other
        tests is longer than the daemon has patience with a map server.
        """
        run("mount", "--bind", self.certificate, SYSTEM_AUTHORITIES)
        test.addCleanup(run, "umount", SYSTEM_AUTHORITIES)


class Nginx:
    """The real web server, on port 443 of the network it is started in."""

    def __init__(self, test, certificate, key, extra="", prefix=()):
        self.folder = pathlib.Path(tempfile.mkdtemp())
        test.addCleanup(shutil.rmtree, self.folder)
        os.chmod(self.folder, 0o755)
        self.root = self.folder / "root"
        self.root.mkdir()
        self.prefix, self.process = list(prefix), None
        test.addCleanup(self.stop)
        self.start(certificate, key, extra)

    def start(self, certificate, key, extra=""):
        f = self.folder
        config = f / "nginx.conf"
        config.write_text(f"""
            daemon off; master_process off; pid {f}/pid; error_log {f}/error.log;
            events {{}}
            http {{
              access_log {f}/access.log combined buffer=1 flush=1;
              access_log {f}/access.log;
              client_body_temp_path {f}/t1; proxy_temp_path {f}/t2; fastcgi_temp_path {f}/t3;
              uwsgi_temp_path {f}/t4; scgi_temp_path {f}/t5;
              types {{ application/gzip gz; application/xml plist; }}
              default_type application/octet-stream;
              server {{
                listen 443 ssl; ssl_certificate {certificate}; ssl_certificate_key {key};
                root {self.root};
                {extra}
              }}
            }}""".replace(f"access_log {f}/access.log combined buffer=1 flush=1;", ""))
        self.process = subprocess.Popen([*self.prefix, "/usr/sbin/nginx", "-c", str(config)], stderr=subprocess.DEVNULL)
        end = time.monotonic() + 10
        while not (f / "pid").exists() or not (f / "pid").read_text().strip():
            if self.process.poll() is not None or time.monotonic() > end:
                raise AssertionError("nginx: " + (f / "error.log").read_text())
            time.sleep(0.01)

    def stop(self):
        if self.process is not None:
            # Not asked to: what it is asked between the start and its first wait for a client, it does after that wait.
            self.process.kill()
            self.process.wait()
            self.process = None
            (self.folder / "pid").unlink(missing_ok=True)

    def requests(self):
        """The paths asked for, in order, as far as the log has them: it has a request a little after its answer."""
        return [line.split('"')[1].split(" ")[1] for line in (self.folder / "access.log").read_text().splitlines()]

    def user_requests(self):
        return (self.folder / "access.log").read_text()


class MessagePort:
    """The telephony daemon's message port: keeps every notification."""

    NAME = "com.norvale.Brenvik.lasd"

    def __init__(self, test):
        path = pathlib.Path(wire.BOOTSTRAP) / self.NAME
        path.parent.mkdir(parents=True, exist_ok=True)
        path.unlink(missing_ok=True)
        self.sock = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        self.sock.bind(str(path))
        self.sock.listen(64)
        self.notifications, self.headers = [], []
        self.changed = threading.Condition()
        self.thread = threading.Thread(target=self._serve, daemon=True)
        self.thread.start()
        test.addCleanup(self._close, path)

    def _serve(self):
        while True:
            try:
                connection, _ = self.sock.accept()
            except OSError:
                return
            with connection:
                while data := connection.recv(1 << 16):
                    with self.changed:
                        self.headers.append(struct.unpack_from("<6I", data))
                        assert data[24:].startswith(b"bplist00")
                        self.notifications.append(plistlib.loads(data[24:]))
                        self.changed.notify_all()

    def _close(self, path):
        self.sock.shutdown(socket.SHUT_RDWR)
        self.thread.join()
        self.sock.close()
        path.unlink(missing_ok=True)

    def wait_for(self, count, timeout=30):
        """The first `count` notifications, without the beginning they share: "UpdateAvailable gsm"."""
        with self.changed:
            if not self.changed.wait_for(lambda: len(self.notifications) >= count, timeout):
                raise AssertionError(f"{len(self.notifications)} of {count} notifications: {self.notifications}")
            return self.texts()

    def texts(self):
        with self.changed:
            return [" ".join([n["Notification"].removeprefix("com.norvale.lasd."), *([n["DBType"]] if "DBType" in n else [])])
                    for n in self.notifications]

    def clear(self):
        with self.changed:
            self.notifications.clear()
            self.headers.clear()
