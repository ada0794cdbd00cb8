#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""Makes the parts of the package that come from the protocol's table.

usage: generate.py PROTOCOL.json OUTPUT_DIRECTORY
Writes _table.py, _routines.py and _async_routines.py.
"""
import json
import keyword
import pathlib
import re
import sys
import textwrap

HEAD = '''# SPDX-License-Identifier: Apache-2.0
# SPDX-FileCopyrightText: The BrenvikMobileHelper authors
"""{}

Made from interface/protocol.json by generate.py; changes here are lost.
"""
'''
GIVEN = ("text", "i32", "f64", "region")
RESULTS = {"status": "None", "boolean": "bool", "text 64": "str", "text 256": "str", "region": "Value"}


def constant(name):
    """SetVoicemailToken: SET_VOICEMAIL_TOKEN"""
    return re.sub(r"(?<=[a-z0-9])(?=[A-Z])|(?<=[A-Z])(?=[A-Z][a-z])", "_", name).upper()


def table(protocol):
    c = protocol["constants"]
    codes = {each["name"]: each["code"] for each in protocol["codes"]}
    lines = [HEAD.format("The protocol's table."), "from ._routine import Argument as A", "from ._routine import Routine", "",
             f"SERVICE = {protocol['service']!r}",
             f"NDR = bytes({c['ndr']})",
             f"COMPLEX = {c['complexBit']:#x}",
             f"REPLY_DISPOSITION = {c['replyDisposition']}",
             f"REPLY_ID = {c['replyIdOffset']}",
             f"LARGEST = {c['largestDatagram']}",
             f"DESCRIPTORS = {c['descriptorsOffset']}",
             f"ALIGNMENT = {c['regionAlignment']}",
             f"CHECK_IN_DISPOSITION = {c['checkInDisposition']}",
             f"CHECK_IN_REPLY_DISPOSITION = {c['checkInReplyDisposition']}",
             f"COPY = {c['copy']}",
             f"PORT = {protocol['portDescriptor']['kind']}",
             f"OUT_OF_LINE = {protocol['outOfLineDescriptor']['kind']}",
             f"TYPE_ERROR = {codes['typeError']}",
             f"BAD_ID = {codes['badId']}",
             f"BAD_ARGUMENTS = {codes['badArguments']}",
             f"REPLY_SIZES = { {each['form']: each['size'] for each in protocol['replyForms']} }",
             f"PUSH_SERVICE = {protocol['pushes']['service']!r}",
             f"PUSH_SIZE = {protocol['pushes']['requestSize']}",
             f"PUSH_REPLY_SIZE = {protocol['pushes']['replySize']}",
             f"PUSHES = { {each['id']: each['name'] for each in protocol['pushes']['messages']} }",
             f"PUSH_KEYS = { {each['name']: tuple(each['keys']) for each in protocol['pushes']['messages']} }",
             f"PUSH_CLIENT_KEY = {protocol['pushes']['clientKey']!r}",
             f"NOTIFICATION_SERVICE = {protocol['notifications']['service']!r}",
             f"NOTIFICATION_ID = {protocol['notifications']['id']}",
             f"NOTIFICATION_KINDS = {tuple(protocol['notifications']['kinds'])}",
             f"DATABASES = {tuple(protocol['notifications']['databases'])}",
             "# Bits of check_lasd_update.",
             f"LASD_BITS = {next(each['arguments'][0]['bits'] for each in protocol['routines'] if each['name'] == 'CheckLASDUpdate')}",
             "CODES = {", *(f"    {each['code']}: {each['meaning']!r}," for each in protocol["codes"]), "}", ""]

    def row(routine):
        arguments = "".join(
            f"A({each['name']!r}, {each['offset']}, {each['size']}, {each['type']!r}"
            + (f", {each['region']!r}" if "region" in each else "") + "), " for each in routine["arguments"])
        return (f"Routine({routine['id']}, {routine['name']!r}, {routine['requestSize']}, {routine['descriptors']},\n"
                f"        ({arguments.rstrip(' ')}), {routine['reply']!r})")

    check_in, *routines = protocol["routines"]
    lines += [f"CHECK_IN = {row(check_in)}", "ROUTINES = {each.name: each for each in ("]
    lines += [f"    {row(each)}," for each in routines] + [")}"]
    return "\n".join(lines) + "\n"


def parameter(argument):
    """The argument's name, with an underscore where it is a word of the language."""
    return argument["name"] + "_" * keyword.iskeyword(argument["name"])


def python_type(routine, argument):
    if argument["type"] == "region":
        return "Value"
    if argument["type"] == "text":
        return "Path" if re.search("path|directory|target", argument["name"]) else "str"
    return {"i32": "int", "f64": "float"}[argument["type"]]


