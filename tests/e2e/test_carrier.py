# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Carrier bundles and voicemail tokens through the real process: what stands on the disk afterwards."""
import os
import pathlib
import plistlib
import re
import shutil
import sqlite3
import unittest
import zipfile

import tracing
import wire
from harness import ERROR, INFO, LOG_ERR, LOG_NOTICE, SANITIZED, HelperTest, main

HOME = pathlib.Path("/var/mobile")
LIBRARY = HOME / "Library"
BUNDLES = LIBRARY / "Carrier Bundles"
FIXED = pathlib.Path("/private/var/mobile/Library")
WORK = pathlib.Path("/tmp/carrier")


def long(text):
    return wire.field(str(text), 1024)


def short(text):
    return wire.field(str(text), 256)


class CarrierTest(HelperTest):
    def prepare(self):
        for folder in (LIBRARY, WORK):
            shutil.rmtree(folder, ignore_errors=True)
        LIBRARY.mkdir(parents=True)
        WORK.mkdir(parents=True)

    def setUp(self):
        super().setUp()
        self.caller = self.client()

    def link(self, target, path, domain=""):
        return self.caller.status("ReplaceCarrierSymlink", long(target), long(path), long(domain))

    def copy(self, source, destination, name):
        return self.caller.integer("CopyCarrierFile", short(source), short(destination), short(name))

    def move(self, source, destination, name):
        return self.caller.integer("MoveIntoCarrierBundles", short(source), short(destination), short(name))

    def unpack(self, archive, destination):
        message = wire.simple("UnpackArchive", short(archive), short(destination))
        reply, fds = self.caller.body(message, timeout=60)  # up to a gigabyte
        self.assertEqual((len(reply), fds), (40, []))
        return reply[36]

    def zip(self, entries, name="archive.zip"):
        path = WORK / name
        with zipfile.ZipFile(path, "w", zipfile.ZIP_DEFLATED) as archive:
            for entry, content in entries:
                archive.writestr(entry, content)
        return path


