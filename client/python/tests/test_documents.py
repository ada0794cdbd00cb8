#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The examples of docs/python.md and docs/mock.md do what the pages say, and so does the example daemon."""
import os
import re
import socket
import subprocess
import sys
import unittest

import support
from brenvik_mobile_helper import Client, _table
from brenvik_mobile_helper.mock import Mock, parse
from brenvik_mobile_helper.mock._script import _IN_RULE

DOCS = support.SOURCE / "docs"
HELPER = """
on SetPreferenceValue
on CopyPreferenceValue
  answer {"greeting": "Hello", "count": 3}
on CopyCountryCode
  answer "NO"
on CopyVoicemailToken
  answer "secret"
on LoadPlistFile
  fail 9
on RequestCountryCodeFromLocation
  push civic-info CountryCode="NO" City="Oslo"
"""
# The examples look for the helper where it is; here that is the mock's folder.
PRELUDE = """
import brenvik_mobile_helper._client as c, brenvik_mobile_helper._listener as l
c.BOOTSTRAP_DIRECTORY = l.BOOTSTRAP_DIRECTORY = {!r}
del c, l
"""


def blocks(page, language):
    text = (DOCS / page).read_text(encoding="utf-8")
    return re.findall(rf"^```{language}\n(.*?)^```\n(?:```text\n(.*?)^```$)?", text, re.M | re.S)


class Pages(unittest.TestCase):
    def run_block(self, code, directory):
        environment = {**os.environ, "PYTHONPATH": str(support.BUILD / "python")}
        return subprocess.run([sys.executable, "-c", PRELUDE.format(directory) + code], env=environment, capture_output=True,
                              text=True, timeout=60)

    def test_every_python_example_prints_what_stands_below_it(self):
        count = 0
        for page in ("python.md", "mock.md"):
            for code, expected in blocks(page, "python"):
                with Mock(HELPER) as mock:
                    done = self.run_block(code, mock.directory)
                self.assertEqual((done.returncode, done.stderr, done.stdout), (0, "", expected), code)
                count += 1
        self.assertEqual(count, 5)

    def test_every_script_is_read(self):
        scripts = blocks("mock.md", "mock")
        self.assertEqual(len(scripts), 2)
        for script, _ in scripts:
            self.assertGreater(len(parse(script).rules), 3)

    def test_the_page_has_every_word_of_a_script(self):
        rows = re.findall(r"^\| `(\w+)", (DOCS / "mock.md").read_text(), re.M)
        self.assertEqual(set(rows) - {"bvhelperctl"}, set(_IN_RULE))

    def test_the_page_names_every_exception_and_event(self):
        import brenvik_mobile_helper as package
        text = (DOCS / "python.md").read_text()
        for name in package.__all__:
            if name.endswith("Error") and name not in ("Error", "TransportError", "NameInUseError", "NameLostError", "NoLongerThereError",
                                                       "NotHandedOverError"):
                self.assertIn(f"`{name}`", text)


class ExampleDaemon(support.InFolder):
    def test_it_prints_what_it_is_told(self):
        with Mock(HELPER) as mock:
            sockets = []
            for name in (_table.PUSH_SERVICE, _table.NOTIFICATION_SERVICE):
                sock = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
                self.addCleanup(sock.close)
                sock.bind(os.path.join(mock.directory, name))
                sock.listen(4)
                sockets.append(sock)
            environment = {**os.environ, "PYTHONPATH": str(support.BUILD / "python"), "LISTEN_FDS": "2",
                           "LISTEN_FDNAMES": f"{_table.PUSH_SERVICE}:{_table.NOTIFICATION_SERVICE}"}
            source = (support.SOURCE / "client" / "examples" / "python" / "brenvikd.py").read_text()
            first, second = (each.fileno() for each in sockets)
            shell = f'exec 3<&{first} 4<&{second}; LISTEN_PID=$$ exec "$@"'
            process = subprocess.Popen(["/bin/bash", "-c", shell, "sh", sys.executable, "-c",
                                        PRELUDE.format(mock.directory) + source], env=environment, pass_fds=(first, second),
                                       stdout=subprocess.PIPE, text=True)
            self.addCleanup(process.stdout.close)
            self.addCleanup(process.wait)
            self.addCleanup(process.kill)
            self.assertEqual(process.stdout.readline(), 'country "NO", city "Oslo"\n')


if __name__ == "__main__":
    unittest.main()
