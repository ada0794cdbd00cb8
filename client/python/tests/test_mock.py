#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The mock: each word of its script, its mistakes, the program, recording, and a command that finds it without root."""
import datetime
import json
import os
import plistlib
import re
import shutil
import signal
import subprocess
import unittest

import support
import brenvik_mobile_helper as package
from brenvik_mobile_helper import Client, Listener, _table
from brenvik_mobile_helper.mock import Mock, ScriptError, parse
from fake_helper import FakeHelper
import wire

PROGRAM = support.BUILD / "brenvik-mobile-helper-mock"


def run(*arguments, **more):
    return subprocess.run([str(each) for each in (PROGRAM, *arguments)], capture_output=True, text=True, timeout=60, **more)


class Words(support.InFolder):
    def test_answers_of_every_form(self):
        script = """
            on CopyCountryCode
              answer "NO"
            on CopyCrashLogs
              answer false
            on CopyPreferenceValue
              answer {"a": [1, 2.5, true, "grün"]}
            on CopyAppPreferenceValue
              answer bytes "PHBsaXN0Lz4="
            on LoadPlistFile
              answer {"big": "value"} in memory
            on CopyVoicemailToken
            on UnpackArchive
            on CopyBadgeLabels
            on ClearVoicemailToken
        """
        with Mock(script) as mock, Client(mock.path) as client:
            self.assertEqual(client.copy_country_code(), "NO")
            self.assertIs(client.copy_crash_logs("/a"), False)
            self.assertEqual(client.copy_preference_value("d", "k"), {"a": [1, 2.5, True, "grün"]})
            self.assertEqual(client.call("CopyAppPreferenceValue", domain="d", key="k"), b"<plist/>")
            self.assertEqual(client.load_plist_file("/a"), {"big": "value"})
            self.assertEqual(client.copy_voicemail_token(), "")
            self.assertIs(client.unpack_archive("/a", "/b"), True)
            self.assertIsNone(client.copy_badge_labels([], []))
            self.assertIsNone(client.clear_voicemail_token())
        self.assertEqual([name for name, _ in mock.requests][:2], ["CopyCountryCode", "CopyCrashLogs"])
        self.assertFalse(os.path.exists(mock.directory))

    def test_a_large_region_comes_in_memory_by_itself(self):
        script = f"on LoadPlistFile\n answer {json.dumps({'a': 'x' * 200_000})}"
        with Mock(script) as mock, Client(mock.path) as client:
            self.assertEqual(len(client.load_plist_file("/a")["a"]), 200_000)

    def test_every_routine_reaches_its_rule_and_its_arguments_are_read(self):
        for routine in _table.ROUTINES.values():
            values = {"text": "ü", "i32": -7, "f64": 1.5, "region": plistlib.dumps(["x"])}
            given = {each.name: values[each.type] for each in routine.parameters}
            written = {"text": '"ü"', "i32": "-7", "f64": "1.5", "region": '["x"]'}
            conditions = " ".join(f"{each.name}={written[each.type]}" for each in routine.parameters)
            with Mock(f"on {routine.name} {conditions}\n") as mock, Client(mock.path) as client:
                client.call(routine.name, **given)
            self.assertEqual((mock.unscripted, mock.requests), ([], [(routine.name, given)]))

    def test_the_first_rule_that_fits_is_taken(self):
        script = """
            on CopyVoicemailTokenForKey key="a"
              times 2
              answer "first"
            on CopyVoicemailTokenForKey key="a"
              answer "then"
            on CopyVoicemailTokenForKey key~"b.*"
              answer "pattern"
            on BVMobileHelperCopyCountryCode
              fail 5
            on *
              answer
        """
        with Mock(script) as mock, Client(mock.path) as client:
            self.assertEqual([client.copy_voicemail_token_for_key("a") for _ in range(4)], ["first", "first", "then", "then"])
            self.assertEqual(client.copy_voicemail_token_for_key("bcd"), "pattern")
            self.assertEqual(client.copy_voicemail_token_for_key("xb"), "")
            with self.assertRaises(package.HelperError):
                client.copy_country_code()
            self.assertIs(client.copy_crash_logs("/a"), True)
        self.assertEqual(mock.unscripted, [])

    def test_true_is_not_one(self):
        with Mock("on SetPreferenceValue value=1\n answer\non SetPreferenceValue value=true\n fail 9") as mock:
            with Client(mock.path) as client:
                client.set_preference_value("d", "k", 1)
                with self.assertRaises(package.HelperError) as caught:
                    client.set_preference_value("d", "k", True)
        self.assertEqual(caught.exception.code, 9)

    def test_what_no_rule_fits_is_not_supported(self):
        with Mock() as mock, Client(mock.path) as client:
            with self.assertRaises(package.HelperError) as caught:
                client.clear_voicemail_token()
        self.assertEqual((caught.exception.code, mock.unscripted), (46, ["ClearVoicemailToken"]))

    def test_failures_and_broken_helpers(self):
        script = """
            on CopyCountryCode
              fail 35
            on ClearVoicemailToken
              close
            on ResetVoicemailStore
              times 1
              close unread
            on ResetVoicemailStore
            on CopyVoicemailToken
              answer "token"
              cut 100
            on IsVoicemailServiceSubscribed
              send "00 ff"
            on RequestWanIPFromLocation
              silence
        """
        with Mock(script) as mock, Client(mock.path) as client:
            with self.assertRaises(package.RefusedError):
                client.copy_country_code()
            with self.assertRaises(package.AnswerLostError):
                client.clear_voicemail_token()
            client.connect()
            client.reset_voicemail_store()  # left unread once, so asked again
            with self.assertRaises(package.ProtocolError):
                client.copy_voicemail_token()
            with self.assertRaises(package.ProtocolError):
                client.is_voicemail_service_subscribed()
            client.connect()
            client.timeout = 0.05
            with self.assertRaises(package.TimedOutError):
                client.request_wan_ip_from_location()
            client.timeout = None
            with self.assertRaises(package.RefusedError):
                client.copy_country_code()

    def test_a_delay_holds_up_its_own_channel_only(self):
        script = "on CopyVoicemailToken\n delay 3600000\non CopyCountryCode\n answer \"NO\""
        with Mock(script) as mock, Client(mock.path) as slow, Client(mock.path) as quick:
            slow.timeout = 0.05
            with self.assertRaises(package.TimedOutError):
                slow.copy_voicemail_token()
            self.assertEqual(quick.copy_country_code(), "NO")

    def test_check_ins(self):
        with Mock("check-in refuse 35 times 1\ncheck-in close times 2\non *") as mock:
            client = Client(mock.path)
            with self.assertRaises(package.RefusedError):
                client.connect()
            client.clear_voicemail_token()  # the library tries again where the helper left
            client.close()

    def test_pushes_and_notifications(self):
        script = """
            on RequestCountryCodeFromLocation
              push civic-info CountryCode="NO" City="Oslo"
            on RequestWanIPFromLocation
              push local-address Address="192.0.2.7" after 1
            on CheckLASDUpdate
              notify UpdateAvailable lte
              notify UpdateFailed after 1
        """
        with Mock(script) as mock, Client(mock.path) as client, Listener(mock.directory) as listener:
            client.request_country_code_from_location(59.9, 10.7)
            event = listener.next(20)
            self.assertEqual((event.country_code, event.city, event.state), ("NO", "Oslo", ""))
            self.assertEqual(event.values["Client"], ["BrenvikMobileHelper"])
            client.request_wan_ip_from_location()
            self.assertEqual(listener.next(20).address, "192.0.2.7")
            client.check_lasd_update(4)
            events = {(event.kind, event.database) for event in (listener.next(20), listener.next(20))}
            self.assertEqual(events, {("UpdateAvailable", "lte"), ("UpdateFailed", "")})

    def test_wrong_requests_get_the_codes_of_the_protocol(self):
        with Mock("on *") as mock:
            client = wire.Client(mock.path)
            self.addCleanup(client.close)
            good, _ = wire.set_preference_message("d", "k", b"value")
            for message, code in ((wire.header(5, 24), -303), (wire.simple("CopyCountryCode") + b"\0", -304),
                                  (wire.simple("LoadPlistFile", b"x" * 255), -304), (good[:-1], -304), (good + b"\0", -304),
                                  (good[:39] + b"\0" + good[40:], -300), (good[:24] + b"\2" + good[25:], -304),
                                  (good[:564] + b"\0" + good[565:], -300), (good[:3] + b"\0" + good[4:], -304)):
                self.assertEqual(client.channel.status(message), code)
            self.assertEqual(client.channel.status(good), 0)
            memory, fds = wire.set_preference_message("d", "k", b"value", "memory")
            self.assertEqual(client.channel.status(memory, fds), 0)
            self.assertEqual(client.channel.status(memory), -304)
            for each in fds:
                os.close(each)
            client.channel.send(wire.simple("ClearVoicemailToken", reply_port=0))  # no reply is wanted
            self.assertEqual(client.text("CopyVoicemailToken"), bytes(256))
            with self.assertRaises(wire.Closed):
                stray = wire.connect(mock.path)
                try:
                    self.assertEqual(stray.status(wire.header(5, 24)), -303)
                    stray.receive()
                finally:
                    stray.close()

    def test_every_shorter_length_and_flipped_bit_of_a_request_is_answered_or_dropped(self):
        good, _ = wire.set_preference_message("d", "k", b"12345")
        codes = set()
        with Mock("on *") as mock:
            client = wire.Client(mock.path)
            self.addCleanup(client.close)
            for length in range(24, len(good)):
                self.assertIn(client.channel.status(good[:length]), (-300, -304), length)
            fixed = [*range(32 * 8), *range(32 * 8, 52 * 8), *range(564 * 8, len(good) * 8)]
            for bit in fixed:
                if 8 <= bit // 8 < 12:
                    continue  # the reply port
                spoilt = bytearray(good)
                spoilt[bit // 8] ^= 1 << bit % 8
                code = client.channel.status(bytes(spoilt))
                if 28 <= bit // 8 < 36:
                    self.assertEqual(code, -304, bit)  # the region's place
                codes.add(code)
        self.assertEqual(codes, {0, -300, -303, -304})

    def test_no_descriptor_is_lost(self):
        def work():
            with Mock("on *\n push civic-info City=\"a\"") as mock:
                for _ in range(3):
                    with Client(mock.path) as client:
                        client.call("SetPreferenceValue", domain="d", key="k", value=b"x" * 100_000)
                client.close()

        self.expect_no_descriptor_lost(work)


class Mistakes(support.InFolder):
    CASES = [
        ("on", 1, "the name of a routine, or * is missing"),
        ("\n\non CopyContryCode", 3, "there is no routine 'CopyContryCode'; is it 'CopyCountryCode'?"),
        ("answer", 1, "'answer' belongs to a rule: \"on ROUTINE\" must stand before it"),
        ("check-in close\nfail 5", 2, "'fail' belongs to a rule: \"on ROUTINE\" must stand before it"),
        ("on *\nansewr", 2, "there is no word 'ansewr'; is it 'answer'?"),
        ("on *\n5", 2, "expected a word of the script, not '5'"),
        ("on CopyCountryCode key=\"a\"", 1, "CopyCountryCode has no arguments"),
        ("on CopyVoicemailTokenForKey kee=\"a\"", 1, "there is no argument 'kee'; is it 'key'?"),
        ("on CopyVoicemailTokenForKey key=\"a\" key=\"b\"", 1, "key is given twice"),
        ("on CopyVoicemailTokenForKey key", 1, "expected ARGUMENT=VALUE, not 'key'"),
        ("on CopyVoicemailTokenForKey key=a", 1, "key is not JSON: Expecting value at column 33"),
        ("on CopyVoicemailTokenForKey key=", 1, "key is missing"),
        ("on CopyVoicemailTokenForKey key=\"a\"b", 1, "expected a blank behind the value, not 'b'"),
        ("on CopyVoicemailTokenForKey key=5", 1, "key must be a text, not NoneType"),
        ("on CopyVoicemailTokenForKey key=\"" + "a" * 256 + '"', 1, "key has 256 bytes, at most 255 fit"),
        ("on CopyVoicemailTokenForKey key~\"(\"", 1, None),
        ("on CellularHeartbeat value~\"1\"", 1, None),
        ("on CellularHeartbeat value=true", 1, "value must be a number"),
        ("on CellularHeartbeat value=1.5", 1, "value must be a number"),
        ("on *\nanswer 5", 2, "nothing was expected behind this: '5'"),
        ("on CopyCountryCode\nanswer 5", 2, "the answer of CopyCountryCode must be a text of at most 64 bytes"),
        ("on CopyCountryCode\nanswer \"" + "a" * 65 + '"', 2, "the answer of CopyCountryCode must be a text of at most 64 bytes"),
        ("on CopyCountryCode\nanswer \"a\" in memory", 2, "the answer of CopyCountryCode is no region, so it cannot come in memory"),
        ("on CopyCrashLogs\nanswer 1", 2, "the answer of CopyCrashLogs must be true or false"),
        ("on ClearVoicemailToken\nanswer 1", 2, "an answer of ClearVoicemailToken has no value"),
        ("on LoadPlistFile\nanswer {\"a\": null}", 2, None),
        ("on LoadPlistFile\nanswer {\"a\"", 2, None),
        ("on LoadPlistFile\nanswer bytes \"?\"", 2, "the region must be a text in base64"),
        ("on LoadPlistFile\nanswer {} in disguise", 2, None),
        ("on *\nanswer\nfail 5", 3, "this rule has an outcome already: answer"),
        ("on *\nfail", 2, "the code must be a whole number"),
        ("on *\nfail 0", 2, "0 is success, no failure"),
        ("on *\nfail 5000000000", 2, "the code must be -2147483648 to 2147483647, not 5000000000"),
        ("on *\ntimes 0", 2, "how often must be 1 to 1000000, not 0"),
        ("on *\ndelay -1", 2, "the delay in milliseconds must be 0 to 3600000, not -1"),
        ("on *\nsend \"xy\"", 2, "the bytes must be a text of hex digits"),
        ("on *\nclose\ncut 5", 1, "there is no answer to cut when the outcome is close"),
        ("on *\npush", 2, "civic-info or local-address is missing"),
        ("on *\npush civic-info Country=\"a\"", 2, "there is no key 'Country'; is it 'CountryCode'?"),
        ("on *\npush civic-info City=5", 2, "City must be a text in quotes"),
        ("on *\npush civic-info after soon", 2, "the time in milliseconds must be a whole number"),
        ("on *\nnotify UpdateAvailable 5g", 2, None),
        ("on *\nnotify Updated", 2, None),
        ("check-in refuse 0", 1, "0 is no refusal"),
        ("check-in allow", 1, "there is no check-in 'allow'; there are refuse, close"),
        ("check-in close times", 1, "how often must be a whole number"),
        ("on * extra", 1, "nothing was expected behind this: 'extra'"),
    ]

    def test_each_is_told_with_line_and_reason_and_ends_with_2(self):
        for text, line, reason in self.CASES:
            with self.assertRaises(ScriptError, msg=text) as caught:
                parse(text)
            self.assertEqual(caught.exception.line, line, text)
            if reason is not None:
                self.assertEqual(caught.exception.reason, reason, text)
        for text, line, _ in self.CASES[:8]:
            path = self.folder / "script"
            path.write_text(text)
            done = run("--check", path)
            self.assertEqual((done.returncode, done.stdout), (2, ""))
            self.assertRegex(done.stderr, rf"^brenvik-mobile-helper-mock: {re.escape(str(path))}:{line}: .+\n$")

    def test_whatever_bytes_a_script_holds_it_is_read_or_refused(self):
        good = "on CopyVoicemailTokenForKey key=\"a\"\n answer \"b\"\n delay 5\n push civic-info City=\"c\" after 5\ncheck-in close times 2\n"
        parse(good)
        for end in range(len(good)):
            for text in (good[:end], good[:end] + chr(ord(good[end]) ^ 1) + good[end + 1:], good[:end] + "\0" + good[end:],
                         good[:end] + "\"" + good[end:], good[:end] + "[" * 3000 + good[end:]):
                try:
                    parse(text)
                except ScriptError as error:
                    self.assertGreater(error.line, 0)

    def test_a_script_that_is_not_utf_8_and_one_that_is_not_there(self):
        path = self.folder / "script"
        path.write_bytes(b"on *\n# \xff\n")
        done = run("--check", path)
        self.assertEqual((done.returncode, done.stderr), (2, f"brenvik-mobile-helper-mock: {path}:2: not UTF-8\n"))
        done = run("--check", self.folder / "none")
        self.assertEqual((done.returncode, done.stderr.count("\n")), (2, 1))

    def test_wrong_usage(self):
        path = self.folder / "script"
        path.write_text("on *\n")
        for arguments in ((), (path,), ("--nonsense",), ("--check",), ("--check", path, "--", "true"), ("--",),
                          ("--record", self.folder / "r", path, "--directory", self.folder), ("--upstream", "x", path, "--", "true"),
                          ("--pushes", "x", path, "--", "true"), (path, "surplus", "--", "true")):
            done = run(*arguments)
            self.assertEqual((done.returncode, done.stdout), (2, ""), arguments)
            self.assertRegex(done.stderr, r"^brenvik-mobile-helper-mock: .+\n$")


class Program(support.InFolder):
    def setUp(self):
        super().setUp()
        self.script = self.folder / "script"
        self.script.write_text('on CopyCountryCode\n  answer "NO"\n')

    def start(self, *arguments):
        process = subprocess.Popen([PROGRAM, *map(str, arguments)], stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
        self.addCleanup(process.stdout.close)
        self.addCleanup(process.stderr.close)
        self.addCleanup(process.wait)
        self.addCleanup(process.kill)
        self.assertRegex(process.stderr.readline(), r"^brenvik-mobile-helper-mock: listening at .+helper\n$")
        return process

    def ask(self, folder):
        with Client(folder / _table.SERVICE) as client:
            return client.copy_country_code()

    def test_it_serves_until_it_is_ended_and_takes_its_socket_away(self):
        for number in (signal.SIGINT, signal.SIGTERM):
            process = self.start("--directory", self.folder / "made", self.script)
            self.assertEqual(self.ask(self.folder / "made"), "NO")
            self.assertEqual(process.stdout.readline(), "CopyCountryCode -> answer\n")
            process.send_signal(number)
            self.assertEqual(process.wait(20), 0)
            self.assertEqual(os.listdir(self.folder / "made"), [])

    def test_two_in_one_folder(self):
        self.start("--directory", self.folder, self.script)
        done = run("--directory", self.folder, self.script)
        self.assertEqual(done.returncode, 1)
        self.assertIn("another process serves that name", done.stderr)

    def test_lines_as_json_and_a_script_of_standard_input(self):
        log = self.folder / "log"
        process = subprocess.Popen([PROGRAM, "--json", "--log", log, "--directory", self.folder, "-"], stdin=subprocess.PIPE,
                                   stderr=subprocess.PIPE, text=True)
        process.stdin.write("on SetPreferenceValue\n fail 5\n")
        process.stdin.close()
        process.stderr.readline()
        with Client(self.folder / _table.SERVICE) as client, self.assertRaises(package.HelperError):
            client.set_preference_value("d", "k", {"a": 1})
        process.terminate()
        process.wait(20)
        process.stderr.close()
        self.assertEqual([json.loads(line) for line in log.read_text().splitlines()], [
            {"request": "SetPreferenceValue", "arguments": {"value": {"a": 1}, "domain": "d", "key": "k"}, "outcome": "fail 5"}])

    def test_strict_tells_what_was_not_as_scripted(self):
        self.script.write_text("on CopyCountryCode\n\non ClearVoicemailToken\n")
        process = self.start("--strict", "--directory", self.folder, self.script)
        with Client(self.folder / _table.SERVICE) as client:
            client.copy_country_code()
            with self.assertRaises(package.HelperError):
                client.copy_voicemail_token()
        process.terminate()
        self.assertEqual(process.wait(20), 1)
        self.assertEqual(process.stderr.read(), "brenvik-mobile-helper-mock: a request of CopyVoicemailToken had no rule\n"
                         f"brenvik-mobile-helper-mock: {self.script}:3: no request came for this rule\n")

    def test_a_dash_writes_the_lines_to_standard_output(self):
        done = run("--log", "-", "--directory", self.folder, self.script, "--", "true", cwd=self.folder)
        self.assertEqual((done.returncode, (self.folder / "-").exists()), (0, False), done.stderr)

    def test_a_folder_that_cannot_be_made_is_named(self):
        done = run("--directory", self.script / "below", self.script)
        self.assertEqual((done.returncode, done.stderr),
                         (1, f"brenvik-mobile-helper-mock: {self.script / 'below'}: Not a directory\n"))

    def test_help_and_version(self):
        done = run("--help")
        self.assertEqual(done.returncode, 0)
        self.assertTrue(done.stdout.startswith("usage: brenvik-mobile-helper-mock [OPTION...] [SCRIPT] [-- COMMAND [ARGUMENT...]]\n"))
        self.assertRegex(run("--version").stdout, r"^brenvik-mobile-helper-mock \d+\.\d+\.\d+\n$")
        offered = run("__complete", "routines").stdout.splitlines()
        self.assertEqual(len(offered), 27)
        self.assertIn("CopyPreferenceValue domain= key=", offered)


def command_line(*command, user=None):
    """Runs a command under the mock, as another account if one is named."""
    if user is not None:
        command = ("setpriv", "--reuid", str(user), "--regid", str(user), "--clear-groups", *command)
    return command


class Commands(support.InFolder):
    """A command finds the mock where the library looks for the helper."""

    def setUp(self):
        super().setUp()
        self.script = self.folder / "script"
        self.script.write_text('on CopyCountryCode\n  answer "NO"\non RequestCountryCodeFromLocation\n  push civic-info City="Oslo"\n')
        done = run(self.script, "--", "true")
        if done.returncode and "namespaces" in done.stderr:
            self.skipTest("this system lets no program make namespaces")

    def test_the_c_library_and_the_tools_find_it_and_its_pushes_arrive(self):
        done = run(self.script, "--", support.BUILD / "bvhelperctl", "location", "country")
        self.assertEqual((done.returncode, done.stdout, done.stderr), (0, "NO\n", ""))
        done = run(self.script, "--", support.BUILD / "bvhelperctl", "location", "civic", "--wait", "59.9", "10.7")
        self.assertEqual((done.returncode, done.stdout), (0, "City: Oslo\n"))

    def test_the_status_of_the_command_is_the_status(self):
        self.assertEqual(run(self.script, "--", "sh", "-c", "exit 7").returncode, 7)
        self.assertEqual(run(self.script, "--", "sh", "-c", "kill -9 $$").returncode, 128 + 9)
        done = run(self.script, "--", self.folder / "none")
        self.assertEqual((done.returncode, done.stderr.count("\n")), (127, 1))
        self.assertEqual(run("--strict", self.script, "--", "true").returncode, 1)

    def test_nothing_else_is_changed_and_nothing_stays(self):
        before = sorted(os.listdir("/run"))
        temporary = self.folder / "temporary"
        temporary.mkdir()
        listing = run(self.script, "--", "ls", "-A", "/run", env={**os.environ, "TMPDIR": str(temporary)}).stdout.split()
        self.assertEqual(sorted(set(listing) - {"brenvik"}), sorted(set(before) - {"brenvik"}))
        self.assertEqual(sorted(os.listdir("/run")), before)
        self.assertEqual(os.listdir(temporary), [])
        self.assertEqual(run(self.script, "--", "pwd", cwd=self.folder).stdout.strip(), str(self.folder))

    @unittest.skipUnless(os.geteuid() == 0, "needs root to become somebody else")
    def test_without_root(self):
        # A copy that another account can read, whatever the build folder allows.
        copy = self.folder / "copy"
        subprocess.run(["cp", "-r", support.BUILD / "python", copy / "python"] if copy.mkdir() is None else [], check=True)
        for name in ("brenvik-mobile-helper-mock", "bvhelperctl"):
            subprocess.run(["cp", support.BUILD / name, copy], check=True)
        subprocess.run(["chmod", "-R", "a+rX", self.folder], check=True)
        command = command_line(copy / "brenvik-mobile-helper-mock", self.script, "--", "sh", "-c",
                               f"id -u; {copy}/bvhelperctl location country", user=65534)
        done = subprocess.run([str(each) for each in command], capture_output=True, text=True, timeout=60, cwd="/")
        if "namespaces" in done.stderr:
            self.skipTest("this system lets no unprivileged program make namespaces")
        self.assertEqual((done.returncode, done.stdout, done.stderr), (0, "65534\nNO\n", ""))


class Recording(support.InFolder):
    def test_what_a_helper_did_is_replayed(self):
        when = datetime.datetime(2026, 1, 2)
        answers = {8683568: lambda request: request.string("grün \"x\"\n", 64), 8683551: lambda request: request.status(5),
                   8683565: lambda request: request.boolean(0), 8683555: lambda request: request.status(0),
                   8683556: lambda request: request.payload(plistlib.dumps({"a": [1, True, "ü"]}), in_line=False),
                   8683557: lambda request: request.payload(b""),
                   8683572: lambda request: request.payload(plistlib.dumps({"when": when, "raw": b"\0"})),
                   8683567: lambda request: request.status(0)}

        def work(client):
            got = []
            for call in (lambda: client.copy_country_code(), lambda: client.clear_voicemail_token(),
                         lambda: client.copy_crash_logs("/a b"), lambda: client.set_preference_value("d", "k", {"v": 1.5}),
                         lambda: client.set_preference_value("d", "k", None), lambda: client.set_preference_value("d", "k", when),
                         lambda: client.copy_preference_value("d", "k"), lambda: client.copy_app_preference_value("d", "k"),
                         lambda: client.load_plist_file("/f"), lambda: client.request_country_code_from_location(1.5, -0.1)):
                try:
                    got.append(call())
                except package.Error as error:
                    got.append(error.code)
            return got

        record, folder, pushes = self.folder / "record", self.folder / "made", self.folder / "pushes"
        with FakeHelper(self.path, lambda request: answers[request.id](request)):
            with Client(self.path) as client:
                expected = work(client)
            process = subprocess.Popen([PROGRAM, "--record", record, "--upstream", self.path, "--directory", folder, "--pushes",
                                        pushes], stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, text=True)
            process.stderr.readline()
            with Client(folder / _table.SERVICE) as client, Listener(folder) as listener:
                self.assertEqual(work(client), expected)
                # The real helper's push is recorded and passed on.
                with support.connected(pushes / "com.norvale.brenvik") as sender:
                    region = plistlib.dumps({"City": "Oslo", "Client": ["x"]}, fmt=plistlib.FMT_BINARY)
                    sender.send(support.push_message(9100001, region))
                    self.assertEqual(len(sender.recv(100)), 44)
                self.assertEqual(listener.next(20).city, "Oslo")
            process.terminate()
            self.assertEqual(process.wait(20), 0)
            process.stderr.close()
        text = record.read_text()
        self.assertIn('answer {"a": [1, true, "ü"]}', text)
        script = parse(text)
        with Mock(script) as mock, Client(mock.path) as client, Listener(mock.directory) as listener:
            self.assertEqual(work(client), expected)
            self.assertEqual(listener.next(20).city, "Oslo")
        self.assertEqual((mock.unscripted, script.unused), ([], []))

    def test_a_helper_that_refuses_or_is_not_there(self):
        record = self.folder / "record"
        process = subprocess.Popen([PROGRAM, "--record", record, "--upstream", self.path, "--directory", self.folder / "made"],
                                   stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, text=True)
        process.stderr.readline()
        with self.assertRaises(package.HelperGoneError):
            Client(self.folder / "made" / _table.SERVICE).connect()
        with FakeHelper(self.path, refusal=35), self.assertRaises(package.RefusedError):
            Client(self.folder / "made" / _table.SERVICE).connect()
        process.terminate()
        self.assertEqual(process.wait(20), 0)
        # Else nobody would learn which socket is missing, or that the mock is what has no entitlement.
        told = [line.removeprefix("brenvik-mobile-helper-mock: the real helper cannot be asked: ")
                for line in process.stderr.read().splitlines()]
        process.stderr.close()
        self.assertEqual(told, [f"no helper answers at its socket: {self.path}: No such file or directory",
                                "the caller lacks the entitlement com.norvale.Teravox.BrenvikHelper.allow: code 35"])


class Completions(unittest.TestCase):
    def test_each_shell_offers_the_options_that_there_are(self):
        options = set(re.findall(r"^  (--[a-z]+)", run("--help").stdout, re.M))
        self.assertGreaterEqual(len(options), 10)
        for shell in ("bash", "zsh", "fish"):
            text = (support.SOURCE / "client" / "python" / "completions" / shell).read_text()
            pattern = r" -l ([a-z]+)" if shell == "fish" else r"(--[a-z]+)\b"
            found = {each if each.startswith("--") else f"--{each}" for each in re.findall(pattern, text)}
            self.assertEqual(found, options, shell)
        page = (support.SOURCE / "docs" / "man" / "brenvik-mobile-helper-mock.1.scd").read_text()
        self.assertEqual(set(re.findall(r"^\*(--[a-z]+)\*", page, re.M)), options)

    def test_bash_and_fish_offer_them(self):
        folder = support.SOURCE / "client" / "python" / "completions"
        script = """source "$1"; COMP_WORDS=(brenvik-mobile-helper-mock --re); COMP_CWORD=1; _brenvik_mobile_helper_mock
            printf '%s\\n' "${COMPREPLY[@]}" """
        done = subprocess.run(["bash", "--norc", "-c", script, "bash", folder / "bash"], capture_output=True, text=True, check=True)
        self.assertEqual(done.stdout.split(), ["--record"])
        if shutil.which("fish"):
            done = subprocess.run(["fish", "--no-config", "-c", "source $argv[1]; complete -C 'brenvik-mobile-helper-mock --re'",
                                   folder / "fish"], capture_output=True, text=True, check=True)
            # From version 4 on it offers after them what has the letters elsewhere.
            offered = [line.split("\t")[0] for line in done.stdout.splitlines()]
            self.assertEqual([each for each in offered if each.startswith("--re")], ["--record"])
        if shutil.which("zsh"):
            subprocess.run(["zsh", "-n", folder / "zsh"], check=True)


if __name__ == "__main__":
    unittest.main()
