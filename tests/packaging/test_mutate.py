#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""scripts/mutate finds the mistakes that can be made in a small source, and which of them its test does not notice."""
import fcntl
import json
import os
import pathlib
import shutil
import subprocess
import tempfile
import unittest

SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
BUILD = """cmake_minimum_required(VERSION 3.25)
project(Toy LANGUAGES CXX)
function(brenvik_tests target)
  add_executable(${target}_tests A.cpp ATest.cpp)
  set_target_properties(${target}_tests PROPERTIES RUNTIME_OUTPUT_DIRECTORY ${PROJECT_BINARY_DIR}/unit)
endfunction()
add_subdirectory(platform/a)
"""
PRESETS = """{ "version": 6, "configurePresets": [
  { "name": "dev", "generator": "Ninja", "binaryDir": "${sourceDir}/build/dev", "cacheVariables": { "CMAKE_BUILD_TYPE": "Debug" } } ] }
"""
CODE = """bool isSmall(int a) {
  return a < 10;
}
int waits = 0;
void countDown(int from) {
  waits = from;
  while (waits != 0) waits = 0;
}
"""
TEST = """bool isSmall(int a);
void countDown(int from);
extern int waits;
int main() {
  countDown(2);
  return isSmall(9) && !isSmall(11) && waits == 0 ? 0 : 1;
}
"""
# What the tests of the toy do not notice.
UNNOTICED = """platform/a/A.cpp:2: survived: <= for <
  - return a < 10;
  + return a <= 10;
platform/a/A.cpp:2: survived: one more
  - return a < 10;
  + return a < 11;
platform/a/A.cpp:4: survived: one more
  - int waits = 0;
  + int waits = 1;
platform/a/A.cpp:5: survived: early return
  - void countDown(int from) {
  + void countDown(int from) { return;
platform/a/A.cpp:6: survived: assignment left out
  - waits = from;
  + ;
"""


