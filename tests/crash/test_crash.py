# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The helper is killed at each of its system calls, and the power is cut at each write to the disk.

After each of these the helper is started again and asked: what was to be changed is as it was or as it was to be, whole, and
what was answered is there. Everything stands on an ext4 of the test's own, on a loop device (disk.py); stores.py says what is
changed and what may be found.

BRENVIK_CRASH_KILLS: how many kills each store is to survive (default 20), BRENVIK_CRASH_CUTS: how many states after a power
cut (default 10), BRENVIK_CRASH_SEED: other values, sizes and choices. Few kills are spread over all calls of a step. `run`
beside this file goes on until each store has survived as many as are asked.
"""
import contextlib
import itertools
import os
import pathlib
import random
import select
import subprocess
import sys
import time
import unittest

sys.path.insert(0, str(pathlib.Path(__file__).resolve().parent.parent / "e2e"))

import disk
import harness
import network
import stores
import wire
from harness import BUILD, Daemon, Logs, entitle, listen
from test_lasd import HOST, UpdateTest

KILLS = int(os.environ.get("BRENVIK_CRASH_KILLS", 20))
CUTS = int(os.environ.get("BRENVIK_CRASH_CUTS", 10))
SEED = int(os.environ.get("BRENVIK_CRASH_SEED", 1))
MOMENT = 0.1  # seconds, for what the process does after its reply
SUBSETS = 2  # of what was not flushed, at each event
KILL_AT = BUILD / "brenvik-kill-at"
PLACES = {"mobile": "/var/mobile", "root": "/root/Library"}


class KillAt:
    """Kills a process at its system call of a number; see KillAt.c."""

    def __init__(self, pid, number):
        self.process = subprocess.Popen([KILL_AT, str(pid), str(number)], stdout=subprocess.PIPE, text=True)
        line = self.process.stdout.readline()
        if line != "ready\n":
            self.process.wait()
            raise AssertionError(f"kill-at said {line!r}")

    def end(self):
        """What it says last, as words."""
        # The reply is seen before the call that comes after it.
        select.select([self.process.stdout], [], [], MOMENT)
        self.process.terminate()
        words = self.process.stdout.read().split()
        self.process.stdout.close()
        if self.process.wait() != 0 and not words:
            raise AssertionError("kill-at failed")
        return words


class CrashTest(unittest.TestCase):
    """A daemon, started by the test as a service manager would, on the file system of the test."""
    loops = None

    @classmethod
    def setUpClass(cls):
        if not disk.is_available():
            raise unittest.SkipTest("no loop devices or no FUSE here")

    serve = UpdateTest.serve
    set_hosts = UpdateTest.set_hosts

    def setUp(self):
        if CrashTest.loops is None:
            CrashTest.loops = disk.LoopDevices()
        self.logs = Logs()
        self.addCleanup(self.logs.close)
        entitle()
        self.daemon = None
        self.listening = listen()
        self.addCleanup(self.listening.close)
        self.image = pathlib.Path("/tmp/crash.img")
        disk.make_image(self.image)
        self.volume = disk.Volume(self.loops, PLACES)
        self.addCleanup(self.volume.unmount)
        self.addCleanup(self.stop)

    def start(self):
        self.daemon = Daemon(activated=True, listening=self.listening)

    def stop(self):
        if self.daemon is not None:
            self.daemon.process.kill()
            self.daemon.process.wait()
            self.daemon.reader.join()
            self.daemon.process.stderr.close()
            self.daemon = None

    def store_worker(self):
        for tasks in pathlib.Path(f"/proc/{self.daemon.pid}/task").glob("*/children"):
            for pid in tasks.read_text().split():
                with contextlib.suppress(FileNotFoundError, ProcessLookupError):  # killed before
                    if os.readlink(f"/proc/{pid}/exe").endswith("brenvik-store-worker"):
                        return int(pid)
        raise AssertionError("no store worker")

    def wait_for_notice(self):
        """The update's notification; raises wire.Closed when the daemon has gone before."""
        end = time.monotonic() + 30
        while not self.port.texts():
            if not self.daemon.running() and not self.port.texts():
                raise wire.Closed()
            if time.monotonic() > end:
                raise AssertionError(f"no notification: {self.logs.lines[-5:]}")
            time.sleep(0.002)

    def make_store(self, name):
        generator = random.Random(f"{name} {SEED}")
        if name == "install":
            network.default_settings()
            self.set_hosts(f"127.0.0.1 {HOST}")
            authority = network.Authority(self)
            authority.trust(self)
            self.port = network.MessagePort(self)
            self.server = network.Nginx(self, *authority.issue([HOST]))
        store = stores.ALL[name](self, generator)
        self.start()
        store.prepare()
        return store

    def take(self, store, client):
        """One step. Whether it was answered."""
        try:
            return store.step(client)
        except wire.Closed:
            return False


