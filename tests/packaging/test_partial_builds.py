#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Builds that have part of the project only have all that this part needs; each names what it builds.

BRENVIK_BUILD names the build folder, BRENVIK_SOURCE the project's.
"""
import os
import pathlib
import shutil
import subprocess
import tempfile
import unittest

SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])


def configured(source, *options, machine=""):
    """`machine`: CMake commands that replace what was found out about the machine that is built for."""
    with tempfile.TemporaryDirectory(prefix="brenvik-partial-") as folder:
        facts = pathlib.Path(folder) / "machine.cmake"
        facts.write_text(machine)
        return subprocess.run(["cmake", "-G", "Ninja", "-S", str(source), "-B", f"{folder}/build", "-DBUILD_TESTING=OFF",
                               f"-DCMAKE_PROJECT_BrenvikMobileHelper_INCLUDE={facts}", *(f"-D{each}=ON" for each in options)],
                              capture_output=True, text=True, timeout=120, check=False)


class PartialBuilds(unittest.TestCase):
    def test_the_programs_that_a_cross_build_runs(self):
        done = configured(SOURCE, "BRENVIK_BUILD_TOOLS_ONLY")
        self.assertEqual(done.returncode, 0, done.stderr)

    def test_the_client_library_alone(self):
        done = configured(SOURCE, "BRENVIK_CLIENT_ONLY")
        self.assertEqual(done.returncode, 0, done.stderr)

    def test_a_library_that_is_not_part_of_the_build_is_named(self):
        with tempfile.TemporaryDirectory(prefix="brenvik-partial-") as folder:
            source = pathlib.Path(folder) / "source"
            shutil.copytree(SOURCE, source, symlinks=True, ignore=shutil.ignore_patterns("build", ".git", "corpus"))
            lists = source / "platform/base/CMakeLists.txt"
            lists.write_text(lists.read_text().replace("brenvik_library(platform_base", "brenvik_library(platform_base DEPENDS platform_geo", 1))
            done = configured(source, "BRENVIK_CLIENT_ONLY")
        self.assertNotEqual(done.returncode, 0)
        self.assertIn("platform_base needs platform_geo, which this build does not have", done.stderr)


class Machines(unittest.TestCase):
    """What the build is for decides whether it begins."""

    def test_a_big_endian_machine_is_refused(self):
        for options in ((), ("BRENVIK_CLIENT_ONLY",), ("BRENVIK_BUILD_TOOLS_ONLY",)):
            with self.subTest(options=options):
                done = configured(SOURCE, *options, machine="set(CMAKE_CXX_BYTE_ORDER BIG_ENDIAN)\nset(CMAKE_SYSTEM_PROCESSOR s390x)")
                self.assertEqual(done.returncode, 1)
                self.assertIn("BrenvikMobileHelper runs on little-endian machines only; s390x is not one.", " ".join(done.stderr.split()))

    def test_32_bits_are_refused(self):
        for options in ((), ("BRENVIK_CLIENT_ONLY",)):
            with self.subTest(options=options):
                done = configured(SOURCE, *options, machine="set(CMAKE_SIZEOF_VOID_P 4)")
                self.assertEqual(done.returncode, 1)
                self.assertIn("BrenvikMobileHelper runs on 64-bit machines only; this build's pointers have 4 bytes.", " ".join(done.stderr.split()))

    def test_another_processor_is_refused(self):
        for processor in ("riscv64", ""):
            with self.subTest(processor):
                done = configured(SOURCE, machine=f"set(CMAKE_SYSTEM_PROCESSOR {processor})")
                self.assertEqual(done.returncode, 1)
                told = " ".join(done.stderr.split())
                self.assertIn(f'BrenvikMobileHelper runs on x86-64 and aarch64 only; CMAKE_SYSTEM_PROCESSOR is "{processor}".', told)
                self.assertIn("-DBRENVIK_CLIENT_ONLY=ON", told)

    def test_the_client_library_may_be_for_another_processor(self):
        done = configured(SOURCE, "BRENVIK_CLIENT_ONLY", machine="set(CMAKE_SYSTEM_PROCESSOR riscv64)")
        self.assertEqual(done.returncode, 0, done.stderr)

    def test_a_cross_build_may_run_on_another_machine(self):
        done = configured(SOURCE, "BRENVIK_BUILD_TOOLS_ONLY", machine="set(CMAKE_SYSTEM_PROCESSOR armv7l)\nset(CMAKE_SIZEOF_VOID_P 4)")
        self.assertEqual(done.returncode, 0, done.stderr)

    def test_another_name_of_one_of_the_two_processors(self):
        """As other kernels and toolchain files write it. To configure the whole build would take longer: it ends after the check."""
        machine = "set(CMAKE_SYSTEM_PROCESSOR {})\nvariable_watch(BRENVIK_BOOTSTRAP_DIRECTORY past_the_check)\n" \
                  "function(past_the_check)\n  message(FATAL_ERROR past-the-check)\nendfunction()"
        for processor in ("AMD64", "aarch64", "arm64"):
            with self.subTest(processor):
                self.assertIn("past-the-check", configured(SOURCE, machine=machine.format(processor)).stderr)


if __name__ == "__main__":
    unittest.main(verbosity=2)
