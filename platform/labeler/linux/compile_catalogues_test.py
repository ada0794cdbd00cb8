#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What the catalogue compiler refuses, each shown by spoiling a copy of a good catalogue."""
import pathlib
import shutil
import subprocess
import sys
import tempfile
import unittest

HERE = pathlib.Path(__file__).resolve().parent


class CompileCatalogues(unittest.TestCase):
    def setUp(self):
        self.folder = pathlib.Path(tempfile.mkdtemp())
        self.addCleanup(shutil.rmtree, self.folder)
        for name in ("en.po", "de.po"):
            shutil.copy(HERE / "po" / name, self.folder)

    def compile(self):
        output = self.folder / "out.cpp"
        result = subprocess.run([sys.executable, HERE / "compile_catalogues.py", output, *self.folder.glob("*.po")],
                                capture_output=True, text=True)
        self.assertEqual(result.returncode == 0, output.exists(), result.stderr)
        return result.stderr

    def spoil(self, old, new, name="de.po"):
        path = self.folder / name
        text = path.read_text(encoding="utf-8")
        self.assertIn(old, text)
        path.write_text(text.replace(old, new, 1), encoding="utf-8")
        return self.compile()

    def test_good_catalogues_compile_to_the_same_source_every_time(self):
        self.assertEqual(self.compile(), "")
        first = (self.folder / "out.cpp").read_bytes()
        self.compile()
        self.assertEqual((self.folder / "out.cpp").read_bytes(), first)

    def test_a_missing_message(self):
        entry = 'msgctxt "subscription label"\nmsgid "Travel"\nmsgstr "Reise"\n'
        self.assertIn("not translated: Travel", self.spoil(entry, ""))

    def test_an_empty_text(self):
        self.assertIn("Travel: empty", self.spoil('"Reise"', '""'))

    def test_a_fuzzy_text(self):
        self.assertIn("Travel: still fuzzy", self.spoil("#. Name of a line used while",
                                                           "#, fuzzy\n#. Name of a line used while"))

    def test_a_text_that_is_not_composed(self):
        self.assertIn("Primary: not in composed form", self.spoil("Primär", "Prima\u0308r"))

    def test_an_unknown_message(self):
        self.assertIn("unknown message: Holiday", self.spoil('msgid "Travel"', 'msgid "Holiday"'))

    def test_a_message_given_twice(self):
        self.assertIn("Business: given twice", self.spoil('msgid "Travel"', 'msgid "Business"'))

    def test_a_header_that_names_another_language(self):
        self.assertIn("not the name of the file", self.spoil("Language: de", "Language: nl"))

    def test_a_tag_served_twice(self):
        self.assertIn("en is served already", self.spoil("X-Also-Serves: gsw", "X-Also-Serves: gsw EN"))

    def test_something_that_is_no_tag(self):
        self.assertIn("not a language tag", self.spoil("X-Also-Serves: gsw", "X-Also-Serves: Swiss_German"))

    def test_no_english(self):
        (self.folder / "en.po").unlink()
        self.assertIn("no catalogue for en", self.compile())


if __name__ == "__main__":
    unittest.main()
