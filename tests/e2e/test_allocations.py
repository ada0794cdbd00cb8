# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Every request of the daemon for memory fails once, and then all of them from each one on, while it serves.

Whatever lacks memory, the daemon stays, answers what is right or a failure, leaves the old files or the new ones, and
has afterwards what it had before; the same request then succeeds.
"""
import contextlib
import itertools
import json
import os
import pathlib
import plistlib
import re
import shutil
import socket
import sqlite3
import stat
import struct
import sys
import threading
import time
import unittest
import zipfile

import allocations
import harness
import network
import wire
from allocations import EVER
from harness import Daemon, HelperTest, eventually, main
from test_heartbeat import ADDRESS as REACHABILITY
from test_lasd import DIRECTORY, MASKS, UpdateTest
from test_location import PARIS, STUN, Brenvik, GeocoderTest, WanIpTest, address, civic

# With this in the environment each and every one fails; else, where there are many, some.
EVERY = "BRENVIK_EVERY_ALLOCATION" in os.environ
MOST_PROBLEMS = 20
MOST_LOST_BY_A_LIBRARY = 4
CLOSING_THREAD_BLOCKS = 2  # its list of accounts, and what the C library keeps for a thread
REFUSED_AT_ONCE = 50  # check-ins of one account; any more wait
LAST_DEADLY = 5  # of a location request: what queues it comes first
OUT_OF_MEMORY = (3, 6)
NO_ANSWER = (wire.Closed, TimeoutError, BrokenPipeError, AssertionError)

HOME = pathlib.Path("/var/mobile")
LIBRARY = HOME / "Library"
WORK = pathlib.Path("/tmp/work")
PREFERENCES = pathlib.Path("/root/Library/Preferences")


def short(text):
    return wire.field(str(text), 256)


def long(text):
    return wire.field(str(text), 1024)


def numbers(count, all_up_to, more):
    """Which of `count` allocations fail: the first, and some that lie evenly among the others."""
    if EVERY or count <= all_up_to + more:
        return list(range(1, count + 1))
    step = (count - all_up_to) / more
    return list(range(1, all_up_to + 1)) + [all_up_to + int(step * (i + 1)) for i in range(more)]


def files_below(*folders):
    """What stands there: names, kinds, owners and contents."""
    found = {}
    for folder in folders:
        for path in [folder, *folder.rglob("*")]:
            try:
                info = path.lstat()
            except FileNotFoundError:
                continue
            content = (os.readlink(path) if stat.S_ISLNK(info.st_mode)
                       else path.read_bytes() if stat.S_ISREG(info.st_mode) else None)
            found[str(path)] = (info.st_mode, info.st_uid, content)
    return found


class Request:
    """What is asked, and how to tell a right answer.

    `prepare` brings everything to the state before the request, `state` tells the state. Both without failures.
    """

    def __init__(self, send, right, prepare=lambda: None, state=lambda: None, failures=OUT_OF_MEMORY, refused=None,
                 finish=lambda: None, between=(), lingering=0, deadly=None, leaky=None):
        self.send, self.right, self.prepare, self.state = send, right, prepare, state
        self.failures = failures  # statuses that say that it was not carried out
        self.refused = refused    # an answer that says so
        self.finish = finish      # waits for what the request has set going
        self.between = between    # states that a failure may leave as well
        self.deadly = deadly      # tells from where memory was asked for whether the failure ends the daemon, by design
        self.leaky = leaky        # a library that loses some blocks itself when it lacks others
        self.lingering = lingering  # seconds for which a timer keeps something of it


@unittest.skipUnless(allocations.AVAILABLE, "a sanitizer has the heap to itself")
class AllocationsTest(HelperTest):
    def setUp(self):
        self.allocations = allocations.Allocations()
        self.addCleanup(self.allocations.close)
        self.problems = []
        super().setUp()
        self.restart()

    def restart(self):
        self.daemon.stop()
        self.daemon = Daemon(environment=self.allocations.environment)
        self.caller = self.client()
        # Opens both logs: a descriptor each, for good.
        self.assertEqual(self.caller.status("RemoveCarrierFile", long("/nowhere"), long("no domain")), 8)
        self.maps = self.daemon.maps()

    def start_closing_thread(self):
        """It starts with the first descriptor of somebody else's that is dropped, and stays."""
        connection = wire.connect()
        connection.status(wire.header(1, 24), [0, 0])
        connection.close()
        harness.eventually(lambda: "closing" in self.daemon.threads(), what="the thread")

    def problem(self, what):
        self.problems.append(what)
        print(what, file=sys.stderr, flush=True)
        if len(self.problems) >= MOST_PROBLEMS:
            self.fail_with_problems()

    def fail_with_problems(self):
        self.fail(f"{len(self.problems)} problems:\n" + "\n\n".join(self.problems))

    def ask(self, request):
        """What was answered: ("status", code) or ("answer", value)."""
        try:
            return "answer", request.send(self.caller)
        except wire.Status as status:
            return "status", status.code

    def is_right(self, request, answer):
        return answer[0] == "answer" and request.right(answer[1])

    def holdings(self):
        """What the daemon has: blocks, descriptors, threads, mappings."""
        return (self.allocations.live, self.daemon.descriptors(), self.daemon.threads(),
                len(self.daemon.maps().splitlines()))

    def hold(self, request):
        """Keeps in mind what the daemon has now that the request is nothing new to it."""
        time.sleep(request.lingering)
        self.held, self.forgiven = (), 0
        quiet = Quiet(self)
        while self.held != (now := self.holdings()):  # twice the same: what comes after the reply has been done
            self.held = now
            time.sleep(0.02)
            quiet()
        self.maps = self.daemon.maps()

    def succeed(self, request, when):
        request.prepare()
        self.last_failed = False
        try:
            answer = self.ask(request)
            request.finish()
        except NO_ANSWER as error:
            answer = "nothing", repr(error)
        if not self.is_right(request, answer):
            self.problem(f"{when}: without a failure the answer is {answer}, after\n"
                         + self.allocations.who(self.maps))
            self.daemon.stop()
            self.restart()

    def sweep(self, request, name, all_up_to=130, more=20):
        """All of it for one request."""
        for _ in range(3):
            self.succeed(request, f"{name} before")
        self.assertEqual(self.problems, [])
        request.prepare()
        self.last_failed = False
        old = request.state()
        before = self.allocations.made
        self.ask(request)
        request.finish()
        count = self.allocations.made - before
        new = request.state()
        self.hold(request)
        for to in (None, EVER):
            for number in numbers(count, all_up_to, more):
                self.fail_at(request, number, to, old, new, f"{name} {number} of {count}{' and on' if to else ''}")
            if not request.lingering:
                self.compare(f"{name}{' all' if to else ' one'}")
        time.sleep(request.lingering)
        self.compare(name)
        if self.problems:
            self.fail_with_problems()
        return count

    def fail_at(self, request, number, to, old, new, when):
        # Of the daemon that came after one that ended: once for all that end by design, which come first.
        if self.held is None and (request.deadly is None or number > LAST_DEADLY):
            self.hold(request)
        request.prepare()
        self.last_failed = True
        self.allocations.arm(number, to)
        try:
            answer = self.ask(request)
            request.finish()
        except NO_ANSWER as error:
            answer = ("nothing", repr(error))
        finally:
            self.allocations.disarm()
        who = lambda: "\n" + self.allocations.who(self.maps)
        if request.deadly and self.allocations.failed > 0 and request.deadly(self.allocations, self.maps, to):
            try_for(lambda: not self.daemon.running(), 5)  # it may have answered before, and takes a while to end
        if not self.daemon.running() or answer[0] == "nothing":
            try:
                self.daemon.process.wait(5)
            except Exception:
                pass
            alive = self.daemon.running()
            self.daemon.stop()
            if alive or not (request.deadly and request.deadly(self.allocations, self.maps, to)):
                self.problem(f"{when}: {answer}; alive: {alive} {self.daemon.process.returncode} {self.daemon.stderr}{who()}")
            self.restart()
            for _ in range(3):
                self.succeed(request, when)
            self.held = None
            return
        state = request.state()
        if (answer[0] == "status" and answer[1] in request.failures
                or request.refused is not None and answer == ("answer", request.refused)):
            if state not in (old, new, *request.between):
                self.problem(f"{when}: neither old nor new: {self.difference(state, old)}{who()}")
        elif self.is_right(request, answer):
            if state != new:
                self.problem(f"{when}: said done, but {self.difference(state, new)}{who()}")
        else:
            self.problem(f"{when}: answered {answer}{who()}")
        self.succeed(request, f"{when}, again")
        if request.state() != new:
            self.problem(f"{when}, again: {self.difference(request.state(), new)}{who()}")
        if request.leaky:
            self.forgive(request.leaky, who)
        self.expect_closing_thread(request, when)

    def expect_closing_thread(self, request, when):
        """What an answer of a worker carries and lack of memory drops is closed by a thread, which starts then and stays."""
        before = self.held
        if before is None or self.daemon.threads().count("closing") == before[2].count("closing"):
            return
        more = self.forgiven + CLOSING_THREAD_BLOCKS
        self.hold(request)
        if (sorted([*before[2], "closing"]) != sorted(self.held[2]) or self.held[1] != before[1]
                or self.held[0] - before[0] > more):
            self.problem(f"{when}: holds {self.held} with the closing thread, before {before} and {more} more blocks at most")

    def forgive(self, library, who):
        for _ in range(100):
            lost = self.allocations.live - self.held[0] - self.forgiven
            if lost <= 0:
                return
            time.sleep(0.002)
        if lost <= MOST_LOST_BY_A_LIBRARY and library in who():
            self.forgiven += lost

    @staticmethod
    def difference(state, wanted):
        if isinstance(state, dict) and isinstance(wanted, dict):
            different = sorted(key for key in {*state, *wanted} if state.get(key) != wanted.get(key))
            return f"{len(different)}: " + " ".join(f"{key} {state.get(key)!r:.60} not {wanted.get(key)!r:.60}"
                                                    for key in different[:2])
        return f"{state!r:.200} not {wanted!r:.200}"

    def compare(self, when):
        def as_before():
            live, *others = self.holdings()
            # A few less: a queue that was longer then has given a part of its room back.
            return others == list(self.held[1:]) and -4 <= live - self.held[0] <= self.forgiven
        try:
            eventually(as_before, 3)
        except AssertionError:
            self.problem(f"{when}: holds {self.holdings()}, before {self.held} and {self.forgiven} more blocks at most")


