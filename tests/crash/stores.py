# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What is changed on the disk while the helper is killed or the power is cut, and what must stand there afterwards.

A store takes one step after the other. After an interruption, check() finds the old state whole or the new one whole, and
the new one when the step was answered; what it finds is what the next step changes.
"""
import os
import pathlib
import plistlib
import pwd
import shutil
import zipfile

import wire
from test_lasd import DIRECTORY, MASKS, RECORDS, request_check

HOME = pathlib.Path("/var/mobile")
LIBRARY = HOME / "Library"
BUNDLES = LIBRARY / "Carrier Bundles"
STAGING = HOME / "staging"
WORK = pathlib.Path("/tmp/work")
MOBILE = pwd.getpwnam("mobile").pw_uid


def short(text):
    return wire.field(str(text), 256)


def long(text):
    return wire.field(str(text), 1024)


def content_of(tree):
    """Every item below, by its path in the tree; a file's content, None for a folder. None when nothing is there."""
    if not tree.is_dir():
        return None
    return {str(path.relative_to(tree)): path.read_bytes() if path.is_file() else None for path in tree.rglob("*")}


def leftovers(*folders):
    """What a killed helper had made and not shown yet."""
    return [path for folder in folders if folder.is_dir() for path in folder.iterdir() if path.name.startswith(".brenvik-")]


class Store:
    """One sort of change. `test` gives access to the daemon; `generator` chooses sizes and the like."""
    # Nobody waits until the disk knows that a hidden item was removed.
    removals_may_be_lost = False

    def __init__(self, test, generator):
        self.test, self.generator, self.number = test, generator, 0

    def prepare(self):
        """Once, before the first step, on a file system that is mounted."""

    def ready(self, client):
        """Chooses the next step. May ask the daemon for what should not be part of it."""
        raise NotImplementedError

    def step(self, client):
        """Takes it. True when it was answered as done; raises wire.Closed when nobody answered."""
        raise NotImplementedError

    def check(self, client, answered):
        """Fails the test unless the old state is there, or the new one."""
        raise NotImplementedError

    def victim(self):
        """The process to kill."""
        return self.test.daemon.pid

    def is_excused(self, killed):
        """Whether an answered step may be missing, because the helper was told that it failed."""
        del killed
        return False

    def check_leftovers(self, answered, *folders):
        """An interrupted step leaves one in each folder at most; the next one that works there removes it."""
        most = 0 if answered and not self.removals_may_be_lost else 1
        for folder in folders:
            left = [path.name for path in leftovers(folder)]
            self.test.assertLessEqual(len(left), most, f"{folder}: {left}")

    def old_or_new(self, found, answered):
        """For stores whose state is one value: found must be self.old or self.new."""
        allowed = [self.new] if answered else [self.old, self.new]
        self.test.assertTrue(found in allowed, f"{short_of(found)} is none of {[short_of(each) for each in allowed]}")
        self.old = found


def short_of(value):
    text = repr(value)
    return text if len(text) < 200 else f"{text[:200]}... ({len(text)} characters)"


class Preferences(Store):
    """A value of a domain with other values is set, made larger or smaller, or removed."""
    DOMAIN = "com.example.crash"
    FOLDER = pathlib.Path("/root/Library/Preferences")

    old = new = None

    def prepare(self):
        with wire.Client() as client:
            for number in range(5):
                assert client.set_preference(self.DOMAIN, f"other {number}", plistlib.dumps(number)) == 0

    def ready(self, client):
        self.number += 1
        size = self.generator.choice((0, 10, 3000, 20000, 70000))
        self.new = None
        if self.old is None or self.generator.random() < 0.8:
            self.new = [self.number, self.generator.randbytes(size)]

    def step(self, client):
        value = b"x" if self.new is None else plistlib.dumps(self.new)
        way = "memfd" if len(value) > 60000 else "in line"
        self.test.assertEqual(client.set_preference(self.DOMAIN, "key", value, way), 0)
        return True

    def check(self, client, answered):
        value = client.copy_preference(self.DOMAIN, "key")
        self.old_or_new(plistlib.loads(value) if value else None, answered)
        for number in range(5):
            self.test.assertEqual(plistlib.loads(client.copy_preference(self.DOMAIN, f"other {number}")), number)
        damaged = [path.name for path in self.FOLDER.iterdir() if self.DOMAIN in path.name]
        self.test.assertEqual(damaged, [f"{self.DOMAIN}.plist"])


