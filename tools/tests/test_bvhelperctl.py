#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""bvhelperctl and brenvik-standin as a person or a script runs them, against a helper played by the test.

usage: test_bvhelperctl.py [unittest arguments]; BRENVIK_BUILD names the build folder.
"""
import base64
import contextlib
import json
import os
import pathlib
import plistlib
import pty
import pwd
import shutil
import signal
import socket
import struct
import subprocess
import tempfile
import threading
import unittest

import fake_helper
import schema
from fake_helper import FakeHelper

BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
ALLOW = "com.norvale.Teravox.BrenvikHelper.allow"
XML = plistlib.dumps


class ToolTest(unittest.TestCase):
    def setUp(self):
        folder = tempfile.TemporaryDirectory(prefix="bvhelperctl-")
        self.addCleanup(folder.cleanup)
        self.folder = pathlib.Path(folder.name)
        self.socket = self.folder / "helper"

    def helper(self, answer=None, refusal=0):
        helper = FakeHelper(self.socket, answer, refusal)
        self.addCleanup(helper.close)
        return helper

    def run_tool(self, *arguments, status=0, cwd=None, given=""):
        """Runs bvhelperctl and returns what it printed on standard output and standard error."""
        done = subprocess.run([BUILD / "bvhelperctl", "--socket", self.socket, *arguments], capture_output=True,
                              text=True, timeout=60, cwd=cwd, input=given)
        self.assertEqual(done.returncode, status, (arguments, done.stdout, done.stderr))
        return done.stdout, done.stderr

    def json(self, *arguments, status=0):
        out, err = self.run_tool("--json", *arguments, status=status)
        self.assertEqual(err, "")
        self.assertEqual(out.count("\n"), 1)
        return schema.check(json.loads(out), arguments)

    def asked(self, helper, *arguments, says=None, notes="", **more):
        """The one request that a command makes."""
        helper.requests.clear()
        out, err = self.run_tool(*arguments, **more)
        self.assertRegex(err, f"\\A{notes}\\Z")
        if says is not None:
            self.assertEqual(out, says + "\n")
        self.assertEqual(len(helper.requests), 1)
        return helper.requests[0]


class Requests(ToolTest):
    """What each command asks for, and says when it is done."""

    def test_ping_checks_in_and_asks_for_nothing(self):
        helper = self.helper()
        self.assertEqual(self.run_tool("ping"), ("the helper answers\n", ""))
        self.assertEqual(helper.requests, [])
        self.assertEqual(self.json("ping"), {"ok": True, "routine": "BVMobileHelperCheckIn", "code": 0})

    def test_preferences_are_set_with_every_type(self):
        helper = self.helper()
        plist = self.folder / "value.plist"
        plist.write_bytes(XML({"a": [1, b"x"]}))
        for arguments, value in [
            (["text"], "text"), (["--type", "string", "K\u00f6ln"], "K\u00f6ln"), ([""], ""),
            (["--type", "integer", "-12"], -12), (["--type", "integer", "18446744073709551615"], 2**64 - 1),
            (["--type", "real", "-0.5"], -0.5), (["--type", "bool", "yes"], True), (["--type", "bool", "false"], False),
            (["--type", "data", "Zm9v"], b"foo"), (["--", "--dashed"], "--dashed"), (["[x]"], "[x]"),
        ]:
            request = self.asked(helper, "prefs", "set", "com.norvale.carrier", "Key", *arguments,
                                 says="set Key of com.norvale.carrier")
            self.assertEqual(request.id, 8683555)
            self.assertEqual(request.text(52, 256), "com.norvale.carrier")
            self.assertEqual(request.text(308, 256), "Key")
            self.assertEqual(plistlib.loads(request.region()), value)
        request = self.asked(helper, "prefs", "set", "d", "k", "--type", "plist-file", str(plist))
        self.assertEqual(request.region(), plist.read_bytes())

    def test_a_large_value_arrives_whole(self):
        helper = self.helper()
        plist = self.folder / "value.plist"
        plist.write_bytes(XML(["x" * 100_000]))
        request = self.asked(helper, "prefs", "set", "d", "k", "--type", "plist-file", str(plist))
        self.assertEqual(request.region(), plist.read_bytes())

    def test_a_preference_is_deleted_by_a_value_of_one_byte(self):
        helper = self.helper()
        request = self.asked(helper, "prefs", "delete", "d", "k", says="removed k of d")
        self.assertEqual(request.id, 8683555)
        self.assertEqual(len(request.region()), 1)

    def test_preferences_are_shown(self):
        value = {"Name": "Norvale", "List": [1, 2.5, True], "Data": b"foo"}
        helper = self.helper(lambda request: request.payload(XML(value, sort_keys=False)))
        for words, message_id in [("get", 8683556), ("get-app", 8683557)]:
            request = self.asked(helper, "prefs", words, "domain", "key",
                                 says="Name: Norvale\nList:\n  - 1\n  - 2.5\n  - true\nData: <3 bytes: 66 6f 6f>")
            self.assertEqual(request.id, message_id)
            self.assertEqual((request.text(32, 256), request.text(288, 256)), ("domain", "key"))
        self.assertEqual(self.json("prefs", "get", "d", "k"), {
            "ok": True, "routine": "BVMobileHelperCopyPreferenceValue", "code": 0, "found": True,
            "value": {"Name": "Norvale", "List": [1, 2.5, True],
                      "Data": {"base64": base64.b64encode(b"foo").decode()}}})

    def test_a_preference_that_is_not_there_is_no_failure_but_has_its_own_status(self):
        helper = self.helper(lambda request: request.payload(b""))
        self.asked(helper, "prefs", "get", "d", "k", says="(no value)", status=3)
        answer = self.json("prefs", "get", "d", "k", status=3)
        self.assertEqual((answer["ok"], answer["found"], answer["value"]), (True, False, None))

    def test_a_value_in_sealed_memory_is_shown_too(self):
        text = "x" * 200_000
        helper = self.helper(lambda request: request.payload(XML(text), in_line=False))
        self.asked(helper, "prefs", "get", "d", "k", says=text)

    def test_a_property_list_file_is_named_by_its_absolute_path(self):
        helper = self.helper(lambda request: request.payload(XML({"k": "v"})))
        request = self.asked(helper, "plist", "load", "a.plist", says="k: v", cwd=self.folder)
        self.assertEqual(request.id, 8683572)
        self.assertEqual(request.text(32, 256), f"{self.folder}/a.plist")

    def test_voicemail(self):
        helper = self.helper()
        request = self.asked(helper, "voicemail", "set-token", "T", says="set the voicemail token")
        self.assertEqual((request.id, request.text(32, 256)), (8683549, "T"))
        request = self.asked(helper, "voicemail", "set-token", "--key", "K", "T", says="set the voicemail token for K")
        self.assertEqual((request.id, request.text(32, 256), request.text(288, 256)), (8683550, "K", "T"))
        request = self.asked(helper, "voicemail", "clear", says="cleared the voicemail token")
        self.assertEqual((request.id, len(request.data)), (8683551, 24))
        request = self.asked(helper, "voicemail", "reset", says="cleared the voicemail token and removed every record")
        self.assertEqual(request.id, 8683552)
        helper.answer = lambda request: request.string("secret", 256)
        request = self.asked(helper, "voicemail", "token", "--key", "K", says="secret")
        self.assertEqual((request.id, request.text(32, 256)), (8683553, "K"))
        request = self.asked(helper, "voicemail", "token", says="secret")
        self.assertEqual(request.id, 8683554)
        self.assertEqual(self.json("voicemail", "token")["token"], "secret")
        helper.answer = lambda request: request.string("", 256)
        self.asked(helper, "voicemail", "token", says="(no token)", status=3)
        helper.answer = lambda request: request.boolean(1)
        self.assertEqual(self.asked(helper, "voicemail", "subscribed", says="subscribed").id, 8683561)
        helper.answer = lambda request: request.boolean(0)
        self.asked(helper, "voicemail", "subscribed", says="not subscribed")
        self.assertIs(self.json("voicemail", "subscribed")["subscribed"], False)

    def test_carrier(self):
        helper = self.helper()
        request = self.asked(helper, "carrier", "replace-link", "rel/target", "/l", "--domain", "d",
                             says="/l -> rel/target")
        self.assertEqual(request.id, 8683558)
        self.assertEqual([request.text(at, 1024) for at in (32, 1056, 2080)], ["rel/target", "/l", "d"])
        request = self.asked(helper, "carrier", "create-link", "t", "l", cwd="/", says="/l -> t")
        self.assertEqual((request.id, request.text(32, 1024), request.text(1056, 1024)), (8683559, "t", "/l"))
        request = self.asked(helper, "carrier", "remove", "/f", says="removed /f")
        self.assertEqual((request.id, request.text(32, 1024), request.text(1056, 1024)), (8683560, "/f", ""))
        helper.answer = lambda request: request.boolean(1)
        request = self.asked(helper, "carrier", "copy-file", "/s", "/d", "n", says="copied n from /s to /d")
        self.assertEqual(request.id, 8683564)
        self.assertEqual([request.text(at, 256) for at in (32, 288, 544)], ["/s", "/d", "n"])
        request = self.asked(helper, "carrier", "copy-crash-logs", "/c", says="copied /c to the crash logs")
        self.assertEqual((request.id, request.text(32, 256)), (8683565, "/c"))
        request = self.asked(helper, "carrier", "move-bundle", "/s", "/d", "n", says="moved /s to /d/n")
        self.assertEqual(request.id, 8683566)
        self.assertEqual([request.text(at, 256) for at in (32, 288, 544)], ["/s", "/d", "n"])
        request = self.asked(helper, "carrier", "unpack", "/a.zip", "/d", says="unpacked /a.zip into /d")
        self.assertEqual((request.id, request.text(32, 256), request.text(288, 256)), (8683571, "/a.zip", "/d"))

    def test_switches(self):
        helper = self.helper()
        for command, message_id, text in [("heartbeat", 8683562, "cellular heartbeat"),
                                          ("radio-logs", 8683570, "radio manager logs")]:
            # What keeps it from having an effect here depends on the machine.
            for state, value, notes in [("on", 1, "(bvhelperctl: note: .*\n)*"), ("off", 0, "")]:
                request = self.asked(helper, command, state, says=f"{text} {state}", notes=notes)
                self.assertEqual((request.id, request.integer()), (message_id, value))

    def test_database_check(self):
        helper = self.helper()
        for arguments, mask in [([], 31), (["--type", "gsm"], 8), (["--type", "lte", "--type", "umts"], 5),
                                (["--mask", "-1"], -1), (["--mask", "0"], 0)]:
            request = self.asked(helper, "lasd", "check", *arguments)
            self.assertEqual((request.id, request.integer()), (8683563, mask))
        self.assertEqual(self.json("lasd", "check", "--type", "cdma")["mask"], 2)

    def test_location(self):
        helper = self.helper()
        request = self.asked(helper, "location", "civic", "-33.5", "151.25")
        self.assertEqual((request.id, request.double(32), request.double(40)), (8683567, -33.5, 151.25))
        self.assertEqual(self.asked(helper, "location", "wan-ip").id, 8683569)
        helper.answer = lambda request: request.string("DE", 64)
        self.assertEqual(self.asked(helper, "location", "country", says="DE").id, 8683568)
        self.assertEqual(self.json("location", "country")["country"], "DE")
        helper.answer = lambda request: request.string("", 64)
        self.asked(helper, "location", "country", says="(not known)", status=3)

    def test_labels_are_asked_for_in_the_order_given(self):
        helper = self.helper(lambda request: request.payload(XML(["G", "M"])))
        request = self.asked(helper, "labels", "badges", "--text", "My line", "--label", "cell-data", "--language", "de",
                             "--text", "Other", "--language", "en", says="G\nM")
        self.assertEqual(request.id, 8683573)
        self.assertEqual(plistlib.loads(request.region(28)), ["", "My line", "USER_LABEL_CELL_DATA", "", "", "Other"])
        self.assertEqual(plistlib.loads(request.region(44)), ["de", "en"])
        request = self.asked(helper, "labels", "localized", "--label", "business", "--label", "USER_LABEL_own",
                             says="G\nM")
        self.assertEqual(request.id, 8683574)
        self.assertEqual(plistlib.loads(request.region(28)), ["USER_LABEL_BUSINESS", "USER_LABEL_own"])
        self.assertEqual(plistlib.loads(request.region(44)), [])
        self.assertEqual(self.json("labels", "localized", "--label", "travel")["labels"], ["G", "M"])

    def test_contacts(self):
        helper = self.helper(lambda request: request.boolean(1))
        try:
            store = pathlib.Path(pwd.getpwnam("mobile").pw_dir, "Library", "AddressBook", "contacts.db").exists()
        except KeyError:
            store = False
        says = "remapped contacts from old to new" if store else "no contacts to move: there is no contacts store"
        request = self.asked(helper, "contacts", "remap", "old", "new", says=says)
        self.assertEqual((request.id, request.text(32, 64), request.text(96, 64)), (8683575, "old", "new"))
        self.assertEqual(self.json("contacts", "remap", "old", "new")["store"], store)


class Input(ToolTest):
    """Values that come from standard input or a file."""

    def setUp(self):
        super().setUp()
        self.file = self.folder / "given"
        self.fake = self.helper()

    def stored(self, *arguments, **more):
        return plistlib.loads(self.asked(self.fake, "prefs", "set", "d", "k", *arguments, **more).region())

    def test_a_value_from_standard_input_or_a_file(self):
        self.file.write_text("from a file\n")
        self.assertEqual(self.stored("-", given="from standard input\n"), "from standard input")
        self.assertEqual(self.stored(f"@{self.file}"), "from a file")
        self.assertEqual(self.stored("@given", cwd=self.folder), "from a file")
        self.assertEqual(self.stored("-", given="two\n\n"), "two\n")  # one newline is the file's own
        self.assertEqual(self.stored("--type", "integer", "-", given="42\n"), 42)
        self.assertEqual(self.stored("--type", "bytes", "-", given="\0\1\n"), b"\0\1\n")
        for form in (plistlib.FMT_XML, plistlib.FMT_BINARY):
            self.file.write_bytes(plistlib.dumps({"a": [1]}, fmt=form))
            self.assertEqual(self.stored("--type", "plist-file", f"@{self.file}"), {"a": [1]})
        self.assertEqual(self.stored("--type", "plist-file", "-", given=XML([7]).decode()), [7])

    def test_a_value_that_looks_like_a_file_can_be_given(self):
        for value in ("-", "@", "@none", "@@"):
            self.assertEqual(self.stored("--literal", value), value)
        self.assertEqual(self.stored("a@b"), "a@b")

    def test_tokens_and_keys_and_labels(self):
        self.file.write_text("secret\n")
        request = self.asked(self.fake, "voicemail", "set-token", "-", given="secret")
        self.assertEqual(request.text(32, 256), "secret")
        request = self.asked(self.fake, "voicemail", "set-token", "--key", f"@{self.file}", "-", given="token\n")
        self.assertEqual((request.text(32, 256), request.text(288, 256)), ("secret", "token"))
        self.fake.answer = lambda request: request.payload(XML(["S"]))
        request = self.asked(self.fake, "labels", "badges", "--text", f"@{self.file}", says="S")
        self.assertEqual(plistlib.loads(request.region(28)), ["", "secret"])

    def test_what_cannot_be_read_is_told_and_nothing_is_sent(self):
        self.file.write_bytes(b"\xff secret")
        for arguments, message in [
            (["prefs", "set", "d", "k", "@none"], "cannot read none: No such file or directory"),
            (["prefs", "set", "d", "k", "@"], "cannot read : No such file or directory"),
            (["voicemail", "set-token", f"@{self.folder}"], f"cannot read {self.folder}: Is a directory"),
            (["voicemail", "set-token", "--key", "-", "-"], "TOKEN: standard input was already read for --key"),
            (["voicemail", "set-token", f"@{self.file}"], "TOKEN: what was read is not UTF-8"),
            (["prefs", "set", "d", "k", f"@{self.file}"], "what was read is not UTF-8"),
            (["voicemail", "set-token", "@/dev/zero"], "/dev/zero is larger than any value can be"),
        ]:
            with self.subTest(arguments=arguments):
                _, err = self.run_tool(*arguments, status=2, cwd=self.folder)
                self.assertEqual(err, f"bvhelperctl: {message}\n")
        _, err = self.run_tool("voicemail", "set-token", "-", status=2, given="a\0b")
        self.assertEqual(err, "bvhelperctl: TOKEN: a NUL cannot be part of it\n")
        self.assertEqual(self.fake.requests, [])

    def test_nothing_to_read_is_an_error_and_not_an_empty_value(self):
        self.file.write_text("\n")
        for arguments, name in [(["set-token", "-"], "TOKEN"), (["set-token", f"@{self.file}"], "TOKEN"),
                                (["set-token", "--key", "-", "T"], "--key")]:
            with self.subTest(arguments=arguments):
                _, err = self.run_tool("voicemail", *arguments, status=2, given="")
                self.assertEqual(err, f"bvhelperctl: {name}: what was read is empty\n"
                                      'An empty value is given as an argument: "".\n')
        self.assertEqual(self.fake.requests, [])
        self.assertEqual(self.asked(self.fake, "voicemail", "set-token", "").text(32, 256), "")

    def test_a_closed_standard_input_is_an_error(self):
        done = subprocess.run(["sh", "-c", f'exec "{BUILD}/bvhelperctl" --socket "$1" voicemail set-token - <&-', "sh",
                               self.socket], capture_output=True, text=True, timeout=60)
        self.assertEqual((done.returncode, done.stderr),
                         (2, "bvhelperctl: cannot read standard input: Bad file descriptor\n"))

    def test_a_value_that_could_not_be_read_back_is_refused(self):
        advice = "--type bytes stores any bytes as data; prefs get --raw reads them back."
        document = self.folder / "value.plist"
        document.write_bytes(plistlib.dumps({"k": ["\x01"]}, fmt=plistlib.FMT_BINARY))
        for arguments in (["\x1b[31m"], ["a\x7f\x01"], ["--type", "plist-file", str(document)]):
            _, err = self.run_tool("prefs", "set", "d", "k", *arguments, status=2)
            self.assertIn("VALUE cannot be read back as XML: a text in it holds a control character", err)
            self.assertEqual(err.splitlines()[1], advice)
        self.assertEqual(self.fake.requests, [])
        self.assertEqual(self.stored("tab\tand\nnewline"), "tab\tand\nnewline")

    def test_bytes_are_read_back_as_they_are(self):
        for value, wanted in [(b"\0\xff\n", b"\0\xff\n"), ("text", b"text"), (12, b"12\n")]:
            self.fake.answer = lambda request: request.payload(XML(value))
            for command in ("get", "get-app"):
                done = subprocess.run([BUILD / "bvhelperctl", "--socket", self.socket, "prefs", command, "--raw", "d", "k"],
                                      capture_output=True, timeout=60)
                self.assertEqual((done.returncode, done.stdout, done.stderr), (0, wanted, b""))


class Refusals(ToolTest):
    """The helper was there and said no."""

    def test_a_caller_without_the_entitlement_is_told_what_to_do(self):
        self.helper(refusal=35)
        out, err = self.run_tool("ping", status=4)
        self.assertEqual(out, "")
        lines = err.splitlines()
        self.assertEqual(lines.pop(0), f"bvhelperctl: refused: the caller lacks the entitlement {ALLOW}")
        program = (BUILD / "bvhelperctl").stat()
        if program.st_uid != 0 or program.st_mode & 0o022:
            self.assertEqual(lines.pop(0), "This program must belong to root first, and be writable by nobody else.")
        self.assertIn("/etc/brenvik/entitlements.d/bvhelperctl.plist", lines[0])
        # What it says is a good entitlement file for this very program.
        advice = plistlib.loads("\n".join(line.strip() for line in lines[1:]).encode())
        self.assertEqual(advice["Executable"], str((BUILD / "bvhelperctl").resolve()))
        self.assertEqual(advice["Entitlements"], {ALLOW: True})
        self.assertIn("User", advice)
        answer = self.json("heartbeat", "on", status=4)
        self.assertEqual(answer, {"ok": False, "routine": "BVMobileHelperCellularHeartbeat", "code": 35,
                                  "error": f"refused: the caller lacks the entitlement {ALLOW}",
                                  "advice": "\n".join(err.splitlines()[1:])})

    def test_a_program_that_others_may_change_is_told_to_mend_that_first(self):
        self.helper(refusal=35)
        copy = self.folder / "bvhelperctl"
        shutil.copy(BUILD / "bvhelperctl", copy)
        copy.chmod(0o775)
        done = subprocess.run([copy, "--socket", self.socket, "ping"], capture_output=True, text=True, timeout=60)
        self.assertEqual(done.returncode, 4)
        self.assertEqual(done.stderr.splitlines()[1],
                         "This program must belong to root first, and be writable by nobody else.")

    def test_codes_are_explained(self):
        for arguments, code, message in [
            (["prefs", "set", "d", "k", "v"], 5, "the helper could not do it (code 5)"),
            (["plist", "load", "/x"], 9, "/x is missing, not readable for the helper, or no property list with a "
                                         "dictionary on top (code 9)"),
            (["carrier", "replace-link", "t", "/l"], 8,
             "refused: /l is not one of the carrier links and files that may be replaced, or is a folder"),
            (["carrier", "remove", "/f"], 8, "refused: /f is no carrier file: not listed, not in the carrier bundles, "
                                             "no package in /tmp"),
            (["carrier", "create-link", "t", "/l"], 5,
             "/l cannot be made: its folder is missing, or may not be written by the helper (code 5)"),
            (["carrier", "replace-link", "t", "/l"], 5,
             "/l cannot be made: its folder is missing, or may not be written by the helper (code 5)"),
            (["carrier", "remove", "/f"], 5,
             "/f cannot be removed: it is missing, a folder with something in it, or read-only (code 5)"),
            (["labels", "badges", "--label", "USER_LABEL_own"], 5, "the helper knows none of these labels (code 5)"),
            (["radio-logs", "on"], 46, "not supported by this build of the helper (code 46)"),
            (["heartbeat", "on"], -304, "the helper found the request malformed (code -304)"),
            (["location", "country"], 4711, "the helper answered with a code of its system (code 4711)"),
        ]:
            with self.subTest(arguments=arguments), FakeHelper(self.socket, lambda request: request.status(code)):
                status = {8: 4, -304: 7}.get(code, 1)
                out, err = self.run_tool(*arguments, status=status)
                self.assertEqual((out, err), ("", f"bvhelperctl: {message}\n"))
                answer = self.json(*arguments, status=status)
                self.assertEqual((answer["ok"], answer["code"], answer["error"]), (False, code, message))
            self.socket.unlink()

    def test_work_that_failed_is_a_failure(self):
        self.helper(lambda request: request.boolean(0))
        for arguments, what in [
            (["carrier", "copy-file", "/s", "/d", "n"], "did not copy n from /s to /d"),
            (["carrier", "copy-crash-logs", "/c"], "did not copy /c"),
            (["carrier", "move-bundle", "/s", "/d", "n"], "did not move /s to /d/n"),
            (["carrier", "unpack", "/a", "/d"], "did not unpack /a into /d"),
            (["contacts", "remap", "a", "b"], "did not move contacts from a to b"),
        ]:
            out, err = self.run_tool(*arguments, status=1)
            self.assertEqual((out, err), ("", f"bvhelperctl: {what}; the helper's log tells why\n"))
            self.assertEqual(self.json(*arguments, status=1)["code"], 0)

    def test_a_value_that_is_no_property_list_is_a_failure(self):
        self.helper(lambda request: request.payload(b"\x1b[31m"))
        _, err = self.run_tool("prefs", "get", "d", "k", status=7)
        self.assertEqual(err, "bvhelperctl: the helper returned something that is no property list\n")
        self.run_tool("labels", "badges", "--label", "travel", status=7)

    def test_nothing_that_the_helper_sends_steers_the_terminal(self):
        self.helper(lambda request: request.string("\x1b]0;x\x07", 256))
        out, _ = self.run_tool("voicemail", "token")
        self.assertEqual(out, "\\x1b]0;x\\x07\n")


class Unusable(ToolTest):
    """Wrong usage, or no helper that answers."""

    def test_no_helper(self):
        out, err = self.run_tool("ping", status=5)
        self.assertEqual(out, "")
        self.assertEqual(err.splitlines()[0],
                         f"bvhelperctl: cannot reach the helper at {self.socket}: No such file or directory")
        answer = self.json("ping", status=5)
        self.assertEqual((answer["ok"], answer["code"]), (False, -7004))

    def test_a_socket_that_nobody_serves(self):
        with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as dead:
            dead.bind(str(self.socket))
        _, err = self.run_tool("ping", status=5)
        self.assertIn("Connection refused", err)

    def test_a_helper_that_does_not_answer(self):
        self.helper(lambda request: None)
        _, err = self.run_tool("--timeout", "0.05", "location", "country", status=6)
        self.assertEqual(err.splitlines()[0], "bvhelperctl: no answer in 0.05 s")

    def test_a_helper_that_lies(self):
        self.helper(lambda request: request.status(0)[:-1])
        _, err = self.run_tool("location", "country", status=7)
        self.assertEqual(err, "bvhelperctl: the answer breaks the protocol\n")

    def test_wrong_usage_is_told_without_a_helper(self):
        (self.folder / "no.plist").write_text("no property list")
        for arguments, message in [
            ([], "a command is required"),
            (["frobnicate"], 'unknown command "frobnicate"'),
            (["pign"], 'unknown command "pign"; did you mean "ping"?'),
            (["pref", "get"], 'unknown command "pref"; did you mean "prefs"?'),
            (["prefs", "gte", "d", "k"], 'unknown command "prefs gte"; did you mean "prefs get"?'),
            (["country"], 'unknown command "country"; did you mean "location country"?'),
            (["\x1b[31m"], 'unknown command "\\x1b[31m"'),
            (["prefs", "set", "d", "k", "--tpye", "real", "1"], 'not expected: --tpye; did you mean "--type"?'),
            (["prefs", "set", "d", "k", "v", "--type"], "--type: TYPE is missing"),
            (["prefs", "set", "d", "k", "v", "--type", "real", "--type=bool"], "--type is given twice"),
            (["ping", "--json=yes"], "--json takes no value"),
            (["location", "wan-ip", "--directory", "/x"], "--directory needs --wait"),
            (["prefs"], '"prefs" needs one of these behind it: set, get, get-app, delete'),
            (["ping", "pong"], "not expected: pong"),
            (["--frob", "ping"], "not expected: --frob"),
            (["prefs", "get", "d"], "KEY is required"),
            (["prefs", "set", "d", "k", "x", "--type", "integer"], '"x" is not an integer of 64 bits'),
            (["prefs", "set", "d", "k", "", "--type", "real"], '"" is not a number'),
            (["prefs", "set", "d", "k", "on", "--type", "bool"], '"on" is not true or false'),
            (["prefs", "set", "d", "k", "%", "--type", "data"], '"%" is not base64'),
            (["prefs", "set", "d", "k", "v", "--type", "date"],
             '--type: "date" is not one of: string, integer, real, bool, data, bytes, plist-file'),
            (["prefs", "set", "d", "k", "--type", "plist-file", f"{self.folder}/none"],
             f"cannot read {self.folder}/none: No such file or directory"),
            (["prefs", "set", "d", "k", "--type", "plist-file", f"{self.folder}"],
             f"cannot read {self.folder}: Is a directory"),
            (["prefs", "set", "d", "k", "--type", "plist-file", f"{self.folder}/no.plist"],
             f"{self.folder}/no.plist is not a property list"),
            (["prefs", "get", "d", "k" * 256], "KEY: at most 255 bytes"),
            (["prefs", "set", "d" * 250, "k", "v"], "DOMAIN: at most 249 bytes"),
            (["prefs", "set", "../evil", "k", "v"],
             'DOMAIN: "../evil" names no file: it is empty, "." or "..", or holds a slash'),
            (["prefs", "delete", "", "k"], 'DOMAIN: "" names no file: it is empty, "." or "..", or holds a slash'),
            (["prefs", "get", b"\xff", "k"], 'DOMAIN: "\\xff" is not UTF-8'),
            (["contacts", "remap", "f" * 64, "t"], "FROM: at most 63 bytes"),
            (["heartbeat", "maybe"], 'STATE: "maybe" is not one of: on, off'),
            (["lasd", "check", "--type", "5g"], '--type: "5g" is not one of: gsm, umts, cdma, lte, scdma'),
            (["lasd", "check", "--mask", "x"], '--mask: "x" is not an integer of 32 bits'),
            (["lasd", "check", "--mask", "1", "--type", "gsm"],
             "--mask and --type say the same: give one of them"),
            (["location", "civic", "91", "0"], 'LATITUDE: "91" is not a latitude, -90 to 90'),
            (["labels", "badges"], "no label given"),
            (["labels", "localized", "--label", "work"], '--label: "work" is not one of: primary, secondary, personal, '
             "business, travel, cell-data, or a key that begins with USER_LABEL_"),
            (["watch", "--count", "0"], '--count: "0" is not a number of at least 1'),
            (["watch", "--helper-uid", "-1"], '--helper-uid: "-1" is not a user\'s number'),
            (["--timeout", "nan", "ping"], '--timeout: "nan" is not a number of seconds, 0.001 to 4000000'),
            (["--timeout", "soon", "ping"], '--timeout: "soon" is not a number of seconds, 0.001 to 4000000'),
            (["ping", "--timeout", "0"], '--timeout: "0" is not a number of seconds, 0.001 to 4000000'),
        ]:
            with self.subTest(arguments=arguments):
                out, err = self.run_tool(*arguments, status=2)
                self.assertEqual((out, err.splitlines()[0]), ("", f"bvhelperctl: {message}"))
                answer = self.json(*arguments, status=2)
                self.assertEqual(answer.pop("advice", ""), "\n".join(err.splitlines()[1:]))
                self.assertEqual(answer, {"ok": False, "error": message})

    def test_help_and_version_are_no_failures(self):
        for arguments in (["--help"], ["prefs", "--help"], ["prefs", "set", "--help"], ["--version"], ["-h"]):
            out, err = self.run_tool(*arguments)
            self.assertNotEqual(out, "")
            self.assertEqual(err, "")

    def test_help_and_version_are_objects_for_programs(self):
        version = self.json("--version")
        self.assertEqual((version["program"], self.run_tool("--version")[0]),
                         ("bvhelperctl", f"bvhelperctl {version['version']}\n"))
        commands = [each["command"] for each in self.json("--help")["commands"]]
        self.assertEqual(set(commands), schema.commands())
        self.assertEqual([each["command"] for each in self.json("plist", "--help")["commands"]], ["plist load"])
        entry, = self.json("prefs", "set", "--help")["commands"]
        self.assertEqual([each["name"] for each in entry["arguments"]], ["DOMAIN", "KEY", "VALUE"])
        self.assertIn("plist-file", entry["options"][0]["choices"])

    def test_the_help_of_a_command_says_where_the_options_of_all_are(self):
        hint = "--json, --timeout and --socket may stand here, too: see bvhelperctl --help."
        for arguments, wanted in [([], False), (["prefs"], True), (["prefs", "set"], True), (["ping"], True)]:
            out, _ = self.run_tool(*arguments, "--help")
            self.assertEqual(hint in out, wanted, arguments)
            self.assertIn("Exit status: 0 done;", out)

    def test_a_socket_path_that_is_none(self):
        for self.socket in (self.folder / ("x" * 120), ""):
            _, err = self.run_tool("ping", status=2)
            self.assertEqual(err, "bvhelperctl: --socket: the path is empty or too long for a socket\n")


class Status(ToolTest):
    """What a helper tells at its status socket, played by the test."""

    LEAST = {"version": "0.1.0", "process": "77", "running-ms": "5000", "clients": "0", "busy-tokens": "0"}

    def answer(self, *texts):
        """Each connection gets the next text, or is closed without a word; after the last one nobody listens."""
        listening = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        path = f"{self.socket}.status"
        with contextlib.suppress(FileNotFoundError):
            os.unlink(path)
        listening.bind(path)
        listening.listen(8)

        def serve():
            with listening:
                for text in texts:
                    connection, _ = listening.accept()
                    with connection:
                        if text is None:
                            connection.recv(1)  # until the other side gives up
                        elif text:
                            connection.send(text if isinstance(text, bytes) else text.encode())
        thread = threading.Thread(target=serve, daemon=True)
        thread.start()
        self.addCleanup(thread.join, 20)

    def text(self, *more, **facts):
        lines = [f"{key}={value}" for key, value in {**self.LEAST, **facts}.items()]
        return "\n".join(["brenvik-status=1", *lines, *more]) + "\n"

    def test_all_that_a_helper_tells_is_shown(self):
        told = self.text("executable=/none", "socket=/run/service", "busy=database-check 2", "busy=heartbeat 1",
                         "heartbeat=yes", "heartbeat-sent=1 40", "heartbeat-received=0 0", "database=gsm updated 3000",
                         "database=umts checking 100", "location-answer=timed-out 7300000", "worker=callers running",
                         "worker=network running", "worker=stores stopped", "a-newer-key=x", **{"busy-tokens": 3, "clients": 2})
        self.answer(told, told)
        out, err = self.run_tool("status")
        lines = out.splitlines()
        self.assertRegex(lines.pop(0), r"^helper        running since \d{4}-\d\d-\d\dT\d\d:\d\d:\d\dZ \(5 s\), process 77$")
        self.assertEqual(lines, [
            "version       0.1.0", "socket        /run/service, which is missing",
            "held by       2 clients, a database check, the heartbeat", "busy tokens   3",
            "heartbeat     on, 1 packet (40 bytes) sent, 0 packets (0 bytes) received",
            "databases     gsm: updated, 3 s ago", "              umts: checking, since 0 s",
            "location      last request timed out, 2 h ago", "workers       callers: running",
            "              network: running", "              stores: not running"])
        self.assertEqual(err, "")
        answer = self.json("status")
        self.assertEqual((answer["version"], answer["installed"], answer["restartPending"]), ("0.1.0", None, False))
        self.assertEqual(answer["heldBy"], ["2 clients", "a database check", "the heartbeat"])
        self.assertEqual(answer["heartbeat"], {"on": True, "sent": {"packets": 1, "bytes": 40},
                                               "received": {"packets": 0, "bytes": 0}})
        self.assertEqual([(each["type"], each["outcome"], each["age"]) for each in answer["databases"]],
                         [("gsm", "updated", 3.0), ("umts", "checking", 0.1)])
        self.assertEqual(answer["locationAnswer"], {"outcome": "timed-out", "age": 7300.0})
        self.assertEqual(answer["workers"], [{"name": "callers", "running": True}, {"name": "network", "running": True},
                                             {"name": "stores", "running": False}])

    def test_a_pending_restart_waits_for_busy_tokens(self):
        replaced = self.text("replaced=yes")
        self.answer(replaced, *(self.text("replaced=yes", **{"busy-tokens": count}) for count in (1, 2)))
        notes = [self.run_tool("status")[1] for _ in range(3)]
        for note in notes:
            self.assertIn("restart pending", note)
            self.assertIn("when it is idle, or by systemctl stop brenvik-mobile-helper.service", note)
        self.assertNotIn("too early", notes[0])
        for note, count in zip(notes[1:], ("1 busy token", "2 busy tokens")):
            self.assertTrue(note.endswith(f"brenvik-mobile-helper.service, for which it is too early: {count}\n"), note)

    def test_an_idle_helper_says_when_it_leaves(self):
        self.answer(self.text("leaves-in-ms=6001"), self.text("leaves-in-ms=6001", "kept-by-baseband=yes"))
        self.assertIn("held by       nothing: idle, leaves in 7 s\n", self.run_tool("status")[0])
        self.assertIn("held by       the hosted baseband server\n", self.run_tool("status")[0])

    def test_nothing_that_is_told_steers_the_terminal(self):
        hostile = self.text(version="1\x1b[31m", executable="/\x1b]0;x\x07")
        self.answer(hostile, hostile, hostile.encode().replace(b"31m", b"\xff"))
        self.assertNotIn("\x1b", "".join(self.run_tool("status")))
        self.json("status")
        self.json("status")

    def test_what_is_no_status_is_not_understood(self):
        for text in ("hello\n", "brenvik-status=2\n", self.text().replace("version", "revision"), self.text() + "x" * 20000,
                     self.text(clients="many")):
            self.answer(text)
            answer = self.json("status", status=7)
            self.assertIn("is no status", answer["error"])

    def test_a_connection_that_is_closed_without_a_word_is_tried_again(self):
        self.answer("", "", self.text())
        self.assertEqual(self.json("status")["pid"], 77)

    def test_a_helper_that_does_not_answer_is_given_up(self):
        self.answer(None)
        out, err = self.run_tool("--timeout", "0.3", "status", status=6)
        self.assertEqual(out, "")
        self.assertIn("bvhelperctl: no status in 0.3 s\n", err)

    def test_nobody_there_is_an_answer(self):
        for make in (lambda: None, self.socket.touch, lambda: (self.socket.unlink(), self.stale(self.socket)),
                     lambda: self.stale(f"{self.socket}.status")):
            make()
            self.assertIs(self.json("status")["running"], False)

    @staticmethod
    def stale(path):
        with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as sock:
            sock.bind(str(path))

    def test_a_path_that_is_none(self):
        for self.socket in (self.folder / ("x" * 120), ""):
            _, err = self.run_tool("status", status=2)
            self.assertEqual(err, "bvhelperctl: --socket: the path is empty or too long for a socket\n")


class ExitStatuses(ToolTest):
    """One for each way to end; scripts rely on the numbers."""

    def test_0_done(self):
        self.helper()
        self.run_tool("ping", status=0)

    def test_1_failed(self):
        self.helper(lambda request: request.status(5))
        self.run_tool("prefs", "set", "d", "k", "v", status=1)

    def test_1_when_the_helper_only_hints_at_a_failure(self):
        self.helper(lambda request: request.boolean(0))
        _, err = self.run_tool("carrier", "unpack", "/a", "/b", status=1)
        self.assertIn("the helper's log tells why", err)

    def test_2_wrong_usage(self):
        self.run_tool("frobnicate", status=2)

    def test_3_no_such_value(self):
        self.helper(lambda request: request.payload(b""))
        self.run_tool("prefs", "get", "d", "k", status=3)

    def test_4_refused(self):
        self.helper(refusal=35)
        self.run_tool("ping", status=4)

    def test_4_the_path_is_refused(self):
        self.helper(lambda request: request.status(8))
        self.run_tool("carrier", "remove", "/f", status=4)

    def test_5_unreachable(self):
        self.run_tool("ping", status=5)

    def test_6_timed_out(self):
        self.helper(lambda request: None)
        self.run_tool("--timeout", "0.05", "location", "country", status=6)

    def test_7_protocol(self):
        self.helper(lambda request: request.status(0) + b"x")
        self.run_tool("location", "country", status=7)

    def test_8_output_lost(self):
        self.helper()
        with open("/dev/full", "w", encoding="ascii") as full:
            done = subprocess.run([BUILD / "bvhelperctl", "--socket", self.socket, "ping"], stdout=full,
                                  stderr=subprocess.PIPE, text=True, timeout=60)
        self.assertEqual((done.returncode, done.stderr), (
            8, "bvhelperctl: not everything could be written to standard output: No space left on device\n"))

    def test_the_help_names_them_all(self):
        out, _ = self.run_tool("--help")
        for number in range(9):
            self.assertRegex(out, f"[:;] {number} ")


class Output(ToolTest):
    """To the last byte, and only for a person what is for a person."""

    def lost(self, redirection, *arguments, reason):
        done = subprocess.run(["bash", "-c", f'exec "$@" {redirection}', "bash", BUILD / "bvhelperctl", "--socket",
                               self.socket, *arguments], stderr=subprocess.PIPE, text=True, timeout=60)
        self.assertEqual((done.returncode, done.stderr),
                         (8, f"bvhelperctl: not everything could be written to standard output: {reason}\n"))

    def test_a_full_disk(self):
        self.helper(lambda request: request.payload(XML("x" * 300_000), in_line=False))
        for arguments in (["prefs", "get", "d", "k"], ["--json", "prefs", "get", "d", "k"],
                          ["prefs", "get", "--raw", "d", "k"], ["ping"], ["--help"], ["--json", "--version"]):
            self.lost("> /dev/full", *arguments, reason="No space left on device")

    def test_a_reader_that_has_gone(self):
        self.helper(lambda request: request.payload(XML("x" * 300_000), in_line=False))
        reading, writing = os.pipe()
        os.close(reading)
        with os.fdopen(writing, "wb") as pipe:
            done = subprocess.run([BUILD / "bvhelperctl", "--socket", self.socket, "prefs", "get", "d", "k"], stdout=pipe,
                                  stderr=subprocess.PIPE, text=True, timeout=60)
        self.assertEqual((done.returncode, done.stderr),
                         (8, "bvhelperctl: not everything could be written to standard output: Broken pipe\n"))

    def test_a_closed_standard_output_takes_no_socket(self):
        helper = self.helper(lambda request: request.payload(XML("x")))
        self.lost(">&-", "prefs", "get", "d", "k", reason="Bad file descriptor")
        self.assertEqual(len(helper.requests), 1)

    def test_a_failure_keeps_its_own_status(self):
        with open("/dev/full", "w", encoding="ascii") as full:
            done = subprocess.run([BUILD / "bvhelperctl", "--json", "--socket", self.socket, "ping"], stdout=full,
                                  stderr=subprocess.PIPE, timeout=60)
        self.assertEqual(done.returncode, 5)

    def on_a_terminal(self, *arguments, **environment):
        """What bvhelperctl prints when all it has is a terminal."""
        ours, theirs = pty.openpty()
        with os.fdopen(theirs, "wb") as terminal:
            subprocess.run([BUILD / "bvhelperctl", "--socket", self.socket, *arguments], stdin=terminal, stdout=terminal,
                           stderr=terminal, timeout=60, env={"TERM": "xterm", **environment}, check=False)
        shown = b""
        with os.fdopen(ours, "rb", buffering=0) as reader, contextlib.suppress(OSError):  # EIO: the end
            while part := reader.read(65536):
                shown += part
        return shown.decode()

    def test_colours_are_for_terminals(self):
        self.assertIn("\x1b[1;31mbvhelperctl:\x1b[0m unknown command", self.on_a_terminal("frobnicate"))
        self.assertIn("\x1b[1mSubcommands:\x1b[0m", self.on_a_terminal("--help"))
        for environment in ({"NO_COLOR": "1"}, {"TERM": "dumb"}):
            self.assertNotIn("\x1b", self.on_a_terminal("frobnicate", **environment))
            self.assertNotIn("\x1b", self.on_a_terminal("--help", **environment))
        self.assertIn("\x1b[", self.on_a_terminal("frobnicate", NO_COLOR=""))  # empty means: not set
        out, err = self.run_tool("frobnicate", status=2)
        self.assertNotIn("\x1b", out + err)

    def test_what_json_has_not_stays_unambiguous(self):
        values = {"data": b"foo", "nan": float("nan"), "inf": float("-inf"), "text": "nan", "real": 1.0, "one": 1,
                  "marked": {"base64": "Zm9v"}, "nested": {"dictionary": {"date": "x"}}, "two": {"base64": "x", "date": "y"}}
        document = XML(values, sort_keys=False).replace(
            b"<key>two</key>", b"<key>when</key><date>2001-01-01T00:00:00Z</date><key>two</key>")
        self.helper(lambda request: request.payload(document))
        answer = self.json("prefs", "get", "d", "k")["value"]
        self.assertEqual(answer, {
            "data": {"base64": "Zm9v"}, "nan": {"real": "nan"}, "inf": {"real": "-inf"}, "text": "nan", "real": 1.0, "one": 1,
            "marked": {"dictionary": {"base64": "Zm9v"}},
            "nested": {"dictionary": {"dictionary": {"dictionary": {"date": "x"}}}},
            "when": {"date": "2001-01-01T00:00:00Z"}, "two": {"base64": "x", "date": "y"}})
        self.assertEqual((type(answer["real"]), type(answer["one"])), (float, int))

    def test_a_token_that_is_no_utf8_is_not_changed(self):
        self.helper(lambda request: request.status(0, b"\xff\xfe".ljust(256, b"\0")))
        self.assertEqual(self.json("voicemail", "token")["token"], {"base64": "//4="})


def push(message_id, values, reply_port=7):
    data = plistlib.dumps(values, fmt=plistlib.FMT_BINARY, sort_keys=False)
    return (struct.pack("<IIIIIi", 0x80000012, 52, reply_port, 0, 0, message_id) + struct.pack("<I", 1)
            + struct.pack("<QBBBBI", 56, 0, 1, 0, 1, len(data)) + fake_helper.NDR + bytes(4) + data)  # 52, rounded up to 56


def notification(values):
    return struct.pack("<IIIIIi", 0, 24, 0, 0, 0, 0) + plistlib.dumps(values, fmt=plistlib.FMT_BINARY, sort_keys=False)


CIVIC = {"Client": ["BrenvikMobileHelper"], "CountryCode": "DE", "State": "", "City": "K\u00f6ln", "PostalCode": "50667"}
UPDATE = {"Notification": "com.norvale.lasd.UpdateAvailable", "DBType": "gsm"}


class Events(ToolTest):
    """watch and brenvik-standin, with a helper played by the test."""

    def start(self, *command):
        program = subprocess.Popen([BUILD / command[0], *command[1:], "--directory", self.folder],
                                   stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
        self.addCleanup(program.stdout.close)
        self.addCleanup(program.stderr.close)
        self.addCleanup(program.wait)
        self.addCleanup(program.kill)
        self.assertEqual(program.stderr.readline(), f"{command[0]}: listening in {self.folder}\n")
        return program

    def send(self, service, message):
        sock = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
        self.addCleanup(sock.close)
        sock.settimeout(60)
        sock.connect(str(self.folder / service))
        sock.send(message)
        return sock

    def test_both_show_and_answer(self):
        for command in (["bvhelperctl", "watch", "--count", "3"], ["brenvik-standin", "--count", "3"]):
            program = self.start(*command)
            reply = self.send("com.norvale.brenvik", push(9100001, CIVIC)).recv(100)
            self.assertEqual(reply, struct.pack("<IIIIIi", 18, 44, 0, 7, 0, 9100101) + fake_helper.NDR
                             + struct.pack("<iq", 0, 0))
            self.assertEqual(program.stdout.readline(),
                             'civic-info Client=BrenvikMobileHelper CountryCode="DE" State="" City="K\u00f6ln" '
                             'PostalCode="50667" (answer: success)\n')
            self.send("com.norvale.brenvik", push(9100002, {"Client": [], "Address": "192.0.2.7"}))
            self.assertIn('local-address Client= Address="192.0.2.7"', program.stdout.readline())
            self.send("com.norvale.Brenvik.lasd", notification(UPDATE)).close()
            self.assertEqual(program.stdout.readline(),
                             'notification Notification="com.norvale.lasd.UpdateAvailable" DBType="gsm"\n')
            self.assertEqual(program.wait(60), 0)
            self.assertEqual(list(self.folder.iterdir()), [])

    def test_sockets_of_a_service_manager_are_taken_and_stay(self):
        names = ["com.norvale.brenvik", "com.norvale.Brenvik.lasd"]
        listening = [socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) for _ in names]
        for sock, name in zip(listening, names):
            self.addCleanup(sock.close)
            sock.bind(str(self.folder / name))
            sock.listen()
        for command in (["bvhelperctl", "watch"], ["brenvik-standin"]):
            first, second = (str(sock.fileno()) for sock in listening)
            # As a service manager does: from descriptor 3 on, and for that process alone.
            handed = ["bash", "-c", f'exec 10<&{first} 11<&{second} 3<&10 4<&11; LISTEN_PID=$$ exec "$@"', "bash",
                      BUILD / command[0], *command[1:], "--count", "2"]
            program = subprocess.Popen(handed, stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True,
                                       pass_fds=[sock.fileno() for sock in listening],
                                       env={**os.environ, "LISTEN_FDS": "2", "LISTEN_FDNAMES": ":".join(names)})
            self.addCleanup(program.stdout.close)
            self.addCleanup(program.stderr.close)
            self.addCleanup(program.wait)
            self.addCleanup(program.kill)
            self.assertEqual(program.stderr.readline(),
                             f"{command[0]}: listening on the sockets of the service manager\n")
            self.send("com.norvale.brenvik", push(9100001, CIVIC)).recv(100)
            self.assertIn("civic-info", program.stdout.readline())
            self.send("com.norvale.Brenvik.lasd", notification(UPDATE)).close()
            self.assertIn("notification", program.stdout.readline())
            self.assertEqual(program.wait(60), 0)
            self.assertEqual({each.name for each in self.folder.iterdir()}, set(names))

    def test_json_lines(self):
        for command in (["bvhelperctl", "watch"], ["brenvik-standin"]):
            program = self.start(*command, "--json", "--count", "2")
            self.send("com.norvale.brenvik", push(9100001, CIVIC)).recv(100)
            line = schema.check(json.loads(program.stdout.readline()), ["watch"])
            self.assertEqual(line, {"event": "civic-info", "values": CIVIC, "answer": "success",
                                    "sender": {"uid": os.getuid(), "pid": os.getpid()}})
            self.send("com.norvale.Brenvik.lasd", notification(UPDATE))
            line = schema.check(json.loads(program.stdout.readline()), ["watch"])
            self.assertEqual((line["event"], line["values"], line["answer"]), ("notification", UPDATE, "none"))
            self.assertEqual(program.wait(60), 0)

    def test_the_stand_in_refuses(self):
        program = self.start("brenvik-standin", "--refuse", "13", "--count", "1")
        reply = self.send("com.norvale.brenvik", push(9100001, CIVIC)).recv(100)
        self.assertEqual(struct.unpack_from("<iII", reply, 32), (13, 0, 13))
        self.assertIn("(answer: refused with 13)", program.stdout.readline())
        self.assertEqual(program.wait(60), 0)

    def test_the_stand_in_hangs(self):
        program = self.start("brenvik-standin", "--hang")
        sock = self.send("com.norvale.brenvik", push(9100001, CIVIC))
        self.assertIn("(answer: none)", program.stdout.readline())
        sock.setblocking(False)
        with self.assertRaises(BlockingIOError):
            sock.recv(100)
        program.send_signal(signal.SIGINT)
        self.assertEqual(program.wait(60), 0)

    def test_signals_end_it_cleanly(self):
        for number in (signal.SIGINT, signal.SIGTERM):
            program = self.start("bvhelperctl", "watch")
            program.send_signal(number)
            self.assertEqual(program.wait(60), 0)
            self.assertEqual(list(self.folder.iterdir()), [])

    def test_only_one_listens(self):
        self.start("brenvik-standin")
        done = subprocess.run([BUILD / "bvhelperctl", "watch", "--directory", self.folder], capture_output=True,
                              text=True, timeout=60)
        self.assertEqual(done.returncode, 1)
        self.assertEqual(done.stderr,
                         f"bvhelperctl: cannot listen in {self.folder}: another process serves that name\n"
                         "The telephony daemon listens there, or another program in its place: stop that one first.\n")

    def test_who_may_not_write_the_folder_is_told_what_to_do(self):
        if os.getuid() != 0:
            self.skipTest("becoming another account needs root")
        self.folder.chmod(0o755)
        program = self.folder / "brenvik-standin"  # the build may stand where others cannot go
        shutil.copy(BUILD / "brenvik-standin", program)
        done = subprocess.run([program, "--directory", self.folder], capture_output=True, text=True, timeout=60,
                              preexec_fn=lambda: os.setresuid(65534, 65534, 65534))
        self.assertEqual((done.returncode, done.stderr),
                         (1, f"brenvik-standin: cannot listen in {self.folder}: Permission denied\n"
                             "The folder is root's. Run this as root, have a service manager hand the sockets over, or name "
                             "another folder with --directory.\n"))

    def test_wrong_usage_of_the_stand_in(self):
        for arguments in (["--refuse", "0"], ["--refuse", "x"], ["--refuse", "1", "--hang"], ["--count", "0"], ["x"]):
            done = subprocess.run([BUILD / "brenvik-standin", *arguments], capture_output=True, timeout=60)
            self.assertEqual(done.returncode, 2, arguments)


if __name__ == "__main__":
    unittest.main()
