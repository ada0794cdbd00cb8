#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Which libraries the helper itself has. What reads foreign bytes with a large library is a worker's, and stays there."""
import os
import pathlib
import re
import subprocess
import unittest

BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
HELPER = BUILD / "BrenvikMobileHelper"
WORKER = BUILD / "brenvik-network-worker"
# The C++ runtime is static in what is installed, and a library of its own in an everyday build.
ALLOWED = r"lib(c|m)\.so\.6|ld-linux.*|lib(stdc\+\+|gcc_s)\.so\..*"
if re.search(r"^BRENVIK_SANITIZE:\w+=.", (BUILD / "CMakeCache.txt").read_text(), re.MULTILINE):
    ALLOWED += r"|lib(a|t|ub)san\.so\..*|libresolv\.so\.2"  # clang's sanitizers replace functions of it
# Functions of HTTP, TLS, SQLite, JSON and compression.
FOREIGN = r"\b(curl_\w+|sqlite3_\w+|SSL_\w+|EVP_\w+|inflate\w*|deflate\w*|gz(open|read)\w*|\w*nlohmann\w*)\b"


def run(*command):
    return subprocess.run([str(each) for each in command], capture_output=True, text=True, check=True).stdout


def needed(program):
    return re.findall(r"NEEDED +(\S+)", run("objdump", "-p", program))


def symbols(program):
    # A stripped program has only those that the dynamic loader needs.
    names = run("nm", "-D", program) + run("nm", program)
    return sorted({found[0] for found in re.finditer(FOREIGN, names)})


class Libraries(unittest.TestCase):
    def test_the_helper_links_the_c_library_and_nothing_else(self):
        self.assertEqual([each for each in needed(HELPER) if not re.fullmatch(ALLOWED, each)], [])

    def test_no_function_of_a_large_library_is_in_it(self):
        self.assertEqual(symbols(HELPER), [])

    def test_it_names_no_such_library_to_load(self):
        content = HELPER.read_bytes()
        self.assertEqual([name for name in (b"libcurl", b"libz.so", b"libsqlite3", b"libssl", b"brenvik-web") if name in content], [])
        self.assertEqual([each.name for each in BUILD.glob("brenvik-*.so") if each.name != "brenvik-allocations.so"], [])

    def test_the_network_worker_does_what_the_helper_does_not(self):
        # Else the tests above would look for the wrong names.
        self.assertIn("libcurl.so.4", needed(WORKER))
        self.assertIn("curl_easy_init", symbols(WORKER))


if __name__ == "__main__":
    unittest.main()
