# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""bvhelperctl, and through it the C library, against the real daemon."""
import contextlib
import datetime
import errno
import itertools
import json
import os
import pathlib
import plistlib
import pwd
import re
import shutil
import socket
import sqlite3
import subprocess
import sys
import tempfile
import unittest
import zipfile
from unittest import mock

import network
import test_lasd
import wire
from harness import (ALLOW, BUILD, DAEMON, DEFAULT, ENTITLEMENTS, LOG_ERR, LOG_NOTICE, Daemon, HelperTest, entitle,
                     eventually, main)

sys.path.append(str(pathlib.Path(__file__).parents[2] / "tools" / "tests"))
import schema  # noqa: E402, of another folder

# Where every account may run it, which the build folder need not be.
TOOL = pathlib.Path("/run/bin/bvhelperctl")
OWN_FILE = ENTITLEMENTS / "bvhelperctl.plist"


def run(*arguments, account=None, given="", **more):
    groups = os.getgrouplist(account, pwd.getpwnam(account).pw_gid) if account else None
    return subprocess.run([TOOL, *arguments], capture_output=True, text=True, timeout=60, input=given,
                           user=account, group=account, extra_groups=groups, **more)


class ToolTest(HelperTest):
    @classmethod
    def setUpClass(cls):
        TOOL.parent.mkdir(mode=0o755, exist_ok=True)
        shutil.copy(BUILD / TOOL.name, TOOL)

    def prepare(self):
        entitle(OWN_FILE.name, executable=TOOL)
        self.addCleanup(lambda: OWN_FILE.unlink(missing_ok=True))
        folder = tempfile.TemporaryDirectory()
        self.addCleanup(folder.cleanup)
        self.folder = pathlib.Path(folder.name)

    def expect(self, says, *arguments, status=0):
        done = run(*arguments)
        self.assertEqual((done.returncode, done.stdout + done.stderr), (status, says), arguments)

    def json(self, *arguments, status=0):
        done = run("--json", *arguments)
        self.assertEqual((done.returncode, done.stderr), (status, ""), arguments)
        return schema.check(json.loads(done.stdout), arguments)


class Admission(ToolTest):
    def test_an_entitled_tool_is_admitted(self):
        self.expect("the helper answers\n", "ping")

    def test_what_a_refused_tool_advises_admits_it(self):
        OWN_FILE.unlink()
        refused = run("ping")
        self.assertEqual((refused.returncode, refused.stdout), (4, ""))
        lines = refused.stderr.splitlines()
        self.assertEqual(lines[0], f"bvhelperctl: refused: the caller lacks the entitlement {ALLOW}")
        self.assertIn(str(OWN_FILE), lines[1])
        OWN_FILE.write_text("\n".join(line.removeprefix("  ") for line in lines[2:]) + "\n")
        OWN_FILE.chmod(0o644)
        self.expect("the helper answers\n", "ping")

    def test_an_account_that_may_not_connect_is_told_about_the_group(self):
        refused = run("ping", account="outsider")
        self.assertEqual((refused.returncode, refused.stdout), (4, ""))
        lines = refused.stderr.splitlines()
        self.assertEqual(lines[0], "bvhelperctl: refused: this account may not connect to /run/brenvik/bootstrap/"
                                   "com.norvale.brenvik.mobile-helper")
        self.assertIn("  usermod -aG brenvik outsider", lines)

    def test_the_advice_names_the_account_of_the_caller(self):
        refused = run("ping", account="telephony")
        self.assertEqual(refused.returncode, 4)
        advice = "\n".join(line.removeprefix("  ") for line in refused.stderr.splitlines()[2:])
        self.assertEqual(plistlib.loads(advice.encode())["User"], "telephony")
        (ENTITLEMENTS / "60-telephony.plist").write_text(advice)
        self.addCleanup((ENTITLEMENTS / "60-telephony.plist").unlink)
        self.assertEqual(run("ping", account="telephony").returncode, 0)
        self.assertEqual(run("ping", account="stranger").returncode, 4)


