# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Requests over the wire: the form of every row, preferences, property-list files, radio logging."""
import os
import pathlib
import plistlib
import struct

import wire
from harness import ERROR, INFO, LOG_ERR, HelperTest, eventually, main

PREFERENCES = pathlib.Path("/root/Library/Preferences")
DOMAIN = "com.example.test"


class EveryRow(HelperTest):
    def test_one_byte_short_and_one_byte_long_get_304(self):
        client = self.client()
        for name, size, _ in wire.ROUTINES:
            for off in (-1, 1):
                if size + off < 24:
                    continue  # shorter than a header: silence, tested elsewhere
                bits = wire.COMPLEX | 18 if size in (568, 76) else 18
                message = wire.header(wire.ID[name], size + off, bits=bits) + bytes(size + off - 24)
                self.assertEqual(client.channel.status(message), -304, f"{name} {off:+d}")

    def test_the_complex_flag_must_be_the_rows(self):
        client = self.client()
        for name, size, _ in wire.ROUTINES:
            bits = 18 if size in (568, 76) else wire.COMPLEX | 18
            message = wire.header(wire.ID[name], size, bits=bits) + bytes(size - 24)
            self.assertEqual(client.channel.status(message), -304, name)

    def test_ids_around_the_table_and_a_check_in_on_a_client_port_are_unknown(self):
        client = self.client()
        for message_id in (wire.FIRST - 1, wire.FIRST + 27, 0, -1, wire.CHECK_IN):
            self.assertEqual(client.channel.status(wire.header(message_id, 24)), -303)

    def test_a_request_on_the_service_port_is_unknown(self):
        service = wire.connect()
        self.addCleanup(service.close)
        for name, size, _ in wire.ROUTINES:
            message = wire.header(wire.ID[name], size) + bytes(size - 24)
            self.assertEqual(service.status(message), -303, name)

    def test_check_in_form(self):
        service = wire.connect()
        self.addCleanup(service.close)
        fd = os.dup(service.fileno())
        self.addCleanup(os.close, fd)
        good = wire.check_in_message()
        self.assertEqual(service.status(good + b"\0", [fd]), -304)
        self.assertEqual(service.status(good[:39]), -304)
        self.assertEqual(service.status(wire.check_in_message(count=2), [fd]), -304)
        self.assertEqual(service.status(wire.check_in_message(bits=18)), -304)
        self.assertEqual(service.status(wire.check_in_message(disposition=19), [fd]), -300)
        self.assertEqual(service.status(good), -304, "no descriptor")
        self.assertEqual(service.status(good, [fd, fd]), -304, "one too many")

    def test_regions_must_be_out_of_line_and_as_long_as_the_body_says(self):
        client = self.client()
        for name in ("CopyBadgeLabels", "CopyLocalizedLabels"):
            one = (wire.header(wire.ID[name], 76, bits=wire.COMPLEX | 18) + struct.pack("<I", 1)
                   + wire.out_of_line(0, 0) + bytes(32))
            self.assertEqual(client.channel.status(one), -304, "one descriptor instead of two")
            wrong = bytearray(wire.labels_message(name, b"abcd", b"efgh"))
            struct.pack_into("<I", wrong, 72, 5)
            self.assertEqual(client.channel.status(bytes(wrong)), -300)
        message, _ = wire.set_preference_message("d", "k", b"abcd", length=5)
        self.assertEqual(client.channel.status(message), -300)
        message, fds = wire.set_preference_message("d", "k", b"abcd", way="memfd", length=3)
        self.assertEqual(client.channel.status(message, fds), -300)
        os.close(fds[0])