class Bundles(CarrierTest):
    def test_a_bundle_is_unpacked_moved_linked_and_read(self):
        carrier = plistlib.dumps({"CarrierName": "Norvale Møbil"})
        archive = self.zip([("Small.bundle/carrier.plist", carrier), ("Small.bundle/leer/", b""),
                            ("Small.bundle/日本.strings", "grüße".encode())])
        self.assertEqual(self.unpack(archive, WORK / "unpacked"), 1)
        self.assertEqual(self.move(WORK / "unpacked" / "Small.bundle", BUNDLES, "Small.bundle"), 1)
        self.assertFalse((WORK / "unpacked" / "Small.bundle").exists())
        self.assertTrue((BUNDLES / "Small.bundle" / "leer").is_dir())
        self.assertEqual((BUNDLES / "Small.bundle" / "日本.strings").read_text(), "grüße")
        link = LIBRARY / "Carrier Bundle.bundle"
        self.assertEqual(self.link(BUNDLES / "Small.bundle", link, "com.norvale.carrier"), 0)
        self.logs.wait_for("unified", INFO, f"linkpath: {link}, domain: com.norvale.carrier")
        content = self.caller.load_plist(str(link / "carrier.plist"))
        self.assertEqual(plistlib.loads(content), {"CarrierName": "Norvale Møbil"})
        self.assertEqual([name for name in os.listdir(BUNDLES) if name.startswith(".brenvik")], [])

    def test_the_fixed_paths_are_policy_as_well(self):
        link = FIXED / "Operator Bundle.bundle"
        self.assertEqual(self.link("target", link), 0)
        self.assertEqual(os.readlink(link), "target")
        self.logs.wait_for("unified", INFO, f"{link} is within allowed path {link}")

    def test_a_file_over_which_nothing_can_be_copied_is_no_success(self):
        BUNDLES.mkdir()
        (BUNDLES / "null").write_text("old")
        self.assertEqual(self.copy("/dev", BUNDLES, "null"), 0)
        self.assertEqual((BUNDLES / "null").read_text(), "old")

    def test_crash_logs_of_a_folder_above_their_own_are_copied_once(self):
        reporter = LIBRARY / "Logs" / "CrashReporter"
        reporter.mkdir(parents=True)
        (reporter / "report").write_text("r")
        for number in range(10):
            (LIBRARY / "Preferences").mkdir(exist_ok=True)
            (LIBRARY / "Preferences" / f"{number}.plist").write_text("x")
        before = len(list(LIBRARY.rglob("*")))
        self.assertEqual(self.caller.integer("CopyCrashLogs", short(LIBRARY)), 1)
        self.assertEqual((reporter / "Library" / "Preferences" / "7.plist").read_text(), "x")
        self.assertEqual(len(list(LIBRARY.rglob("*"))), 2 * before + 1)

    def test_a_link_where_a_directory_stands_gets_8_and_its_line(self):
        link = LIBRARY / "Carrier Bundle.bundle"
        link.mkdir()
        self.assertEqual(self.link("target", link), 8)
        self.logs.wait_for("unified", ERROR, f"Cannot remove symlink: {link}")
        self.assertTrue(link.is_dir())

    def test_any_link_may_be_created_and_a_failure_is_5(self):
        link = WORK / "link"
        link.write_text("old")
        self.assertEqual(self.caller.status("CreateSymlink", long("new"), long(link)), 0)
        self.assertEqual(os.readlink(link), "new")
        self.assertEqual(self.caller.status("CreateSymlink", long("new"), long(WORK / "no" / "link")), 5)

    def test_a_refused_removal_flushes_first_and_removes_nothing(self):
        victim = WORK / "victim"
        victim.write_text("kept")
        self.assertEqual(self.caller.status("RemoveCarrierFile", long(victim), long("com.norvale.carrier")), 8)
        self.assertEqual(victim.read_text(), "kept")
        self.logs.wait_for("bsd", LOG_NOTICE, "Removing domain: com.norvale.carrier")

    def test_a_domain_cannot_disturb_the_log(self):
        self.assertEqual(self.caller.status("RemoveCarrierFile", long("/nowhere"), long("a\n\u202eb\u2029")), 8)
        self.logs.wait_for("bsd", LOG_NOTICE, "Removing domain: a\\x0a\\xe2\\x80\\xaeb\\xe2\\x80\\xa9")
        self.logs.wait_for("unified", ERROR, "/private/var/mobile/Library/Carrier Bundles")
        package = pathlib.Path("/tmp/update.tcpk")
        package.write_text("x")
        self.assertEqual(self.caller.status("RemoveCarrierFile", long(package), long("")), 0)
        self.assertFalse(package.exists())

    def test_a_copied_file_belongs_to_the_mobile_account(self):
        (WORK / "carrier.plist").write_text("content")
        self.assertEqual(self.copy(WORK, BUNDLES / "A.bundle", "carrier.plist"), 1)
        info = (BUNDLES / "A.bundle" / "carrier.plist").stat()
        self.assertEqual((info.st_uid, info.st_gid), (501, 501))
        self.assertEqual((BUNDLES / "A.bundle").stat().st_mode & 0o7777, 0o755)
        self.assertEqual(self.copy(WORK, WORK / "elsewhere", "carrier.plist"), 0)
        self.logs.wait_for("bsd", LOG_ERR, f"Destination directory {WORK}/elsewhere/carrier.plist is not within the "
                                           "allowed directories")
        self.assertEqual(self.copy(WORK, BUNDLES, "missing"), 0)
        self.logs.wait_for("bsd", LOG_ERR, f"Failed to copy the file {WORK} to {BUNDLES}")

    def test_crash_logs_go_to_the_mobile_account(self):
        (WORK / "logs").mkdir()
        (WORK / "logs" / "crash.txt").write_text("boom")
        (LIBRARY / "Logs" / "CrashReporter").mkdir(parents=True)
        self.assertEqual(self.caller.integer("CopyCrashLogs", short(WORK / "logs")), 1)
        self.assertEqual((LIBRARY / "Logs/CrashReporter/logs/crash.txt").read_text(), "boom")
        self.assertEqual(self.caller.integer("CopyCrashLogs", short(WORK / "none")), 0)
        self.logs.wait_for("bsd", LOG_NOTICE, f"Failed to copy the directory {WORK}/none to "
                                              f"{LIBRARY}/Logs/CrashReporter/. Error: -1")

    def test_a_refused_move_leaves_the_directory_made(self):
        (WORK / "bundle").mkdir()
        self.assertEqual(self.move(WORK / "bundle", WORK / "made" / "here", "x"), 0)
        self.assertTrue((WORK / "made" / "here").is_dir())
        self.assertTrue((WORK / "bundle").is_dir())

    def test_unterminated_fields_are_cut(self):
        field = b"a" * 1024
        self.assertEqual(self.caller.status("CreateSymlink", field, long(WORK / "link")), 0)
        self.assertEqual(os.readlink(WORK / "link"), "a" * 1023)


