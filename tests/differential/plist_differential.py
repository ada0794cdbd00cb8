#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Compares our property-list codecs with the plistlib of Python.

usage: plist_differential.py CONVERTER [SEED...]

For every document: what plistlib writes, in either format, we read; what we write of it, in either format,
plistlib reads; and it is the value that we began with. For damaged documents: what we take, plistlib takes, and
both see the same value. The documents are fixed cases and random ones from fixed seeds.
"""

import datetime
import math
import plistlib
import random
import struct
import subprocess
import sys

SEEDS = [1, 2, 3, 20240229]
DOCUMENTS_PER_SEED = 150
DAMAGED_PER_DOCUMENT = 12


class Converter:
    def __init__(self, path):
        self.process = subprocess.Popen([path], stdin=subprocess.PIPE, stdout=subprocess.PIPE)

    def convert(self, document, wanted):
        """The document in the format wanted ('x' or 'b'); 'r' or 'w' where it could not be read or written."""
        self.process.stdin.write(struct.pack(">cI", wanted.encode(), len(document)) + document)
        self.process.stdin.flush()
        head = self.process.stdout.read(5)
        if len(head) != 5:
            raise SystemExit("the converter died of %r" % document)
        status, length = struct.unpack(">cI", head)
        body = self.process.stdout.read(length)
        return body if status == b"+" else status.decode()

    def close(self):
        self.process.stdin.close()
        if self.process.wait() != 0:
            raise SystemExit("the converter ended with %d" % self.process.returncode)


def same(one, other):
    """Equality that tells 1 from True and 1.0, and takes not-a-number for itself."""
    if type(one) is not type(other):
        return False
    if isinstance(one, dict):
        return list(one) == list(other) and all(same(one[key], other[key]) for key in one)
    if isinstance(one, list):
        return len(one) == len(other) and all(map(same, one, other))
    if isinstance(one, float):
        return struct.pack("d", one) == struct.pack("d", other) or (math.isnan(one) and math.isnan(other))
    return one == other


def xml_can_say(value):
    if isinstance(value, str):
        return not any(ord(c) < 32 and c not in "\t\n\r" or c in "\ufffe\uffff" for c in value)
    if isinstance(value, list):
        return all(map(xml_can_say, value))
    if isinstance(value, dict):
        return all(xml_can_say(key) and xml_can_say(item) for key, item in value.items())
    return True


def has_carriage_return(value):
    """plistlib writes these raw, and a reader then sees line feeds; ours are written as references."""
    if isinstance(value, str):
        return "\r" in value
    if isinstance(value, list):
        return any(map(has_carriage_return, value))
    if isinstance(value, dict):
        return any(has_carriage_return(key) or has_carriage_return(item) for key, item in value.items())
    return False


def has_only_same_spelling(value):
    """No real (repr() and the shortest form differ in looks) and no data (wrapped at another column)."""
    if isinstance(value, (float, bytes)):
        return False
    if isinstance(value, list):
        return all(map(has_only_same_spelling, value))
    if isinstance(value, dict):
        return all(map(has_only_same_spelling, value.values()))
    return True


def as_dictionaries(value):
    """plistlib's UID as our reader gives it."""
    if isinstance(value, plistlib.UID):
        return {"CF$UID": value.data}
    if isinstance(value, list):
        return [as_dictionaries(item) for item in value]
    if isinstance(value, dict):
        return {key: as_dictionaries(item) for key, item in value.items()}
    return value


def without_fractions(value):
    """Dates as the XML form has them."""
    if isinstance(value, datetime.datetime):
        return value.replace(microsecond=0)
    if isinstance(value, list):
        return [without_fractions(item) for item in value]
    if isinstance(value, dict):
        return {key: without_fractions(item) for key, item in value.items()}
    return value