def done(code):
    return code == 0


def done_well(result):
    return result == 1


def succeeded(code):
    if code != 0:
        raise wire.Status(code)
    return code


def status(name, *arguments):
    return lambda client: succeeded(client.status(name, *arguments))


def integer(name, *arguments):
    return lambda client: client.integer(name, *arguments)


class Preferences(AllocationsTest):
    def prepare(self):
        super().prepare()
        shutil.rmtree(PREFERENCES, ignore_errors=True)
        PREFERENCES.mkdir(parents=True)

    DOMAIN = "com.example.memory"

    def set(self, value, way="in line"):
        return lambda client: succeeded(client.set_preference(self.DOMAIN, "key", value, way))

    def stored(self, value):
        """Prepares: the key has this value on the disk; other keys stand beside it."""
        def prepare():
            path = PREFERENCES / f"{self.DOMAIN}.plist"
            path.with_suffix(".new").write_bytes(plistlib.dumps({"key": value, "other": ["kept", 1]}))
            path.with_suffix(".new").rename(path)
        return prepare

    def state(self):
        return {str(path): plistlib.loads(path.read_bytes()) if path.suffix == ".plist" else None
                for path in PREFERENCES.rglob("*") if path.is_file()}

    VALUE = {"text": "Grüße", "number": 7, "list": [1, [2, [3]]], "data": b"\0" * 100}

    def test_set(self):
        for fmt in (plistlib.FMT_XML, plistlib.FMT_BINARY):
            self.sweep(Request(self.set(plistlib.dumps(self.VALUE, fmt=fmt)), done, self.stored("old"), self.state,
                               failures=(3, 5, 6)), f"set {fmt}")

    def test_remove(self):
        self.sweep(Request(self.set(b"\0"), done, self.stored("old"), self.state, failures=(3, 5, 6)), "remove")

    def test_set_large(self):
        self.start_closing_thread()  # where the value's memory goes when the request is refused
        value = os.urandom(100_000)
        self.sweep(Request(self.set(plistlib.dumps(value, fmt=plistlib.FMT_BINARY), "memfd"), done, self.stored("old"),
                           self.state, failures=(3, 5, 6)), "set large")

    def test_copy(self):
        for name in ("CopyPreferenceValue", "CopyAppPreferenceValue"):
            for value in (self.VALUE, {"large": os.urandom(100_000)}):
                now = {}

                def prepare():
                    # Another program stores another value each time, so that one from before is noticed.
                    now.update(value, number=now.get("number", 100) + 1)
                    self.stored(now)()
                self.sweep(Request(lambda client: client.copy_preference(self.DOMAIN, "key", name),
                                   lambda answer: answer and plistlib.loads(answer) == now, prepare,
                                   failures=(3, 5, 6)), name)

    def test_load(self):
        path = WORK / "list.plist"
        WORK.mkdir(exist_ok=True)
        for value in ({"a": self.VALUE, "b": [self.VALUE] * 3}, {"data": os.urandom(100_000)}):
            path.write_bytes(plistlib.dumps(value))
            self.sweep(Request(lambda client: plistlib.loads(client.load_plist(str(path))),
                               lambda answer: answer == value, failures=(3, 6, 9)), "LoadPlistFile")