class Preferences(HelperTest):
    def test_values_of_every_type_come_back_as_xml_whichever_way_they_came(self):
        client = self.client()
        value = {"text": "Brenvik", "number": -5, "big": 2 ** 63, "real": 1.5, "flag": True, "data": b"\0\1\2",
                 "list": [1, [2, [3]]], "empty": {}}
        for way in ("in line", "memfd"):
            for fmt in (plistlib.FMT_XML, plistlib.FMT_BINARY):
                key = f"{way} {fmt}"
                self.assertEqual(client.set_preference(DOMAIN, key, plistlib.dumps(value, fmt=fmt), way), 0)
                answer = client.copy_preference(DOMAIN, key)
                self.assertTrue(answer.startswith(b"<?xml version=\"1.0\""), answer[:20])
                self.assertEqual(plistlib.loads(answer), value)
                self.logs.wait_for("bsd", LOG_ERR, f"VM_ALLOCATE {len(answer)}l (mhs1)")
        answer = client.copy_preference(DOMAIN, key, "CopyAppPreferenceValue")
        self.assertEqual(plistlib.loads(answer), value)
        self.logs.wait_for("bsd", LOG_ERR, f"VM_ALLOCATE {len(answer)}l (mhs2)")

    def test_what_was_answered_is_on_the_disk_as_a_property_list(self):
        self.assertEqual(self.client().set_preference("com.example.disk", "key", plistlib.dumps("value")), 0)
        stored = plistlib.loads((PREFERENCES / "com.example.disk.plist").read_bytes())
        self.assertEqual(stored, {"key": "value"})

    def test_a_value_larger_than_a_datagram_travels_both_ways(self):
        client = self.client()
        value = os.urandom(300_000)
        self.assertEqual(client.set_preference(DOMAIN, "large", plistlib.dumps(value), "memfd"), 0)
        self.assertEqual(plistlib.loads(client.copy_preference(DOMAIN, "large")), value)

    def test_one_byte_removes_the_key_whatever_it_is(self):
        client = self.client()
        for way, byte in (("in line", b"\0"), ("memfd", b"x")):
            self.assertEqual(client.set_preference(DOMAIN, "gone", plistlib.dumps(1)), 0)
            self.assertEqual(client.set_preference(DOMAIN, "gone", byte, way), 0)
            self.assertEqual(client.copy_preference(DOMAIN, "gone"), b"")

    def test_a_value_that_is_no_property_list_gets_5_and_leaves_the_key(self):
        client = self.client()
        self.assertEqual(client.set_preference(DOMAIN, "kept", plistlib.dumps("old")), 0)
        for bad in (b"ab", b"", b"<plist", b"bplist00" + bytes(32), plistlib.dumps([1])[:-9]):
            self.assertEqual(client.set_preference(DOMAIN, "kept", bad), 5, bad)
        self.assertEqual(plistlib.loads(client.copy_preference(DOMAIN, "kept")), "old")

    def test_an_absent_key_is_success_with_an_empty_payload(self):
        self.assertEqual(self.client().copy_preference("com.example.nothing", "key"), b"")
        self.assertEqual(self.client().copy_preference("com.example.nothing", "key", "CopyAppPreferenceValue"), b"")

    def test_text_that_is_not_utf8_gets_5(self):
        client = self.client()
        bad = b"\xff\xfe"
        self.assertEqual(client.set_preference(bad, "key", plistlib.dumps(1)), 5)
        self.assertEqual(client.set_preference(DOMAIN, bad, plistlib.dumps(1)), 5)
        for name in ("CopyPreferenceValue", "CopyAppPreferenceValue"):
            for arguments in ((bad, "key"), (DOMAIN, bad)):
                with self.assertRaises(wire.Status) as refused:
                    client.copy_preference(*arguments, name)
                self.assertEqual(refused.exception.code, 5)

    def test_a_domain_that_names_no_file_stores_nothing_and_says_so(self):
        client = self.client()
        for domain in ("", ".", "..", "../escape", "a/b"):
            self.logs.clear()
            self.assertEqual(client.set_preference(domain, "key", plistlib.dumps(1)), 0)
            eventually(lambda: any(line[:2] == ("unified", ERROR) for line in self.logs.lines), what="an error line")
            self.assertEqual(client.copy_preference(domain, "key"), b"")
        self.assertFalse(pathlib.Path("/root/Library/escape.plist").exists())

    def test_a_damaged_file_is_moved_aside_and_reported_not_overwritten(self):
        PREFERENCES.mkdir(parents=True, exist_ok=True)
        (PREFERENCES / "com.example.damaged.plist").write_bytes(b"bplist00 half a file")
        client = self.client()
        self.assertEqual(client.set_preference("com.example.damaged", "key", plistlib.dumps(1)), 0)
        aside = [path for path in PREFERENCES.iterdir() if path.read_bytes() == b"bplist00 half a file"]
        self.assertEqual(len(aside), 1, list(PREFERENCES.iterdir()))
        eventually(lambda: any(aside[0].name in text for _, level, text in self.logs.lines if level == ERROR),
                   what="an error line that says where it went")

    def test_another_writers_value_is_seen(self):
        client = self.client()
        self.assertEqual(client.set_preference(DOMAIN, "shared", plistlib.dumps("ours")), 0)
        path = PREFERENCES / f"{DOMAIN}.plist"
        stored = plistlib.loads(path.read_bytes())
        stored["shared"] = "theirs"
        path.with_suffix(".new").write_bytes(plistlib.dumps(stored))
        path.with_suffix(".new").rename(path)
        self.assertEqual(plistlib.loads(client.copy_preference(DOMAIN, "shared")), "theirs")