FIXED = [
    "", "text", "<&>\"'", "Gr\u00fc\u00dfe", "\u65e5\u672c\u8a9e", "\U0001f600\U0010ffff", "\t\n lines \n", "a\rb\r\nc",
    "x" * 14, "x" * 15, "x" * 16, "\u00e9" * 300, "x" * 70000, "\ufffd\ud7ff\ue000", "\x00", "\x1f", "\uffff", "]]>",
    0, 1, -1, 127, 128, 255, 256, 32767, 32768, 65535, 65536, 2**31 - 1, 2**31, 2**32 - 1, 2**32, 2**63 - 1, 2**63,
    2**64 - 1, -128, -129, -(2**31), -(2**32), -(2**63),
    0.0, -0.0, 1.0, 0.1, -2.5, 1e16, 1e22, 1e-7, 5e-324, 1.7976931348623157e308, math.inf, -math.inf, math.nan,
    True, False,
    datetime.datetime(2001, 1, 1), datetime.datetime(1, 1, 1), datetime.datetime(9999, 12, 31, 23, 59, 59),
    datetime.datetime(2024, 2, 29, 12, 34, 56), datetime.datetime(1900, 3, 1), datetime.datetime(1969, 12, 31, 23, 59, 59),
    b"", b"\0", b"\xff\xfe", bytes(range(256)) * 3, b"x" * 57, b"x" * 58,
    [], {}, [[]], [{}], {"": ""}, {"a": [], "b": {}, "c": b""},
    [True, 1, 1.0, "1", b"1", False, 0, 0.0, ""],
    {"k%d" % i: i for i in range(300)}, {"b": 1, "a": 2}, list(range(70000)), [["x"] * 20] * 20,
    {"<key> & \u00fc": "value", "\t": 1},
]


def deep(levels):
    value = []
    for level in range(levels - 1):
        value = [value] if level % 2 else {"k": value}
    return value


def random_text(rng):
    alphabets = ["abcXYZ 019", "<>&\"'\t\n\r]", "\u00e4\u00df\u20ac\u65e5", "\U0001f600\U00010000", "\x00\x01\x1f\x7f\ufffe"]
    weights = [20, 4, 3, 2, rng.choice([0, 0, 0, 1])]
    length = rng.choice([0, 1, 3, 14, 15, 16, 40, 200])
    return "".join(rng.choice(alphabet) for alphabet in rng.choices(alphabets, weights, k=length))


def random_value(rng, depth):
    kind = rng.randrange(10 if depth > 0 else 7)
    if kind == 0:
        return rng.random() < 0.5
    if kind == 1:
        bits = rng.choice([1, 7, 8, 16, 31, 32, 33, 62])
        return rng.getrandbits(bits) * rng.choice([1, -1])
    if kind == 2:
        return rng.choice([rng.random(), rng.uniform(-1e9, 1e9), float(rng.randrange(1000)),
                           struct.unpack("d", struct.pack("Q", rng.getrandbits(64)))[0]])
    if kind == 3:
        return bytes(rng.getrandbits(8) for _ in range(rng.choice([0, 1, 2, 3, 15, 57, 58, 200])))
    if kind == 4:
        return datetime.datetime(2001, 1, 1) + datetime.timedelta(seconds=rng.randrange(-(10**10), 10**10))
    if kind <= 6:
        return random_text(rng)
    size = rng.choice([0, 1, 2, 5, 14, 15, 20])
    if kind == 7:
        return [random_value(rng, depth - 1) for _ in range(size)]
    if kind == 8:
        return {random_text(rng): random_value(rng, depth - 1) for _ in range(size)}
    shared = random_value(rng, depth - 1)
    return [shared, random_value(rng, depth - 1), shared]


def random_documents(rng, count):
    return [random_value(rng, rng.randrange(5)) for _ in range(count)]


def random_uids(rng):
    return {"top": plistlib.UID(rng.getrandbits(rng.choice([3, 8, 15, 31]))), "list": [plistlib.UID(0), plistlib.UID(2**32 - 1)]}


class Failures:
    def __init__(self):
        self.count = 0

    def check(self, holds, what, document):
        if holds:
            return
        self.count += 1
        if self.count <= 20:
            print("%s: %.400r" % (what, document), file=sys.stderr)