class Preferences(ToolTest):
    DOMAIN = "com.norvale.carrier"

    def test_values_of_every_type_come_back(self):
        for kind, given, wanted in [("string", "K\u00f6ln", "K\u00f6ln"), ("integer", "-12", -12), ("bool", "yes", True),
                                    ("integer", str(2**63 - 1), 2**63 - 1), ("real", "0.5", 0.5),
                                    ("data", "Zm9v", {"base64": "Zm9v"}), ("string", "", "")]:
            self.expect(f"set Key of {self.DOMAIN}\n", "prefs", "set", self.DOMAIN, "Key", given, "--type", kind)
            for words in ("get", "get-app"):
                answer = self.json("prefs", words, self.DOMAIN, "Key")
                self.assertEqual((answer["found"], answer["value"]), (True, wanted))
        with wire.Client() as client:  # an independent reader sees the last one
            self.assertEqual(plistlib.loads(client.copy_preference(self.DOMAIN, "Key")), "")

    def test_any_bytes_come_back_and_do_not_spoil_the_domain(self):
        content = self.folder / "content"
        content.write_bytes(bytes(range(256)) + b"\n")
        self.expect(f"set Any of {self.DOMAIN}\n", "prefs", "set", self.DOMAIN, "Any", "--type", "bytes", f"@{content}")
        raw = subprocess.run([TOOL, "prefs", "get", "--raw", self.DOMAIN, "Any"], capture_output=True, timeout=60)
        self.assertEqual((raw.returncode, raw.stdout), (0, content.read_bytes()))
        refused = run("prefs", "set", self.DOMAIN, "Control", "-", given="a\x01b")
        self.assertEqual((refused.returncode, refused.stdout), (2, ""))
        file = f"/root/Library/Preferences/{self.DOMAIN}.plist"
        self.assertIn("Any", self.json("plist", "load", file)["value"])

    def test_a_deleted_value_is_gone(self):
        self.expect(f"set Key of {self.DOMAIN}\n", "prefs", "set", self.DOMAIN, "Key", "v")
        self.expect(f"removed Key of {self.DOMAIN}\n", "prefs", "delete", self.DOMAIN, "Key")
        self.expect("(no value)\n", "prefs", "get", self.DOMAIN, "Key", status=3)
        self.assertIs(self.json("prefs", "get", self.DOMAIN, "Key", status=3)["found"], False)

    def test_a_value_larger_than_a_datagram_goes_and_comes_in_memory(self):
        # A short list: holding a long one to the schema takes longer than the helper stays.
        value = {"Text": "x" * 100_000, "List": list(range(100))}
        file = self.folder / "value.plist"
        for form in (plistlib.FMT_XML, plistlib.FMT_BINARY):
            file.write_bytes(plistlib.dumps(value, fmt=form))
            self.expect(f"set Large of {self.DOMAIN}\n", "prefs", "set", self.DOMAIN, "Large", str(file), "--type",
                        "plist-file")
            self.assertEqual(self.json("prefs", "get", self.DOMAIN, "Large")["value"], value)

    def test_a_domain_of_the_greatest_length_is_stored(self):
        domain = "d" * 249
        self.expect(f"set k of {domain}\n", "prefs", "set", domain, "k", "v")
        self.assertTrue(pathlib.Path(f"/root/Library/Preferences/{domain}.plist").is_file())
        self.expect("v\n", "prefs", "get", domain, "k")


class Files(ToolTest):
    def test_a_property_list_file_is_shown(self):
        file = self.folder / "a.plist"
        file.write_bytes(plistlib.dumps({"Name": "Norvale", "When": datetime.datetime(2024, 2, 29, 12, 30),
                                         "List": [1, {"k": b"v"}]}, sort_keys=False))
        self.expect("Name: Norvale\nWhen: 2024-02-29T12:30:00Z\nList:\n  - 1\n  -\n    k: <1 byte: 76>\n", "plist", "load",
                    str(file))
        self.assertEqual(self.json("plist", "load", str(file))["value"],
                         {"Name": "Norvale", "When": {"date": "2024-02-29T12:30:00Z"}, "List": [1, {"k": {"base64": "dg=="}}]})

    def test_a_file_that_is_none_is_explained(self):
        missing = f"{self.folder}/none"
        self.expect(f"bvhelperctl: {missing} is missing, not readable for the helper, or no property list with a "
                    "dictionary on top (code 9)\n", "plist", "load", missing, status=1)


