# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""What the package's tests share. BRENVIK_BUILD names the build folder, BRENVIK_SOURCE the project's."""
import os
import pathlib
import socket
import struct
import sys
import tempfile
import unittest

BUILD = pathlib.Path(os.environ["BRENVIK_BUILD"])
SOURCE = pathlib.Path(os.environ["BRENVIK_SOURCE"])
sys.path[:0] = [str(BUILD / "python"), str(SOURCE / "tools" / "tests"), str(SOURCE / "tests" / "e2e")]


def descriptors():
    return len(os.listdir("/proc/self/fd"))


class InFolder(unittest.TestCase):
    """Each test has a folder of its own and must give back every descriptor."""

    def setUp(self):
        folder = tempfile.TemporaryDirectory(prefix="brenvik-python-")
        self.addCleanup(folder.cleanup)
        self.folder = pathlib.Path(folder.name)
        self.path = self.folder / "helper"

    def expect_no_descriptor_lost(self, work):
        work()  # imports and the like
        before = descriptors()
        work()
        self.assertEqual(descriptors(), before)


def push_message(message_id, region, *, port=7, bits=0x80000012, in_line=True):
    """A push as the helper sends it: the datagram, and the descriptors for it."""
    header = struct.pack("<IIIIIi", bits, 52, port, 0, 0, message_id)
    message = header + struct.pack("<IQBBBBI", 1, 56 if in_line else 0, 0, 1, 0, 1, len(region)) + bytes([0, 0, 0, 0, 1, 0, 0, 0])
    return message + bytes(4) + region if in_line else message


def connected(path):
    sock = socket.socket(socket.AF_UNIX, socket.SOCK_SEQPACKET)
    sock.settimeout(20)
    sock.connect(str(path))
    return sock