class LibraryTest(AllocationsTest):
    def prepare(self):
        super().prepare()
        for folder in (LIBRARY, WORK):
            shutil.rmtree(folder, ignore_errors=True)
            folder.mkdir(parents=True)


class Carrier(LibraryTest):
    BUNDLES = LIBRARY / "Carrier Bundles"

    def prepare(self):
        super().prepare()
        (LIBRARY / "Logs/CrashReporter").mkdir(parents=True)

    def state(self):
        return files_below(LIBRARY, WORK)

    @staticmethod
    def linked(path, target="old"):
        def prepare():
            path.unlink(missing_ok=True)
            if target is not None:
                path.symlink_to(target)
        return prepare

    def test_create_symlink(self):
        for before in ("old", None):
            link = WORK / "link"
            self.sweep(Request(status("CreateSymlink", long("n" * 50), long(link)), done, self.linked(link, before),
                               self.state, failures=(5, 6)), "CreateSymlink")

    def test_replace_carrier_symlink(self):
        link = LIBRARY / "Carrier Bundle.bundle"
        self.sweep(Request(status("ReplaceCarrierSymlink", long("n" * 50), long(link), long("com.norvale.carrier")),
                           done, self.linked(link), self.state, failures=(5, 6)), "ReplaceCarrierSymlink")

    def test_remove_carrier_file(self):
        link = LIBRARY / "Carrier Bundle.bundle"
        self.sweep(Request(status("RemoveCarrierFile", long(link), long("com.norvale.carrier")),
                           done, self.linked(link), self.state, failures=(5, 6)), "RemoveCarrierFile")

    @staticmethod
    def remove(path):
        if path.is_dir():
            shutil.rmtree(path)
        else:
            path.unlink(missing_ok=True)

    def test_copy_carrier_file(self):
        (WORK / "a rather long name.plist").write_text("content" * 1000)
        to = self.BUNDLES / "A rather long name.bundle"
        to.mkdir(parents=True)
        def prepare():
            (to / "a rather long name.plist").write_text("old")
            os.chown(to / "a rather long name.plist", 0, 0)
        for how in (prepare, lambda: self.remove(to / "a rather long name.plist")):
            self.sweep(Request(integer("CopyCarrierFile", short(WORK), short(to), short("a rather long name.plist")),
                               done_well, how, self.state, refused=0), "CopyCarrierFile")

    def tree(self, folder, files=12):
        for number in range(files):
            path = folder / f"{number % 3}" / f"a file with a long name {number}"
            path.parent.mkdir(parents=True, exist_ok=True)
            path.write_text(f"content {number}")

    def test_copy_crash_logs(self):
        self.tree(WORK / "logs", 12)
        to = LIBRARY / "Logs/CrashReporter/logs"
        self.sweep(Request(integer("CopyCrashLogs", short(WORK / "logs")), done_well, lambda: self.remove(to), self.state,
                           refused=0), "CopyCrashLogs")

    def test_move(self):
        to = self.BUNDLES / "here"
        to.mkdir(parents=True)

        def prepare():
            self.remove(to / "Moved.bundle")
            self.tree(WORK / "Moved.bundle")
        self.sweep(Request(integer("MoveIntoCarrierBundles", short(WORK / "Moved.bundle"), short(to),
                                        short("Moved.bundle")), done_well, prepare, self.state, refused=0), "Move")

    def test_unpack(self):
        with zipfile.ZipFile(WORK / "archive.zip", "w", zipfile.ZIP_DEFLATED) as archive:
            for number in range(6):
                archive.writestr(f"folder {number}/a file with a long name {number}", "content" * 1000)
        to = WORK / "unpacked"
        self.sweep(Request(integer("UnpackArchive", short(WORK / "archive.zip"), short(to)), done_well,
                           lambda: self.remove(to), self.state, refused=0), "UnpackArchive")


