# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Admission by entitlement files, the radio log switch and the hosted baseband server, on the real process."""
import ctypes
import hashlib
import json
import os
import pathlib
import plistlib
import pwd
import re
import shutil
import signal
import socket
import subprocess
import sys
import threading
import time
import unittest

import wire
from harness import (ALLOW, BUILD, DEFAULT, ENTITLEMENTS, ERROR, INFO, LOG_ERR, SANITIZED, SLOWNESS, SOCKET, Daemon, HelperTest,
                     as_account, entitle, eventually, in_a_new_process, main, refused_with, stop_process)

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
        self.assertEqual([line for line in self.logs.lines if line[1] == ERROR], [])

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
        self.logs.wait_for("unified", ERROR, f"entitlement file {ENTITLEMENTS}/a.plist passed over: Executable cannot "
                           f"be relied on: {other} is not owned by root, or others may write to it")

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
        for key, value, wrong in (
                ("Executable", 1, "is an integer, not a string"), ("User", 0, "is an integer, not a string"),
                ("Unit", ["x"], "is an array, not a string"), ("SHA256", b"\0" * 32, "is data, not a string"),
                ("Entitlements", [ALLOW], "is an array, not a dictionary"),
                ("User", "nobody-has-this-name", 'is "nobody-has-this-name", and there is no such account'),
                ("SHA256", "00", "is not 64 hexadecimal digits"), ("Unit", "", "is not the name of a unit")):
            path.write_bytes(plistlib.dumps({**good, key: value}))
            text = ("unified", ERROR, f"entitlement file {path} passed over: {key} {wrong}")
            for _ in range(3):
                self.assertEqual(in_a_new_process(), 35, key)
            self.logs.wait_for(*text)
            self.assertEqual(self.logs.lines.count(text), 1, "once for each state of the file")
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
        before = self.daemon.settled_descriptors()
        for _ in range(20):
            self.assertEqual(refused_with(), 35)
        self.assertEqual(as_account("stranger", refused_with), 35)
        # It learns a little later that a caller has closed its connection.
        eventually(lambda: self.daemon.descriptors() <= before, what="every descriptor being closed")


def libc_call(name, *arguments):
    libc = ctypes.CDLL(None, use_errno=True)
    if getattr(libc, name)(*arguments) != 0:
        raise OSError(ctypes.get_errno(), name)


class Besieged(HelperTest):
    """With an admitted client beside it whose calls are answered in time."""

    STRANGER = pwd.getpwnam("stranger")
    PYTHON = os.path.realpath(sys.executable)

    def setUp(self):
        super().setUp()
        SOCKET.chmod(0o666)  # as an integrator may have it: the group keeps no stranger out then
        self.addCleanup(shutil.rmtree, ENTITLEMENTS)
        modules = pathlib.Path("/tmp/modules")
        modules.mkdir()
        self.addCleanup(shutil.rmtree, modules)
        shutil.copy(wire.__file__, modules)
        machine = self.watch_machine()
        admitted, ended, self.slowest = self.client(), threading.Event(), []

        def calls():
            while not ended.is_set():
                start = time.monotonic()
                admitted.copy_preference("com.example.nothing", "key")
                self.slowest.append((start, time.monotonic()))
                time.sleep(0.005)
        thread = threading.Thread(target=calls)
        thread.start()

        def end():
            ended.set()
            thread.join()
            self.assertGreater(len(self.slowest), 0)
            self.assertLess(max(machine.ran(*each) for each in self.slowest), 0.1 * SLOWNESS)
        self.addCleanup(end)

    def stranger(self, *command):
        """What a program of the stranger's ends with."""
        return subprocess.run(command, check=False, cwd="/", user=self.STRANGER.pw_uid, group=self.STRANGER.pw_gid,
                              extra_groups=[]).returncode

    # In a folder that any account may read.
    IMPORTS = "import sys; sys.path.insert(0, '/tmp/modules'); import wire\n"
    CHECK_IN = IMPORTS + ("try:\n    wire.Client().close()\n"
                          "except wire.Status as status:\n    sys.exit(status.code)\n")


