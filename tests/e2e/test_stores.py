# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What "mobile" can do with the databases below its home: nothing to root's files, and nobody waits for it long."""
import contextlib
import os
import pathlib
import pwd
import select
import shutil
import signal
import socket
import sqlite3
import struct
import subprocess
import threading
import time

import wire
from harness import BUILD, ERROR, HelperTest, as_account, eventually, kill_process, listen, main, open_files, stop_process
from intrusion import tell_ways_into, ways_into

HOME = pathlib.Path("/var/mobile")
LIBRARY = HOME / "Library"
VOICEMAIL = LIBRARY / "Voicemail/voicemail.db"
CONTACTS = LIBRARY / "AddressBook/contacts.db"
VICTIM = pathlib.Path("/etc/victim")
MOBILE = pwd.getpwnam("mobile")
TABLE = "CREATE TABLE contact_channels(contact_id INTEGER NOT NULL, channel_identifier TEXT NOT NULL)"
WRITTEN = "The voicemail store could not be written"
READ = "The voicemail store could not be read"
WORKER = "brenvik-store-worker"


def short(text):
    return wire.field(str(text), 256)


class StoresTest(HelperTest):
    def setUp(self):
        super().setUp()
        subprocess.run(["rm", "-rf", HOME], check=True)
        (LIBRARY / "AddressBook").mkdir(parents=True)
        for path in (HOME, LIBRARY, LIBRARY / "AddressBook"):
            os.chown(path, MOBILE.pw_uid, MOBILE.pw_gid)
        VICTIM.write_text("root's")
        self.caller = self.client()

    def token(self):
        return self.caller.text("CopyVoicemailToken").split(b"\0")[0].decode()

    def set_token(self, text="token"):
        self.assertEqual(self.caller.status("SetVoicemailToken", short(text)), 0)

    def remap(self):
        return self.caller.integer("RemapContactsChannel", wire.field("old", 64), wire.field("new", 64))

    def as_mobile(self, work):
        """Runs work() as the account; it must not raise."""
        self.assertEqual(as_account("mobile", lambda: work() or 0), 0)

    def make_contacts(self, as_root=False):
        def work():
            with contextlib.closing(sqlite3.connect(CONTACTS)) as database:
                database.execute(TABLE)
                database.execute("INSERT INTO contact_channels VALUES(1, 'old')")
                database.commit()
        if as_root:
            work()
        else:
            self.as_mobile(work)

    def channel(self):
        with contextlib.closing(sqlite3.connect(f"file:{CONTACTS}?mode=ro", uri=True)) as database:
            return database.execute("SELECT channel_identifier FROM contact_channels").fetchone()[0]

    def workers(self):
        """The workers' process ids."""
        found = []
        for line in pathlib.Path(f"/proc/{self.daemon.pid}/task/{self.daemon.pid}/children").read_text().split():
            with contextlib.suppress(FileNotFoundError, ProcessLookupError):
                if os.readlink(f"/proc/{line}/exe").endswith(WORKER):
                    found.append(int(line))
        return found

    @contextlib.contextmanager
    def within(self, seconds):
        machine = self.watch_machine()
        start = time.monotonic()
        yield
        self.assertLess(machine.ran(start), seconds)


def page_checksum(page, nonce):
    """Of a page in a rollback journal (the format is SQLite's own, https://sqlite.org/fileformat2.html)."""
    at, total = len(page) - 200, nonce
    while at > 0:
        total += page[at]
        at -= 200
    return total & 0xFFFFFFFF


