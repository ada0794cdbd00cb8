#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What set-up, the test run and the bare Debian say when a machine lacks something. Copies of the scripts run with small
programs in the place of apt and the like."""
import os
import pathlib
import shutil
import subprocess
import tempfile
import unittest

SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
AS_ROOT = unittest.skipUnless(shutil.which("apt-get") and os.geteuid() == 0, "root installs packages")
BY_HAND = "setup: no Debian mirror is within reach; what is missing can be installed by hand: hello-there"


class Scripts(unittest.TestCase):
    def setUp(self):
        folder = tempfile.TemporaryDirectory()
        self.addCleanup(folder.cleanup)
        self.tree = pathlib.Path(folder.name)
        self.environment = {**os.environ, "PATH": f"{self.tree}/bin:{os.environ['PATH']}"}

    def copy(self, name):
        self.write(name, (SOURCE / name).read_text(encoding="utf-8"))

    def write(self, name, text):
        path = self.tree / name
        path.parent.mkdir(parents=True, exist_ok=True)
        path.write_text(text, encoding="utf-8")
        path.chmod(0o755)

    def program(self, name, text="exit 0"):
        self.write(name, f"#!/bin/sh\n{text}\n")

    def run_script(self, name, *arguments):
        return subprocess.run([self.tree / name, *arguments], capture_output=True, text=True, check=False, timeout=120,
                              env=self.environment)


class Setup(Scripts):
    """All is installed but one package."""

    def setUp(self):
        super().setUp()
        self.copy("scripts/setup")
        self.copy("scripts/install-packages")
        setup = (self.tree / "scripts/setup").read_text(encoding="utf-8").replace("  # tests\n", "  hello-there\n  # tests\n")
        self.write("scripts/setup", setup)
        self.program("bin/dpkg-query", 'for last; do :; done\n[ "$last" != hello-there ] && printf installed')
        (self.tree / "tmp").mkdir()
        self.environment["TMPDIR"] = str(self.tree / "tmp")

    def apt(self, update="exit 0", install="exit 0"):
        self.program("bin/apt-get", f'if [ "$1" = update ]; then\n{update}\nfi\n{install}')

    def real_apt(self, sources):
        (self.tree / "lists" / "partial").mkdir(parents=True)
        self.write("sources", sources)
        self.write("apt.conf", f'Dir::Etc::sourcelist "{self.tree}/sources";\nDir::Etc::sourceparts "-";\n'
                               f'Dir::State::lists "{self.tree}/lists";\nAcquire::Retries "0";\n'
                               f'Dir::Cache::pkgcache "";\nDir::Cache::srcpkgcache "";\n')
        self.environment["APT_CONFIG"] = str(self.tree / "apt.conf")

    def refused(self):
        """What is said, with one line for each reason and one at the end."""
        done = self.run_script("scripts/setup")
        self.assertEqual(done.returncode, 1, done.stdout + done.stderr)
        self.assertEqual(list((self.tree / "tmp").iterdir()), [])
        told = done.stderr.splitlines()
        self.assertLessEqual(len(told), 6, done.stderr)
        self.assertTrue(told, "not a word")
        return told

    @AS_ROOT
    def test_no_mirror(self):
        self.real_apt("deb http://127.0.0.1:9/debian bookworm main\n")
        self.assertEqual(self.refused()[-1], BY_HAND)

    @AS_ROOT
    def test_no_sources(self):
        self.real_apt("")
        self.assertEqual(self.refused(), ["E: Unable to locate package hello-there",
                                          "setup: apt's sources (/etc/apt) do not offer every package; what is missing: hello-there"])

    @AS_ROOT
    def test_apt_is_killed(self):
        for apt, command in (({"update": "kill -KILL $$"}, "update"), ({"install": "kill -KILL $$"}, "install")):
            self.apt(**apt)
            self.assertEqual(self.refused()[-1],
                             f"setup: apt-get {command} ended with status 137 and gave no reason; what is missing: hello-there")

    @AS_ROOT
    def test_each_reason_is_told_as_it_is(self):
        locked = "E: Could not get lock /var/lib/apt/lists/lock. It is held by process 7 (apt-get)"
        no_space = "W: Failed to fetch http://m/debian/InRelease  Error writing to file - write (28: No space left on device)"
        for apt, status, reason in (("update", 100, locked), ("update", 0, no_space), ("install", 100, locked),
                                    ("install", 100, "E: You don't have enough free space in /var/cache/apt/archives/.")):
            self.apt(**{apt: f'echo Reading; echo "{reason}"; exit {status}'})
            self.assertEqual(self.refused(), [reason, f"setup: apt-get {apt} failed for the reason above; what is missing: hello-there"])

    @AS_ROOT
    def test_a_long_log_is_not_shown(self):
        self.apt(install="for i in 1 2 3 4 5 6 7 8 9; do echo Unpacking $i; echo W: $i; done\necho E: broken\nexit 100")
        told = self.refused()
        self.assertEqual((told[0], told[-1]), ("E: broken", "setup: apt-get install failed for the reason above; what is missing: hello-there"))
        self.assertNotIn("Unpacking", " ".join(told))

    @AS_ROOT
    def test_one_source_of_several_that_is_not_there_does_no_harm(self):
        dead = "echo Hit:1 http://m; echo Err:2 http://gone; echo 'W: Failed to fetch http://gone  Could not connect to gone:80'; exit 0"
        self.apt(update=dead)
        done = self.run_script("scripts/setup")
        self.assertEqual((done.returncode, done.stderr), (0, ""))
        # It is the reason only when the package may be there.
        self.apt(update=dead, install="echo E: broken; exit 100")
        self.assertEqual(self.refused()[-1], "setup: apt-get install failed for the reason above; what is missing: hello-there")
        self.apt(update=dead, install="echo E: Unable to locate package hello-there; exit 100")
        self.assertEqual(self.refused()[-1], BY_HAND)

    def test_another_system_than_debian(self):
        for there, missing in ((["apt-get"], "dpkg-query"), (["dpkg-query"], "apt-get")):
            shutil.rmtree(self.tree / "bin", ignore_errors=True)
            for name in there:
                self.program(f"bin/{name}", "exit 1")
            for name in ("bash", "env", "id", "dirname", "mktemp", "grep", "head", "cat", "rm", "chmod"):
                (self.tree / "bin").mkdir(exist_ok=True)
                (self.tree / "bin" / name).symlink_to(shutil.which(name))
            self.environment["PATH"] = str(self.tree / "bin")
            self.assertEqual(self.refused(), [f"setup: this is not Debian: there is no {missing}; "
                                              "docs/dependencies.md lists the packages and what each is for"])


class InDebian(Scripts):
    """The minimal system is there already, or cannot be made."""

    def setUp(self):
        super().setUp()
        self.copy("scripts/in-debian")
        self.copy("scripts/list-files")
        self.environment |= {"BRENVIK_CACHE": str(self.tree / "cache"), "BRENVIK_DEBIAN_MIRROR": "http://mirror.example/debian"}

    @AS_ROOT
    def test_the_mirror_that_the_environment_names(self):
        self.program("bin/debootstrap", 'echo "$*"; exit 1')
        done = self.run_script("scripts/in-debian", "bookworm", "true")
        self.assertEqual((done.returncode, done.stderr.splitlines()[1:]), (1, [
            f"--variant=minbase --include=ca-certificates bookworm {self.tree}/cache/debian-bookworm http://mirror.example/debian",
            "in-debian: no bookworm could be made; is a Debian mirror within reach?"]))

    @unittest.skipUnless(subprocess.run(["unshare", "--mount", "--pid", "--fork", "true"], check=False, capture_output=True).returncode == 0,
                         "no namespaces")
    @AS_ROOT
    def test_an_overlay_that_is_refused(self):
        self.write("cache/debian-bookworm/etc/brenvik-complete", "")
        self.program("bin/debootstrap")
        self.program("bin/mount", 'echo "mount: $*: not permitted" >&2; exit 32')
        done = self.run_script("scripts/in-debian", "bookworm", "true")
        self.assertEqual(done.returncode, 1)
        self.assertIn(f"\nin-debian: no overlay mount is possible in {self.tree}/cache: ", done.stderr)
        self.assertEqual([path.name for path in (self.tree / "cache").glob("layer-*")], [])


class Test(Scripts):
    """Every step passes at once, but the install test."""

    def setUp(self):
        super().setUp()
        self.copy("scripts/test")
        for name in ("scripts/setup", "scripts/check-source", "scripts/check-code", "scripts/siege", "scripts/fuzz", "bin/cmake", "bin/ctest"):
            self.program(name)

    def ends(self, install, *arguments):
        """Exit status, and what is said under "done"."""
        self.program("tests/install/run", f'[ "${{1:-}}" = --prepare ] || {{ {install}; }}')
        done = self.run_script("scripts/test", *arguments)
        self.assertEqual(done.stderr, "")
        return done.returncode, done.stdout.partition("==== done (0m")[2].splitlines()[1:]

    def test_what_was_left_out_is_named_at_the_end(self):
        skipped = "echo 'install test: SKIPPED: systemd-nspawn is not installed'; exit 77"
        told = ["test: NOT RUN: the install test, because: systemd-nspawn is not installed"]
        self.assertEqual(self.ends(skipped), (0, told))
        self.assertEqual(self.ends(skipped, "--require-all"), (77, told))
        self.assertEqual(self.ends("exit 0", "--require-all"), (0, []))
        self.assertEqual(self.ends("exit 3", "--require-all"), (3, []))


if __name__ == "__main__":
    unittest.main()
