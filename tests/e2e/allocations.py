# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Lets requests of the real daemon for memory fail, and tells how many it made and what it holds (Allocations.c)."""
import mmap
import pathlib
import re
import struct
import subprocess

from harness import BUILD

LIBRARY = BUILD / "libbrenvik-allocations.so"
AVAILABLE = LIBRARY.exists()  # a sanitizer has the heap to itself
FILE = pathlib.Path("/tmp/allocations")
FRAMES = 48  # as in Allocations.c
SHOWN = 6
FORMAT = struct.Struct(f"<QqQQQQQ{FRAMES}Q")
EVER = (1 << 64) - 1


class Allocations:
    """Of the daemon that is started with `environment` next, until another one is."""

    def __init__(self, path=FILE):
        path.write_bytes(bytes(FORMAT.size))
        with open(path, "r+b") as file:
            self._map = mmap.mmap(file.fileno(), FORMAT.size)
        self._names = {}  # (file, offset): its function and line
        self.environment = {"LD_PRELOAD": str(LIBRARY), "BRENVIK_ALLOCATIONS": str(path)}

    def close(self):
        self._map.close()

    def _fields(self):
        return FORMAT.unpack_from(self._map)

    @property
    def made(self):
        """Requests for memory, or for a thread, since the daemon started."""
        return self._fields()[0]

    @property
    def live(self):
        """Blocks of the heap that it holds."""
        return self._fields()[1]

    @property
    def failed(self):
        """How many failed since the last arming."""
        return self._fields()[4]

    def arm(self, number, to=None):
        """Lets the request fail that is the `number`th from now, and those after it up to `to`, or EVER."""
        # The daemon is idle now. One byte arms it, so that no thread of it sees half of this.
        made = self.made
        struct.pack_into("<QQQQQ", self._map, 16, made + number, min(made + (to or number), EVER), 0, 0, 0)
        self._map[40] = 1

    def rewind(self):
        """No daemon is there; the next one begins at 0."""
        self._map[:FORMAT.size] = bytes(FORMAT.size)

    def disarm(self):
        self._map[40] = 0

    @property
    def armed(self):
        return self._map[40] != 0

    def who(self, maps, everything=False):
        """The callers of the first that failed, innermost first. `maps`: the process's, while it lived."""
        fields = self._fields()
        places = {}
        for line in maps.splitlines():
            if found := re.match(r"([0-9a-f]+)-([0-9a-f]+) \S+ ([0-9a-f]+) \S+ \S+\s+(/.*)", line):
                start, end, offset = (int(found[i], 16) for i in (1, 2, 3))
                places.update((address, (found[4], address - start + offset - 1))
                              for address in fields[7:7 + fields[6]] if start <= address < end)
        names = self._names
        for file in {file for file, _ in places.values()}:
            offsets = [offset for other, offset in places.values() if other == file and (file, offset) not in names]
            if not offsets:
                continue
            lines = subprocess.run(["addr2line", "-Cfse", file, *map(hex, offsets)], capture_output=True, text=True,
                                   check=False).stdout.splitlines()
            names.update(((file, offset), (lines[2 * i], lines[2 * i + 1].split(" ")[0]))
                         for i, offset in enumerate(offsets))
        trace = []
        for address in fields[7:7 + fields[6]]:
            file, offset = places.get(address, ("?", 0))
            function, line = names.get((file, offset), ("?", "??:?"))
            if everything:
                trace.append(f"{function} {line} of {pathlib.Path(file).name}")
            elif "?" in line:
                trace.append(f"{function} of {pathlib.Path(file).name}")
            elif ".cpp:" in line:  # no header of a library
                trace.append(line)
        return " < ".join(trace if everything else trace[:SHOWN])
