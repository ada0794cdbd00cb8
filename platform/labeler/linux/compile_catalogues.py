#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Compiles the label catalogues into one C++ source of constant tables.

usage: compile_catalogues.py OUTPUT.cpp TAG.po ...

The name of a catalogue is its language tag; its header field X-Also-Serves lists further tags that are
answered from it. Anything a translator left undone or got wrong (a missing, empty, fuzzy or unknown entry, a
text that is not in Unicode's composed form, a tag served twice) fails the build with the file's name.
"""
import pathlib
import re
import sys
import unicodedata

# The order of brenvik::Label.
MESSAGES = ("Primary", "Secondary", "Personal", "Business", "Travel", "Cellular Data")
CONTEXT = "subscription label"
LONGEST_TAG = 15  # as in Catalogue.h
LONGEST_TEXT = 255
FALLBACK = "en"


def fail(path, problem):
    sys.exit(f"{path}: {problem}")


def read_entries(path):
    """The entries of a .po file: (context, msgid, msgstr, is fuzzy)."""
    entries, entry, field, fuzzy = [], {}, None, False

    def finish():
        if "msgid" in entry:
            entries.append((entry.get("msgctxt"), entry["msgid"], entry.get("msgstr", ""), fuzzy))

    for number, line in enumerate(path.read_text(encoding="utf-8").splitlines(), 1):
        line = line.strip()
        match = re.fullmatch(r'(?:(msgctxt|msgid|msgstr)\s+)?"((?:[^"\\]|\\.)*)"', line)
        if match:
            keyword, quoted = match.groups()
            text = re.sub(r"\\(.)", lambda m: {"n": "\n", "t": "\t"}.get(m[1], m[1]), quoted)
            if keyword:
                if keyword in entry:
                    fail(path, f"line {number}: entries must be separated by an empty line")
                field = keyword
                entry[field] = text
            elif field:
                entry[field] += text
            else:
                fail(path, f"line {number}: a text that belongs to nothing")
        elif line == "":
            finish()
            entry, field, fuzzy = {}, None, False
        elif line.startswith("#,"):
            fuzzy = fuzzy or "fuzzy" in line
        elif not line.startswith("#"):
            fail(path, f"line {number}: not understood: {line}")
    finish()
    return entries


def read_catalogue(path):
    """(tags served, own tag first; six texts)"""
    entries = read_entries(path)
    header = next((text for context, source, text, _ in entries if context is None and source == ""), None)
    if header is None:
        fail(path, "no header entry")
    fields = dict(line.split(":", 1) for line in header.splitlines() if ":" in line)
    tag = path.stem
    if fields.get("Language", "").strip().replace("_", "-") != tag:
        fail(path, "the header's Language is not the name of the file")
    tags = [tag] + fields.get("X-Also-Serves", "").split()
    for each in tags:
        if not re.fullmatch(r"[A-Za-z]{2,3}(-[A-Za-z0-9]{2,8})*", each) or len(each) > LONGEST_TAG:
            fail(path, f"not a language tag that can be served: {each}")

    texts = {}
    for context, source, text, fuzzy in entries:
        if context is None and source == "":
            continue
        if context != CONTEXT or source not in MESSAGES:
            fail(path, f"unknown message: {source}")
        if source in texts:
            fail(path, f"{source}: given twice")
        if fuzzy:
            fail(path, f"{source}: still fuzzy")
        if text == "" or text != text.strip():
            fail(path, f"{source}: empty, or blanks around it")
        if text != unicodedata.normalize("NFC", text):
            fail(path, f"{source}: not in composed form (NFC)")
        if any(unicodedata.category(c) in ("Cc", "Co", "Cs", "Cn") for c in text):
            fail(path, f"{source}: holds a control or unassigned character")
        if len(text.encode()) > LONGEST_TEXT:
            fail(path, f"{source}: longer than {LONGEST_TEXT} bytes")
        texts[source] = text
    missing = [source for source in MESSAGES if source not in texts]
    if missing:
        fail(path, "not translated: " + ", ".join(missing))
    return tags, [texts[source] for source in MESSAGES]


def main():
    output, paths = pathlib.Path(sys.argv[1]), sorted(map(pathlib.Path, sys.argv[2:]))
    pool, offsets, catalogues, served = bytearray(), {}, [], {}
    for path in paths:
        tags, texts = read_catalogue(path)
        for tag in tags:
            if tag.lower() in served:
                fail(path, f"{tag} is served already")
            served[tag.lower()] = len(catalogues)
        for text in texts:
            if text not in offsets:
                offsets[text] = len(pool)
                pool += text.encode()
        catalogues.append((tags[0].split("-")[0], texts))
    if FALLBACK not in served:
        sys.exit(f"no catalogue for {FALLBACK}, which stands in for every unknown language")
    if len(pool) > 0xFFFF or len(catalogues) > 0xFF:
        sys.exit("the catalogues have outgrown the tables' number types: widen those of Catalogue.h")

    lines = [
        "// SPDX-License-Identifier: Apache-2.0",
        "// SPDX-FileCopyrightText: The BrenvikMobileHelper authors",
        "// Written by compile_catalogues.py. Change the .po files instead.",
        '#include "platform/labeler/linux/Catalogue.h"',
        "",
        "namespace brenvik::catalogue {",
        "",
        f"const std::size_t kCatalogueCount = {len(catalogues)};",
        f"const std::size_t kServedTagCount = {len(served)};",
        f"const std::uint8_t kFallbackCatalogue = {served[FALLBACK]};",
        "",
        "const char kTexts[] =",
    ]
    for text in offsets:
        # Octal, because a hexadecimal escape would swallow digits that follow it.
        quoted = "".join(chr(b) if 32 <= b < 127 and chr(b) not in '"\\?' else f"\\{b:03o}" for b in text.encode())
        lines.append(f'    "{quoted}"')
    lines[-1] += ";"
    lines += ["", "const Catalogue kCatalogues[] = {"]
    for language, texts in catalogues:
        spans = ", ".join(f"{{{offsets[t]}, {len(t.encode())}}}" for t in texts)
        lines.append(f'    {{"{language}", {{{{{spans}}}}}}},')
    lines += ["};", "", "const ServedTag kServedTags[] = {"]
    lines += [f'    {{"{tag}", {index}}},' for tag, index in sorted(served.items())]
    lines += ["};", "", "}  // namespace brenvik::catalogue", ""]
    output.write_text("\n".join(lines), encoding="utf-8")


if __name__ == "__main__":
    main()