def loads(document):
    """What plistlib reads, or None. It lets many kinds of exception out on malformed input.

    It knows XML by its first five bytes only, which an instruction or a comment may take: so it is told.
    """
    is_binary = document.startswith(b"bplist")
    try:
        return plistlib.loads(document, fmt=plistlib.FMT_BINARY if is_binary else plistlib.FMT_XML)
    except Exception:  # noqa: BLE001
        return None


def round_trips(converter, failures, value, ours_only=False):
    # Three values to start from: plistlib's binary form, its XML form where that is faithful, and our XML.
    binary = plistlib.dumps(value, fmt=plistlib.FMT_BINARY, sort_keys=False)
    expected = as_dictionaries(value)
    sources = [("its binary", binary)]
    if xml_can_say(value) and not has_carriage_return(value) and not ours_only:
        sources.append(("its XML", plistlib.dumps(value, sort_keys=False)))
    for name, source in sources:
        again = converter.convert(source, "b")
        failures.check(isinstance(again, bytes) and same(loads(again), expected), name + " to our binary", value)
        xml = converter.convert(source, "x")
        if not xml_can_say(value):
            failures.check(xml == "w", name + " to XML that cannot be", value)
            continue
        failures.check(isinstance(xml, bytes) and same(loads(xml), expected), name + " to our XML", value)
        if isinstance(xml, bytes):
            back = converter.convert(xml, "b")
            failures.check(isinstance(back, bytes) and same(loads(back), expected), name + " by XML to binary", value)
            if name == "its XML" and has_only_same_spelling(value):
                failures.check(xml == source, "our XML is spelled otherwise than its", value)


def damaged(rng, document):
    changed = bytearray(document)
    for _ in range(rng.choice([1, 1, 1, 2, 4])):
        if not changed:
            break
        at = rng.randrange(len(changed))
        how = rng.randrange(5)
        if how == 0:
            changed[at] = rng.getrandbits(8)
        elif how == 1:
            changed[at] ^= 1 << rng.randrange(8)
        elif how == 2:
            del changed[at]
        elif how == 3:
            changed.insert(at, changed[rng.randrange(len(changed))])
        else:
            changed[at] = rng.choice(b"<>&/ \n\r0x\xff\x10\x5f\xa1\xd1")
    return bytes(changed)


def damage(converter, failures, rng, value, counts):
    documents = [plistlib.dumps(value, fmt=plistlib.FMT_BINARY, sort_keys=False)]
    if xml_can_say(value) and not has_carriage_return(value):
        documents.append(plistlib.dumps(value, sort_keys=False))
    for document in documents:
        for _ in range(DAMAGED_PER_DOCUMENT):
            changed = damaged(rng, document)
            ours = converter.convert(changed, "b")
            if ours == "r":
                counts["refused"] += 1
                continue
            counts["taken"] += 1
            theirs = loads(changed)
            if isinstance(ours, str):
                failures.check(False, "read and then not writable", changed)
                continue
            ours = loads(ours)
            if theirs is None and ours is None:
                continue  # a date beyond its calendar
            failures.check(same(without_fractions(ours), without_fractions(as_dictionaries(theirs))),
                           "taken, and not as plistlib has it", changed)


def main():
    converter = Converter(sys.argv[1])
    failures = Failures()
    values = FIXED + [deep(levels) for levels in (1, 2, 100, 200)]
    for value in values:
        round_trips(converter, failures, value)
    counts = {"taken": 0, "refused": 0}
    seeds = [int(seed) for seed in sys.argv[2:]] or SEEDS
    for seed in seeds:
        rng = random.Random(seed)
        for value in random_documents(rng, DOCUMENTS_PER_SEED):
            round_trips(converter, failures, value)
            damage(converter, failures, rng, value, counts)
            values.append(value)
        round_trips(converter, failures, random_uids(rng), ours_only=True)
    converter.close()
    print("%d documents; of damaged ones %d taken, %d refused; %d differences"
          % (len(values), counts["taken"], counts["refused"], failures.count))
    # A run in which damage was never survived, or never noticed, has compared nothing.
    failures.check(counts["taken"] > 100 and counts["refused"] > 100, "too little compared", counts)
    return 1 if failures.count else 0


if __name__ == "__main__":
    sys.exit(main())
