# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Start, refusal, idle exit: the life of the real process."""
import grp
import os
import pathlib
import plistlib
import re
import resource
import socket
import subprocess
import time
import unittest

import wire
from harness import (DAEMON, ERROR, SOCKET, Daemon, HelperTest, Logs, as_account, entitle, eventually,
                     in_a_new_process, listen, main, refused_with)

IDLE = 10.0  # seconds


class StandingAlone(HelperTest):
    def test_the_socket_file_is_there_for_the_group(self):
        facts = SOCKET.stat()
        self.assertEqual((facts.st_uid, facts.st_gid, facts.st_mode & 0o7777), (0, grp.getgrnam("brenvik").gr_gid, 0o660))
        self.assertEqual(SOCKET.parent.stat().st_mode & 0o7777, 0o755)

    def test_who_is_not_in_the_group_is_turned_away_and_who_is_is_refused_by_entitlement(self):
        def knock():
            try:
                return refused_with()
            except PermissionError:
                return 200
        self.assertEqual(as_account("outsider", knock), 200)
        self.assertEqual(as_account("stranger", knock), 35)

    def test_a_second_instance_says_why_and_exits_with_1(self):
        second = Daemon(wait=False)
        self.addCleanup(second.stop)
        self.assertEqual(second.wait(), 1)
        self.logs.wait_for("unified", ERROR, f"another process already serves {SOCKET}")
        self.logs.wait_for("unified", ERROR, "unable to create server objects - out of resources")
        self.logs.wait_for("unified", ERROR, "unable to startup BrenvikMobileHelper server")
        self.client()  # the first is not disturbed

    def test_without_descriptors_to_start_with_it_says_so_and_exits_with_1(self):
        self.daemon.stop()
        for limit in (4, 5, 6):  # no loop; no lock on the folder; no socket to listen at
            self.logs.clear()
            starved = subprocess.run(["/bin/sh", "-c", f'ulimit -n {limit}; exec "$0"', str(DAEMON)],
                                     stdin=subprocess.DEVNULL, stderr=subprocess.PIPE, timeout=20)
            self.assertEqual(starved.returncode, 1, limit)
            line = "unable to startup BrenvikMobileHelper server"
            if f"<3>{line}" not in starved.stderr.decode().splitlines():  # there may be one left for the journal
                self.logs.wait_for("unified", ERROR, line)
        self.daemon = Daemon()
        self.client()

    def test_a_killed_instance_leaves_a_stale_file_that_the_next_replaces(self):
        self.daemon.process.kill()
        self.daemon.wait()
        self.assertTrue(SOCKET.exists())
        self.daemon.stop()
        self.daemon = Daemon()
        self.client()

    def test_no_client_ever_checks_in_and_the_process_keeps_running_without_waking_up(self):
        connection = wire.connect()  # a connection is not a client
        self.addCleanup(connection.close)

        machine = self.watch_machine()

        def wakeups():
            status = pathlib.Path(f"/proc/{self.daemon.pid}/status").read_text()
            return sum(map(int, re.findall(r"ctxt_switches:\s+(\d+)", status)))

        def still():
            before = wakeups()
            time.sleep(0.2)
            return wakeups() == before
        eventually(still, what="having looked at the connection")
        started, before = time.monotonic(), wakeups()
        time.sleep(IDLE + 2)
        self.assertTrue(self.daemon.running())
        # Processes that are stopped with their machine are woken up to be stopped, and to go on.
        self.assertLessEqual(wakeups() - before, 4 * machine.count(started, time.monotonic()))

    def test_the_process_leaves_10_seconds_after_its_last_client_with_status_0_and_takes_its_file_along(self):
        machine = self.watch_machine()
        first, second = wire.Client(), wire.Client()
        first.close()
        time.sleep(2)  # the countdown must not have started
        closed = time.monotonic()
        second.close()
        self.assertEqual(self.daemon.wait(), 0)
        self.assertGreaterEqual(time.monotonic() - closed, IDLE - 0.1)
        self.assertLess(machine.ran(closed), IDLE + 3)
        self.assertFalse(SOCKET.exists())

    def test_a_check_in_during_the_countdown_starts_it_afresh(self):
        wire.Client().close()
        time.sleep(5)
        client = wire.Client()
        time.sleep(7)
        self.assertTrue(self.daemon.running(), "the first countdown was cancelled")
        closed = time.monotonic()
        client.close()
        self.assertEqual(self.daemon.wait(), 0)
        self.assertGreaterEqual(time.monotonic() - closed, IDLE - 0.1)

    def test_a_connection_that_never_checked_in_does_not_keep_the_process_and_gets_end_of_file(self):
        idle = wire.connect()
        self.addCleanup(idle.close)
        self.client().close()
        self.assertEqual(self.daemon.wait(), 0)
        with self.assertRaises(wire.Closed):
            idle.receive()

    def test_a_refused_caller_does_not_touch_the_countdown(self):
        machine = self.watch_machine()
        closed = time.monotonic()
        wire.Client().close()
        for _ in range(3):  # it must not be gone before the last of them
            time.sleep(2)
            self.assertEqual(as_account("stranger", refused_with), 35)
        self.assertEqual(self.daemon.wait(), 0)
        self.assertLess(machine.ran(closed), IDLE + 3)

    def test_a_file_that_reaches_the_size_limit_is_an_error_of_its_writer_and_not_the_end(self):
        client = self.client()
        self.assertEqual(client.set_preference("com.example.limit", "key", plistlib.dumps("small")), 0)
        resource.prlimit(self.daemon.pid, resource.RLIMIT_FSIZE, (4096, 4096))
        client.set_preference("com.example.limit", "key", plistlib.dumps("x" * 20000))
        eventually(lambda: any(level == ERROR and "com.example.limit" in text for _, level, text in self.logs.lines),
                   what="an error line that names the domain")
        self.assertTrue(self.daemon.running())
        self.assertEqual(plistlib.loads(client.copy_preference("com.example.limit", "key")), "small")


