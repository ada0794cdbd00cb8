# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The network worker of the real daemon: what it is, and what its death costs at every step of its work."""
import os
import pathlib
import random
import re
import time

from harness import ERROR, LOG_ERR, SANITIZED, as_account, eventually, has_ended, kill_process, main, open_files, stop_process
from intrusion import tell_ways_into
from test_lasd import ALL, DIRECTORY, HOST, UpdateTest, request_check
from test_location import Brenvik, LocationTest, civic
import test_heartbeat
import wire

UNAVAILABLE = "HTTP client not available"
DIED = ("unified", ERROR, "brenvik-network-worker has died")
STEPS = 25
MOST_WAIT = 0.1  # seconds that a call of somebody else may take meanwhile


def ping(client, machine):
    """How long a call takes that has nothing to do with the worker."""
    before = time.monotonic()
    client.channel.exchange(wire.simple("CopyCountryCode"))
    after = time.monotonic()
    return machine.ran(before, after) if after - before > MOST_WAIT else after - before


class WorkerTest:
    """For tests that kill the worker."""

    def kill(self):
        """False when there is none."""
        worker = self.daemon.network_worker()
        return worker is not None and kill_process(worker)  # what is asked of one that is still going is lost with it

    def status(self):
        text = pathlib.Path(f"/proc/{self.daemon.network_worker()}/status").read_text()
        return dict(line.split(":\t", 1) for line in text.splitlines() if ":\t" in line)


class Updates(WorkerTest, UpdateTest):
    def strange_descriptors(self, worker):
        usual = r"/dev/null|pipe:|socket:|anon_inode:\[event(poll|fd)\]|anon_inode:\[timerfd\]"
        return [link for link in open_files(worker) if not re.match(usual, link)]

    def test_it_is_nobody_and_has_nothing_of_the_daemons(self):
        self.serve({"gsm": "1"})
        self.assertEqual(self.check(), ["UpdateAvailable gsm"])
        status, worker = self.status(), self.daemon.network_worker()
        self.assertEqual((status["Uid"].split(), status["Gid"].split()), (["65534"] * 4, ["65534"] * 4))
        self.assertEqual(status["Groups"].split(), [])
        self.assertEqual(status["NoNewPrivs"], "1")
        # A raw socket for the heartbeat, where echo sockets are closed to its group, as they are here.
        self.assertEqual({int(status[name], 16) for name in ("CapPrm", "CapEff")}, {1 << 13})
        self.assertEqual(int(status["CapInh"], 16) | int(status["CapAmb"], 16), 0)
        self.assertEqual(pathlib.Path(f"/proc/{worker}/environ").read_bytes(), b"")
        # Its connection, its logs, and what its own loops need; of the daemon nothing but standard error.
        # What it was given for the check it gives back a moment after its answer.
        eventually(lambda: not self.strange_descriptors(worker), what="nothing of the daemon's")
        links = open_files(worker)
        ours = set(open_files(self.daemon.pid))
        self.assertEqual([link for link in links if link.startswith("socket:") and link in ours], [])

    def test_its_own_account_looks_into_it_no_more_than_anybody_else(self):
        self.serve({"gsm": "1"})
        self.assertEqual(self.check(), ["UpdateAvailable gsm"])
        worker = self.daemon.network_worker()
        self.assertEqual(as_account("nobody", lambda: tell_ways_into(worker)), 0)
        self.assertEqual(self.daemon.network_worker(), worker)

    def test_the_daemon_has_no_socket_to_the_network(self):
        self.serve({"gsm": "1"})
        self.assertEqual(self.check(), ["UpdateAvailable gsm"])
        sockets = {match[1] for each in open_files(self.daemon.pid) if (match := re.fullmatch(r"socket:\[(\d+)\]", each))}
        unix = {line.split()[6] for line in pathlib.Path(f"/proc/{self.daemon.pid}/net/unix").read_text().splitlines()[1:]}
        self.assertTrue(sockets)
        self.assertEqual(sockets - unix, set())

    def test_it_leaves_with_the_daemon(self):
        self.serve({"gsm": "1"})
        self.assertEqual(self.check(), ["UpdateAvailable gsm"])
        worker = self.daemon.network_worker()
        self.daemon.process.kill()
        self.daemon.process.wait()
        eventually(lambda: has_ended(worker), what="the worker's end")

    def test_killed_during_a_fetch_the_request_fails_at_once_and_the_next_one_is_served(self):
        self.server.stop()
        self.server.start(*self.good, "location /content/ { limit_rate 2000; }")
        self.serve({"gsm": "1"}, lambda name, version: os.urandom(1_000_000))
        client, machine = self.client_for_all(), self.watch_machine()
        for round in range(1, 11):
            request_check(client, ALL)
            # The server logs a request when it is over; the manifest's is, and the content takes minutes.
            eventually(lambda: self.server.requests().count("/1/v3/lasd.plist") == round, 20, f"the fetch of round {round}")
            time.sleep(0.2)  # for the next request to begin; one that begins later is killed, too
            before = time.monotonic()
            while len(self.port.texts()) < round:
                self.kill()
                time.sleep(0.02)
            if not SANITIZED:
                self.assertLess(machine.ran(before), 2)
            self.assertLess(ping(client, machine), 1)
        self.assertLessEqual(set(self.port.texts()), {"UpdateFailed gsm", "UpdateFailed"})
        self.logs.wait_for("unified", ERROR, self.failure(f"https://{HOST}/content/gsm.db.gz", UNAVAILABLE))
        self.logs.wait_for(*DIED)
        self.assertEqual(list(DIRECTORY.iterdir()), [])
        self.server.stop()
        self.server.start(*self.good)
        manifest = self.serve({"gsm": "2"})
        self.assertEqual(self.check(), ["UpdateAvailable gsm"])
        self.assert_installed(manifest)

    def test_killed_at_any_moment_of_a_check_all_or_nothing_is_installed_and_nobody_else_waits(self):
        contents = {}

        def content(name, version):
            if version not in contents:
                contents[version] = random.Random(version).randbytes(300_000) * 20
            return contents[version]

        self.serve({"gsm": "0"}, content)
        self.assertEqual(self.check(), ["UpdateAvailable gsm"])
        client, other, machine = self.client_for_all(), self.client(), self.watch_machine()
        longest, outcomes, installed = 0.0, set(), "0"
        for step in range(STEPS):
            version = str(step + 1)
            manifest = self.serve({"gsm": version}, content)
            before = len(self.port.texts())
            request_check(client, ALL)
            end = time.monotonic() + step * 0.15 / STEPS
            while time.monotonic() < end:
                longest = max(longest, ping(other, machine))
            self.kill()
            longest = max(longest, ping(other, machine))
            told = self.port.wait_for(before + 1)[before:]
            outcomes.update(told)
            if told == ["UpdateAvailable gsm"]:
                installed = version
                self.assert_installed(manifest, content)
            else:
                self.assertIn(told, (["UpdateFailed"], ["UpdateFailed gsm"]))
                self.assertEqual((DIRECTORY / "gsm.db").read_bytes(), contents[installed])
                self.assertEqual(sorted(path.name for path in DIRECTORY.iterdir()), ["gsm.db"])
        print(f"{sorted(outcomes)}, longest call of somebody else {longest * 1e3:.1f} ms", flush=True)
        if not SANITIZED:
            self.assertLess(longest, MOST_WAIT)
        manifest = self.serve({"gsm": "last"}, content)
        self.assertEqual(self.check(), ["UpdateAvailable gsm"])
        self.assert_installed(manifest, content)


