#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The units: what systemd says of them, and that the service unit explains every point that is open.

BRENVIK_BUILD names the build folder, BRENVIK_SOURCE the project's.
"""
import ipaddress
import json
import os
import pathlib
import re
import shutil
import subprocess
import tempfile
import unittest

BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
SERVICE = "brenvik-mobile-helper.service"


@unittest.skipUnless(shutil.which("systemd-analyze"), "systemd-analyze is not installed")
class Units(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        folder = tempfile.TemporaryDirectory(prefix="brenvik-units-")
        cls.addClassCleanup(folder.cleanup)
        cls.folder = pathlib.Path(folder.name)
        for name in ("brenvik-mobile-helper.service", "brenvik-mobile-helper.socket"):
            # Only programs that are there pass the check; which one does not matter to it.
            text = (BUILD / "units" / name).read_text()
            lines = ["ExecStart=/bin/true" if line.startswith("ExecStart=") else line for line in text.splitlines()]
            (cls.folder / name).write_text("\n".join(lines) + "\n")
        shutil.copy(SOURCE / "units" / "brenvik-mobile-helper-restore.service", cls.folder)
        cls.text = (cls.folder / SERVICE).read_text()

    def analyze(self, *arguments, name=SERVICE):
        return subprocess.run(["systemd-analyze", *arguments, f"./{name}"], cwd=self.folder, capture_output=True,
                              text=True, timeout=60, check=False)

    def test_they_are_well_formed(self):
        for name in ("brenvik-mobile-helper.socket", SERVICE, "brenvik-mobile-helper-restore.service"):
            done = self.analyze("verify", "--man=no", name=name)
            self.assertEqual((done.returncode, done.stderr), (0, ""), name)

    def test_the_exposure_of_the_service_is_at_most_2_6(self):
        done = self.analyze("security", "--offline=true", "--threshold=26", "--no-pager")
        self.assertEqual(done.returncode, 0, done.stdout[-200:] + done.stderr)

    def test_a_weaker_unit_would_not_pass(self):
        weaker = self.text.replace("ProtectSystem=strict", "ProtectSystem=no")
        (self.folder / "weaker.service").write_text(weaker)
        done = self.analyze("security", "--offline=true", "--threshold=26", "--no-pager", name="weaker.service")
        self.assertNotEqual(done.returncode, 0)

    def values(self, key):
        """The words of all lines of the service unit with this key."""
        return [word for line in self.text.splitlines() if line.startswith(f"{key}=")
                for word in line.split("=", 1)[1].split()]

    def test_nothing_can_be_stored_in_the_place_of_the_homes_it_hides(self):
        self.assertEqual(self.values("ProtectHome"), ["tmpfs"])
        self.assertEqual(sorted(self.values("TemporaryFileSystem")), ["/home:ro", "/root:ro", "/run/user:ro"])

    def test_the_folder_of_its_preferences_is_made_before_it_starts(self):
        made = {line.split()[1] for line in (BUILD / "units" / "brenvik.tmpfiles").read_text().splitlines()
                if line.startswith("d ")}
        for path in self.values("BindPaths"):
            self.assertIn(path.lstrip("-"), made)
        self.assertIn("/root/Library/Preferences", made)
        self.assertIn("systemd-tmpfiles-setup.service", self.values("After"))

    def test_servers_behind_every_kind_of_unicast_address_are_reachable(self):
        allowed = [ipaddress.ip_network(each) for line in self.text.splitlines() if line.startswith("IPAddressAllow=")
                   for each in line.split("=", 1)[1].split()]
        self.assertIn("IPAddressDeny=any", self.text)

        def is_allowed(address):
            return any(ipaddress.ip_address(address) in network for network in allowed)
        # 64:ff9b::/96 and 64:ff9b:1::/48: IPv4 servers as a network without IPv4 sees them (RFC 6052, RFC 8215).
        for address in ("127.0.0.1", "9.9.9.9", "198.51.100.7", "223.255.255.254", "::1", "2001:db8::1", "fd00::1",
                        "fe80::1", "64:ff9b::9.9.9.9", "64:ff9b::ffff:ffff", "64:ff9b:1::1", "64:ff9b:1:ffff::9.9.9.9"):
            self.assertTrue(is_allowed(address), address)
        for address in ("224.0.0.1", "255.255.255.255", "ff02::1", "::", "64:ff9b:0:0:0:1::", "64:ff9b:2::1", "100::1"):
            self.assertFalse(is_allowed(address), address)

    def test_every_open_point_is_named_with_its_weight(self):
        done = self.analyze("security", "--offline=true", "--json=short", "--no-pager")
        items = json.loads(done.stdout)
        wanted = {f"# Open: {each['name']} {each['exposure']}" for each in items if not each["set"] and each["exposure"]}
        self.assertGreater(len(wanted), 10)
        named = {line.split(". ")[0] for line in self.text.splitlines() if line.startswith("# Open: ")}
        self.assertEqual(named, wanted)

    def test_the_example_units_of_a_telephony_daemon_are_well_formed(self):
        examples = SOURCE / "client" / "examples" / "brenvikd"
        names = sorted(each.name for each in examples.iterdir() if each.suffix in (".service", ".socket"))
        self.assertEqual(names, ["brenvikd-lasd.socket", "brenvikd.service", "brenvikd.socket"])
        for name in names:
            text = (examples / name).read_text().replace("ExecStart=/usr/libexec/brenvikd", "ExecStart=/bin/true")
            (self.folder / name).write_text(text)
        for name in names:
            done = self.analyze("verify", "--man=no", name=name)
            self.assertEqual((done.returncode, done.stderr), (0, ""), name)

    def allowed_calls(self):
        """The system calls that the service may make, as the service manager counts: line by line, sets unfolded."""
        def unfolded(name):
            if not name.startswith("@"):
                return {name}
            shown = subprocess.run(["systemd-analyze", "syscall-filter", "--no-pager", name], capture_output=True, text=True,
                                   timeout=60, check=True).stdout
            lines = [line.strip() for line in shown.splitlines()[1:]]
            return set().union(*(unfolded(line) for line in lines if line and not line.startswith("#")))

        allowed = set()
        for line in re.findall(r"^SystemCallFilter=(.*)", self.text, re.M):
            names = set().union(*map(unfolded, line.removeprefix("~").split()))
            allowed = allowed - names if line.startswith("~") else allowed | names
        return allowed

    def test_utility_work_may_lower_its_priorities_and_nobody_may_raise_or_hand_out_resources(self):
        allowed = self.allowed_calls()
        self.assertLessEqual({"read", "epoll_wait", "timerfd_create", "openat", "sendmsg"}, allowed, "the lines were read")
        self.assertLessEqual({"setpriority", "ioprio_set"}, allowed)
        self.assertEqual(allowed & {"sched_setscheduler", "sched_setattr", "sched_setparam", "sched_setaffinity", "setrlimit",
                                    "nice", "mbind", "migrate_pages", "move_pages", "ptrace", "setuid"}, set())


if __name__ == "__main__":
    unittest.main()