class PlistFiles(HelperTest):
    def test_a_dictionary_of_any_place_is_loaded_and_comes_as_xml(self):
        client = self.client()
        content = {"Name": "Brenvik", "List": [1, 2]}
        for number, fmt in enumerate((plistlib.FMT_XML, plistlib.FMT_BINARY)):
            path = pathlib.Path(f"/tmp/some file {number}")
            path.write_bytes(plistlib.dumps(content, fmt=fmt))
            answer = client.load_plist(str(path))
            self.assertTrue(answer.startswith(b"<?xml"))
            self.assertEqual(plistlib.loads(answer), content)
            self.logs.wait_for("unified", INFO, f"Loading {path} as plist")

    def test_what_is_no_dictionary_gets_9_and_says_so(self):
        client = self.client()
        pathlib.Path("/tmp/array").write_bytes(plistlib.dumps([1]))
        pathlib.Path("/tmp/text").write_text("no property list")
        pathlib.Path("/tmp/empty").write_bytes(b"")
        for path in ("/tmp/missing", "/tmp/array", "/tmp/text", "/tmp/empty", "/tmp", "", "/dev/zero"):
            self.logs.clear()
            with self.assertRaises(wire.Status) as refused:
                client.load_plist(path)
            self.assertEqual(refused.exception.code, 9, path)
            self.logs.wait_for("unified", ERROR, "Could not create data representation of dictionary")

    def test_control_characters_of_a_path_are_escaped_in_the_log(self):
        with self.assertRaises(wire.Status):
            self.client().load_plist("/tmp/a\nb\x1b[31m\u009b31m\u00a0\u00e9\x7f")
        self.logs.wait_for("unified", INFO, "Loading /tmp/a\\x0ab\\x1b[31m\\xc2\\x9b31m\u00a0\u00e9\\x7f as plist")

    def test_characters_that_turn_the_direction_of_text_or_end_a_line_are_escaped_in_the_log(self):
        path = "/tmp/\u05e9\u202egpj.exe\u2066\u200f\u061c\u2028\u2029"
        with self.assertRaises(wire.Status):
            self.client().load_plist(path)
        self.logs.wait_for("unified", INFO, "Loading /tmp/\u05e9\\xe2\\x80\\xaegpj.exe\\xe2\\x81\\xa6\\xe2\\x80\\x8f"
                           "\\xd8\\x9c\\xe2\\x80\\xa8\\xe2\\x80\\xa9 as plist")


class RadioLogs(HelperTest):
    def test_any_value_is_logged_as_received_and_no_bus_is_no_failure(self):
        client = self.client()
        for value in (2, 0, 1, -7):
            self.assertEqual(client.status("EnableRadioManagerLogs", struct.pack("<i", value)), 0)
            self.logs.wait_for("bsd", LOG_ERR, f"Enabling wireless radio manager logs: {value}")

    def test_where_syslog_ends_in_the_journal_its_lines_go_there_with_their_facility(self):
        os.unlink(self.logs.SYSLOG)
        os.symlink("/run/systemd/journal/dev-log", self.logs.SYSLOG)
        self.assertEqual(self.client().status("EnableRadioManagerLogs", struct.pack("<i", 1)), 0)
        line = "Enabling wireless radio manager logs: 1"
        self.logs.wait_for("unified", LOG_ERR, line)
        entry, = [entry for entry in self.logs.entries if entry["MESSAGE"] == line]
        self.assertEqual(entry["SYSLOG_FACILITY"], "3")
        self.assertEqual(entry["SYSLOG_IDENTIFIER"], "BrenvikMobileHelper")
        self.assertRegex(entry["MESSAGE_ID"], r"\A[0-9a-f]{32}\Z")
        self.assertNotIn("CODE_FILE", entry)


class Bombs(HelperTest):
    def test_deep_and_exploding_property_lists_get_5_at_once_in_bounded_memory(self):
        client = self.client()
        client.set_preference(DOMAIN, "warm", plistlib.dumps(1))
        before = self.daemon.resident_kib()
        depth = 100_000
        xml = b'<plist version="1.0">' + b"<array>" * depth + b"</array>" * depth + b"</plist>"
        # Each array holds the next one ten times over: 136 bytes that say half a gigabyte of XML.
        arrays = b"".join(bytes([0xAA]) + bytes([number + 1]) * 10 for number in range(7))
        text = b"\x5a" + b"x" * 10
        body = b"bplist00" + arrays + text
        offsets = [8 + 11 * number for number in range(8)]
        bomb = body + bytes(offsets) + bytes(6) + struct.pack(">BBQQQ", 1, 1, 8, 0, len(body))
        deep = binary_nesting(depth)
        for bad, way in ((xml, "memfd"), (deep, "memfd"), (bomb, "in line")):
            before_it = self.daemon.cpu_seconds()
            self.assertEqual(client.set_preference(DOMAIN, "bomb", bad, way), 5)
            self.assertLess(self.daemon.cpu_seconds() - before_it, 2)
        self.assertEqual(client.copy_preference(DOMAIN, "bomb"), b"")
        self.assertLess(self.daemon.resident_kib() - before, 64 * 1024)


def binary_nesting(depth):
    """`depth` arrays, each holding the next."""
    size = 4
    objects = b"".join(b"\xa1" + (number + 1).to_bytes(size, "big") for number in range(depth)) + b"\x09"
    offsets = [8 + (1 + size) * number for number in range(depth + 1)]
    table = b"".join(offset.to_bytes(4, "big") for offset in offsets)
    return (b"bplist00" + objects + table + bytes(6)
            + struct.pack(">BBQQQ", 4, size, depth + 1, 0, 8 + len(objects)))


if __name__ == "__main__":
    main()
