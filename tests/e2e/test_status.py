# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What the helper tells about itself: at its status socket, through bvhelperctl status, and to the service manager."""
import array
import contextlib
import os
import pathlib
import shutil
import signal
import socket
import stat
import struct
import subprocess
import time
import unittest
from unittest import mock

import test_lasd
import wire
from harness import DAEMON, INFO, SOCKET, Daemon, as_account, entitle, eventually, listen, main
from test_bvhelperctl import TOOL, ToolTest, run

STATUS = pathlib.Path(f"{SOCKET}.status")
IDLE = 10.0  # seconds


def connect():
    sock = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)  # waits while others wait before it
    try:
        sock.connect(str(STATUS))
        sock.settimeout(10)
    except OSError:
        sock.close()
        raise
    return sock


def ask():
    """The one datagram, as pairs; [] when the connection was closed without a word."""
    with connect() as sock:
        text = sock.recv(65536).decode()
        assert not text or sock.recv(1) == b"", "one datagram, and then the end"
    return [tuple(line.split("=", 1)) for line in text.splitlines()]


def facts():
    return dict(ask())


def wait_for_status():
    eventually(answers, what="an answer")


def answers():
    try:
        return bool(ask())
    except (FileNotFoundError, ConnectionRefusedError):
        return False


class StatusTest(ToolTest):
    def setUp(self):
        super().setUp()
        wait_for_status()

    def status(self, **more):
        return self.json("status", **more)


