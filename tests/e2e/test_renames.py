# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The account "mobile" puts one thing in the place of another, in its own folders, while requests work there.

Nothing of root's or of another account may come to it that way, nor change its owner. A second client calls all the
time and must not notice.
"""
import ctypes
import os
import pathlib
import pwd
import shutil
import signal
import threading
import time
import traceback

import wire
from harness import SLOWNESS, HelperTest, main
from test_carrier import BUNDLES, HOME, LIBRARY, short

MOBILE, TELEPHONY = 501, 601
REPORTER = LIBRARY / "Logs" / "CrashReporter"
THEIRS = pathlib.Path("/var/telephony")  # of another account
PRIVATE = pathlib.Path("/root/private")  # closed, what is in it is not
LONGEST_CALL = 0.1 * SLOWNESS  # seconds, of a client that has nothing to do with it
FILES = 50
SECONDS = 3  # that each attack goes on

libc = ctypes.CDLL(None, use_errno=True)


def exchange(one, other):
    """Both names are never without an item."""
    here, flag = -100, 2
    libc.renameat2(here, os.fsencode(one), here, os.fsencode(other), flag)


def owned(path, number=MOBILE):
    os.chown(path, number, number, follow_symlinks=False)
    return path


def folder(path, number=MOBILE):
    path.mkdir(parents=True, exist_ok=True)
    return owned(path, number)


def file(path, content="x", number=MOBILE, mode=0o644):
    path.write_text(content)
    path.chmod(mode)
    return owned(path, number)


def link(path, target):
    os.symlink(target, path)
    return owned(path)


class Neighbour:
    """A client whose calls are timed until end()."""

    def __init__(self, test):
        self.client, self.machine, self.longest, self.ended = test.client(), test.watch_machine(), 0.0, False
        self.thread = threading.Thread(target=self._call, daemon=True)
        self.thread.start()

    def _call(self):
        while not self.ended:
            started = time.monotonic()
            self.client.copy_preference("com.example.none", "key")
            if (ended := time.monotonic()) - started > LONGEST_CALL:
                self.longest = max(self.longest, self.machine.ran(started, ended))
            time.sleep(0.002)

    def end(self):
        self.ended = True
        self.thread.join()
        return self.longest


class Renames(HelperTest):
    def prepare(self):
        shutil.rmtree(HOME, ignore_errors=True)
        for place in (HOME, LIBRARY, BUNDLES, LIBRARY / "Logs", REPORTER):
            folder(place)
        shutil.rmtree(THEIRS, ignore_errors=True)
        folder(THEIRS, TELEPHONY)
        shutil.rmtree(PRIVATE, ignore_errors=True)
        PRIVATE.mkdir(mode=0o700)

    def setUp(self):
        super().setUp()
        self.caller = self.client()
        neighbour = Neighbour(self)
        self.addCleanup(lambda: self.assertLess(neighbour.end(), LONGEST_CALL))

    def as_mobile(self, step):
        """step() over and over in a process of the account, until the test ends; its id."""
        pid = os.fork()
        if pid == 0:
            try:
                person = pwd.getpwnam("mobile")
                os.setgroups([])
                os.setresgid(person.pw_gid, person.pw_gid, person.pw_gid)
                os.setresuid(person.pw_uid, person.pw_uid, person.pw_uid)
                while True:
                    step()
            except BaseException:
                traceback.print_exc()
            finally:
                os._exit(1)

        def end():
            os.kill(pid, signal.SIGKILL)
            status = os.waitpid(pid, 0)[1]
            self.assertTrue(os.WIFSIGNALED(status), "the attack went on to the end")
        self.addCleanup(end)
        return pid

    def copy(self, source, destination, name):
        return self.caller.integer("CopyCarrierFile", short(source), short(destination), short(name))

    def move(self, source, destination, name):
        return self.caller.integer("MoveIntoCarrierBundles", short(source), short(destination), short(name))

    def crash_logs(self, source):
        return self.caller.integer("CopyCrashLogs", short(source))

    def test_a_private_file_put_in_the_place_of_a_copy_is_not_given_away(self):
        source = file(THEIRS / "carrier.plist", "carrier")
        place, private = BUNDLES / "carrier.plist", BUNDLES / "private"

        def step():
            if os.path.lexists(place):
                try:
                    os.rename(private, place)
                except FileNotFoundError:
                    pass
        self.as_mobile(step)
        end, given, swapped = time.monotonic() + SECONDS, 0, 0
        while time.monotonic() < end:
            place.unlink(missing_ok=True)
            private.unlink(missing_ok=True)
            with open(private, "w", opener=lambda path, flags: os.open(path, flags, 0o600)) as precious:
                self.copy(source.parent, BUNDLES, source.name)
                info = os.fstat(precious.fileno())
            given += info.st_uid != 0
            swapped += not private.exists()
        self.assertGreater(swapped, 0, "it came in between now and then")
        self.assertEqual(given, 0)

    def test_a_private_file_put_in_the_place_of_a_folder_is_not_given_away(self):
        source = file(THEIRS / "name", "carrier")
        place, private = BUNDLES / "name", BUNDLES / "private"
        attack = self.as_mobile(lambda: exchange(place, private))
        end, given = time.monotonic() + SECONDS, 0
        while time.monotonic() < end:
            os.kill(attack, signal.SIGSTOP)
            os.waitpid(attack, os.WUNTRACED)
            for path in (place, private):  # the copy may have taken the place of the file
                if path.is_dir():
                    shutil.rmtree(path)
                path.unlink(missing_ok=True)
            folder(place)
            os.kill(attack, signal.SIGCONT)
            with open(private, "w", opener=lambda path, flags: os.open(path, flags, 0o600)) as precious:
                self.copy(source.parent, BUNDLES, source.name)
                given += os.fstat(precious.fileno()).st_uid != 0
        self.assertEqual(given, 0)

    def test_a_link_put_in_the_place_of_a_folder_leads_no_change_of_owner_out_of_the_tree(self):
        theirs = [file(THEIRS / str(number), "theirs", TELEPHONY) for number in range(FILES)]
        tree, aside = BUNDLES / "tree", link(BUNDLES / "link", THEIRS)
        inside = folder(folder(tree) / "sub")
        for number in range(FILES):
            file(inside / str(number))
        self.as_mobile(lambda: exchange(inside, aside))
        end = time.monotonic() + SECONDS
        while time.monotonic() < end:
            # Without a place to go to: the owners are changed, and the tree stays where it is.
            self.move(tree, BUNDLES, "tree")
            owned(tree)
        self.assertEqual({path.stat().st_uid for path in theirs}, {TELEPHONY})

    def test_a_link_put_in_the_place_of_a_folder_leads_no_copy_out_of_the_tree(self):
        (PRIVATE / "report").write_text("private")
        source, aside = folder(LIBRARY / "reports"), link(LIBRARY / "link", PRIVATE)
        inside = folder(folder(source / "deep") / "sub")
        file(inside / "report", "mine")
        copied = folder(folder(folder(REPORTER / "reports") / "deep") / "sub") / "report"  # copied one by one
        self.as_mobile(lambda: exchange(inside, aside))
        end, leaked = time.monotonic() + SECONDS, 0
        while time.monotonic() < end:
            self.crash_logs(source)
            leaked += copied.exists() and copied.read_text() == "private"
        self.assertEqual(leaked, 0)

    def test_a_link_on_the_way_to_a_source_leads_nowhere(self):
        (PRIVATE / "report").write_text("private")
        (PRIVATE / "below").mkdir()
        link(LIBRARY / "way", PRIVATE)
        self.assertEqual(self.crash_logs(LIBRARY / "way" / "report"), 0)
        self.assertEqual(self.crash_logs(LIBRARY / "way" / "below"), 0)
        self.assertEqual(self.copy(LIBRARY / "way", BUNDLES, "report"), 0)
        self.assertEqual(self.move(LIBRARY / "way" / "below", BUNDLES, "below"), 0)
        self.assertEqual(os.listdir(REPORTER), [])
        self.assertEqual(os.listdir(BUNDLES), [])
        self.assertEqual(sorted(os.listdir(PRIVATE)), ["below", "report"])

    def test_a_link_that_is_merged_does_not_bring_what_it_points_to(self):
        (PRIVATE / "report").write_text("private")
        link(LIBRARY / "reports", PRIVATE)
        folder(REPORTER / "reports")
        self.crash_logs(LIBRARY / "reports")
        self.assertEqual(os.listdir(REPORTER / "reports"), [])

    def test_a_link_that_was_moved_in_with_a_tree_leads_nowhere_afterwards(self):
        tree = folder(LIBRARY / "tree")
        link(tree / "way", PRIVATE)
        self.assertEqual(self.move(tree, BUNDLES, "tree"), 1)
        file(THEIRS / "carrier.plist", "new", TELEPHONY)
        self.assertEqual(self.copy(THEIRS, BUNDLES / "tree" / "way", "carrier.plist"), 0)
        self.assertEqual(os.listdir(PRIVATE), [])

    def test_links_below_the_stores_lead_nothing_out_of_them(self):
        file(THEIRS / "carrier.plist", "new", TELEPHONY)
        link(BUNDLES / "way", PRIVATE)
        self.assertEqual(self.copy(THEIRS, BUNDLES / "way", "carrier.plist"), 0)
        folder(THEIRS / "tree", TELEPHONY)
        self.assertEqual(self.move(THEIRS / "tree", BUNDLES / "way", "tree"), 0)
        shutil.rmtree(REPORTER)
        link(REPORTER, PRIVATE)
        self.assertEqual(self.crash_logs(THEIRS / "tree"), 0)
        self.assertEqual(os.listdir(PRIVATE), [])
        self.assertTrue((THEIRS / "tree").is_dir())

    def test_a_link_as_source_takes_no_file_from_its_owner(self):
        theirs = file(THEIRS / "theirs", "theirs", TELEPHONY)
        link(LIBRARY / "report", theirs)
        self.crash_logs(LIBRARY / "report")
        self.assertEqual(theirs.stat().st_uid, TELEPHONY)
        empty = folder(THEIRS / "empty", TELEPHONY)
        link(LIBRARY / "way", THEIRS)
        folder(REPORTER / "empty")
        self.crash_logs(LIBRARY / "way" / "empty")  # a merge removes its source when that is empty
        self.assertTrue(empty.is_dir())
        self.assertEqual(empty.stat().st_uid, TELEPHONY)

    def test_a_second_name_of_somebody_elses_file_changes_nothing_of_it(self):
        theirs = file(THEIRS / "theirs", "theirs", TELEPHONY, 0o666)  # the system lets everybody make such names
        tree = folder(LIBRARY / "tree")
        os.link(theirs, tree / "name")
        os.link(theirs, LIBRARY / "report")
        file(tree / "own")
        self.assertEqual(self.move(tree, BUNDLES, "tree"), 1)
        self.assertEqual(self.crash_logs(LIBRARY / "report"), 1)
        self.assertEqual(self.copy(LIBRARY, BUNDLES, "report"), 1)
        self.assertEqual((theirs.stat().st_uid, theirs.read_text()), (TELEPHONY, "theirs"))
        self.assertEqual((BUNDLES / "tree" / "own").stat().st_uid, 0)
        self.assertEqual((BUNDLES / "report").stat().st_uid, MOBILE)


if __name__ == "__main__":
    main()
