#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""docs/log-messages.txt, the manual page and the catalogue have every text that the helper can log, and no other.

BRENVIK_SOURCE names the project's folder, BRENVIK_BUILD the build's.
"""
import os
import pathlib
import re
import subprocess
import sys
import unittest

SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
sys.path.insert(0, str(SOURCE / "docs" / "man"))
import pages  # noqa: E402

STRING = r'"(?:[^"\\]|\\.)*"'
LEVELS = {"standard": "default"}


def unquoted(literals):
    text = "".join(part[1:-1] for part in re.findall(STRING, literals))
    return text.replace('\\"', '"').replace("\\\\", "\\").removesuffix("\\n")


def texts_of_the_source():
    found = set()
    for path in [*SOURCE.glob("helper/**/*"), *SOURCE.glob("Helper/**/*"), *SOURCE.glob("platform/**/*")]:
        if path.suffix not in (".cpp", ".h") or "fakes" in path.parts or path.parent.name == "log" or \
                re.search(r"(Test|Fuzz|TestSupport)\.", path.name):
            continue
        source = path.read_text()
        calls = len(re.findall(r"\blog(?:Unified|Bsd)\(", source))
        pattern = rf"\blog(Unified|Bsd)\(\s*(?:LogLevel|SyslogPriority)::(\w+),\s*((?:{STRING}\s*)+)[,)]"
        matches = re.findall(pattern, source)
        if len(matches) != calls:
            raise AssertionError(f"{path}: {calls} log calls, of which {len(matches)} have a text that can be read here")
        for channel, level, text in matches:
            found.add((channel.lower(), LEVELS.get(level, level), unquoted(text)))
        # Texts that a call passes by "%s".
        for table in re.findall(r"\bFieldTexts k\w+\{(.*?)\};", source, flags=re.S):
            found.update(("unified", "error", unquoted(text)) for text in re.findall(STRING, table))
    return found


class LogMessages(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        cls.messages = [each for _, group in pages.read_messages() for each in group]

    def test_every_text_of_the_source_is_explained_and_no_other(self):
        explained = {(each.channel, each.level, each.text) for each in self.messages}
        self.assertEqual(len(explained), len(self.messages), "a text is explained twice")
        source = texts_of_the_source()
        self.assertGreater(len(source), 100)
        self.assertEqual(explained - source, set(), "explained, and not in the source")
        self.assertEqual(source - explained, set(), "in the source, and not explained")

    def test_the_manual_page_has_every_text(self):
        page = BUILD / "docs" / "man" / "BrenvikMobileHelper.8"
        if not page.exists():
            self.skipTest("scdoc is not installed, so there are no pages")
        shown = subprocess.run(["nroff", "-man", "-Tutf8", "-rLL=4000n", str(page)], capture_output=True, text=True,
                               timeout=60, check=True).stdout
        shown = " ".join(re.sub(r"\x1b\[[0-9;]*m|.\x08", "", shown).split())
        for each in self.messages:
            self.assertIn(" ".join(each.text.split()), shown)
            self.assertIn(" ".join(each.meaning.split()), shown)

    def test_the_catalogue_has_every_failure_and_refusal_under_its_id(self):
        catalogue = (BUILD / "docs" / "man" / "brenvik-mobile-helper.catalog").read_text()
        ids = re.findall(r"^-- ([0-9a-f]{32})$", catalogue, flags=re.M)
        self.assertEqual(len(ids), len(set(ids)))
        wanted = {each.id for each in self.messages if each.kind != "progress"}
        self.assertEqual(set(ids), wanted)

    def test_an_entry_of_the_catalogue_says_in_its_subject_what_has_happened(self):
        catalogue = (BUILD / "docs" / "man" / "brenvik-mobile-helper.catalog").read_text()
        subjects = dict(re.findall(r"^-- ([0-9a-f]{32})\nSubject: (.*)$", catalogue, flags=re.M))
        for each in self.messages:
            if each.kind == "progress":
                continue
            subject = subjects[each.id]
            self.assertRegex(subject, r"^(Failed|Refused): \S+( \S+){2,}$")
            self.assertIn(subject.split(": ", 1)[1], each.meaning)
            others = [other.meaning for other in self.messages if other.kind != "progress" and other.id != each.id and
                      subjects[other.id] == subject]
            self.assertLessEqual(len(others), 1, f"{subject!r} does not tell which: {others}")

    def test_ids_are_made_by_the_rule_of_the_log(self):
        # The published value of FNV-1a for "foobar"; LogTest has the same.
        message = pages.Message(["unified error progress", "foobar", "A text."])
        self.assertEqual(message.id, "343e1662793c64bf6f0d3597ba446f18")


if __name__ == "__main__":
    unittest.main()