class Tokens(Store):
    """A voicemail token is set, for a key or the general one, cleared, or all are; the helper is killed."""
    FAILED = "The voicemail store could not be written"
    KEYS = ("", "one", "two")  # "": the general token

    def __init__(self, test, generator):
        super().__init__(test, generator)
        self.old, self.new = {}, {}

    def prepare(self):
        LIBRARY.mkdir(parents=True, exist_ok=True)
        for path in (HOME, LIBRARY):
            os.chown(path, MOBILE, MOBILE)

    def ready(self, client):
        self.number += 1
        self.new = dict(self.old)
        key = self.generator.choice(self.KEYS)
        kind = self.generator.random()
        token = f"token {self.number} " + "x" * self.generator.choice((0, 100, 200))
        if kind < 0.7:
            self.new[key] = token
            if key:
                self.request = wire.simple("SetVoicemailTokenForKey", short(key), short(token))
            else:
                self.request = wire.simple("SetVoicemailToken", short(token))
        elif kind < 0.9:
            self.new.pop("", None)
            self.request = wire.simple("ClearVoicemailToken")
        else:
            # Two changes, one after the other.
            self.new = {}
            self.request = wire.simple("ResetVoicemailStore")
        self.between = {key: value for key, value in self.old.items() if key} if not self.new else self.new
        self.test.logs.clear()

    def step(self, client):
        self.test.assertEqual(client.channel.status(self.request), 0)
        return True

    def read(self, client):
        found = {}
        for key in self.KEYS:
            text = client.text("CopyVoicemailTokenForKey", short(key)) if key else client.text("CopyVoicemailToken")
            if token := text.split(b"\0")[0].decode():
                found[key] = token
        return found

    def check(self, client, answered):
        found = self.read(client)
        allowed = [self.new] if answered else [self.old, self.between, self.new]
        self.test.assertIn(found, allowed)
        self.old = found


class TokensOfTheWorker(Tokens):
    """The same; the process that has the database open is killed, and the helper goes on."""

    def prepare(self):
        super().prepare()
        with wire.Client() as client:
            assert client.status("SetVoicemailToken", short("first")) == 0
        self.old = {"": "first"}

    def ready(self, client):
        super().ready(client)
        client.text("CopyVoicemailToken")  # so that there is a worker

    def victim(self):
        return self.test.store_worker()

    def is_excused(self, killed):
        # The routines answer 0 whatever became of the store; the log tells.
        return killed and any(text.startswith(self.FAILED) for _, _, text in self.test.logs.lines)


class CarrierFile(Store):
    """A file is copied into the carrier bundles, over the one that is there."""
    NAME = "carrier.plist"
    old = new = None

    def prepare(self):
        WORK.mkdir(exist_ok=True)
        BUNDLES.mkdir(parents=True, exist_ok=True)

    def ready(self, client):
        self.number += 1
        self.new = b"%d " % self.number + self.generator.randbytes(self.generator.choice((0, 5000, 100000)))
        (WORK / self.NAME).write_bytes(self.new)
        os.chown(WORK / self.NAME, 0, 0)

    def step(self, client):
        self.test.assertEqual(client.integer("CopyCarrierFile", short(WORK), short(BUNDLES), short(self.NAME)), 1)
        return True

    def check(self, client, answered):
        place = BUNDLES / self.NAME
        self.old_or_new(place.read_bytes() if place.exists() else None, answered)
        if self.old is not None:
            self.test.assertEqual(place.stat().st_uid, MOBILE)
        self.check_leftovers(answered, BUNDLES)
        self.test.assertEqual({path.name for path in BUNDLES.iterdir()} - {path.name for path in leftovers(BUNDLES)},
                              {self.NAME} if self.old is not None else set())


class Links(Store):
    """The carrier link is set anew, or removed."""
    LINK = LIBRARY / "Carrier Bundle.bundle"
    old = new = None

    def prepare(self):
        LIBRARY.mkdir(parents=True, exist_ok=True)

    def ready(self, client):
        self.number += 1
        self.new = None if self.old is not None and self.generator.random() < 0.3 else str(BUNDLES / f"{self.number}.bundle")

    def step(self, client):
        if self.new is None:
            code = client.status("RemoveCarrierFile", long(self.LINK), long(""))
        else:
            code = client.status("ReplaceCarrierSymlink", long(self.new), long(self.LINK), long("com.example.crash"))
        self.test.assertEqual(code, 0)
        return True

    def check(self, client, answered):
        self.old_or_new(os.readlink(self.LINK) if self.LINK.is_symlink() else None, answered)
        self.check_leftovers(answered, LIBRARY)


