# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Labels, badges and the contacts remap, through the real daemon."""
import os
import pathlib
import plistlib
import random
import sqlite3
import struct
import subprocess
import sys

import wire
from harness import DEFAULT, ERROR, HelperTest, main

SIX = ["USER_LABEL_PRIMARY", "USER_LABEL_SECONDARY", "USER_LABEL_PERSONAL", "USER_LABEL_BUSINESS",
       "USER_LABEL_TRAVEL", "USER_LABEL_CELL_DATA"]
FAILURE = 5
BOTH = ("CopyBadgeLabels", "CopyLocalizedLabels")


def binary(value):
    return plistlib.dumps(value, fmt=plistlib.FMT_BINARY)


def pairs(*labels):
    """Keys as they are; a user's own text as a tuple of one."""
    return [part for label in labels for part in (("", label[0]) if isinstance(label, tuple) else (label, "any"))]


class LabelsTest(HelperTest):
    def setUp(self):
        super().setUp()
        self.helper = self.client()

    def ask(self, name, labels, languages):
        return plistlib.loads(self.raw(name, plistlib.dumps(labels), plistlib.dumps(languages)))

    def raw(self, name, labels, languages):
        return self.helper.region(wire.labels_message(name, labels, languages))

    def refusal(self, name, labels, languages):
        with self.assertRaises(wire.Status) as caught:
            self.raw(name, labels, languages)
        return caught.exception.code


class Answers(LabelsTest):
    def test_names_come_in_the_users_language(self):
        for languages, expected in (
                (["de-AT"], ["Primär", "Sekundär", "Privat", "Geschäftlich", "Reise", "Mobile Daten"]),
                (["zh-Hant-TW", "en"], ["主要", "次要", "個人", "公司", "旅行", "行動數據"]),
                (["tlh", "sr-Latn-RS"], ["Glavna", "Sekundarna", "Lična", "Poslovna", "Putovanje", "Mobilni podaci"]),
                ([], ["Primary", "Secondary", "Personal", "Business", "Travel", "Cellular Data"])):
            self.assertEqual(self.ask("CopyLocalizedLabels", SIX, languages), expected)

    def test_badges_of_keys_and_own_texts_are_distinct_within_the_call(self):
        labels = pairs(*SIX, ("istanbul",), ("👨‍👩‍👧 home",), ("Personal",))
        self.assertEqual(self.ask("CopyBadgeLabels", labels, ["en"]),
                         ["P", "S", "PE", "B", "T", "C", "I", "👨‍👩‍👧", "PER"])
        self.assertEqual(self.ask("CopyBadgeLabels", pairs("USER_LABEL_BUSINESS", ("iş",), ("ıssız",)), ["tr"]),
                         ["İ", "İŞ", "I"])

    def test_the_reply_is_an_xml_property_list_whatever_the_request_was(self):
        for encode in (plistlib.dumps, binary):
            answer = self.raw("CopyLocalizedLabels", encode(SIX), encode(["fr"]))
            self.assertTrue(answer.startswith(b"<?xml"))
            self.assertEqual(plistlib.loads(answer)[4], "Voyage")

    def test_regions_that_travel_as_memfds_are_as_good(self):
        labels, languages = plistlib.dumps(SIX), binary(["pt-BR"])
        total = wire.SIZE["CopyLocalizedLabels"]
        message = (wire.header(wire.ID["CopyLocalizedLabels"], total, bits=wire.COMPLEX | 18) + struct.pack("<I", 2)
                   + wire.out_of_line(0, len(labels)) + wire.out_of_line(0, len(languages)) + wire.NDR
                   + struct.pack("<II", len(labels), len(languages)))
        fds = [wire.memfd_of(labels), wire.memfd_of(languages)]
        try:
            self.assertEqual(plistlib.loads(self.helper.region(message, fds))[1], "Secundária")
        finally:
            for fd in fds:
                os.close(fd)

    def test_no_labels_are_an_empty_answer_for_names_and_an_error_for_badges(self):
        self.assertEqual(self.ask("CopyLocalizedLabels", [], ["de"]), [])
        self.assertEqual(self.refusal("CopyBadgeLabels", binary([]), binary(["de"])), FAILURE)
        self.logs.wait_for("unified", ERROR, "no labels given")

    def test_a_request_is_logged_with_its_lengths_and_counts(self):
        labels, languages = plistlib.dumps(pairs(*SIX)), plistlib.dumps(["de"])
        self.raw("CopyBadgeLabels", labels, languages)
        self.logs.wait_for("unified", DEFAULT, f"CopyBadgeLabels, compiling badge labels. labels len:{len(labels)}, "
                                               f"languages len:{len(languages)}")
        self.logs.wait_for("unified", DEFAULT, "getLocalizedBadgeLabelsForUnlocalizedLabels, 6 label(s)")
        self.ask("CopyLocalizedLabels", SIX, ["de", "en"])
        self.logs.wait_for("unified", DEFAULT, "getLocalizedPredefinedLabels, 6 label(s), 2 language(s)")

    def test_one_descriptor_instead_of_two_is_refused_by_the_message_layer(self):
        for name in BOTH:
            message = wire.labels_message(name, b"", b"")
            one = message[:24] + struct.pack("<I", 1) + message[28:]
            self.assertEqual(self.helper.channel.status(one), -304)