class Mistakes(unittest.TestCase):
    def setUp(self):
        folder = tempfile.TemporaryDirectory()
        self.addCleanup(folder.cleanup)
        self.tree = pathlib.Path(folder.name)
        for name in ("scripts/mutate", "scripts/list-files"):
            self.write(name, (SOURCE / name).read_text(encoding="utf-8"))
            (self.tree / name).chmod(0o755)
        self.write("CMakeLists.txt", BUILD)
        self.write("CMakePresets.json", PRESETS)
        self.write("platform/a/CMakeLists.txt", "brenvik_tests(platform_a)\n")
        self.write("platform/a/A.cpp", CODE)
        self.write("platform/a/ATest.cpp", TEST)
        self.write(".gitignore", "/build/\n")

    def write(self, name, text):
        path = self.tree / name
        path.parent.mkdir(parents=True, exist_ok=True)
        path.write_text(text, encoding="utf-8")

    def mutate(self, *arguments):
        return subprocess.run([self.tree / "scripts/mutate", *arguments], capture_output=True, text=True, check=False, cwd=self.tree)

    def listed(self, code):
        """The mistakes in a piece of code, without the line that they replace."""
        self.write("platform/a/A.cpp", code)
        done = self.mutate("--list", "platform/a/A.cpp")
        self.assertEqual((done.returncode, done.stderr), (0, ""))
        return [line[4:] for line in done.stdout.splitlines() if line.startswith("  +")]

    def test_each_kind_of_mistake(self):
        for code, mistakes in {
                "bool a = b == c;": ["bool a = b != c;"],
                "bool a = b >= c;": ["bool a = b > c;"],
                "bool a = b && c;": ["bool a = b || c;"],
                "bool a = !b;": ["bool a = b;"],
                "bool a = true;": ["bool a = false;"],
                "int a = 0x10U;": ["int a = 0x11U;", "int a = 0xfU;"],
                "int a = 0;": ["int a = 1;"],
                "int f() { return g(); }": ["int f() { return {}; }"],
                "int f() { g(a, b.c); }": ["int f() { ; }", "int f() { g(b.c, a); }"],
                "int f() { std::swap(a, b.c); }": ["int f() { ; }"],
                "int f() { return kern::success; }": [],
                "int f() { a.b = c; }": ["int f() { ; }"],
                "void f() noexcept { ++a; }": ["void f() noexcept { return; ++a; }"],
                "int f() { if (a) ++b; }": ["int f() { if (!(a)) ++b; }"],
                "int f() { if (auto a = b; c) ++b; }": ["int f() { if (auto a = b; !(c)) ++b; }"],
                # Nothing to plant: templates, references, declarations, comments, texts, what the compiler checks.
                "std::vector<int> f(int&& a, int* b);": [],
                "int f() { if (auto* a = b) ++b; }": [],
                "// a == 1\nauto a = \"b == 1\"; /* 2 */": [],
                "#if A == 1\n#endif\nstatic_assert(A == 1);": [],
                "auto a = R\"x(b == \"1\")x\";": [],
        }.items():
            with self.subTest(code):
                self.assertEqual(sorted(self.listed(code + "\n")), sorted(mistakes))

    def test_a_choice_is_the_same_each_time_and_another_seed_chooses_others(self):
        chosen = [self.mutate("--list", "--count", "5", "--seed", seed, ".").stdout for seed in "1123"]
        self.assertEqual(chosen[0], chosen[1])
        self.assertEqual(chosen[0].count("\n  + "), 5)
        self.assertGreater(len(set(chosen)), 1)

    def test_lines_that_have_changed(self):
        def git(*arguments):
            subprocess.run(["git", "-c", "user.name=n", "-c", "user.email=e", *arguments], cwd=self.tree, check=True, capture_output=True)

        git("init", "-q", "-b", "main")
        git("add", ".")
        git("commit", "-qm", "first")
        self.assertEqual(self.mutate("--list", "--changed").stdout, "")
        self.write("platform/a/A.cpp", CODE.replace("int waits = 0;", "int waits = 7;"))
        self.write("platform/b/B.cpp", "int b = 0;\n")
        told = self.mutate("--list", "--changed").stdout
        self.assertEqual([line for line in told.splitlines() if line[0] != " "],
                         ["platform/a/A.cpp:4: one less", "platform/a/A.cpp:4: one more", "platform/b/B.cpp:1: one more"])
        self.assertEqual(self.mutate("--list", "--changed", "platform/b").stdout.count("B.cpp"), 1)
        done = self.mutate("--list", "--changed=nothing")
        self.assertEqual(done.returncode, 2)
        self.assertIn("nothing", done.stderr)

    def test_what_cannot_be_done_is_told(self):
        self.write("platform/b/B.cpp", "int b = 0;\n")
        for arguments, text in {
                ("platform/c",): "mutate: platform/c: no source of the project\n",
                ("platform/a/ATest.cpp",): "mutate: platform/a/ATest.cpp: tests, fakes, examples and main.cpp are left alone\n",
                ("platform/b",): "platform/b/B.cpp: left out: no folder above or below it has unit tests\n"
                                 "mutate: no unit tests for any of them\n",
                ("--count", "0", "."): "above zero\n",
                (): "name files or folders, or --changed; see --help\n",
        }.items():
            with self.subTest(arguments):
                done = self.mutate(*arguments)
                self.assertEqual((done.returncode, done.stdout), (2, ""))
                self.assertTrue(done.stderr.endswith(text), done.stderr)

    @unittest.skipUnless(shutil.which("bwrap") and shutil.which("ninja"), "builds, and runs in a sandbox")
    def test_what_the_tests_notice_and_what_they_do_not(self):
        done = self.mutate("--limit", "3", "platform/a")
        if "does not pass without a mistake" in done.stderr and os.geteuid() != 0:
            self.skipTest("no sandbox for this account")
        self.assertEqual(done.returncode, 1, done.stderr)
        self.assertTrue(done.stdout.startswith(UNNOTICED), done.stdout)
        self.assertEqual((self.tree / "build/mutate/source/platform/a/A.cpp").read_text(), CODE)
        self.assertEqual((self.tree / "platform/a/A.cpp").read_text(), CODE)
        kept = json.loads((self.tree / "build/mutate/results.json").read_text())["platform/a/A.cpp"]["mutants"]
        outcomes = sorted(each["outcome"] for each in kept.values())
        self.assertEqual(outcomes.count("survived"), 5, kept)
        self.assertEqual(outcomes.count("killed"), 3, kept)
        self.assertEqual(outcomes.count("timed out"), 3, kept)

        # Two at a time would build in the same place.
        with open(self.tree / "build/mutate/lock", "w", encoding="utf-8") as lock:
            fcntl.flock(lock, fcntl.LOCK_EX)
            busy = self.mutate("platform/a")
        self.assertEqual((busy.returncode, busy.stderr), (2, "mutate: another run works in build/mutate\n"))

        # A second look builds nothing.
        quick = self.mutate("--quick", "platform/a")
        self.assertEqual((quick.returncode, quick.stdout), (1, done.stdout))
        again = self.mutate("platform/a")
        self.assertEqual((again.returncode, again.stdout), (1, done.stdout))
        self.assertNotIn("building", again.stderr)

        # Two of them change nothing that anybody sees; the others are noticed by a better test.
        self.write("tests/mutations/equivalent.txt", "# Comment.\n\nplatform/a/A.cpp\n- int waits = 0;\n+ int waits = 1;\n"
                                                     "countDown sets it first.\n\n"
                                                     "platform/a/A.cpp\n- waits = from;\n+ ;\nThe loop ends at 0 from anywhere.\n")
        self.write("platform/a/ATest.cpp", TEST.replace("isSmall(9)", "waits != 2 && isSmall(9)")
                   .replace("!isSmall(11)", "!isSmall(10)").replace("countDown(2)", "waits = 9; countDown(2)"))
        better = self.mutate("platform/a")
        self.assertEqual(better.returncode, 0, better.stdout)
        self.assertNotIn("survived:", better.stdout)
        self.assertRegex(better.stdout, r"platform/a +\d+ +\d+ +0 +2 +\d+ +100\.0 %\n")

        # A reason is not left out.
        self.write("tests/mutations/equivalent.txt", "platform/a/A.cpp\n- int waits = 0;\n+ int waits = 1;\n")
        done = self.mutate("platform/a")
        self.assertEqual(done.returncode, 2)
        self.assertIn("needs a file", done.stderr)

        (self.tree / "tests/mutations/equivalent.txt").unlink()
        # Without a mistake the tests pass, or nothing could be told.
        self.write("platform/a/A.cpp", CODE.replace("10", "8"))
        done = self.mutate("platform/a")
        self.assertEqual(done.returncode, 2)
        self.assertIn("does not pass without a mistake", done.stderr)

    @unittest.skipUnless(shutil.which("bwrap") and shutil.which("ninja"), "builds, and runs in a sandbox")
    def test_a_header_is_tested_by_the_folder_below_it(self):
        self.write("platform/b/Role.h", "struct Role {\n  int limit = 3;\n};\n")
        self.write("platform/b/CMakeLists.txt", "add_subdirectory(linux)\n")
        self.write("platform/b/linux/CMakeLists.txt", "brenvik_tests(platform_b_linux)\n")
        self.write("platform/b/linux/A.cpp", "#include \"../Role.h\"\nbool isWithin(int a) {\n  return a < Role().limit;\n}\n")
        self.write("platform/b/linux/ATest.cpp", "bool isWithin(int a);\nint main() { return isWithin(2) && !isWithin(3) ? 0 : 1; }\n")
        self.write("CMakeLists.txt", BUILD.replace("platform/a", "platform/b"))
        done = self.mutate("platform/b/Role.h")
        if "does not pass without a mistake" in done.stderr and os.geteuid() != 0:
            self.skipTest("no sandbox for this account")
        self.assertEqual(done.returncode, 0, done.stdout + done.stderr)
        self.assertRegex(done.stdout, r"platform/b +2 +0 +0 +0 +\d+ +100\.0 %\n")


if __name__ == "__main__":
    unittest.main()