class Switches(ToolTest):
    def test_heartbeat(self):
        self.expect("cellular heartbeat on\nbvhelperctl: note: there is no interface pdp_ip0: the echoes take the default "
                    "route\n", "heartbeat", "on")
        self.assertEqual(self.json("heartbeat", "on")["notes"],
                         ["there is no interface pdp_ip0: the echoes take the default route"])
        self.expect("cellular heartbeat off\n", "heartbeat", "off")

    def test_radio_logs(self):
        self.expect("radio manager logs on\nbvhelperctl: note: there is no system bus: no radio manager was told\n",
                    "radio-logs", "on")
        self.logs.wait_for("bsd", LOG_ERR, "Enabling wireless radio manager logs: 1")


    def test_a_helper_that_may_not_send_is_told_of(self):
        self.daemon.stop()
        helper = subprocess.Popen(["setpriv", "--bounding-set", "-net_raw", DAEMON], stdin=subprocess.DEVNULL)
        self.addCleanup(helper.wait)
        self.addCleanup(helper.kill)
        eventually(lambda: run("ping").returncode == 0, what="the helper")
        note = ("the helper may not send echoes: it lacks CAP_NET_RAW, and net.ipv4.ping_group_range leaves its groups out")
        self.assertIn(note, self.json("heartbeat", "on")["notes"])
        pathlib.Path("/proc/sys/net/ipv4/ping_group_range").write_text("0 0")  # the helper's group
        self.addCleanup(pathlib.Path("/proc/sys/net/ipv4/ping_group_range").write_text, "1 0")
        self.assertNotIn(note, self.json("heartbeat", "on")["notes"])

    def start(self, *command):
        """A process of the test's, once it has printed its first line."""
        process = subprocess.Popen(command, stdout=subprocess.PIPE)
        self.addCleanup(process.stdout.close)
        self.addCleanup(process.wait)
        self.addCleanup(process.kill)
        self.assertNotEqual(process.stdout.readline(), b"", command)
        return process

    def start_bus(self):
        pathlib.Path("/run/dbus").mkdir(exist_ok=True)
        self.addCleanup(shutil.rmtree, "/run/dbus")
        self.start("dbus-daemon", "--session", "--nofork", "--nosyslog", "--print-address=1",
                   "--address=unix:path=/run/dbus/system_bus_socket")

    def test_a_bus_without_a_radio_manager_is_told_of(self):
        self.start_bus()
        self.assertEqual(self.json("radio-logs", "on")["notes"], ["ModemManager is not running: no radio manager was told"])
        self.assertNotIn("notes", self.json("radio-logs", "off"))

    def test_a_radio_manager_without_a_modem_is_told_of(self):
        self.start_bus()
        for modems, notes in ((0, ["ModemManager knows no modem"]), (1, None), (2, None)):
            manager = self.start(sys.executable, str(pathlib.Path(__file__).with_name("modem_manager.py")), str(modems))
            self.assertEqual(self.json("radio-logs", "on").get("notes"), notes, modems)
            # Of the helper, and of bvhelperctl.
            self.assertEqual({manager.stdout.readline() for _ in range(2)}, {b"SetLogging\n", b"GetManagedObjects\n"})
            manager.kill()
            manager.wait()

    def test_a_silent_bus_does_not_keep_the_user_waiting(self):
        pathlib.Path("/run/dbus").mkdir(exist_ok=True)
        self.addCleanup(shutil.rmtree, "/run/dbus")
        with socket.socket(socket.AF_UNIX, socket.SOCK_STREAM) as bus:
            bus.bind("/run/dbus/system_bus_socket")
            bus.listen(4)
            self.assertEqual(self.json("radio-logs", "on")["notes"],
                             ["the system bus does not answer: no radio manager may have been told"])


class Labels(ToolTest):
    def test_names_and_badges(self):
        self.expect("Gesch\u00e4ftlich\nReise\n", "labels", "localized", "--language", "de", "--label", "business",
                    "--label", "travel")
        self.expect("I\nB\n", "labels", "badges", "--language", "en", "--text", "istanbul", "--label", "business")
        self.assertEqual(self.json("labels", "localized", "--label", "primary")["labels"], ["Primary"])

    def test_labels_that_nobody_knows_have_no_badge(self):
        self.expect("bvhelperctl: the helper knows none of these labels (code 5)\n", "labels", "badges", "--label",
                    "USER_LABEL_own", status=1)


class Contacts(ToolTest):
    STORE = pathlib.Path("/var/mobile/Library/AddressBook/contacts.db")

    def test_without_a_contacts_store_the_remap_counts_as_done(self):
        self.expect("no contacts to move: there is no contacts store\n", "contacts", "remap", "old", "new")
        self.assertIs(self.json("contacts", "remap", "old", "new")["store"], False)

    def test_with_a_store_the_contacts_are_moved(self):
        self.STORE.parent.mkdir(parents=True, exist_ok=True)
        self.addCleanup(shutil.rmtree, self.STORE.parent)
        with contextlib.closing(sqlite3.connect(self.STORE)) as contacts:
            contacts.execute("CREATE TABLE contact_channels(contact_id INTEGER NOT NULL, channel_identifier TEXT NOT NULL)")
            contacts.execute("INSERT INTO contact_channels VALUES(1, 'old')")
            contacts.commit()
            self.expect("remapped contacts from old to new\n", "contacts", "remap", "old", "new")
            self.assertEqual(contacts.execute("SELECT * FROM contact_channels").fetchall(), [(1, "new")])