class HostilePropertyLists(LabelsTest):
    def check_alive(self):
        self.assertTrue(self.daemon.running())
        self.assertEqual(self.ask("CopyLocalizedLabels", ["USER_LABEL_TRAVEL"], ["de"]), ["Reise"])

    def test_what_is_no_array_is_refused_with_its_line(self):
        good = plistlib.dumps(["USER_LABEL_TRAVEL", ""])
        for name in BOTH:
            for labels, languages, line in (
                    (b"", good, "cannot build labels from data"),
                    (good, b"\0", "cannot build languages from data"),
                    (plistlib.dumps({"a": "b"}), good, "invalid type of 'labels' field"),
                    (good, plistlib.dumps({"a": "b"}), "invalid type of 'languages' field"),
                    (good, binary("en"), "invalid type of 'languages' field")):
                self.logs.clear()
                self.assertEqual(self.refusal(name, labels, languages), FAILURE)
                self.logs.wait_for("unified", ERROR, f"{name}, {line}")
        self.check_alive()

    def test_a_first_element_that_is_a_number_ends_the_walk(self):
        self.assertEqual(self.refusal("CopyBadgeLabels", binary([1, "USER_LABEL_TRAVEL"]), binary([])), FAILURE)
        self.logs.wait_for("unified", ERROR, "invalid object in array - ignore the rest")
        self.logs.wait_for("unified", ERROR, "no labels given")

    def test_elements_of_every_other_type_are_passed_over(self):
        odd = [7, 1.5, True, b"data", {"a": ["b"]}, [["c"]]]
        labels = [part for element in odd for part in ("", element)] + ["", "Mine"]
        self.assertEqual(self.ask("CopyBadgeLabels", labels, odd + ["de"]), ["M"])
        self.assertEqual(self.ask("CopyLocalizedLabels", odd + ["USER_LABEL_TRAVEL"], odd + ["de"]),
                         ["Reise"])
        self.check_alive()

    def test_deep_nesting_and_shared_references_cost_neither_the_process_nor_its_memory(self):
        deep = (b'<?xml version="1.0"?><plist version="1.0">' + b"<array>" * 3000 + b"</array>" * 3000 + b"</plist>")
        # 30 arrays, each of two references to the next: a thousand million elements when written out.
        objects = [bytes([0xA2, i + 1, i + 1]) for i in range(30)] + [b"\x51x"]
        table = b"".join(bytes([8 + 3 * i]) for i in range(31))
        bomb = b"bplist00" + b"".join(objects) + table + struct.pack(">6xBBQQQ", 1, 1, 31, 0, 8 + 3 * 30 + 2)
        loop = b"bplist00" + b"\xA1\x00" + b"\x08" + struct.pack(">6xBBQQQ", 1, 1, 1, 0, 10)
        good = plistlib.dumps(["", "x"])
        before = self.daemon.resident_kib()
        for hostile in (deep, bomb, loop):
            for name in BOTH:
                for message in (wire.labels_message(name, hostile, good), wire.labels_message(name, good, hostile)):
                    try:
                        self.helper.region(message)
                    except wire.Status as status:
                        self.assertEqual(status.code, FAILURE)
        self.assertLess(self.daemon.resident_kib() - before, 16 * 1024)
        self.check_alive()

    def test_damaged_lists_of_all_kinds_are_answered_one_way_or_the_other(self):
        chance = random.Random(6)
        seeds = [encode(value) for encode in (plistlib.dumps, binary)
                 for value in (SIX, pairs("USER_LABEL_TRAVEL", ("straße",), ("👨‍👩‍👧",)), ["zh-Hant-TW", "tr", "*"])]
        for _ in range(1500):
            damaged = bytearray(chance.choice(seeds))
            for _ in range(chance.randint(1, 4)):
                at = chance.randrange(len(damaged))
                action = chance.randrange(3)
                if action == 0:
                    damaged[at] ^= 1 << chance.randrange(8)
                elif action == 1:
                    del damaged[at:at + chance.randint(1, 8)]
                else:
                    damaged[at:at] = chance.randbytes(chance.randint(1, 8))
                if not damaged:
                    break
            arguments = [bytes(damaged), chance.choice(seeds)]
            chance.shuffle(arguments)
            try:
                answer = plistlib.loads(self.raw(chance.choice(BOTH), *arguments))
                self.assertTrue(all(isinstance(text, str) for text in answer))
            except wire.Status as status:
                self.assertEqual(status.code, FAILURE)
        self.check_alive()

    def test_a_message_full_of_equal_labels_gets_as_many_distinct_short_badges(self):
        labels = ["", "Line"] * 12000
        badges = plistlib.loads(self.raw("CopyBadgeLabels", binary(labels), binary(["en"])))
        self.assertEqual(len(badges), 12000)
        self.assertEqual(len(set(badges)), 12000)
        self.assertLessEqual(max(map(len, badges)), 3)
        self.check_alive()

    def test_a_label_that_is_one_endless_pile_of_marks_gets_a_short_badge(self):
        badge, = plistlib.loads(self.raw("CopyBadgeLabels", binary(["", "a" + "\u0301" * 15000]), binary(["en"])))
        self.assertTrue(badge.startswith("Á"))
        self.assertLess(len(badge), 100)