class Location(WorkerTest, LocationTest):
    def ask(self, client, brenvik):
        count = len(brenvik.pushes)
        self.ask_civic(client, 48.8584, 2.2945)
        return count

    def test_killed_at_any_moment_of_an_answer_there_is_a_push_all_the_same(self):
        brenvik, client, other, machine = Brenvik(self), self.client(), self.client(), self.watch_machine()
        longest = 0.0
        for step in range(STEPS):
            count = self.ask(client, brenvik)
            end = time.monotonic() + step * 0.03 / STEPS
            while time.monotonic() < end:
                longest = max(longest, ping(other, machine))
            self.kill()
            longest = max(longest, ping(other, machine))
            push = brenvik.wait_for(count + 1)[count]
            self.assertIn(push[1]["CountryCode"], ("FR", "NO"))
            eventually(lambda: len(brenvik.pushes) == count + 1)
        if not SANITIZED:
            self.assertLess(longest, MOST_WAIT)
        count = self.ask(client, brenvik)
        self.assertEqual(brenvik.wait_for(count + 1)[count][1]["CountryCode"], "FR")

    def test_ten_deaths_in_a_row_keep_nobody_from_anything(self):
        brenvik, client, other = Brenvik(self), self.client(), self.client()
        machine, workers = self.watch_machine(), set()
        for _ in range(10):
            count = self.ask(client, brenvik)
            self.assertEqual(brenvik.wait_for(count + 1)[count][1]["CountryCode"], "FR")
            workers.add(self.daemon.network_worker())
            self.assertTrue(self.kill())
            taken = ping(other, machine)
            if not SANITIZED:
                self.assertLess(taken, MOST_WAIT)
            self.assertIsNone(self.daemon.network_worker(), "nobody has a question for one")
        count = self.ask(client, brenvik)
        self.assertEqual(brenvik.wait_for(count + 1)[count][1]["CountryCode"], "FR")
        self.assertEqual(len(workers | {self.daemon.network_worker()}), 11, "a new one each time")

    def test_one_that_hangs_costs_its_own_question_the_five_seconds_and_nobody_else_anything(self):
        brenvik, client, other, machine = Brenvik(self), self.client(), self.client(), self.watch_machine()
        count = self.ask(client, brenvik)
        brenvik.wait_for(count + 1)
        worker = self.daemon.network_worker()
        stop_process(worker)
        count = self.ask(client, brenvik)
        longest = 0.0
        while len(brenvik.pushes) == count:
            longest = max(longest, ping(other, machine))
        self.assertEqual(brenvik.wait_for(count + 1)[count], civic("NO"))
        if not SANITIZED:
            self.assertLess(longest, MOST_WAIT)
        self.logs.wait_for("unified", ERROR, "brenvik-network-worker does not answer as it should, and is ended", 30)
        self.logs.wait_for("bsd", LOG_ERR, "_RequestCivicInfoFromLatitudeLongitude wasn't waiting for response from GEO")
        count = self.ask(client, brenvik)
        self.assertEqual(brenvik.wait_for(count + 1)[count][1]["CountryCode"], "FR")
        self.assertNotEqual(self.daemon.network_worker(), worker)


class Heartbeat(WorkerTest, test_heartbeat.HeartbeatTest):
    def test_killed_between_and_within_probes_the_next_one_goes_out(self):
        self.silence_kernel()  # so that half of the time a probe waits for its reply
        client, other, machine = self.switch(1), self.client(), self.watch_machine()
        self.probes(2, 10)
        longest = 0.0
        for step in range(4):
            time.sleep(0.7 * step % 2)
            self.assertTrue(self.kill() or step == 0)
            longest = max(longest, ping(other, machine))
            self.probes()
            self.assertTrue(self.probes(1, 10), "no probe after a death")
        self.switch(0, client)
        if not SANITIZED:
            self.assertLess(longest, MOST_WAIT)


if __name__ == "__main__":
    main()