def journal(database, pages, super_journal=None):
    """A hot rollback journal for a database, which puts its own pages back so many times."""
    content = database.read_bytes()
    size = struct.unpack(">H", content[16:18])[0]
    nonce, sector = 7, 512
    head = b"\xd9\xd5\x05\xf9\x20\xa1\x63\xd7" + struct.pack(">IIIII", pages, nonce, len(content) // size, sector, size)
    record = struct.pack(">I", 1) + content[:size] + struct.pack(">I", page_checksum(content[:size], nonce))
    end = b""
    if super_journal is not None:
        name = os.fsencode(super_journal)
        lock_page = 0x40000000 // size + 1
        checksum = sum(byte - 256 if byte > 127 else byte for byte in name) & 0xFFFFFFFF
        end = struct.pack(">I", lock_page) + name + struct.pack(">II", len(name), checksum) + b"\xd9\xd5\x05\xf9\x20\xa1\x63\xd7"
    return head.ljust(sector, b"\0"), record, end


class Attacks(StoresTest):
    def plant(self, database, pages=1, super_journal=None):
        head, record, end = journal(database, pages, super_journal)

        def work():
            with open(f"{database}-journal", "wb") as file:
                file.write(head)
                many = record * 4096
                for _ in range(pages // 4096):
                    file.write(many)
                file.write(record * (pages % 4096))
                file.write(end)
        self.as_mobile(work)

    def test_a_super_journal_that_names_a_file_of_roots_removes_nothing(self):
        self.set_token()
        self.make_contacts()
        for database, use in ((VOICEMAIL, self.token), (CONTACTS, self.remap)):
            self.plant(database, super_journal=VICTIM)
            with self.within(4):
                use()
            self.assertEqual(VICTIM.read_text(), "root's", database)

    def test_the_planted_journal_is_one_that_removes_what_it_names(self):
        # Or the test above would show nothing: with a file of the account's own it works.
        self.set_token()
        other = HOME / "other"
        self.as_mobile(lambda: other.write_text("mobile's") and None)
        self.plant(VOICEMAIL, super_journal=other)
        self.token()
        self.assertFalse(other.exists())

    def test_a_pipe_in_the_journals_place_keeps_nobody_waiting(self):
        self.set_token()
        self.make_contacts()
        for database, use in ((VOICEMAIL, self.token), (CONTACTS, self.remap)):
            self.as_mobile(lambda: os.mkfifo(f"{database}-journal"))
            with self.within(4):
                use()
            self.as_mobile(lambda: os.unlink(f"{database}-journal"))
        self.assertEqual(self.token(), "token")
        self.assertEqual(self.remap(), 1)

    def test_a_large_journal_is_given_up_in_time_and_other_calls_go_on(self):
        self.set_token()
        self.make_contacts()
        other = self.client()
        for database, use, seconds, pages in ((VOICEMAIL, self.token, 3, 2_000_000), (CONTACTS, self.remap, 4.5, 5_000_000)):
            # With the smallest pages there are: rolling so many back takes far longer than anybody is to wait.
            self.as_mobile(lambda: sqlite3.connect(database).executescript("PRAGMA page_size=512; VACUUM") and None)
            self.plant(database, pages=pages)
            with self.within(seconds):
                use()
            self.logs.wait_for("unified", ERROR, f"{WORKER} does not answer as it should, and is ended")
            self.logs.clear()
            self.as_mobile(lambda: os.unlink(f"{database}-journal"))
            with self.within(0.1):
                other.integer("IsVoicemailServiceSubscribed")
        self.set_token("another")
        self.assertEqual(self.token(), "another")
        self.assertEqual(self.remap(), 1)

    def test_a_private_file_of_roots_that_was_moved_to_the_databases_place_stays_roots(self):
        secret = HOME / "secret"
        secret.write_bytes(b"SQLite format 3\0 and a secret")
        secret.chmod(0o600)
        self.as_mobile(lambda: os.rename(secret, CONTACTS))
        self.remap()
        info = CONTACTS.stat()
        self.assertEqual((info.st_uid, info.st_mode & 0o7777), (0, 0o600))
        self.set_token()
        self.as_mobile(lambda: os.unlink(VOICEMAIL))
        secret.write_text("another secret")
        self.as_mobile(lambda: os.rename(secret, VOICEMAIL))
        self.set_token("another")
        self.assertEqual(self.token(), "")
        self.logs.wait_for("unified", ERROR, WRITTEN)
        info = VOICEMAIL.stat()
        self.assertEqual((info.st_uid, VOICEMAIL.read_text()), (0, "another secret"))

    def test_a_folder_of_roots_that_was_moved_to_the_stores_place_stays_roots(self):
        private = LIBRARY / "private"
        private.mkdir(mode=0o700)
        (private / "voicemail.db").write_text("secret")
        self.as_mobile(lambda: os.rename(private, LIBRARY / "Voicemail"))
        self.set_token()
        self.assertEqual(self.token(), "")
        self.assertEqual((LIBRARY / "Voicemail").stat().st_uid, 0)
        self.assertEqual(VOICEMAIL.stat().st_uid, 0)

    def test_links_in_the_stores_places_lead_nowhere(self):
        VICTIM.chmod(0o600)
        elsewhere = pathlib.Path("/etc/folder")
        elsewhere.mkdir(exist_ok=True)
        self.as_mobile(lambda: os.symlink(elsewhere, LIBRARY / "Voicemail"))
        self.as_mobile(lambda: os.symlink(VICTIM, CONTACTS))
        self.set_token()
        self.assertEqual(self.remap(), 1)
        self.logs.wait_for("unified", ERROR, "unable to create ContactsChannelManager")
        self.assertEqual(list(elsewhere.iterdir()), [])
        self.assertEqual((VICTIM.read_text(), VICTIM.stat().st_uid, elsewhere.stat().st_uid), ("root's", 0, 0))


class Places(StoresTest):
    """Stores that root has made, where nobody else can have put them."""

    def setUp(self):
        super().setUp()
        subprocess.run(["rm", "-rf", HOME], check=True)
        LIBRARY.mkdir(parents=True)

    def test_a_database_of_roots_is_used_whatever_its_modes(self):
        for mask in (0o022, 0o077):
            subprocess.run(["rm", "-rf", HOME], check=True)
            before = os.umask(mask)
            try:
                CONTACTS.parent.mkdir(parents=True)
                self.make_contacts(as_root=True)
            finally:
                os.umask(before)
            self.assertEqual(self.remap(), 1)
            self.assertEqual(self.channel(), "new")

    def test_open_folders_that_root_has_made_in_mobiles_own_are_used(self):
        for own in ((HOME,), (HOME, LIBRARY), (LIBRARY,)):
            subprocess.run(["rm", "-rf", HOME], check=True)
            CONTACTS.parent.mkdir(parents=True)
            VOICEMAIL.parent.mkdir()
            for path in own:
                os.chown(path, MOBILE.pw_uid, MOBILE.pw_gid)
            self.make_contacts(as_root=True)
            self.assertEqual(self.remap(), 1)
            self.assertEqual(self.channel(), "new")
            self.set_token()
            self.assertEqual(self.token(), "token")

    def test_a_database_that_root_puts_where_it_has_been_given_away_is_used_again(self):
        for _ in range(3):
            CONTACTS.parent.mkdir(parents=True, exist_ok=True)
            CONTACTS.unlink(missing_ok=True)
            self.make_contacts(as_root=True)
            self.assertEqual(self.remap(), 1)
            self.assertEqual(self.channel(), "new")

    def test_root_reads_and_replaces_the_voicemail_store(self):
        self.set_token("first")
        with contextlib.closing(sqlite3.connect(VOICEMAIL)) as database:
            self.assertEqual(database.execute("SELECT token FROM general").fetchall(), [("first",)])
            copy = VOICEMAIL.read_bytes()
        self.set_token("second")
        VOICEMAIL.unlink()
        VOICEMAIL.write_bytes(copy)
        self.assertEqual(self.token(), "first")
        self.set_token("third")
        self.assertEqual(self.token(), "third")

    def test_a_folder_or_another_file_in_the_databases_place_is_an_error(self):
        VOICEMAIL.mkdir(parents=True)
        CONTACTS.mkdir(parents=True)
        self.set_token()
        self.assertEqual(self.token(), "")
        self.logs.wait_for("unified", ERROR, WRITTEN)
        self.logs.wait_for("unified", ERROR, READ)
        self.assertEqual(self.remap(), 1)
        self.logs.wait_for("unified", ERROR, "unable to create ContactsChannelManager")

    def test_a_database_that_another_process_holds_is_waited_for_a_second(self):
        self.set_token("old")
        with contextlib.closing(sqlite3.connect(VOICEMAIL, isolation_level=None)) as database:
            database.execute("BEGIN EXCLUSIVE")
            with self.within(2):
                self.set_token("new")
            database.execute("ROLLBACK")
        self.logs.wait_for("unified", ERROR, WRITTEN)
        self.assertEqual(self.token(), "old")


class Worker(StoresTest):
    def test_its_own_account_looks_into_it_no_more_than_anybody_else(self):
        self.set_token()
        worker, = self.workers()
        own = subprocess.Popen(["/bin/sleep", "60"], user=MOBILE.pw_uid, group=MOBILE.pw_gid, extra_groups=[])
        self.addCleanup(own.wait)
        self.addCleanup(own.kill)
        self.assertEqual(as_account("mobile", lambda: int("mem" in ways_into(own.pid))), 1, "these are ways")
        self.assertEqual(as_account("mobile", lambda: tell_ways_into(worker)), 0)
        self.assertEqual(self.token(), "token")

    def status(self, pid):
        lines = pathlib.Path(f"/proc/{pid}/status").read_text().splitlines()
        return dict(line.split(":\t", 1) for line in lines if ":\t" in line)

    def test_it_starts_with_the_first_use_and_leaves_with_the_helper(self):
        self.assertEqual(self.token(), "")
        self.assertEqual(self.workers(), [], "there is no store to read yet")
        self.set_token()
        worker, = self.workers()
        self.assertEqual(self.token(), "token")
        self.assertEqual(self.workers(), [worker])
        os.kill(self.daemon.pid, signal.SIGKILL)
        self.daemon.wait()
        eventually(lambda: not os.path.exists(f"/proc/{worker}"), what="the worker's end")

    def test_it_has_the_accounts_rights_and_no_others(self):
        self.set_token()
        worker, = self.workers()
        status = self.status(worker)
        self.assertEqual(status["Uid"].split(), [str(MOBILE.pw_uid)] * 4)
        self.assertEqual(status["Gid"].split(), [str(MOBILE.pw_gid)] * 4)
        self.assertEqual(status["Groups"].split(), [])
        for name in ("CapInh", "CapPrm", "CapEff", "CapAmb"):
            self.assertEqual(int(status[name], 16), 0, name)
        self.assertEqual(status["NoNewPrivs"], "1")
        self.assertEqual(status["Seccomp"], "2", "it opens no network socket")
        self.assertEqual(pathlib.Path(f"/proc/{worker}/environ").read_bytes(), b"")
        # Its own account's processes cannot look into it, nor at what it was handed.
        self.assertEqual(as_account("mobile", lambda: int(os.access(f"/proc/{worker}/mem", os.R_OK))), 0)
        for target in open_files(worker):
            self.assertRegex(target, r"\A(/dev/null|pipe:.*|socket:.*|/var/mobile/Library/Voicemail(/voicemail\.db)?)\Z")

    def test_the_helper_knows_no_database(self):
        self.make_contacts()
        self.set_token()
        self.assertEqual(self.remap(), 1)
        maps = self.daemon.maps()
        self.assertNotIn("sqlite", maps)
        self.assertIn("sqlite", pathlib.Path(f"/proc/{self.workers()[0]}/maps").read_text())

    def test_killed_at_any_moment_it_costs_at_most_the_operation_under_way(self):
        self.make_contacts()
        self.set_token("0")
        held = "0"
        for number in range(1, 40):
            worker, = self.workers()
            # The kill comes somewhere in the operation, each time a little later.
            killer = subprocess.Popen(["/bin/sh", "-c", f"sleep {number / 4000:f}; kill -9 {worker}"],
                                      stderr=subprocess.DEVNULL)
            self.logs.clear()
            with self.within(3):
                self.set_token(number)
                killer.wait()
                if self.remap() == 1:
                    self.assertEqual(self.channel(), "new")
            eventually(lambda: worker not in self.workers(), what="its end")
            self.assertEqual(self.caller.status("SetVoicemailTokenForKey", short("k"), short("v")), 0)
            now = self.token()
            self.assertIn(now, (held, str(number)))
            held = now
            with contextlib.closing(sqlite3.connect(CONTACTS)) as database:
                self.assertEqual(database.execute("PRAGMA integrity_check").fetchall(), [("ok",)])
                database.execute("UPDATE contact_channels SET channel_identifier = 'old'")
                database.commit()

    def test_ten_deaths_in_a_row_keep_nobody_from_anything(self):
        self.set_token()
        other = self.client()
        for _ in range(10):
            worker, = self.workers()
            self.assertTrue(kill_process(worker))
            with self.within(1):
                self.assertEqual(self.token(), "token")
            with self.within(0.1):
                other.integer("IsVoicemailServiceSubscribed")
        self.assertEqual(len(self.workers()), 1)

    def test_one_that_hangs_is_ended_and_the_next_request_has_another(self):
        self.make_contacts()
        self.set_token()
        for use, seconds in ((self.token, 2.5), (self.remap, 4)):
            worker, = self.workers()
            stop_process(worker)
            with self.within(seconds):
                use()
            eventually(lambda: worker not in self.workers(), what="its end")
            self.assertEqual(self.token(), "token")
        self.logs.wait_for("unified", ERROR, f"{WORKER} does not answer as it should, and is ended")
        self.logs.wait_for("unified", ERROR, READ)


class Service(StoresTest):
    """The worker as a service of its own: the service manager holds its socket and starts it as the account."""

    NAME = "com.norvale.brenvik.mobile-helper.stores"

    def prepare(self):
        # Where the account can get at it, as it can where the program is installed.
        self.program = pathlib.Path("/tmp") / WORKER
        shutil.copy(BUILD / WORKER, self.program)
        self.listening = listen(f"/run/brenvik/bootstrap/{self.NAME}")
        self.addCleanup(os.unlink, f"/run/brenvik/bootstrap/{self.NAME}")
        self.addCleanup(self.listening.close)
        self.start()

    def start(self):
        command = ["/bin/sh", "-c", f'exec 3<&{self.listening.fileno()}; LISTEN_PID=$$ exec "$@"', "sh", str(self.program)]
        self.worker = subprocess.Popen(command, env={"LISTEN_FDS": "1", "LISTEN_FDNAMES": self.NAME},
                                       pass_fds=[self.listening.fileno()], user=MOBILE.pw_uid, group=MOBILE.pw_gid,
                                       extra_groups=[])
        self.addCleanup(self.worker.wait)
        self.addCleanup(self.worker.kill)

    @contextlib.contextmanager
    def started_when_somebody_connects(self):
        """As the service manager does it: whenever none runs and a connection waits."""
        ended = threading.Event()

        def look():
            while not ended.wait(0.01):
                if self.worker.poll() is not None and select.select([self.listening], [], [], 0)[0]:
                    self.start()

        looking = threading.Thread(target=look)
        looking.start()
        try:
            yield
        finally:
            ended.set()
            looking.join()

    def test_it_serves_the_helper_which_starts_none_and_leaves_with_it(self):
        self.make_contacts()
        self.set_token()
        self.assertEqual(self.token(), "token")
        self.assertEqual(self.remap(), 1)
        self.assertEqual(self.workers(), [])
        self.assertIsNone(self.worker.poll())
        os.kill(self.daemon.pid, signal.SIGKILL)
        self.daemon.wait()
        self.assertEqual(self.worker.wait(10), 0)

    def test_its_own_account_looks_into_it_no_more_than_anybody_else(self):
        self.set_token()
        self.assertEqual(as_account("mobile", lambda: tell_ways_into(self.worker.pid)), 0)
        self.assertEqual(self.token(), "token")

    def test_while_none_is_started_an_operation_fails_in_time_and_the_next_one_has_the_new_one(self):
        self.set_token()
        self.worker.kill()
        self.worker.wait()
        with self.within(3):
            self.assertEqual(self.token(), "")
        # A new one may find nothing but the connection that was given up, and leave again.
        with self.started_when_somebody_connects():
            self.assertEqual(self.token(), "token")

    def test_stopped_by_its_account_it_costs_each_request_its_time_and_no_more(self):
        self.set_token()
        other = self.client()
        self.as_mobile(lambda: stop_process(self.worker.pid))
        for _ in range(3):
            with self.within(2.5):
                self.assertEqual(self.token(), "")
            with self.within(0.1):
                other.integer("IsVoicemailServiceSubscribed")
        self.logs.wait_for("unified", ERROR, READ)
        self.as_mobile(lambda: os.kill(self.worker.pid, signal.SIGCONT))
        self.assertEqual(self.worker.wait(10), 0, "nobody waits for it any more")
        self.start()
        self.assertEqual(self.token(), "token")

    def test_nobody_but_root_is_served(self):
        os.chmod(f"/run/brenvik/bootstrap/{self.NAME}", 0o666)

        def ask():
            with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as stranger:
                stranger.settimeout(10)
                stranger.connect(f"/run/brenvik/bootstrap/{self.NAME}")
                return len(stranger.recv(10))
        self.assertEqual(as_account("mobile", ask), 0)
        self.assertEqual(self.worker.wait(10), 0, "with nobody else to serve it leaves")
        self.start()
        self.set_token()
        self.assertEqual(self.token(), "token")

    def test_started_by_anybody_else_it_does_nothing(self):
        done = subprocess.run([BUILD / WORKER], stdin=subprocess.DEVNULL, capture_output=True, timeout=10, check=False)
        self.assertEqual(done.returncode, 1)
        self.logs.wait_for("unified", ERROR, f"{self.NAME} is a service for the helper, which starts it")


if __name__ == "__main__":
    main()
