# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Preference values through the real process: where they go, what survives, what hostile input gets."""
import os
import pathlib
import plistlib
import shutil
import signal
import tempfile
import threading

import wire
from harness import ERROR, INFO, LOG_ERR, SANITIZED, Daemon, HelperTest, eventually, main

DOMAIN = "com.example.test"
FOLDER = pathlib.Path("/root/Library/Preferences")
FILE = FOLDER / f"{DOMAIN}.plist"
BY_HOST = FOLDER / "ByHost" / f"{DOMAIN}.0123456789abcdef0123456789abcdef.plist"
ANY_USER = pathlib.Path("/var/lib/brenvik/Library/Preferences") / f"{DOMAIN}.plist"


def xml(value):
    return plistlib.dumps(value)


def binary(value):
    return plistlib.dumps(value, fmt=plistlib.FMT_BINARY)


def put(path, content):
    """Another program's write."""
    path.parent.mkdir(parents=True, exist_ok=True)
    new = path.with_suffix(".new")
    new.write_bytes(content)
    new.rename(path)


class PreferencesTest(HelperTest):
    def prepare(self):
        for folder in (FOLDER.parent, pathlib.Path("/var/lib/brenvik/Library")):
            shutil.rmtree(folder, ignore_errors=True)


class Values(PreferencesTest):
    def setUp(self):
        super().setUp()
        self.caller = self.client()

    def copy(self, key, name="CopyPreferenceValue"):
        content = self.caller.copy_preference(DOMAIN, key, name)
        return plistlib.loads(content) if content else None

    def test_a_value_goes_into_the_domains_file_and_comes_back_as_xml(self):
        value = {"Version": "7", "Sizes": [1, -2, 2.5], "Data": b"\0\xff", "Text": "grüße 😀", "Yes": True}
        for number, form in enumerate((xml(value), binary(value))):
            for way in ("in line", "memfd"):
                key = f"key {number} {way}"
                self.assertEqual(self.caller.set_preference(DOMAIN, key, form, way), 0)
                self.assertEqual(plistlib.loads(FILE.read_bytes())[key], value)
                content = self.caller.copy_preference(DOMAIN, key)
                self.assertTrue(content.startswith(b"<?xml"), content[:20])
                self.assertEqual(plistlib.loads(content), value)
                self.logs.wait_for("bsd", LOG_ERR, f"VM_ALLOCATE {len(content)}l (mhs1)")
        self.assertTrue(FILE.read_bytes().startswith(b"bplist00"))
        self.assertEqual(FILE.stat().st_mode & 0o7777, 0o600)

    def test_a_large_value_goes_both_ways(self):
        value = "x" * 3_000_000
        self.assertEqual(self.caller.set_preference(DOMAIN, "large", xml(value), "memfd"), 0)
        self.assertEqual(self.copy("large"), value)

    def test_one_byte_removes_the_key_and_two_bad_bytes_change_nothing(self):
        self.assertEqual(self.caller.set_preference(DOMAIN, "key", xml("old")), 0)
        self.assertEqual(self.caller.set_preference(DOMAIN, "key", b"xx"), 5)
        self.assertEqual(self.copy("key"), "old")
        self.assertEqual(self.caller.set_preference(DOMAIN, "key", b"\0"), 0)
        self.assertIsNone(self.copy("key"))
        self.assertEqual(plistlib.loads(FILE.read_bytes()), {})

    def test_a_key_without_a_value_is_a_success_without_payload_or_log_line(self):
        self.assertEqual(self.caller.copy_preference(DOMAIN, "nothing"), b"")
        self.assertEqual(self.caller.copy_preference(DOMAIN, "nothing", "CopyAppPreferenceValue"), b"")
        self.assertFalse(FOLDER.exists(), "reading makes nothing")
        self.assertEqual([line for line in self.logs.lines if line[0] == "bsd"], [])

    def test_application_scope_looks_in_three_places(self):
        put(ANY_USER, binary({"key": "any user"}))
        self.assertEqual(self.copy("key", "CopyAppPreferenceValue"), "any user")
        put(FILE, xml({"key": "this user"}))
        self.assertEqual(self.copy("key", "CopyAppPreferenceValue"), "this user")
        put(BY_HOST, binary({"key": "this host"}))
        self.assertEqual(self.copy("key", "CopyAppPreferenceValue"), "this host")
        self.assertEqual(self.copy("key"), "this user")
        content = self.caller.copy_preference(DOMAIN, "key", "CopyAppPreferenceValue")
        self.logs.wait_for("bsd", LOG_ERR, f"VM_ALLOCATE {len(content)}l (mhs2)")

    def test_what_other_programs_write_is_seen_and_kept(self):
        self.assertEqual(self.caller.set_preference(DOMAIN, "ours", xml(1)), 0)
        put(FILE, binary({**plistlib.loads(FILE.read_bytes()), "theirs": 2}))
        self.assertEqual(self.copy("theirs"), 2)
        put(FILE, xml({**plistlib.loads(FILE.read_bytes()), "later": 3}))
        self.assertEqual(self.caller.set_preference(DOMAIN, "ours", xml(4)), 0)
        self.assertEqual(plistlib.loads(FILE.read_bytes()), {"ours": 4, "theirs": 2, "later": 3})

    def test_bad_texts_get_5(self):
        for domain, key in ((b"\xff", "key"), (DOMAIN, b"\xc0\x80")):
            self.assertEqual(self.caller.set_preference(domain, key, xml(1)), 5)
            for name in ("CopyPreferenceValue", "CopyAppPreferenceValue"):
                with self.assertRaises(wire.Status) as refusal:
                    self.caller.copy_preference(domain, key, name)
                self.assertEqual(refusal.exception.code, 5)

    def test_a_domain_that_names_no_file_stores_nothing_and_says_so(self):
        for domain in ("", ".", "..", "../../etc/passwd", "a/b"):
            self.assertEqual(self.caller.set_preference(domain, "key", xml(1)), 0)
            self.logs.wait_for("unified", ERROR, f'Preferences: domain "{domain}" names no file, nothing is stored')
            self.assertEqual(self.caller.copy_preference(domain, "key"), b"")
        self.assertFalse(FOLDER.exists())

    def test_hostile_values_get_5_at_once(self):
        deep = b'<plist version="1.0">' + b"<array>" * 100_000 + b"</array>" * 100_000 + b"</plist>"
        # Each array holds the next one twice: 2^40 strings when written out.
        bomb = plistlib.dumps([0], fmt=plistlib.FMT_BINARY)
        levels = 40
        objects = [b"\xa2" + bytes([i + 1, i + 1]) for i in range(levels)] + [b"\x5a0123456789"]
        offsets, body = [], b"bplist00"
        for item in objects:
            offsets.append(len(body))
            body += item
        bomb = (body + bytes(offsets) + bytes(6) + b"\x01\x01" + len(objects).to_bytes(8, "big") + bytes(8)
                + len(body).to_bytes(8, "big"))
        before = self.daemon.resident_kib()
        for value in (deep, bomb, b"bplist00" + b"\xff" * 40, binary([1, 2])[:-1]):
            before_it = self.daemon.cpu_seconds()
            self.assertEqual(self.caller.set_preference(DOMAIN, "key", value, "memfd"), 5)
            self.assertLess(self.daemon.cpu_seconds() - before_it, 2)
        self.assertLess(self.daemon.resident_kib() - before, 32 * 1024)
        self.assertIsNone(self.copy("key"))

    def test_a_damaged_file_is_moved_aside_and_reported(self):
        put(FILE, b"not a property list")
        self.assertEqual(self.caller.set_preference(DOMAIN, "key", xml("new")), 0)
        aside = FILE.with_name(FILE.name + ".damaged-1")
        self.assertEqual(aside.read_bytes(), b"not a property list")
        self.assertEqual(plistlib.loads(FILE.read_bytes()), {"key": "new"})
        self.logs.wait_for(
            "unified", ERROR, f"Preferences {FILE}: damaged (not a property list), moved aside to {aside.name}")