class Attacks(Besieged):
    """Each as the account it is made from."""

    def test_a_user_namespace_entitles_nobody_not_even_its_root(self):
        if self.stranger("unshare", "--user", "true") != 0:
            self.skipTest("no user namespaces here")
        entitle("60-stranger.plist", user="stranger")
        self.assertEqual(self.stranger(self.PYTHON, "-c", self.CHECK_IN), 0)
        for mapping in ([], ["--map-root-user"], ["--map-current-user"]):
            self.assertEqual(self.stranger("unshare", "--user", *mapping, self.PYTHON, "-c", self.CHECK_IN), 35, mapping)
        self.assertEqual(subprocess.run(["unshare", "--user", "--map-root-user", self.PYTHON, "-c", self.CHECK_IN],
                                        check=False).returncode, 35)
        eventually(lambda: any(text.endswith(f"it does not hold {ALLOW}: the caller is in a user namespace of its own")
                               for _, _, text in self.logs.lines), what="a line that says so")

    def test_a_folder_above_the_executable_that_its_owner_swaps_entitles_nobody(self):
        folder = pathlib.Path("/tmp/strangers")
        (folder / "bin").mkdir(parents=True)
        self.addCleanup(shutil.rmtree, folder)
        program = folder / "bin" / "program"
        shutil.copy2(self.PYTHON, program)
        entitle("60-stranger.plist", executable=str(program), user="stranger")
        content = {"Executable": str(program), "User": "stranger", "Entitlements": {ALLOW: True}}
        (ENTITLEMENTS / "60-stranger.plist").write_bytes(plistlib.dumps(content))
        self.assertEqual(self.stranger(str(program), "-c", self.CHECK_IN), 0, "while every folder is root's")

        os.chown(folder, self.STRANGER.pw_uid, self.STRANGER.pw_gid)
        swap = f"mv {folder}/bin {folder}/away && mkdir {folder}/bin && ln -s {self.PYTHON} {program}"
        self.assertEqual(self.stranger("/bin/sh", "-c", swap), 0)
        self.assertEqual(self.stranger(self.PYTHON, "-c", self.CHECK_IN), 35)
        self.logs.wait_for("unified", ERROR, f"entitlement file {ENTITLEMENTS}/60-stranger.plist passed over: Executable "
                           f"cannot be relied on: {folder} is not owned by root, or others may write to it")

    def test_a_program_that_sends_and_then_becomes_the_entitled_one_stays_of_its_account(self):
        # The daemon is stopped meanwhile: when it looks, the process runs the entitled program.
        plain = pathlib.Path("/tmp/plain")
        shutil.copy2(self.PYTHON, plain)
        self.addCleanup(plain.unlink)
        reply = ("import socket,struct; s = socket.socket(fileno=9); s.settimeout(20); "
                 "raise SystemExit(struct.unpack_from('<i', s.recv(99), 32)[0])")
        code = (self.IMPORTS + "import os, socket\n"
                "service = wire.connect()\n"
                "_, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)\n"
                "service.send(wire.check_in_message(), [theirs.fileno()])\n"
                "os.dup2(service.fileno(), 9)\n"
                "print('sent', flush=True)\n"
                f"os.execv({self.PYTHON!r}, ['python3', '-c', {reply!r}])\n")
        stop_process(self.daemon.pid)
        try:
            attack = subprocess.Popen([str(plain), "-c", code], stdout=subprocess.PIPE, cwd="/", user=self.STRANGER.pw_uid,
                                      group=self.STRANGER.pw_gid, extra_groups=[])
            attack.stdout.readline()
            eventually(lambda: os.readlink(f"/proc/{attack.pid}/exe") == self.PYTHON, what="the other program")
            self.slowest.clear()
        finally:
            stopped = time.monotonic()
            self.daemon.process.send_signal(signal.SIGCONT)
        with attack:
            self.assertEqual(attack.wait(20), 35)
        eventually(lambda: any(each[0] > stopped for each in list(self.slowest)), what="a call after the stop")
        self.slowest[:] = [each for each in self.slowest if each[0] > stopped]


