#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What a benchmark prints comes to the handbook, whatever group it is recorded under."""
import os
import pathlib
import shutil
import subprocess
import sys
import tempfile
import unittest

SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
sys.path.insert(0, str(SOURCE / "docs" / "handbook"))
import plots  # noqa: E402: where it stands is known only now

PRINTED = """some text
a call / a bare one                        12.5 10.0   1.250   1.30  ok
a start / another                                      2.000   1.00  ABOVE
"""


class Plots(unittest.TestCase):
    def setUp(self):
        folder = tempfile.TemporaryDirectory()
        self.addCleanup(folder.cleanup)
        self.record = pathlib.Path(folder.name) / "record"
        self.results = pathlib.Path(folder.name) / "results.tsv"
        shutil.copy(SOURCE / "benchmarks" / "record", self.record)
        shutil.copy(SOURCE / "benchmarks" / "results.tsv", self.results)

    def put_down(self, group, printed=PRINTED):
        return subprocess.run([sys.executable, self.record, group], input=printed, capture_output=True, text=True, check=False).returncode

    def test_every_group_is_recorded_and_drawn(self):
        groups = ["library", "python", "preferences", "location", "fetch", "files", "command", "a-new-one"]
        for group in groups:
            self.assertEqual(self.put_down(group, PRINTED.replace(" / ", f" of {group} / ")), 0, group)
        drawn, page = plots.plots(self.results), plots.sections(self.results)
        for group in groups:
            self.assertIn(f"a call of {group} / a bare one: 1.25 (limit 1.3)", drawn[f"benchmark-{group}"])
            self.assertIn(f"a start of {group} / another: 2 (limit 1)", drawn[f"benchmark-{group}"])
            self.assertEqual(page.count(f":file: drawings/benchmark-{group}.svg\n"), 1)
        self.assertEqual(page.count(":file:"), len(drawn))
        self.assertIn("## The client library\n", page)
        self.assertIn("## A-new-one\n", page)

    def test_a_row_that_is_there_gets_the_new_figures_and_the_others_stay(self):
        before = plots.read(self.results)
        self.assertEqual(self.put_down("library"), 0)
        self.assertEqual(self.put_down("library", PRINTED.replace("1.250", "1.125")), 0)
        after = plots.read(self.results)
        self.assertEqual([row for row in after["library"] if row[0] == "a call / a bare one"], [("a call / a bare one", 1.125, 1.3)])
        for group, rows in before.items():
            self.assertEqual([row for row in after[group] if row in rows], rows)

    def test_a_run_without_ratios_changes_nothing(self):
        before = self.results.read_bytes()
        self.assertEqual(self.put_down("library", "it failed\n"), 1)
        self.assertEqual(self.results.read_bytes(), before)

    def test_the_page_has_a_place_for_them(self):
        page = (SOURCE / "docs" / "handbook" / "benchmarks.md").read_text(encoding="utf-8")
        self.assertEqual(sum(line.startswith("<!-- plots:") and line.endswith("-->") for line in page.splitlines()), 1)


if __name__ == "__main__":
    unittest.main()