class Kills(PreferencesTest):
    def test_answered_sets_survive_the_daemons_death_and_nothing_is_torn(self):
        answered = 0
        for round_number in range(25):
            with wire.Client() as caller:
                # After an answer, somewhere within the sets that follow.
                timer = threading.Timer(0.002 + 0.0007 * round_number, os.kill, (self.daemon.pid, signal.SIGKILL))
                try:
                    while True:
                        value = {"Number": answered + 1, "Text": "x" * ((answered * 7919) % 20_000)}
                        if caller.set_preference(DOMAIN, "key", xml(value)) == 0:
                            answered += 1
                        if timer.ident is None:
                            timer.start()
                except (wire.Closed, OSError):
                    pass
                timer.join()
            self.daemon.wait()
            stored = plistlib.loads(FILE.read_bytes())["key"] if FILE.exists() else {"Number": 0}
            self.assertIn(stored["Number"], (answered, answered + 1))
            if stored["Number"]:
                self.assertEqual(len(stored["Text"]), ((stored["Number"] - 1) * 7919) % 20_000)
            answered = stored["Number"]
            self.daemon.stop()
            self.daemon = Daemon()
        self.assertGreaterEqual(answered, 25)
        with wire.Client() as caller:
            self.assertEqual(plistlib.loads(caller.copy_preference(DOMAIN, "key"))["Number"], answered)


class Descriptors(PreferencesTest):
    def test_many_domains_leave_descriptors_and_memory_bounded(self):
        caller = self.client()
        self.assertEqual(caller.set_preference("domain", "key", xml("x")), 0)  # leaves what is made once, and its file
        before = self.daemon.settled_descriptors() - 1
        memory = self.daemon.resident_kib()
        for number in range(300):
            self.assertEqual(caller.set_preference(f"domain{number}", "key", xml("x" * 50_000)), 0)
        # The last request's own is closed after its answer.
        eventually(lambda: self.daemon.descriptors() - before <= 16, what="few descriptors")
        if not SANITIZED:
            self.assertLess(self.daemon.resident_kib() - memory, 16 * 1024)


class PlistFiles(HelperTest):
    def setUp(self):
        super().setUp()
        self.caller = self.client()
        self.folder = pathlib.Path(tempfile.mkdtemp())
        self.addCleanup(shutil.rmtree, self.folder)

    def test_any_readable_dictionary_comes_back_as_xml(self):
        value = {"CarrierName": "Norvale", "MCC": [1, 2]}
        for number, form in enumerate((xml(value), binary(value))):
            path = self.folder / f"file {number}"
            path.write_bytes(form)
            content = self.caller.load_plist(str(path))
            self.assertTrue(content.startswith(b"<?xml"))
            self.assertEqual(plistlib.loads(content), value)
            self.logs.wait_for("unified", INFO, f"Loading {path} as plist")

    def test_what_is_no_dictionary_gets_9_and_a_line(self):
        (self.folder / "array").write_bytes(xml([1]))
        (self.folder / "text").write_bytes(b"no property list")
        (self.folder / "empty").write_bytes(b"")
        for name in ("array", "text", "empty", "missing", "."):
            self.logs.clear()
            with self.assertRaises(wire.Status) as refusal:
                self.caller.load_plist(str(self.folder / name))
            self.assertEqual(refusal.exception.code, 9)
            self.logs.wait_for("unified", ERROR, "Could not create data representation of dictionary")


if __name__ == "__main__":
    main()