class ForgedUnits(Besieged):
    """A hierarchy of control groups of this test's own, which the daemon sees as the whole."""

    def prepare(self):
        whole = pathlib.Path("/tmp/control-groups")
        whole.mkdir(exist_ok=True)
        if subprocess.run(["mount", "-t", "cgroup2", "none", str(whole)], check=False).returncode != 0:
            self.skipTest("control groups cannot be mounted here")
        self.addCleanup(subprocess.run, ["umount", str(whole)], check=True)
        lines = pathlib.Path("/proc/self/cgroup").read_text().splitlines()
        home = whole / next(line for line in lines if line.startswith("0::"))[4:]
        self.groups = home / f"brenvik-test-{os.getpid()}-{time.time_ns()}"
        self.groups.mkdir()
        self.addCleanup(lambda: [path.rmdir() for path in sorted(self.groups.glob("**/"), reverse=True)])
        before = os.open("/proc/self/ns/cgroup", os.O_RDONLY)
        self.addCleanup(os.close, before)
        # The namespace begins where its maker is.
        (self.groups / "cgroup.procs").write_text(str(os.getpid()))
        libc_call("unshare", 0x02000000)  # CLONE_NEWCGROUP
        self.addCleanup(libc_call, "setns", before, 0)
        (home / "cgroup.procs").write_text(str(os.getpid()))

    def test_a_units_name_that_somebody_gave_who_is_not_the_systems_manager_is_no_unit(self):
        entitle("60-stranger.plist", user="stranger", Unit="telephony.service")
        real = self.groups / "system.slice/telephony.service"
        manager = self.groups / "user.slice/user-602.slice/user@602.service"
        delegated = self.groups / "system.slice/container.service"
        real.mkdir(parents=True)
        for folder in (manager, delegated):
            (folder / "init.scope").mkdir(parents=True)
            for path in (folder, folder / "cgroup.procs", folder / "init.scope", folder / "init.scope/cgroup.procs"):
                os.chown(path, self.STRANGER.pw_uid, self.STRANGER.pw_gid)

        def within(group, forge=None):
            """Checks in as the stranger, who was put into a group and moves on to one that he names himself."""
            pid = os.fork()
            if pid == 0:
                status = 255
                try:
                    (group / "cgroup.procs").write_text(str(os.getpid()))
                    os.setgroups([])
                    os.setresgid(*[self.STRANGER.pw_gid] * 3)
                    os.setresuid(*[self.STRANGER.pw_uid] * 3)
                    if forge is not None:
                        forge.mkdir(parents=True)
                        (forge / "cgroup.procs").write_text(str(os.getpid()))
                    # The process lives on as this Python, which the file names.
                    status = refused_with()
                finally:
                    os._exit(status)
            return os.waitstatus_to_exitcode(os.waitpid(pid, 0)[1])

        self.assertEqual(within(real), 0)
        self.assertEqual(within(manager / "init.scope", manager / "app.slice/telephony.service"), 35)
        self.assertEqual(within(manager / "init.scope", manager / "telephony.service"), 35)
        self.assertEqual(within(delegated / "init.scope", delegated / "telephony.service"), 35)
        eventually(lambda: any("came nearest, but its Unit is telephony.service, and the caller runs in no unit" in text
                               for _, _, text in self.logs.lines), what="a line that says so")


