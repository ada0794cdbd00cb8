#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The life of the packages on a real system, from installation to purge. Runs in a container, as root, once."""
import ctypes
import glob
import os
import pathlib
import plistlib
import pwd
import socket
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
IDLE = 10.0


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


def log_of_the_helper():
    return run("journalctl", "-t", "BrenvikMobileHelper", "-o", "cat").stdout


def bvhelperctl(*arguments, check=True):
    return run("bvhelperctl", *arguments, check=check)


class Library:
    """The installed C library: connects again by itself when the helper has left before it answered."""

    def __init__(self):
        self.lib = ctypes.CDLL("libbrenvik-mobile-helper.so.0")
        self.lib.bvmh_client_create.restype = ctypes.c_void_p
        self.lib.bvmh_error_text.restype = ctypes.c_char_p
        for name in ("bvmh_client_free", "bvmh_connect", "bvmh_client_set_socket", "BVMobileHelperCopyVoicemailToken"):
            getattr(self.lib, name).argtypes = [ctypes.c_void_p]
        self.lib.bvmh_client_set_socket.argtypes = [ctypes.c_void_p, ctypes.c_char_p]
        self.lib.BVMobileHelperCopyVoicemailToken.argtypes = [ctypes.c_void_p, ctypes.c_char_p, ctypes.c_size_t]

    def request(self, path):
        """One client, one check-in, one request. Returns the code and the token."""
        client = self.lib.bvmh_client_create()
        try:
            code = self.lib.bvmh_client_set_socket(client, path.encode())
            buffer = ctypes.create_string_buffer(257)
            if code == 0:
                code = self.lib.bvmh_connect(client)
            if code == 0:
                code = self.lib.BVMobileHelperCopyVoicemailToken(client, buffer, 257)
            return code, buffer.value.decode()
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


# ---- steps, in order -------------------------------------------------------------------------------------------


def install():
    packages = [each for each in glob.glob("/packages/*.deb") if "upgrade" not in each]
    run("dpkg", "-i", *packages, env={**os.environ, "DEBIAN_FRONTEND": "noninteractive"})
    expect_equal(property_of(SOCKET, "ActiveState"), "active", SOCKET)
    expect_equal(property_of(SOCKET, "UnitFileState"), "enabled", SOCKET)
    expect_equal(property_of(SERVICE, "ActiveState"), "inactive", "nobody has asked yet")
    expect_equal(stat.S_IMODE(os.stat(PATH).st_mode), 0o666, "mode of the socket")
    mobile = pwd.getpwnam("mobile")
    expect_equal(mobile.pw_dir, "/var/mobile")
    expect_equal(os.stat("/var/mobile").st_uid, mobile.pw_uid)
    expect(os.path.samefile("/private/var/mobile", "/var/mobile"), "/private/var leads to /var")
    # The heartbeat's ping sockets, for which the service has no other right.
    expect_equal(pathlib.Path("/proc/sys/net/ipv4/ping_group_range").read_text().split(), ["0", "0"], "ping sockets")
    socket.socket(socket.AF_INET, socket.SOCK_DGRAM, socket.IPPROTO_ICMP).close()
    for folder in ("/etc/brenvik/entitlements.d", "/usr/lib/brenvik/entitlements.d"):
        facts = os.stat(folder)
        expect_equal((facts.st_uid, stat.S_IMODE(facts.st_mode)), (0, 0o755), folder)


def refused_without_an_entitlement():
    done = bvhelperctl("ping", check=False)
    expect_equal(done.returncode, 1, "ping without an entitlement")
    expect("com.norvale.Teravox.BrenvikHelper.allow" in done.stderr, "says how to get one")


def served_with_one():
    run("cp", "/usr/share/doc/bvhelperctl/examples/50-bvhelperctl.plist", "/etc/brenvik/entitlements.d/")
    bvhelperctl("ping")
    expect_equal(property_of(SERVICE, "ActiveState"), "active", "started by the client")


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
    expect_equal(bvhelperctl("labels", "badges", "--language", "de", "--label", "business").stdout, "G\n")
    bvhelperctl("heartbeat", "on")
    bvhelperctl("heartbeat", "off")