class Voicemail(LibraryTest):
    DATABASE = LIBRARY / "Voicemail" / "voicemail.db"

    def rows(self):
        if not self.DATABASE.exists():
            return None
        with sqlite3.connect(self.DATABASE) as database:
            tables = [name for name, in database.execute("SELECT name FROM sqlite_master WHERE type='table' ORDER BY name")]
            return {name: sorted(database.execute(f"SELECT * FROM {name}")) for name in tables}

    def call(self, name, *arguments):
        code = self.caller.status(name, *map(short, arguments))
        self.assertEqual(code, 0)

    def test_tokens(self):
        def old():
            self.call("ResetVoicemailStore")
            self.call("SetVoicemailToken", "old" * 20)
            self.call("SetVoicemailTokenForKey", "key" * 20, "value" * 20)
        # A reset takes each of its two steps, whether or not the other has failed.
        cleared = {"general": [], "tokens": [("key" * 20, "value" * 20)]}
        removed = {"general": [(0, "old" * 20)], "tokens": []}
        # The last two have one status whatever the store could do.
        for name, arguments, only_status, between in (("SetVoicemailToken", ["new" * 20], None, ()),
                                                      ("SetVoicemailTokenForKey", ["key" * 20, "new" * 20], None, ()),
                                                      ("SetVoicemailTokenForKey", ["other" * 20, "new" * 20], None, ()),
                                                      ("ClearVoicemailToken", [], 0, ()),
                                                      ("ResetVoicemailStore", [], 0, (cleared, removed))):
            self.sweep(Request(status(name, *map(short, arguments)), done, old, self.rows, failures=(5, 6),
                               refused=only_status, between=between), name, all_up_to=30, more=20)
        old()
        for name, arguments, value, absent in (("CopyVoicemailToken", [], b"old" * 20, b""),
                                               ("CopyVoicemailTokenForKey", ["key" * 20], b"value" * 20, None)):
            self.sweep(Request(lambda client: client.text(name, *map(short, arguments)).split(b"\0")[0],
                               lambda answer: answer == value, failures=(5, 6), refused=absent), name)
        self.sweep(Request(integer("IsVoicemailServiceSubscribed"), done), "subscribed")


SIX = ["USER_LABEL_PRIMARY", "USER_LABEL_SECONDARY", "USER_LABEL_PERSONAL", "USER_LABEL_BUSINESS",
       "USER_LABEL_TRAVEL", "USER_LABEL_CELL_DATA"]


class Labels(LibraryTest):
    def test_labels(self):
        badge = [part for text in ("straße und noch mehr", "été", "👨‍👩‍👧 home") for part in ("", text)]
        for name, labels, languages, right in (
                ("CopyBadgeLabels", [*badge, *(part for key in SIX for part in (key, ""))], ["tlh", "sr-Latn-RS", "de"], None),
                ("CopyLocalizedLabels", SIX, ["tlh", "sr-Latn-RS"],
                 ["Glavna", "Sekundarna", "Lična", "Poslovna", "Putovanje", "Mobilni podaci"])):
            message = wire.labels_message(name, plistlib.dumps(labels), plistlib.dumps(languages))
            answer = lambda client: plistlib.loads(client.region(message))
            if right is None:
                right = answer(self.caller)
                self.assertEqual(len(right), 9)
            self.sweep(Request(answer, lambda given: given == right, failures=(3, 5, 6)), name)

    CONTACTS = LIBRARY / "AddressBook/contacts.db"

    def contacts(self):
        with sqlite3.connect(self.CONTACTS) as database:
            return sorted(database.execute("SELECT * FROM contact_channels")), sorted(os.listdir(self.CONTACTS.parent))

    def test_remap(self):
        self.CONTACTS.parent.mkdir(parents=True)
        with sqlite3.connect(self.CONTACTS) as database:
            database.execute("CREATE TABLE contact_channels(contact_id INTEGER NOT NULL, channel_identifier TEXT NOT NULL)")
            database.executemany("INSERT INTO contact_channels VALUES(?, '')", ((i,) for i in range(10)))
            database.commit()

        def prepare():
            with sqlite3.connect(self.CONTACTS) as database:
                database.execute("UPDATE contact_channels SET channel_identifier = 'old' WHERE contact_id < 7")
                database.commit()
        self.sweep(Request(integer("RemapContactsChannel", wire.field("old", 64), wire.field("new" * 15, 64)), done_well,
                           prepare, self.contacts, refused=0), "Remap", all_up_to=30, more=40)

    def test_radio(self):
        self.sweep(Request(status("EnableRadioManagerLogs", struct.pack("<i", 1)), done), "radio")