class Socket(StatusTest):
    def test_it_is_for_those_who_may_connect_to_the_service(self):
        mine, service = STATUS.stat(), SOCKET.stat()
        self.assertEqual((mine.st_uid, mine.st_gid, stat.S_IMODE(mine.st_mode)), (0, service.st_gid, 0o660))

        def knock():
            try:
                return len(ask())
            except PermissionError:
                return 200
        self.assertEqual(as_account("outsider", knock), 200)
        self.assertGreater(as_account("stranger", knock), 5)

    def test_one_datagram_tells_it_all(self):
        told = ask()
        self.assertEqual(told[0], ("brenvik-status", "1"))
        told = dict(told)
        self.assertEqual((told["process"], told["executable"], told["replaced"], told["socket"]),
                         (str(self.daemon.pid), str(DAEMON), "no", str(SOCKET)))
        self.assertEqual((told["clients"], told["busy-tokens"]), ("0", "0"))
        self.assertNotIn("leaves-in-ms", told)  # no client has come yet

    def test_clients_and_the_countdown_are_told(self):
        first, second = wire.Client(), wire.Client()
        self.assertEqual(facts()["clients"], "2")
        first.close()
        second.close()
        eventually(lambda: facts()["clients"] == "0", what="both to be gone")
        self.assertTrue(0 < int(facts()["leaves-in-ms"]) <= 10000)

    def test_it_is_no_routine(self):
        client = self.client()
        for number in (wire.FIRST - 1, wire.FIRST + len(wire.ROUTINES), wire.CHECK_IN):
            self.assertEqual(client.channel.status(wire.header(number, 24)), -303)

    def test_a_connection_is_no_client(self):
        wire.Client().close()
        eventually(lambda: "leaves-in-ms" in facts(), what="the countdown, whose clock is a descriptor")
        sockets = self.daemon.sockets()
        for _ in range(20):
            self.addCleanup(connect().close)
        eventually(lambda: self.daemon.sockets() <= sockets, what="no connection kept")  # the question before may still have one
        told = facts()
        self.assertEqual((told["clients"], "leaves-in-ms" in told), ("0", True))

    def test_two_hundred_connections_that_never_read_keep_nothing_and_nobody_waiting(self):
        wire.Client().close()
        eventually(lambda: "leaves-in-ms" in facts(), what="the countdown, whose clock is a descriptor")
        client = self.client()
        sockets = self.daemon.sockets()
        held = []
        for _ in range(200):
            sock = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
            self.addCleanup(sock.close)
            sock.setblocking(False)
            with contextlib.suppress(BlockingIOError):  # the queue is full
                sock.connect(str(STATUS))
                held.append(sock)
            client.integer("IsVoicemailServiceSubscribed")
            self.assertLessEqual(self.daemon.sockets(), sockets + 20)
        self.assertGreater(len(held), 20)
        self.assertTrue(self.daemon.running())
        eventually(lambda: self.daemon.sockets() <= sockets, what="no connection kept")
        # Each of them was told, or closed; and another account is not kept from asking.
        self.assertEqual(as_account("stranger", lambda: 0 if answers() else 1), 0)

    def test_an_account_that_asks_all_the_time_is_told_less_often_and_costs_little(self):
        machine = self.watch_machine()
        cpu, began = self.daemon.cpu_seconds(), time.monotonic()
        told = closed = 0
        while time.monotonic() - began < 3:
            told, closed = (told + 1, closed) if ask() else (told, closed + 1)
        seconds = time.monotonic() - began
        self.assertGreaterEqual(told, 40)
        self.assertLessEqual(told, 50 + 20 * seconds + 1)
        self.assertGreater(closed, 0)
        self.assertLess(self.daemon.cpu_seconds() - cpu, 0.2 * machine.ran(began) + 0.1)

    def test_what_is_sent_to_it_delays_nobody(self):
        """A TCP socket that lingers, on its way to whoever closes it."""
        client = self.client()
        server = socket.create_server(("127.0.0.1", 0))
        self.addCleanup(server.close)
        sender = socket.create_connection(server.getsockname())
        sender.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, struct.pack("ii", 1, 15))
        sender.setblocking(False)
        with contextlib.suppress(BlockingIOError):
            while True:
                sender.send(b"x" * 65536)  # never read
        machine = self.watch_machine()
        for _ in range(10):
            sock = connect()
            with contextlib.suppress(OSError):
                sock.sendmsg([b"x"], [(socket.SOL_SOCKET, socket.SCM_RIGHTS, array.array("i", [sender.fileno()]))])
            sock.close()
        sender.close()
        began = time.monotonic()
        for _ in range(20):
            client.integer("IsVoicemailServiceSubscribed")
        self.assertLess(machine.ran(began), 1)

    def test_it_goes_with_the_helper(self):
        self.daemon.stop()  # SIGTERM: nothing is tidied up
        self.assertTrue(STATUS.exists())
        self.daemon = Daemon()
        wait_for_status()
        self.assertEqual(facts()["process"], str(self.daemon.pid))
        self.client().close()
        self.assertEqual(self.daemon.wait(), 0)
        self.assertFalse(STATUS.exists())

    def test_what_stands_there_and_is_no_socket_stays(self):
        self.daemon.stop()
        STATUS.unlink()
        STATUS.write_text("somebody's")
        self.addCleanup(STATUS.unlink)
        self.daemon = Daemon()
        self.logs.wait_for("unified", INFO, f"no status at {STATUS}: File exists")
        self.client()
        self.assertEqual(STATUS.read_text(), "somebody's")

    def test_asking_again_and_again_does_not_put_the_exit_off(self):
        machine = self.watch_machine()
        wire.Client().close()
        closed = time.monotonic()
        left = []
        while self.daemon.running() and time.monotonic() - closed < IDLE + 5:
            with contextlib.suppress(OSError):
                left.append(int(facts()["leaves-in-ms"]))
            time.sleep(0.2)
        self.assertEqual(self.daemon.wait(), 0)
        self.assertGreaterEqual(time.monotonic() - closed, IDLE - 0.1)
        self.assertLess(machine.ran(closed), IDLE + 3)
        self.assertEqual(left, sorted(left, reverse=True))
        self.assertGreater(len(left), 20)