CONTACTS = pathlib.Path("/var/mobile/Library/AddressBook/contacts.db")
ROWS = 100_000

# Looks at the database until every reference has moved; says "whole" for the first look and prints what it saw.
READER = f"""
import sqlite3, sys
database = sqlite3.connect("{CONTACTS}", timeout=0, isolation_level=None)
seen = set()
while True:
    try:
        counts = database.execute("SELECT sum(channel_identifier='old'), sum(channel_identifier='new') "
                                  "FROM contact_channels").fetchone()
    except sqlite3.OperationalError:
        continue
    if counts not in seen:
        seen.add(counts)
        print(*counts, flush=True)
    if counts[0] == 0:
        break
"""


class Contacts(HelperTest):
    def setUp(self):
        super().setUp()
        self.helper = self.client()

    def remap(self, old="old", new="new"):
        return self.helper.integer("RemapContactsChannel", wire.field(old, 64), wire.field(new, 64))

    def make_database(self, rows=3):
        CONTACTS.parent.mkdir(parents=True, exist_ok=True)
        database = sqlite3.connect(CONTACTS, isolation_level=None)
        self.addCleanup(database.close)
        self.addCleanup(CONTACTS.unlink)
        database.execute("CREATE TABLE contact_channels(contact_id INTEGER NOT NULL, channel_identifier TEXT NOT NULL)")
        database.execute("BEGIN")
        database.executemany("INSERT INTO contact_channels VALUES(?, 'old')", ((i,) for i in range(rows)))
        database.execute("COMMIT")
        return database

    def count(self, database, channel):
        return database.execute("SELECT count(*) FROM contact_channels WHERE channel_identifier = ?",
                                (channel,)).fetchone()[0]

    def test_contacts_follow_their_channel(self):
        database = self.make_database()
        self.assertNotIn("libsqlite3", self.daemon.maps(), "the library must not cost a start that has no use for it")
        self.assertEqual(self.remap(), 1)
        self.assertEqual(self.count(database, "new"), 3)
        self.logs.wait_for("unified", DEFAULT, "remapChannelIdentifier old -> new")
        self.logs.wait_for("unified", DEFAULT, "remapChannelIdentifier result: success : (none)")

    def test_without_contacts_there_is_an_error_line_and_success(self):
        self.assertEqual(self.remap(), 1)
        self.logs.wait_for("unified", ERROR, "unable to create ContactsChannelManager")
        self.assertFalse(CONTACTS.exists())

    def test_a_locked_database_is_a_failure_with_its_description_and_status_0(self):
        database = self.make_database()
        database.execute("BEGIN EXCLUSIVE")
        self.assertEqual(self.remap(), 0)
        self.logs.wait_for("unified", DEFAULT, "remapChannelIdentifier result: failure : database is locked")
        database.execute("ROLLBACK")
        self.assertEqual(self.remap(), 1)

    def test_a_read_only_database_is_a_failure_even_for_root(self):
        database = self.make_database()
        CONTACTS.chmod(0o444)
        self.assertEqual(self.remap(), 0)
        self.logs.wait_for("unified", DEFAULT,
                           "remapChannelIdentifier result: failure : attempt to write a readonly database")
        self.assertEqual(self.count(database, "old"), 3)

    def test_fields_without_a_terminator_are_whole_texts(self):
        database = self.make_database()
        self.assertEqual(self.remap("old", "n" * 64), 1)
        self.assertEqual(self.count(database, "n" * 64), 3)

    def test_a_hundred_thousand_references_move_at_once_for_a_process_that_reads(self):
        self.make_database(ROWS)
        with subprocess.Popen([sys.executable, "-c", READER], stdout=subprocess.PIPE, text=True) as reader:
            self.assertEqual(reader.stdout.readline(), f"{ROWS} 0\n")
            self.assertEqual(self.remap(), 1)
            self.assertEqual(reader.stdout.read(), f"0 {ROWS}\n")


if __name__ == "__main__":
    main()