def body(routine, argument):
    """How an argument is turned into what struct packs."""
    name = parameter(argument)
    if argument["type"] == "text":
        return f'text({name}, {argument["size"]}, "{name}")'
    if argument["type"] == "region":
        return ("preference" if routine["name"] == "SetPreferenceValue" else "serialized") + f'({name}, "{name}")'
    return {"i32": "integer", "f64": "real"}[argument["type"]] + f'({name}, "{name}")'


FORMATS = {"i32": "i", "f64": "d", "regionSize": "I"}


def method(routine, prefix, wait):
    given = [each for each in routine["arguments"] if each["type"] in GIVEN]
    if len({each["type"] for each in given}) > 1:  # the large values last
        given.sort(key=lambda each: each["type"] == "region")
    signature = "".join(f", {parameter(each)}: {python_type(routine, each)}" for each in given)
    words = re.sub(r"[`]", "", routine["meaning"])
    if routine["name"] == "SetPreferenceValue":
        words = ("Stores a value for the helper's own user on any host. None removes the key. A domain that names no file, "
                 "or a disk that does not take it, is no error: the helper's log says so.")
    if routine["reply"] == "region":
        words += " The list comes as its value, None when there is none."
    if routine["codes"]:
        words += f" Codes: {routine['codes']}."
    lines = [f"    {prefix}def {constant(routine['name']).lower()}(self{signature}) -> {RESULTS[routine['reply']]}:"]
    text = textwrap.wrap(words, 112)
    lines += [f'        """{text[0]}'] + [f"        {each}" for each in text[1:]]
    lines[-1:] = [lines[-1] + '"""']
    row = f"_{constant(routine['name'])}"
    regions = [each for each in routine["arguments"] if each["type"] == "region"]
    fixed = [each for each in routine["arguments"] if each["type"] in ("text", "i32", "f64", "regionSize")]
    packed = []
    for each in fixed:
        packed.append(f"len({each['region']}_region)" if each["type"] == "regionSize" else body(routine, each))
    pack = f"{row}_PACK(NDR{''.join(', ' + each for each in packed)})" if routine["arguments"] else 'b""'
    for each in regions:
        lines.append(f"        {each['name']}_region = {body(routine, each)}")
    if regions:
        asked = f"{wait}self._ask_complex({row}, {pack}, [{', '.join(each['name'] + '_region' for each in regions)}])"
    else:
        asked = f"{wait}self._ask({row}, {pack})"
    if routine["reply"] == "region":
        asked = f"parsed({asked})"
    lines.append(f"        return {asked}")
    return "\n".join(lines) + "\n"


def routines(protocol, asynchronous):
    prefix, wait = ("async ", "await ") if asynchronous else ("", "")
    rows = protocol["routines"][1:]
    packs = []
    for each in rows:
        name = constant(each["name"])
        packs.append(f"_{name} = ROUTINES[{each['name']!r}]")
        if each["arguments"]:
            fixed = [field for field in each["arguments"] if field["type"] in ("text", "i32", "f64", "regionSize")]
            form = "".join(f"{field['size']}s" if field["type"] == "text" else FORMATS[field["type"]] for field in fixed)
            packs.append(f'_{name}_PACK = Struct("<8s{form}").pack')
    imports = ["from __future__ import annotations", "", "from struct import Struct", "",
               "from ._table import NDR, ROUTINES, Routine",
               "from ._wire import integer, parsed, preference, real, serialized, text", "",
               "TYPE_CHECKING = False", "if TYPE_CHECKING:  # typing costs more to import than it is worth here",
               "    import os", "    from typing import Any, Union", "",
               "    Path = Union[str, os.PathLike[str]]",
               "    # What a property list holds: str, bool, int, float, bytes, datetime.datetime, list, dict; None for no value.",
               "    Value = Any", ""]
    name = "AsyncRoutines" if asynchronous else "Routines"
    lines = [HEAD.format("One method for each routine." if not asynchronous else "One coroutine for each routine."), *imports,
             *packs, "", "", f"class {name}:", '    """The helper\'s 27 routines. Paths are read by the helper: give absolute ones."""',
             "",
             f"    {prefix}def _ask(self, routine: Routine, body: bytes, memories: Any = ()) -> Any:",
             "        raise NotImplementedError", "",
             f"    {prefix}def _ask_complex(self, routine: Routine, rest: bytes, regions: list[bytes]) -> Any:",
             "        raise NotImplementedError", ""]
    return "\n".join(lines) + "\n" + "\n".join(method(each, prefix, wait) for each in rows)


def main(arguments):
    if len(arguments) != 2:
        sys.exit(__doc__)
    protocol = json.loads(pathlib.Path(arguments[0]).read_text(encoding="utf-8"))
    output = pathlib.Path(arguments[1])
    output.mkdir(parents=True, exist_ok=True)
    (output / "_table.py").write_text(table(protocol), encoding="utf-8")
    (output / "_routines.py").write_text(routines(protocol, False), encoding="utf-8")
    (output / "_async_routines.py").write_text(routines(protocol, True), encoding="utf-8")


if __name__ == "__main__":
    main(sys.argv[1:])