class Admission(HelperTest):
    def test_an_entitled_caller_is_admitted_and_another_account_is_refused_with_35(self):
        self.client()
        self.assertEqual(as_account("stranger", refused_with), 35)

    def test_an_entitlement_that_is_not_boolean_true_is_refused(self):
        for value in ("true", 1, False, {"a": True}):
            entitle(value=value)
            self.assertEqual(refused_with(), 35, value)

    def test_a_file_for_another_account_admits_that_account_alone(self):
        entitle(user="telephony")
        self.assertEqual(refused_with(), 35)
        self.assertEqual(as_account("telephony", refused_with), 0)

    def test_a_file_that_others_may_write_is_passed_over_and_reported(self):
        path = entitle()
        path.chmod(0o666)
        self.assertEqual(refused_with(), 35)
        eventually(lambda: any(level == ERROR and str(path) in text for channel, level, text in self.logs.lines),
                   what="an error line that names the file")

    def test_a_grant_is_kept_for_the_life_of_the_process_and_a_refusal_is_not(self):
        path = entitle()
        first = wire.Client()
        self.addCleanup(first.close)
        path.unlink()
        second = wire.Client()
        self.addCleanup(second.close)
        self.assertEqual(in_a_new_process(), 35)
        entitle()
        self.assertEqual(in_a_new_process(), 0)

    def test_the_caller_whose_port_is_already_dead_gets_5(self):
        ours, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        ours.close()
        service = wire.connect()
        self.addCleanup(service.close)
        self.assertEqual(service.status(wire.check_in_message(), [theirs.fileno()]), 5)
        theirs.close()
        # The process noticed the death, and left the countdown running.
        self.assertEqual(self.daemon.wait(), 0)

    def test_two_check_ins_of_one_process_are_independent(self):
        first, second = self.client(), self.client()
        first.life.close()
        with self.assertRaises(wire.Closed):
            first.channel.receive()
        self.assertEqual(second.status("EnableRadioManagerLogs", (1).to_bytes(4, "little")), 0)


class Activated(HelperTest):
    activated = True

    def test_the_manager_keeps_the_socket_file_and_a_late_client_waits_for_the_next_start(self):
        self.client().close()
        self.assertEqual(self.daemon.wait(), 0)
        self.assertTrue(SOCKET.exists())
        late = wire.connect()
        self.addCleanup(late.close)
        late.send(*check_in())
        self.daemon = Daemon(activated=True, listening=self.daemon.listening)
        reply, fds = late.receive()
        self.assertEqual(len(reply), 40)
        for fd in fds:
            os.close(fd)

    def test_a_message_sent_before_the_process_started_has_its_senders_credentials(self):
        listening = listen("/run/brenvik/bootstrap/early")
        early = wire.connect("/run/brenvik/bootstrap/early")
        self.addCleanup(early.close)
        early.send(*check_in())
        daemon = Daemon(activated=True, listening=listening)
        self.addCleanup(daemon.stop)
        reply, fds = early.receive()
        self.assertEqual(len(reply), 40)
        for fd in fds:
            os.close(fd)

    def test_nothing_is_loaded_at_start_that_the_first_check_in_does_not_need(self):
        self.client()
        loaded = self.daemon.maps()
        for library in ("curl", "sqlite", "crypto.so", "archive", "unistring", "expat", "icu"):
            self.assertNotIn(library, loaded)


def check_in():
    """A check-in whose port lives as long as this module's tests."""
    ours, theirs = socket.socketpair(socket.AF_UNIX, socket.SOCK_SEQPACKET)
    unittest.addModuleCleanup(ours.close)
    unittest.addModuleCleanup(theirs.close)
    return wire.check_in_message(), [theirs.fileno()]


class WithoutJournal(unittest.TestCase):
    def test_lines_go_to_standard_error_with_their_priority(self):
        logs = Logs()
        logs.close()  # neither socket is there now
        first = Daemon()
        self.addCleanup(first.stop)
        second = Daemon(wait=False)
        self.assertEqual(second.wait(), 1)
        self.assertIn(b"<3>unable to startup BrenvikMobileHelper server\n", second.stderr)
        second.stop()


class JournalFields(HelperTest):
    def test_entries_carry_identifier_and_place(self):
        second = Daemon(wait=False)
        self.addCleanup(second.stop)
        second.wait()
        self.logs.wait_for("unified", ERROR, "unable to startup BrenvikMobileHelper server")
        entry = self.logs.entries[-1]
        self.assertEqual(entry["SYSLOG_IDENTIFIER"], "BrenvikMobileHelper")
        self.assertTrue(entry["CODE_FILE"].endswith("helper/core/EntryPoint.cpp"))
        self.assertTrue(entry["CODE_LINE"].isdigit())
        self.assertEqual(entry["CODE_FUNC"], "runHelper")


if __name__ == "__main__":
    main()