def held_in_its_sandbox():
    before = pathlib.Path("/etc/hostname").read_bytes() if os.path.exists("/etc/hostname") else None
    expect_equal(bvhelperctl("carrier", "create-link", "/x", "/etc/hostname", check=False).returncode, 1)
    expect_equal(pathlib.Path("/etc/hostname").read_bytes() if before is not None else None, before)
    expect_equal(bvhelperctl("carrier", "unpack", "/tmp/bundle.zip", "/usr/bundle", check=False).returncode, 1)
    pathlib.Path("/home/secret.plist").write_bytes(plistlib.dumps({"a": 1}))
    expect_equal(bvhelperctl("plist", "load", "/home/secret.plist", check=False).returncode, 1)
    main = int(property_of(SERVICE, "MainPID"))
    status = pathlib.Path(f"/proc/{main}/status").read_text()
    fields = dict(line.split(":\t") for line in status.splitlines() if ":\t" in line)
    bits = {"CAP_CHOWN": 0, "CAP_DAC_OVERRIDE": 1, "CAP_FOWNER": 3, "CAP_SYS_PTRACE": 19}
    expect_equal(int(fields["CapBnd"], 16), sum(1 << each for each in bits.values()), "bounding set")
    expect_equal((fields["NoNewPrivs"], fields["Seccomp"]), ("1", "2"), "no new privileges, a filter")
    # Privileges of the archive reader are looked at by its tests; here: it was started in the same sandbox.
    expect("ArkCopier signaled fatal file error" in log_of_the_helper(), "the refused archive is in the log")


def other_accounts_are_told_apart():
    """Reading the executable of another account's process is what CAP_SYS_PTRACE is kept for."""
    run("useradd", "--system", "--no-create-home", "telephony")
    done = run("setpriv", "--reuid=telephony", "--regid=telephony", "--clear-groups", "bvhelperctl", "ping", check=False)
    expect_equal(done.returncode, 1, "another account, the same program")
    file = pathlib.Path("/etc/brenvik/entitlements.d/60-telephony.plist")
    file.write_bytes(plistlib.dumps({"Executable": "/usr/bin/bvhelperctl", "User": "telephony",
                                     "Entitlements": {"com.norvale.Teravox.BrenvikHelper.allow": True}}))
    os.chmod(file, 0o644)
    run("setpriv", "--reuid=telephony", "--regid=telephony", "--clear-groups", "bvhelperctl", "ping")


def journal_explains():
    bvhelperctl("plist", "load", "/nowhere.plist", check=False)
    bvhelperctl("carrier", "remove", "/etc/passwd", check=False)
    shown = run("journalctl", "-x", "-t", "BrenvikMobileHelper").stdout
    for text in ("Could not create data representation of dictionary", "The file is missing, cannot be read, or",
                 "NOT Allowing path /etc/passwd as it isn't within the wild card directories:", "Something was refused",
                 "ArkCopier signaled fatal file error", "The archive is damaged, hostile or no zip archive"):
        expect(text in shown, f"journalctl -x does not show: {text}\n{shown[-3000:]}")
    expect("a-token" not in shown and "Grüße" not in shown, "no token and no value in the log")


def leaves_when_idle_and_comes_back():
    bvhelperctl("ping")
    left = time.monotonic()
    wait_for(lambda: property_of(SERVICE, "ActiveState") == "inactive", "idle exit")
    expect(IDLE - 0.5 < time.monotonic() - left < IDLE + 5, f"left after {time.monotonic() - left:.1f} s")
    expect_equal(property_of(SERVICE, "Result"), "success")
    expect_equal(property_of(SERVICE, "ExecMainStatus"), "0")
    expect_equal(property_of(SOCKET, "ActiveState"), "active", "the socket stays")
    expect_equal(bvhelperctl("voicemail", "token").stdout, "a-token\n")