class Quiet:
    """Tells when what a request has set going has ended: the daemon asks for no memory and no thread of it runs.

    That is so when it has been seen so many times, two milliseconds apart. On a busy machine we may be late for a look as well
    as the daemon for its work, so time alone tells nothing.
    """

    def __init__(self, test, looks=4):
        self.test, self.looks = test, looks

    def __call__(self):
        made, seen = None, 0
        while seen < self.looks and self.test.daemon.running():
            now = self.test.allocations.made, self.sleeping()
            seen = seen + 1 if now == (made, True) else 0
            made = now[0]
            time.sleep(0.002)

    def sleeping(self):
        try:
            return all(pathlib.Path(f"/proc/{self.test.daemon.pid}/task/{task}/stat").read_text().rsplit(")", 1)[1].split()[0]
                       == "S" for task in os.listdir(f"/proc/{self.test.daemon.pid}/task"))
        except (FileNotFoundError, ProcessLookupError):  # a thread that has just ended
            return False


def try_for(condition, seconds):
    end = time.monotonic() + seconds
    while not condition() and time.monotonic() < end:
        time.sleep(0.002)


def queueing(asked, maps, to):
    """An exception while a location request is queued ends the process, by design."""
    whole = asked.who(maps, everything=True)
    # By the routine, and by the step of the main queue after it: each itself, and not what it hands on.
    return (re.search(r"(\A| < )brenvik::(LocationRoutines::dispatch\w+\([a-z, ]*\)|"
                      r"GeoRequests::dispatch\(std::function<void \(\)>\)::{lambda\(\)#1}::operator\(\)\(\)) ", whole)
            # Before that; what is asked for there fails as well.
            or to == EVER and "brenvik::LocationRoutines::request" in whole)


class Location(AllocationsTest):
    COUNTRY = pathlib.Path("/var/lib/brenvik/country.plist")

    def prepare(self):
        super().prepare()
        network.default_settings()
        self.COUNTRY.parent.mkdir(parents=True, exist_ok=True)

    def configure(self, code):
        """Stored anew, so that it is read."""
        path = self.COUNTRY.with_suffix(".new")
        path.write_bytes(plistlib.dumps({"CountryCode": code}))
        path.rename(self.COUNTRY)

    def test_country_code(self):
        codes = itertools.cycle(("x" * 60, "y" * 60))
        now = []

        def prepare():
            now[:] = [next(codes)]
            self.configure(now[0])
        self.sweep(Request(lambda client: client.text("CopyCountryCode", size=64).rstrip(b"\0").decode(),
                           lambda answer: answer == now[0], prepare), "CopyCountryCode")

    def sweep_pushes(self, name, arguments, right, fallback):
        """A request that is answered by a push: without memory it may not come, or be the fallback; never another."""
        brenvik = Brenvik(self)
        quiet = Quiet(self)
        self.configure("NO")
        send = status(name, *arguments)
        seen = []

        def finish():
            if not self.allocations.armed:
                # The time-out of a request that got no answer may take this one's: requests have no identity.
                for _ in range(5):
                    with brenvik.changed:
                        brenvik.changed.wait_for(lambda: brenvik.pushes, 2)
                    if right in brenvik.pushes:
                        break
                    seen.extend(brenvik.pushes)
                    brenvik.pushes.clear()
                    send(self.caller)
            quiet()
            seen.extend(brenvik.pushes)
            brenvik.pushes.clear()

        def prepare():
            seen.clear()

        def is_right(_):
            return all(push in (right, fallback) for push in seen) and (right in seen or self.last_failed)
        self.sweep(Request(send, is_right, prepare, finish=finish, lingering=5.3, deadly=queueing), name,
                   all_up_to=6, more=8)

    def test_offline(self):
        self.sweep_pushes("RequestCountryCodeFromLocation", [struct.pack("<dd", 59.9133, 10.739)],
                          civic("NO", "Oslo", "Oslo"), civic("NO"))

    def test_wan_ip(self):
        hosts = pathlib.Path("/etc/hosts")
        hosts.write_text(hosts.read_text() + f"127.0.0.1 {STUN}\n")
        server = socket.socket(socket.AF_INET, socket.SOCK_DGRAM)
        server.bind(("127.0.0.1", 3478))
        self.addCleanup(server.close)

        def serve():
            while (asked := server.recvfrom(2048))[0] != b"end":
                server.sendto(WanIpTest.seen_as("203.0.113.9", asked[0]), asked[1])
        thread = threading.Thread(target=serve)
        thread.start()
        self.addCleanup(thread.join)
        self.addCleanup(lambda: server.sendto(b"end", server.getsockname()))
        self.sweep_pushes("RequestWanIPFromLocation", [], address("203.0.113.9"), address(""))