CALLS = ["write", "pwrite64", "fsync", "syncfs", "linkat", "rename", "renameat", "renameat2", "symlinkat", "mkdirat",
         "fchmod", "fchownat", "unlinkat", "sendto", "sendmsg", "epoll_wait"]


@unittest.skipIf(SANITIZED, "the leak checker cannot be traced")
class Durability(CarrierTest):
    """What was answered is on the disk: the order of the daemon's system calls."""

    def calls(self, work):
        """(name, arguments) of the calls of one request, up to its answer; descriptors with their paths."""
        text = tracing.traced(self, self.daemon.pid, work, "-y", "-e", "trace=" + ",".join(CALLS))
        found = re.findall(r"^\d+ +(\w+)\((.*)\) += 0", text[:text.rindex("sendto(")], re.M)
        self.assertTrue(found, text)
        return found

    def assert_order(self, calls, *wanted):
        """The calls named come in this order, with others between; a call is a name and what its arguments hold."""
        rest = list(calls)
        for name, *parts in wanted:
            at = next((i for i, (call, arguments) in enumerate(rest)
                       if re.fullmatch(name, call) and all(part in arguments for part in parts)), None)
            self.assertIsNotNone(at, f"{name} {parts} not in {rest} of {calls}")
            del rest[:at + 1]

    def test_a_copied_file_and_its_folder(self):
        (WORK / "carrier.plist").write_text("content")
        BUNDLES.mkdir()
        for old in (False, True):
            calls = self.calls(lambda: self.assertEqual(self.copy(WORK, BUNDLES, "carrier.plist"), 1))
            shown = ("renameat", '"carrier.plist"') if old else ("linkat", '"carrier.plist"')
            # Given away before anybody else can reach it, in the same wait for the disk.
            self.assert_order(calls, ("fchownat", "#", "501, 501"), ("fsync", "#"), shown, ("fsync", f"{BUNDLES}>"))
            self.assertEqual([name for name, _ in calls].count("fsync"), 2, calls)

    def test_the_folders_that_are_made_on_the_way(self):
        (WORK / "carrier.plist").write_text("content")
        calls = self.calls(lambda: self.assertEqual(self.copy(WORK, BUNDLES / "A", "carrier.plist"), 1))
        self.assert_order(calls, ("renameat2", '"Carrier Bundles"'), ("fsync", f"{LIBRARY}>"),
                          ("renameat2", '"A"'), ("fsync", f"{BUNDLES}>"), ("linkat", "carrier.plist"))

    def test_an_unpacked_archive(self):
        archive = self.zip([("Small.bundle/carrier.plist", b"content")])
        for there in (False, True):
            calls = self.calls(lambda: self.assertEqual(self.unpack(archive, WORK / "out"), 1))
            if there:
                self.assert_order(calls, ("syncfs", "/new"), ("renameat2?", "carrier.plist"),
                                  ("syncfs", f"{WORK}/out>"))
            else:
                self.assert_order(calls, ("syncfs", "/new"), ("renameat2", '"out"'), ("fsync", f"{WORK}>"))

    def test_links(self):
        link = LIBRARY / "Carrier Bundle.bundle"
        calls = self.calls(lambda: self.assertEqual(self.link("first", link), 0))
        self.assert_order(calls, ("symlinkat", '"Carrier Bundle.bundle"'), ("fsync", f"{LIBRARY}>"))
        calls = self.calls(lambda: self.assertEqual(self.link("second", link), 0))
        self.assert_order(calls, ("symlinkat", ".brenvik-"), ("renameat", '"Carrier Bundle.bundle"'),
                          ("fsync", f"{LIBRARY}>"))
        created = lambda: self.assertEqual(self.caller.status("CreateSymlink", long("t"), long(WORK / "link")), 0)
        self.assert_order(self.calls(created), ("symlinkat", '"link"'), ("fsync", f"{WORK}>"))
        removed = lambda: self.assertEqual(self.caller.status("RemoveCarrierFile", long(link), long("")), 0)
        self.assert_order(self.calls(removed), ("unlinkat", "Carrier Bundle"), ("fsync", f"{LIBRARY}>"))

    def test_a_move_inside_a_file_system(self):
        (WORK / "bundle").mkdir()
        BUNDLES.mkdir()
        inside = BUNDLES / "from"
        (inside / "bundle").mkdir(parents=True)
        calls = self.calls(lambda: self.assertEqual(self.move(inside / "bundle", BUNDLES, "moved"), 1))
        self.assert_order(calls, ("renameat2", '"moved"'), ("fsync", f"{BUNDLES}>"), ("fsync", f"{inside}>"))

    def test_a_move_to_another_file_system_removes_nothing_before_the_copy_is_on_the_disk(self):
        self.assertNotEqual(WORK.stat().st_dev, LIBRARY.stat().st_dev)
        (WORK / "bundle").mkdir()
        (WORK / "bundle" / "file").write_text("content")
        BUNDLES.mkdir()
        calls = self.calls(lambda: self.assertEqual(self.move(WORK / "bundle", BUNDLES, "moved"), 1))
        self.assert_order(calls, ("syncfs", "/new"), ("renameat2", '"moved"'), ("fsync", f"{BUNDLES}>"),
                          ("renameat", '"bundle"'), ("fsync", f"{WORK}>"), ("unlinkat", '"file"'))
        names = [name for name, _ in calls]
        self.assertLess(names.index("syncfs"), names.index("unlinkat"))
        self.assertEqual((BUNDLES / "moved" / "file").read_text(), "content")
        self.assertEqual(os.listdir(WORK), [])


