#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""docs/protocol.md says what the code does: its table, its byte diagrams and its client are tried.

BRENVIK_BUILD names the build folder, BRENVIK_SOURCE the project's.
"""
import json
import os
import pathlib
import plistlib
import re
import subprocess
import sys
import tempfile
import unittest

import jsonschema

from fake_helper import FakeHelper, Request

BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
INTERFACE = pathlib.Path(os.environ["BRENVIK_SOURCE"]) / "interface"
PAGE = (pathlib.Path(os.environ["BRENVIK_SOURCE"]) / "docs" / "protocol.md").read_text(encoding="utf-8")


def blocks(language):
    return re.findall(rf"^ *```{language}\n(.*?)^ *```$", PAGE, re.M | re.S)


def diagram(block):
    """The bytes of a diagram of "offset  hex bytes   words" lines, which must follow one another."""
    data = b""
    for line in block.splitlines():
        offset, hex_bytes = re.match(r" *(\d+)  ((?:[0-9a-f]{2} )*[0-9a-f]{2})(?:   |$)", line).groups()
        assert int(offset) == len(data), line
        data += bytes.fromhex(hex_bytes)
    return data


class ProtocolPage(unittest.TestCase):
    def test_the_table_is_the_one_of_the_code(self):
        table = re.search(r"<!-- routines: printed .*-->\n\n(.*?)\n<!-- routines: end -->", PAGE, re.S)[1]
        printed = subprocess.run([BUILD / "protocol-table"], capture_output=True, text=True, check=True).stdout
        self.assertEqual(len(printed.splitlines()), 2 + 28)
        self.assertEqual(table, printed, "put what build/.../protocol-table prints between the two marks")

    def test_the_check_in_is_what_a_client_sends_and_gets(self):
        request, reply = [block for block in blocks("text") if "disposition 1" in block]
        with tempfile.TemporaryDirectory() as folder, FakeHelper(f"{folder}/helper") as helper:
            subprocess.run([BUILD / "bvhelperctl", "--socket", f"{folder}/helper", "ping"], check=True,
                           stdout=subprocess.DEVNULL)
        self.assertEqual(helper.check_ins, [(diagram(request), diagram(reply))])

    def test_the_client_works(self):
        source, = blocks("python")
        value = {"Name": "Norvale"}
        for in_line in (True, False):
            def answer(request: Request):
                if request.id == 8683568:
                    return request.string("DE", 64)
                self.assertEqual((request.id, len(request.data)), (8683572, 288))
                self.assertEqual(request.text(32, 256), "/etc/some.plist")
                return request.payload(plistlib.dumps(value), in_line)

            with tempfile.TemporaryDirectory() as folder, FakeHelper(f"{folder}/helper", answer):
                done = self.run_client(source, f"{folder}/helper")
                self.assertEqual((done.returncode, done.stdout, done.stderr), (0, f"DE\n{value}\n", ""))

    def test_the_client_reports_a_refusal(self):
        source, = blocks("python")
        with tempfile.TemporaryDirectory() as folder, FakeHelper(f"{folder}/helper", refusal=35):
            done = self.run_client(source, f"{folder}/helper")
            self.assertEqual((done.returncode, done.stdout, done.stderr), (1, "", "the helper answered 35\n"))

    @staticmethod
    def run_client(source, path):
        return subprocess.run([sys.executable, "-c", source, "/etc/some.plist", path], capture_output=True, text=True,
                              timeout=60)

    def test_every_link_within_the_page_has_its_heading(self):
        headings = {re.sub(r"[^a-z0-9 -]", "", heading.lower()).replace(" ", "-")
                    for heading in re.findall(r"^#+ (.*)$", PAGE, re.M)}
        links = set(re.findall(r"\]\(#([^)]*)\)", PAGE))
        self.assertTrue(links)
        self.assertLessEqual(links, headings)

    def test_the_places_are_the_defaults_of_the_build(self):
        options = (pathlib.Path(os.environ["BRENVIK_SOURCE"]) / "cmake" / "BrenvikOptions.cmake").read_text()
        rows = re.findall(r"^\| `(BRENVIK_\w+)` \| (\S+) \|", PAGE, re.M)
        self.assertGreaterEqual(len(rows), 9)
        for name, value in rows:
            default = re.search(rf'^set\({name} "([^"]*)"', options, re.M)[1]
            default = default.removeprefix("${PROJECT_SOURCE_DIR}/")
            self.assertEqual(value.strip("`"), default or "empty", name)


class ProtocolAsJson(unittest.TestCase):
    """interface/protocol.json, from which bindings of other languages are made."""

    @classmethod
    def setUpClass(cls):
        cls.text = (INTERFACE / "protocol.json").read_text(encoding="utf-8")
        cls.table = json.loads(cls.text)

    def test_it_is_what_the_code_says(self):
        printed = subprocess.run([BUILD / "protocol-table", "json"], capture_output=True, text=True, check=True).stdout
        self.assertEqual(self.text, printed, "put what `build/.../protocol-table json` prints into interface/protocol.json")

    def test_it_fits_its_schema_and_the_schema_is_strict(self):
        schema = json.loads((INTERFACE / "protocol.schema.json").read_text(encoding="utf-8"))
        validator = jsonschema.Draft202012Validator(schema)
        validator.check_schema(schema)
        validator.validate(self.table)
        for spoil in (lambda table: table.pop("codes"), lambda table: table["routines"][3].update(reply="number"),
                      lambda table: table["routines"][1]["arguments"][0].update(surprise=1)):
            spoilt = json.loads(self.text)
            spoil(spoilt)
            self.assertFalse(validator.is_valid(spoilt))

    def test_every_byte_of_a_request_has_one_meaning(self):
        header, ndr = self.table["header"]["size"], len(self.table["constants"]["ndr"])
        for each in self.table["routines"]:
            used = [(0, header)] + [(field["offset"], field["size"]) for field in each["arguments"]]
            if each["arguments"] and each["name"] != "CheckIn":
                descriptors = [field for field in each["arguments"] if field["type"] == "region"]
                used.append((descriptors[-1]["offset"] + descriptors[-1]["size"] if descriptors else header, ndr))
            at = 0
            for offset, size in sorted(used):
                self.assertEqual(offset, at, each["name"])
                at += size
            self.assertEqual(at, each["requestSize"], each["name"])

    def test_the_page_has_its_codes_forms_and_pushes(self):
        codes = re.search(r"^\| Code \| \|\n\|.*\n((?:\|.*\n)+)", PAGE, re.M)[1]
        on_page = {int(number) for row in codes.splitlines() for number in re.findall(r"-?\d+", row.split("|")[1])}
        self.assertEqual(on_page, {each["code"] for each in self.table["codes"]})
        for each in self.table["replyForms"]:
            self.assertRegex(PAGE, rf"(?m)^\| {each['form']} \| {each['size']}\b")
        for each in self.table["pushes"]["messages"]:
            keys = ", ".join(f"`{key}`" for key in each["keys"])
            self.assertIn(f"| {each['id']} | `{each['name']}` | {keys} |", PAGE)
        for kind in self.table["notifications"]["kinds"]:
            self.assertIn(f"| `{kind}` |", PAGE)


if __name__ == "__main__":
    unittest.main()
