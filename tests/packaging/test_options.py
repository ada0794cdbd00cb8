#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The tables of options say what CMake and the scripts say: the same names, the same defaults."""
import os
import pathlib
import re
import subprocess
import unittest

SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
ROW = re.compile(r"^\| `(\w+)`( \(environment\))? \| ([^|]*) \| ", re.MULTILINE)


def read(name):
    return (SOURCE / name).read_text(encoding="utf-8")


def files(*patterns):
    listed = subprocess.run([SOURCE / "scripts" / "list-files", *patterns], check=True, capture_output=True, text=True).stdout
    return [each for each in listed.split("\0") if each]


def rows(page, environment=False):
    """Name and default of each row; an empty default is said in a word."""
    found = [(name, "" if default == "empty" else default.strip("`"))
             for name, kind, default in ROW.findall(page) if bool(kind) == environment]
    names = [name for name, _ in found]
    assert len(names) == len(set(names)), f"named twice: {names}"
    return dict(found)


def options_of_cmake():
    """Name and default of each option that somebody can set. A name that is put together is no option."""
    found = {}
    for path in files("*CMakeLists.txt", "*.cmake"):
        text = read(path)
        found |= re.findall(r'\boption\((BRENVIK_\w+)\s+"[^"]*"\s+(\w+)\)', text)
        found |= re.findall(r'\bset\((BRENVIK_\w+)\s+"([^"]*)"\s+CACHE\s', text)
        found |= {name: "found" for name in re.findall(r"\bfind_program\((BRENVIK_\w+)\s", text)}
        for name in re.findall(r"\b(?:option|find_program)\((BRENVIK_\w+)\s|\bset\((BRENVIK_\w+)[^()]*\sCACHE\s", text):
            assert any(each in found for each in name if each), f"{path}: no default was read of {name}"
    return {name: default.replace("${PROJECT_SOURCE_DIR}/", "") for name, default in found.items()}


class Options(unittest.TestCase):
    maxDiff = None

    def test_what_cmake_takes(self):
        told = rows(read("docs/building.md"))
        self.assertEqual(told.pop("BUILD_TESTING"), "ON")  # CMake's own
        self.assertEqual(told, options_of_cmake())

    def test_the_places_of_the_protocol(self):
        places = rows(read("docs/protocol.md").partition("\n## Places\n")[2])
        building = rows(read("docs/building.md").partition("\n## Places\n")[2])
        self.assertEqual(places, building)
        self.assertGreater(len(places), 10)

    def test_the_environment(self):
        found = {}
        for path in files("*CMakeLists.txt", "*.cmake"):
            found |= {name: None for name in re.findall(r"\$ENV\{(\w+)\}", read(path))}
        self.assertIn("CC_FOR_BUILD", found)
        told = rows(read("docs/building.md"), environment=True)
        for path in files("scripts/*", "tests/install/*", "tests/everywhere/*"):
            for name, default in re.findall(r"\$\{(BRENVIK_\w+):-([^}]*)\}", read(path)):
                found[name] = None
                if default:
                    self.assertEqual(told.get(name), "random" if default == "$RANDOM" else default, f"{path}: {name}")
        self.assertEqual(sorted(told), sorted(found))


if __name__ == "__main__":
    unittest.main()
