# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Admission by entitlement files, the radio log switch and the hosted baseband server, on the real process."""
import hashlib
import os
import pathlib
import plistlib
import re
import shutil
import socket
import sys
import time
import unittest

import wire
from harness import (ALLOW, BUILD, ENTITLEMENTS, ERROR, LOG_ERR, SANITIZED, Daemon, HelperTest, as_account, entitle,
                     eventually, in_a_new_process, main, refused_with)

SYSTEM_BUS = pathlib.Path("/run/dbus/system_bus_socket")
HOSTED = "libbrenvik-baseband-helper.so.0"
TICK = 10.0  # seconds


class EntitlementFiles(HelperTest):
    def prepare(self):
        (ENTITLEMENTS / "50-test.plist").unlink()

    def tearDown(self):
        shutil.rmtree(ENTITLEMENTS)

    def test_the_first_file_in_bytewise_order_of_the_names_that_has_the_key_decides(self):
        entitle("b.plist", value=True)
        self.assertEqual(in_a_new_process(), 0)
        entitle("a.plist", value=False)
        self.assertEqual(in_a_new_process(), 35)
        entitle("Z.plist", value=True)
        self.assertEqual(in_a_new_process(), 0)
        path = entitle("0.plist")
        path.write_bytes(plistlib.dumps({"Executable": os.path.realpath(sys.executable), "Entitlements": {}}))
        self.assertEqual(in_a_new_process(), 0, "a file without the key decides nothing")
        self.assertEqual(self.logs.lines, [])

    def test_the_executable_is_the_very_file_links_followed(self):
        link = pathlib.Path("/tmp/interpreter")
        link.symlink_to(os.path.realpath(sys.executable))
        self.addCleanup(link.unlink)
        path = entitle("a.plist")
        path.write_bytes(plistlib.dumps({"Executable": str(link), "Entitlements": {ALLOW: True}}))
        self.assertEqual(in_a_new_process(), 0)
        path.write_bytes(plistlib.dumps({"Executable": "/usr/bin/env", "Entitlements": {ALLOW: True}}))
        self.assertEqual(in_a_new_process(), 35)

    def test_a_copy_of_the_executable_is_another_program(self):
        copy = pathlib.Path("/usr/bin/python3").resolve()
        other = pathlib.Path("/tmp/python-copy")
        shutil.copy2(copy, other)
        self.addCleanup(other.unlink)
        entitle("a.plist")
        self.assertEqual(in_a_new_process(str(other)), 35)
        entitle("a.plist", executable=str(other))
        self.assertEqual(in_a_new_process(str(other)), 0)
        other.chmod(0o775)
        self.assertEqual(in_a_new_process(str(other)), 35)
        self.logs.wait_for("unified", ERROR, f"entitlement file {ENTITLEMENTS}/a.plist passed over: its executable "
                           "is not owned by root, or others may write to it")

    def test_a_digest_must_match_and_its_library_is_loaded_only_then(self):
        digest = hashlib.sha256(pathlib.Path(os.path.realpath(sys.executable)).read_bytes()).hexdigest()
        entitle("a.plist")
        self.assertEqual(in_a_new_process(), 0)
        self.assertNotIn("libcrypto", self.daemon.maps())
        entitle("a.plist", SHA256=digest.upper())
        self.assertEqual(in_a_new_process(), 0)
        self.assertIn("libcrypto", self.daemon.maps())
        entitle("a.plist", SHA256=digest[:-1] + ("0" if digest[-1] != "0" else "1"))
        self.assertEqual(in_a_new_process(), 35)

    def test_a_unit_that_the_caller_is_not_in_is_no_match(self):
        entitle("a.plist", Unit="some-other.service")
        self.assertEqual(in_a_new_process(), 35)

    def test_keys_of_the_wrong_type_make_a_file_no_match(self):
        good = {"Executable": os.path.realpath(sys.executable), "Entitlements": {ALLOW: True}}
        path = entitle("a.plist")
        for key, value in (("Executable", 1), ("User", 0), ("Unit", ["x"]), ("SHA256", b"\0" * 32),
                           ("Entitlements", [ALLOW])):
            path.write_bytes(plistlib.dumps({**good, key: value}))
            self.assertEqual(in_a_new_process(), 35, key)
        path.write_bytes(plistlib.dumps(good, fmt=plistlib.FMT_BINARY))
        self.assertEqual(in_a_new_process(), 0, "binary files are read as well")

    def test_what_is_no_regular_file_is_passed_over_reported_and_holds_nobody_up(self):
        entitle("z.plist")
        os.mkfifo(ENTITLEMENTS / "a.plist", 0o644)
        (ENTITLEMENTS / "b.plist").symlink_to("z.plist")
        self.assertEqual(in_a_new_process(), 0)
        for name in ("a", "b"):
            self.logs.wait_for("unified", ERROR,
                               f"entitlement file {ENTITLEMENTS}/{name}.plist passed over: not a regular file")

    def test_a_folder_that_others_may_write_to_entitles_nobody(self):
        entitle("a.plist")
        ENTITLEMENTS.chmod(0o775)
        self.assertEqual(in_a_new_process(), 35)
        self.logs.wait_for("unified", ERROR, f"entitlement directory {ENTITLEMENTS} passed over: not owned by root, "
                           "or others may write to it")

    def test_a_file_owned_by_another_account_entitles_nobody(self):
        path = entitle("a.plist")
        os.chown(path, 602, 602)
        self.assertEqual(in_a_new_process(), 35)
        self.logs.wait_for("unified", ERROR, f"entitlement file {path} passed over: not owned by root, or others "
                           "may write to it")

    def test_refused_check_ins_leave_no_descriptor_behind(self):
        entitle("a.plist", SHA256="0" * 64)
        self.assertEqual(refused_with(), 35)
        before = self.daemon.descriptors()
        for _ in range(20):
            self.assertEqual(refused_with(), 35)
        self.assertEqual(as_account("stranger", refused_with), 35)
        # It learns a little later that a caller has closed its connection.
        eventually(lambda: self.daemon.descriptors() <= before, what="every descriptor being closed")


