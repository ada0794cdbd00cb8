#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The installed C library, used as other projects use it: pkg-config, CMake, shared and static, from C and C++; and its
examples.

BRENVIK_BUILD names the build folder, BRENVIK_SOURCE the project's.
"""
import os
import pathlib
import plistlib
import re
import shlex
import socket
import struct
import subprocess
import tempfile
import threading
import unittest

from fake_helper import FakeHelper

BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
CONSUMER = SOURCE / "client" / "consumer"
EXAMPLES = SOURCE / "client" / "examples"
STRICT = ["-Wall", "-Wextra", "-Wpedantic", "-Werror"]


def run(*command, **more):
    return subprocess.run([str(each) for each in command], check=True, capture_output=True, text=True, timeout=300,
                          **more).stdout


class InstalledClient(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        folder = tempfile.TemporaryDirectory(prefix="client-install-")
        cls.addClassCleanup(folder.cleanup)
        cls.folder = pathlib.Path(folder.name)
        cls.prefix = cls.folder / "prefix"
        for component in ("client", "client-dev"):
            run("cmake", "--install", BUILD, "--component", component, "--prefix", cls.prefix)
        cls.library = next(cls.prefix.rglob("libbrenvik-mobile-helper.so.0"))

    def config(self, *arguments):
        environment = {**os.environ, "PKG_CONFIG_PATH": str(self.library.parent / "pkgconfig")}
        return shlex.split(run("pkg-config", *arguments, "brenvik-mobile-helper", env=environment))

    def example(self, *path):
        """Compiles an example with the very line that it gives itself, and with warnings; returns the program."""
        source = EXAMPLES.joinpath(*path)
        line = re.search(r"^ \*   cc (.*)$", source.read_text(), flags=re.M)[1]
        folder = self.folder / ("example-" + source.stem)
        folder.mkdir()
        (folder / source.name).write_text(source.read_text())
        run("sh", "-c", " ".join(["cc", "-std=c11", "-D_DEFAULT_SOURCE", *STRICT, line]), cwd=folder,
            env={**os.environ, "PKG_CONFIG_PATH": str(self.library.parent / "pkgconfig")})
        return folder / source.stem

    def run_example(self, program, path):
        return subprocess.run([program, path], env={**os.environ, "LD_LIBRARY_PATH": str(self.library.parent)},
                              capture_output=True, text=True, timeout=60, check=False)

    def expect_working(self, program):
        path = self.folder / "helper"
        environment = {**os.environ, "LD_LIBRARY_PATH": str(self.library.parent)}
        with FakeHelper(path, lambda request: request.string("DE", 64)):
            self.assertEqual(run(program, path, env=environment), "DE\n")
        path.unlink()
        failed = subprocess.run([program, path], env=environment, capture_output=True, text=True, timeout=60)
        self.assertEqual((failed.returncode, failed.stderr), (1, "no helper answers at its socket\n"))

    def test_shared_through_pkg_config_from_c(self):
        program = self.folder / "c-shared"
        run("cc", "-std=c11", *STRICT, CONSUMER / "main.c", "-o", program, *self.config("--cflags", "--libs"))
        self.expect_working(program)
        self.assertIn("libbrenvik-mobile-helper.so.0", run("objdump", "-p", program))

    def test_static_through_pkg_config_from_c(self):
        program = self.folder / "c-static"
        libraries = [each if each != "-lbrenvik-mobile-helper" else "-l:libbrenvik-mobile-helper.a"
                     for each in self.config("--static", "--libs")]
        run("cc", "-std=c11", *STRICT, CONSUMER / "main.c", "-o", program, *self.config("--cflags"), *libraries)
        self.expect_working(program)
        self.assertNotIn("libbrenvik-mobile-helper", run("objdump", "-p", program))

    def test_from_cpp(self):
        program = self.folder / "cpp"
        run("c++", "-std=c++20", *STRICT, "-x", "c++", CONSUMER / "main.c", "-x", "none", "-o", program,
            *self.config("--cflags", "--libs"))
        self.expect_working(program)

    def test_the_examples_in_cpp_compile_in_both_languages_and_do_what_they_say(self):
        environment = {**os.environ, "LD_LIBRARY_PATH": str(self.library.parent)}
        stored = []

        def answer(request):
            if request.id == 8683555:
                stored.append(request.region())
                return request.status(0)
            return request.payload(stored[-1]) if request.id == 8683556 else request.string("DE", 64)

        def push(request):
            region = plistlib.dumps({"CountryCode": "NO", "City": "Oslo"}, fmt=plistlib.FMT_BINARY)
            with socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET) as sender:
                sender.connect(str(self.folder / "com.norvale.brenvik"))
                sender.send(struct.pack("<IIIIIi", 0x80000012, 52, 7, 0, 0, 9100001) + struct.pack(
                    "<IQBBBBI", 1, 56, 0, 1, 0, 1, len(region)) + bytes([0, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0]) + region)
                self.assertEqual(len(sender.recv(100)), 44)
            return request.status(0)

        def push_later(request):
            threading.Thread(target=push, args=(request,)).start()
            return request.status(0)

        for standard in ("c++20", "c++23"):
            for name, work, words, expected in (
                    ("preferences", answer, [], "51 bytes of XML\ncountry \"DE\"\n"),
                    ("pushes", push_later, [self.folder], 'country "NO", city "Oslo"\n')):
                program = self.folder / f"{name}-{standard}"
                run("c++", f"-std={standard}", *STRICT, "-Wconversion", "-Wold-style-cast",
                    SOURCE / "client" / "examples" / "cpp" / f"{name}.cpp", "-o", program, *self.config("--cflags", "--libs"))
                path = self.folder / "helper"
                with FakeHelper(path, work):
                    self.assertEqual(run(program, path, *words, env=environment), expected)
                path.unlink()
                failed = subprocess.run([program, path, *words], env=environment, capture_output=True, text=True, timeout=60)
                self.assertEqual((failed.returncode, failed.stderr), (1, "cannot connect: no helper answers at its socket\n"))

    def test_every_program_of_the_page_about_cpp_prints_what_stands_below_it(self):
        page = (SOURCE / "docs" / "cpp.md").read_text()
        programs = re.findall(r"^```cpp\n(.*?)^```\n```text\n(.*?)^```$", page, re.M | re.S)
        self.assertEqual(len(programs), 4)
        script = self.folder / "script"
        script.write_text('on SetVoicemailToken\non CopyCountryCode\n answer "NO"\non LoadPlistFile\n fail 9\n'
                          'on SetPreferenceValue value={"text": "Hello"}\non CopyLocalizedLabels\n answer ["Reise"]\n'
                          'on RequestCountryCodeFromLocation\n push civic-info City="Oslo"\n')
        for number, (code, expected) in enumerate(programs):
            source, program = self.folder / f"page-{number}.cpp", self.folder / f"page-{number}"
            source.write_text(code)
            run("c++", "-std=c++20", *STRICT, source, "-o", program, *self.config("--cflags", "--libs"))
            done = subprocess.run([BUILD / "brenvik-mobile-helper-mock", script, "--", program], capture_output=True, text=True,
                                  timeout=60, env={**os.environ, "LD_LIBRARY_PATH": str(self.library.parent)})
            if "namespaces" in done.stderr:
                self.skipTest("this system lets no program make namespaces")
            self.assertEqual((done.returncode, done.stdout, done.stderr), (0, expected, ""))

    def test_through_cmake(self):
        build = self.folder / "consumer"
        run("cmake", "-S", CONSUMER, "-B", build, f"-DCMAKE_PREFIX_PATH={self.prefix}")
        run("cmake", "--build", build)
        for program in ("shared", "static"):
            self.expect_working(build / program)

    def test_the_examples_of_event_loops_print_what_they_asked_for(self):
        answers = {8683568: lambda request: request.string("NO", 64), 8683554: lambda request: request.string("t", 256)}
        for source in ("sd-event.c", "glib.c"):
            with self.subTest(source):
                program = self.example("event-loops", source)
                path = self.folder / "loop-helper"
                with FakeHelper(path, lambda request: answers[request.id](request)):
                    ended = self.run_example(program, path)
                self.assertEqual((ended.returncode, ended.stdout, ended.stderr),
                                 (0, 'country: "NO"\ntoken: "t"\n', ""))
                path.unlink()
                with FakeHelper(path, refusal=35):
                    refused = self.run_example(program, path)
                path.unlink()
                self.assertEqual((refused.returncode, refused.stderr.count("the caller lacks the entitlement")), (1, 3))

    def test_the_example_of_values_stores_and_reads_a_dictionary(self):
        program = self.example("values", "preferences.c")
        stored = []

        def answer(request):
            if request.id == 8683555:
                stored.append(plistlib.loads(request.region()))
                return request.status(0)
            return request.payload(plistlib.dumps(stored[-1]))

        path = self.folder / "values-helper"
        with FakeHelper(path, answer):
            ended = self.run_example(program, path)
        self.assertEqual((ended.returncode, ended.stdout, ended.stderr), (0, "carrier Example, bands 1 3 20\n", ""))
        self.assertEqual(stored, [{"Carrier": "Example", "Version": 7, "Bands": [1, 3, 20]}])

    def test_the_shared_library_exports_what_the_header_declares(self):
        header = (self.prefix / "include" / "brenvik" / "mobile_helper.h").read_text()
        declared = set(re.findall(r"\b(bvmh_\w+|BVMobileHelper\w+)\(", re.sub(r"/\*.*?\*/", "", header, flags=re.S)))
        symbols = [line.split() for line in run("nm", "-D", "--defined-only", self.library).splitlines()]
        exported = {name.split("@")[0] for _, kind, name in symbols if kind == "T"}
        self.assertEqual(exported, declared)
        self.assertEqual({name for _, kind, name in symbols if kind not in "TA"}, set())
        routines = {name for name in exported if name.startswith("BVMobileHelper") and not name.endswith("Begin")}
        self.assertEqual(len(routines), 27)
        self.assertEqual({name for name in exported if name.endswith("Begin")}, {name + "Begin" for name in routines})
        self.assertIn("libbrenvik-mobile-helper.so.0", re.search(r"SONAME +(\S+)", run("objdump", "-p", self.library))[1])

    def test_the_shared_library_needs_the_c_and_cpp_libraries_only(self):
        needed = set(re.findall(r"NEEDED +(\S+)", run("objdump", "-p", self.library)))
        # The loader, which belongs to the C library, is named where the value that guards the stack is its own: on arm64.
        needed = {name for name in needed if not name.startswith("ld-linux-")}
        self.assertLessEqual(needed, {"libc.so.6", "libm.so.6", "libstdc++.so.6", "libgcc_s.so.1"})

    def test_the_library_alone_builds_without_any_other_package(self):
        build = self.folder / "client-only"
        # Neither the test framework nor anything that pkg-config could find may be needed.
        environment = {**os.environ, "PKG_CONFIG_LIBDIR": str(self.folder / "none")}
        run("cmake", "-S", SOURCE, "-B", build, "-G", "Ninja", "-DBRENVIK_CLIENT_ONLY=ON", "-DCMAKE_DISABLE_FIND_PACKAGE_GTest=ON",
            f"-DCMAKE_INSTALL_PREFIX={self.folder / 'alone'}", env=environment)
        run("cmake", "--build", build)
        run("cmake", "--install", build)
        self.assertTrue((self.folder / "alone" / "include" / "brenvik" / "mobile_helper.h").exists())
        self.assertEqual({each.name for each in build.glob("B*Helper")}, set(), "the daemon was built, too")


class Options(unittest.TestCase):
    def options(self, **values):
        return subprocess.run(["cmake", *(f"-D{name}={value}" for name, value in values.items()), "-P",
                               SOURCE / "cmake" / "BrenvikOptions.cmake"], capture_output=True, text=True, timeout=60,
                              check=False)

    def test_a_big_endian_machine_is_refused_with_a_sentence(self):
        refused = self.options(CMAKE_CXX_BYTE_ORDER="BIG_ENDIAN", CMAKE_SYSTEM_PROCESSOR="s390x")
        self.assertNotEqual(refused.returncode, 0)
        self.assertIn("runs on little-endian machines only; s390x is not one.", " ".join(refused.stderr.split()))

    def test_warnings_are_errors_unless_they_are_switched_off(self):
        for given, expected in (([], True), (["-DBRENVIK_WERROR=OFF"], False)):
            with tempfile.TemporaryDirectory(prefix="client-werror-") as build:
                run("cmake", "-S", SOURCE, "-B", build, "-G", "Ninja", "-DBRENVIK_CLIENT_ONLY=ON", *given)
                self.assertEqual("-Werror" in (pathlib.Path(build) / "build.ninja").read_text(), expected)


if __name__ == "__main__":
    unittest.main()