class Start(unittest.TestCase):
    def test_a_client_that_starts_the_helper_has_its_reply_before_the_socket_is_made(self):
        entitle()
        trace = pathlib.Path("/tmp/start-trace")
        listening = listen()
        self.addCleanup(listening.close)
        waiting = wire.connect()
        self.addCleanup(waiting.close)
        mine, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        self.addCleanup(mine.close)
        waiting.send(wire.check_in_message(), [theirs.fileno()])
        theirs.close()
        script = f'exec 3<&{listening.fileno()}; LISTEN_PID=$$ exec "$0"'
        helper = subprocess.Popen(
            ["strace", "-f", "-o", str(trace), "/bin/sh", "-c", script, str(DAEMON)], stdin=subprocess.DEVNULL,
            stderr=subprocess.DEVNULL, pass_fds=[listening.fileno()],
            env={**os.environ, "LISTEN_FDS": "1", "LISTEN_FDNAMES": wire.SERVICE})
        self.addCleanup(helper.wait)
        _, descriptors = waiting.receive(60)
        for each in descriptors:
            os.close(each)
        eventually(answers, what="the status socket")
        os.kill(int(facts()["process"]), signal.SIGTERM)
        helper.wait()
        calls = trace.read_text()
        reply = calls.index("sendmsg(", calls.index("accept4("))
        self.assertIn("SCM_RIGHTS", calls[reply:calls.index("\n", reply)], "the reply to the check-in")
        self.assertEqual((calls[:reply].count(STATUS.name), calls[reply:].count(STATUS.name) > 0), (0, True))