class Heartbeat(AllocationsTest):
    def prepare(self):
        super().prepare()
        network.default_settings()
        network.FarEnd(self, "pdp_ip0", "10.5.0.1/24", ["10.5.0.2/24", f"{REACHABILITY}/32"])
        network.ip("route", "add", "default", "via", "10.5.0.2")

    def test_heartbeat(self):
        quiet = Quiet(self)
        switch = lambda on: status("CellularHeartbeat", struct.pack("<i", on))

        def off():
            switch(0)(self.caller)
            quiet()
        for on in (1, 0):
            def prepare():
                off()
                if not on:
                    switch(1)(self.caller)
                    quiet()
            self.sweep(Request(switch(on), done, prepare, finish=quiet), f"heartbeat {on}")
            off()


def check(client, mask):
    message = wire.simple("CheckLASDUpdate", struct.pack("<I", mask))
    reply, _ = client.channel.exchange(message)
    if struct.unpack_from("<i", reply, 32)[0] != 0:
        raise wire.Status(wire.check_status(message, reply))
    # This routine's reply carries no NDR record on success.
    return wire.check_status(message, reply, ndr=bytes(8))


class Databases(AllocationsTest):
    def prepare(self):
        super().prepare()
        self.updates = UpdateTest()
        self.updates.logs = self.logs
        self.updates.prepare()
        self.addCleanup(self.updates.doCleanups)

    def state(self):
        return {path.name: path.read_bytes() for path in DIRECTORY.iterdir()}, self.updates.records()

    def test_update(self):
        quiet = Quiet(self, 5)
        version = itertools.count(1)
        port = self.updates.port
        self.expected = None
        seen = []

        def prepare():
            self.expected = self.updates.serve({"gsm": f"{next(version)}"})
            port.clear()
            seen.clear()

        def finish():
            if not self.last_failed:
                port.wait_for(1)
            else:
                quiet()
                self.allocations.disarm()
                # One check after the other: this one, which finds nothing to do, tells that the first has ended.
                check(self.caller, 0)
                eventually(lambda: "NoUpdateRequired" in port.texts(), 30, "the end of the check")
            seen.extend(port.texts())
            port.clear()

        def is_new():
            try:
                self.updates.assert_installed(self.expected)
                return True
            except (AssertionError, FileNotFoundError):
                return False

        def is_right(_):
            if self.last_failed:
                # What is announced is so; what failed may not even be announced.
                *announced, _ = seen
                return announced in ([], ["UpdateFailed"]) or announced == ["UpdateAvailable gsm"] and is_new()
            return seen == ["UpdateAvailable gsm"] and is_new()

        def leftovers():
            return sorted(path.name for path in DIRECTORY.iterdir() if path.name != "gsm.db")
        self.sweep(Request(lambda client: check(client, MASKS["gsm"]), is_right, prepare, leftovers, finish=finish,
                           leaky="libcrypto.so"), "CheckLASDUpdate", all_up_to=30, more=40)


class CheckIn(AllocationsTest):
    def check_in(self, account=None):
        """Of a process that is new to the daemon; 0, a status, or 254 when the connection was closed instead."""
        def work():
            try:
                wire.Client().close()
                return 0
            except wire.Status as status:
                return status.code
            except (wire.Closed, BrokenPipeError):
                return 254
        return harness.as_account(account or "root", work)

    def has_clock(self):
        return any("timerfd" in each for each in harness.open_files(self.daemon.pid))

    def sweep_check_in(self, account, right, name):
        self.start_closing_thread()
        # The account's refusals are counted from its first one on. The one that is first to wait for its limit makes the
        # loop's clock, which stays; then waiting is among what is done while memory lacks.
        harness.entitle(value=False)

        def refused_at_once():  # by one process: starting one for each may take as long as the limit lasts
            for _ in range(REFUSED_AT_ONCE):
                with contextlib.suppress(wire.Status, wire.Closed, BrokenPipeError):
                    wire.Client().close()
            return 0
        eventually(lambda: harness.as_account(account or "root", refused_at_once) == 0 and self.has_clock(),
                   what="a refusal that waits")
        harness.entitle()
        quiet = Quiet(self)
        # Closed without an answer: the client tries again. 35: what might say no could not be read.
        def send(_):
            code = self.check_in(account)
            if code in (3, 5, 6, 35, 254) and code != right:
                raise wire.Status(code)
            return code
        self.sweep(Request(send, lambda code: code == right, failures=(3, 5, 6, 35, 254), finish=quiet), name, all_up_to=60,
                   more=20)

    def test_granted(self):
        self.sweep_check_in(None, 0, "check-in")

    def test_refused(self):
        self.sweep_check_in("stranger", 35, "refused check-in")

    def test_a_file_that_says_no_is_not_passed_over_in_favour_of_one_that_says_yes(self):
        harness.entitle("10-no.plist", value=False)
        self.addCleanup((harness.ENTITLEMENTS / "10-no.plist").unlink)
        self.sweep_check_in(None, 35, "denied check-in")