class Privacy(ToolTest):
    """What belongs to a person stands in those lines whose text has it, and nowhere else."""

    FIXED = re.compile(r"remapChannelIdentifier \S+ -> \S+|_RequestCivicInfoFromLatitudeLongitude (country code|state|city|postal "
                       r"code): .*|_RequestWanIPFromLocation WAN IP: .*")
    PRIVATE = ("4915112345678", "49301234567", "Berlin", "52.5", "13.4", "a-secret-token", "secret-value")

    def test_numbers_places_and_tokens_are_in_no_other_line_or_field(self):
        store = Contacts.STORE
        store.parent.mkdir(parents=True, exist_ok=True)
        self.addCleanup(shutil.rmtree, store.parent)
        with contextlib.closing(sqlite3.connect(store)) as contacts:
            contacts.execute("CREATE TABLE contact_channels(contact_id INTEGER NOT NULL, channel_identifier TEXT NOT NULL)")
            contacts.execute("INSERT INTO contact_channels VALUES(1, '+4915112345678')")
            contacts.commit()
        self.assertEqual(run("contacts", "remap", "+4915112345678", "+49301234567").returncode, 0)
        with contextlib.closing(sqlite3.connect(store)) as contacts:  # a failure, which has a description
            contacts.execute("DROP TABLE contact_channels")
            contacts.commit()
        self.assertEqual(run("contacts", "remap", "+49301234567", "+4915112345678").returncode, 1)
        self.assertEqual(run("location", "civic", "--wait", "52.52", "13.40").returncode, 0)
        self.assertEqual(run("location", "civic", "52.52", "13.40").returncode, 0)  # nobody takes the push
        run("voicemail", "set-token", "-", given="a-secret-token")
        run("voicemail", "token")
        self.assertEqual(run("prefs", "set", "com.example.private", "key", "-", given="secret-value").returncode, 0)
        self.addCleanup(pathlib.Path("/root/Library/Preferences/com.example.private.plist").unlink)
        self.addCleanup(run, "voicemail", "reset")
        self.logs.wait_for("bsd", LOG_NOTICE, "_RequestCivicInfoFromLatitudeLongitude city: Berlin")
        self.logs.wait_for("unified", DEFAULT, "remapChannelIdentifier +4915112345678 -> +49301234567")
        told = [text for _, _, text in self.logs.lines] + run("status").stdout.splitlines() + [
            f"{key}={value}" for entry in self.logs.entries for key, value in entry.items() if key != "MESSAGE"]
        self.assertGreater(len(told), 50, told)
        for text in told:
            if not self.FIXED.fullmatch(text.rstrip("\n")):
                for private in self.PRIVATE:
                    self.assertNotIn(private, text)


class Carrier(ToolTest):
    HOME = pathlib.Path("/var/mobile")

    def setUp(self):
        super().setUp()
        (self.HOME / "Library" / "Preferences").mkdir(parents=True, exist_ok=True)
        self.addCleanup(shutil.rmtree, self.HOME / "Library")

    def test_links(self):
        link = self.HOME / "Library" / "Carrier Bundle.bundle"
        self.expect(f"{link} -> some target\n", "carrier", "replace-link", "some target", str(link), "--domain",
                    "com.norvale.carrier")
        self.assertEqual(link.readlink(), pathlib.Path("some target"))
        self.expect(f"removed {link}\n", "carrier", "remove", str(link))
        self.assertFalse(link.is_symlink())
        other = self.folder / "other"
        self.expect(f"bvhelperctl: refused: {other} is not one of the carrier links and files that may be replaced, or "
                    "is a folder\n", "carrier", "replace-link", "t", str(other), status=4)
        self.assertFalse(other.is_symlink())
        self.expect(f"{other} -> t\n", "carrier", "create-link", "t", str(other))
        self.assertEqual(other.readlink(), pathlib.Path("t"))
        nowhere = self.folder / "none" / "link"
        self.expect(f"bvhelperctl: {nowhere} cannot be made: its folder is missing, or may not be written by the helper "
                    "(code 5)\n", "carrier", "create-link", "t", str(nowhere), status=1)
        self.expect(f"bvhelperctl: refused: {other} is no carrier file: not listed, not in the carrier bundles, no "
                    "package in /tmp\n", "carrier", "remove", str(other), status=4)

    def test_archives_and_crash_logs(self):
        archive = self.folder / "a.zip"
        with zipfile.ZipFile(archive, "w") as writer:
            writer.writestr("folder/file", "content")
        target = self.folder / "unpacked"
        target.mkdir()
        self.expect(f"unpacked {archive} into {target}\n", "carrier", "unpack", str(archive), str(target))
        self.assertEqual((target / "folder" / "file").read_text(), "content")
        archive.write_bytes(b"no archive")
        self.expect(f"bvhelperctl: did not unpack {archive} into {target}; the helper's log tells why\n", "carrier",
                    "unpack", str(archive), str(target), status=1)
        (self.HOME / "Library" / "Logs").mkdir()
        self.expect(f"copied {target} to the crash logs\n", "carrier", "copy-crash-logs", str(target))

    def test_bundles(self):
        bundles = self.HOME / "Library" / "Carrier Bundles"
        (self.folder / "New.bundle").mkdir()
        (self.folder / "carrier.plist").write_text("x")
        self.expect(f"moved {self.folder}/New.bundle to {bundles}/New.bundle\n", "carrier", "move-bundle",
                    f"{self.folder}/New.bundle", str(bundles), "New.bundle")
        self.expect(f"copied carrier.plist from {self.folder} to {bundles}/New.bundle\n", "carrier", "copy-file",
                    str(self.folder), f"{bundles}/New.bundle", "carrier.plist")
        self.assertEqual((bundles / "New.bundle" / "carrier.plist").read_text(), "x")
        self.expect(f"bvhelperctl: did not copy carrier.plist from {self.folder} to /var/tmp; the helper's log tells "
                    "why\n", "carrier", "copy-file", str(self.folder), "/var/tmp", "carrier.plist", status=1)