class Archives(CarrierTest):
    def test_hostile_archives_are_refused_and_the_helper_goes_on(self):
        pid = self.daemon.pid
        hostile = {
            "parent": [("good", "g"), ("../outside", "x")],
            "absolute": [("/tmp/carrier/absolute", "x")],
            "twice": [("same", "1"), ("same", "2")],
        }
        link = zipfile.ZipInfo("link")
        link.create_system, link.external_attr = 3, 0o120777 << 16
        hostile["link out"] = [(link, "../../../etc")]
        setuid = zipfile.ZipInfo("run")
        setuid.create_system, setuid.external_attr = 3, 0o104755 << 16
        hostile["set-user-id"] = [(setuid, "x")]
        for name, entries in hostile.items():
            self.assertEqual(self.unpack(self.zip(entries), WORK / "out"), 0, name)
            self.assertEqual(os.listdir(WORK), ["archive.zip"], name)
        self.assertEqual(self.daemon.pid, pid)
        self.assertTrue(self.daemon.running())

    def test_a_damaged_archive_gets_0_and_the_fatal_line(self):
        path = self.zip([("file", b"x" * 5000)])
        path.write_bytes(path.read_bytes()[:-40])
        self.assertEqual(self.unpack(path, WORK / "out"), 0)
        self.logs.wait_for("bsd", LOG_ERR, "ArkCopier signaled fatal file error")
        self.assertFalse((WORK / "out").exists())

    def test_what_is_private_in_the_archive_is_private_on_the_disk(self):
        private = zipfile.ZipInfo("private")
        private.create_system, private.external_attr = 3, 0o100600 << 16
        shared = zipfile.ZipInfo("shared")
        shared.create_system, shared.external_attr = 3, 0o100644 << 16
        self.assertEqual(self.unpack(self.zip([(private, "x"), (shared, "x")]), WORK / "out"), 1)
        self.assertEqual((WORK / "out" / "private").stat().st_mode, 0o100600)
        self.assertEqual((WORK / "out" / "shared").stat().st_mode, 0o100644)

    def test_a_bomb_ends_at_the_cap_and_the_helper_stays_small(self):
        path = WORK / "bomb.zip"
        with zipfile.ZipFile(path, "w", zipfile.ZIP_DEFLATED) as archive, archive.open("zeros", "w") as entry:
            for _ in range(1100):
                entry.write(bytes(1 << 20))
        self.assertEqual(self.unpack(path, WORK / "out"), 0)
        self.assertEqual(os.listdir(WORK), ["bomb.zip"])
        self.assertEqual(self.unpack(self.zip([("file", "x")]), WORK / "out"), 1)
        if not SANITIZED:
            self.assertLess(self.daemon.resident_kib(), 16 * 1024)

    def test_no_reader_stays_behind(self):
        for _ in range(20):
            self.assertEqual(self.unpack(self.zip([("file", "x")]), WORK / "out"), 1)
        children = pathlib.Path(f"/proc/{self.daemon.pid}/task/{self.daemon.pid}/children").read_text()
        self.assertEqual(children, "")


