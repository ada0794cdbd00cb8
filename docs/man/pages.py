#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Makes the parts of manual pages that come from somewhere else, and the journal's catalogue.

usage: pages.py fill PAGE.scd COMMANDS      the page with its marks replaced; COMMANDS: output of `command-pages man PROGRAM`
       pages.py finish PAGE                 a page as scdoc writes it, which tells man(1) of the tables in it
       pages.py catalogue                   entries for journalctl -x
       pages.py functions                   names of the C library's functions, one a line

A mark is a line "@messages@", "@functions@", "@routines@" or "@commands@".
"""
import pathlib
import re
import sys

DOCS = pathlib.Path(__file__).resolve().parent.parent
HEADER = DOCS.parent / "client" / "include" / "brenvik" / "mobile_helper.h"
LEVELS = {"error": "error", "default": "notice", "notice": "notice", "info": "info", "debug": "debug"}


class Message:
    """One record of log-messages.txt."""

    def __init__(self, record):
        head, self.text, *rest = record
        self.channel, self.level, self.kind = head.split()
        if self.channel not in ("unified", "bsd") or self.level not in LEVELS:
            raise ValueError(f"not a channel and level: {head}")
        if self.kind not in ("failure", "refusal", "progress"):
            raise ValueError(f"not a kind: {head}")
        self.meaning = " ".join(line for line in rest if not line.startswith("Do: "))
        self.advice = " ".join(line[4:] for line in rest if line.startswith("Do: "))
        if not self.meaning or bool(self.advice) == (self.kind == "progress"):
            raise ValueError(f"a failure or refusal says what to do, progress does not: {self.text}")

    @property
    def subject(self):
        """Of the catalogue's entry: what has happened, the first sentence of the meaning."""
        first = re.split(r"[.:;](?:\s|$)", self.meaning, maxsplit=1)[0]
        return {"failure": "Failed", "refusal": "Refused", "progress": "Done"}[self.kind] + ": " + first

    @property
    def id(self):
        """As platform/log makes it: FNV-1a, 128 bits."""
        value = 0x6C62272E07BB014262B821756295C58D
        for byte in self.text.encode():
            value = (value ^ byte) * ((1 << 88) + 0x13B) % (1 << 128)
        return f"{value:032x}"


def read_messages():
    """[(title of the group, [Message])]"""
    groups, record = [], []
    for line in (DOCS / "log-messages.txt").read_text().splitlines() + [""]:
        if line.startswith("#") and not record:
            continue
        if line.startswith("= "):
            groups.append((line[2:], []))
        elif line:
            record.append(line)
        elif record:
            groups[-1][1].append(Message(record))
            record = []
    return groups


def escaped(text):
    return re.sub(r"([\\_*~<>#|\[\]`])", r"\\\1", text)


def messages_section():
    lines = []
    for title, messages in read_messages():
        lines += [f"## {title}", ""]
        for each in messages:
            channel = "journal" if each.channel == "unified" else "syslog"
            lines += [f"*{escaped(each.text.strip())}*"]
            lines += [f"\t({channel}, {LEVELS[each.level]}) {escaped(each.meaning)}"]
            if each.advice:
                lines += [f"\tWhat to do: {escaped(each.advice)}"]
            lines += [""]
    return lines


def catalogue():
    lines = ["# SPDX-License-" "Identifier: Apache-2.0", "# SPDX-FileCopyright" "Text: The BrenvikMobileHelper authors", ""]
    done = set()
    for _, messages in read_messages():
        for each in messages:
            if each.kind == "progress" or each.id in done:
                continue
            done.add(each.id)
            lines += [f"-- {each.id}", f"Subject: {each.subject}", "Defined-By: BrenvikMobileHelper",
                      "Documentation: man:BrenvikMobileHelper(8)", "", each.meaning, "",
                      "What to do: " + each.advice, ""]
    return lines


def functions():
    text = re.sub(r"/\*.*?\*/", "", HEADER.read_text(), flags=re.S)
    return sorted(set(re.findall(r"\b(bvmh_\w+|BVMobileHelper\w+)\(", text)))


def functions_section():
    """The header's own comments and declarations, from its first section on."""
    text = HEADER.read_text()
    body = text[text.index("/* ---- "):text.index("#ifdef __cplusplus\n}")]
    lines, code = [], []

    def flush():
        while code and not code[-1].strip():
            code.pop()
        if code:
            lines.extend(["```", *code, "```", ""])
        code.clear()

    for part in re.split(r"(^/\*.*?\*/\n)", body, flags=re.S | re.M):
        if part.startswith("/* ----"):
            flush()
            lines.extend(["## " + re.search(r"---- (.*?) -", part)[1].capitalize(), ""])
        elif part.startswith("/*"):
            flush()
            comment = [re.sub(r"^ ?\*? ?", "", line) for line in part.strip()[2:-2].strip().splitlines()]
            lines.extend([escaped(line.strip()) for line in comment] + [""])
        else:
            cleaned = re.sub(r"\bBVMH_(API|CHECKED) ", "", part)
            code.extend(line for line in cleaned.split("\n") if line.strip() or code)
    flush()
    return lines


def routines_section():
    """The table of docs/protocol.md, as a list."""
    text = (DOCS / "protocol.md").read_text()
    table = text[text.index("<!-- routines:"):text.index("<!-- routines: end")]
    lines = []
    for row in re.findall(r"^\| (\d.*) \|$", table, flags=re.M):
        number, name, request, reply, what, codes = (each.strip() for each in row.split(" | "))
        lines += [f"*{number} {escaped(name.strip('`'))}*", f"\t{escaped(what.replace('`', ''))}",
                  f"\tRequest: {escaped(request)}. Reply: {escaped(reply)}."]
        if codes:
            lines += [f"\tCodes: {escaped(codes)}."]
        lines += [""]
    return lines


def fill(page, commands):
    made = {"@messages@": messages_section, "@functions@": functions_section, "@routines@": routines_section,
            "@commands@": lambda: pathlib.Path(commands).read_text().splitlines()}
    lines = []
    for line in pathlib.Path(page).read_text().splitlines():
        if line in made:
            lines += made[line]()
        elif not line.startswith("; "):
            lines.append(line)
    return [line for line, before in zip(lines, [None] + lines) if line or before]


def finish(page):
    """The first line names the preprocessors of a page: man-pages(7)."""
    lines = pathlib.Path(page).read_text().splitlines()
    return (["'\\\" t"] if ".TS" in lines else []) + lines


def main(arguments):
    match arguments:
        case ["fill", page, commands]:
            lines = fill(page, commands)
        case ["finish", page]:
            lines = finish(page)
        case ["catalogue"]:
            lines = catalogue()
        case ["functions"]:
            lines = functions()
        case _:
            sys.exit(__doc__)
    sys.stdout.write("\n".join(lines) + "\n")


if __name__ == "__main__":
    main(sys.argv[1:])