def nothing_is_lost_at_the_idle_edge():
    """1,000 requests around 50 idle edges: as many instances of the unit, each asked twenty times around the moment in
    which it leaves. The first of the twenty comes between 5 ms before that moment and 35 ms after it."""
    instances, each_time = 50, 20
    unit = pathlib.Path(f"/lib/systemd/system/{SERVICE}").read_text().replace(SOCKET, "edge@%i.socket")
    pathlib.Path("/run/systemd/system/edge@.service").write_text(unit)
    listening = pathlib.Path(f"/lib/systemd/system/{SOCKET}").read_text().replace(PATH, "/run/edge/%i")
    pathlib.Path("/run/systemd/system/edge@.socket").write_text(listening)
    run("systemctl", "daemon-reload")
    # The test speaks for itself here, so its interpreter is entitled.
    file = pathlib.Path("/etc/brenvik/entitlements.d/70-test.plist")
    file.write_bytes(plistlib.dumps({"Executable": os.path.realpath(sys.executable),
                                     "Entitlements": {"com.norvale.Teravox.BrenvikHelper.allow": True}}))
    os.chmod(file, 0o644)
    names = [f"edge@{i}.socket" for i in range(instances)]
    run("systemctl", "start", *names)
    library = Library()
    answers = [[] for _ in range(instances)]
    began = time.monotonic() + 0.5
    spacing = 0.2  # starts spread over ten seconds, so that the processors are not what is measured

    def client(number):
        path = f"/run/edge/{number}"
        time.sleep(max(0.0, began + number * spacing - time.monotonic()))
        expect_equal(library.request(path), (0, "a-token"), f"first request of {number}")
        edge = time.monotonic() + IDLE
        first = -0.005 + 0.040 * (number * 37 % instances) / instances
        for turn in range(each_time):
            time.sleep(max(0.0, edge + first + turn * 0.004 - time.monotonic()))
            answers[number].append(library.request(path))

    threads = [threading.Thread(target=client, args=(number,)) for number in range(instances)]
    for thread in threads:
        thread.start()
    for thread in threads:
        thread.join()
    flat = [answer for answers_of_one in answers for answer in answers_of_one]
    expect_equal(len(flat), instances * each_time, "requests")
    wrong = [answer for answer in flat if answer != (0, "a-token")]
    expect(not wrong, f"{len(wrong)} of {len(flat)} lost: {wrong[:5]}")
    starts = run("journalctl", "-o", "cat", "-u", "edge@*.service", "-g", "^Started ").stdout.count("Started ")
    print(f"    {len(flat)} requests, none lost; {starts} starts of {instances} instances", flush=True)
    expect(starts > instances + instances // 4, "too few edges were met for this to mean anything")
    run("systemctl", "stop", *names)


def comes_back_after_a_limit():
    folder = pathlib.Path(f"/run/systemd/system/{SERVICE}.d")
    folder.mkdir(parents=True)
    (folder / "broken.conf").write_text("[Unit]\nStartLimitBurst=5\n[Service]\nExecStart=\nExecStart=/bin/false\n")
    run("systemctl", "stop", SERVICE)
    run("systemctl", "daemon-reload")
    bvhelperctl("--timeout", "5", "ping", check=False)
    wait_for(lambda: property_of(SOCKET, "ActiveState") == "failed", "the start limit")
    (folder / "broken.conf").unlink()
    run("systemctl", "daemon-reload")
    wait_for(lambda: property_of(SOCKET, "ActiveState") == "active", "the way back", 30)
    bvhelperctl("ping")


def upgrade():
    bvhelperctl("ping")
    process = property_of(SERVICE, "MainPID")
    run("dpkg", "-i", "/packages/upgrade.deb")
    expect_equal(property_of(SOCKET, "ActiveState"), "active", "listens on")
    expect_equal(property_of(SERVICE, "MainPID"), process, "a helper at work is left alone")
    expect_equal(bvhelperctl("voicemail", "token").stdout, "a-token\n")
    expect(os.path.exists("/etc/brenvik/entitlements.d/50-bvhelperctl.plist"), "entitlements stay")


def remove():
    run("dpkg", "-r", "brenvik-mobile-helper")
    expect(not os.path.exists(PATH), "nobody listens")
    expect(not os.path.exists("/usr/libexec/brenvik"), "the programs are gone")
    running = [each for each in glob.glob("/proc/[0-9]*/comm") if pathlib.Path(each).read_text() == "BrenvikMobileHe\n"]
    expect_equal(running, [], "none is left running")
    expect_equal(bvhelperctl("ping", check=False).returncode, 2, "no helper")
    expect(os.path.exists("/etc/brenvik/entitlements.d/50-bvhelperctl.plist"), "entitlements stay")


def purge():
    run("rm", *glob.glob("/etc/brenvik/entitlements.d/*"))
    run("dpkg", "-P", "brenvik-mobile-helper", "bvhelperctl", "libbrenvik-mobile-helper-dev", "libbrenvik-mobile-helper0")
    for path in ("/etc/brenvik", "/private", "/run/brenvik", "/var/lib/brenvik", "/usr/lib/brenvik"):
        expect(not os.path.lexists(path), f"left behind: {path}")
    for path in ("/root/Library/Preferences/com.example.install.plist", "/var/mobile/Library/Voicemail/voicemail.db"):
        expect(os.path.exists(path), f"the user's, and gone: {path}")
    expect_equal(run("dpkg-query", "-W", "-f=${Package}\n", "*brenvik*", "bvhelperctl", check=False).stdout, "")


def main():
    steps = [install, refused_without_an_entitlement, served_with_one, works_in_its_sandbox, held_in_its_sandbox,
             other_accounts_are_told_apart, journal_explains, leaves_when_idle_and_comes_back,
             nothing_is_lost_at_the_idle_edge, comes_back_after_a_limit, upgrade, remove, purge]
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