class Move(Store):
    """A folder is moved into the carrier bundles, within a file system or from another."""

    def prepare(self):
        for folder in (BUNDLES, STAGING, pathlib.Path("/root/Library/staging")):
            folder.mkdir(parents=True, exist_ok=True)

    def ready(self, client):
        self.number += 1
        # The second is another mount, for which the kernel refuses a rename, of the same disk.
        self.source = self.generator.choice((STAGING, pathlib.Path("/root/Library/staging"))) / str(self.number)
        self.place = BUNDLES / str(self.number)
        (self.source / "below/deep").mkdir(parents=True)
        for number in range(self.generator.choice((1, 4))):
            (self.source / "below" / f"file {number}").write_bytes(self.generator.randbytes(self.generator.choice((10, 9000))))
        (self.source / "top").write_bytes(b"top %d" % self.number)
        self.tree = content_of(self.source)

    def step(self, client):
        self.test.assertEqual(client.integer("MoveIntoCarrierBundles", short(self.source), short(BUNDLES),
                                             short(self.number)), 1)
        return True

    def check(self, client, answered):
        here, there = content_of(self.source), content_of(self.place)
        self.test.assertIn(there, (self.tree, None), "what has been moved is whole")
        self.test.assertIn(here, (self.tree, None), "what has not been moved is whole")
        self.test.assertTrue(here is not None or there is not None, "it is at one place at least")
        if answered:
            self.test.assertEqual((here, there), (None, self.tree))
        for path in (self.source, self.place):  # the next step has a place of its own
            if path.exists():
                shutil.rmtree(path)
        self.check_leftovers(answered, BUNDLES, self.source.parent)


class Unpack(Store):
    """An archive is unpacked into a folder that is there, or not."""

    def prepare(self):
        WORK.mkdir(exist_ok=True)
        HOME.mkdir(parents=True, exist_ok=True)
        self.old = self.new = {}
        self.place = HOME / "unpacked"

    def ready(self, client):
        self.number += 1
        names = ["carrier.plist", "below/strings", "below/deep/other"]
        self.new = {name: b"%d %s" % (self.number, self.generator.randbytes(self.generator.choice((0, 3000, 80000))))
                    for name in names}
        self.archive = WORK / "archive.zip"
        with zipfile.ZipFile(self.archive, "w", zipfile.ZIP_DEFLATED) as archive:
            for name, content in self.new.items():
                archive.writestr(name, content)
        if self.generator.random() < 0.4 and self.place.exists():
            shutil.rmtree(self.place)
            self.old = {}

    def step(self, client):
        self.test.assertEqual(client.integer("UnpackArchive", short(self.archive), short(self.place)), 1)
        return True

    def check(self, client, answered):
        found = {name: content for name, content in (content_of(self.place) or {}).items()
                 if content is not None and not name.startswith(".brenvik-")}
        if answered:
            self.test.assertEqual(found, self.new)
        self.test.assertLessEqual(found.keys(), self.new.keys())
        for name in self.new:  # each file is replaced for itself
            self.test.assertTrue(found.get(name) in (self.old.get(name), self.new[name]), f"{name} is whole")
        if not self.old:
            self.test.assertIn(found, ({}, self.new), "a new folder appears whole")
        self.old = found
        self.check_leftovers(answered, HOME, self.place)


class Install(Store):
    """A database is downloaded, uncompressed and put into the place of an older one, and its version recorded."""

    def prepare(self):
        self.number = self.old = self.new = 0
        self.pad = {0: b""}
        DIRECTORY.parent.mkdir(parents=True, exist_ok=True)
        RECORDS.parent.mkdir(parents=True, exist_ok=True)
        with wire.Client() as client:
            self.ready(client)
            self.step(client)
            self.check(client, True)

    def content(self, number):
        return b"gsm %d " % number + self.pad[number]

    def ready(self, client):
        self.number += 1
        self.new = self.number
        self.pad[self.new] = self.generator.randbytes(self.generator.choice((100, 30000)))
        self.test.serve({"gsm": str(self.new)}, lambda name, version: self.content(int(version)))
        self.test.port.clear()

    def step(self, client):
        request_check(client, MASKS["gsm"])
        self.test.wait_for_notice()
        self.test.assertEqual(self.test.port.texts(), ["UpdateAvailable gsm"])
        return True

    def check(self, client, answered):
        records = plistlib.loads(RECORDS.read_bytes()) if RECORDS.exists() else {}
        recorded = int(records["gsm"]["Version"]) if "gsm" in records else 0
        allowed = [self.new] if answered else [self.old, self.new]
        self.test.assertIn(recorded, allowed)
        file = DIRECTORY / "gsm.db"
        found = file.read_bytes() if file.exists() else None
        # The old one is removed before the new one has its name; then the record is still the old one.
        whole = [self.content(self.new)]
        if recorded != self.new:
            whole += [None, self.content(self.old)]
        self.test.assertTrue(found in whole, f"{short_of(found)}, recorded {recorded}, before {self.old}, after {self.new}")
        if recorded != self.new:
            self.test.port.clear()
            self.step(client)
            self.test.assertEqual(file.read_bytes(), self.content(self.new), "the next check repairs it")
        self.old = self.new
        self.test.assertEqual([path.name for path in DIRECTORY.iterdir()], ["gsm.db"])


ALL = {"preferences": Preferences, "tokens": Tokens, "tokens-worker": TokensOfTheWorker, "copy": CarrierFile, "links": Links,
       "move": Move, "unpack": Unpack, "install": Install}
