#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The units: what systemd says of them, and that the service unit explains every point that is open.

BRENVIK_BUILD names the build folder, BRENVIK_SOURCE the project's.
"""
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

    def test_every_open_point_is_named_with_its_weight(self):
        done = self.analyze("security", "--offline=true", "--json=short", "--no-pager")
        items = json.loads(done.stdout)
        wanted = {f"# Open: {each['name']} {each['exposure']}" for each in items if not each["set"] and each["exposure"]}
        self.assertGreater(len(wanted), 10)
        named = {line.split(". ")[0] for line in self.text.splitlines() if line.startswith("# Open: ")}
        self.assertEqual(named, wanted)

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