class Kills(CrashTest):
    def kill_everywhere(self, name):
        """Steps of a store, each killed at a later system call than the one before, until a step has no more; then again from
        the first call."""
        self.volume.mount(self.image)
        store = self.make_store(name)
        calls = self.interrupt(store, name, 0)[1]
        self.kills, self.answered, longest = 0, 0, calls
        choose = random.Random(f"calls {name} {SEED}")
        while self.kills < KILLS:
            # Sizes differ, so a step may have more calls than the last one to its end.
            each = itertools.count(1)
            if KILLS < longest:
                each = sorted(choose.sample(range(1, longest + 1), KILLS - self.kills))
            for number in each:
                killed, calls = self.interrupt(store, name, number)
                longest = max(longest, calls)
                if not killed or self.kills == KILLS:
                    break
        print(f"crash {name}: {self.kills} kills, {self.answered} of them after the answer, in steps of up to {longest} calls",
              flush=True)

    def interrupt(self, store, name, number):
        """One step, killed at that call, and a look at what there is. Whether it was killed, and at which call it ended."""
        with wire.Client() as client:
            store.ready(client)
            killer = KillAt(store.victim(), number)
            answered = self.take(store, client)
            words = killer.end()
        killed = words[0] == "killed"
        where = f"store {name}, seed {SEED}, step {store.number}: {' '.join(words)}"
        excused = store.is_excused(killed)
        if killed:
            self.kills += 1
            self.answered += answered
            if not self.daemon_goes_on(store):
                self.stop()
                self.start()
        else:
            self.assertTrue(answered, where)
        with self.subTest(where), wire.Client() as client:
            store.check(client, answered and not excused)
        return killed, int(words[1])

    def daemon_goes_on(self, store):
        return isinstance(store, stores.TokensOfTheWorker)


class PowerCuts(CrashTest):
    def cut_everywhere(self, name):
        log = disk.BlockLog(self.image)
        try:
            self.volume.mount(log.file)
            store = self.make_store(name)
            store.removals_may_be_lost = True
            done, events_seen, after = 0, 0, 0
            while done < CUTS:
                with wire.Client() as client:
                    store.ready(client)
                    self.volume.flush()
                    log.start()
                    self.assertTrue(self.take(store, client))
                    log.mark()
                base, events = log.take()
                self.stop()
                self.volume.unmount()
                old = store.old if hasattr(store, "old") else None
                cuts = disk.cuts(base, events, store.generator, SUBSETS)
                events_seen += len(events)
                # Few are spread over all moments before the answer; those after it are always among them.
                chosen = [cut for cut in cuts if not cut.is_after_mark]
                late = [cut for cut in cuts if cut.is_after_mark]
                if len(cuts) > CUTS - done:
                    chosen = store.generator.sample(chosen, max(CUTS - done - len(late), 1))
                for cut in chosen + late:
                    done += 1
                    after += cut.is_after_mark
                    if hasattr(store, "old"):
                        store.old = old
                    self.look_at(store, name, cut)
                self.volume.mount(log.file)
                self.start()
                if hasattr(store, "old"):
                    store.old = old
                with wire.Client() as client:
                    store.check(client, True)
            print(f"cut {name}: {done} states, {after} of them after the answer; {events_seen} events on the disk", flush=True)
        finally:
            self.stop()
            self.volume.unmount()
            log.close()

    def look_at(self, store, name, cut):
        file = pathlib.Path("/tmp/state.img")
        file.write_bytes(cut.image())
        self.volume.mount(file)
        self.start()
        try:
            with self.subTest(f"store {name}, seed {SEED}, step {store.number}: {cut.where}"), wire.Client() as client:
                store.check(client, cut.is_after_mark)
        finally:
            self.stop()
            self.volume.unmount()


class KilledWhileItMakesAChild(unittest.TestCase):
    """Until the child becomes another program, it has copies of the helper's descriptors: its sockets, too."""

    def setUp(self):
        logs = Logs()
        self.addCleanup(logs.close)
        entitle()
        pathlib.Path("/tmp/empty.zip").write_bytes(b"PK\5\6" + bytes(18))
        self.daemon = Daemon()
        self.addCleanup(lambda: self.daemon.stop())  # the one that the test has by then
        self.killer = KillAt(self.daemon.pid, "fork")
        with wire.Client() as client:  # the program that reads archives is the child
            client.channel.send(wire.simple("UnpackArchive", stores.short("/tmp/empty.zip"), stores.short("/tmp/empty")))
            self.assertEqual(self.killer.process.stdout.read(len("killed fork")), "killed fork")
        killed = self.daemon
        killed.process.wait()
        self.addCleanup(killed.stop)  # the child has its standard error

    def test_the_next_one_takes_the_socket_file_over_as_soon_as_the_child_lets_go(self):
        orphan = wire.connect()
        self.addCleanup(orphan.close)
        self.daemon = Daemon(wait=False)

        def has_lock():
            self.assertTrue(self.daemon.running())
            return any(each.endswith(".lock") for each in harness.open_files(self.daemon.pid))
        harness.eventually(has_lock, what="the lock under which it looks who listens")
        self.killer.end()
        with self.assertRaises(wire.Closed):
            orphan.receive()
        self.daemon.wait_until_listening()
        wire.Client().close()


def add(case, prefix, run, names):
    for name in names:
        def test(self, name=name):
            run(self, name)
        setattr(case, f"test_{prefix}_{name.replace('-', '_')}", test)


add(Kills, "killed_at_every_system_call", Kills.kill_everywhere, stores.ALL)
add(PowerCuts, "cut_at_every_write", PowerCuts.cut_everywhere,
    [name for name in stores.ALL if name != "tokens-worker"])

if __name__ == "__main__":
    unittest.main(verbosity=2)