class Voicemail(ToolTest):
    def prepare(self):
        super().prepare()
        pathlib.Path("/var/mobile/Library").mkdir(parents=True, exist_ok=True)

    def test_tokens(self):
        self.expect("(no token)\n", "voicemail", "token", status=3)
        self.expect("set the voicemail token\n", "voicemail", "set-token", "general")
        self.expect("set the voicemail token for K\n", "voicemail", "set-token", "--key", "K", "special")
        self.expect("general\n", "voicemail", "token")
        self.expect("special\n", "voicemail", "token", "--key", "K")
        self.expect("cleared the voicemail token\n", "voicemail", "clear")
        self.expect("(no token)\n", "voicemail", "token", status=3)
        self.expect("special\n", "voicemail", "token", "--key", "K")
        self.expect("cleared the voicemail token and removed every record\n", "voicemail", "reset")
        self.expect("(no token)\n", "voicemail", "token", "--key", "K", status=3)
        self.expect("not subscribed\n", "voicemail", "subscribed")


class Events(ToolTest):
    """Answers that come later, to whoever stands in for the telephony daemon."""

    COUNTRY = pathlib.Path("/var/lib/brenvik/country.plist")

    def prepare(self):
        super().prepare()
        self.COUNTRY.parent.mkdir(parents=True, exist_ok=True)
        self.COUNTRY.write_bytes(plistlib.dumps({"CountryCode": "DE"}))
        self.addCleanup(self.COUNTRY.unlink)

    def listen(self, *command):
        program = subprocess.Popen([str(each) for each in command] + ["--json", "--count", "1"],
                                   stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
        self.addCleanup(program.stderr.close)
        self.addCleanup(program.stdout.close)
        self.addCleanup(program.wait)
        self.addCleanup(program.kill)
        self.assertIn("listening in", program.stderr.readline())
        return program

    def event(self, program):
        event = json.loads(program.stdout.readline())
        self.assertEqual(event["sender"], {"uid": 0, "pid": self.daemon.pid})
        self.assertEqual(program.wait(10), 0)
        return event

    def test_watch_shows_the_outcome_of_an_update_check(self):
        watch = self.listen(TOOL, "watch")
        self.assertEqual(self.json("lasd", "check", "--type", "gsm")["mask"], 8)
        event = self.event(watch)  # there is no update server in the sandbox
        self.assertEqual((event["event"], event["values"]),
                         ("notification", {"Notification": "com.norvale.lasd.UpdateFailed"}))

    def test_a_civic_address_is_pushed_and_taken(self):
        standin = self.listen(BUILD / "brenvik-standin")
        self.expect("asked; the answer goes to the telephony daemon (see \"watch\")\n", "location", "civic", "0", "0")
        event = self.event(standin)
        self.assertEqual((event["event"], event["answer"]), ("civic-info", "success"))
        self.assertEqual((event["values"]["Client"], event["values"]["CountryCode"]), (["BrenvikMobileHelper"], "DE"))
        self.logs.wait_for("bsd", LOG_NOTICE, "sendCivicInfoToQV sent civic info to Brenvik successfully")
        self.expect("DE\n", "location", "country")

    def test_a_refused_push_is_logged_by_the_daemon(self):
        standin = self.listen(BUILD / "brenvik-standin", "--refuse", "13")
        self.assertEqual(run("location", "civic", "0", "0").returncode, 0)
        self.assertEqual(self.event(standin)["answer"], "refused with 13")
        self.logs.wait_for("bsd", LOG_NOTICE, "sendCivicInfoToQV failed civic info to Brenvik due to error: 13")

    def test_a_stand_in_that_hangs_costs_the_daemon_a_second(self):
        standin = subprocess.Popen([BUILD / "brenvik-standin", "--hang"], stdout=subprocess.PIPE,
                                   stderr=subprocess.PIPE, text=True)
        with standin.stdout, standin.stderr:
            standin.stderr.readline()
            self.assertEqual(run("location", "civic", "0", "0").returncode, 0)
            self.assertIn("(answer: none)", standin.stdout.readline())
            self.logs.wait_for("bsd", LOG_NOTICE,
                               f"sendCivicInfoToQV failed civic info to Brenvik due to error: {errno.ETIMEDOUT}")
            standin.terminate()
            self.assertEqual(standin.wait(10), 0)

    def test_a_public_address_that_cannot_be_had_is_pushed_as_empty(self):
        watch = self.listen(TOOL, "watch")
        self.assertEqual(run("location", "wan-ip").returncode, 0)
        event = self.event(watch)
        self.assertEqual((event["event"], event["values"]["Address"]), ("local-address", ""))


class Waiting(ToolTest):
    """The tool takes the telephony daemon's place, asks, and shows the answer."""

    COUNTRY = pathlib.Path("/var/lib/brenvik/country.plist")
    ADVICE = ("--wait takes the telephony daemon's place: it must not run, and only root may listen there. Nothing was "
              "asked.\n")

    def prepare(self):
        super().prepare()
        self.COUNTRY.parent.mkdir(parents=True, exist_ok=True)
        self.COUNTRY.write_bytes(plistlib.dumps({"CountryCode": "DE"}))
        self.addCleanup(lambda: self.COUNTRY.unlink(missing_ok=True))

    def test_a_civic_address(self):
        self.expect("CountryCode: DE\n", "location", "civic", "--wait", "0", "0")
        self.assertEqual(self.json("location", "civic", "--wait", "0", "0")["values"], {
            "Client": ["BrenvikMobileHelper"], "CountryCode": "DE", "State": "", "City": "", "PostalCode": ""})
        self.logs.wait_for("bsd", LOG_NOTICE, "sendCivicInfoToQV sent civic info to Brenvik successfully")

    def test_nothing_known_is_no_value(self):
        self.COUNTRY.unlink()
        self.expect("(not known)\n", "location", "civic", "--wait", "0", "0", status=3)

    def test_an_address_that_cannot_be_had_is_a_failure_that_names_the_log(self):
        self.expect("bvhelperctl: the public address could not be found; the helper's log tells why\n", "location", "wan-ip",
                    "--wait", status=1)

    def test_nobody_is_asked_while_somebody_else_listens(self):
        with subprocess.Popen([BUILD / "brenvik-standin"], stdout=subprocess.PIPE, stderr=subprocess.PIPE,
                              text=True) as standin:
            standin.stderr.readline()
            for arguments in (["location", "civic", "0", "0"], ["location", "wan-ip"], ["lasd", "check"]):
                self.expect("bvhelperctl: cannot listen in /run/brenvik/bootstrap: another process serves that name\n"
                            + self.ADVICE, *arguments, "--wait", status=1)
            self.assertEqual(self.json("location", "wan-ip", "--wait", status=1)["advice"] + "\n", self.ADVICE)
            standin.terminate()
            self.assertEqual(standin.stdout.read(), "")

    def test_an_update_check_that_fails(self):
        self.expect("gsm: failed\nlte: failed\nbvhelperctl: 2 of 2 checks failed; the helper's log tells why\n", "lasd",
                    "check", "--wait", "--type", "lte", "--type", "gsm", status=1)
        answer = self.json("lasd", "check", "--wait", "--mask", "2", status=1)
        self.assertEqual(answer["databases"], [{"type": "cdma", "outcome": "failed"}])

    def test_an_answer_that_does_not_come_is_given_up(self):
        # The tool listens where the helper does not report.
        self.expect("bvhelperctl: the helper took the request, and told no answer in time\n--timeout waits longer. The "
                    "helper's log may tell why.\n", "location", "civic", "--wait", "--timeout", "0.2", "--directory",
                    str(self.folder), "0", "0", status=6)
        self.assertEqual(list(self.folder.iterdir()), [])

    def test_watch_ends_in_time(self):
        done = run("watch", "--timeout", "0.05", "--directory", str(self.folder))
        self.assertEqual((done.returncode, done.stdout), (0, ""))
        done = run("watch", "--timeout", "0.05", "--count", "2", "--directory", str(self.folder))
        self.assertEqual((done.returncode, done.stderr.splitlines()[1]), (6, "bvhelperctl: 0 of 2 arrived in time"))
        done = run("watch", "--json", "--timeout", "0.05", "--count", "2", "--directory", str(self.folder))
        self.assertEqual((done.returncode, schema.check(json.loads(done.stdout), ["watch"])),
                         (6, {"ok": False, "error": "0 of 2 arrived in time"}))


class WaitingForDatabases(test_lasd.UpdateTest, ToolTest):
    """A real update server; the tool itself listens for the outcome."""

    def prepare(self):
        ToolTest.prepare(self)
        with mock.patch.object(network, "MessagePort"):
            super().prepare()

    def test_each_database_is_told_when_it_is_done(self):
        manifest = self.serve({"gsm": "1.0", "lte": "2.0"})
        size = len(self.content("gsm", "1.0"))
        self.expect(f"gsm: updated, version 1.0, {size} bytes\numts: no update required\n", "lasd", "check", "--wait",
                    "--type", "umts", "--type", "gsm")
        answer = self.json("lasd", "check", "--wait", "--mask", "12")
        self.assertEqual((answer["mask"], answer["databases"]), (12, [
            {"type": "gsm", "outcome": "no update required", "version": "1.0", "bytes": size},
            {"type": "lte", "outcome": "updated", "version": "2.0", "bytes": size}]))
        self.assert_installed(manifest)

    def test_the_one_that_failed_is_named(self):
        self.serve({"gsm": "1.0", "lte": "2.0"}, gsm=f"https://{test_lasd.HOST}/none.gz")
        answer = self.json("lasd", "check", "--wait", "--mask", "12", status=1)
        self.assertEqual([(each["type"], each["outcome"]) for each in answer["databases"]],
                         [("gsm", "failed"), ("lte", "updated")])
        self.assertEqual(answer["error"], "1 of 2 checks failed; the helper's log tells why")

    def test_a_check_without_an_outcome_is_given_up(self):
        self.serve({"gsm": "1.0", "lte": "2.0"}, gsm="")  # such a check ends without a notification
        self.expect("bvhelperctl: gsm: the helper took the request, and told no answer in time\n--timeout waits longer. The "
                    "helper's log may tell why.\n", "--timeout", "1.5", "lasd", "check", "--wait", "--mask", "12", status=6)


class Completion(ToolTest):
    def test_domains_and_keys_that_exist(self):
        # A blank or a quote would not be one plain word to a shell.
        for key in ("Version", "Name", "with blank"):
            self.assertEqual(run("prefs", "set", "com.norvale.completion", key, "v").returncode, 0)
        self.addCleanup(pathlib.Path("/root/Library/Preferences/com.norvale.completion.plist").unlink)
        self.assertIn("com.norvale.completion\n", run("__complete", "domains").stdout)
        self.expect("Name\nVersion\n", "__complete", "keys", "com.norvale.completion")
        self.expect("", "__complete", "keys", "none")
        self.expect("", "__complete", "keys", "../../etc/passwd")
        self.assertEqual(run("__complete", "keys", "com.norvale.completion", account="stranger").stdout, "")


class ManualPage(ToolTest):
    def test_every_example_runs(self):
        page = BUILD / "docs" / "man" / "bvhelperctl.1.scd"
        if not page.exists():
            self.skipTest("the manual pages are not built")
        examples = re.findall(r"^```\n(.*?)^```$", page.read_text(), flags=re.S | re.M)
        self.assertGreaterEqual(len(examples), 6)
        self.addCleanup(pathlib.Path("/root/Library/Preferences/com.example.greeting.plist").unlink)
        # Before the helper is stopped, which is a clean-up as well.
        self.addCleanup(run, "voicemail", "reset")
        for example in examples:
            done = subprocess.run(["bash", "-euo", "pipefail", "-c", example], capture_output=True, timeout=60,
                                  env={**os.environ, "PATH": f"{TOOL.parent}:{os.environ['PATH']}"})
            explained = 4 if " access " in example else 0  # of a caller that would be refused
            self.assertEqual(done.returncode, explained, (example, done.stdout, done.stderr))


class Demo(unittest.TestCase):
    def test_commands_are_printed_so_that_they_can_be_pasted(self):
        tour = pathlib.Path(__file__).with_name("demo-tour").read_text()
        function = re.search(r"^quoted\(\) \{\n.*?^\}\n", tour, flags=re.S | re.M)[0]
        words = ["plain", "", "two words", "it's", '"', "$HOME", "`x`", "a\nb", "\\", "*", "~", "#", "K\u00f6ln", "--x=1", "%M\\n"]
        printed = subprocess.run(["bash", "-c", function + 'quoted "$@"', "bash", *words], capture_output=True, text=True,
                                 check=True, timeout=60).stdout
        self.assertTrue(printed.startswith("plain '' 'two words' "))
        for shell in ("bash", "sh"):
            pasted = subprocess.run([shell, "-c", f"printf '%s\\0' {printed}"], capture_output=True, text=True, check=True,
                                    timeout=60).stdout
            self.assertEqual(pasted.split("\0")[:-1], words)


class Terminal(ToolTest):
    """A terminal is tried as a terminal."""

    def test_progress_and_colours(self):
        subprocess.run(["tmux", "-L", "bvhelperctl", "new-session", "-d", "-x", "100", "-y", "20",
                        "TERM=xterm exec /bin/sh"], check=True, timeout=60, env={**os.environ, "NO_COLOR": ""})
        self.addCleanup(subprocess.run, ["tmux", "-L", "bvhelperctl", "kill-server"], timeout=60, check=False)

        def tmux(*arguments):
            return subprocess.run(["tmux", "-L", "bvhelperctl", *arguments], check=True, timeout=60, capture_output=True,
                                  text=True).stdout

        ends = itertools.count()

        def shown(*commands):
            end = f"the-end-{next(ends)}"  # an end of its own, for the one before stands there until the screen is cleared
            tmux("send-keys", "clear; " + "; ".join(commands) + f"; echo {end}", "Enter")
            eventually(lambda: re.search(f"^{end}$", tmux("capture-pane", "-p"), re.M), 60, what="the commands' end")
            return tmux("capture-pane", "-p"), tmux("capture-pane", "-p", "-e")

        plain, coloured = shown(f"{TOOL} frobnicate", f"{TOOL} lasd check --wait --type gsm")
        self.assertIn('bvhelperctl: unknown command "frobnicate"', plain)
        self.assertRegex(coloured, "\x1b\\[(1;)?31m.*bvhelperctl:")
        # Nothing is left of the line of progress.
        self.assertIn("\ngsm: failed\nbvhelperctl: 1 of 1 checks failed", plain)
        self.assertNotIn("checking", plain)
        plain, coloured = shown("export NO_COLOR=1", f"{TOOL} frobnicate")
        self.assertIn('bvhelperctl: unknown command "frobnicate"', plain)
        self.assertNotIn("\x1b[", coloured)


class Life(ToolTest):
    def test_no_daemon_is_told_with_a_status_of_its_own(self):
        self.daemon.stop()
        done = run("ping")
        self.assertEqual(done.returncode, 5)
        self.assertIn("cannot reach the helper at /run/brenvik/bootstrap/com.norvale.brenvik.mobile-helper", done.stderr)

    def test_many_short_lives_leave_nothing_in_the_daemon(self):
        # The first leaves what is made once: the areas, and the queue on which exits are handled.
        self.assertEqual(run("prefs", "get", "d", "k").returncode, 3)  # nothing is there
        eventually(lambda: "global" in self.daemon.threads(), what="its exit being handled")
        before = self.daemon.settled_descriptors()
        for _ in range(30):
            self.assertEqual(run("prefs", "get", "d", "k").returncode, 3)  # nothing is there
        eventually(lambda: self.daemon.descriptors() <= before, what="the descriptors back where they were")


class Activated(ToolTest):
    activated = True

    def test_a_daemon_that_leaves_before_it_answers_is_asked_again(self):
        # The connection waits in the listening socket while there is no daemon; the next one takes it.
        listening = self.daemon.listening
        self.daemon.process.kill()
        self.daemon.process.wait()
        tool = subprocess.Popen([TOOL, "ping"], stdout=subprocess.PIPE, text=True)
        second = Daemon(activated=True, listening=listening)
        self.addCleanup(second.stop)
        out, _ = tool.communicate(timeout=60)
        self.assertEqual((tool.returncode, out), (0, "the helper answers\n"))


if __name__ == "__main__":
    main()
