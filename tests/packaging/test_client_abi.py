#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""The C library keeps its promises: what programs were built against stays as it was.

libbrenvik-mobile-helper.abi beside this file is what was promised. After a change that is meant, write it anew:
BRENVIK_BUILD=build/dev BRENVIK_SOURCE=. tests/packaging/test_client_abi.py keep
"""
import os
import pathlib
import re
import subprocess
import sys
import tempfile
import unittest

BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
LIBRARY = BUILD / "client" / "libbrenvik-mobile-helper.so.0"
HEADER = SOURCE / "client" / "include" / "brenvik" / "mobile_helper.h"
KEPT = pathlib.Path(__file__).with_name("libbrenvik-mobile-helper.abi")


# The library's own types are not part of the promise: programs see them as handles only.
PRIVATE = r"""[suppress_type]
name_regexp = ^(brenvik::|std::|__gnu|itimer|iovec|sockaddr)
drop_artifact = yes

[suppress_type]
name_regexp = ^bvmh_(client|listener|value)$
drop_artifact = yes
"""


def write(to):
    with tempfile.NamedTemporaryFile("w", suffix=".ini") as private:
        private.write(PRIVATE)
        private.flush()
        subprocess.run(["abidw", "--exported-interfaces-only", "--suppressions", private.name, "--headers-dir",
                        HEADER.parent, "--drop-private-types", "--no-corpus-path", "--no-comp-dir-path",
                        "--no-show-locs", "--out-file", to, LIBRARY], check=True, timeout=300)


def compare(kept, built):
    return subprocess.run(["abidiff", "--no-show-locs", kept, built], capture_output=True, text=True, timeout=300,
                          check=False)


class ClientAbi(unittest.TestCase):
    def test_programs_that_were_built_against_the_promise_still_run(self):
        sections = subprocess.run(["readelf", "-S", "--wide", LIBRARY], check=True, capture_output=True, text=True).stdout
        if ".debug_info" not in sections:
            self.skipTest("the library was built without -g, so its types cannot be seen")
        with tempfile.TemporaryDirectory() as folder:
            built = pathlib.Path(folder) / "built.abi"
            write(built)
            compared = compare(KEPT, built)
            self.assertEqual(compared.returncode, 0, compared.stdout + compared.stderr + __doc__)
            # The comparison sees a member that has changed its place.
            changed = pathlib.Path(folder) / "changed.abi"
            changed.write_text(re.sub(r"(layout-offset-in-bits=')64('[^>]*>\s*<var-decl name='payload')", r"\g<1>128\2",
                                      built.read_text(), count=1))
            self.assertNotEqual(changed.read_text(), built.read_text())
            self.assertNotEqual(compare(KEPT, changed).returncode, 0)

    def test_every_symbol_has_the_version_that_the_package_says(self):
        symbols = subprocess.run(["nm", "-D", "--defined-only", "--with-symbol-versions", LIBRARY], check=True,
                                 capture_output=True, text=True).stdout
        exported = {line.split()[-1].replace("@@", "@") for line in symbols.splitlines() if " T " in line}
        package = (SOURCE / "debian" / "libbrenvik-mobile-helper0.symbols").read_text()
        named = set(re.findall(r"^ ((?:bvmh_|BVMobileHelper)\S+) ", package, flags=re.M))
        self.assertEqual(exported, named)

    def test_the_header_has_the_projects_version(self):
        header = HEADER.read_text()
        version = ".".join(re.search(rf"#define BVMH_VERSION_{part} (\d+)", header)[1]
                           for part in ("MAJOR", "MINOR", "PATCH"))
        project = re.search(r"project\(\S+ VERSION (\S+)", (SOURCE / "CMakeLists.txt").read_text())[1]
        self.assertEqual(version, project)


if __name__ == "__main__":
    if sys.argv[1:] == ["keep"]:
        write(KEPT)
    else:
        unittest.main()