class Refusals(HelperTest):
    """What the log says of who was refused, and of whom a line is about."""

    def prepare(self):
        SOCKET.parent.mkdir(parents=True, exist_ok=True)

    def refusals(self):
        return [entry for entry in self.logs.entries if entry["MESSAGE"].startswith("refused")]

    def test_a_refused_caller_has_a_line_that_says_who_and_why_and_further_ones_are_counted(self):
        (ENTITLEMENTS / "50-test.plist").unlink()
        entitle("60.plist", user="telephony")
        python = os.path.realpath(sys.executable)
        for _ in range(4):
            self.assertEqual(in_a_new_process(), 35)
        eventually(self.refusals, what="a line about the refusal")
        entry, = self.refusals()
        self.assertRegex(entry["MESSAGE"], rf"^refused process {entry['BRENVIK_CALLER_PID']}: account 0, executable "
                         rf"{python}, unit \S+: it does not hold {ALLOW}: {ENTITLEMENTS}/60.plist came nearest, but its "
                         r"User is telephony \(601\), and the caller is 0$")
        self.assertEqual((entry["PRIORITY"], entry["BRENVIK_CALLER_UID"], entry["BRENVIK_CALLER_EXE"],
                          entry["BRENVIK_ROUTINE"]), ("5", "0", python, "BVMobileHelperCheckIn"))
        self.assertRegex(entry["MESSAGE_ID"], "^[0-9a-f]{32}$")
        (ENTITLEMENTS / "60.plist").unlink()
        other = pathlib.Path("/tmp/python-copy")
        shutil.copy2(python, other)
        self.addCleanup(other.unlink)
        self.assertEqual(in_a_new_process(str(other)), 35)
        self.logs.wait_for("unified", DEFAULT, self.refusals()[-1]["MESSAGE"])
        eventually(lambda: len(self.refusals()) == 2, what="the line of another program")
        self.assertTrue(self.refusals()[1]["MESSAGE"].endswith(f"it does not hold {ALLOW}: no file names it"))
        # It leaves when it is idle, and tells how many it did not.
        entitle()
        wire.Client().close()
        self.assertEqual(self.daemon.wait(), 0)
        self.logs.wait_for("unified", DEFAULT, f"refused 3 more check-ins of account 0, executable {python}")

    def test_lines_that_a_request_causes_say_whose_it_was(self):
        client = self.client()
        with self.assertRaises(wire.Status):
            client.region(wire.simple("LoadPlistFile", wire.field("/etc/passwd", 256)))
        self.logs.wait_for("unified", INFO, "Loading /etc/passwd as plist")
        entry = next(each for each in self.logs.entries if each["MESSAGE"] == "Loading /etc/passwd as plist")
        self.assertEqual({key: entry.get(key) for key in ("BRENVIK_CALLER_PID", "BRENVIK_CALLER_UID",
                                                          "BRENVIK_CALLER_EXE", "BRENVIK_ROUTINE")},
                         {"BRENVIK_CALLER_PID": str(os.getpid()), "BRENVIK_CALLER_UID": "0",
                          "BRENVIK_CALLER_EXE": os.path.realpath(sys.executable),
                          "BRENVIK_ROUTINE": "BVMobileHelperLoadPlistFile"})
        # What is answered later, by other threads: there is no network here.
        self.assertEqual(client.status("RequestWanIPFromLocation"), 0)
        client.channel.exchange(wire.simple("CheckLASDUpdate", (1).to_bytes(4, "little")))
        for routine, text in (("RequestWanIPFromLocation", "_RequestWanIPFromLocation error: "),
                              ("CheckLASDUpdate", "HTTP request failed for URL ")):
            eventually(lambda: any(each["MESSAGE"].startswith(text) for each in self.logs.entries), what=text)
            for each in self.logs.entries:
                if each["MESSAGE"].startswith(text):
                    self.assertEqual((each.get("BRENVIK_ROUTINE"), each.get("BRENVIK_CALLER_PID")),
                                     ("BVMobileHelper" + routine, str(os.getpid())))
        for each in self.logs.entries:
            self.assertRegex(each["CODE_FUNC"], r"^~?\w+$")


class Access(HelperTest):
    """bvhelperctl explains the very decision that the helper makes."""

    def setUp(self):
        super().setUp()
        self.client()  # the helper does not leave, however long a step takes
        (ENTITLEMENTS / "50-test.plist").unlink()

    def tearDown(self):
        shutil.rmtree(ENTITLEMENTS)

    def explain(self, *arguments):
        done = subprocess.run([BUILD / "bvhelperctl", "--json", "access", *arguments], capture_output=True, text=True,
                              check=False, timeout=60)
        self.assertEqual(done.stderr, "")
        return done.returncode, json.loads(done.stdout)

    def test_it_says_what_the_helper_does(self):
        python = os.path.realpath(sys.executable)
        cases = [{}, {"value": False}, {"value": "true"}, {"user": "mobile"}, {"user": "no-such-account"},
                 {"executable": "/bin/true"}, {"Unit": "x.service"}, {"SHA256": "0" * 64},
                 {"SHA256": hashlib.sha256(pathlib.Path(python).read_bytes()).hexdigest()}, {"Unit": 1}]
        for case in cases:
            entitle("a.plist", **case)
            helper = in_a_new_process()
            status, said = self.explain("--exe", python, "--user", "root")
            self.assertEqual((status == 0, said["granted"]), (helper == 0, helper == 0), (case, said))
            self.assertEqual(status, 0 if helper == 0 else 4)
            self.assertTrue(said["ok"])
        (ENTITLEMENTS / "a.plist").chmod(0o666)
        self.assertEqual(in_a_new_process(), 35)
        status, said = self.explain("--exe", python)
        self.assertEqual(status, 4)
        self.assertEqual(said["reason"],
                         f"{ENTITLEMENTS}/a.plist is passed over: not owned by root, or others may write to it")

    def test_a_refused_user_is_told_of_it(self):
        done = subprocess.run([BUILD / "bvhelperctl", "ping"], capture_output=True, text=True, check=False, timeout=60)
        self.assertNotEqual(done.returncode, 0)
        self.assertIn("bvhelperctl access", done.stderr)


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