class Voicemail(CarrierTest):
    def token(self, name="CopyVoicemailToken", *arguments):
        return self.caller.text(name, *arguments).split(b"\0")[0].decode()

    def test_tokens_are_set_copied_cleared_and_reset(self):
        self.assertEqual(self.token(), "")
        self.assertEqual(self.caller.status("SetVoicemailToken", short("gänzlich")), 0)
        self.assertEqual(self.caller.status("SetVoicemailTokenForKey", short("key"), short("value")), 0)
        self.assertEqual(self.token(), "gänzlich")
        self.assertEqual(self.token("CopyVoicemailTokenForKey", short("key")), "value")
        self.assertEqual(self.caller.status("ClearVoicemailToken"), 0)
        self.assertEqual(self.token(), "")
        self.assertEqual(self.caller.status("ResetVoicemailStore"), 0)
        self.assertEqual(self.token("CopyVoicemailTokenForKey", short("key")), "")

    def test_bad_texts_get_5_and_long_ones_are_cut(self):
        self.assertEqual(self.caller.status("SetVoicemailToken", b"\xff" + bytes(255)), 5)
        self.assertEqual(self.caller.status("SetVoicemailTokenForKey", b"\xc3" + bytes(255), short("v")), 5)
        with self.assertRaises(wire.Status) as refusal:
            self.caller.text("CopyVoicemailTokenForKey", b"\xff" + bytes(255))
        self.assertEqual(refusal.exception.code, 5)
        self.assertFalse((LIBRARY / "Voicemail").exists())
        self.assertEqual(self.caller.status("SetVoicemailToken", b"t" * 256), 0)
        self.assertEqual(self.token(), "t" * 255)

    def test_the_store_belongs_to_the_mobile_account(self):
        self.assertEqual(self.caller.status("SetVoicemailToken", short("token")), 0)
        info = (LIBRARY / "Voicemail" / "voicemail.db").stat()
        self.assertEqual((info.st_uid, info.st_gid, info.st_mode & 0o7777), (501, 501, 0o600))

    def test_a_killed_helper_keeps_every_answered_token(self):
        for number in range(20):
            self.assertEqual(self.caller.status("SetVoicemailTokenForKey", short(f"k{number}"), short(number)), 0)
        os.kill(self.daemon.pid, 9)
        self.daemon.wait()
        with sqlite3.connect(LIBRARY / "Voicemail" / "voicemail.db") as database:
            rows = dict(database.execute("SELECT key, token FROM tokens"))
        self.assertEqual(rows, {f"k{number}": str(number) for number in range(20)})

    def test_without_visual_voicemail_nobody_is_subscribed(self):
        for _ in range(2):
            self.assertEqual(self.caller.integer("IsVoicemailServiceSubscribed"), 0)


if __name__ == "__main__":
    main()