class FirstRequest(AllocationsTest):
    """Of a daemon's life: it makes what the later ones use."""

    def sweep_first(self, name, send, right, failures=OUT_OF_MEMORY, refused=None, prepare=lambda: None, finish=None,
                    deadly=None, points=16):
        count = 0
        for to in (None, None, EVER):
            for number in numbers(count, points // 4, points) or [1 << 40]:  # first none, to learn how many there are
                self.daemon.stop()
                self.daemon = Daemon(environment=self.allocations.environment)
                self.caller = self.client()
                self.maps = self.daemon.maps()
                prepare()
                when = f"{name} {number} of {count}{' and on' if to else ''}"
                before = self.allocations.made
                self.allocations.arm(number, to)
                try:
                    answer = "answer", send(self.caller)
                    (finish or (lambda: None))()
                except wire.Status as status:
                    answer = "status", status.code
                except NO_ANSWER as error:
                    answer = "nothing", repr(error)
                finally:
                    self.allocations.disarm()
                if count == 0:
                    self.assertTrue(right(answer[1]), answer)
                    count = self.allocations.made - before
                    continue
                if deadly and self.allocations.failed > 0 and deadly(self.allocations, self.maps, to):
                    try_for(lambda: not self.daemon.running(), 5)  # it may have answered before, and takes a while to end
                    if not self.daemon.running():
                        answer = "nothing", "it ended"
                if answer[0] == "nothing":
                    with contextlib.suppress(OSError):
                        self.maps = self.daemon.maps() or self.maps  # nothing of a process that has ended
                    self.daemon.stop()
                    if deadly and deadly(self.allocations, self.maps, to):
                        continue
                    # The C library ends a process that lacks memory while it reads nsswitch.conf for the first time.
                    if re.search(rb"nss_database|\AUnexpected error\.|\A\Z", self.daemon.stderr) and "getpw" in \
                            self.allocations.who(self.maps, everything=True):
                        continue
                    self.problem(f"{when}: {answer} {self.daemon.stderr}\n{self.allocations.who(self.maps)}")
                    continue
                self.maps = self.daemon.maps()
                if not (answer[0] == "answer" and right(answer[1]) or answer[0] == "status" and answer[1] in failures
                        or refused is not None and answer == ("answer", refused)):
                    self.problem(f"{when}: {answer}\n{self.allocations.who(self.maps)}")
                prepare()
                try:
                    again = send(self.caller)
                    if not right(again):
                        self.problem(f"{when}, again: {again}\n{self.allocations.who(self.maps)}")
                except wire.Status as status:
                    self.problem(f"{when}, again: {status}\n{self.allocations.who(self.maps)}")
        if self.problems:
            self.fail_with_problems()


class FirstUse(FirstRequest):
    def test_plist(self):
        path = pathlib.Path("/tmp/list.plist")
        path.write_bytes(plistlib.dumps({"a": 1}))
        self.sweep_first("LoadPlistFile", lambda client: plistlib.loads(client.load_plist(str(path))),
                         lambda answer: answer == {"a": 1}, (3, 6, 9))

    def test_preference(self):
        PREFERENCES.mkdir(parents=True, exist_ok=True)
        (PREFERENCES / "com.example.first.plist").write_bytes(plistlib.dumps({"key": "value"}))
        self.sweep_first("CopyPreferenceValue", lambda client: client.copy_preference("com.example.first", "key"),
                         lambda answer: answer and plistlib.loads(answer) == "value", (3, 5, 6))

    def test_carrier(self):
        LIBRARY.mkdir(parents=True, exist_ok=True)
        link = LIBRARY / "Carrier Bundle.bundle"
        self.sweep_first("ReplaceCarrierSymlink",
                         status("ReplaceCarrierSymlink", long("target"), long(link), long("com.norvale.carrier")),
                         done, (5, 6, 8))  # 8: what the policy cannot look at it refuses

    def test_crash_logs(self):
        shutil.rmtree(LIBRARY / "Logs", ignore_errors=True)
        (LIBRARY / "Logs/CrashReporter").mkdir(parents=True)
        WORK.mkdir(exist_ok=True)
        (WORK / "crash").write_text("boom")
        self.sweep_first("CopyCrashLogs", lambda client: client.integer("CopyCrashLogs", short(WORK / "crash")), done_well,
                         refused=0)

    def test_voicemail(self):
        LIBRARY.mkdir(parents=True, exist_ok=True)
        self.sweep_first("voicemail", status("SetVoicemailToken", short("token")), done, (5, 6))
        self.sweep_first("voicemail", lambda client: client.text("CopyVoicemailToken").rstrip(b"\0"),
                         lambda token: token == b"token", refused=b"")

    def test_labels(self):
        message = wire.labels_message("CopyLocalizedLabels", plistlib.dumps(SIX), plistlib.dumps(["de"]))
        right = ["Primär", "Sekundär", "Privat", "Geschäftlich", "Reise", "Mobile Daten"]
        self.sweep_first("CopyLocalizedLabels", lambda client: plistlib.loads(client.region(message)),
                         lambda answer: answer == right, (3, 5, 6))

    def test_remap(self):
        contacts = LIBRARY / "AddressBook/contacts.db"
        contacts.parent.mkdir(parents=True, exist_ok=True)
        with sqlite3.connect(contacts) as database:
            database.execute("CREATE TABLE contact_channels(contact_id INTEGER NOT NULL, channel_identifier TEXT NOT NULL)")
            database.execute("INSERT INTO contact_channels VALUES(1, 'old')")
            database.commit()
        self.addCleanup(contacts.unlink)

        def prepare():
            with sqlite3.connect(contacts) as database:
                database.execute("UPDATE contact_channels SET channel_identifier = 'old'")
                database.commit()

        def send(client):
            answer = client.integer("RemapContactsChannel", wire.field("old", 64), wire.field("new", 64))
            with sqlite3.connect(contacts) as database:
                (channel,), = database.execute("SELECT channel_identifier FROM contact_channels")
            return answer if (channel == "new") == (answer == 1) else f"{answer}, and it is {channel}"
        self.sweep_first("RemapContactsChannel", send, done_well, refused=0, prepare=prepare)


class FirstUpdate(FirstRequest):
    """Starts the network worker. How the first check ends is told by a second one, which waits for it."""

    def test_database(self):
        updates = UpdateTest()
        updates.logs = self.logs
        updates.prepare()
        self.addCleanup(updates.doCleanups)
        version = itertools.count(1)

        def prepare():
            self.expected = updates.serve({"gsm": f"{next(version)}"})
            updates.port.clear()

        def finish():
            Quiet(self)()
            self.allocations.disarm()
            self.maps = self.daemon.maps()
            check(self.caller, 0)
            eventually(lambda: "NoUpdateRequired" in updates.port.texts(), 30, "the end of the check")
            *announced, _ = updates.port.texts()
            if announced == ["UpdateAvailable gsm"]:
                updates.assert_installed(self.expected)
            else:
                self.assertIn(announced, ([], ["UpdateFailed"]))
        self.sweep_first("CheckLASDUpdate", lambda client: check(client, MASKS["gsm"]), done, prepare=prepare, finish=finish,
                         points=12)

class FirstGeocoding(FirstRequest):
    """Starts it, too."""

    def test_geocoder(self):
        self.daemon.stop()
        geocoder = GeocoderTest()
        geocoder.prepare()
        self.addCleanup(geocoder.doCleanups)
        geocoder.says(json.dumps(PARIS))
        brenvik = Brenvik(self)

        def is_possible(push):
            # The server's answer, the gazetteer's, or none.
            return push in (civic("FR", "Île-de-France", "Paris", "75007"), civic("NO")) or (
                push[1]["CountryCode"], push[1]["State"], push[1]["PostalCode"]) == ("FR", "Île-de-France", "")

        def finish():
            # Not quiet yet while the server's answer is waited for.
            eventually(lambda: brenvik.pushes or self.allocations.failed > 0 or not self.daemon.running(), 20, "a push")
            Quiet(self)()
            self.assertEqual([push for push in brenvik.pushes if not is_possible(push)], [])
            brenvik.pushes.clear()
        self.sweep_first("RequestCountryCodeFromLocation",
                         status("RequestCountryCodeFromLocation", struct.pack("<dd", 48.8584, 2.2945)), done,
                         finish=finish, deadly=queueing, points=12)


class Activation(AllocationsTest):
    def test_who_waits_for_a_daemon_that_cannot_start_is_served_by_the_next_one(self):
        """Memory lacks from the very start on; the socket stays, and with it whoever has connected."""
        listening = harness.listen()
        self.addCleanup(listening.close)

        def start():
            daemon = Daemon(activated=True, listening=listening, environment=self.allocations.environment)
            daemon.listening = None  # for the next one, too
            return daemon

        def run(number, to):
            """The answer, and how the first daemon ended, if it did."""
            self.daemon.stop()
            self.allocations.rewind()
            self.allocations.arm(number, to)
            first = self.daemon = start()
            served = threading.Event()

            def be_the_service_manager():
                while not served.is_set():
                    if self.daemon.process.poll() is not None:
                        self.allocations.disarm()
                        self.daemon.stop()
                        self.daemon = start()
                    time.sleep(0.002)
            manager = threading.Thread(target=be_the_service_manager)
            manager.start()
            answer = None
            for _ in range(5):
                try:
                    with wire.Client() as client:
                        answer = client.status("EnableRadioManagerLogs", struct.pack("<i", 0))
                except (wire.Closed, BrokenPipeError) as error:
                    answer = repr(error)
                except (wire.Status, TimeoutError) as error:
                    answer = str(error)
                self.allocations.disarm()
                if answer == 0:
                    break
            served.set()
            manager.join()
            first.process.poll()
            return answer, first.process.returncode, first.stderr
        self.assertEqual(run(1 << 40, None), (0, None, b""))
        count = self.allocations.made
        for to in (None, EVER):
            for number in numbers(count, 0, 40):
                answer, status, stderr = run(number, to)
                if answer != 0 or status not in (None, 0, 1):  # 0: it cannot count down its idle time, and leaves
                    self.problem(f"start {number} of {count}{' and on' if to else ''}: {answer}, {status} {stderr}\n"
                                 + self.allocations.who(self.maps))
        if self.problems:
            self.fail_with_problems()


if __name__ == "__main__":
    main()