class Command(StatusTest):
    def test_a_helper_that_runs(self):
        # With root's rights it reads its callers by itself, and has no worker for that.
        told = self.status()
        self.assertIs(told["running"], True)
        self.assertEqual((told["pid"], told["executable"], told["socket"]),
                         (self.daemon.pid, str(DAEMON), {"path": str(SOCKET), "state": "listening"}))
        self.assertEqual((told["version"], told["restartPending"]), (told["installed"], False))
        self.assertEqual((told["clients"], told["heldBy"], told["leavesIn"], told["busyTokens"]), (0, [], None, 0))
        self.assertEqual((told["databases"], told["locationAnswer"], told["workers"]),
                         ([], None, [{"name": "network", "running": False}, {"name": "stores", "running": False}]))
        self.assertNotIn("notes", told)
        lines = run("status").stdout.splitlines()
        self.assertRegex(lines[0], rf"^helper        running since \d{{4}}-\d\d-\d\dT\d\d:\d\d:\d\dZ \(\d+ s\), process {self.daemon.pid}$")
        self.assertIn(f"socket        {SOCKET}, listening", lines)
        self.assertIn("held by       nothing: waits for its first client", lines)

    def test_what_holds_it(self):
        client = wire.Client()
        self.assertEqual(self.status()["heldBy"], ["1 client"])
        self.assertIn("held by       1 client", run("status").stdout.splitlines())
        client.close()
        eventually(lambda: self.status()["clients"] == 0, what="the client to be gone")
        told = self.status()
        self.assertEqual(told["heldBy"], [])
        self.assertTrue(0 < told["leavesIn"] <= 10)
        self.assertRegex(run("status").stdout, r"held by       nothing: idle, leaves in \d+ s\n")

    def test_a_helper_that_does_not_run_is_not_started(self):
        """The service socket stands open, as a service manager holds it: nothing comes to it."""
        self.daemon.stop()
        STATUS.unlink()
        listening = listen()
        self.addCleanup(listening.close)
        listening.setblocking(False)
        told = self.status()
        self.assertIs(told["running"], False)
        self.assertEqual(told["socket"], {"path": str(SOCKET), "state": "listening"})
        self.assertNotIn("notes", told)
        self.assertEqual(run("status").stdout.splitlines()[0], "helper        not running, starts with the next request")
        with self.assertRaises(BlockingIOError):
            listening.accept()

    def test_without_a_service_socket_nothing_would_start_it(self):
        self.daemon.stop()
        STATUS.unlink()
        for state in ("not-listening", "missing"):
            told = self.status()
            self.assertEqual((told["running"], told["socket"]["state"]), (False, state))
            self.assertIn("nothing would start the helper", told["notes"][0])
            SOCKET.unlink(missing_ok=True)

    def test_after_a_kill_the_stale_socket_is_no_helper(self):
        self.daemon.process.kill()
        self.daemon.wait()
        self.assertTrue(STATUS.exists())
        self.assertIs(self.status()["running"], False)
        self.daemon.stop()
        self.daemon = Daemon()
        wait_for_status()
        self.assertEqual(self.status()["pid"], self.daemon.pid)

    def test_a_helper_without_a_status_socket_is_not_called_absent(self):
        STATUS.unlink()
        answer = self.status(status=1)
        self.assertIn(f"the helper runs (process {self.daemon.pid}), and tells nothing", answer["error"])
        self.assertIn("journalctl", answer["advice"])

    def test_an_account_that_may_not_connect_is_told_what_to_do(self):
        refused = run("status", account="outsider")
        self.assertEqual((refused.returncode, refused.stdout), (4, ""))
        lines = refused.stderr.splitlines()
        self.assertEqual(lines[0], f"bvhelperctl: refused: this account may not connect to {STATUS}")
        self.assertIn("  usermod -aG brenvik outsider", lines)
        self.assertEqual(run("status", account="stranger").returncode, 0)  # in the group; needs no entitlement

    def test_a_socket_of_another_account_is_not_believed(self):
        self.daemon.stop()
        STATUS.unlink()
        folder = self.folder / "open"
        folder.mkdir()
        self.folder.chmod(0o755)
        shutil.chown(folder, "mobile", "mobile")

        def pretend():
            with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as sock:
                sock.bind(str(folder / "service.status"))
                sock.listen(1)
                sock.settimeout(20)
                sock.accept()[0].close()
            return 0
        process = os.fork()
        if process == 0:
            os._exit(as_account("mobile", pretend))
        self.addCleanup(os.waitpid, process, 0)
        eventually((folder / "service.status").exists, what="the pretender")
        answer = self.json("--socket", str(folder / "service"), "status", status=7)
        self.assertIn("is not the helper's", answer["error"])

    def test_an_upgraded_program_is_told_of(self):
        self.daemon.stop()
        program = self.folder / "BrenvikMobileHelper"
        shutil.copy(DAEMON, program)
        version = self.start_copy(program)
        self.assertIs(self.status()["restartPending"], False)
        # As a package manager does it: the new file under another name, then in place of the old.
        content = program.read_bytes()
        mark = b"@(#)BrenvikMobileHelper " + version.encode()
        self.assertIn(mark, content)
        newer = version[:-1] + "9"
        new = self.folder / "new"
        new.write_bytes(content.replace(mark, b"@(#)BrenvikMobileHelper " + newer.encode()))
        new.chmod(0o755)
        new.rename(program)
        told = self.status()
        self.assertEqual((told["version"], told["installed"], told["restartPending"]), (version, newer, True))
        self.assertEqual(told["executable"], str(program))
        self.assertIn(f"restart pending: version {version} runs, version {newer} is installed", told["notes"][0])
        self.assertIn(f"version       {version}, installed is {newer}", run("status").stdout.splitlines())
        # The same version, built anew.
        shutil.copy(DAEMON, new)
        new.rename(program)
        told = self.status()
        self.assertIs(told["restartPending"], True)
        self.assertIn("the program that runs is not the one that is installed", told["notes"][0])

    def test_a_replaced_helper_without_a_status_socket_has_a_restart_pending(self):
        """As after an upgrade from a version that had none."""
        self.daemon.stop()
        program = self.folder / "BrenvikMobileHelper"
        shutil.copy(DAEMON, program)
        self.start_copy(program)
        STATUS.unlink()
        self.assertNotIn("restart pending", self.status(status=1)["error"])
        new = self.folder / "new"
        shutil.copy(DAEMON, new)
        new.rename(program)
        answer = self.status(status=1)
        self.assertIn("tells nothing", answer["error"])
        self.assertIn("restart pending: its program is not the one that is installed", answer["error"])
        self.assertIn("systemctl stop brenvik-mobile-helper.service", answer["advice"])

    def start_copy(self, program):
        helper = subprocess.Popen([program], stdin=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        self.addCleanup(helper.wait)
        self.addCleanup(helper.kill)
        eventually(lambda: answers() and facts()["process"] == str(helper.pid), what="the copy")
        return facts()["version"]

    def test_the_heartbeat(self):
        self.assertEqual(run("heartbeat", "on").returncode, 0)
        eventually(lambda: self.status()["heartbeat"]["on"], what="the heartbeat")
        told = self.status()
        self.assertEqual((told["busyTokens"], told["leavesIn"]), (1, None))
        self.assertIn("the heartbeat", told["heldBy"])
        self.assertEqual(run("heartbeat", "off").returncode, 0)
        eventually(lambda: not self.status()["heartbeat"]["on"], what="the heartbeat to end")
        self.assertEqual(self.status()["busyTokens"], 0)

    def test_a_location_answer(self):
        self.assertEqual(run("location", "civic", "--wait", "52.52", "13.40").returncode, 0)
        answer = self.status()["locationAnswer"]
        self.assertEqual(answer["outcome"], "answered")
        self.assertLess(answer["age"], 30)
        text = run("status").stdout
        self.assertRegex(text, r"location      last request answered, \d+ s ago\n?")
        for place in ("Berlin", "DE", "52.52", "13.4"):
            self.assertNotIn(place, text)

    def test_a_checks_failure(self):
        self.assertEqual(run("lasd", "check", "--mask", "9").returncode, 0)  # there is no server
        eventually(lambda: self.status()["databases"] and self.status()["databases"][0]["outcome"] == "failed",
                   timeout=40, what="the end of the check")
        self.assertEqual([(each["type"], each["outcome"]) for each in self.status()["databases"]],
                         [("gsm", "failed"), ("umts", "failed")])
        self.assertRegex(run("status").stdout, r"databases     gsm: failed, \d+ s ago\n              umts: failed, \d+ s ago\n")

    def test_a_full_disk_is_told_like_everywhere(self):
        with open("/dev/full", "w", encoding="ascii") as full:
            done = subprocess.run([TOOL, "status"], stdout=full, stderr=subprocess.PIPE, timeout=60, check=False)
        self.assertEqual(done.returncode, 8)


class Databases(test_lasd.UpdateTest, ToolTest):
    def prepare(self):
        ToolTest.prepare(self)
        super().prepare()

    def checks(self):
        return [(each["type"], each["outcome"]) for each in self.json("status")["databases"]]

    def test_a_check_is_told_of_while_it_runs_and_when_it_has_ended(self):
        self.server.stop()
        self.server.start(*self.good, "location /content/ { limit_rate 1000; }")
        self.serve({"gsm": "1", "umts": "1"}, lambda name, version: os.urandom(4000))
        test_lasd.request_check(self.client_for_all(), 8)
        self.client_for_all().close()
        eventually(lambda: "a database check" in self.json("status")["heldBy"], what="the check to hold the helper")
        self.assertEqual(self.checks(), [("gsm", "checking")])
        self.assertRegex(run("status").stdout, r"databases     gsm: checking, since \d+ s\n")
        eventually(lambda: self.checks() == [("gsm", "updated")], timeout=40, what="the end of the check")
        eventually(lambda: self.json("status")["busyTokens"] == 0, what="the token to go back")
        with wire.Client() as client:
            test_lasd.request_check(client, 9)
            wanted = [("gsm", "no-update-required"), ("umts", "updated")]
            eventually(lambda: self.checks() == wanted, timeout=40, what="the second check")


class ServiceManager(StatusTest):
    """STATUS= for systemctl status."""

    NOTIFY = "/run/notify"

    def prepare(self):
        super().prepare()
        self.manager = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
        self.addCleanup(self.manager.close)
        pathlib.Path(self.NOTIFY).unlink(missing_ok=True)
        self.manager.bind(self.NOTIFY)
        self.manager.settimeout(10)

    def setUp(self):
        with mock.patch.dict(os.environ, NOTIFY_SOCKET=self.NOTIFY):
            super().setUp()

    def told(self):
        return self.manager.recv(4096).decode()

    def test_it_is_told_what_keeps_the_helper_once_a_second_at_most(self):
        self.assertEqual(self.told(), "STATUS=Waits for its first client")
        client = wire.Client()
        self.assertEqual(self.told(), "STATUS=Kept by 1 client")
        began = time.monotonic()
        client.close()
        self.assertEqual(self.told(), "STATUS=Idle, leaves soon")
        self.assertGreater(time.monotonic() - began, 0.9)
        began = time.monotonic()
        for _ in range(50):
            wire.Client().close()
        self.manager.settimeout(1.5)
        lines = 0
        with contextlib.suppress(TimeoutError):
            while True:
                self.told()
                lines += 1
        self.assertLessEqual(lines, time.monotonic() - began)


if __name__ == "__main__":
    main()
