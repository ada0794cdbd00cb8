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


def configured(source, option):
    with tempfile.TemporaryDirectory(prefix="brenvik-partial-") as folder:
        return subprocess.run(["cmake", "-G", "Ninja", "-S", str(source), "-B", folder, f"-D{option}=ON", "-DBUILD_TESTING=OFF"],
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


if __name__ == "__main__":
    unittest.main(verbosity=2)
