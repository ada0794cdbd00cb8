# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Requests placed where the process is about to leave for being idle: every one of them is answered.

The daemon is one of this build that leaves after 10 milliseconds instead of 10 seconds. Each request comes from a
new client after a pause that is made longer while the process is still there and shorter when it had left, so that
the pauses stay around the edge.

BRENVIK_EDGE_REQUESTS says how many a service manager's daemon is asked (default 1000), BRENVIK_EDGE_SEED makes other pauses:
tests/everywhere/idle-edge does so a hundred thousand times.
"""
import os
import random
import select
import subprocess
import threading
import time
import unittest

import harness
import wire
from harness import SOCKET, Daemon, Logs, entitle, listen, main

REQUESTS = int(os.environ.get("BRENVIK_EDGE_REQUESTS", 1000))
SEED = int(os.environ.get("BRENVIK_EDGE_SEED", 20))
ALONE = 300  # of these each start waits for us
IDLE = 0.010  # seconds


class IdleEdge(unittest.TestCase):
    def setUp(self):
        self.logs = Logs()
        self.addCleanup(self.logs.close)
        entitle()
        self.addCleanup(setattr, harness, "DAEMON", harness.DAEMON)
        harness.DAEMON = harness.BUILD / "BrenvikMobileHelper-hasty"
        self.lives = 0
        self.retries = 0

    def request(self):
        """One request of a new client, which does what the protocol says when the helper stopped meanwhile."""
        for _ in range(20):
            try:
                with wire.Client() as client:
                    return client.copy_preference("com.example.edge", "key")
            except wire.Closed:
                self.retries += 1  # not answered: connect and check in again
        raise AssertionError("stopped twenty times in a row before it answered")

    def place_requests(self, requests, ask):
        generator = random.Random(SEED)
        pause, met_alive = IDLE, 0
        for number in range(requests):
            time.sleep(pause * generator.uniform(0.9, 1.1))
            lives = self.lives
            self.assertEqual(ask(), b"", f"request {number}")
            alive = self.lives == lives
            met_alive += alive
            pause = min(max(pause * (1.05 if alive else 1 / 1.05), IDLE / 4), IDLE * 4)
        print(f"{requests} answered: {met_alive} by a process that was there, {self.lives} lives, "
              f"{self.retries} checked in again", flush=True)
        self.assertGreater(met_alive, requests / 20, "the pauses were beyond the edge")
        self.assertGreater(self.lives, requests / 20, "the pauses were short of the edge")

    def test_socket_activated_all_requests_around_the_idle_edge_are_answered(self):
        listening = listen()
        self.addCleanup(listening.close)
        statuses = []
        stop_read, stop_write = os.pipe()

        def activate():
            """The service manager's part: starts the process when somebody waits at the socket."""
            while stop_read not in select.select([listening, stop_read], [], [])[0]:
                self.lives += 1
                daemon = Daemon(activated=True, listening=listening)
                statuses.append(daemon.wait())
                daemon.process.stderr.close()

        activator = threading.Thread(target=activate)
        activator.start()
        try:
            self.place_requests(REQUESTS, self.request)
        finally:
            os.write(stop_write, b"x")
            activator.join()
            os.close(stop_read)
            os.close(stop_write)
        self.assertEqual(set(statuses), {0})
        self.assertTrue(SOCKET.exists())

    def test_standing_alone_all_requests_around_the_idle_edge_are_answered(self):
        daemons = []

        def ask():
            while True:
                try:
                    return self.request()
                except (FileNotFoundError, ConnectionRefusedError):
                    # Nobody starts it but us.
                    if daemons:
                        self.assertEqual(daemons[-1].wait(), 0)
                        daemons.pop().stop()
                    self.lives += 1
                    daemons.append(Daemon())

        try:
            self.place_requests(ALONE, ask)
        finally:
            for daemon in daemons:
                daemon.stop()


class DemoShell(unittest.TestCase):
    """What scripts/demo --shell has in place of a service manager."""

    def test_a_daemon_that_left_for_being_idle_is_started_again_by_the_next_client(self):
        entitle()
        holder = subprocess.Popen(["./hold-socket", harness.BUILD / "BrenvikMobileHelper-hasty", SOCKET],
                                  stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, text=True)
        self.addCleanup(holder.stdout.close)
        self.addCleanup(holder.wait)
        self.addCleanup(holder.kill)
        says = iter(holder.stdout.readline, "")
        self.assertEqual(next(says), "listening\n")
        for _ in range(3):
            with wire.Client() as client:
                self.assertEqual(client.copy_preference("com.example.edge", "key"), b"")
            self.assertEqual((next(says), next(says)), ("starting\n", "left with status 0\n"))


if __name__ == "__main__":
    main()
