#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The checks of the source fail when they should: each fault is planted in a small tree with the real scripts."""
import json
import os
import pathlib
import shutil
import subprocess
import tempfile
import unittest

SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
LICENCE = "// SPDX-License-" "Identifier: Apache-2.0\n"
# Each level counts one more: 1 + 2 + ... + 7 = 28.
COMPLEX = "int {name}(int a) {{\n" + "if (a > 0) {{\n" * 7 + "++a;\n" + "}}\n" * 7 + "return a;\n}}\n"


class Checks(unittest.TestCase):
    def setUp(self):
        folder = tempfile.TemporaryDirectory()
        self.addCleanup(folder.cleanup)
        self.tree = pathlib.Path(folder.name)
        for name in ("scripts/check-source", "scripts/check-names", "scripts/check-code", "scripts/list-files", "scripts/setup",
                     "scripts/install-packages", "scripts/make-sbom", "debian/control", "docs/dependencies.md", ".clang-tidy", ".clang-format"):
            self.write(name, (SOURCE / name).read_text(encoding="utf-8"))
            (self.tree / name).chmod((SOURCE / name).stat().st_mode)
        for name in ("interface", "helper", "Helper", "client", "workers", "tools", "tests", "benchmarks"):
            (self.tree / name).mkdir(exist_ok=True)
        self.write("platform/a/A.cpp", LICENCE + "int simple(int a) { return a; }\n")

    def write(self, name, text):
        path = self.tree / name
        path.parent.mkdir(parents=True, exist_ok=True)
        path.write_text(text, encoding="utf-8")

    def run_check(self, name, *arguments):
        done = subprocess.run([self.tree / "scripts" / name, *arguments], capture_output=True, text=True, check=False)
        return done.returncode, done.stdout + done.stderr

    def complaints(self, name, *arguments):
        status, told = self.run_check(name, *arguments)
        self.assertEqual(status, 1, told)
        return told

    def test_an_internal_header_of_another_folder(self):
        self.write("platform/a/Own.cpp", LICENCE + '#include "platform/a/internal/Reader.h"\n')
        self.assertNotIn("internal headers from", self.run_check("check-source", "--quick")[1])
        self.write("tools/Foreign.cpp", LICENCE + '#include "platform/a/internal/Reader.h"\n')
        told = self.complaints("check-source", "--quick")
        self.assertIn("includes of internal headers from outside their folder:\ntools/Foreign.cpp:2:", told)
        self.assertNotIn("Own.cpp", told.split("outside their folder")[1])

    def test_a_file_that_a_page_names_and_that_is_not_there(self):
        self.write("README.md", "`platform/a/A.cpp`, `platform/a/A`, `A.cpp`, `platform/{a,b}/A.cpp`, `/etc/none.plist`, `platform/*/A.cpp`\n"
                                "and `platform/a/Gone.cpp`, `Gone.h`, platform/a/A.cpp, platform/b/B.cpp.\n")
        self.write("platform/a/A.cpp", LICENCE + "// See docs/decisions/" "99-gone.md.\n")
        told = self.complaints("check-names")
        found = [line for line in told.splitlines() if "README.md:" in line and "there is no" in line]
        self.assertEqual(found, ["check-names: README.md:1: there is no platform/{a,b}/A.cpp",
                                 "check-names: README.md:2: there is no platform/a/Gone.cpp",
                                 "check-names: README.md:2: there is no Gone.h",
                                 "check-names: README.md:2: there is no platform/b/B.cpp"])
        self.assertIn("check-names: platform/a/A.cpp: there is no docs/decisions/" "99-gone.md\n", told)

    @unittest.skipUnless(shutil.which("dpkg"), "packages are Debian's")
    def test_a_package_that_nothing_uses_or_that_no_page_explains(self):
        self.write("platform/a/A.cpp", LICENCE + "#include <zlib.h>\n")
        setup = (self.tree / "scripts/setup").read_text(encoding="utf-8").replace("  # tests\n", "  grep hello-there\n  # tests\n")
        self.write("scripts/setup", setup)
        told = self.complaints("check-names")
        self.assertIn("check-names: scripts/setup: docs/dependencies.md does not say what hello-there is for\n", told)
        self.assertIn("check-names: scripts/setup: nothing uses libsqlite3-dev\n", told)
        self.assertNotIn("zlib1g-dev", told)

    @unittest.skipUnless(shutil.which("clang-tidy-14") or shutil.which("clang-tidy-19"), "no clang-tidy")
    def test_a_function_above_the_limit_and_a_list_that_only_gets_shorter(self):
        build = self.tree / "build" / "dev"
        build.mkdir(parents=True)

        def compiled(*names):
            (build / "compile_commands.json").write_text(json.dumps([
                {"directory": str(self.tree), "file": name, "command": f"c++ -std=c++20 -c {name}"} for name in names]))

        compiled("platform/a/A.cpp")
        self.assertEqual(self.run_check("check-code", "--all"), (0, ""))
        self.write("platform/a/A.cpp", LICENCE + COMPLEX.format(name="tangled"))
        self.assertIn("platform/a/A.cpp:2: tangled has a complexity of 28, which is above the limit", self.complaints("check-code", "--all"))
        self.assertEqual(self.run_check("check-code", "--all", "--write-allowed"), (0, "check-code: 1 functions are above the limit\n"))
        self.assertEqual(self.run_check("check-code", "--all"), (0, ""))
        # Another of the same name is one too many.
        self.write("platform/a/A.cpp", LICENCE + "".join(f"namespace n{i} {{ {COMPLEX.format(name='tangled')} }}\n" for i in range(2)))
        self.assertIn("above the limit", self.complaints("check-code", "--all"))
        self.write("platform/a/A.cpp", LICENCE + "int tangled(int a) { return a; }\n")
        if shutil.which("clang-tidy-14"):  # which alone says so: the list is made with it, and each version counts differently
            self.assertIn("tangled of platform/a/A.cpp is no longer above the limit: remove its line",
                          self.complaints("check-code", "--all"))
        # What is not compiled as it stands is not passed over.
        self.write("platform/a/A.cpp", LICENCE + "#include <none.h>\n")
        self.assertIn("could not be read", self.complaints("check-code", "--all"))

    @unittest.skipUnless(shutil.which("clang-tidy-14") or shutil.which("clang-tidy-19"), "no clang-tidy")
    def test_without_all_it_looks_at_what_has_changed(self):
        def git(*arguments):
            subprocess.run(["git", "-c", "user.name=n", "-c", "user.email=e", *arguments], cwd=self.tree, check=True, capture_output=True)

        build = self.tree / "build" / "dev"
        build.mkdir(parents=True)
        (build / "compile_commands.json").write_text(json.dumps([
            {"directory": str(self.tree), "file": name, "command": f"c++ -std=c++20 -I{build}/views/platform_a -c {name}"}
            for name in ("platform/a/A.cpp", "platform/a/B.cpp", "platform/a/User.cpp")]))
        self.write(".gitignore", "/build/\n")
        self.write("platform/a/Header.h", LICENCE)
        view = build / "views" / "platform_a" / "platform" / "a"
        view.mkdir(parents=True)
        (view / "Header.h").symlink_to(self.tree / "platform" / "a" / "Header.h")
        self.write("platform/a/User.cpp", LICENCE + '#include "platform/a/Header.h"\n')
        self.write("platform/a/B.cpp", LICENCE + COMPLEX.format(name="old"))
        git("init", "-q", "-b", "main")
        git("add", ".")
        git("commit", "-qm", "first")
        self.assertEqual(self.run_check("check-code"), (0, ""))  # nothing has changed
        git("checkout", "-qb", "branch")
        self.write("platform/a/A.cpp", LICENCE + COMPLEX.format(name="fresh"))
        git("commit", "-qam", "second")
        self.write("platform/a/Header.h", LICENCE + "inline " + COMPLEX.format(name="inHeader"))
        told = self.complaints("check-code")
        self.assertIn("fresh has a complexity", told)
        self.assertIn("platform/a/Header.h:2: inHeader has a complexity", told)
        self.assertNotIn("old", told)


if __name__ == "__main__":
    unittest.main()