class RadioLogs(HelperTest):
    def enable(self, client, value):
        self.assertEqual(client.status("EnableRadioManagerLogs", value.to_bytes(4, "little", signed=True)), 0)

    @unittest.skipIf(SANITIZED, "a sanitizer brings libraries of its own")
    def test_what_speaks_to_the_bus_is_loaded_with_the_first_request_and_nothing_but_the_language_before(self):
        client = self.client()
        libraries = set(re.findall(r"/(\w[^/\s]*\.so)\b", self.daemon.maps()))
        self.assertLessEqual(libraries, {"libc.so", "libm.so", "libstdc++.so", "libgcc_s.so", "ld-linux-x86-64.so",
                                         "ld-linux-aarch64.so"})
        self.assertIn("libc.so", libraries)
        self.enable(client, 1)
        eventually(lambda: "libsystemd.so" in self.daemon.maps(), what="the library")

    def test_without_a_bus_there_is_nothing_but_the_line_with_the_value_as_received(self):
        client = self.client()
        for value in (2, 0, -2147483648):
            self.enable(client, value)
            self.logs.wait_for("bsd", LOG_ERR, f"Enabling wireless radio manager logs: {value}")
        self.assertEqual(len(self.logs.lines), 3)

    def test_a_bus_that_never_answers_keeps_no_request_waiting(self):
        SYSTEM_BUS.parent.mkdir(parents=True, exist_ok=True)
        bus = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
        self.addCleanup(bus.close)
        self.addCleanup(SYSTEM_BUS.unlink)
        bus.bind(str(SYSTEM_BUS))
        bus.listen(8)
        bus.settimeout(10)
        machine = self.watch_machine()
        client = self.client()
        self.enable(client, 1)
        connection, _ = bus.accept()
        moments = [time.monotonic()]
        for _ in range(50):
            self.enable(client, 1)
            moments.append(time.monotonic())
        self.assertLess(max(map(machine.ran, moments, moments[1:])), 0.5)
        with connection:
            connection.settimeout(10)
            self.assertTrue(connection.recv(100).startswith(b"\0AUTH EXTERNAL"))
            while connection.recv(4096):  # until it is given up
                pass
        self.assertLess(machine.ran(moments[0]), 3)
        # The switches that came meanwhile are one. A machine that let us send for longer has seen more of these waits.
        bus.accept()[0].close()
        bus.settimeout(1.5)
        with self.assertRaises(TimeoutError):
            for _ in range(1 + int((moments[-1] - moments[0]) / 0.9)):
                bus.accept()[0].close()


class HostedBaseband(HelperTest):
    def prepare(self):
        self.folder = pathlib.Path("/tmp/hosted")
        self.folder.mkdir()
        self.addCleanup(shutil.rmtree, self.folder)
        shutil.copy(BUILD / "unit/baseband_standin_whole.so", self.folder / HOSTED)
        self.calls, self.busy = self.folder / "calls", self.folder / "busy"
        self.calls.touch()
        self.environment = {"LD_LIBRARY_PATH": str(self.folder)}

    def host(self):
        self.daemon.stop()
        self.daemon = Daemon(environment=self.environment)

    def test_a_busy_server_keeps_the_idle_process_until_a_tick_finds_it_idle(self):
        self.host()
        self.assertEqual(self.calls.read_text(), "?cs")
        self.busy.touch()
        closed = time.monotonic()
        self.client().close()
        eventually(lambda: self.calls.read_text() == "?csb", TICK + 5, "the first tick's question")
        self.assertGreaterEqual(time.monotonic() - closed, TICK - 0.1)
        time.sleep(1)
        self.assertTrue(self.daemon.running())
        self.busy.unlink()
        self.assertEqual(self.daemon.wait(), 0)
        self.assertEqual(self.calls.read_text(), "?csbbxr")

    def test_a_process_that_cannot_serve_stops_the_server_it_had_started(self):
        second = Daemon(wait=False, environment=self.environment)
        self.addCleanup(second.stop)
        self.assertEqual(second.wait(), 1)
        self.assertEqual(self.calls.read_text(), "?csxr")

    def test_a_library_finds_nothing_in_the_environment(self):
        found = self.folder / "environment"
        found.touch()
        self.environment |= {"SSLKEYLOGFILE": "/tmp/keys", "https_proxy": "http://proxy", "TZ": "Asia/Tokyo",
                             "LD_BIND_NOW": "1", "LISTEN_PID": "1", "LISTEN_FDS": "1"}
        self.daemon.stop()
        self.daemon = Daemon(environment=self.environment)
        self.assertEqual(self.calls.read_text(), "?cs")
        # How a service manager hands over sockets is what the helper may read, and has yet to.
        self.assertEqual(set(found.read_bytes().split(b"\0")), {b"", b"LISTEN_PID=1", b"LISTEN_FDS=1"})
        self.busy.touch()
        found.write_bytes(b"")
        self.client().close()
        eventually(lambda: self.calls.read_text() == "?csb", TICK + 5, "the first tick's question")
        self.assertEqual(found.read_bytes(), b"")


if __name__ == "__main__":
    main()
